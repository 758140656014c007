// TCP transport of the SMB2 client over the platform's BSD socket facade.
//
// The transport prints on its own debug channel, which stays at level 0:
// its trace (2) and verbose (5) lines are compiled in but silent, and only
// the unconditional failure messages appear.
#include "smb2/TcpTransport.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Header.h"

namespace {

constexpr INT32 TCP_FAILED = -1;
constexpr INT32 TCP_EINVAL = NwErrno::EINVAL_;
constexpr INT32 TCP_ECONNRESET = NwErrno::ECONNRESET_;
constexpr INT32 TCP_ETIMEDOUT = NwErrno::ETIMEDOUT_;
constexpr INT32 TCP_POLL_TIMEOUT_MS = 10000;
constexpr INT32 TCP_POLLIN = 0x0001;

UINT16 HostToNet16(UINT16 Value) {
  return static_cast<UINT16>((Value << 8) | (Value >> 8));
}

// The readiness wait set up before each send and receive. The wait itself is
// deliberately not performed: the ready count is fixed at 1 and the transfer
// runs at once. A silent peer is bounded by the socket's own time limit
// instead (the same 10000 ms). The outcome handling for the other counts is
// kept for the day a real wait is added.
struct TcpPollSetup {
  INT32 Fd;
  INT16 Events;
  UINT8 FdSet[32];
  INT32 TimeoutMs;
};

INT32 TcpPollReady(INT32 SockFd, TcpPollSetup *Poll) {
  ZeroMem(Poll, sizeof(*Poll));
  Poll->Fd = SockFd;
  Poll->Events = TCP_POLLIN;
  if (SockFd >= 0 && SockFd < 256) {
    Poll->FdSet[SockFd / 8] = static_cast<UINT8>(1u << (SockFd % 8));
  }
  Poll->TimeoutMs = TCP_POLL_TIMEOUT_MS;
  return 1;
}

// Outcome of a readiness wait that did not report the descriptor ready.
INT32 TcpPollFailure(INT32 Ready) {
  INT32 Err = NwGetErrno();
  if (Ready < 0) {
    TcpLog(DIAG_ALWAYS, "poll call failed! Status = %d, errno: %d, %s\n", Ready, Err,
           NwStrError(Err));
    if (Err == TCP_ECONNRESET) {
      TcpLog(DIAG_ALWAYS, "Server has reset the connection!\n");
      return TCP_ECONNRESET;
    }
    return TCP_FAILED;
  }
  TcpLog(DIAG_ALWAYS, "poll call failed or timedout! Status = %d, errno: %d, %s\n", Ready, Err,
         NwStrError(Err));
  if (Err == TCP_ECONNRESET) {
    TcpLog(DIAG_ALWAYS, "Server has reset the connection!\n");
    return TCP_ECONNRESET;
  }
  if (Err == TCP_ETIMEDOUT) {
    TcpLog(DIAG_ALWAYS, "poll call has timeout!\n");
    return TCP_FAILED;
  }
  TcpLog(DIAG_ALWAYS, "poll returned failure!\n");
  return TCP_FAILED;
}

} // namespace

INT32 TCP_GetDomainTypeByIPAddress(const CHAR8 *IpAddress, INT32 *Domain, UINT16 Port,
                                   NwSockAddrIn *SocketAddr, NwSockAddrIn6 *SocketAddr6) {
  DiagEntry(DiagChannel::Tcp);
  if (IpAddress == nullptr || Domain == nullptr || SocketAddr == nullptr ||
      SocketAddr6 == nullptr) {
    TcpLog(DIAG_ALWAYS, "Input parameter is NULL!\n");
    return TCP_EINVAL;
  }
  TcpLog(DIAG_VERBOSE, "IN: IPAddress (s) = %s\n", IpAddress);
  TcpLog(DIAG_VERBOSE, "IN: Port = %d\n", Port);

  INT32 Result = NwInetPton(NW_AF_INET, IpAddress, SocketAddr->sin_addr);
  if (Result == 1) {
    SocketAddr->sin_len = sizeof(NwSockAddrIn);
    SocketAddr->sin_family = NW_AF_INET;
    SocketAddr->sin_port = HostToNet16(Port);
    *Domain = NW_AF_INET;
    UINT32 Addr = static_cast<UINT32>(SocketAddr->sin_addr[0]) |
                  (static_cast<UINT32>(SocketAddr->sin_addr[1]) << 8) |
                  (static_cast<UINT32>(SocketAddr->sin_addr[2]) << 16) |
                  (static_cast<UINT32>(SocketAddr->sin_addr[3]) << 24);
    TcpLog(DIAG_VERBOSE, "SocketAddr->sin_addr = %d\n", Addr);
    TcpLog(DIAG_VERBOSE, "SocketAddr->sin_family = %d\n", SocketAddr->sin_family);
    TcpLog(DIAG_VERBOSE, "SocketAddr->sin_port = %d\n", SocketAddr->sin_port);
  } else if (Result != 0) {
    INT32 Err = NwGetErrno();
    TcpLog(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Error! errno = %d (%s)\n", __func__,
           __LINE__, Err, NwStrError(Err));
    return Result;
  } else {
    Result = NwInetPton(NW_AF_INET6, IpAddress, SocketAddr6->sin6_addr);
    if (Result != 1) {
      INT32 Err = NwGetErrno();
      TcpLog(DIAG_ALWAYS,
             "Function: %s, Line no.: = %d, IP check failed! Status = 0x%x (%d), errno = %d "
             "(%s)\n",
             __func__, __LINE__, Result, Result, Err, NwStrError(Err));
      return TCP_FAILED;
    }
    SocketAddr6->sin6_len = sizeof(NwSockAddrIn6);
    SocketAddr6->sin6_family = NW_AF_INET6;
    SocketAddr6->sin6_port = HostToNet16(Port);
    *Domain = NW_AF_INET6;
    TcpLog(DIAG_VERBOSE, "SocketAddr6->sin6_family = %d\n", SocketAddr6->sin6_family);
    TcpLog(DIAG_VERBOSE, "SocketAddr6->sin6_port = %d\n", SocketAddr6->sin6_port);
  }
  TcpLog(DIAG_VERBOSE, "Domain = %d\n", *Domain);
  TcpLog(DIAG_TRACE, "Function: %s, Line no.: = %d. Exiting! Status = %d (0x%x)\n", __func__,
         __LINE__, 0, 0);
  return 0;
}

INT32 TCP_CreateSocket(INT32 *SockFd, INT32 Domain) {
  if (SockFd == nullptr) {
    TcpLog(DIAG_ALWAYS, "Input parameter is NULL!\n");
    return TCP_EINVAL;
  }
  INT32 Fd = NwSocket(Domain, NW_SOCK_STREAM, 0);
  if (Fd == -1) {
    INT32 Err = NwGetErrno();
    TcpLog(DIAG_ALWAYS, "Socket failed! errno = %d (%s)\n", Err, NwStrError(Err));
    return TCP_FAILED;
  }
  *SockFd = Fd;
  TcpLog(DIAG_VERBOSE, "SockFd = %d\n", Fd);
  return 0;
}

INT32 TCP_Connect(INT32 SockFd, UINT8 SetOption, INT32 OptionLevel, INT32 OptionName,
                  INT32 OptionValue, const void *SocketAddr, UINT32 AddrLength) {
  if (SocketAddr == nullptr) {
    TcpLog(DIAG_ALWAYS, "Input parameter is NULL!\n");
    return TCP_EINVAL;
  }
  if (SetOption == 1 &&
      NwSetSockOpt(SockFd, OptionLevel, OptionName, &OptionValue, sizeof(OptionValue)) == -1) {
    TcpLog(DIAG_ALWAYS, "setsockopt failed! errno = %d\n", NwGetErrno());
    return TCP_FAILED;
  }
  TcpLog(DIAG_VERBOSE, "\nConnecting...\n");
  INT32 Result = NwConnect(SockFd, SocketAddr, AddrLength);
  if (Result == -1) {
    INT32 Err = NwGetErrno();
    TcpLog(DIAG_ALWAYS, "connect failed! errno = %d (%s)\n", Err, NwStrError(Err));
  }
  return Result;
}

INT32 TCP_SendMessage(INT32 SockFd, const void *Buffer, INT64 Size, INT64 *SentBytes) {
  if (Size <= 0 || Buffer == nullptr || SentBytes == nullptr) {
    TcpLog(DIAG_ALWAYS, "Input parameter is NULL!\n");
    return TCP_EINVAL;
  }
  TcpLog(DIAG_VERBOSE, "SockFd = %d\n", SockFd);
  *SentBytes = 0;
  INT64 Sent = NwSend(SockFd, Buffer, static_cast<UINT64>(Size), NW_MSG_WAITALL);
  if (Sent < 0) {
    INT32 Err = NwGetErrno();
    TcpLog(DIAG_MISMATCH, "Send failed! %d, SendBytes = %d, errno = %d (%s)\n",
           static_cast<INT32>(Sent), static_cast<INT32>(*SentBytes), Err, NwStrError(Err));
    *SentBytes = -1;
    return TCP_FAILED;
  }
  *SentBytes += Sent;
  return 0;
}

INT32 TCP_PollAndSendMessage(INT32 SockFd, const void *Buffer, INT64 Size, INT64 *SentBytes) {
  TcpPollSetup Poll;
  INT32 Ready = TcpPollReady(SockFd, &Poll);
  if (Ready != 1) {
    return TcpPollFailure(Ready);
  }
  return TCP_SendMessage(SockFd, Buffer, Size, SentBytes);
}

INT32 TCP_ReceiveMessage(INT32 SockFd, void *Buffer, INT64 Size, INT64 *ReceivedBytes) {
  if (Size <= 0 || Buffer == nullptr || ReceivedBytes == nullptr) {
    TcpLog(DIAG_ALWAYS, "Input parameter is NULL! MessageSize = 0x%x\n", static_cast<UINT32>(Size));
    return TCP_EINVAL;
  }
  TcpLog(DIAG_VERBOSE, "SockFd = %d\n", SockFd);
  *ReceivedBytes = 0;
  // errno is cleared first so that a reset recorded by an earlier call is
  // not mistaken for one that ended this read.
  NwSetErrno(0);
  INT64 Got = NwRead(SockFd, Buffer, static_cast<UINT64>(Size));
  if (Got == -1) {
    INT32 Err = NwGetErrno();
    TcpLog(DIAG_ALWAYS, "Receive failed! %d, errno = %d (%s)\n", static_cast<INT32>(Got), Err,
           NwStrError(Err));
    *ReceivedBytes = -1;
    if (Err == TCP_ECONNRESET) {
      TcpLog(DIAG_ALWAYS, "Server has reset the connection!\n");
      return TCP_ECONNRESET;
    }
    return TCP_FAILED;
  }
  *ReceivedBytes += Got;
  if (*ReceivedBytes == Size) {
    return 0;
  }
  INT32 Err = NwGetErrno();
  if (Err == TCP_ECONNRESET) {
    TcpLog(DIAG_ALWAYS, "Server has reset the connection!\n");
    return TCP_ECONNRESET;
  }
  TcpLog(DIAG_MISMATCH, "Receive failed! %d, ReceivedBytes = %d, errno = %d (%s)\n",
         static_cast<INT32>(Got), static_cast<INT32>(*ReceivedBytes), Err, NwStrError(Err));
  return TCP_FAILED;
}

INT32 TCP_PollAndReceiveMessage(INT32 SockFd, void *Buffer, INT64 Size, INT64 *ReceivedBytes) {
  TcpPollSetup Poll;
  INT32 Ready = TcpPollReady(SockFd, &Poll);
  TcpLog(DIAG_VERBOSE, "\nPolling for receive data\n");
  if (Ready != 1) {
    return TcpPollFailure(Ready);
  }
  return TCP_ReceiveMessage(SockFd, Buffer, Size, ReceivedBytes);
}

// Receives until Size bytes are in. The loop limit is carried and printed but
// deliberately does not end the loop: short reads are normal on a stream.
// What does end it early is a peer that stops sending: a receive that failed
// outright (count -1: reset, time-out, other socket error) or one that found
// the connection closed (count 0) returns that failure at once instead of
// spinning on a dead connection.
INT32 TCP_PollAndTryToRxAllData(INT32 SockFd, void *Buffer, INT64 Size, UINT8 LoopCount,
                                INT64 *TotalRead) {
  if (Buffer == nullptr || Size <= 0 || TotalRead == nullptr || LoopCount == 0) {
    TcpLog(DIAG_ALWAYS, "%s: Input parameter is NULL! MessageSize = 0x%x, LoopCnt = %d\n", __func__,
           static_cast<UINT32>(Size), LoopCount);
    return TCP_EINVAL;
  }
  UINT8 *Bytes = static_cast<UINT8 *>(Buffer);
  *TotalRead = -1;
  INT64 Total = 0;
  INT64 LastCount = 0;
  UINT8 Loops = 0;
  INT32 Result = 0;
  for (;;) {
    INT64 Remaining = Size - Total;
    TcpLog(DIAG_VERBOSE, "ReadDataSize = 0x%x (%ld)\n", static_cast<UINT32>(Remaining), Remaining);
    Result = TCP_PollAndReceiveMessage(SockFd, Bytes + Total, Remaining, &LastCount);
    Total += LastCount;
    TcpLog(DIAG_VERBOSE, "BytesRead = 0x%x (%ld)\n", static_cast<UINT32>(LastCount), LastCount);
    TcpLog(DIAG_VERBOSE, "TotalBytesRead = 0x%x (%ld)\n", static_cast<UINT32>(Total), Total);
    if (Total >= Size) {
      break;
    }
    if (Result != 0 && LastCount <= 0) {
      break;
    }
    Loops++;
    if (Loops >= LoopCount) {
      TcpLog(DIAG_VERBOSE, "LoopCnt = %d reached, TotalBytesRead = %ld\n", Loops, Total);
    }
  }
  *TotalRead = Total;
  return Result;
}

INT32 TCP_CloseSocket(INT32 SockFd) {
  TcpLog(DIAG_VERBOSE, "SockFd = %d\n", SockFd);
  INT32 Result = NwClose(SockFd);
  if (Result != 0) {
    INT32 Err = NwGetErrno();
    TcpLog(DIAG_ALWAYS, "Socket close failed! errno = %d (%s)\n", Err, NwStrError(Err));
  }
  return Result;
}

// ---------------------------------------------------------------------------
// The SMB2 client's connection
// ---------------------------------------------------------------------------
EFI_STATUS SMB2NegotiateConnect(const CHAR8 *IpAddress, INT32 *SockFd, TRANSACT_DETAILS *Details) {
  DiagEntry(DiagChannel::Smb2);
  if (IpAddress == nullptr || SockFd == nullptr || Details == nullptr) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Invalid Parameter!\n", __func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  NwSockAddrIn Addr4;
  NwSockAddrIn6 Addr6;
  ZeroMem(&Addr4, sizeof(Addr4));
  ZeroMem(&Addr6, sizeof(Addr6));
  INT32 Domain = 0;
  INT32 TcpStatus =
      TCP_GetDomainTypeByIPAddress(IpAddress, &Domain, SMB2_SERVER_PORT, &Addr4, &Addr6);
  if (TcpStatus != 0) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, TCP_GetDomainTypeByIPAddress failed! Status = 0x%x "
            "(%d)\n",
            __func__, __LINE__, TcpStatus, TcpStatus);
    return EFI_DEVICE_ERROR;
  }
  Smb2Log(DIAG_VERBOSE, "Domain = %d\n", Domain);
  INT32 Fd = 0;
  TcpStatus = TCP_CreateSocket(&Fd, Domain);
  if (TcpStatus != 0) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, TCP socket failed! TCP_Status = 0x%x (%d)\n", __func__,
            __LINE__, TcpStatus, TcpStatus);
    return EFI_DEVICE_ERROR;
  }
  Smb2Log(DIAG_VERBOSE, "SockFd = %d\n", Fd);
  gSMB2SockFd = Fd;
  *SockFd = Fd;

  // TCP_Connect gets the keep-alive option prepared but its flag off, so no
  // option is set.
  constexpr INT32 kOptionLevel = NW_SOL_SOCKET;
  constexpr INT32 kOptionName = 0x200;
  constexpr INT32 kOptionValue = 1;
  CHAR8 *Formatted = Details->ShareDetails.FormattedAddress;
  if (Domain == NW_AF_INET) {
    Smb2Log(DIAG_VERBOSE, "SocketAddr.sin_family = %d\n", Addr4.sin_family);
    Smb2Log(DIAG_VERBOSE, "SocketAddr.sin_port = %d\n", Addr4.sin_port);
    AsciiSPrint(Formatted, SMB2_FORMATTED_ADDRESS_FIELD, "%pI4", Addr4.sin_addr);
    TcpStatus = TCP_Connect(Fd, 0, kOptionLevel, kOptionName, kOptionValue, &Addr4, sizeof(Addr4));
  } else if (Domain == NW_AF_INET6) {
    Smb2Log(DIAG_VERBOSE, "SocketAddr6.sin_family = %d\n", Addr6.sin6_family);
    Smb2Log(DIAG_VERBOSE, "SocketAddr6.sin_port = %d\n", Addr6.sin6_port);
    AsciiSPrint(Formatted, SMB2_FORMATTED_ADDRESS_FIELD, "%pI6", Addr6.sin6_addr);
    TcpStatus = TCP_Connect(Fd, 0, kOptionLevel, kOptionName, kOptionValue, &Addr6, sizeof(Addr6));
  } else {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Invalid Domain %d\n", __func__, __LINE__,
            Domain);
    return EFI_UNSUPPORTED;
  }
  EFI_STATUS Status = TcpStatus == -1 ? EFI_DEVICE_ERROR : EFI_SUCCESS;
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}
