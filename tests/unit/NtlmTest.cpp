// NTLMv2 as the client computes it: the published worked example
// (user "User", domain "Domain", password "Password", server challenge
// 0123456789abcdef, client challenge aa..., time 0), the AUTHENTICATE
// message built around it, the time stamp rule and the walk over the
// server's target info.
#include "MockSmbServer.h"
#include "Smb2TestEnv.h"
#include "smb2/SMB2Ntlmssp.h"

#include <string>
#include <vector>

using MockSmb::AvEol;
using MockSmb::AvPair;
using MockSmb::Bytes;
using MockSmb::Concat;
using MockSmb::FromHex;
using MockSmb::GetLe16;
using MockSmb::GetLe32;
using MockSmb::Hex;
using MockSmb::Utf16;

namespace {

std::string Hex16(const UINT8 *Data) {
  return Hex(Data, 16);
}

// The example's target info: NbDomainName "Domain", NbComputerName
// "Server", EOL.
Bytes ExampleTargetInfo() {
  return Concat({AvPair(2, Utf16("Domain")), AvPair(1, Utf16("Server")), AvEol()});
}

class NtlmTest : public Smb2HostTest {
protected:
  // Records a received CHALLENGE in the connection record as the session
  // setup does, with the given user, password and domain.
  EFI_STATUS Receive(const Bytes &Message, const char *User, const char *Password,
                     const char *Domain) {
    ChallengeBytes = Message;
    Challenge.Message = ChallengeBytes.data();
    Challenge.Length = static_cast<UINT32>(ChallengeBytes.size());
    AsciiStrCpyS(TransactDetails.ShareDetails.UserName, SMB2_USER_FIELD, User);
    AsciiStrCpyS(TransactDetails.ShareDetails.Password, SMB2_PASSWORD_FIELD, Password);
    AsciiStrCpyS(TransactDetails.ShareDetails.DomainName, SMB2_DOMAIN_FIELD, Domain);
    return SMB2NTLMExtractChallenge(&Challenge, &TransactDetails);
  }

  void TearDown() override {
    FreePool(TransactDetails.ChallResponse);
    TransactDetails.ChallResponse = nullptr;
    ExpectNoPoolLeak();
    Smb2HostTest::TearDown();
  }

  Bytes ChallengeBytes;
  SMB2_NTLM_CHALLENGE Challenge = {};
};

TEST_F(NtlmTest, PublishedExampleValues) {
  UINT8 NtHash[16];
  ASSERT_EQ(SMB2CalcMd4PasswordKey("Password", NtHash), EFI_SUCCESS);
  EXPECT_EQ(Hex16(NtHash), "a4f49c406510bdcab6824ee7c30fd852");

  UINT8 Ntlmv2Hash[16];
  ASSERT_EQ(SMB2GetNTLMv2Hash(Ntlmv2Hash, "Domain", "User", "Password", "10.0.0.1"), EFI_SUCCESS);
  EXPECT_EQ(Hex16(Ntlmv2Hash), "0c868a403bfd7a93a3001ef22ef02e3f");

  // The NTLMv2 response head as the client lays it out: the server
  // challenge parked in the proof's second half, then the blob head.
  NTLMV2_RESPONSE Response = {};
  Bytes ServerChallenge = FromHex("0123456789abcdef");
  memcpy(Response.NTProofStr + 8, ServerChallenge.data(), 8);
  Response.RespType = 1;
  Response.HiRespType = 1;
  Response.TimeStamp = 0;
  memset(Response.ChallengeFromClient, 0xAA, 8);
  Bytes Tail = Concat({ExampleTargetInfo(), Bytes(4, 0)});
  ASSERT_EQ(SMB2CalcNTLMv2Response(Ntlmv2Hash, &Response, Tail.data(), Tail.size()), EFI_SUCCESS);
  EXPECT_EQ(Hex16(Response.NTProofStr), "68cd0ab851e51c96aabc927bebef6a1c");

  UINT8 SessionBaseKey[16];
  ASSERT_EQ(SMB2CalcHmacMd5Key(Ntlmv2Hash, 16, Response.NTProofStr, 16, SessionBaseKey),
            EFI_SUCCESS);
  EXPECT_EQ(Hex16(SessionBaseKey), "8de40ccadbc14a82f15cb0ad0de95ca3");

  UINT8 RandomSessionKey[16];
  memset(RandomSessionKey, 0x55, sizeof(RandomSessionKey));
  UINT8 Encrypted[16];
  ASSERT_EQ(CalcARC4Key(SessionBaseKey, 16, RandomSessionKey, 16, Encrypted), EFI_SUCCESS);
  EXPECT_EQ(Hex16(Encrypted), "c5dad2544fc9799094ce1ce90bc9d03e");
}

TEST_F(NtlmTest, OnlyTheUserNameIsUpperCased) {
  UINT8 NtHash[16];
  ASSERT_EQ(SMB2CalcMd4PasswordKey("secret", NtHash), EFI_SUCCESS);
  Bytes Expected = Concat({Utf16("ALICE"), Utf16("Corp")});
  UINT8 Reference[16];
  ASSERT_EQ(SMB2CalcHmacMd5Key(NtHash, 16, Expected.data(), Expected.size(), Reference),
            EFI_SUCCESS);
  UINT8 Hash[16];
  ASSERT_EQ(SMB2GetNTLMv2Hash(Hash, "Corp", "alice", "secret", nullptr), EFI_SUCCESS);
  EXPECT_EQ(Hex16(Hash), Hex16(Reference));

  // Latin-1 letters are upper-cased too; the domain never is.
  Bytes Accented = Concat({Utf16("\xC9LAN"), Utf16("corp")});
  ASSERT_EQ(SMB2CalcHmacMd5Key(NtHash, 16, Accented.data(), Accented.size(), Reference),
            EFI_SUCCESS);
  ASSERT_EQ(SMB2GetNTLMv2Hash(Hash, "corp", "\xE9lan", "secret", nullptr), EFI_SUCCESS);
  EXPECT_EQ(Hex16(Hash), Hex16(Reference));
}

TEST_F(NtlmTest, PasswordIsHashedOverAtMost254Characters) {
  std::string Long(300, 'p');
  UINT8 Cut[16];
  UINT8 Full[16];
  ASSERT_EQ(SMB2CalcMd4PasswordKey(Long.c_str(), Cut), EFI_SUCCESS);
  Bytes Reference = Utf16(std::string(254, 'p'));
  ASSERT_EQ(CalcMD4(Reference.data(), Reference.size(), Full), EFI_SUCCESS);
  EXPECT_EQ(Hex16(Cut), Hex16(Full));
}

TEST_F(NtlmTest, NegotiateMessageBytes) {
  UINT8 Message[33];
  memset(Message, 0xCC, sizeof(Message));
  UINT16 Length = 0;
  ASSERT_EQ(SMB2NTLMSSPNegotiatePacketConstruct(Message, &Length), EFI_SUCCESS);
  ASSERT_EQ(Length, 32);
  EXPECT_EQ(Hex(Message, 33), "4e544c4d5353500001000000050288200000000000000000000000000000000000");
}

TEST_F(NtlmTest, ClockTimeStampKeepsItsThirtyTwoBitArithmetic) {
  NwTimeVal Tv = {1, 0};
  EXPECT_EQ(SMB2TimeFromClock(&Tv), 0x019DB1DED5D71680ULL);
  // Microseconds are divided by 100000, not multiplied by 10.
  Tv = {0, 999999};
  EXPECT_EQ(SMB2TimeFromClock(&Tv), 0x019DB1DED53E8009ULL);
  // The product wraps in 32 bits and the negative result is sign-extended.
  Tv = {1700000000, 999999};
  EXPECT_EQ(SMB2TimeFromClock(&Tv), 0x019DB1DEC66D0009ULL);
}

TEST_F(NtlmTest, TimeStampComesFromTheTargetInfoElseFromTheClock) {
  Bytes Stamp = FromHex("0102030405060708");
  MockSmb::ChallengeShape Shape;
  Shape.TargetInfo =
      Concat({AvPair(2, Utf16("D")), AvPair(7, Bytes(4, 9)), AvPair(7, Stamp), AvEol()});
  ASSERT_EQ(Receive(MockSmb::Challenge(Shape), "u", "p", "D"), EFI_SUCCESS);
  UINT64 Time = 0;
  ASSERT_EQ(SMB2GetTime(&Challenge, &TransactDetails, &Time), EFI_SUCCESS);
  EXPECT_EQ(Time, 0x0807060504030201ULL) << "a timestamp pair of the wrong size is skipped";

  NwTimeVal Now = {1, 0};
  HostSetTimeOverride(&Now);
  for (const Bytes &Info : {Concat({AvEol(), AvPair(7, Stamp)}), // EOL first stops at once
                            Concat({AvPair(2, Utf16("D")), AvEol()})}) {
    Shape.TargetInfo = Info;
    ASSERT_EQ(Receive(MockSmb::Challenge(Shape), "u", "p", "D"), EFI_SUCCESS);
    std::string Out =
        Console([&] { ASSERT_EQ(SMB2GetTime(&Challenge, &TransactDetails, &Time), EFI_SUCCESS); });
    EXPECT_EQ(Time, 0x019DB1DED5D71680ULL);
    EXPECT_TRUE(Contains(Out, "Getting system time\n"));
  }

  HostSetTimeFailure(true);
  std::string Out = Console(
      [&] { EXPECT_EQ(SMB2GetTime(&Challenge, &TransactDetails, &Time), EFI_DEVICE_ERROR); });
  EXPECT_TRUE(Contains(Out, "gettimeofday failed!"));
}

TEST_F(NtlmTest, DomainChoice) {
  MockSmb::ChallengeShape Shape;
  Shape.TargetInfo = MockSmb::DefaultTargetInfo("SRVDOM");

  // The user's own domain wins.
  std::string Out = Console(
      [&] { ASSERT_EQ(Receive(MockSmb::Challenge(Shape), "u", "p", "Mine"), EFI_SUCCESS); });
  EXPECT_STREQ(TransactDetails.ShareDetails.DomainName, "Mine");
  EXPECT_TRUE(Contains(Out, "Using domain passed by the user = Mine\n"));

  // Without one, the server's NetBIOS domain from the target info.
  ASSERT_EQ(Receive(MockSmb::Challenge(Shape), "u", "p", ""), EFI_SUCCESS);
  EXPECT_STREQ(TransactDetails.ShareDetails.DomainName, "SRVDOM");

  // A server naming no target: WORKGROUP.
  Shape.TargetName.clear();
  Out = Console([&] { ASSERT_EQ(Receive(MockSmb::Challenge(Shape), "u", "p", ""), EFI_SUCCESS); });
  EXPECT_STREQ(TransactDetails.ShareDetails.DomainName, "WORKGROUP");
  EXPECT_TRUE(Contains(Out, "Using default domain = WORKGROUP\n"));

  // Target info ahead of the name: the walk stays on the target info.
  Shape.TargetName = Utf16("S");
  Shape.InfoBeforeName = true;
  Shape.TargetInfo = MockSmb::DefaultTargetInfo("FIRST");
  ASSERT_EQ(Receive(MockSmb::Challenge(Shape), "u", "p", ""), EFI_SUCCESS);
  EXPECT_STREQ(TransactDetails.ShareDetails.DomainName, "FIRST");
}

TEST_F(NtlmTest, MalformedTargetInfoIsRefusedCleanly) {
  MockSmb::ChallengeShape Shape;
  // A domain attribute of an odd size, and one longer than the field.
  for (const Bytes &Value : {Bytes(5, 'x'), Bytes(512, 'x')}) {
    Shape.TargetInfo = Concat({AvPair(2, Value), AvEol()});
    std::string Out =
        Console([&] { EXPECT_TRUE(EFI_ERROR(Receive(MockSmb::Challenge(Shape), "u", "p", ""))); });
    EXPECT_TRUE(Contains(Out, "of domain attribute is incorrect!\n")) << Out;
  }
  // No domain pair at all.
  Shape.TargetInfo = Concat({AvPair(1, Utf16("S")), AvEol()});
  std::string Out =
      Console([&] { EXPECT_EQ(Receive(MockSmb::Challenge(Shape), "u", "p", ""), EFI_NOT_FOUND); });
  EXPECT_TRUE(Contains(Out, "Breaking as end of blob type found!\n"));

  // Fields pointing outside what was received.
  Shape = MockSmb::ChallengeShape();
  Shape.InfoOffset = 4000;
  EXPECT_EQ(Receive(MockSmb::Challenge(Shape), "u", "p", "D"), EFI_PROTOCOL_ERROR);
  Shape = MockSmb::ChallengeShape();
  Shape.NameOffset = 0xFFFFFFF0;
  EXPECT_EQ(Receive(MockSmb::Challenge(Shape), "u", "p", "D"), EFI_PROTOCOL_ERROR);
  Bytes Short = MockSmb::Challenge(MockSmb::ChallengeShape());
  Short.resize(40);
  EXPECT_EQ(Receive(Short, "u", "p", "D"), EFI_PROTOCOL_ERROR);
}

// Parses the AUTHENTICATE message and checks it against an independent
// recomputation with the example's credentials.
TEST_F(NtlmTest, AuthenticateMessage) {
  MockSmb::ChallengeShape Shape;
  Shape.Flags = 0x228A0215; // no KEY_EXCH
  Shape.TargetInfo = ExampleTargetInfo();
  ASSERT_EQ(Receive(MockSmb::Challenge(Shape), "User", "Password", "Domain"), EFI_SUCCESS);
  Bytes Random = Concat({Bytes(8, 0xAA), Bytes(16, 0x55)});
  HostSetRandomOverride(Random.data(), Random.size());
  NwTimeVal Now = {1, 0};
  HostSetTimeOverride(&Now);

  UINT8 *Message = nullptr;
  UINT16 Length = 0;
  ASSERT_EQ(SMB2NTLMAuthenticateBlobConstruct(&Challenge, &TransactDetails, &Message, &Length),
            EFI_SUCCESS);
  Bytes Auth(Message, Message + Length);
  FreePool(Message);

  const size_t TiLength = ExampleTargetInfo().size();
  const size_t NtLength = 44 + TiLength + 4;
  ASSERT_EQ(Auth.size(), 64 + NtLength + 12 + 8 + 16);
  EXPECT_EQ(Hex(Auth.data(), 12), "4e544c4d5353500003000000");
  auto Field = [&](size_t At) {
    return std::vector<uint32_t>{GetLe16(Auth, At), GetLe16(Auth, At + 2), GetLe32(Auth, At + 4)};
  };
  EXPECT_EQ(Field(12), (std::vector<uint32_t>{0, 0, 64}));
  EXPECT_EQ(Field(20), (std::vector<uint32_t>{uint32_t(NtLength), uint32_t(NtLength), 64}));
  const uint32_t DomainAt = uint32_t(64 + NtLength);
  EXPECT_EQ(Field(28), (std::vector<uint32_t>{12, 12, DomainAt}));
  EXPECT_EQ(Field(36), (std::vector<uint32_t>{8, 8, DomainAt + 12}));
  EXPECT_EQ(Field(44), (std::vector<uint32_t>{0, 0, DomainAt + 20}));
  EXPECT_EQ(Field(52), (std::vector<uint32_t>{16, 16, DomainAt + 20}));
  EXPECT_EQ(GetLe32(Auth, 60), 0x20880205u);
  EXPECT_EQ(Bytes(Auth.begin() + DomainAt, Auth.begin() + DomainAt + 20),
            Concat({Utf16("Domain"), Utf16("User")}));

  // The NT response: proof, blob head with the clock's time stamp and the
  // client challenge, the target info as received, four zeros.
  const uint8_t *Nt = Auth.data() + 64;
  EXPECT_EQ(Hex(Nt + 16, 8), "0101000000000000");
  EXPECT_EQ(Hex(Nt + 24, 8), "8016d7d5deb19d01");
  EXPECT_EQ(Hex(Nt + 32, 12), "aaaaaaaaaaaaaaaa00000000");
  EXPECT_EQ(Bytes(Nt + 44, Nt + 44 + TiLength), ExampleTargetInfo());
  EXPECT_EQ(Hex(Nt + 44 + TiLength, 4), "00000000");

  UINT8 Ntlmv2Hash[16];
  ASSERT_EQ(SMB2GetNTLMv2Hash(Ntlmv2Hash, "Domain", "User", "Password", nullptr), EFI_SUCCESS);
  NTLMV2_RESPONSE Head;
  memcpy(&Head, Nt, sizeof(Head));
  memcpy(Head.NTProofStr + 8, Shape.ServerChallenge.data(), 8);
  ASSERT_EQ(SMB2CalcNTLMv2Response(Ntlmv2Hash, &Head, Nt + 44, TiLength + 4), EFI_SUCCESS);
  EXPECT_EQ(Hex(Nt, 16), Hex16(Head.NTProofStr));
  UINT8 BaseKey[16];
  UINT8 Exported[16];
  UINT8 Encrypted[16];
  memset(Exported, 0x55, sizeof(Exported));
  ASSERT_EQ(SMB2CalcHmacMd5Key(Ntlmv2Hash, 16, Head.NTProofStr, 16, BaseKey), EFI_SUCCESS);
  ASSERT_EQ(CalcARC4Key(BaseKey, 16, Exported, 16, Encrypted), EFI_SUCCESS);
  EXPECT_EQ(Hex(Auth.data() + DomainAt + 20, 16), Hex16(Encrypted));

  // KEY_EXCH in the challenge is echoed; nothing else of its flags is.
  Shape.Flags = 0x628A0215;
  ASSERT_EQ(Receive(MockSmb::Challenge(Shape), "User", "Password", "Domain"), EFI_SUCCESS);
  ASSERT_EQ(SMB2NTLMAuthenticateBlobConstruct(&Challenge, &TransactDetails, &Message, &Length),
            EFI_SUCCESS);
  EXPECT_EQ(GetLe32(Bytes(Message, Message + Length), 60), 0x60880205u);
  FreePool(Message);
}

TEST_F(NtlmTest, AuthenticateFailuresLeakNothing) {
  MockSmb::ChallengeShape Shape;
  Shape.TargetInfo = Concat({AvPair(2, Utf16("D")), AvEol()}); // no time stamp
  ASSERT_EQ(Receive(MockSmb::Challenge(Shape), "User", "Password", "Domain"), EFI_SUCCESS);
  UINT8 *Message = nullptr;
  UINT16 Length = 0;

  HostSetRandomFailure(true);
  std::string Out = Console([&] {
    EXPECT_EQ(SMB2NTLMAuthenticateBlobConstruct(&Challenge, &TransactDetails, &Message, &Length),
              EFI_OUT_OF_RESOURCES);
  });
  EXPECT_TRUE(Contains(Out, "RandomBytes generation failed!\n"));
  HostSetRandomFailure(false);

  HostSetTimeFailure(true);
  EXPECT_EQ(SMB2NTLMAuthenticateBlobConstruct(&Challenge, &TransactDetails, &Message, &Length),
            EFI_DEVICE_ERROR);
  HostSetTimeFailure(false);

  // A challenge record shorter than the fixed part (its flags lie at 20..23)
  // is refused before anything is read from it.
  SMB2_NTLM_CHALLENGE Short = {ChallengeBytes.data(), 20};
  EXPECT_EQ(SMB2NTLMAuthenticateBlobConstruct(&Short, &TransactDetails, &Message, &Length),
            EFI_INVALID_PARAMETER);

  TransactDetails.ShareDetails.Password[0] = '\0';
  EXPECT_EQ(SMB2NTLMAuthenticateBlobConstruct(&Challenge, &TransactDetails, &Message, &Length),
            EFI_INVALID_PARAMETER);
  EXPECT_EQ(Message, nullptr);
}

} // namespace
