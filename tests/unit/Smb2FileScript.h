// A share served by the scripted loopback server: the connect is answered
// as a server with the given dialect and capabilities would, the test adds
// the answers to its file operations, and the disconnect is answered with
// the message ids the client actually used. Builders for the file-operation
// answers that the tests then bend.
#pragma once

#include "MockSmbServer.h"
#include "Smb2TestEnv.h"
#include "smb2/SMB2FsAdapter.h"
#include "volume/NWLib.h"

#include <list>
#include <string>
#include <vector>

namespace FileScript {

using MockSmb::Bytes;

using MockSmb::Concat;
using MockSmb::Le;

inline uint64_t MessageIdOf(const Bytes &Request) {
  return MockSmb::GetLe64(Request, 4 + 24);
}
inline uint16_t CommandOf(const Bytes &Request) {
  return MockSmb::GetLe16(Request, 4 + 12);
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

} // namespace FileScript
