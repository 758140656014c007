// The socket and clock facade of NwPlatform.h on Linux: POSIX sockets behind
// the BSD-style interface the image uses. Addresses arrive in the BSD layout
// with a leading length byte, and error numbers leave in the BSD numbering,
// whatever Linux calls them.
//
// Every socket created here gets receive and send time limits (10000 ms by
// default), so a peer that goes silent ends a blocking read with ETIMEDOUT
// (60) instead of hanging the program. Connections are refused for
// addresses outside loopback unless CIFSDRV_ALLOW_REMOTE=1 is set: the hosted
// program is a test vehicle.
#include "HostSeams.h"
#include "NwPlatform.h"

#include <arpa/inet.h>
#include <errno.h>
#include <netinet/in.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <atomic>

namespace {

thread_local int32_t tErrno = 0;
std::atomic<uint32_t> gOpenSockets{0};
std::atomic<uint32_t> gSocketTimeoutMs{10000};
std::atomic<uint16_t> gConnectPort{0};
bool gTimeOverrideSet = false;
NwTimeVal gTimeOverride = {};
bool gTimeFails = false;

struct ErrnoMapping {
  int Linux;
  int32_t Bsd;
  const char *Text;
};

// Linux errno → BSD errno, with the text strerror gives for it.
constexpr ErrnoMapping kErrnoTable[] = {
    {EPERM, NwErrno::EPERM_, "Operation not permitted"},
    {ENOENT, NwErrno::ENOENT_, "No such file or directory"},
    {EINTR, NwErrno::EINTR_, "Interrupted system call"},
    {EIO, NwErrno::EIO_, "Input/output error"},
    {EBADF, NwErrno::EBADF_, "Bad file descriptor"},
    {ENOMEM, NwErrno::ENOMEM_, "Cannot allocate memory"},
    {EACCES, NwErrno::EACCES_, "Permission denied"},
    {EFAULT, NwErrno::EFAULT_, "Bad address"},
    {EINVAL, NwErrno::EINVAL_, "Invalid argument"},
    {EMFILE, NwErrno::EMFILE_, "Too many open files"},
    {EPIPE, NwErrno::EPIPE_, "Broken pipe"},
    {EAGAIN, NwErrno::EAGAIN_, "Resource temporarily unavailable"},
    {EAFNOSUPPORT, NwErrno::EAFNOSUPPORT_, "Address family not supported by protocol family"},
    {EADDRNOTAVAIL, NwErrno::EADDRNOTAVAIL_, "Can't assign requested address"},
    {ENETDOWN, NwErrno::ENETDOWN_, "Network is down"},
    {ENETUNREACH, NwErrno::ENETUNREACH_, "Network is unreachable"},
    {ECONNABORTED, NwErrno::ECONNABORTED_, "Software caused connection abort"},
    {ECONNRESET, NwErrno::ECONNRESET_, "Connection reset by peer"},
    {ENOTCONN, NwErrno::ENOTCONN_, "Socket is not connected"},
    {ETIMEDOUT, NwErrno::ETIMEDOUT_, "Operation timed out"},
    {ECONNREFUSED, NwErrno::ECONNREFUSED_, "Connection refused"},
    {EHOSTUNREACH, NwErrno::EHOSTUNREACH_, "No route to host"},
};

int32_t MapErrno(int LinuxErrno) {
  for (const ErrnoMapping &M : kErrnoTable) {
    if (M.Linux == LinuxErrno) {
      return M.Bsd;
    }
  }
  return NwErrno::EIO_;
}

int32_t FailWith(int32_t BsdErrno) {
  tErrno = BsdErrno;
  return -1;
}

// A blocking socket whose receive or send time limit ran out reports EAGAIN;
// to the image that is a time-out.
int32_t MapIoErrno(int LinuxErrno) {
  if (LinuxErrno == EAGAIN || LinuxErrno == EWOULDBLOCK) {
    return NwErrno::ETIMEDOUT_;
  }
  return MapErrno(LinuxErrno);
}

bool RemoteAllowed() {
  const char *Allow = getenv("CIFSDRV_ALLOW_REMOTE");
  return Allow != nullptr && strcmp(Allow, "1") == 0;
}

void ApplyTimeouts(int Fd) {
  uint32_t Ms = gSocketTimeoutMs.load();
  timeval Tv = {};
  Tv.tv_sec = Ms / 1000;
  Tv.tv_usec = (Ms % 1000) * 1000;
  setsockopt(Fd, SOL_SOCKET, SO_RCVTIMEO, &Tv, sizeof(Tv));
  setsockopt(Fd, SOL_SOCKET, SO_SNDTIMEO, &Tv, sizeof(Tv));
}

} // namespace

int32_t NwSocket(int32_t Domain, int32_t Type, int32_t Protocol) {
  int Family;
  if (Domain == NW_AF_INET) {
    Family = AF_INET;
  } else if (Domain == NW_AF_INET6) {
    Family = AF_INET6;
  } else {
    return FailWith(NwErrno::EAFNOSUPPORT_);
  }
  if (Type != NW_SOCK_STREAM) {
    return FailWith(NwErrno::EINVAL_);
  }
  int Fd = socket(Family, SOCK_STREAM | SOCK_CLOEXEC, Protocol);
  if (Fd < 0) {
    return FailWith(MapErrno(errno));
  }
  ApplyTimeouts(Fd);
  gOpenSockets++;
  return Fd;
}

int32_t NwSetSockOpt(int32_t Fd, int32_t Level, int32_t Name, const void *Value, uint32_t Length) {
  if (Level != NW_SOL_SOCKET || Value == nullptr || Length != sizeof(int32_t)) {
    return FailWith(NwErrno::EINVAL_);
  }
  int LinuxName;
  switch (Name) {
  case NW_SO_KEEPALIVE:
    LinuxName = SO_KEEPALIVE;
    break;
  case 0x0004: // SO_REUSEADDR
    LinuxName = SO_REUSEADDR;
    break;
  case 0x0200: // SO_REUSEPORT
    LinuxName = SO_REUSEPORT;
    break;
  default:
    return FailWith(NwErrno::EINVAL_);
  }
  int32_t Flag;
  memcpy(&Flag, Value, sizeof(Flag));
  int LinuxValue = Flag;
  if (setsockopt(Fd, SOL_SOCKET, LinuxName, &LinuxValue, sizeof(LinuxValue)) != 0) {
    return FailWith(MapErrno(errno));
  }
  return 0;
}

int32_t NwConnect(int32_t Fd, const void *Address, uint32_t AddressLength) {
  if (Address == nullptr) {
    return FailWith(NwErrno::EFAULT_);
  }
  sockaddr_storage Storage = {};
  socklen_t Size = 0;
  bool Loopback = false;
  uint16_t PortOverride = gConnectPort.load();
  if (AddressLength == sizeof(NwSockAddrIn)) {
    NwSockAddrIn Bsd;
    memcpy(&Bsd, Address, sizeof(Bsd));
    if (Bsd.sin_family != NW_AF_INET) {
      return FailWith(NwErrno::EAFNOSUPPORT_);
    }
    sockaddr_in *In = reinterpret_cast<sockaddr_in *>(&Storage);
    In->sin_family = AF_INET;
    In->sin_port = PortOverride != 0 ? htons(PortOverride) : Bsd.sin_port;
    memcpy(&In->sin_addr, Bsd.sin_addr, 4);
    Loopback = Bsd.sin_addr[0] == 127;
    Size = sizeof(sockaddr_in);
  } else if (AddressLength == sizeof(NwSockAddrIn6)) {
    NwSockAddrIn6 Bsd;
    memcpy(&Bsd, Address, sizeof(Bsd));
    if (Bsd.sin6_family != NW_AF_INET6) {
      return FailWith(NwErrno::EAFNOSUPPORT_);
    }
    sockaddr_in6 *In6 = reinterpret_cast<sockaddr_in6 *>(&Storage);
    In6->sin6_family = AF_INET6;
    In6->sin6_port = PortOverride != 0 ? htons(PortOverride) : Bsd.sin6_port;
    In6->sin6_flowinfo = Bsd.sin6_flowinfo;
    memcpy(&In6->sin6_addr, Bsd.sin6_addr, 16);
    In6->sin6_scope_id = Bsd.sin6_scope_id;
    Loopback = IN6_IS_ADDR_LOOPBACK(&In6->sin6_addr) != 0;
    Size = sizeof(sockaddr_in6);
  } else {
    return FailWith(NwErrno::EINVAL_);
  }
  if (!Loopback && !RemoteAllowed()) {
    return FailWith(NwErrno::ENETUNREACH_);
  }
  int Result;
  do {
    Result = connect(Fd, reinterpret_cast<sockaddr *>(&Storage), Size);
  } while (Result != 0 && errno == EINTR);
  if (Result != 0) {
    return FailWith(MapIoErrno(errno));
  }
  return 0;
}

int64_t NwSend(int32_t Fd, const void *Buffer, uint64_t Length, int32_t Flags) {
  // A blocking send on Linux already waits for the whole buffer, which is
  // what the wait-all flag asks for; the only flag passed on is the one that
  // keeps a closed peer from raising SIGPIPE.
  (void)Flags;
  ssize_t Sent;
  do {
    Sent = send(Fd, Buffer, Length, MSG_NOSIGNAL);
  } while (Sent < 0 && errno == EINTR);
  if (Sent < 0) {
    tErrno = MapIoErrno(errno);
    return -1;
  }
  return Sent;
}

int64_t NwRead(int32_t Fd, void *Buffer, uint64_t Length) {
  ssize_t Got;
  do {
    Got = read(Fd, Buffer, Length);
  } while (Got < 0 && errno == EINTR);
  if (Got < 0) {
    tErrno = MapIoErrno(errno);
    return -1;
  }
  return Got;
}

int32_t NwClose(int32_t Fd) {
  if (close(Fd) != 0) {
    return FailWith(MapErrno(errno));
  }
  gOpenSockets--;
  return 0;
}

int32_t NwInetPton(int32_t Family, const char *Text, void *Dst) {
  if (Text == nullptr || Dst == nullptr) {
    return FailWith(NwErrno::EINVAL_);
  }
  if (Family == NW_AF_INET) {
    return inet_pton(AF_INET, Text, Dst);
  }
  if (Family == NW_AF_INET6) {
    return inet_pton(AF_INET6, Text, Dst);
  }
  return FailWith(NwErrno::EAFNOSUPPORT_);
}

int32_t NwGetErrno() {
  return tErrno;
}

void NwSetErrno(int32_t Value) {
  tErrno = Value;
}

const char *NwStrError(int32_t Value) {
  if (Value == 0) {
    return "No error: 0";
  }
  for (const ErrnoMapping &M : kErrnoTable) {
    if (M.Bsd == Value) {
      return M.Text;
    }
  }
  return "Unknown error";
}

uint32_t NwOpenSocketCount() {
  return gOpenSockets.load();
}

int32_t NwGetTimeOfDay(NwTimeVal *Tv) {
  if (Tv == nullptr || gTimeFails) {
    return FailWith(NwErrno::EINVAL_);
  }
  if (gTimeOverrideSet) {
    *Tv = gTimeOverride;
    return 0;
  }
  timeval Now;
  gettimeofday(&Now, nullptr);
  Tv->tv_sec = Now.tv_sec;
  Tv->tv_usec = Now.tv_usec;
  return 0;
}

void HostSetTimeOverride(const NwTimeVal *Tv) {
  gTimeOverrideSet = Tv != nullptr;
  if (Tv != nullptr) {
    gTimeOverride = *Tv;
  }
}

void HostSetTimeFailure(bool Fail) {
  gTimeFails = Fail;
}

void HostSetSocketTimeoutMs(uint32_t Milliseconds) {
  gSocketTimeoutMs = Milliseconds;
}

void HostSetConnectPortOverride(uint16_t Port) {
  gConnectPort = Port;
}

void HostResetSeams() {
  HostSetRandomOverride(nullptr, 0);
  HostSetRandomFailure(false);
  HostSetTimeOverride(nullptr);
  HostSetTimeFailure(false);
  HostSetSocketTimeoutMs(10000);
  HostSetConnectPortOverride(0);
}
