// SMB2 framing shared by every command of the client: the 68-byte framed
// header (4-byte stream length + 64-byte SMB2 header), the connection record
// TransactDetails, the per-request header fields, the response-header check
// and read, the send loop, and the mapping of the request layer's NT-style
// codes to EFI_STATUS. The exchange path (SMB2Exchange.h) puts them together.
//
// Wire structures are packed and little-endian except the big-endian stream
// length. Offsets in request structures count from the start of the framed
// buffer, which is also the start of every request buffer.
#pragma once

#include "Uefi.h"

#include <stddef.h>

// ---------------------------------------------------------------------------
// NT-style codes of the request/response layer
// ---------------------------------------------------------------------------
constexpr UINT32 SMB2_NT_SUCCESS = 0;
constexpr UINT32 STATUS_UNSUCCESSFUL = 0xC0000001;
constexpr UINT32 STATUS_INVALID_INFO_CLASS = 0xC0000004;
constexpr UINT32 STATUS_END_OF_FILE = 0xC0000011;
constexpr UINT32 STATUS_MORE_PROCESSING_REQUIRED = 0xC0000016;
constexpr UINT32 STATUS_PENDING = 0x00000103;
constexpr UINT32 STATUS_NO_MEMORY = 0xC0000017;
constexpr UINT32 STATUS_LOGON_FAILURE = 0xC000006D;
constexpr UINT32 STATUS_INVALID_SIGNATURE = 0xC000A000;
constexpr UINT32 SMB2_NT_INVALID_PARAMETER = 0x80070057;
constexpr UINT32 SMB2_NT_OUT_OF_MEMORY = 0x8007000E;

// ---------------------------------------------------------------------------
// Commands, dialects, request structure sizes
// ---------------------------------------------------------------------------
// Command codes.
enum : UINT16 {
  SMB2_NEGOTIATE = 0,
  SMB2_SESSION_SETUP = 1,
  SMB2_LOGOFF = 2,
  SMB2_TREE_CONNECT = 3,
  SMB2_TREE_DISCONNECT = 4,
  SMB2_CREATE = 5,
  SMB2_CLOSE = 6,
  SMB2_READ = 8,
  SMB2_WRITE = 9,
  SMB2_QUERY_DIRECTORY = 14,
  SMB2_QUERY_INFO = 16,
};

constexpr UINT16 SMB2_DIALECT_202 = 0x0202;
constexpr UINT16 SMB2_DIALECT_210 = 0x0210;
constexpr UINT16 SMB2_DIALECT_WILDCARD = 0x02FF;
constexpr UINT16 SMB2_DIALECT_300 = 0x0300;
constexpr UINT16 SMB2_DIALECT_302 = 0x0302;
constexpr UINT16 SMB2_DIALECT_311 = 0x0311;

constexpr UINT16 SMB2_HEADER_STRUCTURE_SIZE = 64;
constexpr UINT16 SMB2_CREDIT_REQUEST = 2;
// The StructureSize each request body carries, by command code (commands
// the client never sends have none).
constexpr UINT16 SMB2_REQUEST_STRUCTURE_SIZE[SMB2_QUERY_INFO + 1] = {
    36, 25, 4, 9, 4, 57, 24, 0, 49, 49, 0, 0, 0, 0, 33, 0, 41,
};
static_assert(SMB2_REQUEST_STRUCTURE_SIZE[SMB2_CREATE] == 57, "CREATE body size");
static_assert(SMB2_REQUEST_STRUCTURE_SIZE[SMB2_QUERY_DIRECTORY] == 33, "QUERY_DIRECTORY body");

// ---------------------------------------------------------------------------
// Framed header
// ---------------------------------------------------------------------------
#pragma pack(push, 1)
struct SMB2_HEADER {
  UINT32 StreamProtocolLength; // big-endian: bytes after this field
  UINT8 ProtocolId[4];         // 0xFE 'S' 'M' 'B'
  UINT16 StructureSize;        // 64
  UINT16 CreditCharge;
  UINT32 Status;
  UINT16 Command;
  UINT16 CreditRequest;
  UINT32 Flags;
  UINT32 NextCommand;
  UINT64 MessageId;
  UINT32 Reserved; // process id
  UINT32 TreeId;
  UINT64 SessionId;
  UINT8 Signature[16];
};
#pragma pack(pop)
static_assert(sizeof(SMB2_HEADER) == 68, "framed SMB2 header is 68 bytes");
static_assert(offsetof(SMB2_HEADER, ProtocolId) == 4, "ProtocolId offset");
static_assert(offsetof(SMB2_HEADER, StructureSize) == 8, "StructureSize offset");
static_assert(offsetof(SMB2_HEADER, CreditCharge) == 10, "CreditCharge offset");
static_assert(offsetof(SMB2_HEADER, Status) == 12, "Status offset");
static_assert(offsetof(SMB2_HEADER, Command) == 16, "Command offset");
static_assert(offsetof(SMB2_HEADER, CreditRequest) == 18, "CreditRequest offset");
static_assert(offsetof(SMB2_HEADER, Flags) == 20, "Flags offset");
static_assert(offsetof(SMB2_HEADER, NextCommand) == 24, "NextCommand offset");
static_assert(offsetof(SMB2_HEADER, MessageId) == 28, "MessageId offset");
static_assert(offsetof(SMB2_HEADER, Reserved) == 36, "Reserved offset");
static_assert(offsetof(SMB2_HEADER, TreeId) == 40, "TreeId offset");
static_assert(offsetof(SMB2_HEADER, SessionId) == 44, "SessionId offset");
static_assert(offsetof(SMB2_HEADER, Signature) == 52, "Signature offset");

constexpr UINT32 SMB2_FRAMED_HEADER_SIZE = sizeof(SMB2_HEADER);
// Framing limits: the stream length of direct TCP is 24 bits; responses the
// client buffers whole (negotiate, session setup, tree connect) are small,
// and a larger announcement is refused rather than allocated.
constexpr UINT32 SMB2_STREAM_PREFIX_SIZE = 4;
constexpr UINT32 SMB2_MAX_STREAM_LENGTH = 0x00FFFFFF;
constexpr UINT32 SMB2_MAX_BUFFERED_BODY = 0x10000;
// A server that takes its time with a request first sends interim answers
// (STATUS_PENDING), and may send unsolicited notifications at any time; the
// header read quietly skips at most this many of them, and waits for the
// final answer no longer than the answer time limit after the first one.
constexpr UINT32 SMB2_MAX_INTERIM_RESPONSES = 16;
constexpr UINT64 SMB2_ANSWER_TIME_LIMIT_US = 10000000;
constexpr UINT64 SMB2_NOTIFICATION_MESSAGE_ID = 0xFFFFFFFFFFFFFFFFULL;

// ---------------------------------------------------------------------------
// The connection record
// ---------------------------------------------------------------------------
constexpr UINTN SMB2_SERVER_ADDRESS_FIELD = 90;
constexpr UINTN SMB2_SERVER_ADDRESS_COPY = 45;
constexpr UINTN SMB2_FORMATTED_ADDRESS_FIELD = 80;
constexpr UINTN SMB2_DOMAIN_FIELD = 256;
constexpr UINTN SMB2_USER_FIELD = 256;
constexpr UINTN SMB2_PASSWORD_FIELD = 512;
constexpr UINTN SMB2_SHARE_FIELD = 256;

#pragma pack(push, 1)
// The connect parameters as copied in by the connect.
struct SHARE_DETAILS {
  CHAR8 ServerAddress[SMB2_SERVER_ADDRESS_FIELD];
  CHAR8 FormattedAddress[SMB2_FORMATTED_ADDRESS_FIELD];
  UINT8 Reserved[2];
  CHAR8 DomainName[SMB2_DOMAIN_FIELD];
  CHAR8 UserName[SMB2_USER_FIELD];
  CHAR8 Password[SMB2_PASSWORD_FIELD];
  CHAR8 ShareName[SMB2_SHARE_FIELD];
};

// The single SMB2 connection's state. Packed: its one-byte fields sit
// between wider ones.
struct TRANSACT_DETAILS {
  SHARE_DETAILS ShareDetails;
  UINT32 TransportStatus;
  UINT32 ResponseStatus;
  UINT16 DialectRevision;
  UINT16 CreditRequest;
  UINT32 MaxTransactSize;
  UINT32 MaxReadSize;
  UINT32 MaxWriteSize;
  UINT64 MessageId;
  UINT64 SessionId;
  UINT32 TreeId;
  UINT32 Capabilities;
  UINT32 ServerCapabilities;
  UINT32 Channel;
  UINT16 SecurityBufferOffset;
  UINT16 SecurityBufferLength;
  UINT8 ServerChallenge[8];
  UINT8 Flags;
  UINT8 SecurityMode;
  UINT8 *ChallResponse;         // owned copy of the challenge's target info
  const UINT8 *ChallAttributes; // in the received challenge, just past the target name
};
#pragma pack(pop)
static_assert(sizeof(SHARE_DETAILS) == 1452, "share details size");
static_assert(offsetof(SHARE_DETAILS, FormattedAddress) == 90, "FormattedAddress offset");
static_assert(offsetof(SHARE_DETAILS, DomainName) == 172, "DomainName offset");
static_assert(offsetof(SHARE_DETAILS, UserName) == 428, "UserName offset");
static_assert(offsetof(SHARE_DETAILS, Password) == 684, "Password offset");
static_assert(offsetof(SHARE_DETAILS, ShareName) == 1196, "ShareName offset");
static_assert(offsetof(TRANSACT_DETAILS, TransportStatus) == 1452, "TransportStatus offset");
static_assert(offsetof(TRANSACT_DETAILS, ResponseStatus) == 1456, "ResponseStatus offset");
static_assert(offsetof(TRANSACT_DETAILS, DialectRevision) == 1460, "DialectRevision offset");
static_assert(offsetof(TRANSACT_DETAILS, CreditRequest) == 1462, "CreditRequest offset");
static_assert(offsetof(TRANSACT_DETAILS, MaxTransactSize) == 1464, "MaxTransactSize offset");
static_assert(offsetof(TRANSACT_DETAILS, MaxReadSize) == 1468, "MaxReadSize offset");
static_assert(offsetof(TRANSACT_DETAILS, MaxWriteSize) == 1472, "MaxWriteSize offset");
static_assert(offsetof(TRANSACT_DETAILS, MessageId) == 1476, "MessageId offset");
static_assert(offsetof(TRANSACT_DETAILS, SessionId) == 1484, "SessionId offset");
static_assert(offsetof(TRANSACT_DETAILS, TreeId) == 1492, "TreeId offset");
static_assert(offsetof(TRANSACT_DETAILS, Capabilities) == 1496, "Capabilities offset");
static_assert(offsetof(TRANSACT_DETAILS, ServerCapabilities) == 1500, "ServerCapabilities offset");
static_assert(offsetof(TRANSACT_DETAILS, Channel) == 1504, "Channel offset");
static_assert(offsetof(TRANSACT_DETAILS, SecurityBufferOffset) == 1508, "SecurityBufferOffset");
static_assert(offsetof(TRANSACT_DETAILS, SecurityBufferLength) == 1510, "SecurityBufferLength");
static_assert(offsetof(TRANSACT_DETAILS, ServerChallenge) == 1512, "ServerChallenge offset");
static_assert(offsetof(TRANSACT_DETAILS, Flags) == 1520, "Flags offset");
static_assert(offsetof(TRANSACT_DETAILS, SecurityMode) == 1521, "SecurityMode offset");
static_assert(offsetof(TRANSACT_DETAILS, ChallResponse) == 1522, "ChallResponse offset");
static_assert(offsetof(TRANSACT_DETAILS, ChallAttributes) == 1530, "ChallAttributes offset");
static_assert(sizeof(TRANSACT_DETAILS) == 1538, "TransactDetails size");

// Connection states kept in SMB2ConnectionState.
constexpr UINT8 SMB2_STATE_CLOSED = 0;
constexpr UINT8 SMB2_STATE_SESSION = 1;
constexpr UINT8 SMB2_STATE_TREE = 2;
constexpr UINT8 SMB2_STATE_FILE_OPEN = 3;
constexpr UINT8 SMB2_STATE_FILE_CLOSED = 4;
constexpr UINT8 SMB2_STATE_TREE_DISCONNECTED = 5;
constexpr UINT8 SMB2_STATE_LOGGED_OFF = 7;

extern INT32 gSMB2SockFd;                // non-zero while a connection is open
extern TRANSACT_DETAILS TransactDetails; // the one connection record
extern UINT8 SMB2ConnectionState;

// ---------------------------------------------------------------------------
// Little-endian field access on received bytes (no alignment assumed)
// ---------------------------------------------------------------------------
inline UINT16 SMB2ReadLe16(const UINT8 *P) {
  return static_cast<UINT16>(P[0] | (static_cast<UINT16>(P[1]) << 8));
}
inline UINT32 SMB2ReadLe32(const UINT8 *P) {
  return static_cast<UINT32>(P[0]) | (static_cast<UINT32>(P[1]) << 8) |
         (static_cast<UINT32>(P[2]) << 16) | (static_cast<UINT32>(P[3]) << 24);
}
inline UINT64 SMB2ReadLe64(const UINT8 *P) {
  return static_cast<UINT64>(SMB2ReadLe32(P)) | (static_cast<UINT64>(SMB2ReadLe32(P + 4)) << 32);
}

// The stream length of a framed header, in host order, and its setter from a
// whole message's length (the prefix itself excluded).
UINT32 SMB2StreamLength(const SMB2_HEADER *Header);
void SMB2SetStreamLength(SMB2_HEADER *Header, UINT32 TotalLength);

// ---------------------------------------------------------------------------
// Building requests
// ---------------------------------------------------------------------------
// Clears the 68 header bytes and fills ProtocolId, StructureSize 64,
// CreditCharge 0 and CreditRequest 2.
EFI_STATUS SMB2HeaderConstruct(void *Buffer);
// The CreditCharge a request carries: 0 on dialect 0x0202; otherwise per
// command, one per started 64 KiB for READ and WRITE of Length bytes.
UINT16 SMB2CreditCharge(UINT16 Command, UINT32 Length, UINT16 Dialect);
// The per-request header fields: stream length from TotalLength, command,
// MessageId, and TreeId/SessionId from the record where the command carries
// them (none for negotiate and session setup, SessionId only for tree
// connect). CreditCharge follows SMB2CreditCharge with DataLength.
void SMB2HeaderFill(SMB2_HEADER *Header, UINT16 Command, UINT32 TotalLength,
                    const TRANSACT_DETAILS *Details, UINT32 DataLength = 0);

// The send loop: sends until all Length bytes are out. Returns 0,
// STATUS_UNSUCCESSFUL for a zero length, or the failing transport status
// (also stored in *TransportStatus, which receives the last send's status in
// every case).
UINT32 SMB2SendAll(INT32 SockFd, const UINT8 *Bytes, UINT64 Length, UINT32 *TransportStatus);

// ---------------------------------------------------------------------------
// Reading responses
// ---------------------------------------------------------------------------
EFI_STATUS SMB2VerifyHeader(const SMB2_HEADER *Header, TRANSACT_DETAILS *Details);
// Reads exactly the 68 header bytes of the answer to the request now
// outstanding (Details->MessageId, Command) and checks them. On the way it
// skips, a bounded number of times and within the answer time limit, interim
// answers (STATUS_PENDING on the same message id) and unsolicited
// notifications (message id 0xFFFFFFFFFFFFFFFF). Results:
//   EFI_SUCCESS             the header, copied out;
//   EFI_PROTOCOL_ERROR      it did not arrive (failed or short receive);
//   EFI_COMPROMISED_DATA    it arrived but puts the stream out of step (no
//                           protocol id, wrong structure size, stream length,
//                           message id or command): nothing more of it is read;
//   another error           the header check refused it (an error status), the
//                           header copied out; the rest of its message is the
//                           caller's to consume.
EFI_STATUS SMB2ReadVerifyHeader(SMB2_HEADER *Header, TRANSACT_DETAILS *Details, INT32 SockFd,
                                UINT16 Command);
// Receives exactly Length bytes (the read-all operation with the standard
// loop limit), recording the transport status in the record. Returns the
// transport result; *Received gets the byte count.
INT32 SMB2ReceiveAll(INT32 SockFd, void *Buffer, UINT64 Length, TRANSACT_DETAILS *Details,
                     INT64 *Received = nullptr);
// The body bytes that follow a framed header (stream length − 64), or 0 for
// a stream shorter than a header.
UINT32 SMB2BodyLength(const SMB2_HEADER *Header);

// "Function: %s, Line no.: = %d, Memory allocation failed!\n", naming the
// calling function and line.
void SMB2PrintAllocFailure(const CHAR8 *Function = __builtin_FUNCTION(),
                           UINT32 Line = __builtin_LINE());

// ---------------------------------------------------------------------------
// Judging the request layer's NT-style codes
// ---------------------------------------------------------------------------
// Maps a request or response function's code to EFI_STATUS and prints one of
// the three messages naming the callee: 0 → EFI_SUCCESS (no message),
// STATUS_UNSUCCESSFUL → EFI_DEVICE_ERROR, 0x80070057 → EFI_INVALID_PARAMETER,
// any other → EFI_DEVICE_ERROR.
EFI_STATUS SMB2MapNtStatus(UINT32 NtStatus, const CHAR8 *Callee,
                           const CHAR8 *Function = __builtin_FUNCTION(),
                           UINT32 Line = __builtin_LINE());
