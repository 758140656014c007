// Random bytes for the platform facade in the firmware image (UefiRandom.h).
#include "UefiRandom.h"

#include "NwBaseLib.h"
#include "NwPlatform.h"

namespace {

// EFI_RNG_PROTOCOL, laid out as the UEFI standard publishes it.
struct EFI_RNG_PROTOCOL {
  EFI_STATUS(EFIAPI *GetInfo)
  (EFI_RNG_PROTOCOL *This, UINTN *AlgorithmListSize, EFI_GUID *AlgorithmList);
  EFI_STATUS(EFIAPI *GetRNG)
  (EFI_RNG_PROTOCOL *This, const EFI_GUID *Algorithm, UINTN ValueLength, UINT8 *Value);
};
static_assert(sizeof(EFI_RNG_PROTOCOL) == 16, "two function pointers");

constexpr EFI_GUID kRngProtocolGuid = {
    0x3152bca5, 0xeade, 0x433d, {0x86, 0x2e, 0xc0, 0x1c, 0xdc, 0x29, 0x1f, 0x44}};

// A device may report itself not ready for a moment; it is asked this often.
constexpr uint32_t kRngAttempts = 3;
// RDRAND may fail transiently when its entropy is drained; ten tries is the
// processor maker's advice.
constexpr uint32_t kRdrandAttempts = 10;
constexpr uint32_t kCpuidRdrandBit = 30; // in ECX of leaf 1

bool FromRngProtocol(uint8_t *Output, uint64_t Length) {
  if (gBS == nullptr) {
    return false;
  }
  void *Interface = nullptr;
  if (EFI_ERROR(gBS->LocateProtocol(&kRngProtocolGuid, nullptr, &Interface)) ||
      Interface == nullptr) {
    return false;
  }
  if (Length == 0) {
    return true;
  }
  EFI_RNG_PROTOCOL *Rng = static_cast<EFI_RNG_PROTOCOL *>(Interface);
  for (uint32_t Attempt = 0; Attempt < kRngAttempts; Attempt++) {
    if (!EFI_ERROR(Rng->GetRNG(Rng, nullptr, Length, Output))) {
      return true;
    }
  }
  return false;
}

bool CpuHasRdrand() {
  uint32_t Eax = 1;
  uint32_t Ebx = 0;
  uint32_t Ecx = 0;
  uint32_t Edx = 0;
  __asm__ volatile("cpuid" : "+a"(Eax), "=b"(Ebx), "+c"(Ecx), "=d"(Edx));
  return (Ecx >> kCpuidRdrandBit & 1) != 0;
}

bool Rdrand64(uint64_t *Value) {
  for (uint32_t Attempt = 0; Attempt < kRdrandAttempts; Attempt++) {
    uint8_t Ok = 0;
    __asm__ volatile("rdrand %0; setc %1" : "=r"(*Value), "=qm"(Ok) : : "cc");
    if (Ok != 0) {
      return true;
    }
  }
  return false;
}

bool FromRdrand(uint8_t *Output, uint64_t Length) {
  if (!CpuHasRdrand()) {
    return false;
  }
  uint64_t Done = 0;
  while (Done < Length) {
    uint64_t Word = 0;
    if (!Rdrand64(&Word)) {
      return false;
    }
    const uint64_t Take = Length - Done < sizeof(Word) ? Length - Done : sizeof(Word);
    CopyMem(Output + Done, &Word, Take);
    Done += Take;
  }
  return true;
}

} // namespace

UefiRandomSource UefiFillRandom(uint8_t *Output, uint64_t Length) {
  if (Output == nullptr && Length != 0) {
    return UefiRandomSource::None;
  }
  if (FromRngProtocol(Output, Length)) {
    return UefiRandomSource::RngProtocol;
  }
  if (FromRdrand(Output, Length)) {
    return UefiRandomSource::Rdrand;
  }
  return UefiRandomSource::None;
}

bool NwRandomBytes(uint8_t *Output, uint64_t Length) {
  return UefiFillRandom(Output, Length) != UefiRandomSource::None;
}
