// The network volume against a real Samba share on loopback, used the way
// firmware code uses it: the network library connects, the volume is
// installed on the image handle, and from then on only
// EFI_SIMPLE_FILE_SYSTEM_PROTOCOL and EFI_FILE_PROTOCOL are called (plus
// the hosted shell's cp, which is itself a user of those protocols).
#include "NwFsDrv.h"
#include "SambaServer.h"
#include "Smb2TestEnv.h"
#include "smb2/SMB2FileAccess.h"
#include "volume/NwVolume.h"

#include <sys/stat.h>

#include <algorithm>
#include <fstream>
#include <random>
#include <string>
#include <vector>

namespace {

using SambaServer::kPassword;
using SambaServer::kShare;
using SambaServer::kUser;
using SambaServer::RunShell;
const std::string kShareDir = SambaServer::ShareDir("SMB2_10");

constexpr UINT64 kRead = EFI_FILE_MODE_READ;
constexpr UINT64 kReadWrite = EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE;
constexpr UINT64 kCreate = EFI_FILE_MODE_CREATE | kReadWrite;
constexpr UINTN kMiB = 0x100000;

std::vector<UINT8> RandomBytes(size_t Size, unsigned Seed) {
  std::mt19937 Engine(Seed);
  std::vector<UINT8> Data(Size);
  for (UINT8 &B : Data) {
    B = static_cast<UINT8>(Engine());
  }
  return Data;
}

std::u16string U16(const std::string &Text) {
  return std::u16string(Text.begin(), Text.end());
}

template <typename T>
T Val(T Value) {
  return Value;
}

class NwVolumeSambaTest : public Smb2HostTest {
protected:
  void SetUp() override {
    Smb2HostTest::SetUp();
    ASSERT_TRUE(SambaServer::Start("SMB2_10"));
    Remote = std::string("vol-") + ::testing::UnitTest::GetInstance()->current_test_info()->name();
    Local = kShareDir + "/" + Remote;
    std::filesystem::remove_all(Local);
    MakeDir("");
    // Each test is a fresh run of the program as far as the transfer
    // offsets are concerned.
    gTotalByteRead = 0;
    gWriteOffset = 0;
    gDirReadIndex = 0;
    gDirRewind = 0;
    gDirFirstReadDone = 0;
    gDriverDebugLevel = 0;
    Mount();
  }

  void TearDown() override {
    if (Volume != nullptr) {
      Quiet([&] { EXPECT_EQ(RemoveInstalledVolume(Volume), EFI_SUCCESS); });
    }
    if (Share != nullptr) {
      Quiet([&] {
        GEE_NWFSDisconnect(Share, nullptr);
        GEE_NWDeInit(NW_SHARE_TYPE_CIFS);
      });
      FreePool(Share->sharename);
      FreePool(Share);
    }
    if (DevicePathInstalled) {
      gBS->UninstallProtocolInterface(gImageHandle, &gEfiDevicePathProtocolGuid,
                                      &gNwFsImageDevicePath);
    }
    ExpectNoSocketLeak();
    ExpectNoPoolLeak();
    std::filesystem::remove_all(Local);
    Smb2HostTest::TearDown();
  }

  // What the mount does: initialise, connect, install the volume (on the
  // image handle, which carries the image's device path so that the shell
  // can map the volume).
  void Mount() {
    Share = static_cast<NW_SHARE_INFO *>(AllocateZeroPool(sizeof(NW_SHARE_INFO)));
    ASSERT_NE(Share, nullptr);
    Share->sharename = StrDup(U16(kShare).c_str());
    Share->shareType = NW_SHARE_TYPE_CIFS;
    std::u16string Ip = u"127.0.0.1", User = U16(kUser), Pass = U16(kPassword);
    NW_CONNECTION_PARAMS Params = {};
    Params.ipAddress = Ip.data();
    Params.username = User.data();
    Params.password = Pass.data();
    EFI_STATUS Status = EFI_SUCCESS;
    // A server restarted under another configuration in the meantime is
    // brought back once.
    for (int Attempt = 0; Attempt < 2; Attempt++) {
      Quiet([&] {
        Status = GEE_NWInit(gImageHandle, gST, NW_SHARE_TYPE_CIFS);
        if (!EFI_ERROR(Status)) {
          Status = GEE_NWFSConnect(&Params, Share);
        }
      });
      if (!EFI_ERROR(Status)) {
        break;
      }
      ASSERT_TRUE(SambaServer::Start("SMB2_10"));
    }
    ASSERT_EQ(Status, EFI_SUCCESS);
    ASSERT_EQ(gBS->InstallProtocolInterface(&gImageHandle, &gEfiDevicePathProtocolGuid,
                                            EFI_NATIVE_INTERFACE, &gNwFsImageDevicePath),
              EFI_SUCCESS);
    DevicePathInstalled = true;
    Quiet([&] {
      Status =
          DetectInstallVolume(gImageHandle, "eng", Share, Ip.c_str(), User.c_str(), Pass.c_str());
    });
    ASSERT_EQ(Status, EFI_SUCCESS);
    void *Interface = nullptr;
    ASSERT_EQ(gBS->HandleProtocol(gImageHandle, &gEfiSimpleFileSystemProtocolGuid, &Interface),
              EFI_SUCCESS);
    Sfs = static_cast<EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *>(Interface);
    Volume = static_cast<NW_VOLUME *>(Interface);
  }

  // Files in the test's directory on the server, written and read directly.
  void MakeDir(const std::string &Relative) {
    std::string Path = Local + (Relative.empty() ? "" : "/" + Relative);
    std::filesystem::create_directories(Path);
    chmod(Path.c_str(), 0777);
  }
  void PutFile(const std::string &Relative, const std::vector<UINT8> &Data, mode_t Mode = 0666) {
    std::string Path = Local + "/" + Relative;
    std::ofstream(Path, std::ios::binary)
        .write(reinterpret_cast<const char *>(Data.data()), Data.size());
    chmod(Path.c_str(), Mode);
  }
  std::vector<UINT8> GetFile(const std::string &Relative) {
    return ReadBytes(Local + "/" + Relative);
  }
  bool Exists(const std::string &Relative) {
    return std::filesystem::exists(Local + "/" + Relative);
  }
  // The test directory's path on the volume, with a further part.
  std::u16string At(const std::string &Relative = "") {
    return U16("\\" + Remote + (Relative.empty() ? "" : "\\" + Relative));
  }

  EFI_FILE_PROTOCOL *OpenRoot() {
    EFI_FILE_PROTOCOL *Root = nullptr;
    EXPECT_EQ(Quiet([&] { return Sfs->OpenVolume(Sfs, &Root); }), EFI_SUCCESS);
    return Root;
  }
  EFI_STATUS Open(EFI_FILE_PROTOCOL *From, const std::u16string &Path, EFI_FILE_PROTOCOL **File,
                  UINT64 Mode = kRead, UINT64 Attributes = 0) {
    return Quiet([&] { return From->Open(From, File, Path.c_str(), Mode, Attributes); });
  }
  EFI_STATUS Read(EFI_FILE_PROTOCOL *File, UINTN *Size, void *Buffer) {
    return Quiet([&] { return File->Read(File, Size, Buffer); });
  }
  EFI_STATUS Write(EFI_FILE_PROTOCOL *File, const std::vector<UINT8> &Data, UINTN *Size) {
    *Size = Data.size();
    return Quiet([&] { return File->Write(File, Size, const_cast<UINT8 *>(Data.data())); });
  }
  void Close(EFI_FILE_PROTOCOL *File) {
    Quiet([&] { File->Close(File); });
  }
  std::vector<UINT8> Info(EFI_FILE_PROTOCOL *File, const EFI_GUID &Type, EFI_STATUS *Status,
                          UINTN *Needed = nullptr) {
    UINTN Size = 0;
    *Status = Quiet([&] { return File->GetInfo(File, &Type, &Size, nullptr); });
    if (Needed != nullptr) {
      *Needed = Size;
    }
    std::vector<UINT8> Buffer(Size);
    if (*Status == EFI_BUFFER_TOO_SMALL) {
      *Status = Quiet([&] { return File->GetInfo(File, &Type, &Size, Buffer.data()); });
    }
    Buffer.resize(*Status == EFI_SUCCESS ? Size : 0);
    return Buffer;
  }
  // Names from directory Reads until one returns nothing (at most Limit).
  std::vector<std::u16string> List(EFI_FILE_PROTOCOL *Directory, size_t Limit = 200) {
    std::vector<std::u16string> Names;
    std::vector<UINT8> Buffer(1024);
    for (size_t I = 0; I < Limit; I++) {
      UINTN Size = Buffer.size();
      EXPECT_EQ(Read(Directory, &Size, Buffer.data()), EFI_SUCCESS);
      if (Size == 0) {
        break;
      }
      Names.push_back(reinterpret_cast<EFI_FILE_INFO *>(Buffer.data())->FileName);
    }
    return Names;
  }

  // Runs one command line through the hosted shell; it must succeed.
  void Shell(const std::u16string &Line) {
    EFI_SHELL_PROTOCOL *Protocol = nullptr;
    ASSERT_EQ(
        gBS->LocateProtocol(&gEfiShellProtocolGuid, nullptr, reinterpret_cast<void **>(&Protocol)),
        EFI_SUCCESS);
    EFI_STATUS CommandStatus = EFI_DEVICE_ERROR;
    std::u16string Copy = Line;
    std::string Text = Console([&] {
      EXPECT_EQ(Protocol->Execute(&gImageHandle, Copy.data(), nullptr, &CommandStatus),
                EFI_SUCCESS);
    });
    EXPECT_EQ(CommandStatus, EFI_SUCCESS) << Text;
  }
  // Refreshes the shell's mappings and returns the volume's shell name
  // ("fsN:"), empty when the shell does not know it.
  std::u16string MapVolume() {
    Shell(u"map -u");
    EFI_SHELL_PROTOCOL *Protocol = nullptr;
    gBS->LocateProtocol(&gEfiShellProtocolGuid, nullptr, reinterpret_cast<void **>(&Protocol));
    EFI_DEVICE_PATH_PROTOCOL *Path = &gNwFsImageDevicePath.Vendor.Header;
    const CHAR16 *Names = Protocol == nullptr ? nullptr : Protocol->GetMapFromDevicePath(&Path);
    if (Names == nullptr) {
      return u"";
    }
    std::u16string Drive = Names;
    Drive = Drive.substr(0, Drive.find(u';'));
    if (!Drive.empty() && Drive.back() != u':') {
      Drive += u':';
    }
    return Drive;
  }

  std::vector<SMB2_REQUEST_TRACE> RequestsSince(UINT64 Count, UINT16 Command) {
    std::vector<SMB2_REQUEST_TRACE> Out;
    for (UINT64 I = Count; I < gSMB2RequestCount; I++) {
      const SMB2_REQUEST_TRACE &Slot = gSMB2RequestTrace[I % SMB2_REQUEST_TRACE_SLOTS];
      if (Slot.Command == Command) {
        Out.push_back(Slot);
      }
    }
    return Out;
  }

  std::string Remote;
  std::string Local;
  NW_SHARE_INFO *Share = nullptr;
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *Sfs = nullptr;
  NW_VOLUME *Volume = nullptr;
  bool DevicePathInstalled = false;
};

// ---------------------------------------------------------------------------
// Volume
// ---------------------------------------------------------------------------
TEST_F(NwVolumeSambaTest, OpenVolumeTwiceSharesTheRootAndBuildsTheLabelOnce) {
  EFI_FILE_PROTOCOL *First = OpenRoot();
  ASSERT_NE(First, nullptr);
  NW_OPEN_FILE *Root = NwHandleOf(First)->OpenFile;
  EXPECT_EQ(Val(Root->HandleCount), 1);
  // The label has no number, and a fresh volume's size field says "KB".
  EXPECT_EQ(std::u16string(Volume->VolumeLabel), u"File System [KB]");
  EXPECT_GT(Val(Volume->TotalSize), 0u);
  EFI_FILE_PROTOCOL *Second = OpenRoot();
  ASSERT_NE(Second, nullptr);
  EXPECT_NE(Second, First);
  EXPECT_EQ(NwHandleOf(Second)->OpenFile, Root);
  EXPECT_EQ(Val(Root->HandleCount), 2);
  EXPECT_EQ(std::u16string(Volume->VolumeLabel), u"File System [KB]");

  EFI_STATUS Status;
  std::vector<UINT8> Fs = Info(First, gEfiFileSystemInfoGuid, &Status);
  ASSERT_EQ(Status, EFI_SUCCESS);
  auto *FsInfo = reinterpret_cast<EFI_FILE_SYSTEM_INFO *>(Fs.data());
  EXPECT_EQ(Fs.size(), 46u);
  EXPECT_EQ(Val(FsInfo->VolumeSize), Val(Volume->TotalSize));
  EXPECT_GT(Val(FsInfo->BlockSize), 0u);
  EXPECT_EQ(std::u16string(FsInfo->VolumeLabel), u"CIFS");
  UINTN Needed = 0;
  std::vector<UINT8> Label = Info(First, gEfiFileSystemVolumeLabelInfoIdGuid, &Status, &Needed);
  EXPECT_EQ(Needed, 10u);
  EXPECT_EQ(std::u16string(reinterpret_cast<CHAR16 *>(Label.data())), u"CIFS");
  Close(Second);
  EXPECT_EQ(Val(Root->HandleCount), 1);
  Close(First);
}

// ---------------------------------------------------------------------------
// Open
// ---------------------------------------------------------------------------
TEST_F(NwVolumeSambaTest, OpensByAbsoluteRelativeDottedAndFoldedPaths) {
  MakeDir("Dir1/Sub");
  PutFile("Dir1/Sub/Deep.txt", {'d', 'e', 'e', 'p'});
  PutFile("Dir1/a.txt", {'a'});
  EFI_FILE_PROTOCOL *Root = OpenRoot();
  struct Case {
    std::u16string Path;
    std::u16string Name; // as the file information reports it
  } Cases[] = {
      {At("Dir1\\Sub\\Deep.txt"), u"Deep.txt"},
      {At("DIR1\\sub\\deep.TXT"), u"Deep.txt"},
      {At("Dir1\\.\\Sub\\..\\a.txt"), u"a.txt"},
      {U16(Remote) + u"\\Dir1\\Sub\\..\\..\\Dir1\\a.txt", u"a.txt"},
      {At("Dir1\\Sub\\"), u"Sub"}, // the trailing backslash is dropped
  };
  for (const Case &C : Cases) {
    EFI_FILE_PROTOCOL *File = nullptr;
    ASSERT_EQ(Open(Root, C.Path, &File), EFI_SUCCESS) << std::string(C.Path.begin(), C.Path.end());
    EFI_STATUS Status;
    std::vector<UINT8> FileInfo = Info(File, gEfiFileInfoGuid, &Status);
    ASSERT_EQ(Status, EFI_SUCCESS);
    EXPECT_EQ(std::u16string(reinterpret_cast<EFI_FILE_INFO *>(FileInfo.data())->FileName), C.Name);
    Close(File);
  }
  // Relative to a directory handle.
  EFI_FILE_PROTOCOL *Dir = nullptr, *File = nullptr;
  ASSERT_EQ(Open(Root, At("Dir1"), &Dir), EFI_SUCCESS);
  ASSERT_EQ(Open(Dir, u"Sub\\Deep.txt", &File), EFI_SUCCESS);
  std::vector<UINT8> Data(16);
  UINTN Size = Data.size();
  ASSERT_EQ(Read(File, &Size, Data.data()), EFI_SUCCESS);
  EXPECT_EQ(std::string(Data.begin(), Data.begin() + Size), "deep");
  Close(File);
  Close(Dir);
  Close(Root);
}

TEST_F(NwVolumeSambaTest, MissingNamesLongPathsAndCreateMode) {
  MakeDir("Dir1");
  EFI_FILE_PROTOCOL *Root = OpenRoot();
  EFI_FILE_PROTOCOL *File = nullptr;
  EXPECT_EQ(Open(Root, At("Dir1\\missing.txt"), &File), EFI_NOT_FOUND);
  EXPECT_EQ(Open(Root, At("nodir\\x.txt"), &File, kCreate), EFI_NOT_FOUND);
  EXPECT_EQ(Open(Root, At("Dir1\\") + std::u16string(261, u'n'), &File, kCreate), EFI_NOT_FOUND);
  EXPECT_EQ(Open(Root, At("Dir1"), &File, kRead, 0x80), EFI_NOT_FOUND);

  ASSERT_EQ(Open(Root, At("Dir1\\new.txt"), &File, kCreate), EFI_SUCCESS);
  EXPECT_TRUE(Exists("Dir1/new.txt")); // the create reaches the server
  EXPECT_EQ(GetFile("Dir1/new.txt").size(), 0u);
  Close(File);
  // A directory is created locally only.
  ASSERT_EQ(Open(Root, At("Dir1\\NewDir"), &File, kCreate, EFI_FILE_DIRECTORY), EFI_SUCCESS);
  EXPECT_FALSE(Exists("Dir1/NewDir"));
  EXPECT_EQ(List(File), (std::vector<std::u16string>{u".", u".", u".."}));
  Close(File);
  Close(Root);
}

// ---------------------------------------------------------------------------
// Read and write
// ---------------------------------------------------------------------------
TEST_F(NwVolumeSambaTest, ReadReturnsAtMostOneMiBPerCallAndMatchesTheServer) {
  std::vector<UINT8> Data = RandomBytes(3 * kMiB, 3);
  PutFile("three.bin", Data);
  EFI_FILE_PROTOCOL *Root = OpenRoot();
  EFI_FILE_PROTOCOL *File = nullptr;
  ASSERT_EQ(Open(Root, At("three.bin"), &File), EFI_SUCCESS);
  std::vector<UINT8> Got, Buffer(2 * kMiB);
  std::vector<UINTN> Sizes;
  for (int I = 0; I < 6; I++) {
    UINTN Size = Buffer.size();
    ASSERT_EQ(Read(File, &Size, Buffer.data()), EFI_SUCCESS);
    Sizes.push_back(Size);
    Got.insert(Got.end(), Buffer.begin(), Buffer.begin() + Size);
    if (Size == 0) {
      break;
    }
  }
  EXPECT_EQ(Sizes, (std::vector<UINTN>{kMiB, kMiB, kMiB, 0}));
  EXPECT_TRUE(Got == Data);
  // At the end of the file Read keeps answering success with nothing.
  UINTN Size = Buffer.size();
  EXPECT_EQ(Read(File, &Size, Buffer.data()), EFI_SUCCESS);
  EXPECT_EQ(Size, 0u);
  // Close and reopen: reading starts at offset 0 again.
  Close(File);
  ASSERT_EQ(Open(Root, At("three.bin"), &File), EFI_SUCCESS);
  Size = 4096;
  ASSERT_EQ(Read(File, &Size, Buffer.data()), EFI_SUCCESS);
  ASSERT_EQ(Size, 4096u);
  EXPECT_TRUE(std::equal(Buffer.begin(), Buffer.begin() + 4096, Data.begin()));
  // A position set on a file does not move the reads.
  Quiet([&] { EXPECT_EQ(File->SetPosition(File, 5), EFI_SUCCESS); });
  Size = 16;
  ASSERT_EQ(Read(File, &Size, Buffer.data()), EFI_SUCCESS);
  EXPECT_TRUE(std::equal(Buffer.begin(), Buffer.begin() + 16, Data.begin() + 4096));
  Close(File);
  Close(Root);
}

TEST_F(NwVolumeSambaTest, WritesGoOutInRequestsOf64512AtTheProcessWideOffset) {
  std::vector<UINT8> Whole = RandomBytes(64512 + 64513, 9);
  std::vector<UINT8> First(Whole.begin(), Whole.begin() + 64512);
  std::vector<UINT8> Second(Whole.begin() + 64512, Whole.end());
  EFI_FILE_PROTOCOL *Root = OpenRoot();
  EFI_FILE_PROTOCOL *File = nullptr;
  ASSERT_EQ(Open(Root, At("w.bin"), &File, kCreate), EFI_SUCCESS);

  UINT64 Before = gSMB2RequestCount;
  UINTN Size = 0;
  ASSERT_EQ(Write(File, First, &Size), EFI_SUCCESS);
  EXPECT_EQ(Size, 64512u);
  std::vector<SMB2_REQUEST_TRACE> Writes = RequestsSince(Before, SMB2_WRITE);
  ASSERT_EQ(Writes.size(), 1u);
  EXPECT_EQ(Writes[0].Length, 64512u);
  EXPECT_EQ(Writes[0].Offset, 0u);

  Before = gSMB2RequestCount;
  ASSERT_EQ(Write(File, Second, &Size), EFI_SUCCESS);
  EXPECT_EQ(Size, 64513u);
  Writes = RequestsSince(Before, SMB2_WRITE);
  ASSERT_EQ(Writes.size(), 2u);
  EXPECT_EQ(Writes[0].Length, 64512u);
  EXPECT_EQ(Writes[0].Offset, 64512u);
  EXPECT_EQ(Writes[1].Length, 1u);
  EXPECT_EQ(Writes[1].Offset, 129024u);
  EXPECT_EQ(gWriteOffset, 129025u);
  Close(File);
  EXPECT_TRUE(GetFile("w.bin") == Whole);

  // The offset is never reset: a second file continues where the first ended.
  ASSERT_EQ(Open(Root, At("w2.bin"), &File, kCreate), EFI_SUCCESS);
  ASSERT_EQ(Write(File, {'x'}, &Size), EFI_SUCCESS);
  Close(File);
  std::vector<UINT8> Second2 = GetFile("w2.bin");
  ASSERT_EQ(Second2.size(), 129026u);
  EXPECT_EQ(Second2.back(), 'x');
  // A directory handle takes writes and writes nothing.
  EFI_FILE_PROTOCOL *Dir = nullptr;
  ASSERT_EQ(Open(Root, At(), &Dir), EFI_SUCCESS);
  Before = gSMB2RequestCount;
  ASSERT_EQ(Write(Dir, First, &Size), EFI_SUCCESS);
  EXPECT_EQ(Size, First.size());
  EXPECT_TRUE(RequestsSince(Before, SMB2_WRITE).empty());
  Close(Dir);
  Close(Root);
}

// Two files read in alternation share the process-wide read offset: each
// read continues where the other file's read stopped, so both come out
// wrong. That is the design (one file is read at a time per run); the test
// pins it down and shows that nothing worse happens.
TEST_F(NwVolumeSambaTest, FilesReadInAlternationShareOneOffset) {
  constexpr UINTN kPiece = 0x10000;
  std::vector<UINT8> A = RandomBytes(4 * kPiece, 1), B = RandomBytes(4 * kPiece, 2);
  PutFile("a.bin", A);
  PutFile("b.bin", B);
  EFI_FILE_PROTOCOL *Root = OpenRoot();
  EFI_FILE_PROTOCOL *FileA = nullptr, *FileB = nullptr;
  ASSERT_EQ(Open(Root, At("a.bin"), &FileA), EFI_SUCCESS);
  ASSERT_EQ(Open(Root, At("b.bin"), &FileB), EFI_SUCCESS);
  std::vector<UINT8> Buffer(kPiece);
  struct Step {
    EFI_FILE_PROTOCOL *File;
    const std::vector<UINT8> *Data;
    UINTN Offset; // where the data really comes from
  } Steps[] = {
      {FileA, &A, 0}, {FileB, &B, kPiece}, {FileA, &A, 2 * kPiece}, {FileB, &B, 3 * kPiece}};
  for (const Step &S : Steps) {
    UINTN Size = Buffer.size();
    ASSERT_EQ(Read(S.File, &Size, Buffer.data()), EFI_SUCCESS);
    ASSERT_EQ(Size, kPiece);
    EXPECT_TRUE(std::equal(Buffer.begin(), Buffer.end(), S.Data->begin() + S.Offset));
  }
  // Both are now "at the end": each got half of its file.
  UINTN Size = Buffer.size();
  ASSERT_EQ(Read(FileA, &Size, Buffer.data()), EFI_SUCCESS);
  EXPECT_EQ(Size, 0u);
  // Closing either one starts every file over.
  Close(FileB);
  Size = Buffer.size();
  ASSERT_EQ(Read(FileA, &Size, Buffer.data()), EFI_SUCCESS);
  EXPECT_TRUE(std::equal(Buffer.begin(), Buffer.end(), A.begin()));
  Close(FileA);
  Close(Root);
}

// ---------------------------------------------------------------------------
// Directories
// ---------------------------------------------------------------------------
TEST_F(NwVolumeSambaTest, DirectoryReadsTakeNPlusOneReadsWithData) {
  MakeDir("empty");
  MakeDir("one");
  MakeDir("many");
  PutFile("one/only.txt", {'1'});
  for (int I = 0; I < 40; I++) {
    PutFile("many/f" + std::to_string(I) + ".dat", {static_cast<UINT8>(I)});
  }
  EFI_FILE_PROTOCOL *Root = OpenRoot();
  EFI_FILE_PROTOCOL *Dir = nullptr;
  // An empty directory still lists "." and "..": two entries, three reads.
  ASSERT_EQ(Open(Root, At("empty"), &Dir), EFI_SUCCESS);
  EXPECT_EQ(List(Dir), (std::vector<std::u16string>{u".", u".", u".."}));
  Close(Dir);
  ASSERT_EQ(Open(Root, At("one"), &Dir), EFI_SUCCESS);
  std::vector<std::u16string> Names = List(Dir);
  ASSERT_EQ(Names.size(), 4u);
  EXPECT_EQ(Names[0], Names[1]);
  EXPECT_EQ(std::count(Names.begin(), Names.end(), u"only.txt"), 1);
  Close(Dir);
  ASSERT_EQ(Open(Root, At("many"), &Dir), EFI_SUCCESS);
  Names = List(Dir);
  ASSERT_EQ(Names.size(), 43u);
  for (int I = 0; I < 40; I++) {
    EXPECT_EQ(std::count(Names.begin(), Names.end(), U16("f" + std::to_string(I) + ".dat")), 1);
  }
  // A buffer too small for the entry: the size it needs, and the same entry
  // on the next Read.
  UINTN Size = 10;
  std::vector<UINT8> Buffer(512);
  EXPECT_EQ(Read(Dir, &Size, Buffer.data()), EFI_BUFFER_TOO_SMALL);
  std::u16string Expected = Names[0];
  EXPECT_EQ(Size, 84u + 2 * Expected.size());
  ASSERT_EQ(Read(Dir, &Size, Buffer.data()), EFI_SUCCESS);
  auto *Entry = reinterpret_cast<EFI_FILE_INFO *>(Buffer.data());
  EXPECT_EQ(std::u16string(Entry->FileName), Expected);
  EXPECT_EQ(Val(Entry->ModificationTime.Year), 2018);
  EXPECT_EQ(Val(Entry->ModificationTime.Second), 10);
  Close(Dir);
  Close(Root);
}

// ---------------------------------------------------------------------------
// Information
// ---------------------------------------------------------------------------
TEST_F(NwVolumeSambaTest, FileInfoComesFromTheServerWithTheFixedTime) {
  PutFile("info.bin", RandomBytes(12345, 4));
  EFI_FILE_PROTOCOL *Root = OpenRoot();
  EFI_FILE_PROTOCOL *File = nullptr;
  ASSERT_EQ(Open(Root, At("info.bin"), &File), EFI_SUCCESS);
  EFI_STATUS Status;
  UINTN Needed = 0;
  std::vector<UINT8> Buffer = Info(File, gEfiFileInfoGuid, &Status, &Needed);
  EXPECT_EQ(Needed, 84u + 2 * 8);
  ASSERT_EQ(Status, EFI_SUCCESS);
  auto *FileInfo = reinterpret_cast<EFI_FILE_INFO *>(Buffer.data());
  EXPECT_EQ(Val(FileInfo->Size), Needed);
  EXPECT_EQ(Val(FileInfo->FileSize), 12345u);
  EXPECT_EQ(Val(FileInfo->PhysicalSize), 12345u);
  EXPECT_EQ(Val(FileInfo->Attribute) & EFI_FILE_DIRECTORY, 0u);
  EFI_TIME Time = FileInfo->CreateTime;
  EXPECT_EQ(Time.Year, 2018);
  EXPECT_EQ(Time.Month, 1);
  EXPECT_EQ(Time.Hour, 10);
  Time = FileInfo->ModificationTime;
  EXPECT_EQ(Time.Minute, 10);
  // The system information still comes from OpenVolume's statistics.
  std::vector<UINT8> Fs = Info(File, gEfiFileSystemInfoGuid, &Status);
  ASSERT_EQ(Status, EFI_SUCCESS);
  EXPECT_EQ(Val(reinterpret_cast<EFI_FILE_SYSTEM_INFO *>(Fs.data())->VolumeSize),
            Val(Volume->TotalSize));
  Close(File);
  Close(Root);
}

TEST_F(NwVolumeSambaTest, SetInfoRenamesLocallyAndChangesSizesLocally) {
  PutFile("old.txt", {'o', 'l', 'd'});
  EFI_FILE_PROTOCOL *Root = OpenRoot();
  EFI_STATUS Status;
  std::vector<UINT8> RootInfo = Info(Root, gEfiFileInfoGuid, &Status);
  ASSERT_EQ(Status, EFI_SUCCESS);
  // Firmware shells find the root by its empty name when they build paths.
  ASSERT_EQ(RootInfo.size(), 84u);
  EXPECT_EQ(reinterpret_cast<const EFI_FILE_INFO *>(RootInfo.data())->FileName[0], u'\0');
  EXPECT_EQ(Quiet([&] {
              return Root->SetInfo(Root, &gEfiFileInfoGuid, RootInfo.size(), RootInfo.data());
            }),
            EFI_ACCESS_DENIED);

  EFI_FILE_PROTOCOL *File = nullptr;
  ASSERT_EQ(Open(Root, At("old.txt"), &File, kReadWrite), EFI_SUCCESS);
  std::vector<UINT8> Buffer = Info(File, gEfiFileInfoGuid, &Status);
  ASSERT_EQ(Status, EFI_SUCCESS);
  // A new name: the handle moves to it; the server is not asked to rename.
  std::u16string NewName = u"new.txt";
  std::vector<UINT8> Renamed = NamedInfo(Buffer, NewName);
  ASSERT_EQ(
      Quiet([&] { return File->SetInfo(File, &gEfiFileInfoGuid, Renamed.size(), Renamed.data()); }),
      EFI_SUCCESS);
  std::vector<UINT8> After = Info(File, gEfiFileInfoGuid, &Status);
  EXPECT_EQ(std::u16string(reinterpret_cast<EFI_FILE_INFO *>(After.data())->FileName), NewName);
  EXPECT_TRUE(GetFile("old.txt") == (std::vector<UINT8>{'o', 'l', 'd'}));
  // A size change is acknowledged and not sent.
  auto *Request = reinterpret_cast<EFI_FILE_INFO *>(After.data());
  Request->FileSize = 1;
  EXPECT_EQ(
      Quiet([&] { return File->SetInfo(File, &gEfiFileInfoGuid, After.size(), After.data()); }),
      EFI_SUCCESS);
  EXPECT_EQ(GetFile("old.txt").size(), 3u);
  Close(File);

  // A handle opened for reading may not change the size.
  ASSERT_EQ(Open(Root, At("old.txt"), &File, kRead), EFI_SUCCESS);
  Buffer = Info(File, gEfiFileInfoGuid, &Status);
  reinterpret_cast<EFI_FILE_INFO *>(Buffer.data())->FileSize = 99;
  EXPECT_EQ(
      Quiet([&] { return File->SetInfo(File, &gEfiFileInfoGuid, Buffer.size(), Buffer.data()); }),
      EFI_ACCESS_DENIED);
  Close(File);
  Close(Root);
}

// ---------------------------------------------------------------------------
// Delete
// ---------------------------------------------------------------------------
TEST_F(NwVolumeSambaTest, DeleteIsLocalAndRefusesTheRootAndReadOnlyFiles) {
  PutFile("gone.txt", {'g'});
  PutFile("locked.txt", {'l'});
  // The DOS read-only attribute, set the way a client sets it.
  std::string Out;
  ASSERT_EQ(RunShell("smbclient -m SMB2_10 //127.0.0.1/" + kShare + " -U " + kUser + "%" +
                         kPassword + " -c 'setmode " + Remote + "/locked.txt +r'",
                     &Out),
            0)
      << Out;
  EFI_FILE_PROTOCOL *Root = OpenRoot();
  EFI_FILE_PROTOCOL *File = nullptr;
  ASSERT_EQ(Open(Root, At("gone.txt"), &File, kReadWrite), EFI_SUCCESS);
  EXPECT_EQ(Quiet([&] { return File->Delete(File); }), EFI_SUCCESS);
  EXPECT_TRUE(Exists("gone.txt")); // the removal is acknowledged, not sent

  ASSERT_EQ(Open(Root, At("locked.txt"), &File, kRead), EFI_SUCCESS);
  EFI_STATUS InfoStatus;
  std::vector<UINT8> Locked = Info(File, gEfiFileInfoGuid, &InfoStatus);
  ASSERT_EQ(InfoStatus, EFI_SUCCESS);
  EXPECT_NE(Val(reinterpret_cast<EFI_FILE_INFO *>(Locked.data())->Attribute) & EFI_FILE_READ_ONLY,
            0u);
  EXPECT_EQ(Quiet([&] { return File->Delete(File); }), EFI_WARN_DELETE_FAILURE);

  EFI_FILE_PROTOCOL *Root2 = OpenRoot();
  UINT64 Handles = Volume->FileHandles.Count;
  EXPECT_EQ(Quiet([&] { return Root2->Delete(Root2); }), EFI_WARN_DELETE_FAILURE);
  EXPECT_EQ(Val(Volume->FileHandles.Count), Handles - 1); // closed by the refusal
  Close(Root);
}

TEST_F(NwVolumeSambaTest, DeleteThroughAnotherHandleInvalidatesThisOne) {
  PutFile("shared.txt", {'s', 'h'});
  EFI_FILE_PROTOCOL *Root = OpenRoot();
  EFI_FILE_PROTOCOL *One = nullptr, *Two = nullptr;
  ASSERT_EQ(Open(Root, At("shared.txt"), &One, kReadWrite), EFI_SUCCESS);
  ASSERT_EQ(Open(Root, At("shared.txt"), &Two, kReadWrite), EFI_SUCCESS);
  EXPECT_EQ(NwHandleOf(One)->OpenFile, NwHandleOf(Two)->OpenFile);
  EXPECT_EQ(Quiet([&] { return One->Delete(One); }), EFI_SUCCESS);
  std::vector<UINT8> Buffer(64);
  UINTN Size = Buffer.size();
  EXPECT_EQ(Read(Two, &Size, Buffer.data()), EFI_NOT_FOUND);
  EXPECT_EQ(Write(Two, {'x'}, &Size), EFI_NOT_FOUND);
  Size = Buffer.size();
  EXPECT_EQ(Quiet([&] { return Two->GetInfo(Two, &gEfiFileInfoGuid, &Size, Buffer.data()); }),
            EFI_NOT_FOUND);
  EXPECT_EQ(Quiet([&] { return Two->Delete(Two); }), EFI_NOT_FOUND);
  EXPECT_EQ(Quiet([&] { return Two->Close(Two); }), EFI_SUCCESS);
  Close(Root);
}

// ---------------------------------------------------------------------------
// The hosted shell's cp through the volume
// ---------------------------------------------------------------------------
TEST_F(NwVolumeSambaTest, ShellCopiesToRamfsAndBackByteIdentical) {
  std::vector<UINT8> Data = RandomBytes(3 * kMiB + 12345, 7);
  PutFile("src.bin", Data);
  std::u16string Drive = MapVolume();
  ASSERT_FALSE(Drive.empty());
  Shell(u"cp -q " + Drive + At("src.bin") + u" ramfs:\\copy.bin");
  EXPECT_TRUE(ReadBytes(RamfsDir + "/copy.bin") == Data);
  Shell(u"cp -q ramfs:\\copy.bin " + Drive + At("back.bin"));
  EXPECT_TRUE(GetFile("back.bin") == Data);
  // TearDown unmounts and checks that the pool is back where it started.
}

} // namespace
