// Test seams of the hosted socket, clock and crypto facades. The image never
// sees these; tests use them to make the NTLMv2 computation reproducible and
// to steer the network behaviour of the hosted program.
#pragma once

#include "NwPlatform.h"

#include <stddef.h>
#include <stdint.h>

// Random bytes: the given bytes are served in order by NwRandomBytes, then
// real randomness again. A null pointer or zero length drops any rest.
void HostSetRandomOverride(const uint8_t *Bytes, size_t Length);
// Makes NwRandomBytes fail (return false) while set.
void HostSetRandomFailure(bool Fail);

// Clock: NwGetTimeOfDay returns *Tv while set; null restores the real clock.
void HostSetTimeOverride(const NwTimeVal *Tv);
// Makes NwGetTimeOfDay fail (-1, errno EINVAL) while set.
void HostSetTimeFailure(bool Fail);

// Sockets: every socket gets SO_RCVTIMEO and SO_SNDTIMEO of this many
// milliseconds (default 10000), so a silent peer ends a read with errno 60.
void HostSetSocketTimeoutMs(uint32_t Milliseconds);
// Redirects every connect to the given TCP port instead of the one in the
// address (0 = no redirection). Lets a test server listen on a free port
// while the client keeps dialling the SMB port.
void HostSetConnectPortOverride(uint16_t Port);
// Restores every seam above to its default.
void HostResetSeams();
