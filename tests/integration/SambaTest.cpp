// What only a real server can show, against Samba on loopback
// (scripts/samba-test-server.sh): the connect on both dialects over IPv4 and
// IPv6, the credential cases, one connect checked by tshark's dissectors,
// and one walk through the mounted volume.
#include "HostInternal.h"
#include "NwFsDrv.h"
#include "SambaServer.h"
#include "Smb2TestEnv.h"
#include "volume/NwVolume.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

extern char **environ;

namespace {

using SambaServer::kPassword;
using SambaServer::kShare;
using SambaServer::kUser;
using SambaServer::RunShell;

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

// ---------------------------------------------------------------------------
// Wire check
// ---------------------------------------------------------------------------
class Capture {
public:
  explicit Capture(const std::string &File) : Path(File) {
    std::string Log = Path + ".log";
    std::vector<std::string> Args = {"tshark", "-i", "lo", "-f", "tcp port 445", "-w", Path};
    std::vector<char *> Argv;
    for (std::string &A : Args) {
      Argv.push_back(A.data());
    }
    Argv.push_back(nullptr);
    posix_spawn_file_actions_t Actions;
    posix_spawn_file_actions_init(&Actions);
    posix_spawn_file_actions_addopen(&Actions, 1, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addopen(&Actions, 2, Log.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (posix_spawnp(&Pid, "tshark", &Actions, nullptr, Argv.data(), environ) != 0) {
      Pid = -1;
    }
    posix_spawn_file_actions_destroy(&Actions);
    for (int I = 0; I < 100 && Pid > 0 && !Ready; I++) { // ready once it says so
      std::ifstream In(Log);
      Ready = std::string(std::istreambuf_iterator<char>(In), {}).find("Capturing on") !=
              std::string::npos;
      std::this_thread::sleep_for(std::chrono::milliseconds(Ready ? 500 : 100));
    }
  }
  ~Capture() { Stop(); }

  void Stop() {
    if (Pid <= 0) {
      return;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(300)); // the last packets
    kill(Pid, SIGINT);
    for (int I = 0; I < 100 && waitpid(Pid, nullptr, WNOHANG) != Pid; I++) {
      std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    kill(Pid, SIGKILL);
    waitpid(Pid, nullptr, 0);
    Pid = -1;
  }

  std::string Path;
  pid_t Pid = -1;
  bool Ready = false;
};

TEST_F(SambaTest, WireCheckWithTshark) {
  if (RunShell("command -v tshark") != 0) {
    GTEST_SKIP() << "tshark is not installed";
  }
  ASSERT_TRUE(SambaServer::Start("SMB2_10"));
  Use("127.0.0.1", kShare, "CIFSTEST");
  Capture Cap(Dir + "/connect.pcap");
  ASSERT_TRUE(Cap.Ready) << "tshark did not start capturing";
  ASSERT_EQ(Connect(), EFI_SUCCESS);
  // Only this connection counts: other clients may use the server meanwhile.
  sockaddr_in Local = {};
  socklen_t Size = sizeof(Local);
  ASSERT_EQ(getsockname(gSMB2SockFd, reinterpret_cast<sockaddr *>(&Local), &Size), 0);
  const std::string Ours = "tcp.port == " + std::to_string(ntohs(Local.sin_port));
  ASSERT_EQ(Disconnect(), EFI_SUCCESS);
  Cap.Stop();

  std::string Out;
  ASSERT_EQ(RunShell("tshark -r " + Cap.Path + " -Y '" + Ours +
                         " && (_ws.malformed || _ws.expert.severity >= 8388608)' -T fields "
                         "-e frame.number -e _ws.expert.message",
                     &Out),
            0);
  EXPECT_EQ(Out.find_first_of("0123456789"), std::string::npos)
      << "malformed or erroneous: " << Out;
  ASSERT_EQ(RunShell("tshark -r " + Cap.Path + " -Y '" + Ours +
                         " && smb2' -T fields -E separator=';' -e smb2.cmd -e smb2.flags.response "
                         "-e smb2.dialect -e ntlmssp.messagetype -e ntlmssp.negotiateflags "
                         "-e ntlmssp.auth.username -e ntlmssp.auth.domain -e smb2.tree",
                     &Out),
            0);
  std::vector<std::string> Lines;
  std::istringstream Stream(Out);
  for (std::string Line; std::getline(Stream, Line);) {
    if (!Line.empty() && isdigit(static_cast<unsigned char>(Line[0]))) {
      Lines.push_back(Line);
    }
  }
  ASSERT_EQ(Lines.size(), 12u) << Out;
  const char *Expected[] = {"0;0;0x0202,0x0210;",
                            "0;1;0x0210;",
                            "1;0;;0x00000001;0x20880205;",
                            "1;1;;0x00000002;",
                            "1;0;;0x00000003;0x20880205;cifstest;CIFSTEST;",
                            "1;1;;;;;;",
                            "3;0;;;;;;\\\\127.0.0.1\\cifsshare",
                            "3;1;",
                            "4;0;",
                            "4;1;",
                            "2;0;",
                            "2;1;"};
  for (size_t I = 0; I < Lines.size(); I++) {
    EXPECT_EQ(Lines[I].rfind(Expected[I], 0), 0u) << Lines[I];
  }
}

// ---------------------------------------------------------------------------
// One walk through the mounted volume
// ---------------------------------------------------------------------------
class VolumeWalkTest : public Smb2HostTest, public ::testing::WithParamInterface<const char *> {};

TEST_P(VolumeWalkTest, MountReadListWriteUnmount) {
  ASSERT_TRUE(SambaServer::Start(GetParam()));
  const std::string Local = SambaServer::ShareDir(GetParam()) + "/walk";
  std::filesystem::remove_all(Local);
  std::filesystem::create_directories(Local + "/Sub");
  std::string Data(3 * 0x100000 + 12345, '\0');
  for (size_t I = 0; I < Data.size(); I++) {
    Data[I] = static_cast<char>(I * 7 + I / 251);
  }
  WriteFile(Local + "/Sub/Data.bin", Data);
  WriteFile(Local + "/Sub/b.txt", "b");
  RunShell("chmod -R a+rwX " + Local);
  gDriverDebugLevel = 0;
  gTotalByteRead = gWriteOffset = 0;
  gNwLibInitialized = FALSE;
  ASSERT_EQ(Quiet([] {
              return MountStaticFileSystem(u"cifsshare", u"127.0.0.1", NWFS_SHARE_TYPE_CIFS,
                                           u"cifstest", u"Cifs-Test-Pw1");
            }),
            EFI_SUCCESS);
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *Sfs = nullptr;
  ASSERT_EQ(gBS->HandleProtocol(gImageHandle, &gEfiSimpleFileSystemProtocolGuid,
                                reinterpret_cast<void **>(&Sfs)),
            EFI_SUCCESS);
  EFI_FILE_PROTOCOL *Root = nullptr, *File = nullptr, *Dir = nullptr;
  ASSERT_EQ(Quiet([&] { return Sfs->OpenVolume(Sfs, &Root); }), EFI_SUCCESS);

  // The file read whole, a megabyte per Read, through folded names.
  ASSERT_EQ(Quiet([&] { return Root->Open(Root, &File, u"\\WALK\\sub\\data.BIN", 1, 0); }),
            EFI_SUCCESS);
  std::string Got, Buffer(2 * 0x100000, '\0');
  for (UINTN Size = 1; Size != 0; Got.append(Buffer, 0, Size)) {
    Size = Buffer.size();
    ASSERT_EQ(Quiet([&] { return File->Read(File, &Size, Buffer.data()); }), EFI_SUCCESS);
  }
  EXPECT_TRUE(Got == Data);
  Quiet([&] { File->Close(File); });

  // The listing, "." and ".." included.
  ASSERT_EQ(Quiet([&] { return Root->Open(Root, &Dir, u"walk\\Sub", 1, 0); }), EFI_SUCCESS);
  std::set<std::string> Names;
  for (int I = 0; I < 6; I++) {
    UINTN Size = Buffer.size();
    ASSERT_EQ(Quiet([&] { return Dir->Read(Dir, &Size, Buffer.data()); }), EFI_SUCCESS);
    const CHAR16 *Name = reinterpret_cast<EFI_FILE_INFO *>(Buffer.data())->FileName;
    Names.insert(Size == 0 ? "" : HostUcs2ToUtf8(Name));
  }
  EXPECT_EQ(Names, (std::set<std::string>{"", ".", "..", "Data.bin", "b.txt"}));

  // A new file written in several requests, read back on the server.
  ASSERT_EQ(Quiet([&] { return Dir->Open(Dir, &File, u"new.bin", EFI_FILE_MODE_CREATE | 3, 0); }),
            EFI_SUCCESS);
  UINTN Size = 200000;
  ASSERT_EQ(Quiet([&] { return File->Write(File, &Size, Data.data()); }), EFI_SUCCESS);
  EXPECT_EQ(Size, 200000u);
  Quiet([&] {
    File->Close(File);
    Dir->Close(Dir);
    Root->Close(Root);
  });
  EXPECT_TRUE(ReadFile(Local + "/Sub/new.bin") == Data.substr(0, 200000));
  EXPECT_EQ(Quiet([] { return UnmountStaticFileSystem(u"cifsshare", u"127.0.0.1"); }), EFI_SUCCESS);
  ExpectNoSocketLeak();
  ExpectNoPoolLeak();
  std::filesystem::remove_all(Local);
}

INSTANTIATE_TEST_SUITE_P(Dialects, VolumeWalkTest, ::testing::Values("SMB2_02", "SMB2_10"),
                         [](const ::testing::TestParamInfo<const char *> &P) {
                           return std::string(P.param[5] == '0' ? "Smb202" : "Smb210");
                         });

} // namespace
