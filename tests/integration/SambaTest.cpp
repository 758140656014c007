// What only a real server can show, against Samba on loopback
// (scripts/samba-test-server.sh): the connect on both dialects over IPv4 and
// IPv6, and the refused credentials and shares. (The wire as tshark reads it:
// tests/e2e/run-signing.sh; whole runs through the volume: the e2e scripts.)
#include "SambaServer.h"
#include "Smb2TestEnv.h"

#include <string>

namespace {

using SambaServer::kShare;

class SambaTest : public Smb2ConnectTest {};

// ---------------------------------------------------------------------------
// Dialects and address families
// ---------------------------------------------------------------------------
struct Route {
  const char *MaxProto;
  const char *Address;
};

class SambaConnectTest : public SambaTest, public ::testing::WithParamInterface<Route> {};

TEST_P(SambaConnectTest, ConnectAndDisconnect) {
  const Route &R = GetParam();
  ASSERT_TRUE(SambaServer::Start(R.MaxProto));
  Use(R.Address, kShare, nullptr);
  std::string Out;
  ASSERT_EQ(Connect(&Out), EFI_SUCCESS) << Out;
  bool Is202 = std::string(R.MaxProto) == "SMB2_02";
  EXPECT_EQ(+TransactDetails.DialectRevision, Is202 ? 0x0202 : 0x0210);
  EXPECT_EQ(Share.MaxReadSize, Is202 ? 0x10000u : 0x800000u);
  EXPECT_EQ(+TransactDetails.ServerCapabilities, Is202 ? 0u : 6u);
  EXPECT_NE(+TransactDetails.SessionId, 0u);
  EXPECT_NE(+TransactDetails.TreeId, 0u);
  EXPECT_EQ(SMB2ConnectionState, SMB2_STATE_TREE);
  ASSERT_EQ(Disconnect(&Out), EFI_SUCCESS) << Out;
  EXPECT_EQ(gSMB2SockFd, 0);
  EXPECT_EQ(+TransactDetails.MessageId, 6u); // ids 0 to 5 went out
}

INSTANTIATE_TEST_SUITE_P(Routes, SambaConnectTest,
                         ::testing::Values(Route{"SMB2_02", "127.0.0.1"}, Route{"SMB2_02", "::1"},
                                           Route{"SMB2_10", "127.0.0.1"}, Route{"SMB2_10", "::1"}),
                         [](const ::testing::TestParamInfo<Route> &P) {
                           return std::string(P.param.MaxProto[5] == '0' ? "Smb202" : "Smb210") +
                                  (P.param.Address[0] == ':' ? "V6" : "V4");
                         });

// ---------------------------------------------------------------------------
// Credentials
// ---------------------------------------------------------------------------
TEST_F(SambaTest, RefusedCredentialsAndShares) {
  ASSERT_TRUE(SambaServer::Start("SMB2_10"));
  struct Case {
    const char *User, *Password, *ShareName;
    UINT32 ServerStatus;
    UINT32 StateAfter;
  } Cases[] = {
      {"cifstest", "not-the-password", "cifsshare", 0xC000006D, SMB2_STATE_CLOSED},
      {"nosuchuser", "Cifs-Test-Pw1", "cifsshare", 0xC000006D, SMB2_STATE_CLOSED},
      {"cifstest", "Cifs-Test-Pw1", "nosuchshare", 0xC00000CC, SMB2_STATE_SESSION},
  };
  for (const Case &C : Cases) {
    SCOPED_TRACE(std::string(C.User) + " " + C.ShareName);
    Use("127.0.0.1", C.ShareName, nullptr, C.User, C.Password);
    std::string Out;
    EXPECT_EQ(Connect(&Out), EFI_DEVICE_ERROR);
    EXPECT_EQ(Share.LastStatus, C.ServerStatus);
    EXPECT_EQ(SMB2ConnectionState, C.StateAfter);
    // The refused answer was consumed whole: the logoff after it is understood.
    EFI_STATUS Teardown = Disconnect(&Out);
    EXPECT_TRUE(C.StateAfter != SMB2_STATE_SESSION || Teardown == EFI_SUCCESS) << Out;
    EXPECT_EQ(gSMB2SockFd, 0);
  }
}

} // namespace
