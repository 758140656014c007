#include "FirmwareTestConsole.h"

#include "NwPlatform.h"

namespace {

constexpr UINTN kLineChars = 512;
constexpr UINTN kArgumentChars = 128;
constexpr UINTN kMaxHexBytes = 64;

UINT32 gPassed = 0;
UINT32 gFailed = 0;
UINT64 gStartMs = 0;
CHAR8 gArgument[kArgumentChars];
CHAR8 gHex[kMaxHexBytes * 2 + 1];

UINT64 ClockMs() {
  NwTimeVal Now = {};
  if (NwGetTimeOfDay(&Now) != 0) {
    return 0;
  }
  return static_cast<UINT64>(Now.tv_sec) * 1000 + static_cast<UINT64>(Now.tv_usec) / 1000;
}

// Writes Text to the console, with CR LF line ends.
void Output(const CHAR8 *Text) {
  CHAR16 Line[kLineChars + 2];
  UINTN Used = 0;
  for (const CHAR8 *P = Text; *P != '\0'; P++) {
    if (Used + 3 >= kLineChars) {
      Line[Used] = 0;
      gST->ConOut->OutputString(gST->ConOut, Line);
      Used = 0;
    }
    if (*P == '\n') {
      Line[Used++] = '\r';
    }
    Line[Used++] = static_cast<UINT8>(*P);
  }
  Line[Used] = 0;
  gST->ConOut->OutputString(gST->ConOut, Line);
}

void VPrint(const char *Format, va_list Args) {
  CHAR8 Text[kLineChars];
  AsciiVSPrint(Text, sizeof(Text), Format, Args);
  Output(Text);
}

} // namespace

void FwTestStart(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable) {
  gImageHandle = ImageHandle;
  gST = SystemTable;
  gBS = SystemTable->BootServices;
  gRT = SystemTable->RuntimeServices;
  gStartMs = ClockMs();
}

void FwTestPrint(const char *Format, ...) {
  va_list Args;
  va_start(Args, Format);
  VPrint(Format, Args);
  va_end(Args);
}

bool FwTestCheck(bool Passed, const char *Format, ...) {
  (Passed ? gPassed : gFailed)++;
  Output(Passed ? "@@CHECK ok " : "@@CHECK FAIL ");
  va_list Args;
  va_start(Args, Format);
  VPrint(Format, Args);
  va_end(Args);
  Output("\n");
  return Passed;
}

EFI_STATUS FwTestFinish() {
  FwTestPrint("@@RESULT %u passed, %u failed\n", gPassed, gFailed);
  return gFailed == 0 ? EFI_SUCCESS : EFI_ABORTED;
}

const char *FwTestArgument(UINTN Index) {
  void *Interface = nullptr;
  if (EFI_ERROR(gBS->HandleProtocol(gImageHandle, &gEfiShellParametersProtocolGuid, &Interface)) ||
      Interface == nullptr) {
    return nullptr;
  }
  EFI_SHELL_PARAMETERS_PROTOCOL *Parameters =
      static_cast<EFI_SHELL_PARAMETERS_PROTOCOL *>(Interface);
  if (Index + 1 >= Parameters->Argc) {
    return nullptr;
  }
  UnicodeStrToAsciiS(Parameters->Argv[Index + 1], gArgument, kArgumentChars);
  return gArgument;
}

UINT64 FwTestElapsedMs() {
  return ClockMs() - gStartMs;
}

const char *FwTestHex(const UINT8 *Bytes, UINTN Length) {
  constexpr char kDigits[] = "0123456789abcdef";
  UINTN Count = Length < kMaxHexBytes ? Length : kMaxHexBytes;
  for (UINTN I = 0; I < Count; I++) {
    gHex[2 * I] = kDigits[Bytes[I] >> 4];
    gHex[2 * I + 1] = kDigits[Bytes[I] & 0xF];
  }
  gHex[2 * Count] = '\0';
  return gHex;
}
