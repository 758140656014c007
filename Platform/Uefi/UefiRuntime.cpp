// The few symbols a freestanding image still needs from a runtime library.
// The compiler emits calls to memcpy, memset, memmove and memcmp for block
// copies, initialisations and comparisons even with -fno-builtin, and the
// image links against no C library, so it supplies them itself.
#include "MemOps.h"

#include <stddef.h>
#include <stdint.h>

extern "C" {

void *memcpy(void *Destination, const void *Source, size_t Length) {
  // Deliberately overlap-safe, like memmove: a copy between overlapping
  // blocks then still comes out right, for one comparison more.
  UefiMem::Move(static_cast<uint8_t *>(Destination), static_cast<const uint8_t *>(Source), Length);
  return Destination;
}

void *memmove(void *Destination, const void *Source, size_t Length) {
  UefiMem::Move(static_cast<uint8_t *>(Destination), static_cast<const uint8_t *>(Source), Length);
  return Destination;
}

void *memset(void *Destination, int Value, size_t Length) {
  UefiMem::Fill(static_cast<uint8_t *>(Destination), static_cast<uint8_t>(Value), Length);
  return Destination;
}

int memcmp(const void *A, const void *B, size_t Length) {
  return UefiMem::Compare(static_cast<const uint8_t *>(A), static_cast<const uint8_t *>(B), Length);
}

// A function named main in the global namespace gets a call to __main (the
// C runtime's constructor runner on this target) at its start. The image has
// no constructors to run; an empty one satisfies the call.
void __main() {}

// Referenced by objects that use floating point when built for the MSVC
// environment; defined so that such objects link all the same.
int _fltused = 0;

} // extern "C"
