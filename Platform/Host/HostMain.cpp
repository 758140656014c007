// The host program: runs the image once in the hosted UEFI environment.
//
//   CIFSDRV_RAMFS     directory behind ramfs: (default ./ramfs, created)
//   CIFSDRV_VARSTORE  variable store file (default ./cifsdrv-vars.txt)
//   CIFSDRV_SMB_PORT  the port dialled for the SMB server instead of 445
//                     (a test's misbehaving server or relay)
//   CIFSDRV_POOL_PEAK set to 1: the most pool bytes the image had in use at
//                     once is printed on stderr at exit ("cifsdrv: pool
//                     peak: N bytes")
//
// The console shows exactly what the image prints; the exit code is the low
// byte of the image's status. Pool blocks or sockets the image leaves behind
// are reported on stderr ("cifsdrv: left behind: ...") without changing the
// exit code, so that scripts can check every run.
#include "HostSeams.h"
#include "HostUefi.h"
#include "NwPlatform.h"

#include <stdio.h>
#include <stdlib.h>

int main(int argc, char **argv) {
  HostConfig Config;
  Config.RamfsDir = getenv("CIFSDRV_RAMFS");
  Config.VarStore = getenv("CIFSDRV_VARSTORE");
  if (const char *Port = getenv("CIFSDRV_SMB_PORT")) {
    HostSetConnectPortOverride(static_cast<uint16_t>(atoi(Port)));
  }
  if (HostInitialize(Config) == nullptr) {
    fprintf(stderr, "cifsdrv: the hosted environment could not be set up\n");
    return 1;
  }
  uint64_t PoolBefore = HostPoolOutstanding();
  uint32_t SocketsBefore = NwOpenSocketCount();
  const char *ReportPeak = getenv("CIFSDRV_POOL_PEAK");
  HostPoolResetPeak();
  uint64_t BytesBefore = HostPoolOutstandingBytes();
  EFI_STATUS Status = HostRunImage(argc, argv);
  uint64_t PoolLeft = HostPoolOutstanding() - PoolBefore;
  uint32_t SocketsLeft = NwOpenSocketCount() - SocketsBefore;
  if (PoolLeft != 0 || SocketsLeft != 0) {
    fprintf(stderr, "cifsdrv: left behind: %llu pool blocks, %u sockets\n",
            static_cast<unsigned long long>(PoolLeft), SocketsLeft);
  }
  if (ReportPeak != nullptr && ReportPeak[0] == '1') {
    fprintf(stderr, "cifsdrv: pool peak: %llu bytes\n",
            static_cast<unsigned long long>(HostPoolPeakBytes() - BytesBefore));
  }
  HostShutdown();
  return static_cast<int>(Status & 0xFF);
}
