// What the firmware image's crypto offers beyond the platform facade.
#pragma once

#include <stdint.h>

// MD5 of Length bytes (OpenSSL's, as compiled into the image), with which
// the firmware self-test checks the digest under HMAC-MD5 on its own.
bool UefiMd5Digest(const void *Data, uint64_t Length, uint8_t Digest[16]);
