// The NTLMv2 one-way functions over the platform's MD4, HMAC-MD5 and RC4.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Ntlmssp.h"

namespace {

constexpr UINTN kPasswordArea = 1024;

void PutUtf16(UINT8 *Out, UINTN Index, UINT16 Unit) {
  Out[Index * 2] = static_cast<UINT8>(Unit & 0xFF);
  Out[Index * 2 + 1] = static_cast<UINT8>(Unit >> 8);
}

// Upper case within Latin-1: a-z and the accented letters à-þ except ÷.
UINT16 UpcaseLatin1(UINT16 Unit) {
  if ((Unit >= 'a' && Unit <= 'z') || (Unit >= 0xE0 && Unit <= 0xFE && Unit != 0xF7)) {
    return static_cast<UINT16>(Unit - 0x20);
  }
  return Unit;
}

// A name converted to UTF-16LE in a fresh pool buffer; null when allocation
// fails. *Bytes receives its length.
UINT8 *Utf16Copy(const CHAR8 *Text, UINTN MaxChars, bool Upcase, UINTN *Bytes) {
  UINT8 *Out = static_cast<UINT8 *>(AllocateZeroPool(MaxChars * 2 + 2));
  if (Out == nullptr) {
    *Bytes = 0;
    return nullptr;
  }
  UINTN Count = strtoUTF16(Out, Text, MaxChars, "default");
  if (Upcase) {
    for (UINTN I = 0; I < Count; I++) {
      PutUtf16(Out, I, UpcaseLatin1(SMB2ReadLe16(Out + I * 2)));
    }
  }
  *Bytes = Count * 2;
  return Out;
}

// "Function: %s, Line no.: = %d, <What>" with or without the line end, as
// each call site prints it.
void ReportFailure(const CHAR8 *What, const CHAR8 *Function, UINT32 Line, bool LineEnd = true) {
  Smb2Log(DIAG_ALWAYS,
          LineEnd ? "Function: %s, Line no.: = %d, %s\n" : "Function: %s, Line no.: = %d, %s",
          Function, Line, What);
}

} // namespace

EFI_STATUS CalcMD4(const void *Data, UINTN Length, UINT8 Digest[NTLM_HASH_SIZE]) {
  NwMd4Context *Ctx = static_cast<NwMd4Context *>(AllocateZeroPool(sizeof(NwMd4Context)));
  if (Ctx == nullptr) {
    ReportFailure("Memory allocation Failed!", __func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_STATUS Status = EFI_SUCCESS;
  if (!NwMd4Init(Ctx)) {
    ReportFailure("Md4Init Failed!", __func__, __LINE__);
    Status = EFI_ABORTED;
  } else if (!NwMd4Update(Ctx, Data, Length)) {
    ReportFailure("Md4Update Failed!", __func__, __LINE__);
    Status = EFI_ABORTED;
  } else if (!NwMd4Final(Ctx, Digest)) {
    ReportFailure("Md4Final Failed!", __func__, __LINE__);
    Status = EFI_ABORTED;
  }
  ZeroMem(Ctx, sizeof(*Ctx));
  FreePool(Ctx);
  return Status;
}

EFI_STATUS SMB2CalcMd4PasswordKey(const CHAR8 *Password, UINT8 Key[NTLM_HASH_SIZE]) {
  if (Password == nullptr || Key == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  UINT8 *Area = static_cast<UINT8 *>(AllocateZeroPool(kPasswordArea));
  if (Area == nullptr) {
    ReportFailure("Memory allocation Failed!", __func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  UINTN Len = strtoUTF16(Area, Password, NTLM_MAX_PASSWORD_CHARS, "default");
  Smb2Log(DIAG_VERBOSE, "(Len * sizeof (UINT16)) = %d\n", static_cast<UINT32>(Len * 2));
  EFI_STATUS Status = CalcMD4(Area, Len * 2, Key);
  if (EFI_ERROR(Status)) {
    DiagError("CalcMD4 failed!", Status);
  }
  ZeroMem(Area, kPasswordArea);
  FreePool(Area);
  return Status;
}

EFI_STATUS SMB2CalcHmacMd5Key(const UINT8 *Key, UINTN KeyLength, const void *Data, UINTN Length,
                              UINT8 Digest[NTLM_HASH_SIZE]) {
  NwHmacMd5Context *Ctx =
      static_cast<NwHmacMd5Context *>(AllocateZeroPool(sizeof(NwHmacMd5Context)));
  if (Ctx == nullptr) {
    ReportFailure("Memory allocation Failed!", __func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_STATUS Status = EFI_SUCCESS;
  if (!NwHmacMd5Init(Ctx, Key, KeyLength)) {
    ReportFailure("HmacMd5Init Failed!", __func__, __LINE__);
    Status = EFI_ABORTED;
  } else if (!NwHmacMd5Update(Ctx, Data, Length)) {
    ReportFailure("HmacMd5Update Failed!", __func__, __LINE__);
    Status = EFI_ABORTED;
  } else if (!NwHmacMd5Final(Ctx, Digest)) {
    ReportFailure("HmacMd5Final Failed!", __func__, __LINE__);
    Status = EFI_ABORTED;
  }
  ZeroMem(Ctx, sizeof(*Ctx));
  FreePool(Ctx);
  return Status;
}

EFI_STATUS SMB2GetNTLMv2Hash(UINT8 Hash[NTLM_HASH_SIZE], const CHAR8 *Domain, const CHAR8 *User,
                             const CHAR8 *Password, const CHAR8 *ServerAddress) {
  (void)ServerAddress;
  if (Hash == nullptr || Domain == nullptr || User == nullptr || Password == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  UINT8 NtHash[NTLM_HASH_SIZE];
  EFI_STATUS Status = SMB2CalcMd4PasswordKey(Password, NtHash);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  UINTN UserBytes = 0;
  UINTN DomainBytes = 0;
  UINT8 *UserUtf16 = nullptr;
  UINT8 *DomainUtf16 = nullptr;
  NwHmacMd5Context *Ctx =
      static_cast<NwHmacMd5Context *>(AllocateZeroPool(sizeof(NwHmacMd5Context)));
  Status = EFI_ABORTED; // what an HMAC failure leaves behind
  if (Ctx == nullptr) {
    ReportFailure("Memory allocation Failed!", __func__, __LINE__);
    Status = EFI_OUT_OF_RESOURCES;
  } else if (!NwHmacMd5Init(Ctx, NtHash, sizeof(NtHash))) {
    ReportFailure("HmacMd5Init Failed!", __func__, __LINE__);
  } else if ((UserUtf16 = Utf16Copy(User, SMB2_USER_FIELD, true, &UserBytes)) == nullptr) {
    ReportFailure("User Memory allocation failed!", __func__, __LINE__);
    Status = EFI_OUT_OF_RESOURCES;
  } else if (!NwHmacMd5Update(Ctx, UserUtf16, UserBytes)) {
    ReportFailure("Username HmacMd5Update Failed!", __func__, __LINE__);
  } else if ((DomainUtf16 = Utf16Copy(Domain, SMB2_DOMAIN_FIELD, false, &DomainBytes)) == nullptr) {
    ReportFailure("Domain Memory allocation failed!", __func__, __LINE__);
    Status = EFI_OUT_OF_RESOURCES;
  } else if (!NwHmacMd5Update(Ctx, DomainUtf16, DomainBytes)) {
    ReportFailure("Domainname HmacMd5Update Failed!", __func__, __LINE__);
  } else if (!NwHmacMd5Final(Ctx, Hash)) {
    ReportFailure("HmacMd5Final Failed!", __func__, __LINE__);
  } else {
    Status = EFI_SUCCESS;
  }
  ZeroMem(NtHash, sizeof(NtHash));
  if (Ctx != nullptr) {
    ZeroMem(Ctx, sizeof(*Ctx));
  }
  FreePool(Ctx);
  FreePool(UserUtf16);
  FreePool(DomainUtf16);
  return Status;
}

EFI_STATUS SMB2CalcNTLMv2Response(const UINT8 Ntlmv2Hash[NTLM_HASH_SIZE], NTLMV2_RESPONSE *Response,
                                  const UINT8 *Tail, UINTN TailLength) {
  if (Ntlmv2Hash == nullptr || Response == nullptr || (Tail == nullptr && TailLength != 0)) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  NwHmacMd5Context *Ctx =
      static_cast<NwHmacMd5Context *>(AllocateZeroPool(sizeof(NwHmacMd5Context)));
  if (Ctx == nullptr) {
    ReportFailure("Memory allocation Failed!", __func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  // The 36 bytes from offset 8: the server challenge (parked in the proof's
  // second half) and the 28-byte blob head.
  const UINT8 *Head = reinterpret_cast<const UINT8 *>(Response) + NTLM_CHALLENGE_SIZE;
  UINT8 Proof[NTLM_HASH_SIZE];
  EFI_STATUS Status = EFI_ABORTED;
  if (!NwHmacMd5Init(Ctx, Ntlmv2Hash, NTLM_HASH_SIZE)) {
    ReportFailure("HmacMd5Init failed!", __func__, __LINE__, false);
  } else if (!NwHmacMd5Update(Ctx, Head, sizeof(NTLMV2_RESPONSE) - NTLM_CHALLENGE_SIZE) ||
             !NwHmacMd5Update(Ctx, Tail, TailLength)) {
    ReportFailure("HmacMd5Update failed!", __func__, __LINE__, false);
  } else if (!NwHmacMd5Final(Ctx, Proof)) {
    ReportFailure("HmacMd5Final failed!", __func__, __LINE__, false);
  } else {
    CopyMem(Response->NTProofStr, Proof, sizeof(Proof));
    Status = EFI_SUCCESS;
  }
  ZeroMem(Proof, sizeof(Proof));
  ZeroMem(Ctx, sizeof(*Ctx));
  FreePool(Ctx);
  return Status;
}

EFI_STATUS CalcARC4Key(const UINT8 *Key, UINTN KeyLength, const UINT8 *Data, UINTN DataLength,
                       UINT8 *Out) {
  if (Key == nullptr || Data == nullptr || Out == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  NwArc4Context *Ctx = static_cast<NwArc4Context *>(AllocateZeroPool(sizeof(NwArc4Context)));
  if (Ctx == nullptr) {
    ReportFailure("Memory allocation Failed!", __func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_STATUS Status = EFI_SUCCESS;
  if (!NwArc4Init(Ctx, Key, KeyLength)) {
    ReportFailure("Arc4Init Failed!", __func__, __LINE__);
    Status = EFI_ABORTED;
  } else if (!NwArc4Encrypt(Ctx, Data, DataLength, Out)) {
    ReportFailure("Arc4Encrypt Failed!", __func__, __LINE__);
    Status = EFI_ABORTED;
  }
  ZeroMem(Ctx, sizeof(*Ctx));
  FreePool(Ctx);
  return Status;
}
