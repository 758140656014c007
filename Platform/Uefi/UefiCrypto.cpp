// The cryptographic half of the platform facade in the firmware image.
//
// Crypto in the image is not attached yet: the digest and cipher code will
// be compiled into the image from C sources, and until then every primitive
// reports failure (false) without touching its outputs, so that callers take
// their error paths instead of computing with made-up values.
#include "NwPlatform.h"

// Crypto in the image is not attached yet: always fails.
bool NwMd4Init(NwMd4Context *Ctx) {
  (void)Ctx;
  return false;
}

// Crypto in the image is not attached yet: always fails.
bool NwMd4Update(NwMd4Context *Ctx, const void *Data, uint64_t Length) {
  (void)Ctx;
  (void)Data;
  (void)Length;
  return false;
}

// Crypto in the image is not attached yet: always fails.
bool NwMd4Final(NwMd4Context *Ctx, uint8_t Digest[NW_MD4_DIGEST_SIZE]) {
  (void)Ctx;
  (void)Digest;
  return false;
}

// Crypto in the image is not attached yet: always fails.
bool NwHmacMd5Init(NwHmacMd5Context *Ctx, const uint8_t *Key, uint64_t KeyLength) {
  (void)Ctx;
  (void)Key;
  (void)KeyLength;
  return false;
}

// Crypto in the image is not attached yet: always fails.
bool NwHmacMd5Update(NwHmacMd5Context *Ctx, const void *Data, uint64_t Length) {
  (void)Ctx;
  (void)Data;
  (void)Length;
  return false;
}

// Crypto in the image is not attached yet: always fails.
bool NwHmacMd5Final(NwHmacMd5Context *Ctx, uint8_t Digest[NW_MD5_DIGEST_SIZE]) {
  (void)Ctx;
  (void)Digest;
  return false;
}

// Crypto in the image is not attached yet: always fails.
bool NwArc4Init(NwArc4Context *Ctx, const uint8_t *Key, uint64_t KeyLength) {
  (void)Ctx;
  (void)Key;
  (void)KeyLength;
  return false;
}

// Crypto in the image is not attached yet: always fails.
bool NwArc4Encrypt(NwArc4Context *Ctx, const uint8_t *Input, uint64_t Length, uint8_t *Output) {
  (void)Ctx;
  (void)Input;
  (void)Length;
  (void)Output;
  return false;
}

// Crypto in the image is not attached yet: no entropy source is bound, so
// this always fails.
bool NwRandomBytes(uint8_t *Output, uint64_t Length) {
  (void)Output;
  (void)Length;
  return false;
}
