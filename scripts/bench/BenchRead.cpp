// Read throughput of the network library, for scripts/bench-read.sh:
// connects to a share, reads one file ROUNDS times through GEE_NWFRead in
// 1 MiB calls (the volume's largest) and prints each time and the median.
//
//   bench-read SERVER SHARE USER PASSWORD FILE SIZE [ROUNDS]
#include "DiagLog.h"
#include "HostUefi.h"
#include "volume/NWLib.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

namespace {

std::u16string Wide(const char *Text) {
  return std::u16string(Text, Text + std::char_traits<char>::length(Text));
}

} // namespace

int main(int Argc, char **Argv) {
  if (Argc < 7) {
    fprintf(stderr, "usage: %s SERVER SHARE USER PASSWORD FILE SIZE [ROUNDS]\n", Argv[0]);
    return 2;
  }
  HostConfig Config;
  Config.RamfsDir = getenv("CIFSDRV_RAMFS");
  Config.VarStore = getenv("CIFSDRV_VARSTORE");
  if (HostInitialize(Config) == nullptr) {
    return 1;
  }
  gImageHandle = HostImageHandle();
  gST = HostSystemTable();
  gBS = gST->BootServices;
  gRT = gST->RuntimeServices;
  gDriverDebugLevel = 0;
  std::u16string Server = Wide(Argv[1]), ShareName = Wide(Argv[2]), User = Wide(Argv[3]),
                 Password = Wide(Argv[4]), Name = Wide(Argv[5]);
  const UINT64 Size = strtoull(Argv[6], nullptr, 10);
  const int Rounds = Argc > 7 ? std::max(1, atoi(Argv[7])) : 5;

  NW_SHARE_INFO Share = {};
  Share.sharename = ShareName.data();
  Share.shareType = NW_SHARE_TYPE_CIFS;
  NW_CONNECTION_PARAMS Params = {Server.data(), User.data(), Password.data(), 0, 0};
  if (EFI_ERROR(GEE_NWInit(gImageHandle, gST, NW_SHARE_TYPE_CIFS)) ||
      EFI_ERROR(GEE_NWFSConnect(&Params, &Share))) {
    fprintf(stderr, "bench-read: connect failed\n");
    return 1;
  }
  std::vector<UINT8> Buffer(1024 * 1024);
  std::vector<double> Seconds;
  for (int Round = 0; Round < Rounds; Round++) {
    NW_REMOTE_FILE File = {};
    File.FileName = Name.data();
    if (EFI_ERROR(GEE_NWFOpen(&Share, &File, EFI_FILE_MODE_READ, 2))) {
      fprintf(stderr, "bench-read: open failed\n");
      return 1;
    }
    auto Start = std::chrono::steady_clock::now();
    for (UINT64 At = 0; At < Size;) {
      UINTN Count = 0;
      UINTN Length = Buffer.size();
      UINT64 Offset = At;
      if (EFI_ERROR(GEE_NWFRead(&Share, &File, Buffer.data(), &Length, &Offset, &Count)) ||
          Count == 0) {
        fprintf(stderr, "bench-read: read failed at %llu\n", static_cast<unsigned long long>(At));
        return 1;
      }
      At += Count;
    }
    Seconds.push_back(
        std::chrono::duration<double>(std::chrono::steady_clock::now() - Start).count());
    GEE_NWFClose(&Share, &File);
    printf("bench-read: round %d %.3f s %.1f MiB/s\n", Round, Seconds.back(),
           Size / 1048576.0 / Seconds.back());
  }
  GEE_NWFSDisconnect(&Share, nullptr);
  GEE_NWDeInit(NW_SHARE_TYPE_CIFS);
  std::sort(Seconds.begin(), Seconds.end());
  const double Median = Seconds[Seconds.size() / 2];
  printf("bench-read: GEE_NWFRead median %.3f s %.1f MiB/s\n", Median, Size / 1048576.0 / Median);
  HostShutdown();
  return 0;
}
