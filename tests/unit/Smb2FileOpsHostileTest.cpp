// File operations against a scripted server that lies: lengths beyond what
// it sends, offsets outside its answer, names beyond their entries, zero
// file ids and resets in the middle of data. Each must end in a clear error
// without reading or writing outside a buffer (ASan and UBSan watch), with
// the pool back where it started and, where the message was whole, the
// connection still in step for the next request.
#include "Smb2FileScript.h"

#include <string.h>

namespace {

using namespace FileScript;
using MockSmb::Bytes;

class Smb2FileOpsHostileTest : public ScriptedShareTest {
protected:
  // A read of Length bytes at 0 through the network library.
  EFI_STATUS ReadFile(NW_REMOTE_FILE *File, UINT8 *Buffer, UINTN Length, UINTN *Count,
                      std::string *Out) {
    UINT64 Offset = 0;
    EFI_STATUS Status = EFI_SUCCESS;
    *Out = Console([&] { Status = GEE_NWFRead(&Share, File, Buffer, &Length, &Offset, Count); });
    return Status;
  }

  EFI_STATUS FindFirst(std::string *Out, EFI_FILE_INFO **Entry) {
    EFI_STATUS Status = EFI_SUCCESS;
    *Out = Console([&] { Status = GEE_NWFindFirst(&Share, u"*", Entry); });
    return Status;
  }

  EFI_STATUS CloseFile(NW_REMOTE_FILE *File) {
    return Quiet([&] { return GEE_NWFClose(&Share, File); });
  }
};

TEST_F(Smb2FileOpsHostileTest, ReadDataLengthBeyondWhatFollowsOrWhatWasAskedFor) {
  ScriptConnect();
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  // Announces 1000 bytes and sends 10.
  Expect([](uint64_t Id) { return ReadAnswer(Id, Bytes(10, 0xAB), 1000); });
  // Sends (and announces) 200 bytes for a 100-byte request.
  Expect([](uint64_t Id) { return ReadAnswer(Id, Bytes(200, 0xCD)); });
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  ScriptDisconnect();
  Connect();
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open(u"file.bin", &File), EFI_SUCCESS);

  std::vector<UINT8> Buffer(100 + 32, 0x5A);
  UINTN Count = 77;
  std::string Out;
  EXPECT_EQ(ReadFile(&File, Buffer.data(), 100, &Count, &Out), EFI_DEVICE_ERROR);
  EXPECT_EQ(Count, 0u);
  EXPECT_TRUE(Contains(Out, "DataLength 1000 is beyond the 10 bytes that follow or the 100 bytes "
                            "asked for!"))
      << Out;
  EXPECT_TRUE(Contains(Out, "SMB2ReadResponse returned unsuccessful! Status = 0xc0000001")) << Out;

  EXPECT_EQ(ReadFile(&File, Buffer.data(), 100, &Count, &Out), EFI_DEVICE_ERROR);
  EXPECT_TRUE(Contains(Out, "DataLength 200 is beyond")) << Out;
  // Nothing of either answer reached the caller's buffer.
  EXPECT_EQ(std::count(Buffer.begin(), Buffer.end(), 0x5A), 132);

  // Both answers were consumed whole: the close is understood.
  EXPECT_EQ(CloseFile(&File), EFI_SUCCESS);
  EXPECT_EQ(Server.Failure(), "");
}

TEST_F(Smb2FileOpsHostileTest, ResetInTheMiddleOfARead) {
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
  EXPECT_TRUE(Contains(Out, "SMB2_Read Failed!")) << Out;
  EXPECT_EQ(Buffer[64511], 1);
}

TEST_F(Smb2FileOpsHostileTest, PeerThatClosesInTheMiddleOfDataDoesNotHang) {
  ScriptConnect();
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  Server.Respond([](const Bytes &Request) {
    Bytes Whole = ReadAnswer(MessageIdOf(Request), Bytes(5000, 3));
    return Bytes(Whole.begin(), Whole.begin() + 84 + 100);
  });
  Server.Close();
  Connect();
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open(u"f", &File), EFI_SUCCESS);
  std::vector<UINT8> Buffer(5000);
  UINTN Count = 0;
  std::string Out;
  EXPECT_EQ(ReadFile(&File, Buffer.data(), Buffer.size(), &Count, &Out), EFI_DEVICE_ERROR);
  EXPECT_EQ(Count, 0u);
}

TEST_F(Smb2FileOpsHostileTest, ReadAnswerWithoutDataEndsTheReadInsteadOfLooping) {
  ScriptConnect();
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  Expect([](uint64_t Id) { return ReadAnswer(Id, {}); });
  ScriptDisconnect();
  Connect();
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open(u"f", &File), EFI_SUCCESS);
  UINT8 Buffer[64];
  UINTN Count = 9;
  std::string Out;
  EXPECT_EQ(ReadFile(&File, Buffer, sizeof(Buffer), &Count, &Out), EFI_SUCCESS);
  EXPECT_EQ(Count, 0u);
  EXPECT_TRUE(Contains(Out, "No file data to read\n")) << Out;
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
  EXPECT_TRUE(Contains(Out, "SMB2CreateResponse returned unsuccessful! Status = 0xc0000001"))
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

TEST_F(Smb2FileOpsHostileTest, QueryAnswersLongerThanTheMessageOrTheRequest) {
  ScriptConnect();
  // The share root is opened for the query and closed again each time.
  for (uint32_t Announced : {0xFFFFFF00u, 9000u}) {
    Expect([](uint64_t Id) { return CreateAnswer(Id); });
    Expect([Announced](uint64_t Id) {
      return QueryAnswer(16, Id, Bytes(Announced == 9000u ? 9000 : 24, 1), Announced);
    });
    Expect([](uint64_t Id) { return CloseAnswer(Id); });
  }
  // A file-system answer shorter than its 24-byte structure.
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  Expect([](uint64_t Id) { return QueryAnswer(16, Id, Bytes(8, 1)); });
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  ScriptDisconnect();
  Connect();
  for (const char *Expected :
       {"OutputBufferLength 4294967040 is beyond the 24 bytes that follow or the 8293 bytes",
        "OutputBufferLength 9000 is beyond the 9000 bytes that follow or the 8293 bytes",
        "Output buffer length 8 is shorter than the 24 bytes of class 3!"}) {
    EFI_FILE_SYSTEM_INFO Info = {};
    Info.BlockSize = 123;
    EFI_STATUS Status = EFI_SUCCESS;
    std::string Out = Console([&] { Status = GEE_NWGetFSInfo(&Share, &Info); });
    EXPECT_EQ(Status, EFI_DEVICE_ERROR) << Expected;
    EXPECT_TRUE(Contains(Out, Expected)) << Out;
    EXPECT_TRUE(Contains(Out, "SMB2_FSInfo Failed!")) << Out;
    EXPECT_EQ(+Info.BlockSize, 123u);
  }
  EXPECT_EQ(Server.Failure(), "");
}

TEST_F(Smb2FileOpsHostileTest, DirectoryAnswersThatPointOutsideThemselves) {
  struct Case {
    const char *What;
    Bytes Answer;
    EFI_STATUS Status;
    const char *Message;
  };
  Bytes First = DirEntry("first", 80);
  Bytes Wrap = First;
  // From the second entry at 80, a NextEntryOffset that wraps a 32-bit sum
  // back to the first entry.
  Bytes Second = DirEntry("second", 0xFFFFFFB0u);
  Wrap.insert(Wrap.end(), Second.begin(), Second.end());
  Bytes Outside = DirEntry("first", 4000);
  Bytes NameBeyondEntry = DirEntry("abcdefgh", 72, 0, 0x20, 16);
  NameBeyondEntry.resize(72 + 80, 0);
  Bytes NameBeyondAnswer = DirEntry("last", 0, 0, 0x20, 200);
  Bytes Truncated = DirEntry("x", 0);
  Truncated.resize(40);
  Bytes LongName = DirEntry(std::string(128, 'n'), 0);
  std::vector<Case> Cases = {
      {"next entry wraps", Wrap, EFI_PROTOCOL_ERROR, "NextEntryOffset 4294967216 at offset 80"},
      {"next entry outside", Outside, EFI_PROTOCOL_ERROR,
       "NextEntryOffset 4000 at offset 0 points outside the answer of 78 bytes"},
      {"name beyond entry", NameBeyondEntry, EFI_PROTOCOL_ERROR,
       "FileNameLength 16 runs past its entry at offset 0"},
      {"name beyond answer", NameBeyondAnswer, EFI_PROTOCOL_ERROR,
       "FileNameLength 200 runs past its entry at offset 0"},
      {"truncated entry", Truncated, EFI_PROTOCOL_ERROR,
       "Directory entry at offset 0 runs past the answer of 40 bytes"},
      {"name of 256 bytes", LongName, EFI_SECURITY_VIOLATION,
       "Error! FileNameLength 256 is greater than limited 255 length\n"},
  };
  ScriptConnect();
  for (const Case &C : Cases) {
    Bytes Answer = C.Answer;
    Expect([](uint64_t Id) { return CreateAnswer(Id); });
    Expect([Answer](uint64_t Id) { return QueryAnswer(14, Id, Answer); });
    Expect([](uint64_t Id) { return CloseAnswer(Id); });
  }
  // A directory answer longer than the 16384 bytes asked for.
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  Expect([](uint64_t Id) { return QueryAnswer(14, Id, Bytes(16400, 0)); });
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  // A successful answer without output: nothing to walk, no first entry.
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  Expect([](uint64_t Id) { return QueryAnswer(14, Id, Bytes()); });
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  ScriptDisconnect();
  Connect();
  for (const Case &C : Cases) {
    EFI_FILE_INFO *Entry = nullptr;
    std::string Out;
    EXPECT_EQ(FindFirst(&Out, &Entry), C.Status) << C.What << Out;
    EXPECT_TRUE(Contains(Out, C.Message)) << C.What << Out;
    EXPECT_TRUE(Contains(Out, "Read directory error!")) << C.What;
    EXPECT_EQ(Entry, nullptr);
    // The nodes made before the bad entry are gone with the answer copy.
    EXPECT_EQ(gDirNodePtr, nullptr) << C.What;
    EXPECT_EQ(+gFileAccessDetails.FullDirInfoPtr, nullptr) << C.What;
  }
  EFI_FILE_INFO *Entry = nullptr;
  std::string Out;
  EXPECT_EQ(FindFirst(&Out, &Entry), EFI_DEVICE_ERROR);
  EXPECT_TRUE(Contains(Out, "OutputBufferLength 16400 is beyond the 16400 bytes that follow or the "
                            "16384 bytes asked for!"))
      << Out;
  EXPECT_EQ(FindFirst(&Out, &Entry), EFI_INVALID_PARAMETER);
  EXPECT_TRUE(Contains(Out, "QueryDirResp->OutputBufferLength is 0!\n")) << Out;
  EXPECT_TRUE(Contains(Out, "FileAccessDetails.FullDirInfoPtr is NULL!\n")) << Out;
  EXPECT_TRUE(Contains(Out, "SMB2_PopulateFileInfo failed!")) << Out;
  EXPECT_EQ(Entry, nullptr);
  EXPECT_EQ(gDirNodePtr, nullptr);
  EXPECT_EQ(Server.Failure(), "");
}

TEST_F(Smb2FileOpsHostileTest, AnswersTooShortForTheirFixedPart) {
  ScriptConnect();
  Expect([](uint64_t Id) { return CreateAnswer(Id); });
  // A READ answer of 4 body bytes.
  Expect([](uint64_t Id) { return AnswerTo(8, Id, {Bytes{17, 0, 0x50, 0}}); });
  Expect([](uint64_t Id) { return CloseAnswer(Id); });
  ScriptDisconnect();
  Connect();
  NW_REMOTE_FILE File;
  ASSERT_EQ(Open(u"f", &File), EFI_SUCCESS);
  UINT8 Buffer[32];
  UINTN Count = 0;
  std::string Out;
  EXPECT_EQ(ReadFile(&File, Buffer, sizeof(Buffer), &Count, &Out), EFI_DEVICE_ERROR);
  EXPECT_TRUE(Contains(Out, "Response body of 4 bytes is shorter than its fixed part of 16 bytes!"))
      << Out;
  EXPECT_EQ(CloseFile(&File), EFI_SUCCESS);
}

TEST_F(Smb2FileOpsHostileTest, InterimAnswersAreSkippedUntilTheFinalOne) {
  ScriptConnect();
  Expect([](uint64_t Id) {
    return MockSmb::Concat(
        {MockSmb::ErrorResponse(5, 0x103, Id, MockSmb::kSessionId, MockSmb::kTreeId),
         CreateAnswer(Id)});
  });
  ScriptDisconnect();
  Connect();
  NW_REMOTE_FILE File;
  std::string Out;
  EXPECT_EQ(Open(u"slow", &File, &Out), EFI_SUCCESS) << Out;
  EXPECT_EQ(+File.FileId[0], 1);
  EXPECT_FALSE(Contains(Out, "BufPtr[")) << "an interim answer is not a refused header";
}

} // namespace
