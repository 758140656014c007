// The image entry and main: argument checks, the flow to the outcome record
// and the unmount on every path, and the records the entry installs.
#include "HostImageFixture.h"
#include "NwFsDrv.h"
#include "ProvisioningVars.h"

#include <stdlib.h>
#include <string.h>

namespace {

class MainTest : public HostImageTest {
protected:
  // VerifyStatus as main leaves it (the outcome record under main's GUID).
  static int VerifyStatus() {
    Variable Outcome = ReadVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid);
    if (Outcome.Status != EFI_SUCCESS || Outcome.Data.size() != 40) {
      return -1;
    }
    return Outcome.Data[0];
  }
};

TEST_F(MainTest, WrongArgumentCountIsRefusedButStillRecordedAndUnmounted) {
  for (const std::vector<std::string> &Args :
       {std::vector<std::string>{"CIFSDrv.efi", "a", "b"},
        std::vector<std::string>{"CIFSDrv.efi", "G", "s", "1.2.3.4", "u", "p", "f", "7", "8",
                                 "9"}}) {
    std::string Out;
    EXPECT_EQ(RunImage(Args, &Out), EFI_UNSUPPORTED);
    std::string Mismatch = "Mismatch in number of parameters passed! Min. = 4, Max = 9, Actual = " +
                           std::to_string(Args.size()) + "\n";
    EXPECT_NE(Out.find(Mismatch), std::string::npos) << Out;
    for (size_t Index = 0; Index < Args.size(); Index++) {
      std::string Line = "argv[" + std::to_string(Index) + "] = " + Args[Index] + "\n";
      EXPECT_EQ(Count(Out, Line + Line), 1u) << Line;
    }
    EXPECT_NE(Out.find("Parameters validation failed!"), std::string::npos);
    EXPECT_NE(Out.find("Entering UnmountStaticFileSystem"), std::string::npos);
    // Nothing after the check ran: no start-up.
    EXPECT_EQ(Out.find("Entering into IPMI Library"), std::string::npos);
    EXPECT_EQ(VerifyStatus(), 3); // EFI_UNSUPPORTED's low byte
    EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
  }
}

TEST_F(MainTest, ArgumentCheckLetsTheLastArgumentDecide) {
  std::string Long(600, 'x'), Limit(511, 'y'), Over(512, 'y');
  char Name[] = "CIFSDrv.efi", Action[] = "G", Share[] = "share", Ip[] = "127.0.0.1", Pw[] = "pw";
  struct Case {
    std::vector<char *> Argv;
    EFI_STATUS Status;
    const char *Line;
  } Cases[] = {
      {{Name, Action, Share, Ip, Long.data(), Pw}, EFI_SUCCESS, "Invalid Parameters 4\n"},
      {{Name, Action, Share, Ip, Pw, Long.data()}, EFI_INVALID_PARAMETER, "Invalid Parameters 5\n"},
      {{Name, Action, Share, Limit.data()}, EFI_SUCCESS, ""},
      {{Name, Action, Share, Over.data()}, EFI_INVALID_PARAMETER, ""},
      // A missing argument ends the check at once, even before a valid one.
      {{Name, Action, nullptr, Ip, Pw}, EFI_INVALID_PARAMETER, "Parameters 2 is NULL\n"},
  };
  for (Case &C : Cases) {
    INTN Count = static_cast<INTN>(C.Argv.size());
    C.Argv.push_back(nullptr);
    std::string Out =
        Console([&] { EXPECT_EQ(ValidateArguments(Count, C.Argv.data(), 4, 9), C.Status); });
    EXPECT_NE(Out.find(C.Line), std::string::npos) << Out;
  }
}

TEST_F(MainTest, MountFailureIsRecordedAndTheUnmountDecidesTheExitValue) {
  // The record's other bytes belong to other users and must survive.
  std::vector<UINT8> Preset(40);
  for (size_t Index = 0; Index < Preset.size(); Index++) {
    Preset[Index] = static_cast<UINT8>(0xA0 + Index);
  }
  ASSERT_EQ(WriteVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid,
                     PROVISIONING_VOLATILE_ATTRIBUTES, Preset),
            EFI_SUCCESS);
  std::string Debug = "0";
  const EFI_GUID DebugGuid = {
      0x47C7B224, 0xC42A, 0x11D2, {0x8E, 0x57, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B}};
  ASSERT_EQ(WriteVar(u"QVUIkestDebugLevel", DebugGuid, 3, {Debug.begin(), Debug.end()}),
            EFI_SUCCESS);

  std::string Out;
  EXPECT_EQ(RunImage({"CIFSDrv.efi", "m", "share", "127.0.0.1", "Export", "VML"}, &Out),
            EFI_SUCCESS);
  EXPECT_NE(Out.find("\n Entering into IPMI Library \n"), std::string::npos);
  EXPECT_NE(Out.find("Debug level is set to 0\n"), std::string::npos);
  EXPECT_NE(Out.find("SMB2 Debug level is set to 0\n"), std::string::npos);
  // Nothing serves the share, so the mount fails; its status byte is what
  // VerifyStatus must end with.
  const std::string Failed = "Mount partition failed!, Status = ";
  size_t At = Out.find(Failed);
  ASSERT_NE(At, std::string::npos) << Out;
  int MountError = atoi(Out.c_str() + At + Failed.size());
  EXPECT_NE(MountError, 0);

  Variable Outcome = ReadVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid);
  ASSERT_EQ(Outcome.Data.size(), 40u);
  EXPECT_EQ(Outcome.Attributes, PROVISIONING_VOLATILE_ATTRIBUTES);
  EXPECT_EQ(Outcome.Data[0], MountError);
  EXPECT_TRUE(std::equal(Preset.begin() + 1, Preset.end(), Outcome.Data.begin() + 1));

  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

TEST_F(MainTest, DriverBindingPublishesTheStaticMountProtocolOnce) {
  ASSERT_EQ(InstallImageProtocols(HostImageHandle()), EFI_SUCCESS);
  UINTN Count = 0;
  EFI_HANDLE *Volumes = nullptr;
  ASSERT_EQ(gBS->LocateHandleBuffer(ByProtocol, &gEfiSimpleFileSystemProtocolGuid, nullptr, &Count,
                                    &Volumes),
            EFI_SUCCESS);
  ASSERT_GE(Count, 1u);
  EFI_HANDLE Controller = Volumes[0];
  FreePool(Volumes);

  EFI_HANDLE Drivers[] = {HostImageHandle(), nullptr};
  Console([&] { gBS->ConnectController(Controller, Drivers, nullptr, FALSE); });
  void *Found = nullptr;
  ASSERT_EQ(gBS->LocateProtocol(&gStaticFSProtocolGuid, nullptr, &Found), EFI_SUCCESS);
  EXPECT_EQ(Found, &gStaticFSProtocol);
  EXPECT_EQ(SimpleFileSystemStart(&gSimpleFileSystemDriverBinding, Controller, nullptr),
            EFI_ALREADY_STARTED);

  // The unload disconnects the driver everywhere, which withdraws the protocol.
  Console([&] { UnloadSimpleFileSystemDriver(HostImageHandle()); });
  EXPECT_NE(gBS->LocateProtocol(&gStaticFSProtocolGuid, nullptr, &Found), EFI_SUCCESS);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

TEST_F(MainTest, PathTrimmingTakesWhatFollowsTheFirstVolumePrefix) {
  const CHAR16 *Path = u"ramfs:\\dir\\f.img";
  const CHAR16 *Twice = u"a:\\b:\\c";
  std::string Out = Console([&] {
    EXPECT_EQ(std::u16string(TrimVolumePrefix(Path, false)), u"dir\\f.img");
    EXPECT_EQ(std::u16string(TrimVolumePrefix(Twice, true)), u"b:\\c");
  });
  EXPECT_EQ(Out, "\nFound :\\ in the file path\n DupPath = dir\\f.img\n"
                 "\nFound :\\ in the file path\n\n DupPath = b:\\c\n");
  const CHAR16 *Plain = u"dir/f.img";
  EXPECT_EQ(TrimVolumePrefix(Plain, false), Plain);
  EXPECT_EQ(TrimVolumePrefix(nullptr, false), nullptr);
}

TEST(MainHelpers, CatalogFlagNeedsAnNfsShareWithASubdirectory) {
  EXPECT_FALSE(ComputeCatalogFlag(NWFS_SHARE_TYPE_CIFS, u"srv\\share\\dir"));
  EXPECT_TRUE(ComputeCatalogFlag(NWFS_SHARE_TYPE_NFS, u"srv\\share"));
  EXPECT_TRUE(ComputeCatalogFlag(NWFS_SHARE_TYPE_NFS, u"srv/share"));
  EXPECT_FALSE(ComputeCatalogFlag(NWFS_SHARE_TYPE_NFS, u"share/"));
  EXPECT_FALSE(ComputeCatalogFlag(NWFS_SHARE_TYPE_NFS, u"share"));
  // A backslash is looked for first, even when a slash comes earlier.
  EXPECT_FALSE(ComputeCatalogFlag(NWFS_SHARE_TYPE_NFS, u"a/b\\"));
}

} // namespace
