// Shell commands, the console capture and the volume lookup by label.
#include "HostImageFixture.h"
#include "ShellCommand.h"

#include <string.h>

namespace {

// A file-system volume of the test's own: a label, a root that only answers
// EFI_FILE_SYSTEM_INFO, and a vendor device path. It can ask for a larger
// buffer first and leave its label unterminated, as a careless driver might.
struct FakeVolume {
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL Fs; // first: the interface is the record
  EFI_FILE_PROTOCOL Root;
  CHAR16 Label[128];
  bool TerminateLabel;
  UINTN RequiredSize;
  int OpenRoots;
  struct {
    EFI_DEVICE_PATH_PROTOCOL Header;
    EFI_GUID Guid;
    EFI_DEVICE_PATH_PROTOCOL End;
  } Path;
  EFI_HANDLE Handle;
};
static_assert(offsetof(FakeVolume, Fs) == 0, "interface first");

FakeVolume *FromRoot(EFI_FILE_PROTOCOL *Root) {
  return reinterpret_cast<FakeVolume *>(reinterpret_cast<UINT8 *>(Root) -
                                        offsetof(FakeVolume, Root));
}

EFI_STATUS EFIAPI FakeGetInfo(EFI_FILE_PROTOCOL *This, const EFI_GUID *Type, UINTN *Size,
                              void *Buffer) {
  FakeVolume *Volume = FromRoot(This);
  if (!EfiGuidEqual(*Type, gEfiFileSystemInfoGuid)) {
    return EFI_UNSUPPORTED;
  }
  UINTN Chars = std::char_traits<char16_t>::length(Volume->Label);
  UINTN Needed = std::max<UINTN>(Volume->RequiredSize,
                                 SIZE_OF_EFI_FILE_SYSTEM_INFO + (Chars + 1) * sizeof(CHAR16));
  if (*Size < Needed) {
    *Size = Needed;
    return EFI_BUFFER_TOO_SMALL;
  }
  memset(Buffer, 0, Needed);
  auto *Info = static_cast<EFI_FILE_SYSTEM_INFO *>(Buffer);
  Info->Size = *Size = Needed;
  // Unterminated: the label's characters repeat to the very end.
  for (UINTN Index = 0; Index < (Needed - SIZE_OF_EFI_FILE_SYSTEM_INFO) / sizeof(CHAR16); Index++) {
    Info->VolumeLabel[Index] = !Volume->TerminateLabel ? Volume->Label[Index % Chars]
                               : Index < Chars         ? Volume->Label[Index]
                                                       : 0;
  }
  return EFI_SUCCESS;
}

class ShellCommandTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    gShellEnv2Found = FALSE;
  }
  void TearDown() override {
    for (FakeVolume *Volume : Installed) {
      gBS->UninstallMultipleProtocolInterfaces(Volume->Handle, &gEfiSimpleFileSystemProtocolGuid,
                                               &Volume->Fs, &gEfiDevicePathProtocolGuid,
                                               &Volume->Path, nullptr);
      delete Volume;
    }
    gShellEnv2Found = FALSE;
    HostImageTest::TearDown();
  }

  FakeVolume *AddVolume(const char16_t *Label, UINT32 Tag) {
    FakeVolume *Volume = new FakeVolume{};
    Volume->Fs = {EFI_SIMPLE_FILE_SYSTEM_PROTOCOL_REVISION,
                  [](EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *This, EFI_FILE_PROTOCOL **Root) {
                    reinterpret_cast<FakeVolume *>(This)->OpenRoots++;
                    *Root = &reinterpret_cast<FakeVolume *>(This)->Root;
                    return EFI_SUCCESS;
                  }};
    Volume->Root.Revision = EFI_FILE_PROTOCOL_REVISION;
    Volume->Root.Open = [](EFI_FILE_PROTOCOL *, EFI_FILE_PROTOCOL **, const CHAR16 *, UINT64,
                           UINT64) -> EFI_STATUS { return EFI_NOT_FOUND; };
    Volume->Root.Close = [](EFI_FILE_PROTOCOL *This) -> EFI_STATUS {
      FromRoot(This)->OpenRoots--;
      return EFI_SUCCESS;
    };
    Volume->Root.GetInfo = FakeGetInfo;
    std::char_traits<char16_t>::copy(Volume->Label, Label,
                                     std::char_traits<char16_t>::length(Label) + 1);
    Volume->TerminateLabel = true;
    Volume->Path = {{HARDWARE_DEVICE_PATH, HW_VENDOR_DP, {20, 0}},
                    {Tag, 0x1234, 0x5678, {1, 2, 3, 4, 5, 6, 7, 8}},
                    {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, {4, 0}}};
    EXPECT_EQ(gBS->InstallMultipleProtocolInterfaces(
                  &Volume->Handle, &gEfiSimpleFileSystemProtocolGuid, &Volume->Fs,
                  &gEfiDevicePathProtocolGuid, &Volume->Path, nullptr),
              EFI_SUCCESS);
    Installed.push_back(Volume);
    return Volume;
  }

  static std::u16string Lookup(const char16_t *Wanted, std::string *Out = nullptr) {
    CHAR16 DriveName[NWFS_DRIVE_NAME_CHARS] = {};
    std::string Text = Console([&] { GetFS_OLD_NWFS(Wanted, DriveName, NWFS_DRIVE_NAME_CHARS); });
    if (Out != nullptr) {
      *Out = Text;
    }
    return DriveName;
  }

  static void Bind() {
    Console([] { ASSERT_EQ(InitializeSystemEnv(gImageHandle, gST), EFI_SUCCESS); });
  }

  std::vector<FakeVolume *> Installed;
};

TEST_F(ShellCommandTest, ExecuteReportsTheCommandsOwnStatus) {
  Bind();
  EXPECT_TRUE(gShellEnv2Found);
  std::string Out = Console([] { EXPECT_EQ(ExecuteShellCommand(u"map -u"), EFI_SUCCESS); });
  EXPECT_NE(Out.find("\nCommand Success: ..\n"), std::string::npos);
  Out = Console([] { EXPECT_TRUE(EFI_ERROR(ExecuteShellCommand(u"del -q ramfs:\\missing.txt"))); });
  EXPECT_NE(Out.find("\nCommand Failed: Status = "), std::string::npos);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

TEST_F(ShellCommandTest, CaptureTakesConsoleAndErrorOutputAndRestoresThem) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *ConOut = gST->ConOut;
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *StdErr = gST->StdErr;
  CHAR16 *Text = nullptr;
  std::string Host = Console([&] {
    ASSERT_EQ(ConsoleCaptureBegin(), EFI_SUCCESS);
    EXPECT_EQ(ConsoleCaptureBegin(), EFI_ALREADY_STARTED);
    DiagLog(DIAG_ALWAYS, "to the console ");
    gST->StdErr->OutputString(gST->StdErr, u"and to errors ");
    RunShellCommand(u"vol ramfs:");
    Text = ConsoleCaptureEnd();
  });
  EXPECT_EQ(Host, "");
  EXPECT_EQ(gST->ConOut, ConOut);
  EXPECT_EQ(gST->StdErr, StdErr);
  ASSERT_NE(Text, nullptr);
  std::u16string Captured = Text;
  FreePool(Text);
  EXPECT_EQ(Captured.rfind(u"to the console and to errors ", 0), 0u);
  EXPECT_NE(Captured.find(u"ramfs"), std::u16string::npos);
  EXPECT_EQ(ConsoleCaptureEnd(), nullptr);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);

  EFI_SYSTEM_TABLE *Saved = gST;
  gST = nullptr;
  EXPECT_EQ(ConsoleCaptureBegin(), EFI_UNSUPPORTED);
  gST = Saved;
}

TEST_F(ShellCommandTest, LookupComparesTheFirstSixCharactersOfTheLabel) {
  Bind();
  RefreshShellMappings();
  EXPECT_EQ(Lookup(u"ramfs"), u"ramfs");
  EXPECT_EQ(Lookup(u"ramfsX"), u""); // the sixth character differs from the end
  FakeVolume *Data = AddVolume(u"MYDATA-VOLUME", 0xD0);
  RefreshShellMappings();
  // The lookup's own lines carry no level; only its entry trace does.
  gDriverDebugLevel = 0;
  std::string Out;
  EXPECT_EQ(Lookup(u"MYDATA", &Out), u"MYDATA");
  EXPECT_NE(Out.find("partitionLabel = MYDATA-VOLUME\nvolumeName = MYDATA\n"), std::string::npos);
  EXPECT_NE(Out.find("Mapping successful. Copying volumeName: MYDATA to driveName: MYDATA.\n"),
            std::string::npos);
  EXPECT_NE(Out.find("Exiting from GetFS_OLD_NWFS function \n"), std::string::npos);
  // The shell name is printed alone, without its ':' or the shell's other names.
  EFI_DEVICE_PATH_PROTOCOL *Cursor = &Data->Path.Header;
  std::u16string Names = gShellEnv2->GetMapFromDevicePath(&Cursor);
  std::u16string First = Names.substr(0, Names.find(u':'));
  EXPECT_NE(Out.find("FSName: " + std::string(First.begin(), First.end()) + "\n"),
            std::string::npos)
      << Out;
  EXPECT_EQ(Out.find("Entered"), std::string::npos);
  EXPECT_EQ(Data->OpenRoots, 0);
  EXPECT_NE(gShellEnv2->GetDevicePathFromMap(u"MYDATA:"), nullptr);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

TEST_F(ShellCommandTest, PartitionTableLabelsGetTheirFixedNames) {
  Bind();
  FakeVolume *Tools = AddVolume(u"OSTRA1-TOOLS", 0x01);
  RefreshShellMappings();
  std::string Out;
  EXPECT_EQ(Lookup(u"OSTRA1", &Out), u"ostra1");
  const EFI_DEVICE_PATH_PROTOCOL *Mapped = gShellEnv2->GetDevicePathFromMap(u"ostra1:");
  ASSERT_NE(Mapped, nullptr);
  EXPECT_EQ(memcmp(Mapped, &Tools->Path, sizeof(Tools->Path)), 0);
  EXPECT_EQ(Out.find("Did not map"), std::string::npos);

  // A later row: every row before it is reported, none after it.
  AddVolume(u"DIAGNS", 0x04);
  RefreshShellMappings();
  EXPECT_EQ(Lookup(u"DIAGNS", &Out), u"diags");
  EXPECT_NE(Out.find("Did not map, wrong partition name: OSTRA1\n"), std::string::npos);
  EXPECT_NE(Out.find("Did not map, wrong partition name: OSTRA2\n"), std::string::npos);
  EXPECT_EQ(Out.find("Did not map, wrong partition name: SVCPCK"), std::string::npos);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

TEST_F(ShellCommandTest, LongOrCarelessLabelsAreReadWithinTheirBuffer) {
  Bind();
  FakeVolume *Careless = AddVolume(u"ABCDEFGHIJKLMNOPQRSTUVWXYZ", 0x02);
  Careless->TerminateLabel = false;
  Careless->RequiredSize = 301; // asks for a second read, and an odd size
  RefreshShellMappings();
  std::string Out;
  // A wanted name of 20 characters or more is mapped but the shell's own
  // name is handed back.
  std::u16string Drive = Lookup(u"ABCDEFGHIJKLMNOPQRSTUVWX", &Out);
  EFI_DEVICE_PATH_PROTOCOL *Cursor = &Careless->Path.Header;
  std::u16string Names = gShellEnv2->GetMapFromDevicePath(&Cursor);
  EXPECT_EQ(Names.substr(0, Names.find(u':')), Drive) << Out;
  EXPECT_NE(Out.find("RootFs->GetInfo return Buffer small"), std::string::npos);
  EXPECT_NE(Out.find("partitionLabel = ABCDEFGHIJKLMNOPQRST\n"), std::string::npos);
  EXPECT_EQ(Careless->OpenRoots, 0);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

} // namespace
