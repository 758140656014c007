// A share held in memory and served to the network volume through the
// back-end table in place of the SMB2 client, every call recorded; and a
// volume installed over it with its root open, for the volume's tests.
#pragma once

#include "HostImageFixture.h"
#include "ProvisioningVars.h"
#include "volume/NwVolume.h"

#include <map>
#include <string>
#include <vector>

// Each test program file gets its own copy.
namespace {

constexpr UINT64 kMiB = 0x100000;
constexpr UINT64 kRead = EFI_FILE_MODE_READ;
constexpr UINT64 kCreate = EFI_FILE_MODE_CREATE | EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE;

struct Call {
  std::string Op;
  std::string Path;
  UINT64 Length;
  UINT64 Offset;
};
inline bool operator==(const Call &A, const Call &B) {
  return A.Op == B.Op && A.Path == B.Path && A.Length == B.Length && A.Offset == B.Offset;
}
inline std::ostream &operator<<(std::ostream &Out, const Call &C) {
  return Out << C.Op << "(" << C.Path << "," << C.Length << "@" << C.Offset << ")";
}

// The share: paths from its root ("dir\\f.txt"), each a file or a directory.
struct Node {
  std::string Data;
  bool Directory = false;
};

struct ScriptedShare {
  std::map<std::string, Node> Nodes = {};
  std::vector<Call> Calls = {};
  UINT64 MaxPerCall = ~0ULL; // the most a read or write call moves
  UINT64 Extra = 0;          // reported beyond what a read or write moved
  EFI_STATUS Status = EFI_SUCCESS;
  UINT64 ReadStop = ~0ULL;               // bytes of a file served before reads misbehave
  EFI_STATUS ReadFailure = EFI_SUCCESS;  // then: this error, or an answer without data
  EFI_STATUS FsInfoStatus = EFI_SUCCESS; // of every file-system information call
  std::vector<std::string> Listing = {}; // paths of the listing being handed out
  size_t Next = 0;
  size_t Prefix = 0; // characters of the directory's path in front of a name
} *gShare = nullptr;

std::string Narrow(const CHAR16 *Text) {
  std::string Out;
  for (; Text != nullptr && *Text != 0; Text++) {
    Out += static_cast<char>(*Text);
  }
  return Out;
}

void Fill(EFI_FILE_INFO *Info, const Node &N) {
  Info->FileSize = Info->PhysicalSize = N.Data.size();
  Info->Attribute = N.Directory ? EFI_FILE_DIRECTORY : EFI_FILE_ARCHIVE;
}

EFI_STATUS Recorded(const char *Op, const std::string &Path, UINT64 Length = 0, UINT64 At = 0) {
  gShare->Calls.push_back({Op, Path, Length, At});
  return EFI_SUCCESS;
}

EFI_STATUS Ok() {
  return EFI_SUCCESS;
}
EFI_STATUS Connect(const NW_CONNECTION_PARAMS *, const NW_SHARE_INFO *) {
  return EFI_SUCCESS;
}
EFI_STATUS Open(NW_SHARE_INFO *, NW_REMOTE_FILE *File, UINT64, UINT64 Flags) {
  std::string Path = Narrow(File->FileName);
  Recorded("open", Path, Flags);
  if (gShare->Nodes.count(Path) == 0 && (Flags & 0x8) == 0) {
    return EFI_DEVICE_ERROR;
  }
  gShare->Nodes[Path];
  File->FileId[0] = 1;
  return EFI_SUCCESS;
}
EFI_STATUS Read(NW_SHARE_INFO *, NW_REMOTE_FILE *File, void *Buffer, UINTN *Size, UINT64 At) {
  std::string Path = Narrow(File->FileName);
  Recorded("read", Path, *Size, At);
  const std::string &Data = gShare->Nodes[Path].Data;
  UINT64 End = std::min<UINT64>(Data.size(), gShare->ReadStop);
  UINT64 Count = At >= End ? 0 : std::min<UINT64>(*Size, End - At);
  Count = std::min(Count, gShare->MaxPerCall);
  memcpy(Buffer, Data.data() + std::min<UINT64>(At, Data.size()), Count);
  *Size = Count + gShare->Extra;
  return At >= End && End < Data.size() ? gShare->ReadFailure : gShare->Status;
}
EFI_STATUS Write(NW_SHARE_INFO *, NW_REMOTE_FILE *File, const void *Buffer, UINTN *Size,
                 UINT64 At) {
  std::string Path = Narrow(File->FileName);
  Recorded("write", Path, *Size, At);
  std::string &Data = gShare->Nodes[Path].Data;
  UINT64 Count = std::min<UINT64>(*Size, gShare->MaxPerCall);
  Data.resize(std::max<UINT64>(Data.size(), At + Count), '\0');
  memcpy(&Data[At], Buffer, Count);
  *Size = Count + gShare->Extra;
  return gShare->Status;
}
EFI_STATUS Close(NW_SHARE_INFO *, NW_REMOTE_FILE *File) {
  ZeroMem(File->FileId, sizeof(File->FileId));
  return Recorded("close", Narrow(File->FileName));
}
EFI_STATUS FsInfo(NW_SHARE_INFO *, EFI_FILE_SYSTEM_INFO *Info) {
  Info->VolumeSize = 3 * kMiB;
  Info->FreeSpace = kMiB;
  Info->BlockSize = 4096;
  Recorded("fsinfo", "");
  return gShare->FsInfoStatus;
}
EFI_STATUS FindNext(EFI_FILE_INFO **Entry) {
  if (gShare->Next >= gShare->Listing.size()) {
    return EFI_NOT_FOUND;
  }
  const std::string &Path = gShare->Listing[gShare->Next++];
  std::string Name = Path.substr(gShare->Prefix);
  UINTN Size = SIZE_OF_EFI_FILE_INFO + 2 * (Name.size() + 1);
  auto *Info = static_cast<EFI_FILE_INFO *>(AllocateZeroPool(std::max<UINTN>(Size, 88)));
  Info->Size = Size;
  std::copy(Name.begin(), Name.end(), Info->FileName);
  Fill(Info, gShare->Nodes[Path]);
  *Entry = Info;
  return EFI_SUCCESS;
}
// Lists the directory the volume stored in the share record.
EFI_STATUS FindFirst(NW_SHARE_INFO *Share, const CHAR16 *, EFI_FILE_INFO **Entry) {
  std::string Dir = Share->FilePath;
  Recorded("list", Dir);
  gShare->Listing.clear();
  gShare->Next = 0;
  std::string Prefix = Dir.empty() ? "" : Dir + "\\";
  gShare->Prefix = Prefix.size();
  for (const auto &Entry : gShare->Nodes) {
    const std::string &Path = Entry.first;
    if (Path.compare(0, Prefix.size(), Prefix) == 0 &&
        Path.find('\\', Prefix.size()) == std::string::npos) {
      gShare->Listing.push_back(Path);
    }
  }
  return gShare->Status != EFI_SUCCESS ? gShare->Status : FindNext(Entry);
}
EFI_STATUS Stat(NW_SHARE_INFO *, const CHAR16 *Path, EFI_FILE_INFO *Info) {
  Recorded("stat", Narrow(Path));
  auto Found = gShare->Nodes.find(Narrow(Path));
  if (Found == gShare->Nodes.end() || gShare->Status != EFI_SUCCESS) {
    return EFI_DEVICE_ERROR;
  }
  Fill(Info, Found->second);
  return EFI_SUCCESS;
}

const NW_BACKEND kScripted = {
    NW_BACKEND_REVISION, Ok,       Connect, Ok, Open, Read, Write, Close, FsInfo,
    FindFirst,           FindNext, Stat};

class ScriptedVolumeTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    gDriverDebugLevel = 0;
    gTotalByteRead = gWriteOffset = 0;
    gDirReadIndex = 0;
    gDirRewind = gDirFirstReadDone = 0;
    gShare = &Share;
    gNwBackend = &kScripted;
    ZeroMem(&Record, sizeof(Record));
    Record.sharename = const_cast<CHAR16 *>(u"share");
    Record.shareType = NW_SHARE_TYPE_CIFS;
    Quiet([&] {
      ASSERT_EQ(DetectInstallVolume(gImageHandle, "eng", &Record, u"127.0.0.1", u"u", u"p"),
                EFI_SUCCESS);
    });
    void *Interface = nullptr;
    ASSERT_EQ(gBS->HandleProtocol(gImageHandle, &gEfiSimpleFileSystemProtocolGuid, &Interface),
              EFI_SUCCESS);
    Volume = static_cast<NW_VOLUME *>(Interface);
    ASSERT_EQ(Quiet([&] { return Volume->Sfs.OpenVolume(&Volume->Sfs, &Root); }), EFI_SUCCESS);
    RootRecord = NwHandleOf(Root)->OpenFile;
    Share.Calls.clear();
  }

  void TearDown() override {
    if (Volume != nullptr) {
      Quiet([&] { Root->Close(Root); });
      EXPECT_EQ(RemoveInstalledVolume(Volume), EFI_SUCCESS);
    }
    gNwBackend = &gSMB2FsBackend;
    gShare = nullptr;
    EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
    HostImageTest::TearDown();
  }

  void Put(const std::string &Path, const std::string &Data, bool Directory = false) {
    Share.Nodes[Path] = {Data, Directory};
  }
  EFI_FILE_PROTOCOL *Open(const std::u16string &Path, UINT64 Mode = kRead, UINT64 Attributes = 0,
                          EFI_STATUS Expected = EFI_SUCCESS) {
    EFI_FILE_PROTOCOL *File = nullptr;
    EXPECT_EQ(Quiet([&] { return Root->Open(Root, &File, Path.c_str(), Mode, Attributes); }),
              Expected);
    return File;
  }
  EFI_STATUS OpenFrom(EFI_FILE_PROTOCOL *From, const std::u16string &Path, EFI_FILE_PROTOCOL **Out,
                      UINT64 Mode = kRead, UINT64 Attributes = 0) {
    return Quiet([&] { return From->Open(From, Out, Path.c_str(), Mode, Attributes); });
  }
  // One Read of up to Size bytes; the bytes it returned.
  std::string Read(EFI_FILE_PROTOCOL *File, UINTN Size, EFI_STATUS *Status = nullptr) {
    std::string Buffer(Size, '\0');
    EFI_STATUS Result = Quiet([&] { return File->Read(File, &Size, Buffer.data()); });
    if (Status != nullptr) {
      *Status = Result;
    } else {
      EXPECT_EQ(Result, EFI_SUCCESS);
    }
    return Buffer.substr(0, Size);
  }
  EFI_STATUS Write(EFI_FILE_PROTOCOL *File, std::string Data, UINTN *Size) {
    *Size = Data.size();
    return Quiet([&] { return File->Write(File, Size, Data.data()); });
  }
  void Close(EFI_FILE_PROTOCOL *File) {
    Quiet([&] { File->Close(File); });
  }
  std::vector<Call> CallsOf(const std::string &Op) {
    std::vector<Call> Out;
    for (const Call &C : Share.Calls) {
      if (C.Op == Op) {
        Out.push_back(C);
      }
    }
    return Out;
  }
  // The directory entry names delivered by Count Reads ("" at the end).
  std::vector<std::string> ReadNames(EFI_FILE_PROTOCOL *Dir, int Count) {
    std::vector<std::string> Names;
    for (int I = 0; I < Count; I++) {
      std::string Entry = Read(Dir, 512);
      Names.push_back(
          Entry.empty() ? "" : Narrow(reinterpret_cast<EFI_FILE_INFO *>(&Entry[0])->FileName));
    }
    return Names;
  }
  static UINT64 RecordedStatus() {
    Variable V = ReadVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid);
    UINT64 Value = ~0ULL;
    if (V.Data.size() == 40) {
      memcpy(&Value, V.Data.data(), sizeof(Value));
    }
    return Value;
  }

  static std::string Pattern(size_t Size) {
    std::string Data(Size, '\0');
    for (size_t I = 0; I < Size; I++) {
      Data[I] = static_cast<char>(I * 7 + I / 251);
    }
    return Data;
  }

  // Entries put straight into a directory's cached listing.
  struct SeedEntry {
    std::u16string Name;
    UINT64 Attribute;
    UINT64 Size;
  };
  void Seed(NW_OPEN_FILE *Directory, const std::vector<SeedEntry> &Entries) {
    for (const SeedEntry &E : Entries) {
      NW_DIRECTORY_ENTRY Entry = {};
      Entry.Attribute = E.Attribute;
      Entry.FileSize = Entry.PhysicalSize = E.Size;
      ASSERT_EQ(AddToDirList(Directory, &Entry, E.Name.c_str()), EFI_SUCCESS);
    }
  }
  // A child record of Directory, made from a cached entry of that name.
  NW_OPEN_FILE *Child(NW_OPEN_FILE *Directory, const std::u16string &Name) {
    NW_DIR_ENTRY *Entry = nullptr;
    EXPECT_TRUE(FindMatchingDirEntry(Directory, Name.c_str(), &Entry));
    NW_OPEN_FILE *Made = nullptr;
    EXPECT_EQ(CreateFHFromDirEntryList(Entry, Directory, &Made), EFI_SUCCESS);
    return Made;
  }
  EFI_FILE_PROTOCOL *NewHandle(NW_OPEN_FILE *Of, UINT64 Mode = 3) {
    NW_FILE_HANDLE *Handle = nullptr;
    EXPECT_EQ(CreateFileHandleInstance(Of, &Handle, Mode), EFI_SUCCESS);
    return &Handle->Protocol;
  }

  ScriptedShare Share;
  NW_SHARE_INFO Record;
  NW_OPEN_FILE *RootRecord = nullptr;
  NW_VOLUME *Volume = nullptr;
  EFI_FILE_PROTOCOL *Root = nullptr;
};

} // namespace
