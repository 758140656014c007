// The network library's file operations against Samba on loopback, on both
// dialects: data written and read back, reads cut into requests, credit
// charges, information classes, volume sizes, listings with their
// attributes and times, end of file, the status record, the operations
// that send nothing, and the pool and sockets after a run.
//
// With CIFSDRV_BENCH_FILE set (scripts/bench-read.sh) the disabled
// ReadThroughput test times reads of that share file through GEE_NWFRead.
#include "ProvisioningVars.h"
#include "SambaServer.h"
#include "Smb2TestEnv.h"
#include "smb2/SMB2FsAdapter.h"
#include "volume/NWLib.h"

#include <pwd.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <list>
#include <map>
#include <random>
#include <string>
#include <vector>

namespace {

using SambaServer::kPassword;
using SambaServer::kUser;
constexpr UINT64 kCreateReadWrite = EFI_FILE_MODE_CREATE | EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE;

std::u16string U16(const std::string &Text) {
  return std::u16string(Text.begin(), Text.end());
}

std::vector<UINT8> Pattern(size_t Size, uint32_t Seed) {
  std::vector<UINT8> Data(Size);
  std::mt19937 Random(Seed);
  for (UINT8 &Byte : Data) {
    Byte = static_cast<UINT8>(Random());
  }
  return Data;
}

std::vector<SMB2_REQUEST_TRACE> RequestsSince(UINT64 Mark) {
  std::vector<SMB2_REQUEST_TRACE> Out;
  for (UINT64 I = Mark; I < gSMB2RequestCount; I++) {
    Out.push_back(gSMB2RequestTrace[I % SMB2_REQUEST_TRACE_SLOTS]);
  }
  return Out;
}

void ExpectFixedTime(EFI_TIME T) {
  EXPECT_EQ(T.Year * 10000 + T.Month * 100 + T.Day, 20180101);
  EXPECT_EQ(T.Hour * 10000 + T.Minute * 100 + T.Second, 101010);
  EXPECT_EQ(T.Nanosecond, 0u);
}

class FileOpsSambaTest : public Smb2HostTest {
protected:
  void SetUp() override {
    Smb2HostTest::SetUp();
    gDriverDebugLevel = 0;
    ZeroMem(&Share, sizeof(Share));
  }

  void TearDown() override {
    if (gSMB2SockFd != 0) {
      Console([] { GEE_NWFSDisconnect(nullptr, nullptr); });
    }
    Console([] { GEE_NWDeInit(NW_SHARE_TYPE_CIFS); });
    ExpectNoSocketLeak();
    ExpectNoPoolLeak();
    if (!Work.empty()) {
      std::filesystem::remove_all(Work);
    }
    Smb2HostTest::TearDown();
  }

  // Starts the server and connects; the test works in a directory of its
  // own inside the share.
  void StartAndConnect(const std::string &MaxProto, UINT64 ShareType = NW_SHARE_TYPE_CIFS) {
    ASSERT_TRUE(SambaServer::Start(MaxProto));
    std::string Out;
    Dialect = MaxProto == "SMB2_02" ? SMB2_DIALECT_202 : SMB2_DIALECT_210;
    WorkName = "fileops-" + std::to_string(getpid()) + "-" +
               ::testing::UnitTest::GetInstance()->current_test_info()->name();
    std::replace(WorkName.begin(), WorkName.end(), '/', '-');
    Work = SambaServer::ShareDir(MaxProto) + "/" + WorkName;
    MakeHostDir(Work);
    Strings = {u"127.0.0.1", U16(kUser), U16(kPassword), u"cifsshare"};
    auto At = Strings.begin();
    Params.ipAddress = (At++)->data();
    Params.username = (At++)->data();
    Params.password = (At++)->data();
    Share.sharename = At->data();
    Share.shareType = ShareType;
    // A server restarted for the other dialect may still turn away the
    // first connection; the connect itself is tested elsewhere.
    EFI_STATUS Status = EFI_DEVICE_ERROR;
    for (int Attempt = 0; Attempt < 5 && Status != EFI_SUCCESS; Attempt++) {
      usleep(Attempt * 200 * 1000);
      Out = Console([&] {
        GEE_NWInit(gImageHandle, gST, ShareType);
        Status = GEE_NWFSConnect(&Params, &Share);
      });
    }
    ASSERT_EQ(Status, EFI_SUCCESS) << Out;
    ASSERT_EQ(+TransactDetails.DialectRevision, Dialect);
  }

  static void MakeHostDir(const std::string &Path) { WriteHostFile(Path, {}, 0775, true); }

  // Host-side files belong to the share's user, as if made through it.
  static void WriteHostFile(const std::string &Path, const std::vector<UINT8> &Data,
                            mode_t Mode = 0664, bool Directory = false) {
    if (Directory) {
      std::filesystem::create_directories(Path);
    } else {
      std::ofstream(Path, std::ios::binary)
          .write(reinterpret_cast<const char *>(Data.data()),
                 static_cast<std::streamsize>(Data.size()));
    }
    chmod(Path.c_str(), Mode);
    passwd *Owner = getpwnam(kUser.c_str());
    ASSERT_NE(Owner, nullptr);
    ASSERT_EQ(chown(Path.c_str(), Owner->pw_uid, Owner->pw_gid), 0);
  }

  std::u16string Remote(const std::string &Name) const { return U16(WorkName + "\\" + Name); }

  EFI_STATUS Open(const std::string &Name, UINT64 Mode, NW_REMOTE_FILE *File) {
    Strings.push_back(Remote(Name));
    ZeroMem(File, sizeof(*File));
    File->FileName = Strings.back().data();
    return Quiet(
        [&] { return GEE_NWFOpen(&Share, File, Mode, Mode == EFI_FILE_MODE_READ ? 2 : 8); });
  }

  EFI_STATUS Read(NW_REMOTE_FILE *File, UINT8 *Buffer, UINTN Length, UINT64 Offset, UINTN *Count,
                  std::string *Out = nullptr) {
    return Captured(Out,
                    [&] { return GEE_NWFRead(&Share, File, Buffer, &Length, &Offset, Count); });
  }

  EFI_STATUS Write(NW_REMOTE_FILE *File, const UINT8 *Buffer, UINTN *Length, UINT64 Offset) {
    return Quiet([&] { return GEE_NWFWrite(&Share, File, Buffer, Length, Offset); });
  }

  EFI_STATUS Close(NW_REMOTE_FILE *File) {
    return Quiet([&] { return GEE_NWFClose(&Share, File); });
  }

  // Lists a directory of this test's tree, entry records by name.
  EFI_STATUS List(const std::string &Directory, std::map<std::string, EFI_FILE_INFO> *Entries,
                  const CHAR16 *Pattern = u"*", std::string *Out = nullptr) {
    ZeroMem(Share.FilePath, sizeof(Share.FilePath));
    snprintf(Share.FilePath, sizeof(Share.FilePath), "%s\\%s", WorkName.c_str(), Directory.c_str());
    EFI_STATUS Status = EFI_SUCCESS;
    std::string Text = Console([&] {
      EFI_FILE_INFO *Entry = nullptr;
      Status = GEE_NWFindFirst(&Share, Pattern, &Entry);
      while (Status == EFI_SUCCESS) {
        std::string Name;
        const UINT8 *Bytes = reinterpret_cast<const UINT8 *>(Entry) + SIZE_OF_EFI_FILE_INFO;
        for (const CHAR16 *C = reinterpret_cast<const CHAR16 *>(Bytes); *C; C++) {
          Name.push_back(static_cast<char>(*C));
        }
        (*Entries)[Name] = *Entry;
        FreePool(Entry);
        Status = GEE_NWFindNext(&Share, &Entry);
      }
      GEE_NWFindClose(&Share, nullptr);
    });
    if (Out != nullptr) {
      *Out = Text;
    }
    return Status == EFI_NOT_FOUND && !Entries->empty() ? EFI_SUCCESS : Status;
  }

  static UINT64 RecordedStatus() {
    UINT64 Record[5] = {};
    UINTN Size = sizeof(Record);
    EXPECT_EQ(gRT->GetVariable(PROVISIONING_VOLATILE_VAR_NAME, &gProvisioningEnvGuid, nullptr,
                               &Size, Record),
              EFI_SUCCESS);
    return Record[0];
  }

  UINT16 Dialect = 0;
  std::string WorkName, Work;
  std::list<std::u16string> Strings; // stable addresses for the records
  NW_CONNECTION_PARAMS Params = {};
  NW_SHARE_INFO Share;
};

class BothDialects : public FileOpsSambaTest, public ::testing::WithParamInterface<const char *> {
protected:
  void SetUp() override {
    FileOpsSambaTest::SetUp();
    StartAndConnect(GetParam());
  }
  UINT16 Charge(UINT16 OnTwoPointOne) const {
    return Dialect == SMB2_DIALECT_202 ? 0 : OnTwoPointOne;
  }
};

TEST_P(BothDialects, WriteThenReadBackFiveMebibytes) {
  const std::vector<UINT8> Data = Pattern(5 * 1024 * 1024, 5);
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open("five.bin", kCreateReadWrite, &File), EFI_SUCCESS);
  // Written as the volume writes: requests of at most 64512 bytes.
  for (UINT64 Offset = 0; Offset < Data.size();) {
    UINTN Length = std::min<UINTN>(SMB2_FS_MAX_CHUNK, Data.size() - Offset);
    ASSERT_EQ(Write(&File, &Data[Offset], &Length, Offset), EFI_SUCCESS);
    Offset += Length;
  }
  EXPECT_EQ(Close(&File), EFI_SUCCESS);
  ASSERT_EQ(Open("five.bin", EFI_FILE_MODE_READ, &File), EFI_SUCCESS);
  std::vector<UINT8> Back(Data.size(), 0);
  for (UINT64 At = 0; At < Back.size();) {
    UINTN Count = 0;
    UINTN Want = std::min<UINTN>(1024 * 1024, Back.size() - At);
    ASSERT_EQ(Read(&File, &Back[At], Want, At, &Count), EFI_SUCCESS);
    ASSERT_EQ(Count, Want);
    At += Count;
  }
  EXPECT_EQ(Close(&File), EFI_SUCCESS);
  std::hash<std::string> Checksum;
  EXPECT_EQ(Checksum(std::string(Back.begin(), Back.end())),
            Checksum(std::string(Data.begin(), Data.end())));
  EXPECT_TRUE(ReadBytes(Work + "/five.bin") == Data);
}

TEST_P(BothDialects, ReadsGoInRequestsOfAtMost64512BytesWithTheirCredits) {
  const std::vector<UINT8> Data = Pattern(100000, 1);
  WriteHostFile(Work + "/hundred.bin", Data);
  UINT64 Mark = gSMB2RequestCount;
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open("hundred.bin", EFI_FILE_MODE_READ, &File), EFI_SUCCESS);
  std::vector<UINT8> Back(Data.size());
  UINTN Count = 0;
  ASSERT_EQ(Read(&File, Back.data(), Back.size(), 0, &Count), EFI_SUCCESS);
  EXPECT_EQ(Count, 100000u);
  EXPECT_TRUE(Back == Data);
  EXPECT_EQ(Close(&File), EFI_SUCCESS);
  std::vector<SMB2_REQUEST_TRACE> Sent = RequestsSince(Mark);
  ASSERT_EQ(Sent.size(), 4u);
  const UINT16 Commands[] = {SMB2_CREATE, SMB2_READ, SMB2_READ, SMB2_CLOSE};
  for (size_t I = 0; I < 4; I++) {
    EXPECT_EQ(Sent[I].Command, Commands[I]);
    EXPECT_EQ(Sent[I].CreditCharge, Charge(1)) << I;
  }
  EXPECT_EQ(Sent[1].Length, 64512u);
  EXPECT_EQ(Sent[1].Offset, 0u);
  EXPECT_EQ(Sent[2].Length, 35488u);
  EXPECT_EQ(Sent[2].Offset, 64512u);
}

TEST_P(BothDialects, InformationClassesAndVolumeSizes) {
  const std::vector<UINT8> Data = Pattern(12345, 3);
  WriteHostFile(Work + "/info.bin", Data);
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open("info.bin", EFI_FILE_MODE_READ, &File), EFI_SUCCESS);
  FILE_ACCESS_DETAILS &F = gFileAccessDetails;
  UINT64 Mark = gSMB2RequestCount;
  auto Ask = [&](UINT8 Type, UINT8 Class) {
    QUERY_DETAILS Q = {};
    Q.InfoType = Type;
    Q.FileInfoClass = Class;
    return Quiet([&] { return SMB2_FSInfo(&gSMB2ShareDetails, &gSMB2ClientSession, &Q, &F); });
  };
  ASSERT_EQ(Ask(1, 4), EFI_SUCCESS);
  EXPECT_NE(+F.FileInfo.ChangeTime, 0u);
  EXPECT_EQ(+F.FileInfo.FileAttributes & SMB2_ATTR_DIRECTORY, 0u);
  ASSERT_EQ(Ask(1, 5), EFI_SUCCESS);
  EXPECT_EQ(+F.FileInfo.EndOfFile, Data.size());
  EXPECT_GE(+F.FileInfo.AllocationSize, Data.size());
  EXPECT_EQ(+F.FileInfo.NumberOfLinks, 1u);
  ASSERT_EQ(Ask(1, 6), EFI_SUCCESS);
  const UINT64 Index = F.IndexNumber;
  EXPECT_NE(Index, 0u);
  ASSERT_EQ(Ask(1, 8), EFI_SUCCESS);
  EXPECT_EQ(+F.AccessFlags & 0x20089u, 0x20089u); // what the read-only open asked for
  // FileAllInformation refreshes the basic and standard fields, not the
  // index number's own place.
  F.FileInfo.EndOfFile = 0;
  F.IndexNumber = 77;
  ASSERT_EQ(Ask(1, 18), EFI_SUCCESS);
  EXPECT_EQ(+F.FileInfo.EndOfFile, Data.size());
  EXPECT_EQ(+F.FileInfo.InternalIndexNumber, Index);
  EXPECT_EQ(+F.IndexNumber, 77u);
  // FileEndOfFileInformation lands on EndOfFile alone.
  F.FileInfo.EndOfFile = 0;
  F.FileInfo.AllocationSize = 1;
  ASSERT_EQ(Ask(1, 20), EFI_SUCCESS);
  EXPECT_EQ(+F.FileInfo.EndOfFile, Data.size());
  EXPECT_EQ(+F.FileInfo.AllocationSize, 1u);
  ASSERT_EQ(Ask(2, 3), EFI_SUCCESS);
  EXPECT_NE(+F.FsSize.TotalAllocationUnits, 0u);
  // A class the client keeps nothing of is refused once answered.
  EXPECT_EQ(Ask(1, 7), EFI_DEVICE_ERROR);
  for (const SMB2_REQUEST_TRACE &T : RequestsSince(Mark)) {
    EXPECT_EQ(T.CreditCharge, Charge(1));
  }
  EXPECT_EQ(Close(&File), EFI_SUCCESS);

  // The volume's sizes, from the share root opened and closed for them,
  // against the share directory's file system.
  EFI_FILE_SYSTEM_INFO Info = {};
  Console([&] { ASSERT_EQ(GEE_NWGetFSInfo(&Share, &Info), EFI_SUCCESS); });
  struct statvfs Fs;
  ASSERT_EQ(statvfs(Work.c_str(), &Fs), 0);
  const INT64 Total = static_cast<INT64>(Fs.f_blocks * Fs.f_frsize);
  const INT64 Free = static_cast<INT64>(Fs.f_bavail * Fs.f_frsize);
  EXPECT_GT(+Info.BlockSize, 0u);
  EXPECT_LE(std::llabs(static_cast<INT64>(Info.VolumeSize) - Total), +Info.BlockSize);
  EXPECT_LE(std::llabs(static_cast<INT64>(Info.FreeSpace) - Free), 64 << 20); // others write
  EXPECT_EQ(+Info.ReadOnly, FALSE);
  EXPECT_EQ(+gFileAccessDetails.FileId[0], 0);
}

TEST_P(BothDialects, ListingsAttributesAndTimes) {
  MakeHostDir(Work + "/full");
  MakeHostDir(Work + "/full/sub");
  MakeHostDir(Work + "/empty");
  MakeHostDir(Work + "/n127");
  MakeHostDir(Work + "/n128");
  WriteHostFile(Work + "/full/plain.bin", Pattern(70000, 2));
  WriteHostFile(Work + "/n127/" + std::string(127, 'a'), {'1'});
  WriteHostFile(Work + "/n128/" + std::string(128, 'b'), {'2'});
  // A file created through the share gets the archive bit.
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open("full\\made.txt", kCreateReadWrite, &File), EFI_SUCCESS);
  UINTN Length = 10;
  ASSERT_EQ(Write(&File, Pattern(10, 1).data(), &Length, 0), EFI_SUCCESS);
  ASSERT_EQ(Close(&File), EFI_SUCCESS);

  std::map<std::string, EFI_FILE_INFO> Entries;
  std::string Out;
  ASSERT_EQ(List("full", &Entries, u"*", &Out), EFI_SUCCESS) << Out;
  ASSERT_EQ(Entries.size(), 5u) << Out;
  for (auto &[Name, E] : Entries) {
    EXPECT_EQ(+E.Size, (Name.size() * 2 + 1) * 2 + 80) << Name;
    ExpectFixedTime(E.CreateTime);
    ExpectFixedTime(E.LastAccessTime);
    ExpectFixedTime(E.ModificationTime);
  }
  EXPECT_EQ(+Entries["."].Attribute & EFI_FILE_DIRECTORY, EFI_FILE_DIRECTORY);
  EXPECT_EQ(+Entries[".."].Attribute & EFI_FILE_DIRECTORY, EFI_FILE_DIRECTORY);
  EXPECT_EQ(+Entries["sub"].Attribute & EFI_FILE_DIRECTORY, EFI_FILE_DIRECTORY);
  EXPECT_EQ(+Entries["plain.bin"].FileSize, 70000u);
  EXPECT_EQ(+Entries["made.txt"].FileSize, 10u);
  // A file with no attributes is "normal" (0x80), reported as a system file.
  EXPECT_EQ(+Entries["plain.bin"].Attribute, EFI_FILE_SYSTEM);
  EXPECT_EQ(+Entries["made.txt"].Attribute, EFI_FILE_ARCHIVE);

  // A stat follows the same rules and leaves the time zone alone.
  EFI_FILE_INFO Stat = {};
  Stat.CreateTime.TimeZone = 60;
  std::u16string Path = Remote("full\\plain.bin");
  Console([&] { ASSERT_EQ(GEE_NWGetFileStat(&Share, Path.c_str(), &Stat), EFI_SUCCESS); });
  EXPECT_EQ(+Stat.FileSize, 70000u);
  EXPECT_EQ(+Stat.Attribute, EFI_FILE_SYSTEM);
  ExpectFixedTime(Stat.ModificationTime);
  EXPECT_EQ(+Stat.CreateTime.TimeZone, 60);

  Entries.clear();
  ASSERT_EQ(List("empty", &Entries), EFI_SUCCESS);
  EXPECT_EQ(Entries.size(), 2u);
  EXPECT_EQ(Entries.count(".") + Entries.count(".."), 2u);
  // No match: the server's error status fails the listing.
  Entries.clear();
  EXPECT_EQ(List("empty", &Entries, u"nothing*", &Out), EFI_DEVICE_ERROR);
  EXPECT_TRUE(Contains(Out, "SMB2_DirInfo Failed!")) << Out;
  // 127 UTF-16 characters pass; 128 (256 bytes) end the listing.
  ASSERT_EQ(List("n127", &Entries), EFI_SUCCESS);
  EXPECT_EQ(Entries.count(std::string(127, 'a')), 1u);
  Entries.clear();
  EXPECT_EQ(List("n128", &Entries, u"*", &Out), EFI_SECURITY_VIOLATION);
  EXPECT_TRUE(Contains(Out, "Error! FileNameLength 256 is greater than limited 255 length\n"));
  EXPECT_TRUE(Entries.empty());
}

TEST_P(BothDialects, ReadAtEndOfFileFailsWithoutBecomingSuccess) {
  WriteHostFile(Work + "/short.txt", {'a', 'b', 'c'});
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open("short.txt", EFI_FILE_MODE_READ, &File), EFI_SUCCESS);
  UINT8 Buffer[16] = {};
  UINTN Count = 99;
  std::string Out;
  EXPECT_EQ(Read(&File, Buffer, sizeof(Buffer), 3, &Count, &Out), EFI_DEVICE_ERROR);
  EXPECT_EQ(Count, 0u);
  EXPECT_EQ(+TransactDetails.ResponseStatus, STATUS_END_OF_FILE);
  // A read leaves the share details' status as it set it, so the
  // end-of-file rule never applies.
  EXPECT_EQ(gSMB2ShareDetails.LastStatus, STATUS_UNSUCCESSFUL);
  EXPECT_FALSE(Contains(Out, "Exiting as success")) << Out;
  // Reaching past the end: the bytes there are, then the failing request.
  EXPECT_EQ(Read(&File, Buffer, sizeof(Buffer), 0, &Count), EFI_DEVICE_ERROR);
  EXPECT_EQ(Count, 3u);
  EXPECT_EQ(std::string(reinterpret_cast<char *>(Buffer), 3), "abc");
  EXPECT_EQ(Close(&File), EFI_SUCCESS); // still in step
}

TEST_P(BothDialects, StatusRecordAndTheOperationsThatSendNothing) {
  NW_REMOTE_FILE File;
  EXPECT_EQ(Open("absent.txt", EFI_FILE_MODE_READ, &File), EFI_DEVICE_ERROR);
  EXPECT_EQ(RecordedStatus(), EFI_DEVICE_ERROR);
  WriteHostFile(Work + "/present.txt", {'p'});
  ASSERT_EQ(Open("present.txt", EFI_FILE_MODE_READ, &File), EFI_SUCCESS);
  EXPECT_EQ(RecordedStatus(), EFI_SUCCESS);
  EXPECT_EQ(Close(&File), EFI_SUCCESS);

  const UINT64 Requests = gSMB2RequestCount;
  const UINT64 MessageId = TransactDetails.MessageId;
  const std::function<EFI_STATUS()> Local[] = {
      [&] { return GEE_NWMkdir(&Share, u"newdir"); },
      [&] { return GEE_NWRemove(&Share, u"present.txt"); },
      [&] { return GEE_NWFindClose(&Share, nullptr); },
      [&] { return GEE_NWFSetSize(&Share, &File, 4096); },
      [&] { return GEE_NWFCommit(&Share, &File, 0); },
  };
  for (const auto &Call : Local) {
    Console([] { SetOperationStatus(EFI_ABORTED); });
    EXPECT_EQ(Quiet([&] { return Call(); }), EFI_SUCCESS);
    EXPECT_EQ(RecordedStatus(), EFI_SUCCESS);
  }
  EXPECT_EQ(gSMB2RequestCount, Requests);
  EXPECT_EQ(+TransactDetails.MessageId, MessageId);
  EXPECT_TRUE(std::filesystem::exists(Work + "/present.txt"));
}

TEST_P(BothDialects, ListingsLeftUnfinishedOrFailedLeakNothing) {
  MakeHostDir(Work + "/many");
  for (int I = 0; I < 20; I++) {
    WriteHostFile(Work + "/many/f" + std::to_string(I), {'x'});
  }
  snprintf(Share.FilePath, sizeof(Share.FilePath), "%s\\many", WorkName.c_str());
  Console([&] {
    EFI_FILE_INFO *Entry = nullptr;
    for (int Round = 0; Round < 2; Round++) { // abandoned after two entries
      ASSERT_EQ(GEE_NWFindFirst(&Share, u"*", &Entry), EFI_SUCCESS);
      FreePool(Entry);
      ASSERT_EQ(GEE_NWFindNext(&Share, &Entry), EFI_SUCCESS);
      FreePool(Entry);
    }
    EXPECT_EQ(GEE_NWFindFirst(&Share, u"nomatch", &Entry), EFI_DEVICE_ERROR);
    EXPECT_EQ(GEE_NWFindNext(&Share, &Entry), EFI_NOT_FOUND);
    ASSERT_EQ(GEE_NWFindFirst(&Share, u"*", &Entry), EFI_SUCCESS); // walked to the end
    int Count = 0;
    do {
      FreePool(Entry);
      Count++;
    } while (GEE_NWFindNext(&Share, &Entry) == EFI_SUCCESS);
    EXPECT_EQ(Count, 22);
    ASSERT_EQ(GEE_NWFindFirst(&Share, u"*", &Entry), EFI_SUCCESS); // left for the disconnect
    FreePool(Entry);
    EXPECT_EQ(GEE_NWFSDisconnect(nullptr, nullptr), EFI_SUCCESS);
  });
  EXPECT_EQ(gDirNodePtr, nullptr);
  ExpectNoPoolLeak();
}

INSTANTIATE_TEST_SUITE_P(Dialects, BothDialects, ::testing::Values("SMB2_02", "SMB2_10"),
                         [](const ::testing::TestParamInfo<const char *> &P) {
                           return std::string(P.param[5] == '0' ? "Smb202" : "Smb210");
                         });

TEST_F(FileOpsSambaTest, NfsShareTypeReachesTheSmb2Adapter) {
  StartAndConnect("SMB2_10", NW_SHARE_TYPE_NFS);
  EXPECT_EQ(gSMB2AdapterState, SMB2_FS_STATE_READY);
  EXPECT_STREQ(gSMB2ShareDetails.Sharename, "\\\\127.0.0.1\\cifsshare");
}

// Reads the share file named by CIFSDRV_BENCH_FILE five times (or
// CIFSDRV_BENCH_ROUNDS) through GEE_NWFRead in 1 MiB calls, the volume's
// largest, and prints each time and the median.
TEST_F(FileOpsSambaTest, DISABLED_ReadThroughput) {
  const char *Name = getenv("CIFSDRV_BENCH_FILE");
  ASSERT_NE(Name, nullptr);
  StartAndConnect("SMB2_10");
  const UINT64 Size = std::filesystem::file_size(SambaServer::ShareDir("SMB2_10") + "/" + Name);
  const char *RoundsText = getenv("CIFSDRV_BENCH_ROUNDS");
  const int Rounds = RoundsText != nullptr ? std::max(1, atoi(RoundsText)) : 5;
  std::vector<UINT8> Buffer(1024 * 1024);
  std::vector<double> Seconds;
  for (int Round = 0; Round < Rounds; Round++) {
    NW_REMOTE_FILE File;
    ZeroMem(&File, sizeof(File));
    Strings.push_back(U16(Name));
    File.FileName = Strings.back().data();
    Console([&] { ASSERT_EQ(GEE_NWFOpen(&Share, &File, EFI_FILE_MODE_READ, 2), EFI_SUCCESS); });
    auto Start = std::chrono::steady_clock::now();
    for (UINT64 At = 0; At < Size;) {
      UINTN Count = 0;
      UINTN Length = Buffer.size();
      UINT64 Offset = At;
      ASSERT_EQ(GEE_NWFRead(&Share, &File, Buffer.data(), &Length, &Offset, &Count), EFI_SUCCESS);
      ASSERT_GT(Count, 0u);
      At += Count;
    }
    Seconds.push_back(
        std::chrono::duration<double>(std::chrono::steady_clock::now() - Start).count());
    EXPECT_EQ(Close(&File), EFI_SUCCESS);
    printf("bench-read: round %d %.3f s %.1f MiB/s\n", Round, Seconds.back(),
           Size / 1048576.0 / Seconds.back());
  }
  std::sort(Seconds.begin(), Seconds.end());
  const double Median = Seconds[Seconds.size() / 2];
  printf("bench-read: GEE_NWFRead median %.3f s %.1f MiB/s\n", Median, Size / 1048576.0 / Median);
}

} // namespace
