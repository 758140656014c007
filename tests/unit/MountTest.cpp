// The share mount against the scripted server: what a mount installs, that
// the keep-alive timer sends nothing, what the unmount takes down, the retry
// with the share name's slashes swapped, and the driver's names. Every test
// ends with no pool block and no socket left behind.
#include "HostImageFixture.h"
#include "HostInternal.h"
#include "HostSeams.h"
#include "MockSmbServer.h"
#include "NwFsDrv.h"
#include "NwPlatform.h"
#include "volume/NWLib.h"
#include "volume/NwVolume.h"

namespace {

using namespace MockSmb;

// A loopback port nothing listens on: a server's, bound but never started.
uint16_t ClosedPort() {
  return Server().Port();
}

class MountTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    gDriverDebugLevel = 5;
    HostResetSeams();
    HostSetSocketTimeoutMs(3000);
    gNwLibInitialized = FALSE;
    gMountShareType = 0;
    // Found once and kept by the image; each test has a new environment.
    gUnicodeCollationInterface = nullptr;
    SocketsAtStart = NwOpenSocketCount();
  }

  void TearDown() override {
    HostResetSeams();
    HostImageTest::TearDown();
  }

  static NW_VOLUME *MountedVolume() {
    void *Interface = nullptr;
    if (gBS->HandleProtocol(gImageHandle, &gEfiSimpleFileSystemProtocolGuid, &Interface) !=
        EFI_SUCCESS) {
      return nullptr;
    }
    return static_cast<NW_VOLUME *>(Interface);
  }

  EFI_STATUS Mount(const CHAR16 *ShareName, std::string *Out = nullptr) {
    return Captured(Out, [&] {
      return MountStaticFileSystem(ShareName, u"127.0.0.1", NWFS_SHARE_TYPE_CIFS, u"cifstest",
                                   u"secret");
    });
  }

  EFI_STATUS Unmount() {
    return Quiet([&] { return UnmountStaticFileSystem(u"share", u"127.0.0.1"); });
  }

  void ExpectNothingLeft() {
    EXPECT_EQ(MountedVolume(), nullptr);
    EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
    EXPECT_EQ(NwOpenSocketCount(), SocketsAtStart);
    EXPECT_FALSE(gNwLibInitialized);
  }

  uint32_t SocketsAtStart = 0;
};

TEST_F(MountTest, MountInstallsTheVolumeAndUnmountTakesItAllDown) {
  Server S;
  S.ScriptConnect(0x0210).ScriptDisconnect();
  HostSetConnectPortOverride(S.Port());
  S.Start();
  ASSERT_EQ(Mount(u"share"), EFI_SUCCESS);

  NW_VOLUME *Volume = MountedVolume();
  ASSERT_NE(Volume, nullptr);
  // The record is packed: its fields are copied out before they are looked at.
  CHAR16 VolumeId[NW_VOLUME_ID_CHARS];
  memcpy(VolumeId, Volume->VolumeID, sizeof(VolumeId));
  NW_SHARE_INFO *ShareInfo = Volume->shareInfo;
  EXPECT_EQ(HostUcs2ToUtf8(VolumeId), "CIFS");
  EXPECT_STREQ(Volume->Language, "eng");
  ASSERT_NE(ShareInfo, nullptr);
  EXPECT_EQ(HostUcs2ToUtf8(ShareInfo->sharename), "share");
  EFI_EVENT KeepAlive = ShareInfo->KeepAliveEvent;
  EXPECT_NE(KeepAlive, nullptr);
  EXPECT_TRUE(gNwLibInitialized);
  // The component name answers for the mounted volume only in its language.
  CHAR16 *Name = nullptr;
  EXPECT_EQ(gSimpleFileSystemComponentName.GetControllerName(&gSimpleFileSystemComponentName,
                                                             gImageHandle, nullptr,
                                                             const_cast<CHAR8 *>("fra"), &Name),
            EFI_UNSUPPORTED);

  // The keep-alive notification sends nothing, whether the network is idle
  // or busy, and leaves the lock as it found it.
  ASSERT_EQ(gBS->SignalEvent(KeepAlive), EFI_SUCCESS);
  gBS->Stall(0);
  EXPECT_EQ(NetworkBusyLock.Busy, 0);
  ASSERT_TRUE(NwAcquireBusyLock());
  ASSERT_EQ(gBS->SignalEvent(KeepAlive), EFI_SUCCESS);
  gBS->Stall(0);
  EXPECT_EQ(NetworkBusyLock.Busy, 1);
  NwReleaseBusyLock();

  EXPECT_EQ(Unmount(), EFI_SUCCESS);
  S.Join();
  EXPECT_EQ(S.Failure(), "");
  // Negotiate, two session setups, tree connect; tree disconnect, logoff.
  EXPECT_EQ(S.Requests().size(), 6u);
  ExpectNothingLeft();
  EXPECT_EQ(gMountShareType, 0u);
}

TEST_F(MountTest, FailedConnectLeavesNothingBehindAndAllowsAnotherMount) {
  HostSetConnectPortOverride(ClosedPort());
  std::string Out;
  EFI_STATUS Status = Mount(u"share", &Out);
  EXPECT_TRUE(EFI_ERROR(Status));
  EXPECT_NE(Out.find("Couldn't Connect to the share directory, Status: 0x"), std::string::npos);
  EXPECT_EQ(MountedVolume(), nullptr);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
  EXPECT_EQ(NwOpenSocketCount(), SocketsAtStart);
  if (Status == EFI_DEVICE_ERROR) {
    EXPECT_FALSE(gNwLibInitialized); // the next mount initialises again
  }

  // The same library state serves a mount that works.
  Server S;
  S.ScriptConnect(0x0202).ScriptDisconnect();
  HostSetConnectPortOverride(S.Port());
  S.Start();
  EXPECT_EQ(Mount(u"share"), EFI_SUCCESS);
  EXPECT_NE(MountedVolume(), nullptr);
  EXPECT_EQ(Unmount(), EFI_SUCCESS);
  S.Join();
  EXPECT_EQ(S.Failure(), "");
  ExpectNothingLeft();
}

TEST_F(MountTest, FailedMountIsRetriedWithTheOtherSlashes) {
  HostSetConnectPortOverride(ClosedPort());
  struct Case {
    const CHAR16 *ShareName;
    const char *Retried;
    bool Mixed;
  };
  const Case Cases[] = {
      {u"share/sub", "shareName = share\\sub\n", false},
      {u"\\share\\sub", "shareName = /share/sub\n", false},
      {u"share/a\\b/c", "shareName = share\\a\\b\\c\n", true},
      {u"plain", "shareName = plain\n", false},
  };
  for (const Case &C : Cases) {
    std::string Name = HostUcs2ToUtf8(C.ShareName);
    SCOPED_TRACE(Name);
    EFI_STATUS Status = EFI_SUCCESS;
    std::string Out = Console([&] {
      Status = StartMountFileSystem(C.ShareName, u"127.0.0.1", NWFS_SHARE_TYPE_CIFS, u"u", u"p");
    });
    EXPECT_TRUE(EFI_ERROR(Status));
    EXPECT_NE(Out.find("MountStaticFileSystem failed! Status = 0x"), std::string::npos);
    EXPECT_NE(Out.find(". Unmounting...\n"), std::string::npos);
    EXPECT_EQ(Count(Out, "shareName = "), 2u);
    EXPECT_NE(Out.find("shareName = " + Name + "\n"), std::string::npos);
    EXPECT_NE(Out.find(C.Retried), std::string::npos) << Out;
    EXPECT_EQ(Out.find("Incorrent usage of slashes. Both '\\' and '/' are used.") !=
                  std::string::npos,
              C.Mixed);
    EXPECT_NE(Out.find("Failed to mount: " + Name + ", Status: 0x"), std::string::npos);
    EXPECT_EQ(MountedVolume(), nullptr);
    EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
    EXPECT_EQ(NwOpenSocketCount(), SocketsAtStart);
  }
  Unmount();
  ExpectNothingLeft();
}

} // namespace
