// The cryptographic primitives of NwPlatform.h on the host, backed by
// OpenSSL 3. This is the only file of the project that sees OpenSSL: the
// facade's contexts are opaque blocks, and the OpenSSL state lives inside
// them, so no OpenSSL type leaks out and nothing is allocated behind the
// caller's back (a construction abandoned half-way leaks nothing).
//
// MD4, MD5 and RC4 come from OpenSSL's low-level interface, which version 3
// deprecates but still ships in libcrypto without the legacy provider.
#define OPENSSL_SUPPRESS_DEPRECATED
#include <openssl/md4.h>
#include <openssl/md5.h>
#include <openssl/rand.h>
#include <openssl/rc4.h>

#include "HostSeams.h"
#include "NwPlatform.h"

#include <string.h>

#include <mutex>
#include <vector>

namespace {

// HMAC-MD5 as two MD5 passes over the padded key (RFC 2104), kept in the
// facade's opaque block.
constexpr size_t kMd5BlockSize = 64;

struct HmacMd5State {
  MD5_CTX Inner;
  uint8_t OuterPad[kMd5BlockSize];
};

static_assert(sizeof(MD4_CTX) <= sizeof(NwMd4Context::Opaque), "MD4 state fits the context");
static_assert(sizeof(HmacMd5State) <= sizeof(NwHmacMd5Context::Opaque),
              "HMAC-MD5 state fits the context");
static_assert(sizeof(RC4_KEY) <= sizeof(NwArc4Context::Opaque), "RC4 state fits the context");

MD4_CTX *Md4Of(NwMd4Context *Ctx) {
  return reinterpret_cast<MD4_CTX *>(Ctx->Opaque);
}
HmacMd5State *HmacOf(NwHmacMd5Context *Ctx) {
  return reinterpret_cast<HmacMd5State *>(Ctx->Opaque);
}
RC4_KEY *Rc4Of(NwArc4Context *Ctx) {
  return reinterpret_cast<RC4_KEY *>(Ctx->Opaque);
}

std::mutex gRandomLock;
std::vector<uint8_t> gRandomOverride;
size_t gRandomServed = 0;
bool gRandomFails = false;

} // namespace

bool NwMd4Init(NwMd4Context *Ctx) {
  return Ctx != nullptr && MD4_Init(Md4Of(Ctx)) == 1;
}

bool NwMd4Update(NwMd4Context *Ctx, const void *Data, uint64_t Length) {
  if (Ctx == nullptr || (Data == nullptr && Length != 0)) {
    return false;
  }
  return MD4_Update(Md4Of(Ctx), Data, Length) == 1;
}

bool NwMd4Final(NwMd4Context *Ctx, uint8_t Digest[NW_MD4_DIGEST_SIZE]) {
  if (Ctx == nullptr || Digest == nullptr) {
    return false;
  }
  bool Ok = MD4_Final(Digest, Md4Of(Ctx)) == 1;
  OPENSSL_cleanse(Ctx->Opaque, sizeof(Ctx->Opaque));
  return Ok;
}

bool NwHmacMd5Init(NwHmacMd5Context *Ctx, const uint8_t *Key, uint64_t KeyLength) {
  if (Ctx == nullptr || (Key == nullptr && KeyLength != 0)) {
    return false;
  }
  HmacMd5State *State = HmacOf(Ctx);
  uint8_t Block[kMd5BlockSize] = {};
  if (KeyLength > kMd5BlockSize) {
    MD5(Key, KeyLength, Block);
  } else if (KeyLength != 0) {
    memcpy(Block, Key, KeyLength);
  }
  uint8_t InnerPad[kMd5BlockSize];
  for (size_t I = 0; I < kMd5BlockSize; I++) {
    InnerPad[I] = Block[I] ^ 0x36;
    State->OuterPad[I] = Block[I] ^ 0x5C;
  }
  bool Ok = MD5_Init(&State->Inner) == 1 && MD5_Update(&State->Inner, InnerPad, kMd5BlockSize) == 1;
  OPENSSL_cleanse(Block, sizeof(Block));
  OPENSSL_cleanse(InnerPad, sizeof(InnerPad));
  return Ok;
}

bool NwHmacMd5Update(NwHmacMd5Context *Ctx, const void *Data, uint64_t Length) {
  if (Ctx == nullptr || (Data == nullptr && Length != 0)) {
    return false;
  }
  return MD5_Update(&HmacOf(Ctx)->Inner, Data, Length) == 1;
}

bool NwHmacMd5Final(NwHmacMd5Context *Ctx, uint8_t Digest[NW_MD5_DIGEST_SIZE]) {
  if (Ctx == nullptr || Digest == nullptr) {
    return false;
  }
  HmacMd5State *State = HmacOf(Ctx);
  uint8_t InnerDigest[MD5_DIGEST_LENGTH];
  MD5_CTX Outer;
  bool Ok = MD5_Final(InnerDigest, &State->Inner) == 1 && MD5_Init(&Outer) == 1 &&
            MD5_Update(&Outer, State->OuterPad, kMd5BlockSize) == 1 &&
            MD5_Update(&Outer, InnerDigest, sizeof(InnerDigest)) == 1 &&
            MD5_Final(Digest, &Outer) == 1;
  OPENSSL_cleanse(InnerDigest, sizeof(InnerDigest));
  OPENSSL_cleanse(&Outer, sizeof(Outer));
  OPENSSL_cleanse(Ctx->Opaque, sizeof(Ctx->Opaque));
  return Ok;
}

bool NwArc4Init(NwArc4Context *Ctx, const uint8_t *Key, uint64_t KeyLength) {
  if (Ctx == nullptr || Key == nullptr || KeyLength == 0 || KeyLength > 256) {
    return false;
  }
  RC4_set_key(Rc4Of(Ctx), static_cast<int>(KeyLength), Key);
  return true;
}

bool NwArc4Encrypt(NwArc4Context *Ctx, const uint8_t *Input, uint64_t Length, uint8_t *Output) {
  if (Ctx == nullptr || Input == nullptr || Output == nullptr) {
    return false;
  }
  RC4(Rc4Of(Ctx), Length, Input, Output);
  return true;
}

bool NwRandomBytes(uint8_t *Output, uint64_t Length) {
  if (Output == nullptr) {
    return false;
  }
  std::lock_guard<std::mutex> Guard(gRandomLock);
  if (gRandomFails) {
    return false;
  }
  uint64_t Done = 0;
  while (Done < Length && gRandomServed < gRandomOverride.size()) {
    Output[Done++] = gRandomOverride[gRandomServed++];
  }
  if (Done == Length) {
    return true;
  }
  return RAND_bytes(Output + Done, static_cast<int>(Length - Done)) == 1;
}

void HostSetRandomOverride(const uint8_t *Bytes, size_t Length) {
  std::lock_guard<std::mutex> Guard(gRandomLock);
  gRandomOverride.assign(Bytes, Bytes == nullptr ? Bytes : Bytes + Length);
  gRandomServed = 0;
}

void HostSetRandomFailure(bool Fail) {
  std::lock_guard<std::mutex> Guard(gRandomLock);
  gRandomFails = Fail;
}
