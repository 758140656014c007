// SMB2 framing: per-command header fields and credit charges, and the
// builders' and connect parameters' limits.
#include "MockSmbServer.h"
#include "Smb2TestEnv.h"
#include "smb2/SMB2Connect.h"
#include "smb2/SMB2Session.h"

#include <string>

using MockSmb::Hex;

namespace {

class Smb2FramingTest : public Smb2HostTest {
protected:
  void TearDown() override {
    ExpectNoPoolLeak();
    Smb2HostTest::TearDown();
  }
};

TEST_F(Smb2FramingTest, PerCommandHeaderFieldsAndCreditCharges) {
  TransactDetails.MessageId = 9;
  TransactDetails.SessionId = 0x1122334455667788ULL;
  TransactDetails.TreeId = 7;
  TransactDetails.DialectRevision = 0x0210;
  const UINT64 Sid = 0x1122334455667788ULL;
  struct Case {
    UINT16 Command;
    UINT64 MessageId;
    UINT32 TreeId;
    UINT64 SessionId;
    UINT16 Charge;
  } Cases[] = {{SMB2_NEGOTIATE, 0, 0, 0, 0},      {SMB2_SESSION_SETUP, 9, 0, Sid, 0},
               {SMB2_TREE_CONNECT, 9, 0, Sid, 1}, {SMB2_TREE_DISCONNECT, 9, 7, Sid, 0},
               {SMB2_LOGOFF, 9, 7, Sid, 0},       {SMB2_CREATE, 9, 7, Sid, 1}};
  for (const Case &C : Cases) {
    SMB2_HEADER Header;
    memset(&Header, 0xCC, sizeof(Header));
    ASSERT_EQ(SMB2HeaderConstruct(&Header), EFI_SUCCESS);
    SMB2HeaderFill(&Header, C.Command, 100, &TransactDetails);
    EXPECT_EQ(Hex(reinterpret_cast<UINT8 *>(&Header), 12),
              "00000060fe534d4240000" + std::to_string(C.Charge) + "00");
    EXPECT_EQ(+Header.MessageId, C.MessageId) << C.Command;
    EXPECT_EQ(+Header.TreeId, C.TreeId) << C.Command;
    EXPECT_EQ(+Header.SessionId, C.SessionId) << C.Command;
    EXPECT_EQ(+Header.CreditRequest, 2);
    EXPECT_EQ(+Header.Flags | Header.Status | Header.NextCommand, 0u);
  }
  // READ and WRITE: one credit per started 64 KiB, 32-bit arithmetic
  // stored in 16 bits; nothing on dialect 0x0202.
  struct Charge {
    UINT16 Command;
    UINT32 Length;
    UINT16 Dialect, Expected;
  } Charges[] = {
      {SMB2_READ, 65536, SMB2_DIALECT_210, 1},  {SMB2_READ, 65537, SMB2_DIALECT_210, 2},
      {SMB2_WRITE, 64512, SMB2_DIALECT_210, 1}, {SMB2_WRITE, 0, SMB2_DIALECT_210, 0},
      {SMB2_READ, 65537, SMB2_DIALECT_202, 0},  {SMB2_QUERY_INFO, 0, SMB2_DIALECT_202, 0}};
  for (const Charge &C : Charges) {
    EXPECT_EQ(SMB2CreditCharge(C.Command, C.Length, C.Dialect), C.Expected) << C.Length;
  }
}

TEST_F(Smb2FramingTest, TreeConnectPathLimit) {
  UINT8 *Packet = nullptr;
  UINT32 Total = 0;
  std::string Path(335, 'p');
  ASSERT_EQ(SMB2TreeConnectPacketConstruct(Path.c_str(), &TransactDetails, &Packet, &Total),
            EFI_SUCCESS);
  EXPECT_EQ(Total, 335u * 2 + 78);
  FreePool(Packet);
  Path += 'p';
  std::string Out = Console([&] {
    EXPECT_EQ(SMB2TreeConnectPacketConstruct(Path.c_str(), &TransactDetails, &Packet, &Total),
              EFI_INVALID_PARAMETER);
  });
  EXPECT_TRUE(Contains(Out, "Share name length 336 is longer than expected length 336\n"));
}

TEST_F(Smb2FramingTest, ConnectParameters) {
  char User[] = "u", Password[] = "p", Ip[] = "10.1.2.3", Path[] = "\\\\10.1.2.3\\s";
  SMB2ConnectInfo Info = {0, Ip, User, Password, nullptr};
  SMB2ShareDetails Share = {Path, 0, 0, 0, 0};
  std::string D256(256, 'd'), D257(257, 'd');
  struct Case {
    const char *Domain;
    EFI_STATUS Expected;
    const char *Message; // null: the domain is kept and the address field stays empty
  } Cases[] = {
      {"CORP", EFI_SUCCESS, nullptr},
      {"0", EFI_SUCCESS, "Domain is NULL!"}, // "0" names no domain either
      {D256.c_str(), EFI_SUCCESS, "Domain is NULL!"},
      {D257.c_str(), EFI_INVALID_PARAMETER,
       "Domain length 257 is greater isexpected length 256. Exiting!\n"},
  };
  for (const Case &C : Cases) {
    ZeroMem(&TransactDetails, sizeof(TransactDetails));
    Info.Domain = const_cast<char *>(C.Domain);
    std::string Out =
        Console([&] { EXPECT_EQ(FillShareDetails(&Info, &Share, &TransactDetails), C.Expected); });
    EXPECT_STREQ(TransactDetails.ShareDetails.DomainName, C.Message ? "" : C.Domain);
    EXPECT_STREQ(TransactDetails.ShareDetails.ServerAddress, C.Message ? "10.1.2.3" : "");
    EXPECT_TRUE(C.Message == nullptr || Contains(Out, C.Message)) << Out;
  }
  std::string Long(600, 'x');
  Info = {0, Long.data(), Long.data(), Long.data(), nullptr};
  ASSERT_EQ(FillShareDetails(&Info, &Share, &TransactDetails), EFI_SUCCESS);
  EXPECT_EQ(strlen(TransactDetails.ShareDetails.UserName), 255u);
  EXPECT_EQ(strlen(TransactDetails.ShareDetails.Password), 511u);
  EXPECT_EQ(strlen(TransactDetails.ShareDetails.ServerAddress), 45u);
  Info.Username = nullptr;
  std::string Out = Console(
      [&] { EXPECT_EQ(FillShareDetails(&Info, &Share, &TransactDetails), EFI_INVALID_PARAMETER); });
  EXPECT_TRUE(Contains(Out, "Username is NULL!\n"));
  EXPECT_STREQ(TransactDetails.ShareDetails.UserName, "");

  // A connect with a bad domain stops before any network traffic.
  Info = {0, Ip, User, Password, const_cast<char *>(D257.c_str())};
  Out = Console([&] { EXPECT_EQ(SMB2_Connect(&Info, &Share), EFI_INVALID_PARAMETER); });
  EXPECT_TRUE(Contains(Out, "FillShareDetails failed! Input details are incorrect!"));
  EXPECT_EQ(gSMB2SockFd, 0);
}

} // namespace
