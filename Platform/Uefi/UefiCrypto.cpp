// The digests and the cipher of the platform facade in the firmware image:
// the shared facade of OpenSslFacade.h over OpenSSL's own MD4, MD5, SHA-256
// and RC4, compiled from source into the image with its code generation
// (Image.cmake), and the image's own OPENSSL_cleanse. This is the only file
// of the image that sees OpenSSL. Random bytes are in UefiRandom.cpp.
//
// MD4, MD5, SHA-256 and RC4 are OpenSSL's low-level interface, which
// version 3 marks deprecated; it is exactly the part compiled into the image.
#define OPENSSL_SUPPRESS_DEPRECATED
#include <openssl/md4.h>
#include <openssl/md5.h>
#include <openssl/rc4.h>
#include <openssl/sha.h>

#include "NwPlatform.h"
#include "UefiCrypto.h"

// Defined below; OpenSSL's digest code and the facade call it.
extern "C" void OPENSSL_cleanse(void *Pointer, size_t Length);

#include "../Common/OpenSslFacade.h"

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
