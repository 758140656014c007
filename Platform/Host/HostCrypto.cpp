// The cryptographic primitives of NwPlatform.h on the host, backed by
// OpenSSL 3. This is the only file of the host build that sees OpenSSL: the
// digests, HMACs and RC4 are the shared facade of OpenSslFacade.h over
// libcrypto's low-level interface (which version 3 deprecates but still
// ships without the legacy provider); random bytes come from RAND_bytes, or
// from what a test set in their place.
#define OPENSSL_SUPPRESS_DEPRECATED
#include <openssl/crypto.h>
#include <openssl/md4.h>
#include <openssl/md5.h>
#include <openssl/rand.h>
#include <openssl/rc4.h>
#include <openssl/sha.h>

#include "HostSeams.h"
#include "NwPlatform.h"

#include <stddef.h>
#include <stdint.h>

#include <mutex>
#include <vector>

#include "../Common/OpenSslFacade.h"

namespace {

std::mutex gRandomLock;
std::vector<uint8_t> gRandomOverride;
size_t gRandomServed = 0;
bool gRandomFails = false;

} // namespace

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
