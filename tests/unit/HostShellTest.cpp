// The hosted shell and the ramfs: volume: file semantics of the RAM disk,
// the mapping table, the commands the image runs (map, vol, cd, cp, del) with
// their redirections.
#include "HostImageFixture.h"
#include "HostInternal.h"

#include <cstring>
#include <memory>

namespace {

constexpr UINT64 kRead = EFI_FILE_MODE_READ;
constexpr UINT64 kReadWrite = EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE;
constexpr UINT64 kCreate = kReadWrite | EFI_FILE_MODE_CREATE;

std::string Utf8(const CHAR16 *Text) {
  return Text == nullptr ? "(null)" : HostUcs2ToUtf8(Text);
}

#pragma pack(push, 1)
struct VendorPath {
  EFI_DEVICE_PATH_PROTOCOL Vendor;
  EFI_GUID Guid;
  EFI_DEVICE_PATH_PROTOCOL End;
};
#pragma pack(pop)

VendorPath MakeVendorPath(UINT32 Tag) {
  return {{HARDWARE_DEVICE_PATH, HW_VENDOR_DP, {20, 0}},
          {Tag, 0x1111, 0x2222, {1, 2, 3, 4, 5, 6, 7, 8}},
          {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, {4, 0}}};
}

// A second volume over the RAM disk, under a device path of its own.
struct ExtraVolume {
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL Protocol;
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *Inner;
  VendorPath Path;
  EFI_HANDLE Handle = nullptr;
};
ExtraVolume *gExtra = nullptr;

EFI_STATUS EFIAPI ExtraOpenVolume(EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *, EFI_FILE_PROTOCOL **Root) {
  return gExtra->Inner->OpenVolume(gExtra->Inner, Root);
}

class HostShellTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    ASSERT_FALSE(EFI_ERROR(
        gBS->LocateProtocol(&gEfiShellProtocolGuid, nullptr, reinterpret_cast<void **>(&Shell))));
  }

  void TearDown() override {
    RemoveVolume();
    EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
    HostImageTest::TearDown();
  }

  // Runs a command line; returns Execute's status and the command's.
  std::pair<EFI_STATUS, EFI_STATUS> Run(const std::u16string &Line, std::string *Out = nullptr) {
    EFI_HANDLE Parent = HostImageHandle();
    std::u16string Copy = Line;
    EFI_STATUS Command = 0xDEAD;
    EFI_STATUS Launch = EFI_SUCCESS;
    std::string Text =
        Console([&] { Launch = Shell->Execute(&Parent, Copy.data(), nullptr, &Command); });
    if (Out != nullptr) {
      *Out = Text;
    }
    return {Launch, Command};
  }

  EFI_FILE_PROTOCOL *RamfsRoot() {
    void *Fs = nullptr;
    EXPECT_FALSE(
        EFI_ERROR(gBS->HandleProtocol(HostRamfsHandle(), &gEfiSimpleFileSystemProtocolGuid, &Fs)));
    EFI_FILE_PROTOCOL *Root = nullptr;
    auto *Sfs = static_cast<EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *>(Fs);
    EXPECT_EQ(Sfs->OpenVolume(Sfs, &Root), EFI_SUCCESS);
    return Root;
  }

  std::string HostFile(const std::string &Name) { return ReadFile(RamfsDir + "/" + Name); }
  bool HostExists(const std::string &Name) {
    return std::filesystem::exists(RamfsDir + "/" + Name);
  }
  void PutHostFile(const std::string &Name, const std::string &Data) {
    WriteFile(RamfsDir + "/" + Name, Data);
  }

  // Installs a second volume over the RAM disk.
  void InstallVolume(UINT32 Tag) {
    Extra = std::make_unique<ExtraVolume>();
    gExtra = Extra.get();
    void *Inner = nullptr;
    ASSERT_FALSE(EFI_ERROR(
        gBS->HandleProtocol(HostRamfsHandle(), &gEfiSimpleFileSystemProtocolGuid, &Inner)));
    Extra->Inner = static_cast<EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *>(Inner);
    Extra->Protocol = {EFI_SIMPLE_FILE_SYSTEM_PROTOCOL_REVISION, ExtraOpenVolume};
    Extra->Path = MakeVendorPath(Tag);
    ASSERT_EQ(gBS->InstallMultipleProtocolInterfaces(
                  &Extra->Handle, &gEfiSimpleFileSystemProtocolGuid, &Extra->Protocol,
                  &gEfiDevicePathProtocolGuid, &Extra->Path, nullptr),
              EFI_SUCCESS);
  }

  void RemoveVolume() {
    if (Extra) {
      gBS->UninstallMultipleProtocolInterfaces(Extra->Handle, &gEfiSimpleFileSystemProtocolGuid,
                                               &Extra->Protocol, &gEfiDevicePathProtocolGuid,
                                               &Extra->Path, nullptr);
      Extra.reset();
      gExtra = nullptr;
    }
  }

  std::string MapOf(const void *Path) {
    auto *Cursor = static_cast<EFI_DEVICE_PATH_PROTOCOL *>(const_cast<void *>(Path));
    return Utf8(Shell->GetMapFromDevicePath(&Cursor));
  }

  EFI_SHELL_PROTOCOL *Shell = nullptr;
  std::unique_ptr<ExtraVolume> Extra;
};

std::vector<UINT8> Info(EFI_FILE_PROTOCOL *File, const EFI_GUID &Type) {
  UINTN Size = 0;
  EXPECT_EQ(File->GetInfo(File, &Type, &Size, nullptr), EFI_BUFFER_TOO_SMALL);
  std::vector<UINT8> Buffer(Size);
  EXPECT_EQ(File->GetInfo(File, &Type, &Size, Buffer.data()), EFI_SUCCESS);
  return Buffer;
}
const EFI_FILE_INFO *AsInfo(const std::vector<UINT8> &Buffer) {
  return reinterpret_cast<const EFI_FILE_INFO *>(Buffer.data());
}

} // namespace

TEST_F(HostShellTest, RamfsFilesFollowFirmwareSemantics) {
  EFI_FILE_PROTOCOL *Root = RamfsRoot();
  EFI_FILE_PROTOCOL *Dir = nullptr;
  EFI_FILE_PROTOCOL *File = nullptr;
  ASSERT_EQ(Root->Open(Root, &Dir, u"\\Logs", kCreate, EFI_FILE_DIRECTORY), EFI_SUCCESS);
  ASSERT_EQ(Dir->Open(Dir, &File, u"Report.TXT", kCreate, 0), EFI_SUCCESS);
  std::string Data = "hello world";
  UINTN Size = Data.size();
  EXPECT_EQ(File->Write(File, &Size, Data.data()), EFI_SUCCESS);
  EXPECT_EQ(File->SetPosition(File, 6), EFI_SUCCESS);
  char Buffer[32] = {};
  Size = sizeof Buffer;
  EXPECT_EQ(File->Read(File, &Size, Buffer), EFI_SUCCESS);
  EXPECT_EQ(std::string(Buffer, Size), "world");
  UINT64 Position = 0;
  EXPECT_EQ(File->GetPosition(File, &Position), EFI_SUCCESS);
  EXPECT_EQ(Position, 11u);
  Size = sizeof Buffer; // at the end: success with nothing
  EXPECT_EQ(File->Read(File, &Size, Buffer), EFI_SUCCESS);
  EXPECT_EQ(Size, 0u);
  EXPECT_EQ(File->SetPosition(File, 20), EFI_SUCCESS);
  EXPECT_EQ(File->Read(File, &Size, Buffer), EFI_DEVICE_ERROR); // past the end
  EXPECT_EQ(File->SetPosition(File, 0xFFFFFFFFFFFFFFFFULL), EFI_SUCCESS);
  Size = 1;
  EXPECT_EQ(File->Write(File, &Size, const_cast<char *>("!")), EFI_SUCCESS);
  EXPECT_EQ(HostFile("Logs/Report.TXT"), "hello world!");

  std::vector<UINT8> Fi = Info(File, gEfiFileInfoGuid);
  EXPECT_EQ(AsInfo(Fi)->FileSize, 12u);
  EXPECT_EQ(AsInfo(Fi)->Size, SIZE_OF_EFI_FILE_INFO + 11 * sizeof(CHAR16));
  EXPECT_EQ(Utf8(AsInfo(Fi)->FileName), "Report.TXT");
  EXPECT_EQ(AsInfo(Fi)->Attribute & EFI_FILE_DIRECTORY, 0u);

  // Names match whatever their case; "." and ".." walk as in a path.
  EFI_FILE_PROTOCOL *Again = nullptr;
  ASSERT_EQ(Root->Open(Root, &Again, u"\\LOGS\\.\\..\\logs\\report.txt", kRead, 0), EFI_SUCCESS);
  Size = 5;
  EXPECT_EQ(Again->Read(Again, &Size, Buffer), EFI_SUCCESS);
  EXPECT_EQ(std::string(Buffer, Size), "hello");
  EXPECT_EQ(Again->Write(Again, &Size, Buffer), EFI_ACCESS_DENIED);
  EXPECT_EQ(Again->Close(Again), EFI_SUCCESS);

  // Size change and rename through SetInfo.
  std::vector<UINT8> Changed = Fi;
  reinterpret_cast<EFI_FILE_INFO *>(Changed.data())->FileSize = 5;
  EXPECT_EQ(File->SetInfo(File, &gEfiFileInfoGuid, Changed.size(), Changed.data()), EFI_SUCCESS);
  EXPECT_EQ(HostFile("Logs/Report.TXT"), "hello");
  std::u16string NewName = u"Moved.txt";
  Changed = NamedInfo(Fi, NewName);
  reinterpret_cast<EFI_FILE_INFO *>(Changed.data())->FileSize = 5;
  EXPECT_EQ(File->SetInfo(File, &gEfiFileInfoGuid, Changed.size(), Changed.data()), EFI_SUCCESS);
  EXPECT_TRUE(HostExists("Logs/Moved.txt"));
  EXPECT_FALSE(HostExists("Logs/Report.TXT"));

  EXPECT_EQ(Dir->Write(Dir, &Size, Buffer), EFI_UNSUPPORTED);
  EXPECT_EQ(Root->Delete(Root), EFI_WARN_DELETE_FAILURE); // the root stays, its handle goes
  EXPECT_EQ(File->Delete(File), EFI_SUCCESS);
  EXPECT_FALSE(HostExists("Logs/Moved.txt"));

  EFI_FILE_PROTOCOL *Missing = nullptr;
  Root = RamfsRoot();
  EXPECT_EQ(Root->Open(Root, &Missing, u"\\Logs\\none.txt", kRead, 0), EFI_NOT_FOUND);
  EXPECT_EQ(Root->Open(Root, &Missing, u"\\none\\x.txt", kCreate, 0), EFI_NOT_FOUND);
  EXPECT_EQ(Root->Open(Root, &Missing, u"\\Logs", EFI_FILE_MODE_WRITE, 0), EFI_INVALID_PARAMETER);
  EXPECT_EQ(Root->Open(Root, &Missing, u"\\a/..", kCreate, 0), EFI_INVALID_PARAMETER);
  EXPECT_EQ(Dir->Delete(Dir), EFI_SUCCESS); // empty again
  EXPECT_FALSE(HostExists("Logs"));
  Root->Close(Root);
}

TEST_F(HostShellTest, CopyIntoRamfsRootDirectoriesAndErrors) {
  PutHostFile("share/catalog.xml.gz", "catalog-bytes");
  PutHostFile("my dir/with space.txt", "spaced");
  std::string Out;
  auto Result = Run(u"cp -q ramfs:\\share\\catalog.xml.gz ramfs:\\", &Out);
  EXPECT_EQ(Result, std::make_pair(EFI_SUCCESS, EFI_SUCCESS)) << Out;
  EXPECT_EQ(HostFile("catalog.xml.gz"), "catalog-bytes");
  EXPECT_EQ(Out, ""); // quiet

  // Into an existing directory (no trailing separator), keeping the name.
  EXPECT_EQ(Run(u"cp \"ramfs:\\my dir\\with space.txt\" RAMFS:\\share", &Out).second, EFI_SUCCESS);
  EXPECT_EQ(HostFile("share/with space.txt"), "spaced");
  EXPECT_NE(Out.find("Copying ramfs:\\my dir\\with space.txt -> ramfs:\\share\\with space.txt"),
            std::string::npos);
  // Forward slashes separate like backslashes; a missing last directory is created.
  EXPECT_EQ(Run(u"cp -q ramfs:/share/catalog.xml.gz ramfs:/new/c.gz").second, EFI_SUCCESS);
  EXPECT_EQ(HostFile("new/c.gz"), "catalog-bytes");

  Result = Run(u"cp -q ramfs:\\share\\none.xml ramfs:\\", &Out);
  EXPECT_EQ(Result, std::make_pair(EFI_SUCCESS, EFI_NOT_FOUND));
  EXPECT_NE(Out.find("none.xml"), std::string::npos);
  EXPECT_EQ(Run(u"cp -q ramfs:\\share ramfs:\\x").second, EFI_UNSUPPORTED);
  EXPECT_EQ(Run(u"cp -q nosuch:\\a ramfs:\\").second, EFI_NOT_FOUND);
  EXPECT_EQ(Run(u"cp -q ramfs:\\share\\catalog.xml.gz").second, EFI_INVALID_PARAMETER);
  EXPECT_EQ(Run(u"cp -z a b").second, EFI_INVALID_PARAMETER);
}

TEST_F(HostShellTest, MapUpdateAliasesAndDevicePathLookups) {
  VendorPath Ramfs = MakeVendorPath(0);
  void *RamfsPath = nullptr;
  ASSERT_EQ(gBS->HandleProtocol(HostRamfsHandle(), &gEfiDevicePathProtocolGuid, &RamfsPath),
            EFI_SUCCESS);
  EXPECT_EQ(MapOf(RamfsPath), "FS0:;ramfs:");

  InstallVolume(0xA);
  EXPECT_EQ(MapOf(&Extra->Path), "(null)"); // new volumes wait for "map -u"
  std::string Out;
  EXPECT_EQ(Run(u"map -u", &Out).second, EFI_SUCCESS);
  EXPECT_NE(Out.find("FS1: VenHw(0000000A-1111-2222-0102-030405060708)"), std::string::npos);
  EXPECT_EQ(Run(u"map CIFS fs1:").second, EFI_SUCCESS);
  EFI_DEVICE_PATH_PROTOCOL *Cursor = &Extra->Path.Vendor;
  EXPECT_EQ(Utf8(Shell->GetMapFromDevicePath(&Cursor)), "FS1:;CIFS:");
  EXPECT_EQ(Cursor, &Extra->Path.End); // moved to the end node
  for (const CHAR16 *Name : {u"cifs:", u"Cifs", u"fs1"}) {
    const EFI_DEVICE_PATH_PROTOCOL *Path = Shell->GetDevicePathFromMap(Name);
    ASSERT_NE(Path, nullptr) << Utf8(Name);
    EXPECT_EQ(std::memcmp(Path, &Extra->Path, sizeof(VendorPath)), 0) << Utf8(Name);
  }
  EXPECT_EQ(Run(u"map CIFS fs9:").second, EFI_INVALID_PARAMETER);
  EXPECT_EQ(Run(u"map C*FS fs1:").second, EFI_INVALID_PARAMETER);
  EXPECT_EQ(Run(u"vol cifs:", &Out).second, EFI_SUCCESS);
  EXPECT_NE(Out.find("Volume ramfs (rw)"), std::string::npos);

  // A volume that went away loses its names; numbers are not reused.
  RemoveVolume();
  EXPECT_EQ(Run(u"map -u").second, EFI_SUCCESS);
  EXPECT_EQ(Shell->GetDevicePathFromMap(u"CIFS:"), nullptr);
  InstallVolume(0xB);
  Run(u"map -u");
  EXPECT_EQ(MapOf(&Extra->Path), "FS2:");
  EXPECT_EQ(Run(u"map -r").second, EFI_SUCCESS); // a reset numbers from 0 again
  EXPECT_EQ(MapOf(RamfsPath), "FS0:;ramfs:");
  EXPECT_EQ(MapOf(&Extra->Path), "FS1:");
  EXPECT_EQ(Run(u"map -d FS1").second, EFI_SUCCESS);
  EXPECT_EQ(MapOf(&Extra->Path), "(null)");
  EXPECT_EQ(Shell->SetMap(&Extra->Path.Vendor, u"Extra:"), EFI_SUCCESS);
  EXPECT_EQ(MapOf(&Extra->Path), "Extra:");
  EXPECT_EQ(Shell->SetMap(&Ramfs.Vendor, u"Nowhere:"), EFI_NO_MAPPING);
}

TEST_F(HostShellTest, RedirectionAndDelete) {
  std::string Out;
  EXPECT_EQ(Run(u"echo hello > ramfs:\\out.txt", &Out), std::make_pair(EFI_SUCCESS, EFI_SUCCESS));
  EXPECT_EQ(Out, "");
  EXPECT_EQ(HostFile("out.txt"), std::string("\xFF\xFEh\0e\0l\0l\0o\0\r\0\n\0", 16));
  Run(u"echo more >> ramfs:\\out.txt"); // appended, no second byte-order mark
  EXPECT_EQ(HostFile("out.txt").size(), 16u + 12u);
  Run(u"echo again > ramfs:\\out.txt"); // starts afresh
  EXPECT_EQ(HostFile("out.txt").size(), 2u + 14u);
  Run(u"echo one >a ramfs:\\a.txt");
  Run(u"echo two >>a ramfs:\\a.txt");
  EXPECT_EQ(HostFile("a.txt"), "one\r\ntwo\r\n");
  Run(u"echo \"> not a redirection\"", &Out);
  EXPECT_EQ(Out, "> not a redirection\r\n");

  // What the image runs for a report: the copy's output goes to the log.
  PutHostFile("report.zip", "zip");
  EXPECT_EQ(Run(u"cp ramfs:\\report.zip ramfs:\\copy.zip > ramfs:\\DGRLog.txt", &Out).second,
            EFI_SUCCESS);
  EXPECT_EQ(Out, "");
  EXPECT_NE(HostFile("DGRLog.txt").find(std::string("[\0o\0k\0]", 7)), std::string::npos);

  EXPECT_EQ(Run(u"echo x > nosuch:\\f.txt").first, EFI_NOT_FOUND);
  EXPECT_EQ(Run(u"echo x >").first, EFI_INVALID_PARAMETER);

  EXPECT_EQ(Run(u"del -q ramfs:\\copy.zip", &Out), std::make_pair(EFI_SUCCESS, EFI_SUCCESS));
  EXPECT_EQ(Out, "");
  EXPECT_FALSE(HostExists("copy.zip"));
  EXPECT_EQ(Run(u"del -q ramfs:\\copy.zip").second, EFI_NOT_FOUND);
  PutHostFile("full/x", "x");
  EXPECT_EQ(Run(u"del -q ramfs:\\full").second, EFI_ACCESS_DENIED);
  EXPECT_EQ(Run(u"del -q ramfs:\\").second, EFI_ACCESS_DENIED);
  EXPECT_TRUE(HostExists("full/x"));
}

TEST_F(HostShellTest, ExecuteStatusesAndCurrentDirectory) {
  std::string Out;
  EXPECT_EQ(Run(u"frobnicate now", &Out), std::make_pair(EFI_NOT_FOUND, EFI_NOT_FOUND));
  EXPECT_NE(Out.find("'frobnicate' is not recognized"), std::string::npos);
  EXPECT_EQ(Run(u"   "), std::make_pair(EFI_SUCCESS, EFI_SUCCESS));
  EXPECT_EQ(Utf8(Shell->GetEnv(u"lasterror")), "0x0");
  EXPECT_EQ(Run(u"echo \"open").first, EFI_INVALID_PARAMETER);

  EXPECT_EQ(Run(u"cd ostra1:\\Tools").second, EFI_NOT_FOUND);
  EXPECT_EQ(Utf8(Shell->GetEnv(u"lasterror")), "0xE");
  EXPECT_EQ(Shell->GetCurDir(nullptr), nullptr);
  EXPECT_EQ(Run(u"cp -q a.txt b.txt").second, EFI_NOT_FOUND); // relative, nowhere to be

  PutHostFile("Tools/a.txt", "A");
  EXPECT_EQ(Run(u"cd ramfs:\\tools").second, EFI_SUCCESS);
  EXPECT_EQ(Utf8(Shell->GetCurDir(nullptr)), "ramfs:\\tools");
  EXPECT_EQ(Utf8(Shell->GetEnv(u"cwd")), "ramfs:\\tools");
  EXPECT_EQ(Run(u"cp -q a.txt ..\\b.txt").second, EFI_SUCCESS);
  EXPECT_EQ(HostFile("b.txt"), "A");
  EXPECT_EQ(Run(u"cd ramfs:\\b.txt").second, EFI_INVALID_PARAMETER);
  EXPECT_EQ(Run(u"fs0:").second, EFI_SUCCESS);
  EXPECT_EQ(Utf8(Shell->GetCurDir(nullptr)), "FS0:\\");
  EXPECT_EQ(Utf8(Shell->GetCurDir(u"ramfs:")), "ramfs:\\tools");
}
