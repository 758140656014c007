// SMB2 NEGOTIATE: the dialect agreement (2.0.2 and 2.1 offered, only those
// accepted) on the connection the transport has just opened.
#pragma once

#include "smb2/SMB2Exchange.h"

#pragma pack(push, 1)
struct SMB2_NEGOTIATE_REQUEST {
  SMB2_HEADER Header;
  UINT16 StructureSize; // 36
  UINT16 DialectCount;  // 2
  UINT16 SecurityMode;  // 1: signing enabled, not required
  UINT16 Reserved;
  UINT32 Capabilities;
  UINT8 ClientGuid[16];
  UINT64 ClientStartTime;
  UINT16 Dialects[2];
};

struct SMB2_NEGOTIATE_RESPONSE {
  SMB2_HEADER Header;
  UINT16 StructureSize;
  UINT16 SecurityMode;
  UINT16 DialectRevision;
  UINT16 Reserved;
  UINT8 ServerGuid[16];
  UINT32 Capabilities;
  UINT32 MaxTransactSize;
  UINT32 MaxReadSize;
  UINT32 MaxWriteSize;
  UINT64 SystemTime;
  UINT64 ServerStartTime;
  UINT16 SecurityBufferOffset;
  UINT16 SecurityBufferLength;
  UINT32 Reserved2;
};
#pragma pack(pop)
static_assert(sizeof(SMB2_NEGOTIATE_REQUEST) == 108, "negotiate request is 108 bytes");
static_assert(offsetof(SMB2_NEGOTIATE_REQUEST, StructureSize) == 68, "StructureSize offset");
static_assert(offsetof(SMB2_NEGOTIATE_REQUEST, DialectCount) == 70, "DialectCount offset");
static_assert(offsetof(SMB2_NEGOTIATE_REQUEST, SecurityMode) == 72, "SecurityMode offset");
static_assert(offsetof(SMB2_NEGOTIATE_REQUEST, Reserved) == 74, "Reserved offset");
static_assert(offsetof(SMB2_NEGOTIATE_REQUEST, Capabilities) == 76, "Capabilities offset");
static_assert(offsetof(SMB2_NEGOTIATE_REQUEST, ClientGuid) == 80, "ClientGuid offset");
static_assert(offsetof(SMB2_NEGOTIATE_REQUEST, ClientStartTime) == 96, "ClientStartTime offset");
static_assert(offsetof(SMB2_NEGOTIATE_REQUEST, Dialects) == 104, "Dialects offset");
static_assert(sizeof(SMB2_NEGOTIATE_RESPONSE) == 132, "negotiate response fixed part");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, SecurityMode) == 70, "SecurityMode offset");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, DialectRevision) == 72, "DialectRevision offset");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, ServerGuid) == 76, "ServerGuid offset");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, Capabilities) == 92, "Capabilities offset");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, MaxTransactSize) == 96, "MaxTransactSize offset");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, MaxReadSize) == 100, "MaxReadSize offset");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, MaxWriteSize) == 104, "MaxWriteSize offset");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, SystemTime) == 108, "SystemTime offset");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, ServerStartTime) == 116, "ServerStartTime");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, SecurityBufferOffset) == 124, "SecBuf offset");
static_assert(offsetof(SMB2_NEGOTIATE_RESPONSE, SecurityBufferLength) == 126, "SecBuf length");

// The least MaxReadSize and MaxWriteSize a server may announce.
constexpr UINT32 SMB2_MIN_TRANSFER_SIZE = 4096;

// {FCB1A629-F177-4738-A677-37A3CB048EBA}, the same on every connect.
constexpr UINT8 SMB2_CLIENT_GUID[16] = {0x29, 0xA6, 0xB1, 0xFC, 0x77, 0xF1, 0x38, 0x47,
                                        0xA6, 0x77, 0x37, 0xA3, 0xCB, 0x04, 0x8E, 0xBA};

// The negotiate exchange works on the caller's 108-byte request area; the
// dialect check's verdict is kept for the step to report.
struct SMB2_NEGOTIATE_CONTEXT {
  SMB2_NEGOTIATE_REQUEST *Request;
  EFI_STATUS Verdict;
};
extern const SMB2_COMMAND gSMB2NegotiateCommand;

// The whole step: the transport's connection, then the exchange.
EFI_STATUS SMB2Negotiate(const CHAR8 *IpAddress, SMB2_NEGOTIATE_REQUEST *Request, INT32 *SockFd,
                         TRANSACT_DETAILS *Details);
EFI_STATUS SMB2NegotiatePacketConstruct(SMB2_NEGOTIATE_REQUEST *Request);
EFI_STATUS SMB2VerifyExtractNegotiateResponse(const SMB2_NEGOTIATE_RESPONSE *Response,
                                              TRANSACT_DETAILS *Details);
EFI_STATUS SMB2VerifyDialect(UINT16 Dialect);
