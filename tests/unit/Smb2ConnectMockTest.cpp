// SMB2_Connect and SMB2_Disconnect against the scripted server: the bytes
// the client sends, and how it copes with a server that answers wrongly,
// partially, too much, or not at all. Every test ends with no pool block
// and no socket left behind.
#include "MockSmbServer.h"
#include "Smb2TestEnv.h"
#include "smb2/SMB2Connect.h"

#include <algorithm>
#include <random>
#include <string>
#include <vector>

using namespace MockSmb;

namespace {

constexpr uint32_t kMoreProcessing = 0xC0000016;

uint16_t Command(const Bytes &Request) {
  return GetLe16(Request, 16);
}
uint64_t MessageId(const Bytes &Request) {
  return GetLe64(Request, 28);
}
uint32_t TreeOf(const Bytes &Request) {
  return GetLe32(Request, 40);
}
uint64_t SessionOf(const Bytes &Request) {
  return GetLe64(Request, 44);
}
uint16_t CreditCharge(const Bytes &Request) {
  return GetLe16(Request, 10);
}

Bytes ChallengeReply(const ChallengeShape &Shape = ChallengeShape()) {
  return SessionSetupResponse(kMoreProcessing, 1, kSessionId, Challenge(Shape));
}
Bytes AuthReply(uint32_t Status = 0) {
  return SessionSetupResponse(Status, 2, kSessionId, {});
}
Bytes TreeReply() {
  return TreeConnectResponse(3, kSessionId, kTreeId);
}

class Smb2ConnectMockTest : public Smb2ConnectTest {
protected:
  void SetUp() override {
    Smb2ConnectTest::SetUp();
    Use("127.0.0.1", "share", "CIFSTEST");
  }

  // Starts the scripted server and connects to it.
  EFI_STATUS Connect(Server &S, std::string *Out = nullptr) {
    HostSetConnectPortOverride(S.Port());
    S.Start();
    return Smb2ConnectTest::Connect(Out);
  }
};

TEST_F(Smb2ConnectMockTest, ConnectAndDisconnectOnDialect210) {
  Server S;
  S.ScriptConnect(0x0210).ScriptDisconnect();
  ASSERT_EQ(Connect(S), EFI_SUCCESS);
  EXPECT_EQ(Info.Connected, 1);
  EXPECT_EQ(+TransactDetails.SessionId, kSessionId);
  EXPECT_EQ(+TransactDetails.TreeId, kTreeId);
  EXPECT_EQ(+TransactDetails.MessageId, 4u); // the tree connect's id was 3
  EXPECT_EQ(SMB2ConnectionState, SMB2_STATE_TREE);
  EXPECT_EQ(Share.MaxReadSize, 0x800000u);
  ASSERT_EQ(Disconnect(), EFI_SUCCESS);
  EXPECT_EQ(gSMB2SockFd, 0);
  EXPECT_EQ(SMB2ConnectionState, SMB2_STATE_CLOSED);
  S.Join();
  ASSERT_EQ(S.Failure(), "");

  std::vector<Bytes> R = S.Requests();
  ASSERT_EQ(R.size(), 6u);
  // NEGOTIATE: 108 bytes, two dialects, the fixed client GUID.
  EXPECT_EQ(Hex(R[0].data(), R[0].size()),
            "00000068fe534d42400000000000000000000200" + std::string(96, '0') +
                "24000200010000000000000029a6b1fc77f13847a67737a3cb048eba000000000000000002021002");
  // SESSION_SETUP legs: ids 1 and 2, the session id only on the second,
  // the raw NTLMSSP token at 88.
  for (int Leg = 1; Leg <= 2; Leg++) {
    const Bytes &Q = R[Leg];
    EXPECT_EQ(MessageId(Q), uint64_t(Leg));
    EXPECT_EQ(SessionOf(Q), Leg == 1 ? 0 : kSessionId);
    EXPECT_EQ(Q[71], 1) << "security mode adopted from the server";
    EXPECT_EQ(4u + GetLe16(Q, 80) + GetLe16(Q, 82), Q.size());
    EXPECT_EQ(StreamLength(Q), Q.size() - 4);
    EXPECT_EQ(Hex(Q.data() + 4 + GetLe16(Q, 80), 9),
              Leg == 1 ? "4e544c4d5353500001" : "4e544c4d5353500003");
  }
  EXPECT_EQ(GetLe16(R[1], 82), 32);
  // TREE_CONNECT: id 3, credit charge 1, the UNC path in UTF-16 and two
  // zero bytes that PathLength does not count.
  const Bytes &T = R[3];
  EXPECT_EQ(MessageId(T), 3u);
  EXPECT_EQ(CreditCharge(T), 1);
  Bytes Unc = Utf16(Path);
  EXPECT_EQ(GetLe16(T, 74), Unc.size());
  EXPECT_EQ(Bytes(T.begin() + 4 + GetLe16(T, 72), T.end()), Concat({Unc, Bytes{0, 0}}));
  // TREE_DISCONNECT (4) and LOGOFF (2) with tree and session ids.
  for (int I = 4; I <= 5; I++) {
    EXPECT_EQ(Command(R[I]), I == 4 ? 4 : 2);
    EXPECT_EQ(MessageId(R[I]), uint64_t(I));
    EXPECT_EQ(TreeOf(R[I]), kTreeId);
  }
}

TEST_F(Smb2ConnectMockTest, RefusedDialects) {
  struct Case {
    uint16_t Dialect;
    EFI_STATUS Expected;
    const char *Message;
  } Cases[] = {
      {0x0300, EFI_UNSUPPORTED, "Unsupported dialect 0x300 detected! \n"},
      {0x02FF, EFI_UNSUPPORTED,
       "Wildcard dialect 0x2ff detected! It is unsupported at the moment!\n"},
      {0x0201, EFI_NOT_FOUND, "Unrecognized dialect 0x201 detected! \n"},
  };
  for (const Case &C : Cases) {
    Server S;
    S.ExpectRequest().Send(NegotiateResponse(C.Dialect)).DrainUntilClosed();
    std::string Out;
    EXPECT_EQ(Connect(S, &Out), C.Expected) << std::hex << C.Dialect;
    EXPECT_TRUE(Contains(Out, C.Message)) << Out;
    EXPECT_TRUE(Contains(Out, "SMB2Negotiate failed!"));
    EXPECT_EQ(Info.Connected, 0);
    // The socket stays open for the disconnect, which still logs off.
    EXPECT_NE(gSMB2SockFd, 0);
    Disconnect();
    S.Join();
    ASSERT_EQ(S.Requests().size(), 2u);
    EXPECT_EQ(Command(S.Requests()[1]), 2);
  }
}

// The header of an answer: its protocol id and, when it reports success,
// its message id; a continuation is let through whatever its protocol id.
TEST_F(Smb2ConnectMockTest, AnswerHeadersAreChecked) {
  Bytes BentChallenge = ChallengeReply(), BentTree = TreeReply();
  BentChallenge[4] = BentTree[4] = 0xFF; // 0xFE 'S' 'M' 'B' -> 0xFF 'S' 'M' 'B'
  struct Case {
    const char *What;
    Bytes Challenge, Tree;
    EFI_STATUS Status;
    const char *Message;
  } Cases[] = {
      {"continuation with a wrong protocol id", BentChallenge, TreeReply(), EFI_SUCCESS,
       "Header check failed!"},
      {"success with a wrong protocol id", ChallengeReply(), BentTree, EFI_DEVICE_ERROR,
       "Header check failed!"},
      {"message id off by one", ChallengeReply(), TreeConnectResponse(2, kSessionId, kTreeId),
       EFI_DEVICE_ERROR, "Response Message Id is incorrect! Id = 0x2, Expected = 0x3\n"},
  };
  for (const Case &C : Cases) {
    Server S;
    S.ExpectRequest().Send(NegotiateResponse(0x0210));
    S.ExpectRequest().Send(C.Challenge).ExpectRequest().Send(AuthReply());
    S.ExpectRequest().Send(C.Tree).ScriptDisconnect();
    std::string Out;
    EXPECT_EQ(Connect(S, &Out), C.Status) << C.What;
    EXPECT_TRUE(Contains(Out, C.Message)) << C.What << Out;
    EXPECT_EQ(SMB2ConnectionState, C.Status == EFI_SUCCESS ? SMB2_STATE_TREE : SMB2_STATE_SESSION);
    Disconnect();
  }
}

// A refused response is consumed whole, so the teardown that follows still
// speaks on message boundaries: the logoff is answered and accepted.
TEST_F(Smb2ConnectMockTest, ErrorStatusIsRecordedAndTheStreamStaysInStep) {
  Server S;
  S.ExpectRequest().Send(NegotiateResponse(0x0210));
  S.ExpectRequest().Send(ChallengeReply()).ExpectRequest().Send(AuthReply());
  S.ExpectRequest().Send(ErrorResponse(3, 0xC0000022, 3, kSessionId));
  S.ExpectRequest().Send(SimpleResponse(2, 4, kSessionId, 0));
  std::string Out;
  EXPECT_EQ(Connect(S, &Out), EFI_DEVICE_ERROR);
  EXPECT_TRUE(
      Contains(Out, "SMB2VerifyHeader: Response Status returned error! Status = 0xc0000022\n"));
  EXPECT_EQ(+TransactDetails.ResponseStatus, 0xC0000022u);
  EXPECT_EQ(Share.LastStatus, 0xC0000022u);
  EXPECT_EQ(Disconnect(&Out), EFI_SUCCESS) << Out;
  EXPECT_EQ(Share.LastStatus, 0u);
  S.Join();
  EXPECT_EQ(S.Failure(), "");
}

TEST_F(Smb2ConnectMockTest, ResponsesArrivingInPiecesAreReassembled) {
  Server S;
  Bytes Tree = TreeReply();
  S.ExpectRequest().SendInPieces(NegotiateResponse(0x0210), {2, 50, 100}, 20);
  S.ExpectRequest().SendInPieces(ChallengeReply(), {70, 80}, 20);
  S.ExpectRequest().Send(AuthReply());
  S.ExpectRequest().SendInPieces(Tree, {30, 60}, 20).ScriptDisconnect();
  ASSERT_EQ(Connect(S), EFI_SUCCESS);
  ASSERT_EQ(Disconnect(), EFI_SUCCESS);
}

// Session answers the client cannot use: each ends the connect with an
// error, whatever follows it.
TEST_F(Smb2ConnectMockTest, UnusableSessionAnswersFailTheConnect) {
  Use("127.0.0.1", "share", nullptr); // the target name counts only without a domain
  auto Shaped = [](void (*Bend)(ChallengeShape &)) {
    ChallengeShape Shape;
    Bend(Shape);
    return ChallengeReply(Shape);
  };
  Bytes BadSignature = ChallengeReply();
  BadSignature[4 + 72] = 'X'; // "XTLMSSP"
  // A security buffer pointing past the message, one too small for a
  // CHALLENGE, and a final answer whose buffer lies outside it.
  Bytes Outside = ChallengeReply();
  SetLe16(Outside, 4 + 68, 0x4000);
  Bytes Tiny = SessionSetupResponse(kMoreProcessing, 1, kSessionId, Bytes(20, 'N'));
  Bytes FinalOutside = AuthReply();
  SetLe16(FinalOutside, 4 + 68, 72);
  SetLe16(FinalOutside, 4 + 70, 100);
  // A negotiate announcing a huge body, and one too short for its fields.
  Bytes Huge = NegotiateResponse(0x0210);
  Huge[1] = 0xFF;
  Bytes Full = NegotiateResponse(0x0210);
  Bytes Short = Frame(Bytes(Full.begin() + 4, Full.begin() + 4 + 64 + 10));
  struct Case {
    const char *What;
    std::vector<Bytes> Answers; // from the negotiate on
    const char *Message;
  } Cases[] = {
      {"AV pairs past the end of the target info",
       {Full, Shaped([](ChallengeShape &S) {
          S.TargetInfo = Concat({AvPair(1, Utf16("S")), AvPair(2, Utf16("DOMAIN"))});
          S.TargetInfo.resize(S.TargetInfo.size() - 6);
        })},
       "runs past the 16 bytes of the target info!\n"},
      {"target name of 255 bytes",
       {Full, Shaped([](ChallengeShape &S) { S.TargetName = Bytes(255, 'N'); })},
       "Target name length 255 is more than 255"},
      {"target info beyond the message",
       {Full, Shaped([](ChallengeShape &S) { S.InfoOffset = 0x7000; })},
       "Target info lies outside"},
      {"challenge without target info",
       {Full, Shaped([](ChallengeShape &S) { S.Flags &= ~0x00800000u; })},
       "TargetInfo.MaximumLength is zero length!\n"},
      {"wrong message type",
       {Full, Shaped([](ChallengeShape &S) { S.MessageType = 3; })},
       "Session Message type is incorrect! Type = 0x3"},
      {"wrong signature",
       {Full, BadSignature},
       "Session Message type is incorrect! Signature = XTLMSSP"},
      {"security buffer past the message", {Full, Outside}, "lies outside the response!"},
      {"security buffer too small for a challenge", {Full, Tiny}, "is truncated!"},
      {"first leg without more processing",
       {Full, SessionSetupResponse(0, 1, kSessionId, Challenge(ChallengeShape()))},
       "Session Status is incorrect! Status = 0x0\n"},
      {"second leg refused",
       {Full, ChallengeReply(), AuthReply(0xC000006D)},
       "SMB2VerifyHeader: Response Status returned error! Status = 0xc000006d\n"},
      {"second leg with more processing",
       {Full, ChallengeReply(), AuthReply(kMoreProcessing)},
       "Session Status is incorrect! Status = 0xc0000016\n"},
      {"final security buffer past the message",
       {Full, ChallengeReply(), FinalOutside, TreeReply()},
       "lies outside the response!"},
      {"tree connect answer of 4 body bytes",
       {Full, ChallengeReply(), AuthReply(), SimpleResponse(3, 3, kSessionId, kTreeId)},
       "shorter than its fixed part"},
      {"negotiate announcing a huge body", {Huge}, ""},
      {"negotiate too short for its fields", {Short}, ""},
  };
  for (const Case &C : Cases) {
    Server S;
    for (const Bytes &Reply : C.Answers) {
      S.ExpectRequest().Send(Reply);
    }
    S.Close();
    std::string Out;
    EXPECT_TRUE(EFI_ERROR(Connect(S, &Out))) << C.What;
    EXPECT_TRUE(Contains(Out, C.Message)) << C.What << Out;
    Disconnect();
  }
}

// Whatever a server sends, the client reads and writes only inside its
// buffers (the sanitizers watch) and leaves nothing behind: each round
// bends one answer of a connect (a flipped byte, a 16-bit field set to an
// extreme, a cut) and hangs up right after it.
TEST_F(Smb2ConnectMockTest, RandomlyBentAnswersAreSurvived) {
  HostSetSocketTimeoutMs(1000);
  std::mt19937 Random(20240611);
  const Bytes Answers[] = {NegotiateResponse(0x0210), ChallengeReply(), AuthReply(), TreeReply()};
  int Connected = 0;
  for (int Round = 0; Round < 500; Round++) {
    size_t Bent = Random() % 4;
    Bytes Answer = Answers[Bent];
    size_t At = Random() % Answer.size();
    switch (Random() % 3) {
    case 0:
      Answer[At] ^= static_cast<uint8_t>(1 + Random() % 255);
      break;
    case 1:
      At = std::min(At, Answer.size() - 2);
      SetLe16(Answer, At, Random() % 2 ? 0xFFFF : static_cast<uint16_t>(Random()));
      break;
    default:
      Answer.resize(At);
      break;
    }
    Server S;
    for (size_t I = 0; I < Bent; I++) {
      S.ExpectRequest().Send(Answers[I]);
    }
    S.ExpectRequest().Send(Answer).Close();
    Connected += Connect(S) == EFI_SUCCESS;
    Disconnect();
    ASSERT_EQ(gSMB2SockFd, 0) << Round;
  }
  // Some bends are harmless (a flipped server GUID byte); most are not.
  EXPECT_GT(Connected, 0);
  EXPECT_LT(Connected, 250);
}

// Transport failures: a peer that resets, one that falls silent, a port
// nothing listens on, an address that is no address.
TEST_F(Smb2ConnectMockTest, TransportFailuresAreReported) {
  HostSetSocketTimeoutMs(300);
  uint16_t Closed;
  {
    Server Gone; // bound but never started: closed once it goes
    Closed = Gone.Port();
  }
  struct Case {
    void (*Script)(Server &);
    const char *Address;
    EFI_STATUS Status;
    const char *Message;
  } Cases[] = {
      {[](Server &S) { S.ExpectRequest().Pause(50).Reset(); }, "127.0.0.1", EFI_PROTOCOL_ERROR,
       "Server has reset the connection!\n"},
      {[](Server &S) { S.ExpectRequest().Pause(600).Close(); }, "127.0.0.1", EFI_PROTOCOL_ERROR,
       "errno = 60 (Operation timed out)"},
      {nullptr, "127.0.0.1", EFI_DEVICE_ERROR, "connect failed! errno = 61 (Connection refused)"},
      {nullptr, "server.example", EFI_DEVICE_ERROR,
       "TCP_GetDomainTypeByIPAddress failed! Status = 0xffffffff (-1)"},
  };
  for (const Case &C : Cases) {
    Use(C.Address, "share", nullptr);
    Server S;
    HostSetConnectPortOverride(C.Script != nullptr ? S.Port() : Closed);
    if (C.Script != nullptr) {
      C.Script(S);
      S.Start();
    }
    std::string Out;
    EXPECT_EQ(Captured(&Out, [&] { return SMB2_Connect(&Info, &Share); }), C.Status);
    EXPECT_TRUE(Contains(Out, C.Message)) << Out;
    Disconnect(); // closes what the failure left open
    EXPECT_EQ(gSMB2SockFd, 0);
  }
  std::string Out;
  EXPECT_EQ(Disconnect(&Out), EFI_NOT_FOUND);
  EXPECT_TRUE(Contains(Out, "gSMB2SockFd is 0!\n"));
}

} // namespace
