// SMB2 signing for dialects 2.0.2 and 2.1: HMAC-SHA256 over the whole SMB2
// message with its Signature field zeroed, keyed with the session key, the
// first 16 bytes of the result in Signature and SMB2_FLAGS_SIGNED set.
//
// Signing is in use when the server's negotiate answer requires it
// (SecurityMode bit 0x02), or when the UEFI variable "SMB2Signing" under the
// debug levels' GUID holds the text "1". Otherwise nothing is signed and the
// wire is as without this module. Once the session key is known, every
// request after the session setup is signed, and the final session-setup
// answer and every later answer are verified.
#pragma once

#include "NwPlatform.h"
#include "smb2/SMB2Header.h"

constexpr UINT32 SMB2_FLAGS_SIGNED = 0x00000008;
constexpr UINT16 SMB2_NEGOTIATE_SIGNING_REQUIRED = 0x0002;
constexpr UINTN SMB2_SIGNING_KEY_SIZE = 16;
constexpr UINTN SMB2_SIGNATURE_SIZE = 16;

// Decides, after the negotiate, whether the connection signs (a level-5 line
// says so and why). A connect starts undecided and without a key.
void SMB2SigningDecide(UINT16 ServerSecurityMode);
void SMB2SigningReset();
// Signing is in use for this connection (the session setup asks for what
// the key needs).
bool SMB2SigningInUse();
// The session key is known: from now on requests are signed and answers
// verified. The key is copied; the caller clears its own.
void SMB2SigningStart(const UINT8 Key[SMB2_SIGNING_KEY_SIZE]);
// Requests are signed and answers verified.
bool SMB2SigningActive();

// The MAC of one message, fed in pieces: the framed header (its prefix and
// Signature are left out, as zeros), then the body bytes as they come.
struct SMB2_SIGNATURE_CHECK {
  NwHmacSha256Context Mac;
  UINT8 Expected[SMB2_SIGNATURE_SIZE];
  bool Signed;
};
void SMB2SignatureBegin(SMB2_SIGNATURE_CHECK *Check, const SMB2_HEADER *Header);
void SMB2SignatureUpdate(SMB2_SIGNATURE_CHECK *Check, const void *Bytes, UINT64 Length);
// True when the message carried SMB2_FLAGS_SIGNED and its Signature matches.
bool SMB2SignatureMatches(SMB2_SIGNATURE_CHECK *Check);
// Signs a whole framed request of Length bytes in place.
void SMB2SignRequest(UINT8 *Message, UINT64 Length);
