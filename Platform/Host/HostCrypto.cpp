// The cryptographic primitives of NwPlatform.h on the host, backed by
// OpenSSL 3. This is the only file of the project that sees OpenSSL: the
// facade's contexts are opaque blocks, and the OpenSSL state lives inside
// them, so no OpenSSL type leaks out and nothing is allocated behind the
// caller's back (a construction abandoned half-way leaks nothing).
//
// MD4, MD5, SHA-256 and RC4 come from OpenSSL's low-level interface, which
// version 3 deprecates but still ships in libcrypto without the legacy
// provider. HMAC-MD5 and HMAC-SHA256 are built here on those digests.
#define OPENSSL_SUPPRESS_DEPRECATED
#include <openssl/md4.h>
#include <openssl/md5.h>
#include <openssl/rand.h>
#include <openssl/rc4.h>
#include <openssl/sha.h>

#include "HostSeams.h"
#include "NwPlatform.h"

#include <string.h>

#include <mutex>
#include <vector>

namespace {

// The digests under the HMACs, through OpenSSL's low-level interface.
struct Md5Hash {
  using Ctx = MD5_CTX;
  static constexpr size_t kBlockSize = MD5_CBLOCK;
  static constexpr size_t kDigestSize = MD5_DIGEST_LENGTH;
  static bool Init(Ctx *C) { return MD5_Init(C) == 1; }
  static bool Update(Ctx *C, const void *Data, size_t Length) {
    return MD5_Update(C, Data, Length) == 1;
  }
  static bool Final(uint8_t *Digest, Ctx *C) { return MD5_Final(Digest, C) == 1; }
};
struct Sha256Hash {
  using Ctx = SHA256_CTX;
  static constexpr size_t kBlockSize = SHA256_CBLOCK;
  static constexpr size_t kDigestSize = SHA256_DIGEST_LENGTH;
  static bool Init(Ctx *C) { return SHA256_Init(C) == 1; }
  static bool Update(Ctx *C, const void *Data, size_t Length) {
    return SHA256_Update(C, Data, Length) == 1;
  }
  static bool Final(uint8_t *Digest, Ctx *C) { return SHA256_Final(Digest, C) == 1; }
};

// HMAC (RFC 2104) as two passes of the digest over the padded key, kept in
// the facade's opaque block: the inner pass, already fed its key block, and
// the outer key block for Final.
template <typename Hash>
struct HmacState {
  typename Hash::Ctx Inner;
  uint8_t OuterPad[Hash::kBlockSize];
};

template <typename Hash, typename Context>
HmacState<Hash> *HmacOf(Context *Ctx) {
  static_assert(sizeof(HmacState<Hash>) <= sizeof(Ctx->Opaque), "HMAC state fits the context");
  return reinterpret_cast<HmacState<Hash> *>(Ctx->Opaque);
}

template <typename Hash, typename Context>
bool HmacInit(Context *Ctx, const uint8_t *Key, uint64_t KeyLength) {
  if (Ctx == nullptr || (Key == nullptr && KeyLength != 0)) {
    return false;
  }
  HmacState<Hash> *State = HmacOf<Hash>(Ctx);
  // The key, or its digest when it is longer than a block, zero-padded.
  uint8_t Block[Hash::kBlockSize] = {};
  bool Ok = true;
  if (KeyLength > Hash::kBlockSize) {
    typename Hash::Ctx KeyPass;
    Ok = Hash::Init(&KeyPass) && Hash::Update(&KeyPass, Key, KeyLength) &&
         Hash::Final(Block, &KeyPass);
    OPENSSL_cleanse(&KeyPass, sizeof(KeyPass));
  } else if (KeyLength != 0) {
    memcpy(Block, Key, KeyLength);
  }
  uint8_t InnerPad[Hash::kBlockSize];
  for (size_t I = 0; I < Hash::kBlockSize; I++) {
    InnerPad[I] = Block[I] ^ 0x36;
    State->OuterPad[I] = Block[I] ^ 0x5C;
  }
  Ok = Ok && Hash::Init(&State->Inner) && Hash::Update(&State->Inner, InnerPad, Hash::kBlockSize);
  OPENSSL_cleanse(Block, sizeof(Block));
  OPENSSL_cleanse(InnerPad, sizeof(InnerPad));
  if (!Ok) {
    OPENSSL_cleanse(Ctx->Opaque, sizeof(Ctx->Opaque));
  }
  return Ok;
}

template <typename Hash, typename Context>
bool HmacUpdate(Context *Ctx, const void *Data, uint64_t Length) {
  if (Ctx == nullptr || (Data == nullptr && Length != 0)) {
    return false;
  }
  return Hash::Update(&HmacOf<Hash>(Ctx)->Inner, Data, Length);
}

template <typename Hash, typename Context>
bool HmacFinal(Context *Ctx, uint8_t *Digest) {
  if (Ctx == nullptr || Digest == nullptr) {
    return false;
  }
  HmacState<Hash> *State = HmacOf<Hash>(Ctx);
  uint8_t InnerDigest[Hash::kDigestSize];
  typename Hash::Ctx Outer;
  const bool Ok = Hash::Final(InnerDigest, &State->Inner) && Hash::Init(&Outer) &&
                  Hash::Update(&Outer, State->OuterPad, Hash::kBlockSize) &&
                  Hash::Update(&Outer, InnerDigest, sizeof(InnerDigest)) &&
                  Hash::Final(Digest, &Outer);
  OPENSSL_cleanse(InnerDigest, sizeof(InnerDigest));
  OPENSSL_cleanse(&Outer, sizeof(Outer));
  OPENSSL_cleanse(Ctx->Opaque, sizeof(Ctx->Opaque));
  return Ok;
}

static_assert(sizeof(MD4_CTX) <= sizeof(NwMd4Context::Opaque), "MD4 state fits the context");
static_assert(MD5_DIGEST_LENGTH == NW_MD5_DIGEST_SIZE, "MD5 digest size");
static_assert(SHA256_DIGEST_LENGTH == NW_SHA256_DIGEST_SIZE, "SHA-256 digest size");
static_assert(sizeof(RC4_KEY) <= sizeof(NwArc4Context::Opaque), "RC4 state fits the context");

MD4_CTX *Md4Of(NwMd4Context *Ctx) {
  return reinterpret_cast<MD4_CTX *>(Ctx->Opaque);
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
  return HmacInit<Md5Hash>(Ctx, Key, KeyLength);
}

bool NwHmacMd5Update(NwHmacMd5Context *Ctx, const void *Data, uint64_t Length) {
  return HmacUpdate<Md5Hash>(Ctx, Data, Length);
}

bool NwHmacMd5Final(NwHmacMd5Context *Ctx, uint8_t Digest[NW_MD5_DIGEST_SIZE]) {
  return HmacFinal<Md5Hash>(Ctx, Digest);
}

bool NwHmacSha256Init(NwHmacSha256Context *Ctx, const uint8_t *Key, uint64_t KeyLength) {
  return HmacInit<Sha256Hash>(Ctx, Key, KeyLength);
}

bool NwHmacSha256Update(NwHmacSha256Context *Ctx, const void *Data, uint64_t Length) {
  return HmacUpdate<Sha256Hash>(Ctx, Data, Length);
}

bool NwHmacSha256Final(NwHmacSha256Context *Ctx, uint8_t Digest[NW_SHA256_DIGEST_SIZE]) {
  return HmacFinal<Sha256Hash>(Ctx, Digest);
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
