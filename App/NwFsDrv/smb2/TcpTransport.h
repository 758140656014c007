// The TCP transport under the SMB2 client: address parsing, socket creation
// and connect, and moving message bytes. Results are socket-style integers
// (0 success, -1 or a BSD errno value on failure), not EFI_STATUS; the
// opening of the SMB2 client's connection reports EFI_STATUS.
#pragma once

#include "NwPlatform.h"
#include "Uefi.h"

constexpr UINT16 SMB2_SERVER_PORT = 445;
// Every SMB2 response reader passes this loop limit to the read-all call.
constexpr UINT8 TCP_RX_LOOP_LIMIT = 5;

INT32 TCP_GetDomainTypeByIPAddress(const CHAR8 *IpAddress, INT32 *Domain, UINT16 Port,
                                   NwSockAddrIn *SocketAddr, NwSockAddrIn6 *SocketAddr6);
INT32 TCP_CreateSocket(INT32 *SockFd, INT32 Domain);
INT32 TCP_Connect(INT32 SockFd, UINT8 SetOption, INT32 OptionLevel, INT32 OptionName,
                  INT32 OptionValue, const void *SocketAddr, UINT32 AddrLength);
INT32 TCP_SendMessage(INT32 SockFd, const void *Buffer, INT64 Size, INT64 *SentBytes);
INT32 TCP_PollAndSendMessage(INT32 SockFd, const void *Buffer, INT64 Size, INT64 *SentBytes);
INT32 TCP_ReceiveMessage(INT32 SockFd, void *Buffer, INT64 Size, INT64 *ReceivedBytes);
INT32 TCP_PollAndReceiveMessage(INT32 SockFd, void *Buffer, INT64 Size, INT64 *ReceivedBytes);
INT32 TCP_PollAndTryToRxAllData(INT32 SockFd, void *Buffer, INT64 Size, UINT8 LoopCount,
                                INT64 *TotalRead);
INT32 TCP_CloseSocket(INT32 SockFd);

struct TRANSACT_DETAILS;
// Opens the SMB2 client's connection to the server's port 445: parses the
// address text, creates the socket (kept in gSMB2SockFd and *SockFd),
// formats the parsed address into the record and connects. Only a connect
// result of -1 is a failure (EFI_DEVICE_ERROR); a failure after the socket
// was created leaves it open.
EFI_STATUS SMB2NegotiateConnect(const CHAR8 *IpAddress, INT32 *SockFd, TRANSACT_DETAILS *Details);
