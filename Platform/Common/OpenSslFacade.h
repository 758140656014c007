// MD4, HMAC-MD5, HMAC-SHA256 and RC4 of the platform facade (NwPlatform.h)
// on OpenSSL's low-level digests and cipher, the same on every platform.
// Each platform's crypto file includes it once, after the OpenSSL headers it
// builds against (it includes none itself, so that file stays the only one
// that sees OpenSSL), and after a declaration of OPENSSL_cleanse.
//
// The OpenSSL state lives inside the facade's opaque context blocks: no
// OpenSSL type leaks out and nothing is allocated behind the caller's back,
// so a construction abandoned half-way leaks nothing. Every context is
// cleared when it is finished or fails.
#pragma once

namespace {

constexpr uint8_t kInnerPad = 0x36;
constexpr uint8_t kOuterPad = 0x5C;
constexpr uint64_t kRc4MaxKeyLength = 256;

// The digests under the HMACs.
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

// Both passes of the HMAC (RFC 2104), each already fed its padded key
// block: the inner one takes the message, the outer one the inner digest.
template <typename Hash>
struct HmacState {
  typename Hash::Ctx Inner;
  typename Hash::Ctx Outer;
};

static_assert(sizeof(MD4_CTX) <= sizeof(NwMd4Context::Opaque), "MD4 state fits its context");
static_assert(sizeof(RC4_KEY) <= sizeof(NwArc4Context::Opaque), "RC4 state fits its context");
static_assert(MD4_DIGEST_LENGTH == NW_MD4_DIGEST_SIZE, "MD4 digest size");
static_assert(MD5_DIGEST_LENGTH == NW_MD5_DIGEST_SIZE, "MD5 digest size");
static_assert(SHA256_DIGEST_LENGTH == NW_SHA256_DIGEST_SIZE, "SHA-256 digest size");

MD4_CTX *Md4Of(NwMd4Context *Ctx) {
  return reinterpret_cast<MD4_CTX *>(Ctx->Opaque);
}
RC4_KEY *Rc4Of(NwArc4Context *Ctx) {
  return reinterpret_cast<RC4_KEY *>(Ctx->Opaque);
}

template <typename Hash, typename Context>
HmacState<Hash> *HmacOf(Context *Ctx) {
  static_assert(sizeof(HmacState<Hash>) <= sizeof(Ctx->Opaque), "HMAC state fits its context");
  return reinterpret_cast<HmacState<Hash> *>(Ctx->Opaque);
}

bool DataValid(const void *Data, uint64_t Length) {
  return Data != nullptr || Length == 0;
}

// Starts a pass with the key block XOR Pad.
template <typename Hash>
bool StartPass(typename Hash::Ctx *Pass, const uint8_t *KeyBlock, uint8_t Pad) {
  uint8_t Block[Hash::kBlockSize];
  for (size_t I = 0; I < Hash::kBlockSize; I++) {
    Block[I] = KeyBlock[I] ^ Pad;
  }
  const bool Ok = Hash::Init(Pass) && Hash::Update(Pass, Block, Hash::kBlockSize);
  OPENSSL_cleanse(Block, sizeof(Block));
  return Ok;
}

template <typename Hash, typename Context>
bool HmacInit(Context *Ctx, const uint8_t *Key, uint64_t KeyLength) {
  if (Ctx == nullptr || !DataValid(Key, KeyLength)) {
    return false;
  }
  // The key, or its digest when it is longer than a block, zero-padded to
  // one block.
  uint8_t KeyBlock[Hash::kBlockSize] = {};
  bool Ok = true;
  if (KeyLength > Hash::kBlockSize) {
    typename Hash::Ctx KeyPass;
    Ok = Hash::Init(&KeyPass) && Hash::Update(&KeyPass, Key, KeyLength) &&
         Hash::Final(KeyBlock, &KeyPass);
    OPENSSL_cleanse(&KeyPass, sizeof(KeyPass));
  } else {
    for (uint64_t I = 0; I < KeyLength; I++) {
      KeyBlock[I] = Key[I];
    }
  }
  HmacState<Hash> *State = HmacOf<Hash>(Ctx);
  Ok = Ok && StartPass<Hash>(&State->Inner, KeyBlock, kInnerPad) &&
       StartPass<Hash>(&State->Outer, KeyBlock, kOuterPad);
  OPENSSL_cleanse(KeyBlock, sizeof(KeyBlock));
  if (!Ok) {
    OPENSSL_cleanse(Ctx->Opaque, sizeof(Ctx->Opaque));
  }
  return Ok;
}

template <typename Hash, typename Context>
bool HmacUpdate(Context *Ctx, const void *Data, uint64_t Length) {
  return Ctx != nullptr && DataValid(Data, Length) &&
         Hash::Update(&HmacOf<Hash>(Ctx)->Inner, Data, Length);
}

template <typename Hash, typename Context>
bool HmacFinal(Context *Ctx, uint8_t *Digest) {
  if (Ctx == nullptr || Digest == nullptr) {
    return false;
  }
  HmacState<Hash> *State = HmacOf<Hash>(Ctx);
  uint8_t InnerDigest[Hash::kDigestSize];
  const bool Ok = Hash::Final(InnerDigest, &State->Inner) &&
                  Hash::Update(&State->Outer, InnerDigest, sizeof(InnerDigest)) &&
                  Hash::Final(Digest, &State->Outer);
  OPENSSL_cleanse(InnerDigest, sizeof(InnerDigest));
  OPENSSL_cleanse(Ctx->Opaque, sizeof(Ctx->Opaque));
  return Ok;
}

} // namespace

bool NwMd4Init(NwMd4Context *Ctx) {
  return Ctx != nullptr && MD4_Init(Md4Of(Ctx)) == 1;
}

bool NwMd4Update(NwMd4Context *Ctx, const void *Data, uint64_t Length) {
  return Ctx != nullptr && DataValid(Data, Length) && MD4_Update(Md4Of(Ctx), Data, Length) == 1;
}

bool NwMd4Final(NwMd4Context *Ctx, uint8_t Digest[NW_MD4_DIGEST_SIZE]) {
  if (Ctx == nullptr || Digest == nullptr) {
    return false;
  }
  const bool Ok = MD4_Final(Digest, Md4Of(Ctx)) == 1;
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
  if (Ctx == nullptr || Key == nullptr || KeyLength == 0 || KeyLength > kRc4MaxKeyLength) {
    return false;
  }
  RC4_set_key(Rc4Of(Ctx), static_cast<int>(KeyLength), Key);
  return true;
}

bool NwArc4Encrypt(NwArc4Context *Ctx, const uint8_t *Input, uint64_t Length, uint8_t *Output) {
  if (Ctx == nullptr || ((Input == nullptr || Output == nullptr) && Length != 0)) {
    return false;
  }
  RC4(Rc4Of(Ctx), Length, Input, Output);
  return true;
}
