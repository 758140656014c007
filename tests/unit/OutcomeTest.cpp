// The outcome a run records against a share whose transfers go wrong: the
// whole image runs on a scripted back end under the network volume, and
// VerifyStatus is 0 only when the file arrived whole. Also the rename names
// that must not touch a directory's record.
#include "HostImageFixture.h"
#include "HostInternal.h"
#include "NwFsDrv.h"
#include "ProvisioningVars.h"
#include "volume/NwVolume.h"

#include <string.h>

namespace {

// One file on the share, and how its transfers go.
struct Script {
  std::string Path = "f.img"; // from the share's root; at most one directory
  std::string Data = std::string(300, 'd');
  bool RootFails = false;               // the first request on the share fails
  size_t ReadStop = SIZE_MAX;           // bytes served before reads misbehave
  EFI_STATUS ReadFailure = 0;           // then: this error, or an answer without data
  size_t WriteKeep = SIZE_MAX;          // most bytes a write request reports
  std::vector<std::string> Listed = {}; // directories listed
  size_t FsInfoCalls = 0;
};
Script *S = nullptr;

constexpr auto Ok = [](auto...) { return EFI_SUCCESS; };
constexpr auto NotFound = [](auto...) { return EFI_NOT_FOUND; };
EFI_FILE_INFO *Entry(const std::string &Name, UINT64 Size, UINT64 Attribute) {
  UINTN Bytes = SIZE_OF_EFI_FILE_INFO + 2 * Name.size() + 2;
  auto *I = static_cast<EFI_FILE_INFO *>(AllocateZeroPool(Bytes));
  I->Size = Bytes;
  I->FileSize = I->PhysicalSize = Size;
  I->Attribute = Attribute;
  std::copy(Name.begin(), Name.end(), I->FileName);
  return I;
}
EFI_STATUS Read(NW_SHARE_INFO *, NW_REMOTE_FILE *, void *Buffer, UINTN *Size, UINT64 Offset) {
  size_t Stop = std::min(S->ReadStop, S->Data.size());
  if (Offset >= Stop) {
    *Size = 0;
    return Offset < S->Data.size() ? S->ReadFailure : EFI_SUCCESS;
  }
  *Size = std::min<UINT64>(*Size, Stop - Offset);
  memcpy(Buffer, S->Data.data() + Offset, *Size);
  return EFI_SUCCESS;
}
EFI_STATUS Write(NW_SHARE_INFO *, NW_REMOTE_FILE *, const void *, UINTN *Size, UINT64) {
  *Size = std::min<UINTN>(*Size, S->WriteKeep);
  return EFI_SUCCESS;
}
EFI_STATUS FsInfo(NW_SHARE_INFO *, EFI_FILE_SYSTEM_INFO *Info) {
  S->FsInfoCalls++;
  Info->VolumeSize = Info->FreeSpace = Info->BlockSize = 512;
  return S->RootFails ? EFI_DEVICE_ERROR : EFI_SUCCESS;
}
// The entry of the path's next component below the directory listed.
EFI_STATUS FindFirst(NW_SHARE_INFO *Share, const CHAR16 *, EFI_FILE_INFO **Out) {
  std::string Dir = Share->FilePath, Prefix = Dir.empty() ? "" : Dir + "\\";
  S->Listed.push_back(Dir);
  if (S->Path.compare(0, Prefix.size(), Prefix) != 0) {
    return EFI_NOT_FOUND;
  }
  std::string Rest = S->Path.substr(Prefix.size());
  size_t Cut = Rest.find('\\');
  *Out = Cut == std::string::npos ? Entry(Rest, S->Data.size(), EFI_FILE_ARCHIVE)
                                  : Entry(Rest.substr(0, Cut), 0, EFI_FILE_DIRECTORY);
  return EFI_SUCCESS;
}
const NW_BACKEND kScripted = {
    NW_BACKEND_REVISION, Ok, Ok, Ok, Ok, Read, Write, Ok, FsInfo, FindFirst, NotFound, NotFound};

class OutcomeTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    gNwBackend = &kScripted;
  }
  void TearDown() override {
    gNwBackend = &gSMB2FsBackend;
    HostImageTest::TearDown();
  }
};

// Pool blocks freed while they still begin with the password, 8-bit or UCS-2
// (compared a byte at a time, so that nothing past a short block is read).
int gSecretsFreed = 0;
EFI_STATUS(EFIAPI *gRealFreePool)(void *) = nullptr;
EFI_STATUS EFIAPI CheckedFreePool(void *Buffer) {
  auto *Bytes = static_cast<const char *>(Buffer);
  auto BeginsWith = [&](const void *Text, size_t Length) {
    return std::mismatch(Bytes, Bytes + Length, static_cast<const char *>(Text)).first ==
           Bytes + Length;
  };
  gSecretsFreed += BeginsWith("Zq7-Secret", 10) || BeginsWith(u"Zq7-Secret", 20);
  return gRealFreePool(Buffer);
}

TEST_F(OutcomeTest, SuccessMeansTheFileArrivedWhole) {
  using Args = std::vector<std::string>;
  const Args Import = {"CIFSDrv.efi", "I", "share", "127.0.0.1", "u", "Zq7-Secret", "f.img"};
  const Args Catalog = {"CIFSDrv.efi", "G", "share", "127.0.0.1", "u", "Zq7-Secret"};
  const Args Export = {"CIFSDrv.efi", "e",   "share", "127.0.0.1",
                       "Export",      "VML", "u",     "Zq7-Secret"};
  Args Mount = Export;
  Mount[1] = "m";
  struct Case {
    const char *Name;
    const Args &Line;
    Script Share;
    int Status;
    const char *InRamfs; // whole in ramfs: afterwards, or null: nothing there
  } Cases[] = {
      {"import", Import, {}, 0, "f.img"},
      {"import, no data at all", Import, {.ReadStop = 0}, 7, nullptr},
      {"import, no data after a few bytes", Import, {.ReadStop = 10}, 7, nullptr},
      {"import, reset", Import, {.ReadStop = 10, .ReadFailure = EFI_DEVICE_ERROR}, 7, nullptr},
      {"import, no such file", Import, {.Path = "other.img"}, 0x0E, nullptr},
      {"catalog", Catalog, {.Path = "catalog.xml.gz"}, 0, "catalog.xml.gz"},
      {"catalog, cut short", Catalog, {.Path = "catalog.xml.gz", .ReadStop = 10}, 7, nullptr},
      {"export", Export, {}, 0, nullptr},
      {"export, short write", Export, {.WriteKeep = 1}, 7, nullptr},
      {"mount", Mount, {}, 0, nullptr},
      {"mount, root does not open", Mount, {.RootFails = true}, 7, nullptr},
  };
  gRealFreePool = gBS->FreePool;
  gBS->FreePool = CheckedFreePool;
  for (Case &C : Cases) {
    SCOPED_TRACE(C.Name);
    S = &C.Share;
    std::filesystem::remove_all(RamfsDir);
    WriteFile(RamfsDir + "/VelmorLog.xml", "log");
    std::vector<UINT8> Record(sizeof(PU_PROVISIONING_RECORD), 0);
    memcpy(Record.data() + offsetof(PU_PROVISIONING_RECORD, CifsCatalogPath), "CIFS:\\old", 9);
    WriteVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid, PROVISIONING_NV_ATTRIBUTES, Record);
    std::string Out;
    RunImage(C.Line, &Out);
    Variable Outcome = ReadVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid);
    EXPECT_EQ(Outcome.Data.at(0), C.Status) << Out;
    for (std::string Name : {"f.img", "catalog.xml.gz"}) {
      bool Whole = C.InRamfs != nullptr && Name == C.InRamfs;
      EXPECT_EQ(ReadFile(RamfsDir + "/" + Name), Whole ? C.Share.Data : "") << Name;
    }
    // A catalog copy that broke ends the search and leaves the place remembered.
    EXPECT_EQ(std::count(C.Share.Listed.begin(), C.Share.Listed.end(), "repository"), 0);
    Variable Kept = ReadVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid);
    EXPECT_STREQ(reinterpret_cast<char *>(Kept.Data.data()) +
                     offsetof(PU_PROVISIONING_RECORD, CifsCatalogPath),
                 &C.Line == &Catalog && C.Status == 0 ? "CIFS:" : "CIFS:\\old");
    // The mount takes the root the shell-name lookup opened (two statistics
    // queries for a new root), or failed to open, without a request of its own.
    if (&C.Line == &Mount) {
      EXPECT_EQ(C.Share.FsInfoCalls, C.Share.RootFails ? 1u : 2u);
    }
  }
  gBS->FreePool = gRealFreePool;
  EXPECT_EQ(gSecretsFreed, 0);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

// "", "." and ".." name the directories above a file, never a new name for
// it: the rename changes nothing, and the path stays open for later opens.
TEST_F(OutcomeTest, RenameToADirectoryNameChangesNothing) {
  Script Share = {.Path = "dir\\f.img"};
  S = &Share;
  Quiet([] { return MountStaticFileSystem(u"s", u"127.0.0.1", NWFS_SHARE_TYPE_CIFS, u"", u""); });
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *Fs = nullptr;
  ASSERT_EQ(gBS->HandleProtocol(gImageHandle, &gEfiSimpleFileSystemProtocolGuid,
                                reinterpret_cast<void **>(&Fs)),
            EFI_SUCCESS);
  EFI_FILE_PROTOCOL *Root = nullptr;
  ASSERT_EQ(Quiet([&] { return Fs->OpenVolume(Fs, &Root); }), EFI_SUCCESS);
  // The name a handle reports, with its whole information record.
  auto NameOf = [](EFI_FILE_PROTOCOL *File, std::vector<UINT8> *Info) {
    Info->assign(512, 0);
    UINTN Size = Info->size();
    Quiet([&] { return File->GetInfo(File, &gEfiFileInfoGuid, &Size, Info->data()); });
    return HostUcs2ToUtf8(reinterpret_cast<EFI_FILE_INFO *>(Info->data())->FileName);
  };
  for (const char16_t *Name : {u"", u".", u".."}) {
    SCOPED_TRACE(HostUcs2ToUtf8(Name));
    EFI_FILE_PROTOCOL *File = nullptr, *Again = nullptr;
    ASSERT_EQ(Quiet([&] { return Root->Open(Root, &File, u"dir\\f.img", 3, 0); }), EFI_SUCCESS);
    std::vector<UINT8> Info;
    ASSERT_EQ(NameOf(File, &Info), "f.img");
    Info = NamedInfo(Info, Name);
    EXPECT_EQ(
        Quiet([&] { return File->SetInfo(File, &gEfiFileInfoGuid, Info.size(), Info.data()); }),
        EFI_SUCCESS);
    EXPECT_EQ(NameOf(File, &Info), "f.img");
    ASSERT_EQ(Quiet([&] { return Root->Open(Root, &Again, u"dir\\f.img", 1, 0); }), EFI_SUCCESS);
    EXPECT_EQ(NameOf(Again, &Info), "f.img");
    Quiet([&] { return Again->Close(Again) | File->Close(File); });
  }
  Quiet([&] { return Root->Close(Root); });
  Quiet([] { return UnmountStaticFileSystem(u"share", u"127.0.0.1"); });
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

} // namespace
