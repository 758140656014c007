// The counted, doubly linked list of the network volume.
#include "volume/NwList.h"

void NwListInit(NW_LIST_HEAD *Head) {
  Head->Count = 0;
  Head->First = nullptr;
  Head->Last = nullptr;
}

void NwListAppend(NW_LIST_HEAD *Head, NW_LIST_LINK *Link) {
  Link->Next = nullptr;
  Link->Prev = Head->Last;
  if (Head->Last != nullptr) {
    Head->Last->Next = Link;
  } else {
    Head->First = Link;
  }
  Head->Last = Link;
  Head->Count++;
}

bool NwListContains(const NW_LIST_HEAD *Head, const NW_LIST_LINK *Link) {
  for (const NW_LIST_LINK *Walk = Head->First; Walk != nullptr; Walk = Walk->Next) {
    if (Walk == Link) {
      return true;
    }
  }
  return false;
}

bool NwListRemove(NW_LIST_HEAD *Head, NW_LIST_LINK *Link) {
  if (Link == nullptr || Head->Count == 0 || !NwListContains(Head, Link)) {
    return false;
  }
  if (Link->Prev != nullptr) {
    Link->Prev->Next = Link->Next;
  } else {
    Head->First = Link->Next;
  }
  if (Link->Next != nullptr) {
    Link->Next->Prev = Link->Prev;
  } else {
    Head->Last = Link->Prev;
  }
  Link->Next = nullptr;
  Link->Prev = nullptr;
  Head->Count--;
  return true;
}

bool NwListIsEmpty(const NW_LIST_HEAD *Head) {
  return Head->Count == 0;
}
