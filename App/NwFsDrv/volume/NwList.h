// The counted, doubly linked list used throughout the network volume.
//
// A head holds the number of links and the first and last link; a link holds
// its next and previous neighbours and is embedded in the record it belongs
// to. Links are always appended at the tail. The record that owns a link is
// found by subtracting the link's offset within the record (NW_LIST_OWNER).
#pragma once

#include "Uefi.h"

#pragma pack(push, 1)
struct NW_LIST_LINK {
  NW_LIST_LINK *Next;
  NW_LIST_LINK *Prev;
};

struct NW_LIST_HEAD {
  UINT64 Count;
  NW_LIST_LINK *First;
  NW_LIST_LINK *Last;
};
#pragma pack(pop)
static_assert(sizeof(NW_LIST_LINK) == 16, "list link is two pointers");
static_assert(sizeof(NW_LIST_HEAD) == 24, "list head is a count and two pointers");
static_assert(offsetof(NW_LIST_HEAD, First) == 8, "list head: first link after the count");

void NwListInit(NW_LIST_HEAD *Head);
// Appends Link at the tail; the link must not be on any list.
void NwListAppend(NW_LIST_HEAD *Head, NW_LIST_LINK *Link);
// Unlinks Link from Head. A link that is not on Head is left alone and false
// is returned, so a record can never be unlinked twice or from the wrong list.
bool NwListRemove(NW_LIST_HEAD *Head, NW_LIST_LINK *Link);
bool NwListIsEmpty(const NW_LIST_HEAD *Head);
bool NwListContains(const NW_LIST_HEAD *Head, const NW_LIST_LINK *Link);

// The record that embeds Link at byte offset Offset (null for a null link).
template <typename T>
T *NwListOwnerAt(NW_LIST_LINK *Link, UINTN Offset) {
  if (Link == nullptr) {
    return nullptr;
  }
  return reinterpret_cast<T *>(reinterpret_cast<UINT8 *>(Link) - Offset);
}
#define NW_LIST_OWNER(Link, Type, Field) NwListOwnerAt<Type>((Link), offsetof(Type, Field))
