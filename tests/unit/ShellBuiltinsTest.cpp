// The image's own commands on a shell that nests: with "nonesting" set to
// "False" the image must carry out map, vol, cd, cp and del on the calling
// shell's functions, never through Execute, so that the caller's mappings
// (ramfs:, the share's name) are the ones used and kept.
#include "ShareStandIn.h"
#include "tasks/TaskSupport.h"

#include <random>

namespace {

namespace fs = std::filesystem;

EFI_SHELL_PROTOCOL *gShell = nullptr;
decltype(EFI_SHELL_PROTOCOL::Execute) gRealExecute = nullptr;
int gExecuteCalls = 0;

EFI_STATUS EFIAPI CountingExecute(EFI_HANDLE *Parent, CHAR16 *Line, CHAR16 **Environment,
                                  EFI_STATUS *Status) {
  gExecuteCalls++;
  return gRealExecute(Parent, Line, Environment, Status);
}

class ShellBuiltinsTest : public ShareTaskTest {
protected:
  // The share's "map -u" and "vol" at its installation run nested already.
  void BeforeInstall() override {
    ASSERT_EQ(
        gBS->LocateProtocol(&gEfiShellProtocolGuid, nullptr, reinterpret_cast<void **>(&gShell)),
        EFI_SUCCESS);
    gRealExecute = gShell->Execute;
    gShell->Execute = CountingExecute;
    gExecuteCalls = 0;
    ASSERT_EQ(gShell->SetEnv(u"nonesting", u"False", TRUE), EFI_SUCCESS);
    fs::create_directories(ShareDir + "/catalog");
  }
  void TearDown() override {
    gShell->Execute = gRealExecute;
    ShareTaskTest::TearDown();
  }

  static EFI_STATUS Run(const CHAR16 *Line) {
    return Quiet([&] { return RunSystemCommandW(Line); });
  }
};

TEST_F(ShellBuiltinsTest, MappingsAndCopiesAreMadeInTheCallingShell) {
  // The share got an FSn: name and its label in this shell's table, and
  // ramfs: is still there; a second refresh names nothing twice.
  const EFI_DEVICE_PATH_PROTOCOL *Cifs = gShell->GetDevicePathFromMap(u"CIFS:");
  ASSERT_NE(Cifs, nullptr);
  auto NamesOf = [&] {
    EFI_DEVICE_PATH_PROTOCOL *Cursor = const_cast<EFI_DEVICE_PATH_PROTOCOL *>(Cifs);
    return std::u16string(gShell->GetMapFromDevicePath(&Cursor));
  };
  std::u16string All = NamesOf();
  EXPECT_NE(All.find(u"FS"), std::u16string::npos) << std::string(All.begin(), All.end());
  EXPECT_NE(gShell->GetDevicePathFromMap(u"ramfs:"), nullptr);
  EXPECT_EQ(Run(u"map -u"), EFI_SUCCESS);
  EXPECT_EQ(NamesOf(), All);
  EXPECT_EQ(Run(u"vol CIFS:"), EFI_SUCCESS);
  EXPECT_EQ(Run(u"vol NOSUCH:"), EFI_NOT_FOUND);
  EXPECT_EQ(Run(u"cd CIFS:\\catalog"), EFI_SUCCESS);
  EXPECT_TRUE(EFI_ERROR(Run(u"map ALIAS NOSUCH:")));

  // Copies of several chunks and a partial one, byte for byte. A destination
  // ending in '\' or naming a directory gets the source's name; a longer
  // existing file is replaced, not overwritten in place.
  std::mt19937 Random(7);
  std::string Content(300 * 1024 + 17, '\0');
  for (char &C : Content) {
    C = static_cast<char>(Random());
  }
  WriteFile(ShareDir + "/catalog/big.bin", Content);
  EXPECT_EQ(Run(u"cp -q CIFS:\\catalog\\big.bin ramfs:\\"), EFI_SUCCESS);
  EXPECT_EQ(ReadFile(RamfsDir + "/big.bin"), Content);
  WriteFile(ShareDir + "/catalog/back.bin", std::string(400 * 1024, 'o'));
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
  EXPECT_EQ(Log.substr(0, 2), std::string("\xFF\xFE", 2));
  EXPECT_LT(Log.size(), 4096u);
  EXPECT_EQ(gExecuteCalls, 0);
  ExpectNoPoolLeak();
}

TEST_F(ShellBuiltinsTest, OtherCommandsAndNonNestingShellsUseExecute) {
  // Forms the image does not carry out itself still reach the shell.
  Run(u"map -d ALIAS:");
  Run(u"cp -r CIFS:\\catalog ramfs:\\");
  Run(u"echo hello");
  EXPECT_EQ(gExecuteCalls, 3);
  // A shell that runs commands in place ("nonesting" is "True", in any case)
  // gets every command through Execute.
  ASSERT_EQ(gShell->SetEnv(u"nonesting", u"TRUE", TRUE), EFI_SUCCESS);
  WriteFile(RamfsDir + "/old.txt", "old");
  EXPECT_EQ(Run(u"del -q ramfs:\\old.txt"), EFI_SUCCESS);
  EXPECT_FALSE(fs::exists(RamfsDir + "/old.txt"));
  EXPECT_EQ(gExecuteCalls, 4);
}

} // namespace
