/* Included by the OpenSSL sources built into the image, which use nothing
 * from it: the image has no C library. */
#ifndef NW_OPENSSL_SHIM_ERRNO_H
#define NW_OPENSSL_SHIM_ERRNO_H
#endif
