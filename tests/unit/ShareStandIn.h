// A stand-in for the mounted share in the tasks' tests: a volume of its own
// (its own handle and device path) labelled like the network volume ("CIFS"),
// whose files are those of one directory of the ramfs: directory. The tasks
// then find it, map it and copy to and from it exactly as they do with the
// share, without a server.
#pragma once

#include "HostImageFixture.h"
#include "HostInternal.h"
#include "ProvisioningVars.h"
#include "ShellCommand.h"

#include <string.h>

#include <filesystem>
#include <fstream>
#include <string>

class ShareStandIn {
public:
  // Installs the volume over RamfsDir/SubDir (which must exist) and lets the
  // shell map it, under its label as well, as the mount does.
  void Install(const char16_t *SubDir, const char16_t *Label = u"CIFS") {
    Volume.Owner = this;
    Volume.Fs.Revision = EFI_SIMPLE_FILE_SYSTEM_PROTOCOL_REVISION;
    Volume.Fs.OpenVolume = OpenVolume;
    Directory = SubDir;
    VolumeLabel = Label;
    Path.Vendor = {0x01, 0x04, {20, 0}};
    Path.Guid = {0x5B0C4E51, 0x2D7A, 0x4F0B, {0x8E, 0x33, 0x61, 0x19, 0xC2, 0x7D, 0x40, 0xA6}};
    Path.End = {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, {4, 0}};
    ASSERT_EQ(gBS->InstallMultipleProtocolInterfaces(&Handle, &gEfiSimpleFileSystemProtocolGuid,
                                                     &Volume.Fs, &gEfiDevicePathProtocolGuid, &Path,
                                                     nullptr),
              EFI_SUCCESS);
    ASSERT_EQ(RunShellCommand(u"map -u"), 0);
    CHAR16 DriveName[NWFS_DRIVE_NAME_CHARS + 1] = {};
    ASSERT_EQ(GetFS_OLD_NWFS(Label, DriveName, NWFS_DRIVE_NAME_CHARS), EFI_SUCCESS);
  }

  void Uninstall() {
    if (Handle != nullptr) {
      gBS->UninstallMultipleProtocolInterfaces(Handle, &gEfiSimpleFileSystemProtocolGuid,
                                               &Volume.Fs, &gEfiDevicePathProtocolGuid, &Path,
                                               nullptr);
      Handle = nullptr;
    }
  }

  int OpenHandles() const { return Open; }

private:
  struct VOLUME {
    EFI_SIMPLE_FILE_SYSTEM_PROTOCOL Fs; // first: the interface is the record
    ShareStandIn *Owner;
  };
  // A handle on the share's directory: the root the volume hands out. Names
  // opened through it are taken relative to the share's directory.
  struct ROOT {
    EFI_FILE_PROTOCOL Protocol; // first: the handle is the record
    EFI_FILE_PROTOCOL *Directory;
    ShareStandIn *Owner;
  };
  struct {
    EFI_DEVICE_PATH_PROTOCOL Vendor;
    EFI_GUID Guid;
    EFI_DEVICE_PATH_PROTOCOL End;
  } Path = {};
  VOLUME Volume = {};
  EFI_HANDLE Handle = nullptr;
  const char16_t *Directory = nullptr;
  const char16_t *VolumeLabel = nullptr;
  int Open = 0;

  static ROOT *RootOf(EFI_FILE_PROTOCOL *This) { return reinterpret_cast<ROOT *>(This); }
  static EFI_FILE_PROTOCOL *Dir(EFI_FILE_PROTOCOL *This) { return RootOf(This)->Directory; }

  static EFI_STATUS NewRoot(ShareStandIn *Owner, EFI_FILE_PROTOCOL *Directory,
                            EFI_FILE_PROTOCOL **Root) {
    ROOT *R = new ROOT{};
    R->Protocol.Revision = EFI_FILE_PROTOCOL_REVISION;
    R->Protocol.Open = RootOpen;
    R->Protocol.Close = RootClose;
    R->Protocol.Delete = [](EFI_FILE_PROTOCOL *) -> EFI_STATUS { return EFI_WARN_DELETE_FAILURE; };
    R->Protocol.Read = [](EFI_FILE_PROTOCOL *This, UINTN *Size, void *Buffer) {
      return Dir(This)->Read(Dir(This), Size, Buffer);
    };
    R->Protocol.Write = [](EFI_FILE_PROTOCOL *This, UINTN *Size, void *Buffer) {
      return Dir(This)->Write(Dir(This), Size, Buffer);
    };
    R->Protocol.GetPosition = [](EFI_FILE_PROTOCOL *This, UINT64 *Position) {
      return Dir(This)->GetPosition(Dir(This), Position);
    };
    R->Protocol.SetPosition = [](EFI_FILE_PROTOCOL *This, UINT64 Position) {
      return Dir(This)->SetPosition(Dir(This), Position);
    };
    R->Protocol.GetInfo = RootGetInfo;
    R->Protocol.SetInfo = [](EFI_FILE_PROTOCOL *, const EFI_GUID *, UINTN, void *) -> EFI_STATUS {
      return EFI_WRITE_PROTECTED;
    };
    R->Protocol.Flush = [](EFI_FILE_PROTOCOL *This) { return Dir(This)->Flush(Dir(This)); };
    R->Directory = Directory;
    R->Owner = Owner;
    Owner->Open++;
    *Root = &R->Protocol;
    return EFI_SUCCESS;
  }

  static EFI_STATUS EFIAPI OpenVolume(EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *This,
                                      EFI_FILE_PROTOCOL **Root) {
    ShareStandIn *Owner = reinterpret_cast<VOLUME *>(This)->Owner;
    EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *Ramfs = nullptr;
    EFI_STATUS Status = gBS->HandleProtocol(HostRamfsHandle(), &gEfiSimpleFileSystemProtocolGuid,
                                            reinterpret_cast<void **>(&Ramfs));
    EFI_FILE_PROTOCOL *RamfsRoot = nullptr;
    if (!EFI_ERROR(Status)) {
      Status = Ramfs->OpenVolume(Ramfs, &RamfsRoot);
    }
    if (EFI_ERROR(Status)) {
      return Status;
    }
    EFI_FILE_PROTOCOL *Directory = nullptr;
    Status = RamfsRoot->Open(RamfsRoot, &Directory, Owner->Directory,
                             EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE, 0);
    RamfsRoot->Close(RamfsRoot);
    return EFI_ERROR(Status) ? Status : NewRoot(Owner, Directory, Root);
  }

  static EFI_STATUS EFIAPI RootOpen(EFI_FILE_PROTOCOL *This, EFI_FILE_PROTOCOL **New,
                                    const CHAR16 *Name, UINT64 Mode, UINT64 Attributes) {
    while (*Name == u'\\') {
      Name++;
    }
    if (*Name == 0) {
      EFI_FILE_PROTOCOL *Again = nullptr;
      EFI_STATUS Status = Dir(This)->Open(Dir(This), &Again, u".", Mode, Attributes);
      return EFI_ERROR(Status) ? Status : NewRoot(RootOf(This)->Owner, Again, New);
    }
    return Dir(This)->Open(Dir(This), New, Name, Mode, Attributes);
  }

  static EFI_STATUS EFIAPI RootClose(EFI_FILE_PROTOCOL *This) {
    ROOT *R = RootOf(This);
    R->Directory->Close(R->Directory);
    R->Owner->Open--;
    delete R;
    return EFI_SUCCESS;
  }

  // The label is the stand-in's; everything else is the directory's.
  static EFI_STATUS EFIAPI RootGetInfo(EFI_FILE_PROTOCOL *This, const EFI_GUID *Type, UINTN *Size,
                                       void *Buffer) {
    const char16_t *Label = RootOf(This)->Owner->VolumeLabel;
    UINTN LabelBytes = (std::char_traits<char16_t>::length(Label) + 1) * sizeof(CHAR16);
    if (EfiGuidEqual(*Type, gEfiFileSystemVolumeLabelInfoIdGuid)) {
      if (*Size < LabelBytes) {
        *Size = LabelBytes;
        return EFI_BUFFER_TOO_SMALL;
      }
      memcpy(Buffer, Label, LabelBytes);
      *Size = LabelBytes;
      return EFI_SUCCESS;
    }
    if (!EfiGuidEqual(*Type, gEfiFileSystemInfoGuid)) {
      return Dir(This)->GetInfo(Dir(This), Type, Size, Buffer);
    }
    UINTN Needed = SIZE_OF_EFI_FILE_SYSTEM_INFO + LabelBytes;
    if (*Size < Needed) {
      *Size = Needed;
      return EFI_BUFFER_TOO_SMALL;
    }
    memset(Buffer, 0, Needed);
    auto *Info = static_cast<EFI_FILE_SYSTEM_INFO *>(Buffer);
    Info->Size = Needed;
    Info->VolumeSize = 1ULL << 30;
    Info->FreeSpace = 1ULL << 29;
    Info->BlockSize = 512;
    memcpy(Info->VolumeLabel, Label, LabelBytes);
    *Size = Needed;
    return EFI_SUCCESS;
  }
};

// A hosted image with the stand-in share over RamfsDir/share, the shell bound
// as the image binds it, and helpers for files and the text-field record.
class ShareTaskTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    ShareDir = RamfsDir + "/share";
    std::filesystem::create_directories(ShareDir);
    BeforeInstall();
    Console([&] {
      InitializeSystemEnv(gImageHandle, gST);
      Share.Install(u"share");
    });
    PoolAtStart = HostPoolOutstanding();
  }

  void TearDown() override {
    EXPECT_EQ(Share.OpenHandles(), 0);
    Share.Uninstall();
    HostImageTest::TearDown();
  }

  // Runs in SetUp once the environment is there, before the shell is bound.
  virtual void BeforeInstall() {}

  // The text-field record the catalog tasks persist into, as other firmware
  // components would have created it.
  static void SeedTextFields(const std::string &CifsCatalogPath = "") {
    std::vector<UINT8> Record(sizeof(PU_PROVISIONING_RECORD), 0);
    memcpy(Record.data() + offsetof(PU_PROVISIONING_RECORD, CifsCatalogPath),
           CifsCatalogPath.data(), CifsCatalogPath.size());
    ASSERT_EQ(WriteVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid, PROVISIONING_NV_ATTRIBUTES,
                       Record),
              EFI_SUCCESS);
  }

  static std::string PersistedCatalogPath() {
    Variable V = ReadVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid);
    if (V.Data.size() != sizeof(PU_PROVISIONING_RECORD)) {
      return "<no record>";
    }
    return reinterpret_cast<const char *>(V.Data.data() +
                                          offsetof(PU_PROVISIONING_RECORD, CifsCatalogPath));
  }

  static UINT32 CatalogKind() {
    Variable V = ReadVar(CATALOG_FILE_VAR_NAME, gCatalogFileEnvGuid);
    UINT32 Kind = 0xFFFFFFFF;
    if (V.Data.size() == sizeof(Kind)) {
      memcpy(&Kind, V.Data.data(), sizeof(Kind));
    }
    return Kind;
  }
  void ExpectNoPoolLeak() const { EXPECT_EQ(HostPoolOutstanding(), PoolAtStart); }

  std::string ShareDir;
  ShareStandIn Share;
};
