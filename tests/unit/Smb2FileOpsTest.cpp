// The SMB2 file operations' requests as they go on the wire, the storing of
// information answers, the walk of directory answers into nodes, and the
// adapter's UEFI view of them.
#include "Smb2FileScript.h"

#include <string.h>

namespace {

using namespace FileScript;
using MockSmb::Bytes;
using MockSmb::GetLe16;
using MockSmb::GetLe32;
using MockSmb::GetLe64;

// ---------------------------------------------------------------------------
// Building requests (no server needed)
// ---------------------------------------------------------------------------
class Smb2FileRequestTest : public Smb2HostTest {
protected:
  void SetUp() override {
    Smb2HostTest::SetUp();
    ZeroMem(&Access, sizeof(Access));
    TransactDetails.DialectRevision = SMB2_DIALECT_210;
    TransactDetails.ServerCapabilities = SMB2_GLOBAL_CAP_LEASING;
    TransactDetails.MessageId = 7;
    TransactDetails.TreeId = 5;
    TransactDetails.SessionId = 0x1122334455667788ULL;
  }

  void TearDown() override {
    SMB2FreeCreateContexts(&Access);
    FreePool(Access.DirInfoPtr);
    FreePool(Access.FullDirInfoPtr);
    ExpectNoPoolLeak();
    Smb2HostTest::TearDown();
  }

  struct Built {
    EFI_STATUS Status;
    SMB2_CREATE_REQUEST Packet;
    std::vector<UINT8> Name;
    UINT32 Total;
    std::string Out;
  };
  Built BuildCreate(const std::string &FileName, UINT8 Oplock) {
    ZeroMem(Access.FileName, sizeof(Access.FileName));
    strncpy(Access.FileName, FileName.c_str(), sizeof(Access.FileName) - 1);
    Access.RequestedOplockLevel = Oplock;
    Built B = {};
    UINT8 *Name = nullptr;
    UINT32 NameSize = 0;
    B.Out = Console([&] {
      B.Status = SMB2CreateContextRequestPacketConstruct(&B.Packet, &TransactDetails, &Access,
                                                         &Name, &NameSize, &B.Total);
    });
    if (Name != nullptr) {
      B.Name.assign(Name, Name + NameSize);
      FreePool(Name);
    }
    return B;
  }

  FILE_ACCESS_DETAILS Access;
};

TEST_F(Smb2FileRequestTest, CreateNameLengthsAndPadding) {
  Built Root = BuildCreate("", 0);
  ASSERT_EQ(Root.Status, EFI_SUCCESS);
  EXPECT_EQ(Root.Total, 126u);
  EXPECT_TRUE(Root.Name.empty());
  EXPECT_EQ(+Root.Packet.NameLength, 0);

  Built Five = BuildCreate("a.txt", 0);
  EXPECT_EQ(+Five.Packet.NameLength, 10);
  ASSERT_EQ(Five.Name.size(), 16u);
  EXPECT_EQ(Five.Total, 124u + 16 + 2);
  EXPECT_EQ(Bytes(Five.Name.begin(), Five.Name.begin() + 10), MockSmb::Utf16("a.txt"));
  EXPECT_EQ(Five.Name[10] | Five.Name[15], 0);

  Built Longest = BuildCreate(std::string(254, 'n'), 0);
  ASSERT_EQ(Longest.Status, EFI_SUCCESS);
  EXPECT_EQ(+Longest.Packet.NameLength, 508);
  EXPECT_EQ(Longest.Name.size(), 512u);

  Built TooLong = BuildCreate(std::string(255, 'n'), 0);
  EXPECT_EQ(TooLong.Status, EFI_INVALID_PARAMETER);
  EXPECT_TRUE(Contains(TooLong.Out, "Filename length 255 is longer than expected length 255\n"))
      << TooLong.Out;
  EXPECT_TRUE(TooLong.Name.empty());
}

TEST_F(Smb2FileRequestTest, CreateContextsFollowTheOplockLevelAndTheServersLeasing) {
  struct Case {
    UINT8 Oplock;
    UINT32 Capabilities;
    UINT32 ContextsLength;
    bool Offset;
    UINT32 LeaseState;
  } Cases[] = {
      {0, SMB2_GLOBAL_CAP_LEASING, 0, false, 0},
      {1, SMB2_GLOBAL_CAP_LEASING, 56, true, 1},
      {8, SMB2_GLOBAL_CAP_LEASING, 56, true, 5},
      {9, SMB2_GLOBAL_CAP_LEASING, 96, true, 7},
      {8, 0, 0, false, 0},
      // Batch on a server without leasing: 40 bytes counted, offset left 0.
      {9, 0, 40, false, 0},
  };
  for (const Case &C : Cases) {
    SMB2FreeCreateContexts(&Access);
    TransactDetails.ServerCapabilities = C.Capabilities;
    Built B = BuildCreate("f.txt", C.Oplock);
    ASSERT_EQ(B.Status, EFI_SUCCESS);
    SCOPED_TRACE(testing::Message() << "oplock " << +C.Oplock << " caps " << C.Capabilities);
    EXPECT_EQ(+B.Packet.CreateContextsLength, C.ContextsLength);
    EXPECT_EQ(+B.Packet.CreateContextsOffset, C.Offset ? 120u + 16 : 0u);
    EXPECT_EQ(B.Total, 124u + 16 + C.ContextsLength + 2);
    if (C.LeaseState != 0) {
      const auto *Lease = reinterpret_cast<const SMB2_CREATE_LEASE_CONTEXT *>(Access.LeaseContext);
      ASSERT_NE(Lease, nullptr);
      EXPECT_EQ(+Access.LeaseContextLength, 56u);
      EXPECT_EQ(std::string(Lease->Header.Name, 4), "RqLs");
      EXPECT_EQ(+Lease->Header.DataLength, 32u);
      EXPECT_EQ(+Lease->LeaseKey[0], C.Oplock + 1);
      EXPECT_EQ(+Lease->LeaseState, C.LeaseState);
      EXPECT_EQ(+Lease->Header.Next, C.Oplock == 9 ? 56u : 0u);
    }
    if (C.Oplock == 9) {
      const auto *Durable =
          reinterpret_cast<const SMB2_CREATE_DURABLE_CONTEXT *>(Access.DurableContext);
      ASSERT_NE(Durable, nullptr);
      EXPECT_EQ(std::string(Durable->Header.Name, 4), "DHnQ");
      EXPECT_EQ(+Durable->Header.DataLength, 16u);
      EXPECT_EQ(+Access.DurableContextLength, 40u);
    }
  }
}

// ---------------------------------------------------------------------------
// Storing information answers and walking directory answers
// ---------------------------------------------------------------------------
TEST_F(Smb2FileRequestTest, InformationAnswersLandInTheirOwnFields) {
  SMB2_QUERY_RESPONSE Packet = {};
  QUERY_DETAILS Query = {};
  auto Verify = [&](UINT8 Type, UINT8 Class, Bytes Output) {
    Query.InfoType = Type;
    Query.FileInfoClass = Class;
    Packet.Body.OutputBufferLength = static_cast<UINT32>(Output.size());
    EFI_STATUS Status = EFI_SUCCESS;
    Console([&] { Status = SMB2VerifyInfoStructure(&Packet, Output.data(), &Query, &Access); });
    EXPECT_EQ(Access.RawFileInfo == nullptr, Status != EFI_SUCCESS);
    return Status;
  };
  Bytes All(104);
  for (size_t I = 0; I < All.size(); I++) {
    All[I] = static_cast<UINT8>(I + 1);
  }
  Access.IndexNumber = 99;
  ASSERT_EQ(Verify(1, 18, All), EFI_SUCCESS);
  EXPECT_EQ(CompareMem(&Access.FileInfo, All.data(), 104), 0);
  EXPECT_EQ(+Access.IndexNumber, 99u); // class 6 has its own place

  Bytes Standard(24, 0xEE);
  ASSERT_EQ(Verify(1, 5, Standard), EFI_SUCCESS);
  EXPECT_EQ(+Access.FileInfo.EndOfFile, 0xEEEEEEEEEEEEEEEEULL);
  EXPECT_EQ(+Access.FileInfo.FileAttributes, GetLe32(All, 32)); // basic part untouched
  EXPECT_EQ(+Access.FileInfo.InternalIndexNumber, GetLe64(All, 64));

  // Unknown classes and types are refused and change nothing; so is an
  // answer shorter than its class.
  Access.RawFileInfo = nullptr;
  FILE_ACCESS_DETAILS Before = Access;
  EXPECT_EQ(Verify(1, 7, Bytes(64, 1)), EFI_NOT_FOUND);
  EXPECT_EQ(Verify(3, 1, Bytes(64, 1)), EFI_NOT_FOUND);
  EXPECT_EQ(Verify(2, 1, Bytes(64, 1)), EFI_NOT_FOUND);
  EXPECT_EQ(Verify(1, 4, Bytes(39, 1)), EFI_PROTOCOL_ERROR);
  EXPECT_EQ(Verify(1, 8, Bytes(3, 1)), EFI_PROTOCOL_ERROR);
  EXPECT_EQ(CompareMem(&Before, &Access, sizeof(Access)), 0);

  ASSERT_EQ(Verify(2, 3, Concat({Le(1000, 8), Le(250, 8), Le(16, 4), Le(512, 4)})), EFI_SUCCESS);
  EXPECT_EQ(+Access.FsSize.TotalAllocationUnits, 1000u);
  EXPECT_EQ(+Access.FsSize.AvailableAllocationUnits, 250u);
  EXPECT_EQ(+Access.FsSize.SectorsPerAllocationUnit, 16u);
  EXPECT_EQ(+Access.FsSize.BytesPerSector, 512u);

  // Directory answers are copied; a new copy releases the one before.
  ASSERT_EQ(Verify(1, 2, Bytes(300, 7)), EFI_SUCCESS);
  UINT64 Blocks = HostPoolOutstanding();
  ASSERT_EQ(Verify(1, 2, Bytes(100, 8)), EFI_SUCCESS);
  EXPECT_EQ(HostPoolOutstanding(), Blocks);
  EXPECT_EQ(+Access.FullDirInfoLength, 100u);
  EXPECT_EQ(Access.FullDirInfoPtr[99], 8);
  EXPECT_EQ(Access.FullDirInfoPtr[100 + SMB2_DIR_INFO_SLACK - 1], 0);
  ASSERT_EQ(Verify(1, 1, Bytes(10, 9)), EFI_SUCCESS);
  EXPECT_EQ(+Access.DirInfoLength, 10u);
}

TEST_F(Smb2FileRequestTest, DirectoryEntriesAsFileInfo) {
  SMB2_DIR_NODE *Node = nullptr;
  ASSERT_EQ(SMB2_CreateDirNode(&Node, 8), EFI_SUCCESS);
  Bytes Entry = DirEntry("ab", 0, 777, 0x80);
  ASSERT_EQ(SMB2_PopulateDirInfo(Entry.data(), Node), EFI_SUCCESS);
  UINT64 Bytes0 = HostPoolOutstandingBytes();
  EFI_FILE_INFO *Info = nullptr;
  ASSERT_EQ(SMB2_PopulateDirFileInfo(Node, &Info), EFI_SUCCESS);
  // (4 name bytes + 1) x 2 + 80, and never less than the 88 bytes the
  // volume copies.
  EXPECT_EQ(+Info->Size, 90u);
  EXPECT_GE(HostPoolOutstandingBytes() - Bytes0, 90u);
  EXPECT_EQ(+Info->FileSize, 777u);
  EXPECT_EQ(+Info->PhysicalSize, 4096u);
  EXPECT_EQ(+Info->Attribute, EFI_FILE_SYSTEM);
  EXPECT_EQ(std::u16string(Info->FileName), u"ab");
  for (EFI_TIME T : {Info->CreateTime, Info->LastAccessTime, Info->ModificationTime}) {
    EXPECT_EQ(T.Year * 10000 + T.Month * 100 + T.Day, 20180101);
    EXPECT_EQ(T.Hour * 10000 + T.Minute * 100 + T.Second + T.Nanosecond + T.TimeZone, 101010);
  }
  FreePool(Info);

  // Directory, hidden, archive and read-only map across; system and the
  // rest are dropped.
  Bytes Flags = DirEntry("", 0, 0, 0x33 | 0x04 | 0x100);
  ASSERT_EQ(SMB2_PopulateDirInfo(Flags.data(), Node), EFI_SUCCESS);
  ASSERT_EQ(SMB2_PopulateDirFileInfo(Node, &Info), EFI_SUCCESS);
  EXPECT_EQ(+Info->Attribute,
            EFI_FILE_DIRECTORY | EFI_FILE_HIDDEN | EFI_FILE_ARCHIVE | EFI_FILE_READ_ONLY);
  FreePool(Info);
  Bytes Short = DirEntry("", 0);
  ASSERT_EQ(SMB2_PopulateDirInfo(Short.data(), Node), EFI_SUCCESS);
  Bytes0 = HostPoolOutstandingBytes();
  ASSERT_EQ(SMB2_PopulateDirFileInfo(Node, &Info), EFI_SUCCESS);
  EXPECT_EQ(+Info->Size, 82u);
  EXPECT_GE(HostPoolOutstandingBytes() - Bytes0, SMB2_FS_MIN_FILE_INFO_ALLOCATION);
  FreePool(Info);
  Node->FileNameLength = 511;
  Console([&] { EXPECT_EQ(SMB2_PopulateDirFileInfo(Node, &Info), EFI_BUFFER_TOO_SMALL); });
  FreePool(Node);
}

// ---------------------------------------------------------------------------
// On the wire, against the scripted server
// ---------------------------------------------------------------------------
class Smb2FileWireTest : public ScriptedShareTest {};

TEST_F(Smb2FileWireTest, ContextsGoOutBoundedByTheirMessage) {
  ScriptConnect(SMB2_DIALECT_210, 6);
  for (int I = 0; I < 2; I++) {
    Expect([](uint64_t Id) { return CreateAnswer(Id); });
  }
  ScriptDisconnect();
  Connect();
  NW_REMOTE_FILE File;
  std::u16string Name = u"a.txt";
  ZeroMem(&File, sizeof(File));
  File.FileName = Name.data();
  File.OplockLevel = 9;
  Console([&] { ASSERT_EQ(GEE_NWFOpen(&Share, &File, EFI_FILE_MODE_READ, 2), EFI_SUCCESS); });
  // The next open asks for no oplock: the contexts left in the record from
  // the first must not travel with it.
  File.OplockLevel = 0;
  Console([&] { ASSERT_EQ(GEE_NWFOpen(&Share, &File, EFI_FILE_MODE_READ, 2), EFI_SUCCESS); });
  std::vector<Bytes> Sent = FileRequests();
  ASSERT_EQ(Sent.size(), 2u);
  const Bytes &Batch = Sent[0];
  ASSERT_EQ(Batch.size(), 124u + 16 + 96 + 2);
  EXPECT_EQ(GetLe32(Batch, 116), 120u + 16);
  EXPECT_EQ(GetLe32(Batch, 120), 96u);
  EXPECT_EQ(std::string(Batch.begin() + 140 + 16, Batch.begin() + 140 + 20), "RqLs");
  EXPECT_EQ(GetLe32(Batch, 140), 56u);
  EXPECT_EQ(std::string(Batch.begin() + 196 + 16, Batch.begin() + 196 + 20), "DHnQ");
  const Bytes &Plain = Sent[1];
  EXPECT_EQ(Plain.size(), 124u + 16 + 2);
  EXPECT_EQ(GetLe32(Plain, 120), 0u);
  EXPECT_EQ(Plain[71], 0);
}

TEST_F(Smb2FileWireTest, ReadWriteCreateAndWrite) {
  ScriptConnect(SMB2_DIALECT_202, 0);
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  Expect([](uint64_t Id) { return WriteAnswer(Id, 5); });
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  ScriptDisconnect();
  Connect();
  NW_REMOTE_FILE File;
  std::u16string Name = u"\\dir\\new.bin";
  ZeroMem(&File, sizeof(File));
  File.FileName = Name.data();
  Console([&] {
    ASSERT_EQ(GEE_NWFOpen(&Share, &File, EFI_FILE_MODE_CREATE | 3, 0x8), EFI_SUCCESS);
    UINTN Length = 5;
    ASSERT_EQ(GEE_NWFWrite(&Share, &File, "hello", &Length, 7), EFI_SUCCESS);
    EXPECT_EQ(Length, 5u);
    ASSERT_EQ(GEE_NWFClose(&Share, &File), EFI_SUCCESS);
  });
  EXPECT_EQ(+File.FileId[0], 0); // forgotten at close
  std::vector<Bytes> Sent = FileRequests();
  ASSERT_EQ(Sent.size(), 3u);
  const Bytes &Create = Sent[0];
  // Read-write create: access, share, disposition, options; the name goes
  // without its leading separator.
  EXPECT_EQ(GetLe32(Create, 92), 0xC0000187u);
  EXPECT_EQ(GetLe32(Create, 100), 3u);
  EXPECT_EQ(GetLe32(Create, 104), 5u);
  EXPECT_EQ(GetLe32(Create, 108), 0x44u);
  EXPECT_EQ(GetLe16(Create, 114), 22);
  EXPECT_EQ(Bytes(Create.begin() + 124, Create.begin() + 146), MockSmb::Utf16("dir\\new.bin"));
  const Bytes &Write = Sent[1];
  ASSERT_EQ(Write.size(), 116u + 5);
  EXPECT_EQ(GetLe32(Write, 72), 5u);
  EXPECT_EQ(GetLe64(Write, 76), 7u);
  EXPECT_EQ(Bytes(Write.begin() + 84, Write.begin() + 100), Bytes(kFileId, kFileId + 16));
  EXPECT_EQ(std::string(Write.begin() + 116, Write.end()), "hello");
}

} // namespace
