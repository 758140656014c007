// One TCP connection over the firmware's TCP4 or TCP6 protocol, as the
// socket facade (UefiSocket.cpp) uses it.
//
// This interface names no UEFI type: its implementation (UefiTcp.cpp) is
// written against the firmware's own protocol headers, which cannot share a
// translation unit with the image's Uefi.h. Errors are BSD errno values
// (NwErrno), 0 is success.
#pragma once

#include <stdint.h>

struct UefiTcpConnection;

// A connection record for the family (NW_AF_INET or NW_AF_INET6), not yet
// bound to a network interface. BootServices is the firmware's boot services
// table. ENETDOWN when the firmware has no TCP service of that family.
int32_t UefiTcpCreate(void *BootServices, int32_t Family, UefiTcpConnection **Connection);

// Binds the connection to an interface with its default station address
// (waiting a bounded time for the address to be assigned, e.g. by DHCP) and
// connects to Address (4 or 16 bytes, network order) and Port (host order).
// Gives up after WaitMs milliseconds (ETIMEDOUT).
int32_t UefiTcpConnect(UefiTcpConnection *Connection, const uint8_t *Address, uint16_t Port,
                       uint32_t WaitMs);

// Transmits all Length bytes; each part must be accepted within WaitMs.
int32_t UefiTcpSend(UefiTcpConnection *Connection, const uint8_t *Data, uint64_t Length,
                    uint32_t WaitMs);

// Receives what is available, up to Length bytes, waiting at most WaitMs for
// the first byte. *Received is 0 with result 0 once the peer has closed its
// side. A time-out (ETIMEDOUT) leaves the connection usable.
int32_t UefiTcpReceive(UefiTcpConnection *Connection, uint8_t *Buffer, uint64_t Length,
                       uint32_t WaitMs, uint64_t *Received);

// Closes the connection (gracefully when it is healthy) and releases it.
void UefiTcpDestroy(UefiTcpConnection *Connection);
