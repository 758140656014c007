/* Force-included before every OpenSSL source and header compiled for the
 * image. OpenSSL's UEFI configuration takes its integer types from the
 * firmware's base type names; they are defined here from the compiler's own
 * <stdint.h>, together with the few limits it asks for. */
#ifndef NW_OPENSSL_UEFI_BASE_TYPES_H
#define NW_OPENSSL_UEFI_BASE_TYPES_H

#include <stddef.h>
#include <stdint.h>

typedef int8_t INT8;
typedef uint8_t UINT8;
typedef int16_t INT16;
typedef uint16_t UINT16;
typedef int32_t INT32;
typedef uint32_t UINT32;
typedef int64_t INT64;
typedef uint64_t UINT64;
typedef int64_t INTN;
typedef uint64_t UINTN;
#define MAX_INTN INT64_MAX

#endif
