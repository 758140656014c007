// Firmware test of the image's sockets over the firmware TCP stack, run
// inside OVMF by run-net-test.sh against the peer net-peer.pl on this
// machine's loopback, which QEMU's user networking shows the guest as
// 10.0.2.2.
//
//   NetCheck.efi SERVER ECHO CLOSED RESET SILENT FINISH [SERVER6 ECHO6]
//
// SERVER is the peer's IPv4 address, the rest are its ports: ECHO returns
// every byte, CLOSED has no listener, RESET accepts and resets at once,
// SILENT accepts and never answers, FINISH sends kFinishBytes and closes.
// SERVER6 and ECHO6, when given, repeat the echo check over IPv6.
#include "FirmwareTestConsole.h"
#include "NwPlatform.h"

namespace {

constexpr UINT64 kEchoBytes = 150000; // more than two of the connection's 64 KiB buffers
constexpr UINT64 kFinishBytes = 3000;
constexpr UINT64 kSocketWaitMs = 10000;
// The real-time clock may count whole seconds only.
constexpr UINT64 kClockSlackMs = 2000;

struct Peer {
  const char *Address;
  INT32 Family;
  UINT16 Port;
};

UINT8 PatternByte(UINT64 Index) {
  return static_cast<UINT8>(Index * 7 + Index / 251 + 3);
}

UINT16 PortArgument(UINTN Index) {
  const char *Text = FwTestArgument(Index);
  return Text == nullptr ? 0 : static_cast<UINT16>(AsciiStrDecimalToInt(Text));
}

// A connected socket to Peer, or -1 (the error printed).
INT32 ConnectTo(const Peer &P, INT32 *ConnectErrno) {
  *ConnectErrno = 0;
  INT32 Fd = NwSocket(P.Family, NW_SOCK_STREAM, 0);
  if (Fd < 0) {
    *ConnectErrno = NwGetErrno();
    FwTestPrint("socket failed: errno %d (%a)\n", *ConnectErrno, NwStrError(*ConnectErrno));
    return -1;
  }
  INT32 Result;
  if (P.Family == NW_AF_INET) {
    NwSockAddrIn In = {};
    In.sin_len = sizeof(In);
    In.sin_family = NW_AF_INET;
    In.sin_port = static_cast<UINT16>(P.Port >> 8 | (P.Port & 0xFF) << 8);
    NwInetPton(NW_AF_INET, P.Address, In.sin_addr);
    Result = NwConnect(Fd, &In, sizeof(In));
  } else {
    NwSockAddrIn6 In6 = {};
    In6.sin6_len = sizeof(In6);
    In6.sin6_family = NW_AF_INET6;
    In6.sin6_port = static_cast<UINT16>(P.Port >> 8 | (P.Port & 0xFF) << 8);
    NwInetPton(NW_AF_INET6, P.Address, In6.sin6_addr);
    Result = NwConnect(Fd, &In6, sizeof(In6));
  }
  if (Result != 0) {
    *ConnectErrno = NwGetErrno();
    NwClose(Fd);
    return -1;
  }
  return Fd;
}

// ConnectTo as a check of its own; the descriptor, or -1.
INT32 ConnectChecked(const Peer &P, const char *Label) {
  INT32 Errno = 0;
  const UINT64 Started = FwTestElapsedMs();
  const INT32 Fd = ConnectTo(P, &Errno);
  FwTestCheck(Fd >= 3, "%a: connect to port %u (errno %d, %lu ms)", Label, P.Port, Errno,
              FwTestElapsedMs() - Started);
  return Fd;
}

// Sends the pattern and reads it back; reads return what is there, never
// more than asked for.
void CheckEcho(const Peer &P, const char *Label) {
  const INT32 Fd = ConnectChecked(P, Label);
  if (Fd < 0) {
    return;
  }
  FwTestCheck(NwOpenSocketCount() == 1, "%a: one socket open", Label);
  UINT8 *Out = static_cast<UINT8 *>(AllocatePool(kEchoBytes));
  UINT8 *In = static_cast<UINT8 *>(AllocateZeroPool(kEchoBytes));
  if (Out == nullptr || In == nullptr) {
    FwTestCheck(false, "%a: buffers", Label);
    FreePool(Out);
    FreePool(In);
    NwClose(Fd);
    return;
  }
  for (UINT64 I = 0; I < kEchoBytes; I++) {
    Out[I] = PatternByte(I);
  }
  const INT64 Sent = NwSend(Fd, Out, kEchoBytes, NW_MSG_WAITALL);
  FwTestCheck(Sent == static_cast<INT64>(kEchoBytes), "%a: send of %lu bytes gave %ld", Label,
              kEchoBytes, Sent);
  const INT64 First = NwRead(Fd, In, 10);
  FwTestCheck(First >= 1 && First <= 10, "%a: a read of 10 returns 1 to 10 bytes (%ld)", Label,
              First);
  UINT64 Total = First > 0 ? static_cast<UINT64>(First) : 0;
  UINT32 Reads = 1;
  bool Bounded = true;
  while (First > 0 && Total < kEchoBytes) {
    const UINT64 Ask = kEchoBytes - Total;
    const INT64 Got = NwRead(Fd, In + Total, Ask);
    if (Got <= 0) {
      FwTestPrint("%a: read gave %ld, errno %d\n", Label, Got, NwGetErrno());
      break;
    }
    Bounded = Bounded && static_cast<UINT64>(Got) <= Ask;
    Total += static_cast<UINT64>(Got);
    Reads++;
  }
  FwTestCheck(Total == kEchoBytes && Bounded, "%a: %lu bytes came back in %u reads", Label, Total,
              Reads);
  FwTestCheck(CompareMem(In, Out, kEchoBytes) == 0, "%a: the bytes came back unchanged", Label);
  FwTestCheck(NwConnect(Fd, In, 16) == -1, "%a: a second connect is refused", Label);
  const UINT64 CloseStarted = FwTestElapsedMs();
  FwTestCheck(NwClose(Fd) == 0 && NwOpenSocketCount() == 0, "%a: close, no socket left (%lu ms)",
              Label, FwTestElapsedMs() - CloseStarted);
  FwTestCheck(NwClose(Fd) == -1 && NwGetErrno() == NwErrno::EBADF_, "%a: second close: EBADF",
              Label);
  FreePool(Out);
  FreePool(In);
}

// The peer sends Expected bytes of the pattern and closes: reads of
// ReadSize end with 0, and stay there.
void CheckFinish(const Peer &P, const char *Label, UINT64 Expected, UINT64 ReadSize) {
  const INT32 Fd = ConnectChecked(P, Label);
  if (Fd < 0) {
    return;
  }
  UINT8 *Buffer = static_cast<UINT8 *>(AllocatePool(ReadSize));
  if (!FwTestCheck(Buffer != nullptr, "%a: buffer", Label)) {
    NwClose(Fd);
    return;
  }
  const UINT64 Started = FwTestElapsedMs();
  UINT64 Total = 0;
  bool Matches = true;
  INT64 Got;
  while ((Got = NwRead(Fd, Buffer, ReadSize)) > 0) {
    for (INT64 I = 0; I < Got; I++) {
      Matches = Matches && Buffer[I] == PatternByte(Total + static_cast<UINT64>(I));
    }
    Total += static_cast<UINT64>(Got);
  }
  FwTestCheck(Got == 0 && Total == Expected && Matches,
              "%a: %lu bytes in %lu ms, then end of stream (last read %ld, errno %d)", Label, Total,
              FwTestElapsedMs() - Started, Got, NwGetErrno());
  FwTestCheck(NwRead(Fd, Buffer, ReadSize) == 0, "%a: end of stream again", Label);
  FwTestCheck(NwClose(Fd) == 0, "%a: close", Label);
  FreePool(Buffer);
}

void CheckClosedPort(const Peer &P) {
  INT32 Errno = 0;
  const UINT64 Started = FwTestElapsedMs();
  INT32 Fd = ConnectTo(P, &Errno);
  const UINT64 Took = FwTestElapsedMs() - Started;
  FwTestCheck(Fd == -1 && Errno == NwErrno::ECONNREFUSED_,
              "closed port: connect refused (errno %d, %a)", Errno, NwStrError(Errno));
  FwTestCheck(Took < kClockSlackMs + 1000, "closed port: refused at once (%lu ms)", Took);
  FwTestCheck(NwOpenSocketCount() == 0, "closed port: no socket left");
}

// The firmware tells a reset only to a receive that is waiting when it
// arrives; a reset that came before the read must give the same error. (The
// peer resets 0.2 s after accepting.)
void CheckReset(const Peer &P, bool ReadLate, const char *Label) {
  constexpr UINTN kLateReadUs = 1500000;
  const INT32 Fd = ConnectChecked(P, Label);
  if (Fd < 0) {
    return;
  }
  if (ReadLate) {
    gBS->Stall(kLateReadUs);
  }
  UINT8 Buffer[64];
  const INT64 Got = NwRead(Fd, Buffer, sizeof(Buffer));
  const INT32 Errno = NwGetErrno();
  FwTestCheck(Got == -1 && Errno == NwErrno::ECONNRESET_, "%a: read fails with %d (%a)", Label,
              Errno, NwStrError(Errno));
  FwTestCheck(NwSend(Fd, Buffer, sizeof(Buffer), NW_MSG_WAITALL) == -1 &&
                  NwGetErrno() == NwErrno::ECONNRESET_,
              "%a: a later send fails with ECONNRESET too", Label);
  FwTestCheck(NwClose(Fd) == 0, "%a: close", Label);
}

void CheckSilent(const Peer &P) {
  const INT32 Fd = ConnectChecked(P, "silent");
  if (Fd < 0) {
    return;
  }
  UINT8 Buffer[64];
  const UINT64 Started = FwTestElapsedMs();
  const INT64 Got = NwRead(Fd, Buffer, sizeof(Buffer));
  const UINT64 Took = FwTestElapsedMs() - Started;
  const INT32 Errno = NwGetErrno();
  FwTestCheck(Got == -1 && Errno == NwErrno::ETIMEDOUT_, "silent: read fails with %d (%a)", Errno,
              NwStrError(Errno));
  FwTestCheck(Took + kClockSlackMs >= kSocketWaitMs && Took <= kSocketWaitMs + 2 * kClockSlackMs,
              "silent: after the 10000 ms limit (%lu ms)", Took);
  const UINT64 CloseStarted = FwTestElapsedMs();
  FwTestCheck(NwClose(Fd) == 0 && NwOpenSocketCount() == 0, "silent: close (%lu ms)",
              FwTestElapsedMs() - CloseStarted);
}

} // namespace

extern "C" EFI_STATUS EFIAPI EfiMain(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable) {
  FwTestStart(ImageHandle, SystemTable);
  FwTestPrint("@@BEGIN net-check\n");
  const char *Server = FwTestArgument(0);
  CHAR8 Address[64] = {};
  CHAR8 Address6[64] = {};
  if (Server != nullptr) {
    AsciiStrCpyS(Address, sizeof(Address), Server);
  }
  if (FwTestArgument(6) != nullptr) {
    AsciiStrCpyS(Address6, sizeof(Address6), FwTestArgument(6));
  }
  const Peer Echo = {Address, NW_AF_INET, PortArgument(1)};
  const Peer Closed = {Address, NW_AF_INET, PortArgument(2)};
  const Peer Reset = {Address, NW_AF_INET, PortArgument(3)};
  const Peer Silent = {Address, NW_AF_INET, PortArgument(4)};
  const Peer Finish = {Address, NW_AF_INET, PortArgument(5)};
  const Peer Echo6 = {Address6, NW_AF_INET6, PortArgument(7)};
  if (FwTestCheck(Server != nullptr && Finish.Port != 0, "arguments: server and five ports")) {
    CheckEcho(Echo, "echo");
    CheckFinish(Finish, "finish", kFinishBytes, 1024);
    CheckClosedPort(Closed);
    CheckReset(Reset, false, "reset");
    CheckReset(Reset, true, "reset before the read");
    CheckSilent(Silent);
    if (Echo6.Port != 0) {
      CheckEcho(Echo6, "echo over IPv6");
    }
  }
  FwTestCheck(NwOpenSocketCount() == 0, "no socket left open");
  EFI_STATUS Status = FwTestFinish();
  FwTestPrint("@@END net-check\n");
  return Status;
}
