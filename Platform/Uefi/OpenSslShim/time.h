/* Declarations OpenSSL's headers mention; the image calls no time function. */
#ifndef NW_OPENSSL_SHIM_TIME_H
#define NW_OPENSSL_SHIM_TIME_H

typedef long long time_t;
struct tm;

#endif
