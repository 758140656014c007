// The socket half of the platform facade in the firmware image.
//
// The image's sockets over the firmware TCP4/TCP6 stack are not attached
// yet: every socket operation fails honestly, with the BSD error a socket
// library gives when the network is unavailable, and no descriptor is ever
// handed out. Address parsing, the error number and its texts are real.
#include "InetText.h"
#include "NwPlatform.h"

namespace {

int32_t gNwErrno = 0;

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

// The answer to every operation on a descriptor: none can exist, since
// NwSocket never succeeds.
template <typename Result>
Result FailBadDescriptor() {
  gNwErrno = NwErrno::EBADF_;
  return -1;
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

// Networking in the image is not attached yet: the firmware TCP4/TCP6 stack
// is not bound, so the network is reported down for the two Internet
// families and any other family as unsupported.
int32_t NwSocket(int32_t Domain, int32_t Type, int32_t Protocol) {
  (void)Type;
  (void)Protocol;
  gNwErrno = IsInetFamily(Domain) ? NwErrno::ENETDOWN_ : NwErrno::EAFNOSUPPORT_;
  return -1;
}

// Networking in the image is not attached yet: no descriptor can exist.
int32_t NwSetSockOpt(int32_t Fd, int32_t Level, int32_t Name, const void *Value, uint32_t Length) {
  (void)Fd;
  (void)Level;
  (void)Name;
  (void)Value;
  (void)Length;
  return FailBadDescriptor<int32_t>();
}

// Networking in the image is not attached yet: no descriptor can exist.
int32_t NwConnect(int32_t Fd, const void *Address, uint32_t AddressLength) {
  (void)Fd;
  (void)Address;
  (void)AddressLength;
  return FailBadDescriptor<int32_t>();
}

// Networking in the image is not attached yet: no descriptor can exist.
int64_t NwSend(int32_t Fd, const void *Buffer, uint64_t Length, int32_t Flags) {
  (void)Fd;
  (void)Buffer;
  (void)Length;
  (void)Flags;
  return FailBadDescriptor<int64_t>();
}

// Networking in the image is not attached yet: no descriptor can exist.
int64_t NwRead(int32_t Fd, void *Buffer, uint64_t Length) {
  (void)Fd;
  (void)Buffer;
  (void)Length;
  return FailBadDescriptor<int64_t>();
}

// Networking in the image is not attached yet: no descriptor can exist.
int32_t NwClose(int32_t Fd) {
  (void)Fd;
  return FailBadDescriptor<int32_t>();
}

// Networking in the image is not attached yet: no socket is ever open.
uint32_t NwOpenSocketCount() {
  return 0;
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
