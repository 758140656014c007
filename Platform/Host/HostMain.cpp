// The host program: runs the image once in the hosted UEFI environment.
//
//   CIFSDRV_RAMFS     directory behind ramfs: (default ./ramfs, created)
//   CIFSDRV_VARSTORE  variable store file (default ./cifsdrv-vars.txt)
//
// The console shows exactly what the image prints; the exit code is the low
// byte of the image's status.
#include "HostUefi.h"

#include <stdio.h>
#include <stdlib.h>

int main(int argc, char **argv) {
  HostConfig Config;
  Config.RamfsDir = getenv("CIFSDRV_RAMFS");
  Config.VarStore = getenv("CIFSDRV_VARSTORE");
  if (HostInitialize(Config) == nullptr) {
    fprintf(stderr, "cifsdrv: the hosted environment could not be set up\n");
    return 1;
  }
  EFI_STATUS Status = HostRunImage(argc, argv);
  HostShutdown();
  return static_cast<int>(Status & 0xFF);
}
