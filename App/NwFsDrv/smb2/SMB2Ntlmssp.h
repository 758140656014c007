// NTLMSSP messages as the client builds or reads them (raw, without SPNEGO),
// and the NTLMv2 computation: NT hash, NTLMv2 hash, NTProofStr, session
// base key and the RC4-encrypted exported session key.
#pragma once

#include "NwPlatform.h"
#include "smb2/SMB2Header.h"

constexpr UINT32 NTLMSSP_NEGOTIATE_UNICODE = 0x00000001;
constexpr UINT32 NTLMSSP_REQUEST_TARGET = 0x00000004;
constexpr UINT32 NTLMSSP_NEGOTIATE_SIGN = 0x00000010;
constexpr UINT32 NTLMSSP_NEGOTIATE_NTLM = 0x00000200;
constexpr UINT32 NTLMSSP_NEGOTIATE_EXTENDED_SESSIONSECURITY = 0x00080000;
constexpr UINT32 NTLMSSP_NEGOTIATE_TARGET_INFO = 0x00800000;
constexpr UINT32 NTLMSSP_NEGOTIATE_128 = 0x20000000;
constexpr UINT32 NTLMSSP_NEGOTIATE_KEY_EXCH = 0x40000000;
// The flags the client asks for: 0x20880205.
constexpr UINT32 SMB2_NTLMSSP_CLIENT_FLAGS = NTLMSSP_NEGOTIATE_UNICODE | NTLMSSP_REQUEST_TARGET |
                                             NTLMSSP_NEGOTIATE_NTLM |
                                             NTLMSSP_NEGOTIATE_EXTENDED_SESSIONSECURITY |
                                             NTLMSSP_NEGOTIATE_TARGET_INFO | NTLMSSP_NEGOTIATE_128;
static_assert(SMB2_NTLMSSP_CLIENT_FLAGS == 0x20880205, "client NTLMSSP flags");
// With signing in use the client also asks for what the session key needs.
constexpr UINT32 SMB2_NTLMSSP_SIGNING_FLAGS = NTLMSSP_NEGOTIATE_SIGN | NTLMSSP_NEGOTIATE_KEY_EXCH;
// The flags the client asks for on this connection.
UINT32 SMB2NTLMClientFlags();

constexpr UINT32 NTLMSSP_NEGOTIATE_MESSAGE_TYPE = 1;
constexpr UINT32 NTLMSSP_CHALLENGE_MESSAGE_TYPE = 2;
constexpr UINT32 NTLMSSP_AUTHENTICATE_MESSAGE_TYPE = 3;
constexpr UINT8 NTLMSSP_SIGNATURE[8] = {'N', 'T', 'L', 'M', 'S', 'S', 'P', 0};

constexpr UINT16 MSV_AV_EOL = 0;
constexpr UINT16 MSV_AV_NB_DOMAIN_NAME = 2;
constexpr UINT16 MSV_AV_TIMESTAMP = 7;

constexpr UINT32 NTLM_HASH_SIZE = 16;
constexpr UINT32 NTLM_CHALLENGE_SIZE = 8;
constexpr UINT32 NTLM_SESSION_KEY_SIZE = 16;
constexpr UINT32 NTLMV2_TRAILING_ZEROS = 4;
// Names longer than this are cut when laid out in UTF-16.
constexpr UINTN NTLM_MAX_NAME_CHARS = 256;
// The password is hashed over at most this many characters.
constexpr UINTN NTLM_MAX_PASSWORD_CHARS = 254;
constexpr UINTN NTLM_TARGET_NAME_LIMIT = 255;
// 100-ns intervals from 1601-01-01 to 1970-01-01.
constexpr UINT64 NTLM_FILETIME_UNIX_EPOCH = 0x019DB1DED53E8000ULL;

#pragma pack(push, 1)
struct NTLMSSP_FIELD {
  UINT16 Len;
  UINT16 MaxLen;
  UINT32 BufferOffset;
};

struct SMB2_NTLMSSP_NEGOTIATE_MESSAGE {
  UINT8 Signature[8];
  UINT32 MessageType;
  UINT32 NegotiateFlags;
  NTLMSSP_FIELD DomainNameFields;
  NTLMSSP_FIELD WorkstationFields;
};

// The fixed part of a CHALLENGE up to its target-info field.
struct SMB2_NTLMSSP_CHALLENGE_MESSAGE {
  UINT8 Signature[8];
  UINT32 MessageType;
  NTLMSSP_FIELD TargetNameFields;
  UINT32 NegotiateFlags;
  UINT8 ServerChallenge[8];
  UINT8 Reserved[8];
  NTLMSSP_FIELD TargetInfoFields;
};

struct NTLMV2_RESPONSE {
  UINT8 NTProofStr[16];
  UINT8 RespType;
  UINT8 HiRespType;
  UINT16 Reserved1;
  UINT32 Reserved2;
  UINT64 TimeStamp;
  UINT8 ChallengeFromClient[8];
  UINT32 Reserved3;
};

struct SMB2_NTLMSSP_AUTHENTICATE_MESSAGE {
  UINT8 Signature[8];
  UINT32 MessageType;
  NTLMSSP_FIELD LmChallengeResponseFields;
  NTLMSSP_FIELD NtChallengeResponseFields;
  NTLMSSP_FIELD DomainNameFields;
  NTLMSSP_FIELD UserNameFields;
  NTLMSSP_FIELD WorkstationFields;
  NTLMSSP_FIELD EncryptedRandomSessionKeyFields;
  UINT32 NegotiateFlags;
};
#pragma pack(pop)
static_assert(sizeof(NTLMSSP_FIELD) == 8, "NTLMSSP field is 8 bytes");
static_assert(offsetof(NTLMSSP_FIELD, MaxLen) == 2, "MaxLen offset");
static_assert(offsetof(NTLMSSP_FIELD, BufferOffset) == 4, "BufferOffset offset");
static_assert(sizeof(SMB2_NTLMSSP_NEGOTIATE_MESSAGE) == 32, "NEGOTIATE message is 32 bytes");
static_assert(offsetof(SMB2_NTLMSSP_NEGOTIATE_MESSAGE, MessageType) == 8, "MessageType offset");
static_assert(offsetof(SMB2_NTLMSSP_NEGOTIATE_MESSAGE, NegotiateFlags) == 12, "flags offset");
static_assert(offsetof(SMB2_NTLMSSP_NEGOTIATE_MESSAGE, DomainNameFields) == 16, "domain offset");
static_assert(offsetof(SMB2_NTLMSSP_NEGOTIATE_MESSAGE, WorkstationFields) == 24, "ws offset");
static_assert(sizeof(SMB2_NTLMSSP_CHALLENGE_MESSAGE) == 48, "CHALLENGE fixed part is 48 bytes");
static_assert(offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, MessageType) == 8, "MessageType offset");
static_assert(offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, TargetNameFields) == 12, "name offset");
static_assert(offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, NegotiateFlags) == 20, "flags offset");
static_assert(offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, ServerChallenge) == 24, "challenge");
static_assert(offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, Reserved) == 32, "reserved offset");
static_assert(offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, TargetInfoFields) == 40, "info offset");
static_assert(sizeof(NTLMV2_RESPONSE) == 44, "NTLMv2 response head is 44 bytes");
static_assert(offsetof(NTLMV2_RESPONSE, RespType) == 16, "RespType offset");
static_assert(offsetof(NTLMV2_RESPONSE, HiRespType) == 17, "HiRespType offset");
static_assert(offsetof(NTLMV2_RESPONSE, Reserved1) == 18, "Reserved1 offset");
static_assert(offsetof(NTLMV2_RESPONSE, Reserved2) == 20, "Reserved2 offset");
static_assert(offsetof(NTLMV2_RESPONSE, TimeStamp) == 24, "TimeStamp offset");
static_assert(offsetof(NTLMV2_RESPONSE, ChallengeFromClient) == 32, "client challenge offset");
static_assert(offsetof(NTLMV2_RESPONSE, Reserved3) == 40, "Reserved3 offset");
static_assert(sizeof(SMB2_NTLMSSP_AUTHENTICATE_MESSAGE) == 64, "AUTHENTICATE fixed part");
static_assert(offsetof(SMB2_NTLMSSP_AUTHENTICATE_MESSAGE, LmChallengeResponseFields) == 12, "lm");
static_assert(offsetof(SMB2_NTLMSSP_AUTHENTICATE_MESSAGE, NtChallengeResponseFields) == 20, "nt");
static_assert(offsetof(SMB2_NTLMSSP_AUTHENTICATE_MESSAGE, DomainNameFields) == 28, "domain");
static_assert(offsetof(SMB2_NTLMSSP_AUTHENTICATE_MESSAGE, UserNameFields) == 36, "user");
static_assert(offsetof(SMB2_NTLMSSP_AUTHENTICATE_MESSAGE, WorkstationFields) == 44, "ws");
static_assert(offsetof(SMB2_NTLMSSP_AUTHENTICATE_MESSAGE, EncryptedRandomSessionKeyFields) == 52,
              "session key");
static_assert(offsetof(SMB2_NTLMSSP_AUTHENTICATE_MESSAGE, NegotiateFlags) == 60, "flags");

// A received CHALLENGE: the message bytes and how many of them arrived.
struct SMB2_NTLM_CHALLENGE {
  const UINT8 *Message;
  UINT32 Length;
};

// ---------------------------------------------------------------------------
// Cryptography
// ---------------------------------------------------------------------------
EFI_STATUS CalcMD4(const void *Data, UINTN Length, UINT8 Digest[NTLM_HASH_SIZE]);
EFI_STATUS SMB2CalcMd4PasswordKey(const CHAR8 *Password, UINT8 Key[NTLM_HASH_SIZE]);
EFI_STATUS SMB2CalcHmacMd5Key(const UINT8 *Key, UINTN KeyLength, const void *Data, UINTN Length,
                              UINT8 Digest[NTLM_HASH_SIZE]);
// HMAC-MD5 keyed with the NT hash of Password over the upper-cased UTF-16
// user name followed by the UTF-16 domain (not upper-cased). The server
// address is not part of the computation.
EFI_STATUS SMB2GetNTLMv2Hash(UINT8 Hash[NTLM_HASH_SIZE], const CHAR8 *Domain, const CHAR8 *User,
                             const CHAR8 *Password, const CHAR8 *ServerAddress);
// NTProofStr = HMAC-MD5 (NTLMv2 hash, bytes 8..43 of Response || Tail),
// where Tail is the target info followed by its 4 zero bytes; written over
// Response->NTProofStr.
EFI_STATUS SMB2CalcNTLMv2Response(const UINT8 Ntlmv2Hash[NTLM_HASH_SIZE], NTLMV2_RESPONSE *Response,
                                  const UINT8 *Tail, UINTN TailLength);
EFI_STATUS CalcARC4Key(const UINT8 *Key, UINTN KeyLength, const UINT8 *Data, UINTN DataLength,
                       UINT8 *Out);

// ---------------------------------------------------------------------------
// Messages
// ---------------------------------------------------------------------------
// Builds the NEGOTIATE message into a 33-byte area; *Length = 32.
EFI_STATUS SMB2NTLMSSPNegotiatePacketConstruct(UINT8 *Message, UINT16 *Length);
// AV pair walks over the target info as recorded by the challenge check
// (ChallAttributes, SecurityBufferLength).
EFI_STATUS SMB2GetDomainName(const SMB2_NTLM_CHALLENGE *Challenge, const TRANSACT_DETAILS *Details,
                             CHAR8 *DomainName);
EFI_STATUS SMB2GetTime(const SMB2_NTLM_CHALLENGE *Challenge, const TRANSACT_DETAILS *Details,
                       UINT64 *Time);
// The client-clock time stamp: seconds × 10^7 + microseconds ÷ 100000 in
// signed 32-bit arithmetic, sign-extended, plus the 1601→1970 offset.
UINT64 SMB2TimeFromClock(const NwTimeVal *Tv);
// Copies the recorded target info (ChallResponse) into a new pool buffer.
EFI_STATUS SMB2NTLM_AllAttribAVPairBlobConstruct(const TRANSACT_DETAILS *Details, UINT8 **Blob,
                                                 UINTN *BlobLength);
// Builds the AUTHENTICATE message; the caller frees *Message.
EFI_STATUS SMB2NTLMAuthenticateBlobConstruct(const SMB2_NTLM_CHALLENGE *Challenge,
                                             TRANSACT_DETAILS *Details, UINT8 **Message,
                                             UINT16 *Length);
// Checks the received CHALLENGE against the record and stores what the
// client keeps (session id is the caller's), then chooses the domain.
EFI_STATUS SMB2NTLMExtractChallenge(const SMB2_NTLM_CHALLENGE *Challenge,
                                    TRANSACT_DETAILS *Details);
