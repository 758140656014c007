// A hosted environment for the SMB2 client's tests: firmware tables for the
// pool, the connection globals reset, the host seams at their defaults (with
// a short socket time limit so a misbehaving peer ends a test quickly), and
// leak accounting for pool blocks and sockets.
#pragma once

#include "../unit/HostImageFixture.h"
#include "HostSeams.h"
#include "NwPlatform.h"
#include "smb2/SMB2Connect.h"
#include "smb2/SMB2Header.h"

#include <gtest/gtest.h>

#include <stdlib.h>

#include <string>

class Smb2HostTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    // SMB2_TEST_DEBUG=6 shows the client's whole trace while debugging.
    const char *Level = getenv("SMB2_TEST_DEBUG");
    gSMB2DebugLevel = Level != nullptr ? static_cast<UINT8>(atoi(Level)) : 0;
    HostResetSeams();
    HostSetSocketTimeoutMs(3000);
    ZeroMem(&TransactDetails, sizeof(TransactDetails));
    gSMB2SockFd = 0;
    SMB2ConnectionState = 0;
    PoolAtStart = HostPoolOutstanding();
    SocketsAtStart = NwOpenSocketCount();
  }

  void TearDown() override {
    HostResetSeams();
    HostImageTest::TearDown();
  }

  static bool Contains(const std::string &Text, const std::string &Part) {
    return Text.find(Part) != std::string::npos;
  }

  void ExpectNoPoolLeak() const { EXPECT_EQ(HostPoolOutstanding(), PoolAtStart); }
  void ExpectNoSocketLeak() const { EXPECT_EQ(NwOpenSocketCount(), SocketsAtStart); }

  uint32_t SocketsAtStart = 0;
};

// The connect parameters of one client connection, with connect and
// disconnect helpers that capture the console; a connection left open is
// closed and checked for leaks at the end of the test.
class Smb2ConnectTest : public Smb2HostTest {
protected:
  void TearDown() override {
    if (gSMB2SockFd != 0) {
      Console([&] { SMB2_Disconnect(&Info, &Share); });
    }
    ExpectNoSocketLeak();
    ExpectNoPoolLeak();
    Smb2HostTest::TearDown();
  }

  void Use(const std::string &Address, const std::string &ShareName, const char *DomainText,
           const std::string &User = "cifstest", const std::string &Password = "Cifs-Test-Pw1") {
    Ip = Address;
    Username = User;
    Secret = Password;
    Domain = DomainText == nullptr ? "" : DomainText;
    Path = "\\\\" + Address + "\\" + ShareName;
    Info = {0, Ip.data(), Username.data(), Secret.data(),
            DomainText == nullptr ? nullptr : Domain.data()};
    Share = {Path.data(), 0, 0, 0, 0};
  }

  EFI_STATUS Connect(std::string *Out = nullptr) { return Run(SMB2_Connect, Out); }
  EFI_STATUS Disconnect(std::string *Out = nullptr) { return Run(SMB2_Disconnect, Out); }

  std::string Ip, Username, Secret, Domain, Path;
  SMB2ConnectInfo Info = {};
  SMB2ShareDetails Share = {};

private:
  EFI_STATUS Run(EFI_STATUS (*Call)(SMB2ConnectInfo *, SMB2ShareDetails *), std::string *Out) {
    return Captured(Out, [&] { return Call(&Info, &Share); });
  }
};
