// NTLMSSP messages: the NEGOTIATE the client sends first, what it keeps of
// the server's CHALLENGE (target info, server challenge, domain, time
// stamp), and the AUTHENTICATE with its NTLMv2 response.
//
// The CHALLENGE comes from an untrusted server: every offset and length in
// it is checked against the bytes received before anything is read.
#include "smb2/SMB2Ntlmssp.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Signing.h"

namespace {

constexpr UINTN kNegotiateArea = 33;
constexpr UINTN kMaxDomainAttributeBytes = (SMB2_DOMAIN_FIELD - 1) * 2;
constexpr UINT8 kNtlmV2RespType = 1;
constexpr UINT32 kMaxSecurityBlob = 0xFFFF;

void PrintAt(const CHAR8 *Text, const CHAR8 *Function, UINT32 Line) {
  Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, %s\n", Function, Line, Text);
}

// Walks the target info from ChallAttributes for the first pair of type
// Wanted (and of length Required, when Required is not 0). Messages name
// the caller.
EFI_STATUS AvPairFind(const TRANSACT_DETAILS *Details, UINT16 Wanted, UINT16 Required,
                      const UINT8 **Value, UINT16 *ValueLength, const CHAR8 *Caller) {
  const UINT8 *Pos = Details->ChallAttributes;
  if (Pos == nullptr) {
    return EFI_NOT_FOUND;
  }
  const UINT8 *End = Pos + Details->SecurityBufferLength;
  while (End - Pos >= 4) {
    UINT16 AvId = SMB2ReadLe16(Pos);
    UINT16 AvLen = SMB2ReadLe16(Pos + 2);
    Smb2Log(DIAG_VERBOSE, "AttrType = %d\n", AvId);
    Smb2Log(DIAG_VERBOSE, "Length = %d\n", AvLen);
    if (AvId == MSV_AV_EOL) {
      PrintAt("Breaking as end of blob type found!", Caller, __LINE__);
      return EFI_NOT_FOUND;
    }
    if (AvLen > End - Pos - 4) {
      PrintAt("Breaking as end of blob!", Caller, __LINE__);
      return EFI_NOT_FOUND;
    }
    if (AvId == Wanted && (Required == 0 || AvLen == Required)) {
      *Value = Pos + 4;
      *ValueLength = AvLen;
      return EFI_SUCCESS;
    }
    Pos += 4 + AvLen;
  }
  return EFI_NOT_FOUND;
}

// The AV pairs of a target info of Length bytes: every pair's 4-byte header
// and its value lie within it, up to the end-of-list pair (or the end).
bool AvPairsWithin(const UINT8 *Info, UINT64 Length) {
  UINT64 At = 0;
  while (At < Length) {
    if (Length - At < 4 || SMB2ReadLe16(Info + At + 2) > Length - At - 4) {
      Smb2Log(DIAG_ALWAYS,
              "Function: %s, Line no.: = %d, Target info AV pair at %ld runs past the %ld bytes "
              "of the target info!\n",
              "SMB2NTLMExtractChallenge", __LINE__, static_cast<INT64>(At),
              static_cast<INT64>(Length));
      return false;
    }
    if (SMB2ReadLe16(Info + At) == MSV_AV_EOL) {
      return true;
    }
    At += 4 + SMB2ReadLe16(Info + At + 2);
  }
  return true;
}

void LayField(NTLMSSP_FIELD *Field, UINT32 Length, UINT32 Offset) {
  Field->Len = static_cast<UINT16>(Length);
  Field->MaxLen = static_cast<UINT16>(Length);
  Field->BufferOffset = Offset;
}

void ChooseDefaultDomain(TRANSACT_DETAILS *Details) {
  AsciiStrCpyS(Details->ShareDetails.DomainName, SMB2_DOMAIN_FIELD, "WORKGROUP");
  Smb2Log(DIAG_ALWAYS, "Using default domain = %s\n", Details->ShareDetails.DomainName);
}

// The domain for the NTLMv2 hash: the user's, else the server's NetBIOS
// domain from the target info, else "WORKGROUP" when the server names no
// target.
EFI_STATUS ChooseDomain(const SMB2_NTLM_CHALLENGE *Challenge, UINT16 TargetNameLength,
                        TRANSACT_DETAILS *Details) {
  if (Details->ShareDetails.DomainName[0] != '\0') {
    Smb2Log(DIAG_ALWAYS, "Using domain passed by the user = %s\n",
            Details->ShareDetails.DomainName);
    return EFI_SUCCESS;
  }
  if (TargetNameLength == 0) {
    ChooseDefaultDomain(Details);
    return EFI_SUCCESS;
  }
  if (TargetNameLength >= NTLM_TARGET_NAME_LIMIT) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Error! Target name length %d is more than %d "
            "characters.\n",
            __func__, __LINE__, TargetNameLength, static_cast<INT32>(NTLM_TARGET_NAME_LIMIT));
    return EFI_BUFFER_TOO_SMALL;
  }
  return SMB2GetDomainName(Challenge, Details, Details->ShareDetails.DomainName);
}

// The NTLMv2 response: the 44-byte head, the target info and 4 zero bytes,
// with the NTProofStr computed over it; SessionBaseKey receives
// HMAC-MD5 (NTLMv2 hash, NTProofStr).
EFI_STATUS BuildNtResponse(const SMB2_NTLM_CHALLENGE *Challenge, TRANSACT_DETAILS *Details,
                           UINT8 *NtResponse, const UINT8 *TargetInfo, UINTN TargetInfoLength,
                           UINT8 SessionBaseKey[NTLM_SESSION_KEY_SIZE]) {
  NTLMV2_RESPONSE *Resp = reinterpret_cast<NTLMV2_RESPONSE *>(NtResponse);
  CopyMem(Resp->NTProofStr + NTLM_CHALLENGE_SIZE, Details->ServerChallenge, NTLM_CHALLENGE_SIZE);
  Resp->RespType = kNtlmV2RespType;
  Resp->HiRespType = kNtlmV2RespType;
  UINT64 Time = 0;
  EFI_STATUS Status = SMB2GetTime(Challenge, Details, &Time);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Resp->TimeStamp = Time;
  if (!NwRandomBytes(Resp->ChallengeFromClient, NTLM_CHALLENGE_SIZE)) {
    PrintAt("RandomBytes generation failed!", __func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  CopyMem(NtResponse + sizeof(NTLMV2_RESPONSE), TargetInfo, TargetInfoLength);

  UINT8 Ntlmv2Hash[NTLM_HASH_SIZE];
  const SHARE_DETAILS &Share = Details->ShareDetails;
  Status = SMB2GetNTLMv2Hash(Ntlmv2Hash, Share.DomainName, Share.UserName, Share.Password,
                             Share.ServerAddress);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2GetNTLMv2Hash failed!", Status);
  } else {
    Status = SMB2CalcNTLMv2Response(Ntlmv2Hash, Resp, NtResponse + sizeof(NTLMV2_RESPONSE),
                                    TargetInfoLength + NTLMV2_TRAILING_ZEROS);
    if (EFI_ERROR(Status)) {
      DiagError("SMB2CalcNTLMv2Response failed!", Status);
    } else {
      Status = SMB2CalcHmacMd5Key(Ntlmv2Hash, sizeof(Ntlmv2Hash), Resp->NTProofStr,
                                  sizeof(Resp->NTProofStr), SessionBaseKey);
      if (EFI_ERROR(Status)) {
        DiagError("NTLMv2Hash SMB2CalcHmacMd5Key failed!", Status);
      }
    }
  }
  ZeroMem(Ntlmv2Hash, sizeof(Ntlmv2Hash));
  return Status;
}

// A fresh exported session key, and the same RC4-encrypted with the session
// base key.
EFI_STATUS BuildEncryptedSessionKey(const UINT8 SessionBaseKey[NTLM_SESSION_KEY_SIZE],
                                    UINT8 Exported[NTLM_SESSION_KEY_SIZE],
                                    UINT8 Encrypted[NTLM_SESSION_KEY_SIZE]) {
  bool Random = NwRandomBytes(Exported, NTLM_SESSION_KEY_SIZE);
  Smb2Log(DIAG_VERBOSE, "RandomBytes status = %d\n", Random ? 1 : 0);
  if (!Random) {
    PrintAt("RandomBytes generation failed!", __func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_STATUS Status = CalcARC4Key(SessionBaseKey, NTLM_SESSION_KEY_SIZE, Exported,
                                  NTLM_SESSION_KEY_SIZE, Encrypted);
  if (EFI_ERROR(Status)) {
    DiagError("CalcARC4Key returned", Status);
  }
  return Status;
}

} // namespace

UINT32 SMB2NTLMClientFlags() {
  return SMB2_NTLMSSP_CLIENT_FLAGS | (SMB2SigningInUse() ? SMB2_NTLMSSP_SIGNING_FLAGS : 0);
}

EFI_STATUS SMB2NTLMSSPNegotiatePacketConstruct(UINT8 *Message, UINT16 *Length) {
  if (Message == nullptr || Length == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  ZeroMem(Message, kNegotiateArea);
  SMB2_NTLMSSP_NEGOTIATE_MESSAGE *Negotiate =
      reinterpret_cast<SMB2_NTLMSSP_NEGOTIATE_MESSAGE *>(Message);
  CopyMem(Negotiate->Signature, NTLMSSP_SIGNATURE, sizeof(NTLMSSP_SIGNATURE));
  Negotiate->MessageType = NTLMSSP_NEGOTIATE_MESSAGE_TYPE;
  Negotiate->NegotiateFlags = SMB2NTLMClientFlags();
  *Length = sizeof(SMB2_NTLMSSP_NEGOTIATE_MESSAGE);
  return EFI_SUCCESS;
}

EFI_STATUS SMB2GetDomainName(const SMB2_NTLM_CHALLENGE *Challenge, const TRANSACT_DETAILS *Details,
                             CHAR8 *DomainName) {
  if (Challenge == nullptr || Details == nullptr || DomainName == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  const UINT8 *Value = nullptr;
  UINT16 ValueLength = 0;
  EFI_STATUS Status = AvPairFind(Details, MSV_AV_NB_DOMAIN_NAME, 0, &Value, &ValueLength, __func__);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  if (ValueLength % 2 != 0 || ValueLength > kMaxDomainAttributeBytes) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Breaking as Size %d of domain attribute is incorrect!\n",
            __func__, __LINE__, ValueLength);
    return EFI_BAD_BUFFER_SIZE;
  }
  // UTF-16 narrowed to Latin-1; a character beyond it becomes '?'.
  UINTN Chars = ValueLength / 2;
  for (UINTN I = 0; I < Chars; I++) {
    UINT16 Unit = SMB2ReadLe16(Value + I * 2);
    DomainName[I] = Unit <= 0xFF ? static_cast<CHAR8>(Unit) : '?';
  }
  DomainName[Chars] = '\0';
  return EFI_SUCCESS;
}

UINT64 SMB2TimeFromClock(const NwTimeVal *Tv) {
  // Deliberately 32-bit: the product wraps and the microseconds are divided
  // by 100000; the result is sign-extended before the epoch offset is added.
  UINT32 Product = static_cast<UINT32>(Tv->tv_sec) * 10000000u;
  UINT32 Fraction = static_cast<UINT32>(Tv->tv_usec / 100000);
  INT32 Wrapped = static_cast<INT32>(Product + Fraction);
  return static_cast<UINT64>(static_cast<INT64>(Wrapped)) + NTLM_FILETIME_UNIX_EPOCH;
}

EFI_STATUS SMB2GetTime(const SMB2_NTLM_CHALLENGE *Challenge, const TRANSACT_DETAILS *Details,
                       UINT64 *Time) {
  if (Challenge == nullptr || Details == nullptr || Time == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  const UINT8 *Value = nullptr;
  UINT16 ValueLength = 0;
  if (!EFI_ERROR(AvPairFind(Details, MSV_AV_TIMESTAMP, 8, &Value, &ValueLength, __func__))) {
    *Time = SMB2ReadLe64(Value);
    return EFI_SUCCESS;
  }
  Smb2Log(DIAG_ALWAYS, "Getting system time\n");
  NwTimeVal Tv;
  ZeroMem(&Tv, sizeof(Tv));
  INT32 Result = NwGetTimeOfDay(&Tv);
  if (Result != 0) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, gettimeofday failed! Status = %d\n",
            __func__, __LINE__, Result);
    return EFI_DEVICE_ERROR;
  }
  *Time = SMB2TimeFromClock(&Tv);
  Smb2Log(DIAG_ALWAYS, "ResponseTime = 0x%lx\n", *Time);
  return EFI_SUCCESS;
}

EFI_STATUS SMB2NTLM_AllAttribAVPairBlobConstruct(const TRANSACT_DETAILS *Details, UINT8 **Blob,
                                                 UINTN *BlobLength) {
  if (Details == nullptr || Blob == nullptr || BlobLength == nullptr ||
      (Details->ChallResponse == nullptr && Details->SecurityBufferLength != 0)) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  UINTN Length = Details->SecurityBufferLength;
  *Blob = static_cast<UINT8 *>(AllocateZeroPool(Length + 1));
  if (*Blob == nullptr) {
    PrintAt("Memory allocation failed!", __func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  CopyMem(*Blob, Details->ChallResponse, Length);
  *BlobLength = Length;
  return EFI_SUCCESS;
}

EFI_STATUS SMB2NTLMExtractChallenge(const SMB2_NTLM_CHALLENGE *Challenge,
                                    TRANSACT_DETAILS *Details) {
  if (Challenge == nullptr || Challenge->Message == nullptr || Details == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  const UINT8 *Msg = Challenge->Message;
  UINT64 Length = Challenge->Length;
  if (Length < sizeof(SMB2_NTLMSSP_CHALLENGE_MESSAGE)) {
    PrintAt("Challenge message is truncated!", __func__, __LINE__);
    return EFI_PROTOCOL_ERROR;
  }
  UINT16 NameLength =
      SMB2ReadLe16(Msg + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, TargetNameFields));
  UINT64 NameOffset =
      SMB2ReadLe32(Msg + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, TargetNameFields) + 4);
  UINT16 InfoLength =
      SMB2ReadLe16(Msg + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, TargetInfoFields));
  UINT64 InfoOffset =
      SMB2ReadLe32(Msg + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, TargetInfoFields) + 4);
  if (NameOffset + NameLength > Length) {
    PrintAt("Target name lies outside the security buffer!", __func__, __LINE__);
    return EFI_PROTOCOL_ERROR;
  }
  if (InfoOffset + InfoLength > Length) {
    PrintAt("Target info lies outside the security buffer!", __func__, __LINE__);
    return EFI_PROTOCOL_ERROR;
  }
  UINT8 *Copy = static_cast<UINT8 *>(AllocateZeroPool(InfoLength + 1u));
  if (Copy == nullptr) {
    PrintAt("Memory allocation failed!", __func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  CopyMem(Copy, Msg + InfoOffset, InfoLength);
  FreePool(Details->ChallResponse);
  Details->ChallResponse = Copy;
  Details->SecurityBufferLength = InfoLength;
  Details->SecurityBufferOffset = static_cast<UINT16>(InfoOffset);
  CopyMem(Details->ServerChallenge, Msg + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, ServerChallenge),
          NTLM_CHALLENGE_SIZE);
  // The target info is taken to begin just past the target name. When that
  // position is not payload or would run past what arrived, the walk uses
  // the copy of the target info instead.
  UINT64 NameEnd = NameOffset + NameLength;
  bool NameEndUsable =
      NameEnd >= sizeof(SMB2_NTLMSSP_CHALLENGE_MESSAGE) && NameEnd + InfoLength <= Length;
  Details->ChallAttributes = NameEndUsable ? Msg + NameEnd : Details->ChallResponse;
  // Every pair the walks may meet must lie within the target info.
  if (!AvPairsWithin(Details->ChallAttributes, InfoLength) ||
      !AvPairsWithin(Details->ChallResponse, InfoLength)) {
    return EFI_PROTOCOL_ERROR;
  }
  return ChooseDomain(Challenge, NameLength, Details);
}

EFI_STATUS SMB2NTLMAuthenticateBlobConstruct(const SMB2_NTLM_CHALLENGE *Challenge,
                                             TRANSACT_DETAILS *Details, UINT8 **Message,
                                             UINT16 *Length) {
  // The challenge's flags are read from its fixed part, so a shorter one is
  // refused like a missing one.
  if (Challenge == nullptr || Challenge->Message == nullptr ||
      Challenge->Length < sizeof(SMB2_NTLMSSP_CHALLENGE_MESSAGE) || Details == nullptr ||
      Message == nullptr || Length == nullptr || Details->ShareDetails.UserName[0] == '\0' ||
      Details->ShareDetails.Password[0] == '\0') {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  *Message = nullptr;
  *Length = 0;
  UINT8 *TargetInfo = nullptr;
  UINTN TargetInfoLength = 0;
  EFI_STATUS Status =
      SMB2NTLM_AllAttribAVPairBlobConstruct(Details, &TargetInfo, &TargetInfoLength);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2NTLMSSPPacketConstruct failed!", Status);
    return Status;
  }
  UINT8 DomainUtf16[NTLM_MAX_NAME_CHARS * 2];
  UINT8 UserUtf16[NTLM_MAX_NAME_CHARS * 2];
  UINT32 DomainBytes = static_cast<UINT32>(
      strtoUTF16(DomainUtf16, Details->ShareDetails.DomainName, NTLM_MAX_NAME_CHARS, "default") *
      2);
  UINT32 UserBytes = static_cast<UINT32>(
      strtoUTF16(UserUtf16, Details->ShareDetails.UserName, NTLM_MAX_NAME_CHARS, "default") * 2);
  UINT32 NtBytes =
      static_cast<UINT32>(sizeof(NTLMV2_RESPONSE) + TargetInfoLength + NTLMV2_TRAILING_ZEROS);
  UINT32 Total = sizeof(SMB2_NTLMSSP_AUTHENTICATE_MESSAGE) + NtBytes + DomainBytes + UserBytes +
                 NTLM_SESSION_KEY_SIZE;
  UINT8 *NtResponse = nullptr;
  UINT8 *Out = nullptr;
  UINT8 SessionBaseKey[NTLM_SESSION_KEY_SIZE];
  UINT8 ExportedKey[NTLM_SESSION_KEY_SIZE];
  UINT8 EncryptedKey[NTLM_SESSION_KEY_SIZE];
  ZeroMem(SessionBaseKey, sizeof(SessionBaseKey));
  ZeroMem(ExportedKey, sizeof(ExportedKey));
  ZeroMem(EncryptedKey, sizeof(EncryptedKey));
  if (Total > kMaxSecurityBlob) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Authenticate message of %d bytes is too long!\n",
            __func__, __LINE__, Total);
    Status = EFI_BAD_BUFFER_SIZE;
  } else if ((NtResponse = static_cast<UINT8 *>(AllocateZeroPool(NtBytes))) == nullptr ||
             (Out = static_cast<UINT8 *>(AllocateZeroPool(Total))) == nullptr) {
    PrintAt("Memory allocation failed!", __func__, __LINE__);
    Status = EFI_OUT_OF_RESOURCES;
  } else {
    Status = BuildNtResponse(Challenge, Details, NtResponse, TargetInfo, TargetInfoLength,
                             SessionBaseKey);
    if (!EFI_ERROR(Status)) {
      Status = BuildEncryptedSessionKey(SessionBaseKey, ExportedKey, EncryptedKey);
    }
  }
  if (!EFI_ERROR(Status)) {
    // Payload order: NT response, domain, user, (empty workstation), key.
    SMB2_NTLMSSP_AUTHENTICATE_MESSAGE *Auth =
        reinterpret_cast<SMB2_NTLMSSP_AUTHENTICATE_MESSAGE *>(Out);
    CopyMem(Auth->Signature, NTLMSSP_SIGNATURE, sizeof(NTLMSSP_SIGNATURE));
    Auth->MessageType = NTLMSSP_AUTHENTICATE_MESSAGE_TYPE;
    UINT32 Offset = sizeof(SMB2_NTLMSSP_AUTHENTICATE_MESSAGE);
    LayField(&Auth->LmChallengeResponseFields, 0, Offset);
    LayField(&Auth->NtChallengeResponseFields, NtBytes, Offset);
    CopyMem(Out + Offset, NtResponse, NtBytes);
    Offset += NtBytes;
    LayField(&Auth->DomainNameFields, DomainBytes, Offset);
    CopyMem(Out + Offset, DomainUtf16, DomainBytes);
    Offset += DomainBytes;
    LayField(&Auth->UserNameFields, UserBytes, Offset);
    CopyMem(Out + Offset, UserUtf16, UserBytes);
    Offset += UserBytes;
    LayField(&Auth->WorkstationFields, 0, Offset);
    LayField(&Auth->EncryptedRandomSessionKeyFields, NTLM_SESSION_KEY_SIZE, Offset);
    CopyMem(Out + Offset, EncryptedKey, NTLM_SESSION_KEY_SIZE);
    UINT32 ServerFlags =
        SMB2ReadLe32(Challenge->Message + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, NegotiateFlags));
    Auth->NegotiateFlags = (SMB2NTLMClientFlags() & ~NTLMSSP_NEGOTIATE_KEY_EXCH) |
                           (ServerFlags & NTLMSSP_NEGOTIATE_KEY_EXCH);
    // The session key: the exported key when key exchange was negotiated,
    // else the session base key.
    if (SMB2SigningInUse()) {
      SMB2SigningStart((ServerFlags & NTLMSSP_NEGOTIATE_KEY_EXCH) != 0 ? ExportedKey
                                                                       : SessionBaseKey);
    }
    Smb2Log(DIAG_VERBOSE, "TotalBytes = %ld\n", static_cast<INT64>(Total));
    *Message = Out;
    *Length = static_cast<UINT16>(Total);
    Out = nullptr;
  }
  ZeroMem(SessionBaseKey, sizeof(SessionBaseKey));
  ZeroMem(ExportedKey, sizeof(ExportedKey));
  ZeroMem(EncryptedKey, sizeof(EncryptedKey));
  FreePool(Out);
  FreePool(NtResponse);
  FreePool(TargetInfo);
  return Status;
}
