// The digests and the cipher of the platform facade in the firmware image:
// OpenSSL's own MD4, MD5 and RC4, compiled from source into the image with
// its code generation (Image.cmake), and HMAC-MD5 (RFC 2104) built here on
// that MD5. This is the only file of the image that sees OpenSSL; its state
// lives inside the facade's opaque context blocks, so nothing is allocated
// and no OpenSSL type leaks out. Random bytes are in UefiRandom.cpp.
//
// MD4, MD5 and RC4 are OpenSSL's low-level interface, which version 3 marks
// deprecated; it is exactly the part compiled into the image.
#define OPENSSL_SUPPRESS_DEPRECATED
#include <openssl/md4.h>
#include <openssl/md5.h>
#include <openssl/rc4.h>

#include "NwPlatform.h"
#include "UefiCrypto.h"

// Defined below; OpenSSL's digest code calls it too.
extern "C" void OPENSSL_cleanse(void *Pointer, size_t Length);

namespace {

constexpr size_t kMd5BlockSize = 64;
constexpr uint8_t kInnerPad = 0x36;
constexpr uint8_t kOuterPad = 0x5C;
constexpr uint64_t kRc4MaxKeyLength = 256;

// Both MD5 passes of the HMAC, each already fed its padded key block: the
// inner one takes the message, the outer one the inner digest.
struct HmacMd5State {
  MD5_CTX Inner;
  MD5_CTX Outer;
};

static_assert(sizeof(MD4_CTX) <= sizeof(NwMd4Context::Opaque), "MD4 state fits its context");
static_assert(sizeof(HmacMd5State) <= sizeof(NwHmacMd5Context::Opaque),
              "HMAC-MD5 state fits its context");
static_assert(sizeof(RC4_KEY) <= sizeof(NwArc4Context::Opaque), "RC4 state fits its context");
static_assert(MD4_DIGEST_LENGTH == NW_MD4_DIGEST_SIZE, "MD4 digest size");
static_assert(MD5_DIGEST_LENGTH == NW_MD5_DIGEST_SIZE, "MD5 digest size");
static_assert(MD5_CBLOCK == kMd5BlockSize, "MD5 block size");

MD4_CTX *Md4Of(NwMd4Context *Ctx) {
  return reinterpret_cast<MD4_CTX *>(Ctx->Opaque);
}
HmacMd5State *HmacOf(NwHmacMd5Context *Ctx) {
  return reinterpret_cast<HmacMd5State *>(Ctx->Opaque);
}
RC4_KEY *Rc4Of(NwArc4Context *Ctx) {
  return reinterpret_cast<RC4_KEY *>(Ctx->Opaque);
}

bool DataValid(const void *Data, uint64_t Length) {
  return Data != nullptr || Length == 0;
}

// Starts an MD5 pass with the key block XOR Pad.
bool StartPass(MD5_CTX *Pass, const uint8_t KeyBlock[kMd5BlockSize], uint8_t Pad) {
  uint8_t Block[kMd5BlockSize];
  for (size_t I = 0; I < kMd5BlockSize; I++) {
    Block[I] = KeyBlock[I] ^ Pad;
  }
  const bool Ok = MD5_Init(Pass) == 1 && MD5_Update(Pass, Block, kMd5BlockSize) == 1;
  OPENSSL_cleanse(Block, sizeof(Block));
  return Ok;
}

} // namespace

// Clears memory in a way the compiler may not drop.
extern "C" void OPENSSL_cleanse(void *Pointer, size_t Length) {
  volatile uint8_t *Bytes = static_cast<volatile uint8_t *>(Pointer);
  for (size_t I = 0; I < Length; I++) {
    Bytes[I] = 0;
  }
}

bool UefiMd5Digest(const void *Data, uint64_t Length, uint8_t Digest[MD5_DIGEST_LENGTH]) {
  if (!DataValid(Data, Length) || Digest == nullptr) {
    return false;
  }
  MD5_CTX Ctx;
  const bool Ok =
      MD5_Init(&Ctx) == 1 && MD5_Update(&Ctx, Data, Length) == 1 && MD5_Final(Digest, &Ctx) == 1;
  OPENSSL_cleanse(&Ctx, sizeof(Ctx));
  return Ok;
}

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
  if (Ctx == nullptr || !DataValid(Key, KeyLength)) {
    return false;
  }
  // The key, or its digest when it is longer than a block, zero-padded to
  // one block.
  uint8_t KeyBlock[kMd5BlockSize] = {};
  bool Ok = true;
  if (KeyLength > kMd5BlockSize) {
    Ok = UefiMd5Digest(Key, KeyLength, KeyBlock);
  } else {
    for (uint64_t I = 0; I < KeyLength; I++) {
      KeyBlock[I] = Key[I];
    }
  }
  HmacMd5State *State = HmacOf(Ctx);
  Ok = Ok && StartPass(&State->Inner, KeyBlock, kInnerPad) &&
       StartPass(&State->Outer, KeyBlock, kOuterPad);
  OPENSSL_cleanse(KeyBlock, sizeof(KeyBlock));
  if (!Ok) {
    OPENSSL_cleanse(Ctx->Opaque, sizeof(Ctx->Opaque));
  }
  return Ok;
}

bool NwHmacMd5Update(NwHmacMd5Context *Ctx, const void *Data, uint64_t Length) {
  return Ctx != nullptr && DataValid(Data, Length) &&
         MD5_Update(&HmacOf(Ctx)->Inner, Data, Length) == 1;
}

bool NwHmacMd5Final(NwHmacMd5Context *Ctx, uint8_t Digest[NW_MD5_DIGEST_SIZE]) {
  if (Ctx == nullptr || Digest == nullptr) {
    return false;
  }
  HmacMd5State *State = HmacOf(Ctx);
  uint8_t InnerDigest[MD5_DIGEST_LENGTH];
  const bool Ok = MD5_Final(InnerDigest, &State->Inner) == 1 &&
                  MD5_Update(&State->Outer, InnerDigest, sizeof(InnerDigest)) == 1 &&
                  MD5_Final(Digest, &State->Outer) == 1;
  OPENSSL_cleanse(InnerDigest, sizeof(InnerDigest));
  OPENSSL_cleanse(Ctx->Opaque, sizeof(Ctx->Opaque));
  return Ok;
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
