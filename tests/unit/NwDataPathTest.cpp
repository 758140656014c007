// The volume's data path through the back-end table, with a scripted back
// end in place of the SMB2 client: a share held in memory whose every call
// is recorded. Reads (the 1 MiB cap, whole chunks, the process-wide offset),
// writes (requests of at most 64512 bytes at the never-reset offset),
// listings (n + 1 reads), information, answers the volume must not trust,
// renames to directory names, whole runs of the image and the outcome they
// record, the status record the network library keeps, and the login
// splitter.
#include "ScriptedVolume.h"

namespace {

using NwDataPathTest = ScriptedVolumeTest;

// ---------------------------------------------------------------------------
// Reads and writes
// ---------------------------------------------------------------------------
TEST_F(NwDataPathTest, ReadsReturnWholeChunksOfAtMostOneMiB) {
  const UINT64 Chunk = 64512;
  struct Case {
    const char *Name;
    UINT64 FileSize, MaxPerCall, Buffer;
    std::vector<UINT64> Sizes; // what successive Reads return
    size_t BackEndReads;       // calls the whole file takes
  } Cases[] = {
      {"whole calls", 3 * kMiB, ~0ULL, 2 * kMiB, {kMiB, kMiB, kMiB, 0, 0}, 3},
      // The first chunk sets the unit: 16 chunks fit 1 MiB, the rest waits.
      {"64512-byte calls",
       3 * kMiB,
       Chunk,
       2 * kMiB,
       {16 * Chunk, 16 * Chunk, 16 * Chunk, 3 * kMiB - 48 * Chunk, 0},
       49},
      {"small buffer", 10000, ~0ULL, 4096, {4096, 4096, 1808, 0}, 3},
  };
  // The root's listing is taken once: every file is there from the start.
  std::u16string Names[] = {u"f0", u"f1", u"f2"};
  for (const std::u16string &Name : Names) {
    Put(Narrow(Name.c_str()), Pattern(Cases[&Name - Names].FileSize));
  }
  for (const Case &C : Cases) {
    SCOPED_TRACE(C.Name);
    const std::u16string &Name = Names[&C - Cases];
    const std::string &Data = Share.Nodes[Narrow(Name.c_str())].Data;
    Share.MaxPerCall = C.MaxPerCall;
    Share.Calls.clear();
    EFI_FILE_PROTOCOL *File = Open(Name);
    std::string Got;
    std::vector<UINT64> Sizes;
    for (size_t I = 0; I < C.Sizes.size(); I++) {
      std::string Piece = Read(File, C.Buffer);
      Sizes.push_back(Piece.size());
      Got += Piece;
    }
    EXPECT_EQ(Sizes, C.Sizes);
    EXPECT_TRUE(Got == Data);
    std::vector<Call> Reads = CallsOf("read");
    ASSERT_EQ(Reads.size(), C.BackEndReads);
    UINT64 At = 0;
    for (const Call &R : Reads) { // each call at the offset where the last one ended
      EXPECT_EQ(R.Offset, At);
      At += std::min({R.Length, C.MaxPerCall, C.FileSize - At});
    }
    Close(File);
  }
}

TEST_F(NwDataPathTest, ReadOffsetIsProcessWideAndAClosedFileStartsOver) {
  const UINT64 Piece = 0x10000;
  std::string A = Pattern(4 * Piece), B = std::string(4 * Piece, 'b');
  Put("a.bin", A);
  Put("b.bin", B);
  EFI_FILE_PROTOCOL *FileA = Open(u"a.bin"), *FileB = Open(u"b.bin");
  // A position set on a file does not move its reads.
  Quiet([&] { EXPECT_EQ(FileA->SetPosition(FileA, 5), EFI_SUCCESS); });
  // Each read continues where the other file's read stopped.
  struct Step {
    EFI_FILE_PROTOCOL *File;
    const std::string *Data;
    UINT64 Offset;
  } Steps[] = {{FileA, &A, 0}, {FileB, &B, Piece}, {FileA, &A, 2 * Piece}, {FileB, &B, 3 * Piece}};
  for (const Step &S : Steps) {
    EXPECT_TRUE(Read(S.File, Piece) == S.Data->substr(S.Offset, Piece)) << S.Offset;
  }
  EXPECT_EQ(Read(FileA, Piece), "");
  Close(FileB); // closing either one starts every file over
  EXPECT_TRUE(Read(FileA, Piece) == A.substr(0, Piece));
  Close(FileA);
}

TEST_F(NwDataPathTest, WritesGoOutInRequestsOf64512AtAnOffsetNeverReset) {
  Put("d", "", true);
  EFI_FILE_PROTOCOL *File = Open(u"w.bin", kCreate);
  std::string First = Pattern(64512), Second = Pattern(64513);
  UINTN Size = 0;
  ASSERT_EQ(Write(File, First, &Size), EFI_SUCCESS);
  EXPECT_EQ(Size, 64512u);
  ASSERT_EQ(Write(File, Second, &Size), EFI_SUCCESS);
  EXPECT_EQ(Size, 64513u);
  Close(File);
  EXPECT_EQ(CallsOf("write"), (std::vector<Call>{{"write", "w.bin", 64512, 0},
                                                 {"write", "w.bin", 64512, 64512},
                                                 {"write", "w.bin", 1, 129024}}));
  EXPECT_TRUE(Share.Nodes["w.bin"].Data == First + Second);
  // A second file continues where the first ended.
  File = Open(u"x.bin", kCreate);
  ASSERT_EQ(Write(File, "x", &Size), EFI_SUCCESS);
  Close(File);
  EXPECT_EQ(Share.Nodes["x.bin"].Data, std::string(129025, '\0') + "x");
  // A directory takes writes and sends nothing.
  EFI_FILE_PROTOCOL *Dir = Open(u"d");
  Share.Calls.clear();
  ASSERT_EQ(Write(Dir, First, &Size), EFI_SUCCESS);
  EXPECT_TRUE(CallsOf("write").empty());
  Close(Dir);
}

// A back end that reports more than it moved, or no progress, ends the
// transfer with an error instead of being believed or looped on.
TEST_F(NwDataPathTest, TransferCountsBeyondTheRequestAreRefused) {
  struct Case {
    const char *Name;
    UINT64 MaxPerCall, Extra;
    bool Write;
    UINTN Length;
  } Cases[] = {{"read of more than asked", ~0ULL, 1, false, 100},
               {"write of more than asked", ~0ULL, 1, true, 100},
               {"chunked write without progress", 0, 0, true, 100000}};
  Put("f.bin", Pattern(1000));
  for (const Case &C : Cases) {
    SCOPED_TRACE(C.Name);
    Share.MaxPerCall = C.MaxPerCall;
    Share.Extra = C.Extra;
    EFI_FILE_PROTOCOL *File = Open(u"f.bin", C.Write ? kCreate : kRead);
    EFI_STATUS Status = EFI_SUCCESS;
    UINTN Size = C.Length;
    if (C.Write) {
      Status = Write(File, Pattern(C.Length), &Size);
      EXPECT_LE(Size, C.Length);
    } else {
      Read(File, C.Length, &Status);
    }
    EXPECT_EQ(Status, EFI_DEVICE_ERROR);
    Close(File);
  }
}

// ---------------------------------------------------------------------------
// Listings and information
// ---------------------------------------------------------------------------
TEST_F(NwDataPathTest, ListingOfNEntriesTakesNPlusOneReadsAndRewindsByOne) {
  Put("a", "1");
  Put("b", "22");
  Put("c", "333");
  Put("d", "", true);
  std::vector<std::string> Expected = {"a", "a", "b", "c", "d", ""};
  EXPECT_EQ(ReadNames(Root, 6), Expected);
  EXPECT_EQ(ReadNames(Root, 6), Expected); // the next listing starts over
  EXPECT_EQ(CallsOf("list"), (std::vector<Call>{{"list", "", 0, 0}})); // fetched once
  // A buffer too small: the size needed, and the same entry on the next Read.
  UINTN Size = 10;
  std::string Buffer(512, '\0');
  EXPECT_EQ(Quiet([&] { return Root->Read(Root, &Size, Buffer.data()); }), EFI_BUFFER_TOO_SMALL);
  EXPECT_EQ(Size, 84u + 2);
  EXPECT_EQ(ReadNames(Root, 3), (std::vector<std::string>{"a", "a", "b"}));
  // A directory is rewound by one entry only, and GetPosition is refused.
  Quiet([&] { EXPECT_EQ(Root->SetPosition(Root, 0), EFI_SUCCESS); });
  EXPECT_EQ(ReadNames(Root, 2), (std::vector<std::string>{"b", "c"}));
  UINT64 Position = 0;
  EXPECT_EQ(Root->GetPosition(Root, &Position), EFI_UNSUPPORTED);
  // A listing the back end cannot give fails the Read and the Open.
  EFI_FILE_PROTOCOL *Dir = Open(u"d");
  Share.Status = EFI_DEVICE_ERROR;
  EFI_STATUS Status = EFI_SUCCESS;
  Read(Dir, 512, &Status);
  EXPECT_TRUE(EFI_ERROR(Status));
  Open(u"d\\x", kRead, 0, EFI_DEVICE_ERROR);
  Share.Status = EFI_SUCCESS;
  Close(Dir);
}

TEST_F(NwDataPathTest, OpenAndInformationReachTheBackEndByPath) {
  Put("Dir", "", true);
  Put("Dir\\f.txt", Pattern(12345));
  EFI_FILE_PROTOCOL *File = Open(u"\\dir\\F.TXT");
  EXPECT_EQ(CallsOf("open"), (std::vector<Call>{{"open", "Dir\\f.txt", 0x2, 0}}));
  Open(u"Dir\\missing.txt", kRead, 0, EFI_NOT_FOUND); // not listed: not asked for
  EFI_FILE_PROTOCOL *Made = Open(u"Dir\\new.txt", kCreate);
  EXPECT_EQ(CallsOf("open").back(), (Call{"open", "Dir\\new.txt", 0x8, 0}));
  Close(Made);

  UINTN Size = 0;
  EXPECT_EQ(File->GetInfo(File, &gEfiFileInfoGuid, &Size, nullptr), EFI_BUFFER_TOO_SMALL);
  std::vector<UINT8> Info(Size);
  ASSERT_EQ(Quiet([&] { return File->GetInfo(File, &gEfiFileInfoGuid, &Size, Info.data()); }),
            EFI_SUCCESS);
  auto *FileInfo = reinterpret_cast<EFI_FILE_INFO *>(Info.data());
  EXPECT_EQ(FileInfo->FileSize, 12345u);
  EXPECT_EQ(Narrow(FileInfo->FileName), "f.txt");
  EXPECT_EQ(CallsOf("stat").back().Path, "Dir\\f.txt");
  // When the stat fails the listing's values stand.
  Share.Nodes["Dir\\f.txt"].Data = "short";
  Share.Status = EFI_DEVICE_ERROR;
  ASSERT_EQ(Quiet([&] { return File->GetInfo(File, &gEfiFileInfoGuid, &Size, Info.data()); }),
            EFI_SUCCESS);
  EXPECT_EQ(FileInfo->FileSize, 12345u);
  Share.Status = EFI_SUCCESS;

  // The volume's sizes come from OpenVolume's statistics; its label is CIFS.
  Size = 200;
  std::vector<UINT8> Fs(Size);
  ASSERT_EQ(File->GetInfo(File, &gEfiFileSystemInfoGuid, &Size, Fs.data()), EFI_SUCCESS);
  auto *FsInfo = reinterpret_cast<EFI_FILE_SYSTEM_INFO *>(Fs.data());
  EXPECT_EQ(FsInfo->VolumeSize, 3 * kMiB);
  EXPECT_EQ(FsInfo->FreeSpace, kMiB);
  EXPECT_EQ(std::u16string(FsInfo->VolumeLabel), u"CIFS");
  EXPECT_EQ(std::u16string(Volume->VolumeLabel),
            u"File System [KB]"); // built before the statistics
  // Firmware shells find the root by its empty name.
  Size = Info.size();
  ASSERT_EQ(Quiet([&] { return Root->GetInfo(Root, &gEfiFileInfoGuid, &Size, Info.data()); }),
            EFI_SUCCESS);
  EXPECT_EQ(Size, 84u);
  EXPECT_EQ(FileInfo->FileName[0], 0);
  Close(File);
}

// "", "." and ".." name the directories above a file, never a new name for
// it: the rename changes nothing, and the path stays open for later opens.
TEST_F(NwDataPathTest, RenameToADirectoryNameChangesNothing) {
  Put("dir", "", true);
  Put("dir\\f.img", "data");
  auto NameOf = [](EFI_FILE_PROTOCOL *File, std::vector<UINT8> *Info) {
    Info->assign(512, 0);
    UINTN Size = Info->size();
    Quiet([&] { return File->GetInfo(File, &gEfiFileInfoGuid, &Size, Info->data()); });
    return Narrow(reinterpret_cast<EFI_FILE_INFO *>(Info->data())->FileName);
  };
  for (const char16_t *Name : {u"", u".", u".."}) {
    SCOPED_TRACE(Narrow(Name));
    EFI_FILE_PROTOCOL *File = Open(u"dir\\f.img", 3);
    std::vector<UINT8> Info;
    ASSERT_EQ(NameOf(File, &Info), "f.img");
    Info = NamedInfo(Info, Name);
    EXPECT_EQ(
        Quiet([&] { return File->SetInfo(File, &gEfiFileInfoGuid, Info.size(), Info.data()); }),
        EFI_SUCCESS);
    EXPECT_EQ(NameOf(File, &Info), "f.img");
    EFI_FILE_PROTOCOL *Again = Open(u"dir\\f.img");
    EXPECT_EQ(NameOf(Again, &Info), "f.img");
    Close(Again);
    Close(File);
  }
}

// ---------------------------------------------------------------------------
// Whole runs of the image over the scripted share: VerifyStatus is 0 only
// when the file arrived whole
// ---------------------------------------------------------------------------
class OutcomeTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    gNwBackend = &kScripted;
  }
  void TearDown() override {
    gNwBackend = &gSMB2FsBackend;
    gShare = nullptr;
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
  const std::string Data(300, 'd');
  const char *const F = "f.img";
  struct Case {
    const char *Name;
    const Args &Line;
    const char *File; // the one file on the share
    ScriptedShare Share;
    int Status;
    const char *InRamfs; // whole in ramfs: afterwards, or null: nothing there
  } Cases[] = {
      {"import", Import, F, {}, 0, F},
      {"import, no data at all", Import, F, {.ReadStop = 0}, 7, nullptr},
      {"import, no data after a few bytes", Import, F, {.ReadStop = 10}, 7, nullptr},
      {"import, reset", Import, F, {.ReadStop = 10, .ReadFailure = EFI_DEVICE_ERROR}, 7, nullptr},
      {"import, no such file", Import, "other.img", {}, 0x0E, nullptr},
      {"catalog", Catalog, "catalog.xml.gz", {}, 0, "catalog.xml.gz"},
      {"catalog, cut short", Catalog, "catalog.xml.gz", {.ReadStop = 10}, 7, nullptr},
      {"export", Export, F, {}, 0, nullptr},
      {"export, short write", Export, F, {.MaxPerCall = 1}, 7, nullptr},
      {"mount", Mount, F, {}, 0, nullptr},
      {"mount, root does not open", Mount, F, {.FsInfoStatus = EFI_DEVICE_ERROR}, 7, nullptr},
  };
  gRealFreePool = gBS->FreePool;
  gBS->FreePool = CheckedFreePool;
  for (Case &C : Cases) {
    SCOPED_TRACE(C.Name);
    C.Share.Nodes[C.File].Data = Data;
    gShare = &C.Share;
    std::filesystem::remove_all(RamfsDir);
    WriteFile(RamfsDir + "/VelmorLog.xml", "log");
    std::vector<UINT8> Record(sizeof(PU_PROVISIONING_RECORD), 0);
    memcpy(Record.data() + offsetof(PU_PROVISIONING_RECORD, CifsCatalogPath), "CIFS:\\old", 9);
    WriteVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid, PROVISIONING_NV_ATTRIBUTES, Record);
    std::string Out;
    RunImage(C.Line, &Out);
    Variable Outcome = ReadVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid);
    EXPECT_EQ(Outcome.Data.at(0), C.Status) << Out;
    for (std::string Name : {F, "catalog.xml.gz"}) {
      bool Whole = C.InRamfs != nullptr && Name == C.InRamfs;
      EXPECT_EQ(ReadFile(RamfsDir + "/" + Name), Whole ? Data : "") << Name;
    }
    // A catalog copy that broke ends the search and leaves the place remembered.
    EXPECT_EQ(
        std::count(C.Share.Calls.begin(), C.Share.Calls.end(), Call{"list", "repository", 0, 0}),
        0);
    Variable Kept = ReadVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid);
    EXPECT_STREQ(reinterpret_cast<char *>(Kept.Data.data()) +
                     offsetof(PU_PROVISIONING_RECORD, CifsCatalogPath),
                 &C.Line == &Catalog && C.Status == 0 ? "CIFS:" : "CIFS:\\old");
    // The mount takes the root the shell-name lookup opened (two statistics
    // queries for a new root), or failed to open, and sends nothing else.
    if (&C.Line == &Mount) {
      EXPECT_EQ(C.Share.Calls, std::vector<Call>(C.Status == 0 ? 2 : 1, Call{"fsinfo", "", 0, 0}));
    }
  }
  gBS->FreePool = gRealFreePool;
  EXPECT_EQ(gSecretsFreed, 0);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

// ---------------------------------------------------------------------------
// The network library: the status record and the login splitter
// ---------------------------------------------------------------------------
TEST_F(NwDataPathTest, StatusRecordFollowsEveryRecordedOperation) {
  NW_REMOTE_FILE File = {};
  std::u16string Name = u"f.bin";
  File.FileName = Name.data();
  Put("f.bin", Pattern(100));
  UINT8 Buffer[100];
  UINT64 At = 0;
  UINTN Length = 100, Count = 0;
  struct Case {
    const char *Name;
    EFI_STATUS BackEnd;
    std::function<EFI_STATUS()> Run;
    EFI_STATUS Recorded;
    size_t Calls; // back-end calls it makes
  } Cases[] = {
      {"open", EFI_SUCCESS, [&] { return GEE_NWFOpen(&Record, &File, kRead, 0); }, EFI_SUCCESS, 1},
      {"failed read", EFI_DEVICE_ERROR,
       [&] { return GEE_NWFRead(&Record, &File, Buffer, &Length, &At, &Count); }, EFI_DEVICE_ERROR,
       1},
      {"read", EFI_SUCCESS,
       [&] { return GEE_NWFRead(&Record, &File, Buffer, &Length, &At, &Count); }, EFI_SUCCESS, 1},
      {"read without a count", EFI_SUCCESS,
       [&] { return GEE_NWFRead(&Record, &File, Buffer, &Length, &At, nullptr); },
       EFI_INVALID_PARAMETER, 0},
      {"failed write", EFI_DEVICE_ERROR,
       [&] { return GEE_NWFWrite(&Record, &File, Buffer, &Length, 0); }, EFI_DEVICE_ERROR, 1},
      {"file-system information", EFI_SUCCESS,
       [&] {
         EFI_FILE_SYSTEM_INFO Info;
         return GEE_NWGetFSInfo(&Record, &Info);
       },
       EFI_SUCCESS, 1},
      {"mkdir", EFI_DEVICE_ERROR, [&] { return GEE_NWMkdir(&Record, u"d"); }, EFI_SUCCESS, 0},
      {"remove", EFI_DEVICE_ERROR, [&] { return GEE_NWRemove(&Record, u"f.bin"); }, EFI_SUCCESS, 0},
      {"find close", EFI_DEVICE_ERROR, [&] { return GEE_NWFindClose(&Record, nullptr); },
       EFI_SUCCESS, 0},
      {"set size", EFI_DEVICE_ERROR, [&] { return GEE_NWFSetSize(&Record, &File, 4096); },
       EFI_SUCCESS, 0},
      {"commit", EFI_DEVICE_ERROR, [&] { return GEE_NWFCommit(&Record, &File, 0); }, EFI_SUCCESS,
       0},
  };
  for (const Case &C : Cases) {
    Quiet([] { SetOperationStatus(EFI_ABORTED); });
    Share.Status = C.BackEnd;
    Share.Calls.clear();
    EXPECT_EQ(Quiet(C.Run), C.Recorded) << C.Name;
    EXPECT_EQ(RecordedStatus(), C.Recorded) << C.Name;
    EXPECT_EQ(Share.Calls.size(), C.Calls) << C.Name;
  }
  Share.Status = EFI_SUCCESS;
  GEE_NWFClose(&Record, &File);
  // The rest of the record is kept as it was.
  Variable Before = ReadVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid);
  Before.Data[39] = 0x5A;
  ASSERT_EQ(WriteVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid, 2, Before.Data),
            EFI_SUCCESS);
  Quiet([] { SetOperationStatus(EFI_NOT_FOUND); });
  Variable After = ReadVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid);
  EXPECT_EQ(After.Attributes, 2u);
  EXPECT_EQ(After.Data[0], 14);
  EXPECT_EQ(After.Data[39], 0x5A);
}

using LoginSplitTest = HostImageTest;

TEST_F(LoginSplitTest, LoginsSplitAtTheirSeparatorsWithinTheirBuffers) {
  const std::string Full(256, 'u');
  struct Case {
    std::string Input;
    CHAR8 Separator; // 0: the splitter, '@' then '\'
    UINTN UserSize, DomainSize;
    EFI_STATUS Status;
    std::string User, Domain;
  } Cases[] = {
      {"alice@CORP", 0, 256, 256, EFI_SUCCESS, "alice", "CORP"},
      {"CORP\\bob", 0, 256, 256, EFI_SUCCESS, "bob", "CORP"},
      // '@' is tried first; the backslash stays with the user.
      {"CORP\\carol@WORK", 0, 256, 256, EFI_SUCCESS, "CORP\\carol", "WORK"},
      {"dave", 0, 256, 256, EFI_NOT_FOUND, "dave", ""},
      // Exactly the user size before '@': filled without a terminator.
      {Full + "@D", 0, 256, 256, EFI_SUCCESS, Full, "D"},
      {Full + "u@D", 0, 256, 256, EFI_SUCCESS, "", "D"},
      {"u@" + Full, 0, 256, 256, EFI_SUCCESS, "u", ""},
      // With '\' the domain (before) is measured against the user size and
      // the user (after) against the domain size.
      {std::string(20, 'd') + "\\" + std::string(10, 'u'), '\\', 32, 16, EFI_SUCCESS,
       std::string(10, 'u'), ""},
      {"dom\\" + std::string(20, 'u'), '\\', 32, 16, EFI_SUCCESS, "", "dom"},
  };
  gDriverDebugLevel = 0; // the splitter's lines need a level
  for (const Case &C : Cases) {
    std::vector<CHAR8> User(C.UserSize + 16, '#'), Domain(C.DomainSize + 16, '#');
    EFI_STATUS Status =
        C.Separator == 0 ? SplitUserAndDomain(C.Input.c_str(), C.UserSize, User.data(),
                                              C.DomainSize, Domain.data())
                         : SearchUserAndDomainSeparator(C.Input.c_str(), C.Separator, C.UserSize,
                                                        User.data(), C.DomainSize, Domain.data());
    EXPECT_EQ(Status, C.Status) << C.Input;
    EXPECT_EQ(std::string(User.data(), strnlen(User.data(), C.UserSize)), C.User) << C.Input;
    EXPECT_EQ(std::string(Domain.data(), strnlen(Domain.data(), C.DomainSize)), C.Domain)
        << C.Input;
    EXPECT_EQ(std::string(User.end() - 16, User.end()), std::string(16, '#')) << C.Input;
    EXPECT_EQ(std::string(Domain.end() - 16, Domain.end()), std::string(16, '#')) << C.Input;
  }
}

} // namespace
