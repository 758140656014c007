// Pool memory and the raw memory helpers.
#include "NwBaseLib.h"

void *AllocatePool(UINTN Size) {
  if (gBS == nullptr || gBS->AllocatePool == nullptr) {
    return nullptr;
  }
  void *Buffer = nullptr;
  if (EFI_ERROR(gBS->AllocatePool(EfiBootServicesData, Size, &Buffer))) {
    return nullptr;
  }
  return Buffer;
}

void *AllocateZeroPool(UINTN Size) {
  void *Buffer = AllocatePool(Size);
  if (Buffer != nullptr) {
    ZeroMem(Buffer, Size);
  }
  return Buffer;
}

void *AllocateCopyPool(UINTN Size, const void *Source) {
  if (Source == nullptr && Size != 0) {
    return nullptr;
  }
  void *Buffer = AllocatePool(Size);
  if (Buffer != nullptr) {
    CopyMem(Buffer, Source, Size);
  }
  return Buffer;
}

void FreePool(void *Buffer) {
  if (Buffer != nullptr && gBS != nullptr && gBS->FreePool != nullptr) {
    gBS->FreePool(Buffer);
  }
}

namespace {

constexpr uintptr_t WordMask = sizeof(UINT64) - 1;
// Word access to memory of any type.
using AliasWord = UINT64 __attribute__((may_alias));

// Forward copy: whole words when both sides can be aligned together, bytes
// otherwise.
void CopyForward(UINT8 *D, const UINT8 *S, UINTN Length) {
  if (((reinterpret_cast<uintptr_t>(D) ^ reinterpret_cast<uintptr_t>(S)) & WordMask) == 0) {
    while (Length > 0 && (reinterpret_cast<uintptr_t>(D) & WordMask) != 0) {
      *D++ = *S++;
      Length--;
    }
    for (; Length > WordMask; Length -= sizeof(UINT64)) {
      *reinterpret_cast<AliasWord *>(D) = *reinterpret_cast<const AliasWord *>(S);
      D += sizeof(UINT64);
      S += sizeof(UINT64);
    }
  }
  while (Length-- > 0) {
    *D++ = *S++;
  }
}

// Backward copy for a destination that overlaps the source from above.
void CopyBackward(UINT8 *D, const UINT8 *S, UINTN Length) {
  D += Length;
  S += Length;
  while (Length-- > 0) {
    *--D = *--S;
  }
}

} // namespace

void CopyMem(void *Destination, const void *Source, UINTN Length) {
  if (Destination == nullptr || Source == nullptr || Length == 0 || Destination == Source) {
    return;
  }
  UINT8 *D = static_cast<UINT8 *>(Destination);
  const UINT8 *S = static_cast<const UINT8 *>(Source);
  const uintptr_t Dv = reinterpret_cast<uintptr_t>(D);
  const uintptr_t Sv = reinterpret_cast<uintptr_t>(S);
  if (Dv > Sv && Dv - Sv < Length) {
    CopyBackward(D, S, Length);
  } else {
    CopyForward(D, S, Length);
  }
}

void SetMem(void *Buffer, UINTN Length, UINT8 Value) {
  if (Buffer == nullptr) {
    return;
  }
  UINT8 *P = static_cast<UINT8 *>(Buffer);
  for (UINTN I = 0; I < Length; I++) {
    P[I] = Value;
  }
}

void ZeroMem(void *Buffer, UINTN Length) {
  SetMem(Buffer, Length, 0);
}

INTN CompareMem(const void *A, const void *B, UINTN Length) {
  if (A == B || Length == 0) {
    return 0;
  }
  if (A == nullptr || B == nullptr) {
    return A == nullptr ? -1 : 1;
  }
  const UINT8 *Pa = static_cast<const UINT8 *>(A);
  const UINT8 *Pb = static_cast<const UINT8 *>(B);
  for (UINTN I = 0; I < Length; I++) {
    if (Pa[I] != Pb[I]) {
      return static_cast<INTN>(Pa[I]) - static_cast<INTN>(Pb[I]);
    }
  }
  return 0;
}
