// The image's own commands on a shell that nests: with "nonesting" set to
// "False" the image must carry out map, vol, cd, cp and del on the calling
// shell's functions, never through Execute, so that the caller's mappings
// (ramfs:, the share's name) are the ones used and kept.
#include "ShareStandIn.h"
#include "tasks/TaskSupport.h"

#include <random>

namespace {

namespace fs = std::filesystem;

EFI_SHELL_PROTOCOL *gWrappedShell = nullptr;
decltype(EFI_SHELL_PROTOCOL::Execute) gRealExecute = nullptr;
int gExecuteCalls = 0;

EFI_STATUS EFIAPI CountingExecute(EFI_HANDLE *Parent, CHAR16 *Line, CHAR16 **Environment,
                                  EFI_STATUS *Status) {
  gExecuteCalls++;
  return gRealExecute(Parent, Line, Environment, Status);
}

class ShellBuiltinsTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    ASSERT_EQ(gBS->LocateProtocol(&gEfiShellProtocolGuid, nullptr,
                                  reinterpret_cast<void **>(&gWrappedShell)),
              EFI_SUCCESS);
    gRealExecute = gWrappedShell->Execute;
    gWrappedShell->Execute = CountingExecute;
    gExecuteCalls = 0;
    ASSERT_EQ(gWrappedShell->SetEnv(u"nonesting", u"False", TRUE), EFI_SUCCESS);
    ShareDir = RamfsDir + "/share";
    fs::create_directories(ShareDir + "/catalog");
    Console([&] {
      InitializeSystemEnv(gImageHandle, gST);
      Share.Install(u"share"); // "map -u", then the share's name and "vol"
    });
    PoolAtStart = HostPoolOutstanding();
  }

  void TearDown() override {
    EXPECT_EQ(Share.OpenHandles(), 0);
    Share.Uninstall();
    gWrappedShell->Execute = gRealExecute;
    HostImageTest::TearDown();
  }

  static EFI_STATUS Run(const CHAR16 *Line) {
    return Quiet([&] { return RunSystemCommandW(Line); });
  }

  static std::string Bytes(size_t Count, unsigned Seed) {
    std::mt19937 Random(Seed);
    std::string Text(Count, '\0');
    for (char &C : Text) {
      C = static_cast<char>(Random());
    }
    return Text;
  }

  ShareStandIn Share;
  std::string ShareDir;
};

TEST_F(ShellBuiltinsTest, MappingsAreMadeInTheCallingShell) {
  // The share got an FSn: name and its label as well, in this shell's table,
  // and ramfs: is still there.
  const EFI_DEVICE_PATH_PROTOCOL *Cifs = gWrappedShell->GetDevicePathFromMap(u"CIFS:");
  ASSERT_NE(Cifs, nullptr);
  EFI_DEVICE_PATH_PROTOCOL *Cursor = const_cast<EFI_DEVICE_PATH_PROTOCOL *>(Cifs);
  const CHAR16 *Names = gWrappedShell->GetMapFromDevicePath(&Cursor);
  ASSERT_NE(Names, nullptr);
  std::u16string All(Names);
  EXPECT_NE(All.find(u"FS"), std::u16string::npos) << std::string(All.begin(), All.end());
  EXPECT_NE(gWrappedShell->GetDevicePathFromMap(u"ramfs:"), nullptr);

  // A second refresh names nothing twice; "vol" and "cd" work on the names.
  EXPECT_EQ(Run(u"map -u"), EFI_SUCCESS);
  Cursor = const_cast<EFI_DEVICE_PATH_PROTOCOL *>(Cifs);
  EXPECT_EQ(std::u16string(gWrappedShell->GetMapFromDevicePath(&Cursor)), All);
  EXPECT_EQ(Run(u"vol CIFS:"), EFI_SUCCESS);
  EXPECT_EQ(Run(u"vol NOSUCH:"), EFI_NOT_FOUND);
  EXPECT_EQ(Run(u"cd CIFS:\\catalog"), EFI_SUCCESS);
  EXPECT_TRUE(EFI_ERROR(Run(u"map ALIAS NOSUCH:")));
  EXPECT_EQ(gExecuteCalls, 0);
}

TEST_F(ShellBuiltinsTest, CopiesAreByteIdenticalAcrossVolumes) {
  // Several copy chunks and a partial one.
  const std::string Content = Bytes(300 * 1024 + 17, 7);
  WriteFile(ShareDir + "/catalog/big.bin", Content);

  // A destination ending in '\' gets the source's name.
  EXPECT_EQ(Run(u"cp -q CIFS:\\catalog\\big.bin ramfs:\\"), EFI_SUCCESS);
  EXPECT_EQ(ReadFile(RamfsDir + "/big.bin"), Content);

  // An existing directory as destination does too; a longer existing file is
  // replaced, not overwritten in place.
  WriteFile(ShareDir + "/catalog/back.bin", Bytes(400 * 1024, 9));
  EXPECT_EQ(Run(u"cp -q ramfs:\\big.bin CIFS:\\catalog\\back.bin"), EFI_SUCCESS);
  EXPECT_EQ(ReadFile(ShareDir + "/catalog/back.bin"), Content);
  fs::create_directories(RamfsDir + "/into");
  EXPECT_EQ(Run(u"cp CIFS:\\catalog\\back.bin ramfs:\\into"), EFI_SUCCESS);
  EXPECT_EQ(ReadFile(RamfsDir + "/into/back.bin"), Content);

  // With a redirection the target receives a UCS-2 account of the copy.
  WriteFile(RamfsDir + "/DGRLog.txt", std::string(4096, 'x'));
  EXPECT_EQ(Run(u"cp -q ramfs:\\big.bin CIFS:\\log.bin > ramfs:\\DGRLog.txt"), EFI_SUCCESS);
  EXPECT_EQ(ReadFile(ShareDir + "/log.bin"), Content);
  std::string Log = ReadFile(RamfsDir + "/DGRLog.txt");
  ASSERT_GE(Log.size(), 4u);
  EXPECT_EQ(Log.substr(0, 2), std::string("\xFF\xFE", 2));
  EXPECT_LT(Log.size(), 4096u);
  EXPECT_EQ(gExecuteCalls, 0);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

TEST_F(ShellBuiltinsTest, OtherCommandsAndNonNestingShellsUseExecute) {
  // Forms the image does not carry out itself still reach the shell.
  Run(u"map -d ALIAS:");
  Run(u"cp -r CIFS:\\catalog ramfs:\\");
  Run(u"echo hello");
  EXPECT_EQ(gExecuteCalls, 3);
  // A shell that runs commands in place ("nonesting" is "True", in any case)
  // gets every command through Execute.
  ASSERT_EQ(gWrappedShell->SetEnv(u"nonesting", u"TRUE", TRUE), EFI_SUCCESS);
  WriteFile(RamfsDir + "/old.txt", "old");
  EXPECT_EQ(Run(u"del -q ramfs:\\old.txt"), EFI_SUCCESS);
  EXPECT_FALSE(fs::exists(RamfsDir + "/old.txt"));
  EXPECT_EQ(gExecuteCalls, 4);
}

} // namespace
