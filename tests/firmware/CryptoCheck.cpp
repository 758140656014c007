// Firmware self-test of the image's crypto and random bytes, run inside
// OVMF by run-crypto-test.sh. It links the platform code exactly as
// CIFSDrv.efi does and checks every primitive against published vectors:
// MD4 (RFC 1320), MD5 (RFC 1321), HMAC-MD5 (RFC 2202), HMAC-SHA256
// (RFC 4231) and RC4, fed whole and in uneven pieces. (HMAC-SHA256 at length,
// under the firmware's interrupts: the e2e test's signed 8 MiB import.) Then
// it reports which random source answered ("@@RANDOM <source>"); the script
// knows which one QEMU offers.
#include "FirmwareTestConsole.h"
#include "NwPlatform.h"
#include "UefiCrypto.h"
#include "UefiRandom.h"

namespace {

struct DigestVector {
  const char *Message;
  const char *Md4;
  const char *Md5;
};

// From the test suites of RFC 1320 and RFC 1321 (same messages): one block,
// and two.
constexpr DigestVector kDigestVectors[] = {
    {"abc", "a448017aaf21d8525fc10ae87aa6729d", "900150983cd24fb0d6963f7d28e17f72"},
    {"1234567890123456789012345678901234567890123456789012345678901234567890123456789"
     "0",
     "e33b4ddc9c38f2199c3e7b164fcc0536", "57edf4a22be3c955ac49da2e2107b67a"},
};

struct HmacVector {
  UINT8 KeyByte; // the key is KeyLength copies of KeyByte
  UINT8 KeyLength;
  const char *KeyText; // instead of the bytes, when set
  UINT8 DataByte;      // the data is DataLength copies of DataByte
  UINT8 DataLength;
  const char *DataText; // instead of the bytes, when set
  const char *Mac;      // all of it
};
constexpr UINTN kMaxHmacKey = 131;
constexpr UINTN kMaxHmacData = 50;

// RFC 2202, test cases 3 and 6 for HMAC-MD5 (a short key with data of
// bytes, a key longer than a block).
constexpr HmacVector kHmacMd5Vectors[] = {
    {0xaa, 16, nullptr, 0xdd, 50, nullptr, "56be34521d144c88dbb8c733f0e8b3f6"},
    {0xaa, 80, nullptr, 0, 0, "Test Using Larger Than Block-Size Key - Hash Key First",
     "6b1ab7fe4bd7bf8f0b62e6ce61b9d0cd"},
};

// RFC 4231, test cases 1, 2, 6 and 7 for HMAC-SHA-256.
constexpr HmacVector kHmacSha256Vectors[] = {
    {0x0b, 20, nullptr, 0, 0, "Hi There",
     "b0344c61d8db38535ca8afceaf0bf12b881dc200c9833da726e9376c2e32cff7"},
    {0, 0, "Jefe", 0, 0, "what do ya want for nothing?",
     "5bdcc146bf60754e6a042426089575c75a003f089d2739839dec58b964ec3843"},
    {0xaa, 131, nullptr, 0, 0, "Test Using Larger Than Block-Size Key - Hash Key First",
     "60e431591ee0b67f0d8a26aacbf5b77f8e0bc6213728c5140546040f0ee37f54"},
    {0xaa, 131, nullptr, 0, 0,
     "This is a test using a larger than block-size key and a larger than block-size data. "
     "The key needs to be hashed before being used by the HMAC algorithm.",
     "9b09ffa71b942fcb27635fbcd5b0e944bfdc63644f0713938a7f51535c3a35e2"},
};

struct Rc4Vector {
  const char *Key;
  const char *Plaintext;
  const char *Ciphertext;
};

constexpr Rc4Vector kRc4Vectors[] = {
    {"Secret", "Attack at dawn", "45a01f645fc35b383552544b9bf5"},
};
// RFC 6229: the first 16 key-stream bytes for the 40-bit key 0102030405.
constexpr UINT8 kRc4StreamKey[] = {1, 2, 3, 4, 5};
constexpr const char *kRc4Stream = "b2396305f03dc027ccc3524a0a1118a8";

const UINT8 *Bytes(const char *Text) {
  return reinterpret_cast<const UINT8 *>(Text);
}

bool HexIs(const UINT8 *Digest, UINTN Length, const char *Expected) {
  return AsciiStrCmp(FwTestHex(Digest, Length), Expected) == 0;
}

// MD4 of Length bytes, fed in pieces of at most Piece bytes.
bool Md4Pieces(const UINT8 *Data, UINT64 Length, UINT64 Piece, UINT8 Digest[16]) {
  NwMd4Context Ctx;
  if (!NwMd4Init(&Ctx)) {
    return false;
  }
  for (UINT64 Done = 0; Done < Length;) {
    UINT64 Take = Length - Done < Piece ? Length - Done : Piece;
    if (!NwMd4Update(&Ctx, Data + Done, Take)) {
      return false;
    }
    Done += Take;
  }
  return NwMd4Final(&Ctx, Digest);
}

void CheckDigestVectors() {
  for (const DigestVector &V : kDigestVectors) {
    const UINT64 Length = AsciiStrLen(V.Message);
    UINT8 Digest[16] = {};
    bool Ok = Md4Pieces(Bytes(V.Message), Length, Length + 1, Digest);
    FwTestCheck(Ok && HexIs(Digest, 16, V.Md4), "MD4 (\"%a\") = %a", V.Message,
                FwTestHex(Digest, 16));
    // Byte by byte, and in pieces of 7 across the block boundaries.
    UINT8 ByteWise[16] = {};
    UINT8 Sevens[16] = {};
    Ok = Md4Pieces(Bytes(V.Message), Length, 1, ByteWise) &&
         Md4Pieces(Bytes(V.Message), Length, 7, Sevens);
    FwTestCheck(Ok && HexIs(ByteWise, 16, V.Md4) && HexIs(Sevens, 16, V.Md4),
                "MD4 (\"%a\") fed in pieces", V.Message);
    Ok = UefiMd5Digest(V.Message, Length, Digest);
    FwTestCheck(Ok && HexIs(Digest, 16, V.Md5), "MD5 (\"%a\") = %a", V.Message,
                FwTestHex(Digest, 16));
  }
}

// The MAC of Data under Key through one of the facade's HMACs, fed as the
// first Split bytes and then the rest.
template <typename Context, bool (*Init)(Context *, const uint8_t *, uint64_t),
          bool (*Update)(Context *, const void *, uint64_t), bool (*Final)(Context *, uint8_t *)>
bool HmacInTwo(const UINT8 *Key, UINTN KeyLength, const UINT8 *Data, UINTN DataLength, UINTN Split,
               UINT8 *Mac) {
  Context Ctx;
  return Init(&Ctx, Key, KeyLength) && Update(&Ctx, Data, Split) &&
         Update(&Ctx, Data + Split, DataLength - Split) && Final(&Ctx, Mac);
}
using HmacFunction = bool (*)(const UINT8 *, UINTN, const UINT8 *, UINTN, UINTN, UINT8 *);

template <UINTN Count>
void CheckHmacVectors(const char *Name, const HmacVector (&Vectors)[Count], HmacFunction Hmac,
                      UINTN MacLength) {
  for (UINT32 Case = 1; Case <= Count; Case++) {
    const HmacVector &V = Vectors[Case - 1];
    UINT8 Key[kMaxHmacKey];
    UINT8 Data[kMaxHmacData];
    const UINT8 *KeyBytes = Key;
    UINTN KeyLength = V.KeyLength;
    if (V.KeyText != nullptr) {
      KeyBytes = Bytes(V.KeyText);
      KeyLength = AsciiStrLen(V.KeyText);
    } else {
      SetMem(Key, KeyLength, V.KeyByte);
    }
    const UINT8 *DataBytes = Data;
    UINTN DataLength = V.DataLength;
    if (V.DataText != nullptr) {
      DataBytes = Bytes(V.DataText);
      DataLength = AsciiStrLen(V.DataText);
    } else {
      SetMem(Data, DataLength, V.DataByte);
    }
    // Whole, then in two uneven updates.
    UINT8 Mac[NW_SHA256_DIGEST_SIZE] = {};
    bool Ok = Hmac(KeyBytes, KeyLength, DataBytes, DataLength, DataLength, Mac);
    FwTestCheck(Ok && HexIs(Mac, MacLength, V.Mac), "%a case %u = %a", Name, Case,
                FwTestHex(Mac, MacLength));
    UINT8 Split[NW_SHA256_DIGEST_SIZE] = {};
    Ok = Hmac(KeyBytes, KeyLength, DataBytes, DataLength, 3, Split);
    FwTestCheck(Ok && HexIs(Split, MacLength, V.Mac), "%a case %u in two updates", Name, Case);
  }
}

void CheckHmacs() {
  CheckHmacVectors("HMAC-MD5 RFC 2202", kHmacMd5Vectors,
                   HmacInTwo<NwHmacMd5Context, NwHmacMd5Init, NwHmacMd5Update, NwHmacMd5Final>,
                   NW_MD5_DIGEST_SIZE);
  CheckHmacVectors(
      "HMAC-SHA256 RFC 4231", kHmacSha256Vectors,
      HmacInTwo<NwHmacSha256Context, NwHmacSha256Init, NwHmacSha256Update, NwHmacSha256Final>,
      NW_SHA256_DIGEST_SIZE);
}

void CheckRc4() {
  for (const Rc4Vector &V : kRc4Vectors) {
    const UINTN Length = AsciiStrLen(V.Plaintext);
    UINT8 Out[32] = {};
    NwArc4Context Ctx;
    bool Ok = NwArc4Init(&Ctx, Bytes(V.Key), AsciiStrLen(V.Key)) &&
              NwArc4Encrypt(&Ctx, Bytes(V.Plaintext), Length, Out);
    FwTestCheck(Ok && HexIs(Out, Length, V.Ciphertext), "RC4 key \"%a\" on \"%a\" = %a", V.Key,
                V.Plaintext, FwTestHex(Out, Length));
  }
  // The key stream continues across calls: 5 + 11 bytes equal 16 at once.
  UINT8 Zeros[16] = {};
  UINT8 Stream[16] = {};
  NwArc4Context Ctx;
  bool Ok = NwArc4Init(&Ctx, kRc4StreamKey, sizeof(kRc4StreamKey)) &&
            NwArc4Encrypt(&Ctx, Zeros, 5, Stream) && NwArc4Encrypt(&Ctx, Zeros + 5, 11, Stream + 5);
  FwTestCheck(Ok && HexIs(Stream, 16, kRc4Stream), "RC4 key stream (RFC 6229, 40-bit key) = %a",
              FwTestHex(Stream, 16));
}

const char *SourceName(UefiRandomSource Source) {
  switch (Source) {
  case UefiRandomSource::RngProtocol:
    return "rng-protocol";
  case UefiRandomSource::Rdrand:
    return "rdrand";
  case UefiRandomSource::None:
    break;
  }
  return "none";
}

void CheckRandom() {
  UINT8 First[37] = {};
  UINT8 Second[37] = {};
  const UefiRandomSource Source = UefiFillRandom(First, sizeof(First));
  FwTestPrint("@@RANDOM %a\n", SourceName(Source));
  const bool Facade = NwRandomBytes(Second, sizeof(Second));
  if (Source == UefiRandomSource::None) {
    FwTestCheck(!Facade, "without a random source NwRandomBytes fails");
    return;
  }
  FwTestCheck(Facade, "NwRandomBytes succeeds");
  // 37 bytes: not a whole number of 64-bit words. Two draws that agree, or
  // a draw with a zero tail, would mean the bytes were not all filled.
  UINT8 Zeros[8] = {};
  FwTestCheck(CompareMem(First, Second, sizeof(First)) != 0, "two random draws differ");
  FwTestCheck(CompareMem(First + 29, Zeros, 8) != 0 || CompareMem(Second + 29, Zeros, 8) != 0,
              "the last bytes of a draw are filled");
}

} // namespace

extern "C" EFI_STATUS EFIAPI EfiMain(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable) {
  FwTestStart(ImageHandle, SystemTable);
  FwTestPrint("@@BEGIN crypto-check\n");
  CheckDigestVectors();
  CheckHmacs();
  CheckRc4();
  CheckRandom();
  EFI_STATUS Status = FwTestFinish();
  FwTestPrint("@@END crypto-check\n");
  return Status;
}
