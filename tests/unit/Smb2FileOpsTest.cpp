// The SMB2 file operations: requests as a server reads them, the storing of
// information answers, directory answers walked into entries, and a
// scripted server that lies (lengths beyond what it sends, offsets outside
// its answer, names beyond their entries, zero file ids, resets in the
// middle of data). Each lie must end in a clear error without reading or
// writing outside a buffer (ASan and UBSan watch), with the pool back where
// it started and, where the message was whole, the stream still in step.
#include "HostInternal.h"
#include "MockSmbServer.h"
#include "Smb2TestEnv.h"
#include "smb2/SMB2FsAdapter.h"
#include "volume/NWLib.h"

#include <string.h>

#include <list>
#include <string>
#include <vector>

namespace {

using MockSmb::Bytes;

using MockSmb::Concat;
using MockSmb::Le;

inline uint64_t MessageIdOf(const Bytes &Request) {
  return MockSmb::GetLe64(Request, 4 + 24);
}

// A framed answer to Command: the header, then the parts.
inline Bytes AnswerTo(uint16_t Command, uint64_t MessageId, std::initializer_list<Bytes> Parts,
                      uint32_t Status = 0) {
  Bytes Header =
      MockSmb::Header({Command, Status, MessageId, MockSmb::kSessionId, MockSmb::kTreeId, 1, 1});
  return MockSmb::Frame(Concat({Header, Concat(Parts)}));
}

// A length field: Announced when given, else the size of what it describes.
inline Bytes Announce(int64_t Announced, size_t Actual) {
  return Le(Announced < 0 ? Actual : static_cast<uint32_t>(Announced), 4);
}

// Four FILETIMEs starting at Base (created, accessed, written, changed).
inline Bytes Times(uint64_t Base, uint64_t Step) {
  return Concat({Le(Base, 8), Le(Base + Step, 8), Le(Base + 2 * Step, 8), Le(Base + 3 * Step, 8)});
}

constexpr uint8_t kFileId[16] = {1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16};

// A CREATE answer (opened, oplock none); ContextsLength is announced, Tail
// follows the body.
inline Bytes CreateAnswer(uint64_t MessageId, const uint8_t *FileId = kFileId,
                          uint32_t ContextsLength = 0, const Bytes &Tail = {}) {
  return AnswerTo(5, MessageId,
                  {Le(89, 2), Le(0, 2), Le(1, 4), Times(0x01D0000000000000ULL, 1), Le(4096, 8),
                   Le(100, 8), Le(0x20, 4), Le(0, 4), Bytes(FileId, FileId + 16),
                   Le(ContextsLength == 0 ? 0 : 152, 4), Le(ContextsLength, 4), Tail});
}

inline Bytes CloseAnswer(uint64_t MessageId) {
  return AnswerTo(6, MessageId, {Le(60, 2), Bytes(58, 0)});
}

// A READ answer carrying Data; DataLength announces Announced bytes (the
// data's size unless given).
inline Bytes ReadAnswer(uint64_t MessageId, const Bytes &Data, int64_t Announced = -1) {
  return AnswerTo(8, MessageId,
                  {Le(17, 2), {0x50, 0}, Announce(Announced, Data.size()), Le(0, 8), Data});
}

inline Bytes WriteAnswer(uint64_t MessageId, uint32_t Count) {
  return AnswerTo(9, MessageId, {Le(17, 2), Le(0, 2), Le(Count, 4), Le(0, 8)});
}

// A QUERY_INFO (16) or QUERY_DIRECTORY (14) answer with Output;
// OutputBufferLength announces Announced bytes unless -1.
inline Bytes QueryAnswer(uint16_t Command, uint64_t MessageId, const Bytes &Output,
                         int64_t Announced = -1) {
  return AnswerTo(Command, MessageId,
                  {Le(9, 2), Le(72, 2), Announce(Announced, Output.size()), Output});
}

// One FileFullDirectoryInformation entry; NameLength announces the name's
// byte count unless given.
inline Bytes DirEntry(const std::string &Name, uint32_t Next, uint64_t Size = 0,
                      uint32_t Attributes = 0x20, int64_t NameLength = -1) {
  Bytes Utf = MockSmb::Utf16(Name);
  Bytes Entry = Concat({Le(Next, 4), Le(0, 4), Times(0x01D0000000000000ULL, 0), Le(Size, 8),
                        Le((Size + 4095) / 4096 * 4096, 8), Le(Attributes, 4),
                        Announce(NameLength, Utf.size()), Le(0, 4), Utf});
  // Padded up to the next entry when that is near.
  if (Next > Entry.size() && Next <= 1024) {
    Entry.resize(Next, 0);
  }
  return Entry;
}

// The answer to one request, with the request's own message id.
using Answer = std::function<Bytes(uint64_t MessageId)>;

class ScriptedShareTest : public Smb2HostTest {
protected:
  void SetUp() override {
    Smb2HostTest::SetUp();
    gDriverDebugLevel = 0;
    ZeroMem(&Share, sizeof(Share));
    HostSetConnectPortOverride(Server.Port());
  }

  void TearDown() override {
    if (gSMB2SockFd != 0) {
      Console([] { GEE_NWFSDisconnect(nullptr, nullptr); });
    }
    Console([] { GEE_NWDeInit(NW_SHARE_TYPE_CIFS); });
    Server.Join();
    ExpectNoSocketLeak();
    ExpectNoPoolLeak();
    Smb2HostTest::TearDown();
  }

  // The answers of a connect on Dialect by a server with Capabilities.
  void ScriptConnect(uint16_t Dialect = 0x0210, uint32_t Capabilities = 6) {
    Server.ScriptConnect(Dialect, MockSmb::ChallengeShape(), Capabilities);
  }

  // Reads one request and sends what Reply builds for its message id.
  void Expect(const Answer &Reply) {
    Server.Respond([Reply](const Bytes &Request) { return Reply(MessageIdOf(Request)); });
  }

  // Tree disconnect and logoff, answered with the ids the client used.
  void ScriptDisconnect() {
    for (uint16_t Command : {uint16_t{4}, uint16_t{2}}) {
      Server.Respond([Command](const Bytes &Request) {
        return MockSmb::SimpleResponse(Command, MessageIdOf(Request), MockSmb::kSessionId,
                                       MockSmb::kTreeId);
      });
    }
  }

  // Starts the server and connects through the network library.
  void Connect() {
    Server.Start();
    Ip = u"127.0.0.1";
    User = u"user@DOMAIN";
    Password = u"secret";
    ShareName = u"share";
    Params.ipAddress = Ip.data();
    Params.username = User.data();
    Params.password = Password.data();
    Share.sharename = ShareName.data();
    Share.shareType = NW_SHARE_TYPE_CIFS;
    EFI_STATUS Status = EFI_DEVICE_ERROR;
    std::string Out = Console([&] {
      GEE_NWInit(gImageHandle, gST, NW_SHARE_TYPE_CIFS);
      Status = GEE_NWFSConnect(&Params, &Share);
    });
    ASSERT_EQ(Status, EFI_SUCCESS) << Out << Server.Failure();
  }

  // Opens Name (read-only) through the network library.
  EFI_STATUS Open(const std::u16string &Name, NW_REMOTE_FILE *File, std::string *Out = nullptr) {
    Names.push_back(Name);
    ZeroMem(File, sizeof(*File));
    File->FileName = Names.back().data();
    return Captured(Out, [&] { return GEE_NWFOpen(&Share, File, EFI_FILE_MODE_READ, 2); });
  }

  // The requests the server received after the connect (ids 0 to 3).
  std::vector<Bytes> FileRequests() {
    std::vector<Bytes> All = Server.Requests();
    return All.size() > 4 ? std::vector<Bytes>(All.begin() + 4, All.end()) : std::vector<Bytes>();
  }

  MockSmb::Server Server;
  NW_SHARE_INFO Share;
  NW_CONNECTION_PARAMS Params = {};
  std::u16string Ip, User, Password, ShareName;
  std::list<std::u16string> Names; // stable addresses for the records
};

using MockSmb::GetLe16;
using MockSmb::GetLe32;
using MockSmb::GetLe64;

// ---------------------------------------------------------------------------
// Building requests and storing answers (no server)
// ---------------------------------------------------------------------------
class Smb2FileRequestTest : public Smb2HostTest {
protected:
  void SetUp() override {
    Smb2HostTest::SetUp();
    ZeroMem(&Access, sizeof(Access));
    TransactDetails.DialectRevision = SMB2_DIALECT_210;
    TransactDetails.ServerCapabilities = SMB2_GLOBAL_CAP_LEASING;
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
    Bytes Name;
    UINT32 Total;
  };
  Built BuildCreate(const std::string &FileName, UINT8 Oplock) {
    ZeroMem(Access.FileName, sizeof(Access.FileName));
    strncpy(Access.FileName, FileName.c_str(), sizeof(Access.FileName) - 1);
    Access.RequestedOplockLevel = Oplock;
    Built B = {};
    UINT8 *Name = nullptr;
    UINT32 NameSize = 0;
    B.Status = Quiet([&] {
      return SMB2CreateContextRequestPacketConstruct(&B.Packet, &TransactDetails, &Access, &Name,
                                                     &NameSize, &B.Total);
    });
    if (Name != nullptr) {
      B.Name.assign(Name, Name + NameSize);
      FreePool(Name);
    }
    return B;
  }

  FILE_ACCESS_DETAILS Access;
};

TEST_F(Smb2FileRequestTest, CreateNamesArePaddedAndBounded) {
  struct Case {
    std::string Name;
    EFI_STATUS Status;
    UINT16 NameLength;
    size_t Padded;
    UINT32 Total;
  } Cases[] = {{"", EFI_SUCCESS, 0, 0, 126},
               {"a.txt", EFI_SUCCESS, 10, 16, 142},
               {std::string(254, 'n'), EFI_SUCCESS, 508, 512, 638},
               {std::string(255, 'n'), EFI_INVALID_PARAMETER, 0, 0, 0}};
  for (const Case &C : Cases) {
    Built B = BuildCreate(C.Name, 0);
    EXPECT_EQ(B.Status, C.Status) << C.Name.size();
    EXPECT_EQ(B.Name.size(), C.Padded) << C.Name.size();
    if (C.Status == EFI_SUCCESS) {
      EXPECT_EQ(+B.Packet.NameLength, C.NameLength);
      EXPECT_EQ(B.Total, C.Total);
      EXPECT_EQ(Bytes(B.Name.begin(), B.Name.begin() + C.NameLength), MockSmb::Utf16(C.Name));
    }
  }
}

TEST_F(Smb2FileRequestTest, InformationAnswersLandInTheirOwnFields) {
  SMB2_QUERY_RESPONSE Packet = {};
  QUERY_DETAILS Query = {};
  auto Verify = [&](UINT8 Type, UINT8 Class, Bytes Output) {
    Query.InfoType = Type;
    Query.FileInfoClass = Class;
    Packet.Body.OutputBufferLength = static_cast<UINT32>(Output.size());
    return Quiet([&] { return SMB2VerifyInfoStructure(&Packet, Output.data(), &Query, &Access); });
  };
  Bytes All(104);
  for (size_t I = 0; I < All.size(); I++) {
    All[I] = static_cast<UINT8>(I + 1);
  }
  Access.IndexNumber = 99;
  ASSERT_EQ(Verify(1, 18, All), EFI_SUCCESS);
  EXPECT_EQ(CompareMem(&Access.FileInfo, All.data(), 104), 0);
  EXPECT_EQ(+Access.IndexNumber, 99u); // class 6 has its own place
  ASSERT_EQ(Verify(1, 5, Bytes(24, 0xEE)), EFI_SUCCESS);
  EXPECT_EQ(+Access.FileInfo.EndOfFile, 0xEEEEEEEEEEEEEEEEULL);
  EXPECT_EQ(+Access.FileInfo.FileAttributes, GetLe32(All, 32)); // basic part untouched

  // Unknown classes and types, and answers shorter than their class, are
  // refused and change nothing.
  Access.RawFileInfo = nullptr;
  FILE_ACCESS_DETAILS Before = Access;
  EXPECT_EQ(Verify(1, 7, Bytes(64, 1)), EFI_NOT_FOUND);
  EXPECT_EQ(Verify(3, 1, Bytes(64, 1)), EFI_NOT_FOUND);
  EXPECT_EQ(Verify(2, 1, Bytes(64, 1)), EFI_NOT_FOUND);
  EXPECT_EQ(Verify(1, 4, Bytes(39, 1)), EFI_PROTOCOL_ERROR);
  EXPECT_EQ(Verify(1, 8, Bytes(3, 1)), EFI_PROTOCOL_ERROR);
  EXPECT_EQ(CompareMem(&Before, &Access, sizeof(Access)), 0);

  // Directory answers are copied; a new copy releases the one before.
  ASSERT_EQ(Verify(1, 2, Bytes(300, 7)), EFI_SUCCESS);
  UINT64 Blocks = HostPoolOutstanding();
  ASSERT_EQ(Verify(1, 2, Bytes(100, 8)), EFI_SUCCESS);
  EXPECT_EQ(HostPoolOutstanding(), Blocks);
  EXPECT_EQ(+Access.FullDirInfoLength, 100u);
  EXPECT_EQ(Access.FullDirInfoPtr[99], 8);
  EXPECT_EQ(Access.FullDirInfoPtr[100 + SMB2_DIR_INFO_SLACK - 1], 0);
}

TEST_F(Smb2FileRequestTest, DirectoryEntriesAsFileInfo) {
  SMB2_DIR_NODE *Node = nullptr;
  ASSERT_EQ(SMB2_CreateDirNode(&Node, 8), EFI_SUCCESS);
  struct Case {
    std::string Name;
    UINT32 Attributes;
    UINT64 Expected;
    UINT64 InfoSize;
  } Cases[] = {
      {"ab", 0x80, EFI_FILE_SYSTEM, 90}, // (4 name bytes + 1) x 2 + 80
      // Directory, hidden, archive and read-only map across; system and the
      // rest are dropped.
      {"", 0x33 | 0x04 | 0x100,
       EFI_FILE_DIRECTORY | EFI_FILE_HIDDEN | EFI_FILE_ARCHIVE | EFI_FILE_READ_ONLY, 82},
  };
  for (const Case &C : Cases) {
    Bytes Entry = DirEntry(C.Name, 0, 777, C.Attributes);
    ASSERT_EQ(SMB2_PopulateDirInfo(Entry.data(), Node), EFI_SUCCESS);
    UINT64 Bytes0 = HostPoolOutstandingBytes();
    EFI_FILE_INFO *Info = nullptr;
    ASSERT_EQ(SMB2_PopulateDirFileInfo(Node, &Info), EFI_SUCCESS);
    EXPECT_EQ(+Info->Size, C.InfoSize);
    // Never less than the 88 bytes the volume copies.
    EXPECT_GE(HostPoolOutstandingBytes() - Bytes0, SMB2_FS_MIN_FILE_INFO_ALLOCATION);
    EXPECT_EQ(+Info->FileSize, 777u);
    EXPECT_EQ(+Info->PhysicalSize, 4096u);
    EXPECT_EQ(+Info->Attribute, C.Expected);
    EXPECT_EQ(HostUcs2ToUtf8(Info->FileName), C.Name);
    for (EFI_TIME T : {Info->CreateTime, Info->LastAccessTime, Info->ModificationTime}) {
      EXPECT_EQ(T.Year * 10000 + T.Month * 100 + T.Day, 20180101);
      EXPECT_EQ(T.Hour * 10000 + T.Minute * 100 + T.Second + T.Nanosecond + T.TimeZone, 101010);
    }
    FreePool(Info);
  }
  EFI_FILE_INFO *Info = nullptr;
  Node->FileNameLength = 511;
  Quiet([&] { EXPECT_EQ(SMB2_PopulateDirFileInfo(Node, &Info), EFI_BUFFER_TOO_SMALL); });
  FreePool(Node);
}

// ---------------------------------------------------------------------------
// Well-formed answers from the scripted server
// ---------------------------------------------------------------------------
class Smb2FileWireTest : public ScriptedShareTest {};

// The server's own reading of each request: the name at NameOffset, the
// data at DataOffset, reads cut into requests of at most 64512 bytes.
TEST_F(Smb2FileWireTest, RequestsCarryWhatAServerReadsFromThem) {
  ScriptConnect(SMB2_DIALECT_210, 6);
  for (int I = 0; I < 2; I++) {
    Expect([](uint64_t Id) { return CreateAnswer(Id); });
  }
  Expect([](uint64_t Id) { return WriteAnswer(Id, 5); });
  for (int I = 0; I < 2; I++) {
    Server.Respond([](const Bytes &Request) {
      return ReadAnswer(MessageIdOf(Request), Bytes(GetLe32(Request, 72), 0x77));
    });
  }
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  ScriptDisconnect();
  Connect();
  NW_REMOTE_FILE File;
  std::u16string Name = u"a.txt", NewName = u"\\dir\\new.bin";
  ZeroMem(&File, sizeof(File));
  File.FileName = Name.data();
  File.OplockLevel = 9;
  std::vector<UINT8> Data(100000);
  UINT64 At = 0;
  UINTN Length = Data.size(), Count = 0, Written = 5;
  Console([&] {
    ASSERT_EQ(GEE_NWFOpen(&Share, &File, EFI_FILE_MODE_READ, 2), EFI_SUCCESS);
    // The next open asks for no oplock: the contexts left in the record from
    // the first must not travel with it.
    File.OplockLevel = 0;
    File.FileName = NewName.data();
    ASSERT_EQ(GEE_NWFOpen(&Share, &File, EFI_FILE_MODE_CREATE | 3, 0x8), EFI_SUCCESS);
    ASSERT_EQ(GEE_NWFWrite(&Share, &File, "hello", &Written, 7), EFI_SUCCESS);
    ASSERT_EQ(GEE_NWFRead(&Share, &File, Data.data(), &Length, &At, &Count), EFI_SUCCESS);
    ASSERT_EQ(GEE_NWFClose(&Share, &File), EFI_SUCCESS);
  });
  EXPECT_EQ(Count, 100000u);
  EXPECT_EQ(Data[99999], 0x77);
  EXPECT_EQ(+File.FileId[0], 0); // forgotten at close
  std::vector<Bytes> Sent = FileRequests();
  ASSERT_EQ(Sent.size(), 6u);
  auto At16 = [](const Bytes &R, size_t Offset, size_t Length) {
    return Bytes(R.begin() + 4 + Offset, R.begin() + 4 + Offset + Length);
  };
  const Bytes &Batch = Sent[0];
  ASSERT_EQ(Batch.size(), 124u + 16 + 96 + 2);
  EXPECT_EQ(At16(Batch, GetLe16(Batch, 112), GetLe16(Batch, 114)), MockSmb::Utf16("a.txt"));
  EXPECT_EQ(GetLe32(Batch, 120), 96u);
  const UINT32 Contexts = 4 + GetLe32(Batch, 116);
  EXPECT_EQ(std::string(Batch.begin() + Contexts + 16, Batch.begin() + Contexts + 20), "RqLs");
  EXPECT_EQ(std::string(Batch.begin() + Contexts + 72, Batch.begin() + Contexts + 76), "DHnQ");
  // Read-write create: access, share, disposition, options; the name goes
  // without its leading separator, and no contexts.
  const Bytes &Create = Sent[1];
  EXPECT_EQ(GetLe32(Create, 92), 0xC0000187u);
  EXPECT_EQ(GetLe32(Create, 104), 5u);
  EXPECT_EQ(GetLe32(Create, 120), 0u);
  EXPECT_EQ(At16(Create, GetLe16(Create, 112), GetLe16(Create, 114)),
            MockSmb::Utf16("dir\\new.bin"));
  const Bytes &Write = Sent[2];
  EXPECT_EQ(At16(Write, GetLe16(Write, 70), GetLe32(Write, 72)), Bytes({'h', 'e', 'l', 'l', 'o'}));
  EXPECT_EQ(GetLe64(Write, 76), 7u);
  EXPECT_EQ(Bytes(Write.begin() + 84, Write.begin() + 100), Bytes(kFileId, kFileId + 16));
  struct ReadRequest {
    UINT32 Length;
    UINT64 Offset;
  } Reads[] = {{64512, 0}, {64512, 64512}}; // the tail asks for a whole request
  for (const ReadRequest &R : Reads) {
    const Bytes &Read = Sent[3 + (&R - Reads)];
    EXPECT_EQ(GetLe32(Read, 72), R.Length);
    EXPECT_EQ(GetLe64(Read, 76), R.Offset);
    EXPECT_EQ(GetLe16(Read, 10), 1) << "credit charge";
  }
  // A directory path too long for a request is refused before anything is sent.
  memset(Share.FilePath, 'd', 300);
  EFI_FILE_INFO *Entry = nullptr;
  EXPECT_EQ(Quiet([&] { return GEE_NWFindFirst(&Share, u"*", &Entry); }), EFI_INVALID_PARAMETER);
  EXPECT_EQ(FileRequests().size(), 6u);
}

TEST_F(Smb2FileWireTest, ListingAndVolumeSizesFromWellFormedAnswers) {
  ScriptConnect();
  Bytes Listing = MockSmb::Concat({DirEntry("first.txt", 88, 10), DirEntry("second", 0, 0, 0x10)});
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  Expect([Listing](uint64_t Id) { return QueryAnswer(14, Id, Listing); });
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  Expect([](uint64_t Id) {
    return QueryAnswer(16, Id, MockSmb::Concat({Le(1000, 8), Le(250, 8), Le(8, 4), Le(512, 4)}));
  });
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  ScriptDisconnect();
  Connect();
  std::vector<std::string> Names;
  EFI_FILE_INFO *Entry = nullptr;
  EFI_FILE_SYSTEM_INFO Info = {};
  Console([&] {
    for (EFI_STATUS S = GEE_NWFindFirst(&Share, u"*", &Entry); S == EFI_SUCCESS;
         S = GEE_NWFindNext(&Share, &Entry)) {
      Names.push_back(HostUcs2ToUtf8(Entry->FileName));
      FreePool(Entry);
    }
    ASSERT_EQ(GEE_NWGetFSInfo(&Share, &Info), EFI_SUCCESS);
  });
  EXPECT_EQ(Names, (std::vector<std::string>{"first.txt", "second"}));
  EXPECT_EQ(gDirNodePtr, nullptr); // released at the end of the listing
  EXPECT_EQ(+Info.VolumeSize, 1000u * 8 * 512);
  EXPECT_EQ(+Info.FreeSpace, 250u * 8 * 512);
  EXPECT_EQ(+Info.BlockSize, 8u * 512);
}

// ---------------------------------------------------------------------------
// Answers that lie
// ---------------------------------------------------------------------------
class Smb2FileOpsHostileTest : public ScriptedShareTest {
protected:
  EFI_STATUS ReadFile(NW_REMOTE_FILE *File, UINT8 *Buffer, UINTN Length, UINTN *Count,
                      std::string *Out) {
    UINT64 Offset = 0;
    return Captured(Out,
                    [&] { return GEE_NWFRead(&Share, File, Buffer, &Length, &Offset, Count); });
  }
  EFI_STATUS CloseFile(NW_REMOTE_FILE *File) {
    return Quiet([&] { return GEE_NWFClose(&Share, File); });
  }
};

// Each answer to a 100-byte read is taken whole or refused whole: the next
// answer, and the close after them all, are understood.
TEST_F(Smb2FileOpsHostileTest, ReadAnswersAreConsumedWholeWhateverTheyAnnounce) {
  struct Case {
    const char *What;
    Answer Reply;
    EFI_STATUS Status;
    const char *Message;
  } Cases[] = {
      {"more announced than follows",
       [](uint64_t Id) { return ReadAnswer(Id, Bytes(10, 0xAB), 50); }, EFI_DEVICE_ERROR,
       "DataOffset 0x50 and DataLength 50 lie outside the 10 bytes that follow!"},
      // A short read asks for a whole request of 64512 bytes.
      {"more sent than asked", [](uint64_t Id) { return ReadAnswer(Id, Bytes(65000, 0xCD)); },
       EFI_DEVICE_ERROR, "DataLength 65000 is beyond the 64512 bytes asked for!"},
      {"no data", [](uint64_t Id) { return ReadAnswer(Id, {}); }, EFI_DEVICE_ERROR,
       "No file data to read\n"},
      {"body shorter than its fixed part",
       [](uint64_t Id) {
         return AnswerTo(8, Id, {Bytes{17, 0, 0x50, 0}});
       },
       EFI_DEVICE_ERROR, "Response body of 4 bytes is shorter than its fixed part of 16 bytes!"},
      {"an interim answer first",
       [](uint64_t Id) {
         return MockSmb::Concat(
             {MockSmb::ErrorResponse(8, 0x103, Id, MockSmb::kSessionId, MockSmb::kTreeId),
              ReadAnswer(Id, Bytes(100, 0x11))});
       },
       EFI_SUCCESS, ""},
  };
  ScriptConnect();
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  for (const Case &C : Cases) {
    Expect(C.Reply);
  }
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  ScriptDisconnect();
  Connect();
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open(u"file.bin", &File), EFI_SUCCESS);
  for (const Case &C : Cases) {
    std::vector<UINT8> Buffer(100 + 32, 0x5A);
    UINTN Count = 77;
    std::string Out;
    EXPECT_EQ(ReadFile(&File, Buffer.data(), 100, &Count, &Out), C.Status) << C.What;
    EXPECT_TRUE(Contains(Out, C.Message)) << C.What << Out;
    EXPECT_EQ(Count, C.Status == EFI_SUCCESS ? 100u : 0u) << C.What;
    // Nothing of a refused answer reaches the caller's buffer, nor past it.
    EXPECT_EQ(std::count(Buffer.begin() + (Count == 0 ? 0 : 100), Buffer.end(), 0x5A),
              Count == 0 ? 132 : 32)
        << C.What;
  }
  EXPECT_EQ(CloseFile(&File), EFI_SUCCESS);
  EXPECT_EQ(Server.Failure(), "");
}

TEST_F(Smb2FileOpsHostileTest, ResetOrCloseInTheMiddleOfAReadEndsIt) {
  ScriptConnect();
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  Expect([](uint64_t Id) { return ReadAnswer(Id, Bytes(64512, 1)); });
  // The second request's answer breaks off after 1000 data bytes.
  Server.Respond([](const Bytes &Request) {
    Bytes Whole = ReadAnswer(MessageIdOf(Request), Bytes(35488, 2));
    return Bytes(Whole.begin(), Whole.begin() + 84 + 1000);
  });
  Server.Pause(50).Reset();
  Connect();
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open(u"big.bin", &File), EFI_SUCCESS);
  std::vector<UINT8> Buffer(100000);
  UINTN Count = 0;
  std::string Out;
  EXPECT_EQ(ReadFile(&File, Buffer.data(), Buffer.size(), &Count, &Out), EFI_DEVICE_ERROR);
  // The bytes of the request that succeeded are reported.
  EXPECT_EQ(Count, 64512u);
  EXPECT_EQ(+gFileAccessDetails.TransportStatus, 54u);
  EXPECT_TRUE(Contains(Out, "Server has reset, so exiting!\n")) << Out;
  EXPECT_EQ(Buffer[64511], 1);
}

TEST_F(Smb2FileOpsHostileTest, CreateWithZeroFileIdOrContextsBeyondTheAnswer) {
  const uint8_t Zero[16] = {};
  ScriptConnect();
  Expect([&Zero](uint64_t Id) { return CreateAnswer(Id, Zero); });
  Expect([](uint64_t Id) { return CreateAnswer(Id, kFileId, 0xFFFFFFF0u, Bytes(8, 0)); });
  // Contexts that fit are consumed unread, padding included.
  Expect([](uint64_t Id) { return CreateAnswer(Id, kFileId, 32, Bytes(40, 0xEE)); });
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  ScriptDisconnect();
  Connect();
  NW_REMOTE_FILE File;
  std::string Out;
  EXPECT_EQ(Open(u"zero", &File, &Out), EFI_DEVICE_ERROR);
  EXPECT_TRUE(Contains(Out, "CreateResp->FileId is 0! - 0x00000000000000000000000000000000\n"))
      << Out;
  EXPECT_EQ(+File.FileId[0], 0);
  EXPECT_EQ(Open(u"huge", &File, &Out), EFI_DEVICE_ERROR);
  EXPECT_TRUE(Contains(Out, "CreateContextsLength 4294967280 is beyond the 8 bytes the response "
                            "holds!"))
      << Out;
  EXPECT_EQ(Open(u"fine", &File, &Out), EFI_SUCCESS) << Out;
  EXPECT_EQ(+File.FileId[15], 16);
  EXPECT_EQ(CloseFile(&File), EFI_SUCCESS);
}

// File-system information answers: the share root is opened for each query
// and closed again; a refused answer leaves the caller's record alone.
TEST_F(Smb2FileOpsHostileTest, QueryAnswersLongerThanTheMessageOrTheRequest) {
  struct Case {
    Bytes Output;
    int64_t Announced;
    const char *Message;
  } Cases[] = {
      {Bytes(24, 1), 0xFFFFFF00,
       "OutputBufferLength 4294967040 is beyond the 24 bytes that follow or the 8293 bytes"},
      {Bytes(9000, 1), -1,
       "OutputBufferLength 9000 is beyond the 9000 bytes that follow or the 8293 bytes"},
      {Bytes(24, 1), 100, "OutputBufferLength 100 is beyond the 24 bytes that follow"},
      {Bytes(8, 1), -1, "Output buffer length 8 is shorter than the 24 bytes of class 3!"},
  };
  ScriptConnect();
  for (const Case &C : Cases) {
    Expect([](uint64_t Id) { return CreateAnswer(Id); });
    Expect([&C](uint64_t Id) { return QueryAnswer(16, Id, C.Output, C.Announced); });
    Expect([](uint64_t Id) { return CloseAnswer(Id); });
  }
  ScriptDisconnect();
  Connect();
  for (const Case &C : Cases) {
    EFI_FILE_SYSTEM_INFO Info = {};
    Info.BlockSize = 123;
    std::string Out;
    EXPECT_EQ(Captured(&Out, [&] { return GEE_NWGetFSInfo(&Share, &Info); }), EFI_DEVICE_ERROR);
    EXPECT_TRUE(Contains(Out, C.Message)) << Out;
    EXPECT_EQ(+Info.BlockSize, 123u);
  }
  EXPECT_EQ(Server.Failure(), "");
}

TEST_F(Smb2FileOpsHostileTest, DirectoryAnswersThatPointOutsideThemselves) {
  Bytes Wrap = DirEntry("first", 80);
  // From the second entry at 80, a NextEntryOffset that wraps a 32-bit sum
  // back to the first entry.
  Bytes Second = DirEntry("second", 0xFFFFFFB0u);
  Wrap.insert(Wrap.end(), Second.begin(), Second.end());
  Bytes NameBeyondEntry = DirEntry("abcdefgh", 72, 0, 0x20, 16);
  NameBeyondEntry.resize(72 + 80, 0);
  Bytes Truncated = DirEntry("x", 0);
  Truncated.resize(40);
  struct Case {
    Bytes Answer;
    EFI_STATUS Status;
    const char *Message;
  } Cases[] = {
      {Wrap, EFI_PROTOCOL_ERROR, "NextEntryOffset 4294967216 at offset 80"},
      {DirEntry("first", 4000), EFI_PROTOCOL_ERROR,
       "NextEntryOffset 4000 at offset 0 points outside the answer of 78 bytes"},
      {NameBeyondEntry, EFI_PROTOCOL_ERROR, "FileNameLength 16 runs past its entry at offset 0"},
      {DirEntry("last", 0, 0, 0x20, 200), EFI_PROTOCOL_ERROR,
       "FileNameLength 200 runs past its entry at offset 0"},
      {Truncated, EFI_PROTOCOL_ERROR,
       "Directory entry at offset 0 runs past the answer of 40 bytes"},
      {DirEntry(std::string(128, 'n'), 0), EFI_SECURITY_VIOLATION,
       "Error! FileNameLength 256 is greater than limited 255 length\n"},
      {Bytes(16400, 0), EFI_DEVICE_ERROR,
       "OutputBufferLength 16400 is beyond the 16400 bytes that follow or the 16384 bytes"},
      // A successful answer without output: nothing to walk, no first entry.
      {Bytes(), EFI_INVALID_PARAMETER, "QueryDirResp->OutputBufferLength is 0!\n"},
  };
  ScriptConnect();
  for (const Case &C : Cases) {
    Expect([](uint64_t Id) { return CreateAnswer(Id); });
    Expect([&C](uint64_t Id) { return QueryAnswer(14, Id, C.Answer); });
    Expect([](uint64_t Id) { return CloseAnswer(Id); });
  }
  ScriptDisconnect();
  Connect();
  for (const Case &C : Cases) {
    EFI_FILE_INFO *Entry = nullptr;
    std::string Out;
    EXPECT_EQ(Captured(&Out, [&] { return GEE_NWFindFirst(&Share, u"*", &Entry); }), C.Status)
        << Out;
    EXPECT_TRUE(Contains(Out, C.Message)) << Out;
    EXPECT_EQ(Entry, nullptr);
    // The nodes made before the bad entry are gone with the answer copy.
    EXPECT_EQ(gDirNodePtr, nullptr) << C.Message;
    EXPECT_EQ(+gFileAccessDetails.FullDirInfoPtr, nullptr) << C.Message;
  }
  EXPECT_EQ(Server.Failure(), "");
}

TEST_F(Smb2FileOpsHostileTest, InitialisationDropsAConnectionLeftBehind) {
  // What a connect that failed part-way leaves: its buffers, the target-info
  // copy and an open socket.
  gSMB2ConnectInfo.Username = static_cast<CHAR8 *>(AllocateZeroPool(257));
  gSMB2ShareDetails.Sharename = static_cast<CHAR8 *>(AllocateZeroPool(336));
  TransactDetails.ChallResponse = static_cast<UINT8 *>(AllocateZeroPool(40));
  TransactDetails.MessageId = 9;
  gSMB2SockFd = NwSocket(NW_AF_INET, NW_SOCK_STREAM, 0);
  ASSERT_GT(gSMB2SockFd, 0);
  EXPECT_EQ(GEE_NWInit(gImageHandle, gST, NW_SHARE_TYPE_NFS), EFI_SUCCESS);
  EXPECT_EQ(gSMB2SockFd, 0);
  EXPECT_EQ(+TransactDetails.MessageId, 0u);
  EXPECT_EQ(gSMB2ConnectInfo.Username, nullptr);
  // TearDown checks the pool and the sockets.
}

} // namespace
