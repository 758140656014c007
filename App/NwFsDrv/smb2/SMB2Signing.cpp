// SMB2 signing (see SMB2Signing.h).
#include "smb2/SMB2Signing.h"

#include "DiagLog.h"
#include "NwBaseLib.h"

namespace {

struct SIGNING_STATE {
  bool InUse;
  bool Active;
  UINT8 Key[SMB2_SIGNING_KEY_SIZE];
};
SIGNING_STATE gSigning;

constexpr UINTN kVariableRoom = 8;

// "SMB2Signing" holds the text "1" (a terminator may follow).
bool VariableAsksForSigning() {
  if (gRT == nullptr || gRT->GetVariable == nullptr) {
    return false;
  }
  UINT8 Data[kVariableRoom] = {};
  UINTN Size = sizeof(Data);
  EFI_STATUS Status =
      gRT->GetVariable(u"SMB2Signing", &gDebugLevelVariableGuid, nullptr, &Size, Data);
  if (EFI_ERROR(Status) || Size == 0 || Size > sizeof(Data) || Data[0] != '1') {
    return false;
  }
  for (UINTN I = 1; I < Size; I++) {
    if (Data[I] != 0) {
      return false;
    }
  }
  return true;
}

// The message a signature covers starts behind the 4-byte stream prefix; its
// Signature field counts as zeros.
void MacHeader(NwHmacSha256Context *Mac, const SMB2_HEADER *Header) {
  SMB2_HEADER Copy;
  CopyMem(&Copy, Header, sizeof(Copy));
  ZeroMem(Copy.Signature, sizeof(Copy.Signature));
  NwHmacSha256Update(Mac, reinterpret_cast<const UINT8 *>(&Copy) + SMB2_STREAM_PREFIX_SIZE,
                     sizeof(Copy) - SMB2_STREAM_PREFIX_SIZE);
}

} // namespace

void SMB2SigningReset() {
  ZeroMem(&gSigning, sizeof(gSigning));
}

void SMB2SigningDecide(UINT16 ServerSecurityMode) {
  SMB2SigningReset();
  if ((ServerSecurityMode & SMB2_NEGOTIATE_SIGNING_REQUIRED) != 0) {
    gSigning.InUse = true;
    Smb2Log(DIAG_VERBOSE, "SMB2 signing is on: the server requires it.\n");
  } else if (VariableAsksForSigning()) {
    gSigning.InUse = true;
    Smb2Log(DIAG_VERBOSE, "SMB2 signing is on: the SMB2Signing variable asks for it.\n");
  }
}

bool SMB2SigningInUse() {
  return gSigning.InUse;
}

void SMB2SigningStart(const UINT8 Key[SMB2_SIGNING_KEY_SIZE]) {
  CopyMem(gSigning.Key, Key, SMB2_SIGNING_KEY_SIZE);
  gSigning.Active = gSigning.InUse;
}

bool SMB2SigningActive() {
  return gSigning.Active;
}

void SMB2SignatureBegin(SMB2_SIGNATURE_CHECK *Check, const SMB2_HEADER *Header) {
  ZeroMem(Check, sizeof(*Check));
  Check->Signed = (Header->Flags & SMB2_FLAGS_SIGNED) != 0;
  CopyMem(Check->Expected, Header->Signature, sizeof(Check->Expected));
  NwHmacSha256Init(&Check->Mac, gSigning.Key, sizeof(gSigning.Key));
  MacHeader(&Check->Mac, Header);
}

void SMB2SignatureUpdate(SMB2_SIGNATURE_CHECK *Check, const void *Bytes, UINT64 Length) {
  if (Length != 0) {
    NwHmacSha256Update(&Check->Mac, Bytes, Length);
  }
}

bool SMB2SignatureMatches(SMB2_SIGNATURE_CHECK *Check) {
  UINT8 Digest[NW_SHA256_DIGEST_SIZE];
  bool Computed = NwHmacSha256Final(&Check->Mac, Digest);
  // Every byte is compared, whatever the first difference.
  UINT8 Difference = 0;
  for (UINTN I = 0; I < SMB2_SIGNATURE_SIZE; I++) {
    Difference |= static_cast<UINT8>(Digest[I] ^ Check->Expected[I]);
  }
  ZeroMem(Digest, sizeof(Digest));
  return Computed && Check->Signed && Difference == 0;
}

void SMB2SignRequest(UINT8 *Message, UINT64 Length) {
  SMB2_HEADER *Header = reinterpret_cast<SMB2_HEADER *>(Message);
  Header->Flags |= SMB2_FLAGS_SIGNED;
  NwHmacSha256Context Mac;
  UINT8 Digest[NW_SHA256_DIGEST_SIZE];
  NwHmacSha256Init(&Mac, gSigning.Key, sizeof(gSigning.Key));
  MacHeader(&Mac, Header);
  NwHmacSha256Update(&Mac, Message + SMB2_FRAMED_HEADER_SIZE, Length - SMB2_FRAMED_HEADER_SIZE);
  NwHmacSha256Final(&Mac, Digest);
  CopyMem(Header->Signature, Digest, SMB2_SIGNATURE_SIZE);
  ZeroMem(Digest, sizeof(Digest));
}
