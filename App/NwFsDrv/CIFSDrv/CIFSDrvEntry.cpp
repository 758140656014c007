// The image's entry symbol. Everything it does is in ShellCEntryLib.
#include "NwFsDrv.h"

extern "C" EFI_STATUS EFIAPI EfiMain(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable) {
  return ShellCEntryLib(ImageHandle, SystemTable);
}
