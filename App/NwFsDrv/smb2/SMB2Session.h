// The session exchanges of the SMB2 client: the two-leg SESSION_SETUP with
// raw NTLMSSP, TREE_CONNECT, TREE_DISCONNECT and LOGOFF (their encoders and
// decoders; the steps that run them are the connection's).
#pragma once

#include "smb2/SMB2Exchange.h"
#include "smb2/SMB2Ntlmssp.h"

#pragma pack(push, 1)
struct SMB2_SESSION_SETUP_REQUEST {
  SMB2_HEADER Header;
  UINT16 StructureSize; // 25
  UINT8 Flags;
  UINT8 SecurityMode;
  UINT32 Capabilities;
  UINT32 Channel;
  UINT16 SecurityBufferOffset; // 88, from the SMB2 header
  UINT16 SecurityBufferLength;
  UINT64 PreviousSessionId;
};

// The framed header and the fixed part of a SESSION_SETUP response.
struct SMB2_SESSION_SETUP_RESPONSE {
  SMB2_HEADER Header;
  UINT16 StructureSize;
  UINT16 SessionFlags;
  UINT16 SecurityBufferOffset;
  UINT16 SecurityBufferLength;
};

struct SMB2_TREE_CONNECT_REQUEST {
  SMB2_HEADER Header;
  UINT16 StructureSize; // 9
  UINT16 Reserved;
  UINT16 PathOffset; // 72, from the SMB2 header
  UINT16 PathLength;
};

struct SMB2_TREE_CONNECT_RESPONSE {
  SMB2_HEADER Header;
  UINT16 StructureSize;
  UINT8 ShareType;
  UINT8 Reserved;
  UINT32 ShareFlags;
  UINT32 Capabilities;
  UINT32 MaximalAccess;
};

// TREE_DISCONNECT and LOGOFF requests share this layout.
struct SMB2_SIMPLE_REQUEST {
  SMB2_HEADER Header;
  UINT16 StructureSize; // 4
  UINT16 Reserved;
};
#pragma pack(pop)
static_assert(sizeof(SMB2_SESSION_SETUP_REQUEST) == 92, "session setup request fixed part");
static_assert(offsetof(SMB2_SESSION_SETUP_REQUEST, StructureSize) == 68, "StructureSize");
static_assert(offsetof(SMB2_SESSION_SETUP_REQUEST, Flags) == 70, "Flags offset");
static_assert(offsetof(SMB2_SESSION_SETUP_REQUEST, SecurityMode) == 71, "SecurityMode offset");
static_assert(offsetof(SMB2_SESSION_SETUP_REQUEST, Capabilities) == 72, "Capabilities offset");
static_assert(offsetof(SMB2_SESSION_SETUP_REQUEST, Channel) == 76, "Channel offset");
static_assert(offsetof(SMB2_SESSION_SETUP_REQUEST, SecurityBufferOffset) == 80, "SecBuf offset");
static_assert(offsetof(SMB2_SESSION_SETUP_REQUEST, SecurityBufferLength) == 82, "SecBuf length");
static_assert(offsetof(SMB2_SESSION_SETUP_REQUEST, PreviousSessionId) == 84, "PreviousSessionId");
static_assert(sizeof(SMB2_SESSION_SETUP_RESPONSE) == 76, "session setup response fixed part");
static_assert(offsetof(SMB2_SESSION_SETUP_RESPONSE, SessionFlags) == 70, "SessionFlags offset");
static_assert(offsetof(SMB2_SESSION_SETUP_RESPONSE, SecurityBufferOffset) == 72, "SecBuf offset");
static_assert(offsetof(SMB2_SESSION_SETUP_RESPONSE, SecurityBufferLength) == 74, "SecBuf length");
static_assert(sizeof(SMB2_TREE_CONNECT_REQUEST) == 76, "tree connect request fixed part");
static_assert(offsetof(SMB2_TREE_CONNECT_REQUEST, Reserved) == 70, "Reserved offset");
static_assert(offsetof(SMB2_TREE_CONNECT_REQUEST, PathOffset) == 72, "PathOffset offset");
static_assert(offsetof(SMB2_TREE_CONNECT_REQUEST, PathLength) == 74, "PathLength offset");
static_assert(sizeof(SMB2_TREE_CONNECT_RESPONSE) == 84, "tree connect response");
static_assert(offsetof(SMB2_TREE_CONNECT_RESPONSE, ShareType) == 70, "ShareType offset");
static_assert(offsetof(SMB2_TREE_CONNECT_RESPONSE, ShareFlags) == 72, "ShareFlags offset");
static_assert(offsetof(SMB2_TREE_CONNECT_RESPONSE, Capabilities) == 76, "Capabilities offset");
static_assert(offsetof(SMB2_TREE_CONNECT_RESPONSE, MaximalAccess) == 80, "MaximalAccess offset");
static_assert(sizeof(SMB2_SIMPLE_REQUEST) == 72, "tree disconnect / logoff request");
static_assert(offsetof(SMB2_SIMPLE_REQUEST, Reserved) == 70, "Reserved offset");

// The security buffer sits right behind the fixed part: 88 from the header.
constexpr UINT16 SMB2_SESSION_SETUP_BUFFER_OFFSET =
    sizeof(SMB2_SESSION_SETUP_REQUEST) - SMB2_STREAM_PREFIX_SIZE;
// A share path must be shorter than this many characters.
constexpr UINTN SMB2_SHARE_PATH_LIMIT = 336;

// ---------------------------------------------------------------------------
// Session setup: two exchanges. The first carries the NTLMSSP NEGOTIATE and
// takes in the server's CHALLENGE; the second carries the AUTHENTICATE.
// ---------------------------------------------------------------------------
struct SMB2_SESSION_CONTEXT {
  SMB2_SESSION_SETUP_REQUEST Packet; // the fixed part of the request being sent
  UINT8 Negotiate[sizeof(SMB2_NTLMSSP_NEGOTIATE_MESSAGE) + 1];
  UINT8 *Authenticate; // pool, scrubbed when freed
  UINT16 AuthenticateLength;
  SMB2_NTLM_CHALLENGE Challenge;      // a pool copy of the server's CHALLENGE
  SMB2_SESSION_SETUP_RESPONSE *First; // the first answer's header and fixed part
};
extern const SMB2_COMMAND gSMB2SessionNegotiateCommand;
extern const SMB2_COMMAND gSMB2SessionAuthenticateCommand;

// The whole exchange. *Response receives the first response's header and
// fixed part.
EFI_STATUS SMB2SessionSetUp(INT32 SockFd, SMB2_SESSION_SETUP_RESPONSE *Response,
                            TRANSACT_DETAILS *Details);
// Fills the 92-byte fixed part of a SESSION_SETUP request whose security
// buffer of BlobLength bytes follows it; the blob's place and length pass
// through the record's SecurityBufferOffset and SecurityBufferLength.
EFI_STATUS SMB2SessionSetupPacketConstruct(SMB2_SESSION_SETUP_REQUEST *Packet, UINT16 BlobLength,
                                           TRANSACT_DETAILS *Details);
EFI_STATUS SMB2VerifySetupChallengeResponse(const SMB2_SESSION_SETUP_RESPONSE *Response,
                                            const SMB2_NTLM_CHALLENGE *Challenge,
                                            TRANSACT_DETAILS *Details);
EFI_STATUS SMB2VerifySetupResponse(const SMB2_HEADER *Header, TRANSACT_DETAILS *Details);

// ---------------------------------------------------------------------------
// Tree connect, tree disconnect, logoff
// ---------------------------------------------------------------------------
struct SMB2_TREE_CONTEXT {
  const CHAR8 *SharePath;
  UINT8 *Packet; // the request with its UTF-16 path (pool)
};
extern const SMB2_COMMAND gSMB2TreeConnectCommand;
extern const SMB2_COMMAND gSMB2TreeDisconnectCommand;
extern const SMB2_COMMAND gSMB2LogOffCommand;

EFI_STATUS SMB2TreeConnectPacketConstruct(const CHAR8 *SharePath, const TRANSACT_DETAILS *Details,
                                          UINT8 **Packet, UINT32 *Total);
UINT32 SMB2TreeConnect(const CHAR8 *SharePath, TRANSACT_DETAILS *Details, INT32 SockFd);
EFI_STATUS SMB2TreeDisconnectPacketConstruct(SMB2_SIMPLE_REQUEST *Request,
                                             const TRANSACT_DETAILS *Details);
EFI_STATUS SMB2LogOffPacketConstruct(SMB2_SIMPLE_REQUEST *Request, const TRANSACT_DETAILS *Details);
UINT32 SMB2TreeDisconnect(TRANSACT_DETAILS *Details, INT32 SockFd);
UINT32 SMB2LogOff(TRANSACT_DETAILS *Details, INT32 SockFd);
