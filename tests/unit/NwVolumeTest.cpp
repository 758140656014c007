// The network volume's own logic, without a back end: the counted list, path
// splitting and name folding, full paths, the walk over cached listings, the
// label and set-information rules, the network busy lock and the lifetime of
// the shared records under every order of open, close and delete. Listings
// are seeded into the records directly (the data path through the back-end
// table is NwDataPathTest's).
#include "ScriptedVolume.h"

namespace {

struct Item {
  NW_LIST_LINK Link;
  int Value;
};

// Fields of the packed records are compared by value: a reference to one
// may be misaligned.
template <typename T>
T Val(T Value) {
  return Value;
}

TEST(NwListTest, RefusesToUnlinkWhatIsNotOnTheList) {
  NW_LIST_HEAD A, B;
  NwListInit(&A);
  NwListInit(&B);
  Item One = {{}, 1}, Two = {{}, 2};
  NwListAppend(&A, &One.Link);
  NwListAppend(&B, &Two.Link);
  EXPECT_FALSE(NwListRemove(&A, &Two.Link));
  EXPECT_TRUE(NwListRemove(&A, &One.Link));
  EXPECT_FALSE(NwListRemove(&A, &One.Link)); // twice
  EXPECT_TRUE(NwListIsEmpty(&A));
  EXPECT_EQ(B.Count, 1u);
}

TEST(NwPathTest, ComponentsSplitOneAtATimeAndFoldOnlyAsciiLetters) {
  struct Case {
    std::u16string Path, Component, Rest;
    EFI_STATUS Status;
  } Cases[] = {{u"dir\\sub\\file", u"dir", u"sub\\file", EFI_SUCCESS},
               {u"file.txt", u"file.txt", u"", EFI_SUCCESS},
               {u"\\x", u"", u"x", EFI_SUCCESS},                  // empty between two separators
               {u"dir\\", u"", u"dir\\", EFI_INVALID_PARAMETER}}; // the cursor stays
  for (const Case &C : Cases) {
    CHAR16 Buffer[NW_MAX_REMAINING_PATH + 1] = {};
    const CHAR16 *Cursor = C.Path.c_str();
    EXPECT_EQ(GetNextCompName(&Cursor, Buffer), C.Status);
    if (C.Status == EFI_SUCCESS) {
      EXPECT_EQ(std::u16string(Buffer), C.Component);
    }
    EXPECT_EQ(std::u16string(Cursor), C.Rest);
  }
  EXPECT_TRUE(NwNamesEqual(u"Catalog.XML", u"cATALOG.xml"));
  EXPECT_FALSE(NwNamesEqual(u"caf\u00e9", u"CAF\u00c9")); // no folding beyond ASCII
  EXPECT_FALSE(NwNamesEqual(u"abc", u"abcd"));
  EXPECT_FALSE(NwNamesEqual(u"abcd", u"abc"));
  EXPECT_FALSE(NwNamesEqual(u"[", u"{")); // neighbours of the letter ranges
}

// ---------------------------------------------------------------------------
// The volume over the scripted share; listings seeded into the records
// ---------------------------------------------------------------------------
class NwVolumeTest : public ScriptedVolumeTest {
protected:
  std::u16string PathOf(NW_OPEN_FILE *Of) {
    CHAR16 *Path = nullptr;
    if (EFI_ERROR(Quiet([&] { return FindCurrentLocation(Of, &Path); }))) {
      return u"<error>";
    }
    std::u16string Out = Path;
    fsFreeMemory(Volume, Path);
    return Out;
  }
};

TEST_F(NwVolumeTest, FullPathsAreRelativeToTheShareRoot) {
  Seed(RootRecord, {{u"Dir", EFI_FILE_DIRECTORY, 0}});
  NW_OPEN_FILE *Dir = Child(RootRecord, u"Dir");
  Seed(Dir, {{u".", EFI_FILE_DIRECTORY, 0}, {u"..", EFI_FILE_DIRECTORY, 0}, {u"f.txt", 0x20, 5}});
  EXPECT_EQ(PathOf(RootRecord), u"");
  EXPECT_EQ(PathOf(Dir), u"Dir");
  EXPECT_EQ(PathOf(Child(Dir, u"f.txt")), u"Dir\\f.txt");
  // "." stands for the directory itself, ".." for its parent.
  EXPECT_EQ(PathOf(Child(Dir, u".")), u"Dir");
  EXPECT_EQ(PathOf(Child(Dir, u"..")), u"");
  Record.shareType = NW_SHARE_TYPE_NFS;
  EXPECT_EQ(PathOf(Child(Dir, u"f.txt")), u"Dir/f.txt");
}

TEST_F(NwVolumeTest, FullPathLongerThan512CharactersIsRefused) {
  std::u16string Long(300, u'x');
  Seed(RootRecord, {{Long, EFI_FILE_DIRECTORY, 0}});
  NW_OPEN_FILE *A = Child(RootRecord, Long);
  // The limit counts the path as "\a\b": 512 characters with the separator in
  // front, which the share's relative form leaves out.
  Seed(A, {{Long.substr(0, 210), EFI_FILE_DIRECTORY, 0}, {Long.substr(0, 211), 0, 0}});
  EXPECT_EQ(PathOf(Child(A, Long.substr(0, 210))).size(), 511u);
  CHAR16 *Path = nullptr;
  EFI_STATUS Status = EFI_SUCCESS;
  std::string Text =
      Console([&] { Status = FindCurrentLocation(Child(A, Long.substr(0, 211)), &Path); });
  EXPECT_EQ(Status, EFI_BUFFER_TOO_SMALL);
  EXPECT_NE(Text.find("Error!: File path length 513 is more than 512\n"), std::string::npos);
}

TEST_F(NwVolumeTest, WalkFollowsDotsCaseAndOpenRecords) {
  Seed(RootRecord, {{u"Tools", EFI_FILE_DIRECTORY, 0}, {u"Other", EFI_FILE_DIRECTORY, 0}});
  NW_OPEN_FILE *Tools = Child(RootRecord, u"Tools");
  Seed(Tools, {{u"Sub", EFI_FILE_DIRECTORY, 0}});
  NW_OPEN_FILE *Sub = Child(Tools, u"Sub");
  NW_OPEN_FILE *Other = Child(RootRecord, u"Other");
  // Handles held on the records keep them open whatever the closes below
  // do to the cached listings, so every step is found among open records.
  EFI_FILE_PROTOCOL *Held[] = {NewHandle(Tools), NewHandle(Sub), NewHandle(Other)};

  struct Case {
    std::u16string Path;
    NW_OPEN_FILE *Expected;
  } Cases[] = {
      {u"\\tools\\SUB", Sub},    {u"Tools\\.\\Sub", Sub},      {u"Other\\..\\Tools\\Sub", Sub},
      {u"..\\..\\Tools", Tools}, {u"Tools\\Sub\\", Sub},       {u"\\", RootRecord},
      {u".", RootRecord},        {u"\\Tools\\Sub\\..", Tools},
  };
  for (const Case &C : Cases) {
    EFI_FILE_PROTOCOL *Out = nullptr;
    ASSERT_EQ(OpenFrom(Root, C.Path, &Out), EFI_SUCCESS)
        << std::string(C.Path.begin(), C.Path.end());
    EXPECT_EQ(NwHandleOf(Out)->OpenFile, C.Expected);
    EXPECT_EQ(Out->Close(Out), EFI_SUCCESS);
  }
  // Relative to a handle on a subdirectory.
  EFI_FILE_PROTOCOL *Out = nullptr;
  ASSERT_EQ(OpenFrom(Held[0], u"sub", &Out), EFI_SUCCESS);
  EXPECT_EQ(std::u16string(NwHandleOf(Out)->FullPath), u"Tools\\Sub");
  Out->Close(Out);
  for (EFI_FILE_PROTOCOL *H : Held) {
    H->Close(H);
  }
}

TEST_F(NwVolumeTest, OpenRefusalsKeepTheirStatuses) {
  Seed(RootRecord,
       {{u"Dir", EFI_FILE_DIRECTORY, 0}, {u"X", EFI_FILE_DIRECTORY, 0}, {u"f.txt", 0x20, 3}});
  NW_OPEN_FILE *F = Child(RootRecord, u"f.txt");
  EFI_FILE_PROTOCOL *FileHandle = NewHandle(F);
  EFI_FILE_PROTOCOL *Out = nullptr;
  EXPECT_EQ(OpenFrom(Root, u"Dir", &Out, 2), EFI_INVALID_PARAMETER); // write without read
  EXPECT_EQ(OpenFrom(Root, u"Dir", &Out, EFI_FILE_MODE_CREATE | 1), EFI_INVALID_PARAMETER);
  EXPECT_EQ(OpenFrom(Root, u"Dir", &Out, 1, 0x40), EFI_NOT_FOUND); // bad attributes
  EXPECT_EQ(OpenFrom(Root, u"missing", &Out), EFI_NOT_FOUND);
  EXPECT_EQ(OpenFrom(Root, u"missing\\deeper", &Out, EFI_FILE_MODE_CREATE | 3), EFI_NOT_FOUND);
  EXPECT_EQ(OpenFrom(Root, u"X\\", &Out), EFI_NOT_FOUND); // too short to lose its backslash
  EXPECT_EQ(OpenFrom(Root, std::u16string(261, u'a'), &Out), EFI_NOT_FOUND);
  EXPECT_EQ(OpenFrom(FileHandle, u"anything", &Out), EFI_NOT_FOUND); // a file is no directory
  EXPECT_EQ(OpenFrom(Root, u"Dir\\\\x", &Out, EFI_FILE_MODE_CREATE | 3), EFI_NOT_FOUND);
  EXPECT_EQ(Quiet([&] { return Root->Open(Root, &Out, nullptr, 1, 0); }), EFI_NOT_FOUND);
  Volume->ReadOnly = 1;
  EXPECT_EQ(OpenFrom(Root, u"Dir", &Out, 3), EFI_WRITE_PROTECTED);
  EXPECT_EQ(OpenFrom(Root, u"Dir", &Out, 1), EFI_SUCCESS);
  Out->Close(Out);
  FileHandle->Close(FileHandle);
}

TEST_F(NwVolumeTest, CreatingADirectoryStaysLocalAndListsDotEntries) {
  Seed(RootRecord, {{u"a.txt", 0x20, 1}});
  EFI_FILE_PROTOCOL *Dir = nullptr;
  ASSERT_EQ(OpenFrom(Root, u"NewDir", &Dir, EFI_FILE_MODE_CREATE | 3, EFI_FILE_DIRECTORY),
            EFI_SUCCESS);
  NW_OPEN_FILE *Record = NwHandleOf(Dir)->OpenFile;
  EXPECT_TRUE(NwIsDirectory(Record));
  EXPECT_EQ(Val(Record->DirEntries.Count), 2u);
  EXPECT_EQ(ReadNames(Dir, 1), std::vector<std::string>{"."});
  NW_DIR_ENTRY *Entry = nullptr;
  EXPECT_TRUE(FindMatchingDirEntry(RootRecord, u"newdir", &Entry)); // now in the parent's listing
  EXPECT_EQ(Val(Record->Children.Count), 0u); // the "." and ".." records are not kept
  Dir->Close(Dir);
}

TEST_F(NwVolumeTest, LabelFromAListingEntryCountsCharactersNotBytes) {
  Volume->Valid = 0;
  ZeroMem(Volume->VolumeID, sizeof(Volume->VolumeID));
  Seed(RootRecord,
       {{u"dir", EFI_FILE_DIRECTORY | EFI_FILE_RESERVED, 0}, {u"MY.LABEL", EFI_FILE_RESERVED, 0}});
  CHAR16 Label[16] = {};
  UINTN Size = 4;
  EXPECT_EQ(GetVolumeLabel(Volume, &Size, Label), EFI_BUFFER_TOO_SMALL);
  EXPECT_EQ(Size, 16u);                                    // 2 x 7 + 2
  EXPECT_EQ(std::u16string(Volume->VolumeID), u"MYLABEL"); // adopted on the way
  Volume->Valid = 0;
  Size = sizeof(Label);
  EXPECT_EQ(GetVolumeLabel(Volume, &Size, Label), EFI_SUCCESS);
  EXPECT_EQ(std::u16string(Label), u"MYLABEL");
  EXPECT_EQ(Size, 7u);
}

TEST_F(NwVolumeTest, SetInfoGuardsTheRootAndTheBufferSizes) {
  EFI_FILE_PROTOCOL *H = Root;
  std::vector<UINT8> Buffer(120);
  auto *Info = reinterpret_cast<EFI_FILE_INFO *>(Buffer.data());
  Info->Size = Buffer.size();
  Info->Attribute = EFI_FILE_DIRECTORY;
  EXPECT_EQ(H->SetInfo(H, &gEfiFileInfoGuid, Buffer.size(), Info), EFI_ACCESS_DENIED);
  EXPECT_EQ(H->SetInfo(H, &gEfiFileInfoGuid, 79, Info), EFI_BAD_BUFFER_SIZE);
  EXPECT_EQ(H->SetInfo(H, &gEfiFileSystemInfoGuid, 37, Info), EFI_BAD_BUFFER_SIZE);
  const EFI_GUID Unknown = {1, 2, 3, {4, 5, 6, 7, 8, 9, 10, 11}};
  UINTN Size = Buffer.size();
  EXPECT_EQ(H->GetInfo(H, &Unknown, &Size, Buffer.data()), EFI_UNSUPPORTED);
  EXPECT_EQ(H->SetInfo(H, &Unknown, Size, Buffer.data()), EFI_UNSUPPORTED);
  CHAR16 NewLabel[] = u"SHARE2";
  EXPECT_EQ(H->SetInfo(H, &gEfiFileSystemVolumeLabelInfoIdGuid, sizeof(NewLabel), NewLabel),
            EFI_SUCCESS);
  EXPECT_EQ(std::u16string(Volume->VolumeID), u"SHARE2");
  CHAR16 TooLong[] = u"ABCDEFGHIJKLMNOP";
  EXPECT_EQ(H->SetInfo(H, &gEfiFileSystemVolumeLabelInfoIdGuid, sizeof(TooLong), TooLong),
            EFI_INVALID_PARAMETER);
  Volume->ReadOnly = 1;
  EXPECT_EQ(H->SetInfo(H, &gEfiFileSystemVolumeLabelInfoIdGuid, sizeof(NewLabel), NewLabel),
            EFI_WRITE_PROTECTED);
}

// ---------------------------------------------------------------------------
// Record lifetime
// ---------------------------------------------------------------------------
TEST_F(NwVolumeTest, RecordInUseIsNeverFreed) {
  Seed(RootRecord, {{u"D", EFI_FILE_DIRECTORY, 0}, {u"L", EFI_FILE_DIRECTORY, 0}});
  NW_OPEN_FILE *D = Child(RootRecord, u"D");
  EXPECT_EQ(ReleaseOpenFile(RootRecord), EFI_ACCESS_DENIED);
  EFI_FILE_PROTOCOL *H = NewHandle(D);
  EXPECT_EQ(ReleaseOpenFile(D), EFI_ACCESS_DENIED); // held by a handle
  EXPECT_EQ(Val(D->HandleCount), 1);
  Seed(D, {{u"x", 0x20, 1}});
  NW_OPEN_FILE *X = Child(D, u"x");
  EXPECT_EQ(H->Close(H), EFI_SUCCESS);
  EXPECT_EQ(Val(D->DirEntries.Count), 0u);          // the close dropped D's listing...
  EXPECT_EQ(ReleaseOpenFile(D), EFI_ACCESS_DENIED); // ...but D still has a child
  EXPECT_EQ(Val(D->Children.Count), 1u);
  UINT64 Records = Volume->OpenFiles.Count;
  EXPECT_EQ(ReleaseOpenFile(X), EFI_SUCCESS); // X, and D that only stayed for it
  EXPECT_EQ(Val(Volume->OpenFiles.Count), Records - 2);
  // A record held only by its cached listing.
  Seed(RootRecord, {{u"L", EFI_FILE_DIRECTORY, 0}});
  NW_OPEN_FILE *L = Child(RootRecord, u"L");
  Seed(L, {{u"y", 0x20, 1}});
  EXPECT_EQ(ReleaseOpenFile(L), EFI_ACCESS_DENIED);
  DiscardDirEntries(L);
  EXPECT_EQ(ReleaseOpenFile(L), EFI_SUCCESS);
  EXPECT_EQ(Val(RootRecord->Children.Count), 0u);
}

TEST_F(NwVolumeTest, DeleteThroughOneHandleInvalidatesTheOthers) {
  Seed(RootRecord, {{u"D", EFI_FILE_DIRECTORY, 0}});
  EFI_FILE_PROTOCOL *A = nullptr, *B = nullptr, *C = nullptr;
  ASSERT_EQ(OpenFrom(Root, u"D", &A), EFI_SUCCESS);
  ASSERT_EQ(OpenFrom(Root, u"D", &B), EFI_SUCCESS);
  ASSERT_EQ(OpenFrom(Root, u"d", &C), EFI_SUCCESS);
  NW_OPEN_FILE *D = NwHandleOf(A)->OpenFile;
  EXPECT_EQ(NwHandleOf(B)->OpenFile, D);
  EXPECT_EQ(Val(D->HandleCount), 3);
  EXPECT_EQ(Quiet([&] { return B->Delete(B); }), EFI_SUCCESS);
  UINTN Size = 100;
  UINT8 Buffer[100];
  UINT64 Position = 0;
  EFI_FILE_PROTOCOL *Out = nullptr;
  for (EFI_FILE_PROTOCOL *H : {A, C}) {
    std::string Text = Console([&] {
      EXPECT_EQ(H->Read(H, &Size, Buffer), EFI_NOT_FOUND);
      EXPECT_EQ(H->GetInfo(H, &gEfiFileInfoGuid, &Size, Buffer), EFI_NOT_FOUND);
      EXPECT_EQ(H->SetInfo(H, &gEfiFileInfoGuid, Size, Buffer), EFI_NOT_FOUND);
      EXPECT_EQ(H->SetPosition(H, 0), EFI_NOT_FOUND);
      EXPECT_EQ(H->GetPosition(H, &Position), EFI_NOT_FOUND);
      EXPECT_EQ(H->Flush(H), EFI_NOT_FOUND);
      EXPECT_EQ(H->Open(H, &Out, u".", 1, 0), EFI_NOT_FOUND);
      EXPECT_EQ(H->Delete(H), EFI_NOT_FOUND);
    });
    // Each refusal is reported under the operation's own name.
    EXPECT_NE(Text.find("Function: ReadFileHandle, Line no.: = "), std::string::npos);
    EXPECT_EQ(Count(Text, " - ValidateCurrentStatus failed!, Status = 14 (0xe)\n"), 5u);
  }
  EXPECT_EQ(A->Close(A), EFI_SUCCESS);
  EXPECT_EQ(C->Close(C), EFI_SUCCESS);
  EXPECT_EQ(Val(Volume->FileHandles.Count), 1u);
  EXPECT_EQ(Val(RootRecord->Children.Count), 0u);
}

// A rename moves the handle to a record of the new name; the old record
// goes, nothing is asked of the share.
TEST_F(NwVolumeTest, RenamingADirectoryMovesTheHandle) {
  Seed(RootRecord, {{u"Old", EFI_FILE_DIRECTORY, 0}});
  EFI_FILE_PROTOCOL *Dir = nullptr;
  ASSERT_EQ(OpenFrom(Root, u"Old", &Dir, 3), EFI_SUCCESS);
  NW_OPEN_FILE *Old = NwHandleOf(Dir)->OpenFile;
  std::u16string NewName = u"Renamed";
  std::vector<UINT8> Info = NamedInfo({}, NewName);
  auto *Request = reinterpret_cast<EFI_FILE_INFO *>(Info.data());
  Request->Attribute = EFI_FILE_DIRECTORY;
  ASSERT_EQ(Quiet([&] { return Dir->SetInfo(Dir, &gEfiFileInfoGuid, Info.size(), Info.data()); }),
            EFI_SUCCESS);
  NW_OPEN_FILE *New = NwHandleOf(Dir)->OpenFile;
  EXPECT_NE(New, Old);
  EXPECT_EQ(std::u16string(New->FileName), NewName);
  EXPECT_EQ(std::u16string(NwHandleOf(Dir)->FullPath), NewName);
  EXPECT_EQ(Val(New->HandleCount), 1);
  EXPECT_EQ(Val(New->DirectoryEntry.Attribute), EFI_FILE_DIRECTORY | EFI_FILE_ARCHIVE);
  EXPECT_EQ(Val(RootRecord->Children.Count), 1u); // the old record is gone
  EXPECT_EQ(Val(Volume->FileHandles.Count), 2u);
  // The size of a directory cannot change.
  Request->FileSize = 10;
  EXPECT_EQ(Quiet([&] { return Dir->SetInfo(Dir, &gEfiFileInfoGuid, Info.size(), Info.data()); }),
            EFI_ACCESS_DENIED);
  Dir->Close(Dir);
}

TEST_F(NwVolumeTest, DeleteRefusalsCloseTheHandle) {
  Seed(RootRecord, {{u"Full", EFI_FILE_DIRECTORY, 0},
                    {u"Empty", EFI_FILE_DIRECTORY, 0},
                    {u"Locked", EFI_FILE_DIRECTORY | EFI_FILE_READ_ONLY | EFI_FILE_ARCHIVE, 0}});
  NW_OPEN_FILE *Full = Child(RootRecord, u"Full");
  Seed(Full, {{u".", 0x10, 0}, {u"..", 0x10, 0}, {u"x", 0x20, 1}});
  NW_OPEN_FILE *Empty = Child(RootRecord, u"Empty");
  Seed(Empty, {{u".", 0x10, 0}, {u"..", 0x10, 0}});
  UINT64 Handles = Volume->FileHandles.Count;
  struct Case {
    NW_OPEN_FILE *Record;
    EFI_STATUS Expected;
  } Cases[] = {{Full, EFI_WARN_DELETE_FAILURE}, // first: any close drops other listings
               {RootRecord, EFI_WARN_DELETE_FAILURE},
               {Child(RootRecord, u"Locked"), EFI_WARN_DELETE_FAILURE},
               {Empty, EFI_SUCCESS}};
  for (const Case &C : Cases) {
    EFI_FILE_PROTOCOL *H = NewHandle(C.Record);
    EXPECT_EQ(Quiet([&] { return H->Delete(H); }), C.Expected);
    EXPECT_EQ(Val(Volume->FileHandles.Count), Handles); // closed either way
  }
}

// Handles on a directory D and on its child E closed in every order, or D
// deleted first through one of them while E is open (D's record then stays
// for its child, and the other handle on D is no longer valid): every record
// and handle goes, exactly once.
TEST_F(NwVolumeTest, ClosesAndDeletesInEveryOrderLeaveNothingBehind) {
  Seed(RootRecord, {{u"D", EFI_FILE_DIRECTORY, 0}});
  const UINT64 BytesAtStart = Volume->AllocatedBytes;
  const struct {
    bool Delete; // through H[0], before the closes
    std::vector<int> Closes;
  } Cases[] = {{false, {0, 1, 2, 3}}, {false, {3, 2, 1, 0}}, {false, {1, 0, 2, 3}},
               {false, {2, 1, 3, 0}}, {true, {1, 2, 3}},     {true, {3, 2, 1}}};
  for (const auto &C : Cases) {
    EFI_FILE_PROTOCOL *H[4] = {};
    ASSERT_EQ(OpenFrom(Root, u"D", &H[0], 3), EFI_SUCCESS);
    NW_OPEN_FILE *D = NwHandleOf(H[0])->OpenFile;
    Seed(D, {{u"E", EFI_FILE_DIRECTORY, 0}});
    ASSERT_EQ(OpenFrom(H[0], u"E", &H[1]), EFI_SUCCESS);
    ASSERT_EQ(OpenFrom(Root, u"D\\E", &H[2]), EFI_SUCCESS);
    ASSERT_EQ(OpenFrom(Root, u"d", &H[3]), EFI_SUCCESS);
    if (C.Delete) {
      DiscardDirEntries(D); // D's listing is not cached: deletable
      EXPECT_EQ(Quiet([&] { return H[0]->Delete(H[0]); }), EFI_SUCCESS);
      EXPECT_EQ(Val(NwHandleOf(H[3])->OpenFile), nullptr);
      EXPECT_EQ(Val(D->HandleCount), 0);
      EXPECT_EQ(Val(NwHandleOf(H[1])->OpenFile->Parent), D);
    }
    for (int I : C.Closes) {
      Quiet([&] { EXPECT_EQ(H[I]->Close(H[I]), EFI_SUCCESS); });
    }
    // Unless deleted, D may stay for its cached listing; it goes now.
    NW_OPEN_FILE *Left = nullptr;
    if (!C.Delete && !EFI_ERROR(FindMatchingFH(Volume, u"D", RootRecord, &Left))) {
      DiscardDirEntries(Left);
      EXPECT_EQ(ReleaseOpenFile(Left), EFI_SUCCESS);
    }
    DiscardDirEntries(RootRecord);
    Seed(RootRecord, {{u"D", EFI_FILE_DIRECTORY, 0}});
    EXPECT_EQ(Val(Volume->FileHandles.Count), 1u);
    EXPECT_EQ(Val(Volume->OpenFiles.Count), 1u);
    EXPECT_EQ(Val(Volume->AllocatedBytes), BytesAtStart);
  }
}

TEST_F(NwVolumeTest, BusyLockIsTakenOnceAndWaitedForOnItsEvent) {
  UINT8 Busy = 0;
  EFI_EVENT Event = nullptr;
  EXPECT_TRUE(AcquireNetworkBusyLock(&Busy, &Event, FALSE));
  EFI_EVENT Held = Event;
  ASSERT_NE(Held, nullptr);
  // Held: a try fails at once, and so does a wait that nothing could end.
  EXPECT_FALSE(AcquireNetworkBusyLock(&Busy, &Event, FALSE));
  EXPECT_FALSE(AcquireNetworkBusyLock(&Busy, &Event, TRUE));
  EXPECT_EQ(Busy, 1);
  EXPECT_EQ(Event, Held);
  EXPECT_FALSE(ReleaseNetworkBusyLock(&Busy, &Event));
  EXPECT_EQ(Busy, 0);
  EXPECT_EQ(Event, nullptr);
  EXPECT_EQ(gBS->CheckEvent(Held), EFI_INVALID_PARAMETER); // closed
  EXPECT_FALSE(ReleaseNetworkBusyLock(&Busy, &Event));     // a free lock: nothing
}

TEST_F(NwVolumeTest, HandleAllocationFailureLeavesTheRecordAsItWas) {
  UINT64 Bytes = Volume->AllocatedBytes;
  HostPoolFailAfter(0);
  NW_FILE_HANDLE *H = nullptr;
  std::string Text = Console(
      [&] { EXPECT_EQ(CreateFileHandleInstance(RootRecord, &H, 3), EFI_OUT_OF_RESOURCES); });
  HostPoolFailAfter(UINT64_MAX);
  EXPECT_NE(Text.find("CreateFileHandleInstance: Memory allocation failed!\n"), std::string::npos);
  EXPECT_EQ(Val(RootRecord->HandleCount), 1);
  EXPECT_EQ(Val(Volume->FileHandles.Count), 1u);
  EXPECT_EQ(Val(Volume->AllocatedBytes), Bytes);
}

TEST_F(NwVolumeTest, RemovingTheVolumeFreesHandlesStillOpen) {
  Seed(RootRecord, {{u"D", EFI_FILE_DIRECTORY, 0}});
  EFI_FILE_PROTOCOL *Left = nullptr;
  ASSERT_EQ(OpenFrom(Root, u"D", &Left), EFI_SUCCESS);
  ASSERT_EQ(RemoveInstalledVolume(Volume), EFI_SUCCESS);
  Volume = nullptr;
  void *Interface = nullptr;
  EXPECT_EQ(gBS->HandleProtocol(gImageHandle, &gEfiSimpleFileSystemProtocolGuid, &Interface),
            EFI_UNSUPPORTED);
  // TearDown checks that the pool is back where it started.
}

} // namespace
