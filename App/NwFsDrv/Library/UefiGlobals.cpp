// The firmware tables every module reaches through. The image entry fills
// them in before anything else runs; until then they are null and the
// helpers that need them do nothing.
#include "NwBaseLib.h"

EFI_HANDLE gImageHandle = nullptr;
EFI_SYSTEM_TABLE *gST = nullptr;
EFI_BOOT_SERVICES *gBS = nullptr;
EFI_RUNTIME_SERVICES *gRT = nullptr;
