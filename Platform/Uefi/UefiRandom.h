// Random bytes in the firmware image, from the first source that works:
// EFI_RNG_PROTOCOL, then the processor's RDRAND instruction when CPUID
// reports it. There is deliberately no weaker fallback.
#pragma once

#include <stdint.h>

enum class UefiRandomSource : uint8_t {
  None,        // no source worked; the output is unspecified
  RngProtocol, // EFI_RNG_PROTOCOL with its default algorithm
  Rdrand,      // the RDRAND instruction
};

// Fills Length bytes of Output and tells which source gave them.
UefiRandomSource UefiFillRandom(uint8_t *Output, uint64_t Length);
