// The socket half of the platform facade in the firmware image: BSD-style
// descriptors over the firmware's TCP4 and TCP6 protocols (UefiTcp.h), with
// the BSD error numbers and their texts, and address parsing.
//
// Every wait of a socket (connect, each part of a send, a read) is bounded
// by kSocketWaitMs, so a closed port, a reset and a peer that goes silent all
// end in an error, never a hang. A connect to a closed port fails with
// ECONNREFUSED (the firmware reports the reset that answers the connection
// request at once); a reset of an established connection gives ECONNRESET,
// a silent peer ETIMEDOUT.
#include "InetText.h"
#include "NwBaseLib.h"
#include "NwPlatform.h"
#include "UefiTcp.h"

namespace {

constexpr uint32_t kSocketWaitMs = 10000;
constexpr uint32_t kMaxSockets = 8;
// Descriptors start above the three standard streams of a BSD process, so
// that 0 never names a socket.
constexpr int32_t kFirstDescriptor = 3;
constexpr int32_t kIpProtoTcp = 6;
constexpr int32_t kSoReuseAddr = 0x0004;
constexpr int32_t kSoReusePort = 0x0200;

int32_t gNwErrno = 0;

struct SocketSlot {
  bool InUse;
  int32_t Family;
  UefiTcpConnection *Connection;
};

SocketSlot gSockets[kMaxSockets];

struct ErrorText {
  int32_t Value;
  const char *Text;
};

// The standard texts of the BSD error numbers the facade uses.
constexpr ErrorText kErrorTexts[] = {
    {0, "Undefined error: 0"},
    {NwErrno::EPERM_, "Operation not permitted"},
    {NwErrno::ENOENT_, "No such file or directory"},
    {NwErrno::EINTR_, "Interrupted system call"},
    {NwErrno::EIO_, "Input/output error"},
    {NwErrno::EBADF_, "Bad file descriptor"},
    {NwErrno::ENOMEM_, "Cannot allocate memory"},
    {NwErrno::EACCES_, "Permission denied"},
    {NwErrno::EFAULT_, "Bad address"},
    {NwErrno::EINVAL_, "Invalid argument"},
    {NwErrno::EMFILE_, "Too many open files"},
    {NwErrno::EPIPE_, "Broken pipe"},
    {NwErrno::EAGAIN_, "Resource temporarily unavailable"},
    {NwErrno::EAFNOSUPPORT_, "Address family not supported by protocol family"},
    {NwErrno::EADDRNOTAVAIL_, "Can't assign requested address"},
    {NwErrno::ENETDOWN_, "Network is down"},
    {NwErrno::ENETUNREACH_, "Network is unreachable"},
    {NwErrno::ECONNABORTED_, "Software caused connection abort"},
    {NwErrno::ECONNRESET_, "Connection reset by peer"},
    {NwErrno::ENOTCONN_, "Socket is not connected"},
    {NwErrno::ETIMEDOUT_, "Operation timed out"},
    {NwErrno::ECONNREFUSED_, "Connection refused"},
    {NwErrno::EHOSTUNREACH_, "No route to host"},
};

bool IsInetFamily(int32_t Family) {
  return Family == NW_AF_INET || Family == NW_AF_INET6;
}

int32_t FailWith(int32_t Errno) {
  gNwErrno = Errno;
  return -1;
}

// The open socket behind Fd, or null (with EBADF set).
SocketSlot *SlotOf(int32_t Fd) {
  const int64_t Index = static_cast<int64_t>(Fd) - kFirstDescriptor;
  if (Index < 0 || Index >= kMaxSockets || !gSockets[Index].InUse) {
    gNwErrno = NwErrno::EBADF_;
    return nullptr;
  }
  return &gSockets[Index];
}

// Decodes a BSD socket address of the socket's family: address bytes in
// network order and the port in host order.
int32_t DecodeAddress(const SocketSlot &Slot, const void *Address, uint32_t AddressLength,
                      uint8_t Bytes[16], uint16_t *Port) {
  const uint8_t *Raw = static_cast<const uint8_t *>(Address);
  if (AddressLength == sizeof(NwSockAddrIn)) {
    NwSockAddrIn In;
    CopyMem(&In, Raw, sizeof(In));
    if (In.sin_family != NW_AF_INET || Slot.Family != NW_AF_INET) {
      return NwErrno::EAFNOSUPPORT_;
    }
    CopyMem(Bytes, In.sin_addr, sizeof(In.sin_addr));
  } else if (AddressLength == sizeof(NwSockAddrIn6)) {
    NwSockAddrIn6 In6;
    CopyMem(&In6, Raw, sizeof(In6));
    if (In6.sin6_family != NW_AF_INET6 || Slot.Family != NW_AF_INET6) {
      return NwErrno::EAFNOSUPPORT_;
    }
    CopyMem(Bytes, In6.sin6_addr, sizeof(In6.sin6_addr));
  } else {
    return NwErrno::EINVAL_;
  }
  // The port is the third and fourth byte in both layouts, in network order.
  *Port = static_cast<uint16_t>(Raw[2] << 8 | Raw[3]);
  return 0;
}

} // namespace

int32_t NwGetErrno() {
  return gNwErrno;
}

void NwSetErrno(int32_t Value) {
  gNwErrno = Value;
}

const char *NwStrError(int32_t Value) {
  for (const ErrorText &Entry : kErrorTexts) {
    if (Entry.Value == Value) {
      return Entry.Text;
    }
  }
  return "Unknown error";
}

int32_t NwSocket(int32_t Domain, int32_t Type, int32_t Protocol) {
  if (!IsInetFamily(Domain)) {
    return FailWith(NwErrno::EAFNOSUPPORT_);
  }
  if (Type != NW_SOCK_STREAM || (Protocol != 0 && Protocol != kIpProtoTcp)) {
    return FailWith(NwErrno::EINVAL_);
  }
  for (uint32_t I = 0; I < kMaxSockets; I++) {
    SocketSlot &Slot = gSockets[I];
    if (Slot.InUse) {
      continue;
    }
    UefiTcpConnection *Connection = nullptr;
    const int32_t Error = UefiTcpCreate(gBS, Domain, &Connection);
    if (Error != 0) {
      return FailWith(Error);
    }
    Slot.InUse = true;
    Slot.Family = Domain;
    Slot.Connection = Connection;
    return kFirstDescriptor + static_cast<int32_t>(I);
  }
  return FailWith(NwErrno::EMFILE_);
}

// The socket-level options a client may set are accepted but change
// nothing: every connection gets the same fixed TCP options (UefiTcp.cpp),
// address reuse means nothing for a connection from an ephemeral port, and
// the firmware sends no keep-alive probes.
int32_t NwSetSockOpt(int32_t Fd, int32_t Level, int32_t Name, const void *Value, uint32_t Length) {
  if (SlotOf(Fd) == nullptr) {
    return -1;
  }
  if (Level != NW_SOL_SOCKET || Value == nullptr || Length != sizeof(int32_t)) {
    return FailWith(NwErrno::EINVAL_);
  }
  if (Name != NW_SO_KEEPALIVE && Name != kSoReuseAddr && Name != kSoReusePort) {
    return FailWith(NwErrno::EINVAL_);
  }
  return 0;
}

int32_t NwConnect(int32_t Fd, const void *Address, uint32_t AddressLength) {
  SocketSlot *Slot = SlotOf(Fd);
  if (Slot == nullptr) {
    return -1;
  }
  if (Address == nullptr) {
    return FailWith(NwErrno::EFAULT_);
  }
  uint8_t Bytes[16] = {};
  uint16_t Port = 0;
  int32_t Error = DecodeAddress(*Slot, Address, AddressLength, Bytes, &Port);
  if (Error == 0) {
    Error = UefiTcpConnect(Slot->Connection, Bytes, Port, kSocketWaitMs);
  }
  return Error == 0 ? 0 : FailWith(Error);
}

// The whole buffer is sent whatever the flags: a blocking send that returns
// early is not something the image ever wants.
int64_t NwSend(int32_t Fd, const void *Buffer, uint64_t Length, int32_t Flags) {
  (void)Flags;
  SocketSlot *Slot = SlotOf(Fd);
  if (Slot == nullptr) {
    return -1;
  }
  if (Buffer == nullptr && Length != 0) {
    return FailWith(NwErrno::EFAULT_);
  }
  if (Length > static_cast<uint64_t>(INT64_MAX)) {
    return FailWith(NwErrno::EINVAL_);
  }
  const int32_t Error =
      UefiTcpSend(Slot->Connection, static_cast<const uint8_t *>(Buffer), Length, kSocketWaitMs);
  return Error == 0 ? static_cast<int64_t>(Length) : FailWith(Error);
}

int64_t NwRead(int32_t Fd, void *Buffer, uint64_t Length) {
  SocketSlot *Slot = SlotOf(Fd);
  if (Slot == nullptr) {
    return -1;
  }
  if (Buffer == nullptr && Length != 0) {
    return FailWith(NwErrno::EFAULT_);
  }
  uint64_t Received = 0;
  const int32_t Error = UefiTcpReceive(Slot->Connection, static_cast<uint8_t *>(Buffer), Length,
                                       kSocketWaitMs, &Received);
  return Error == 0 ? static_cast<int64_t>(Received) : FailWith(Error);
}

int32_t NwClose(int32_t Fd) {
  SocketSlot *Slot = SlotOf(Fd);
  if (Slot == nullptr) {
    return -1;
  }
  UefiTcpDestroy(Slot->Connection);
  Slot->InUse = false;
  Slot->Connection = nullptr;
  return 0;
}

uint32_t NwOpenSocketCount() {
  uint32_t Count = 0;
  for (const SocketSlot &Slot : gSockets) {
    Count += Slot.InUse ? 1 : 0;
  }
  return Count;
}

int32_t NwInetPton(int32_t Family, const char *Text, void *Dst) {
  if (!IsInetFamily(Family)) {
    gNwErrno = NwErrno::EAFNOSUPPORT_;
    return -1;
  }
  if (Text == nullptr || Dst == nullptr) {
    gNwErrno = NwErrno::EFAULT_;
    return -1;
  }
  uint8_t *Address = static_cast<uint8_t *>(Dst);
  const bool Parsed =
      Family == NW_AF_INET ? NwParseInet4(Text, Address) : NwParseInet6(Text, Address);
  return Parsed ? 1 : 0;
}
