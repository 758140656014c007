/* The part of <string.h> the OpenSSL sources built into the image use. The
 * image's runtime (UefiRuntime.cpp) defines memcpy and memset; nothing may
 * call the other declarations, and the link would fail if something did. */
#ifndef NW_OPENSSL_SHIM_STRING_H
#define NW_OPENSSL_SHIM_STRING_H

#include <stddef.h>

void *memcpy(void *Destination, const void *Source, size_t Length);
void *memset(void *Destination, int Value, size_t Length);
size_t strlen(const char *String);

#endif
