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

// Value appended as Width little-endian bytes.
inline void Put(Bytes &Out, size_t Width, uint64_t Value) {
  for (size_t I = 0; I < Width; I++) {
    Out.push_back(static_cast<uint8_t>(Value >> (8 * I)));
  }
}

inline uint64_t MessageIdOf(const Bytes &Request) {
  return MockSmb::GetLe64(Request, 4 + 24);
}
inline uint16_t CommandOf(const Bytes &Request) {
  return MockSmb::GetLe16(Request, 4 + 12);
}

inline Bytes HeaderFor(uint16_t Command, uint64_t MessageId, uint32_t Status = 0) {
  MockSmb::HeaderFields Fields;
  Fields.Command = Command;
  Fields.Status = Status;
  Fields.MessageId = MessageId;
  Fields.SessionId = MockSmb::kSessionId;
  Fields.TreeId = MockSmb::kTreeId;
  return MockSmb::Header(Fields);
}

constexpr uint8_t kFileId[16] = {1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16};

// A CREATE answer; ContextsLength is announced, Tail follows the body.
inline Bytes CreateAnswer(uint64_t MessageId, const uint8_t *FileId = kFileId,
                          uint32_t ContextsLength = 0, const Bytes &Tail = {}) {
  Bytes Body;
  Put(Body, 2, 89);
  Body.push_back(0); // oplock
  Body.push_back(0);
  Put(Body, 4, 1); // opened
  for (int I = 0; I < 4; I++) {
    Put(Body, 8, 0x01D0000000000000ULL + I);
  }
  Put(Body, 8, 4096);
  Put(Body, 8, 100);
  Put(Body, 4, 0x20);
  Put(Body, 4, 0);
  Body.insert(Body.end(), FileId, FileId + 16);
  Put(Body, 4, ContextsLength == 0 ? 0 : 152);
  Put(Body, 4, ContextsLength);
  return MockSmb::Frame(MockSmb::Concat({HeaderFor(5, MessageId), Body, Tail}));
}

inline Bytes CloseAnswer(uint64_t MessageId) {
  Bytes Body;
  Put(Body, 2, 60);
  Body.resize(60, 0);
  return MockSmb::Frame(MockSmb::Concat({HeaderFor(6, MessageId), Body}));
}

// A READ answer carrying Data; DataLength announces Announced bytes (the
// data's size unless given).
inline Bytes ReadAnswer(uint64_t MessageId, const Bytes &Data, int64_t Announced = -1) {
  Bytes Body;
  Put(Body, 2, 17);
  Body.push_back(0x50);
  Body.push_back(0);
  Put(Body, 4,
      Announced < 0 ? static_cast<uint32_t>(Data.size()) : static_cast<uint32_t>(Announced));
  Put(Body, 4, 0);
  Put(Body, 4, 0);
  return MockSmb::Frame(MockSmb::Concat({HeaderFor(8, MessageId), Body, Data}));
}

inline Bytes WriteAnswer(uint64_t MessageId, uint32_t Count) {
  Bytes Body;
  Put(Body, 2, 17);
  Put(Body, 2, 0);
  Put(Body, 4, Count);
  Put(Body, 4, 0);
  Put(Body, 4, 0);
  return MockSmb::Frame(MockSmb::Concat({HeaderFor(9, MessageId), Body}));
}

// A QUERY_INFO (16) or QUERY_DIRECTORY (14) answer with Output;
// OutputBufferLength announces Announced bytes unless -1.
inline Bytes QueryAnswer(uint16_t Command, uint64_t MessageId, const Bytes &Output,
                         int64_t Announced = -1) {
  Bytes Body;
  Put(Body, 2, 9);
  Put(Body, 2, 72);
  Put(Body, 4,
      Announced < 0 ? static_cast<uint32_t>(Output.size()) : static_cast<uint32_t>(Announced));
  return MockSmb::Frame(MockSmb::Concat({HeaderFor(Command, MessageId), Body, Output}));
}

// One FileFullDirectoryInformation entry; NameLength announces the name's
// byte count unless given.
inline Bytes DirEntry(const std::string &Name, uint32_t Next, uint64_t Size = 0,
                      uint32_t Attributes = 0x20, int64_t NameLength = -1) {
  Bytes Entry;
  Put(Entry, 4, Next);
  Put(Entry, 4, 0);
  for (int I = 0; I < 4; I++) {
    Put(Entry, 8, 0x01D0000000000000ULL);
  }
  Put(Entry, 8, Size);
  Put(Entry, 8, (Size + 4095) / 4096 * 4096);
  Put(Entry, 4, Attributes);
  Bytes Utf = MockSmb::Utf16(Name);
  MockSmb::PutLe32(Entry, NameLength < 0 ? static_cast<uint32_t>(Utf.size())
                                         : static_cast<uint32_t>(NameLength));
  Put(Entry, 4, 0);
  Entry.insert(Entry.end(), Utf.begin(), Utf.end());
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
    Server.ExpectRequest().Send(MockSmb::NegotiateResponse(Dialect, 1, Capabilities));
    Server.ExpectRequest().Send(MockSmb::SessionSetupResponse(
        0xC0000016, 1, MockSmb::kSessionId, MockSmb::Challenge(MockSmb::ChallengeShape())));
    Server.ExpectRequest().Send(MockSmb::SessionSetupResponse(0, 2, MockSmb::kSessionId, {}));
    Server.ExpectRequest().Send(
        MockSmb::TreeConnectResponse(3, MockSmb::kSessionId, MockSmb::kTreeId));
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
    EFI_STATUS Status = EFI_SUCCESS;
    std::string Text = Console([&] { Status = GEE_NWFOpen(&Share, File, EFI_FILE_MODE_READ, 2); });
    if (Out != nullptr) {
      *Out = Text;
    }
    return Status;
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
