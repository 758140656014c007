// The small platform facade under the image: BSD-style sockets, the clock and
// the cryptographic primitives. Each platform (hosted Linux, UEFI firmware)
// supplies one implementation; nothing here names a platform type.
//
// Error numbers use the BSD numbering on every platform.
#pragma once

#include <stdint.h>

namespace NwErrno {
constexpr int32_t EPERM_ = 1;
constexpr int32_t ENOENT_ = 2;
constexpr int32_t EINTR_ = 4;
constexpr int32_t EIO_ = 5;
constexpr int32_t EBADF_ = 9;
constexpr int32_t ENOMEM_ = 12;
constexpr int32_t EACCES_ = 13;
constexpr int32_t EFAULT_ = 14;
constexpr int32_t EINVAL_ = 22;
constexpr int32_t EMFILE_ = 24;
constexpr int32_t EPIPE_ = 32;
constexpr int32_t EAGAIN_ = 35;
constexpr int32_t EAFNOSUPPORT_ = 47;
constexpr int32_t EADDRNOTAVAIL_ = 49;
constexpr int32_t ENETDOWN_ = 50;
constexpr int32_t ENETUNREACH_ = 51;
constexpr int32_t ECONNABORTED_ = 53;
constexpr int32_t ECONNRESET_ = 54;
constexpr int32_t ENOTCONN_ = 57;
constexpr int32_t ETIMEDOUT_ = 60;
constexpr int32_t ECONNREFUSED_ = 61;
constexpr int32_t EHOSTUNREACH_ = 65;
} // namespace NwErrno

// Address families and socket types as the socket interface numbers them.
constexpr int32_t NW_AF_INET = 2;
constexpr int32_t NW_AF_INET6 = 24;
constexpr int32_t NW_SOCK_STREAM = 1;
constexpr int32_t NW_SOL_SOCKET = 0xFFFF;
constexpr int32_t NW_SO_KEEPALIVE = 0x0008;
constexpr int32_t NW_MSG_WAITALL = 0x40;

#pragma pack(push, 1)
// BSD socket addresses with their leading length byte.
struct NwSockAddrIn {
  uint8_t sin_len;
  uint8_t sin_family;
  uint16_t sin_port; // network order
  uint8_t sin_addr[4];
  uint8_t sin_zero[8];
};
struct NwSockAddrIn6 {
  uint8_t sin6_len;
  uint8_t sin6_family;
  uint16_t sin6_port; // network order
  uint32_t sin6_flowinfo;
  uint8_t sin6_addr[16];
  uint32_t sin6_scope_id;
};
#pragma pack(pop)
static_assert(sizeof(NwSockAddrIn) == 16, "IPv4 socket address is 16 bytes");
static_assert(sizeof(NwSockAddrIn6) == 28, "IPv6 socket address is 28 bytes");

struct NwTimeVal {
  int64_t tv_sec;
  int64_t tv_usec;
};

// Sockets: each returns -1 on failure with the error in NwGetErrno().
int32_t NwSocket(int32_t Domain, int32_t Type, int32_t Protocol);
int32_t NwSetSockOpt(int32_t Fd, int32_t Level, int32_t Name, const void *Value, uint32_t Length);
int32_t NwConnect(int32_t Fd, const void *Address, uint32_t AddressLength);
int64_t NwSend(int32_t Fd, const void *Buffer, uint64_t Length, int32_t Flags);
int64_t NwRead(int32_t Fd, void *Buffer, uint64_t Length);
int32_t NwClose(int32_t Fd);
// 1 when Text is an address of the family, 0 when it is not, -1 (EAFNOSUPPORT)
// for an unknown family. Dst receives 4 or 16 bytes in network order.
int32_t NwInetPton(int32_t Family, const char *Text, void *Dst);
int32_t NwGetErrno();
void NwSetErrno(int32_t Value);
const char *NwStrError(int32_t Value);
// Open socket descriptors, for leak checks.
uint32_t NwOpenSocketCount();

int32_t NwGetTimeOfDay(NwTimeVal *Tv);

// Cryptographic primitives. Contexts are opaque blocks that the caller
// provides; each Init/Update/Final returns true on success. Final (and a
// failed Init) clears the context, so no key material stays behind in it.
// Updates may be split anywhere: a message in several buffers is fed piece
// by piece.
constexpr uint32_t NW_MD4_DIGEST_SIZE = 16;
constexpr uint32_t NW_MD5_DIGEST_SIZE = 16;
constexpr uint32_t NW_SHA256_DIGEST_SIZE = 32;

struct alignas(8) NwMd4Context {
  uint8_t Opaque[160];
};
struct alignas(8) NwHmacMd5Context {
  uint8_t Opaque[512];
};
struct alignas(8) NwHmacSha256Context {
  uint8_t Opaque[512];
};
struct alignas(8) NwArc4Context {
  uint8_t Opaque[1152];
};

bool NwMd4Init(NwMd4Context *Ctx);
bool NwMd4Update(NwMd4Context *Ctx, const void *Data, uint64_t Length);
bool NwMd4Final(NwMd4Context *Ctx, uint8_t Digest[NW_MD4_DIGEST_SIZE]);

bool NwHmacMd5Init(NwHmacMd5Context *Ctx, const uint8_t *Key, uint64_t KeyLength);
bool NwHmacMd5Update(NwHmacMd5Context *Ctx, const void *Data, uint64_t Length);
bool NwHmacMd5Final(NwHmacMd5Context *Ctx, uint8_t Digest[NW_MD5_DIGEST_SIZE]);

bool NwHmacSha256Init(NwHmacSha256Context *Ctx, const uint8_t *Key, uint64_t KeyLength);
bool NwHmacSha256Update(NwHmacSha256Context *Ctx, const void *Data, uint64_t Length);
bool NwHmacSha256Final(NwHmacSha256Context *Ctx, uint8_t Digest[NW_SHA256_DIGEST_SIZE]);

bool NwArc4Init(NwArc4Context *Ctx, const uint8_t *Key, uint64_t KeyLength);
bool NwArc4Encrypt(NwArc4Context *Ctx, const uint8_t *Input, uint64_t Length, uint8_t *Output);

// Cryptographically strong random bytes; false when no source is available.
bool NwRandomBytes(uint8_t *Output, uint64_t Length);
