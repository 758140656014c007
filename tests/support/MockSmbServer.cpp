// The scripted SMB2 test server and its byte builders.
#include "MockSmbServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstring>

namespace MockSmb {

namespace {

constexpr int kAcceptTimeoutMs = 10000;
constexpr int kReadTimeoutMs = 10000;
constexpr int kDrainIdleMs = 200;

} // namespace

bool WriteAll(int Fd, const uint8_t *Data, size_t Length) {
  while (Length > 0) {
    ssize_t Sent = send(Fd, Data, Length, MSG_NOSIGNAL);
    if (Sent <= 0) {
      return false;
    }
    Data += Sent;
    Length -= static_cast<size_t>(Sent);
  }
  return true;
}

bool ReadAll(int Fd, uint8_t *Data, size_t Length) {
  while (Length > 0) {
    ssize_t Got = read(Fd, Data, Length);
    if (Got <= 0) {
      return false;
    }
    Data += Got;
    Length -= static_cast<size_t>(Got);
  }
  return true;
}

bool ReadFrame(int Fd, Bytes &Out) {
  Out.assign(4, 0);
  if (!ReadAll(Fd, Out.data(), 4) || StreamLength(Out) > (1u << 24)) {
    return false;
  }
  Out.resize(4 + StreamLength(Out));
  return ReadAll(Fd, Out.data() + 4, Out.size() - 4);
}

int ListenOnLoopback(uint16_t *Port) {
  int Fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in In = {};
  In.sin_family = AF_INET;
  In.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t Size = sizeof(In);
  if (Fd < 0 || bind(Fd, reinterpret_cast<sockaddr *>(&In), Size) != 0 || listen(Fd, 1) != 0 ||
      getsockname(Fd, reinterpret_cast<sockaddr *>(&In), &Size) != 0) {
    if (Fd >= 0) {
      close(Fd);
    }
    return -1;
  }
  *Port = ntohs(In.sin_port);
  return Fd;
}

Bytes Le(uint64_t Value, size_t Width) {
  Bytes Out(Width);
  for (size_t I = 0; I < Width; I++) {
    Out[I] = static_cast<uint8_t>(Value >> (8 * I));
  }
  return Out;
}
void SetLe16(Bytes &Out, size_t At, uint16_t Value) {
  Out.at(At) = static_cast<uint8_t>(Value);
  Out.at(At + 1) = static_cast<uint8_t>(Value >> 8);
}
uint64_t GetLe(const Bytes &In, size_t At, size_t Width) {
  uint64_t Value = 0;
  for (size_t I = Width; I-- > 0;) {
    Value = Value << 8 | In.at(At + I);
  }
  return Value;
}
uint16_t GetLe16(const Bytes &In, size_t At) {
  return static_cast<uint16_t>(GetLe(In, At, 2));
}
uint32_t GetLe32(const Bytes &In, size_t At) {
  return static_cast<uint32_t>(GetLe(In, At, 4));
}
uint64_t GetLe64(const Bytes &In, size_t At) {
  return GetLe(In, At, 8);
}

Bytes Utf16(const std::string &Text) {
  Bytes Out;
  for (unsigned char C : Text) {
    Out.insert(Out.end(), {C, 0});
  }
  return Out;
}

Bytes Concat(std::initializer_list<Bytes> Parts) {
  Bytes Out;
  for (const Bytes &Part : Parts) {
    Out.insert(Out.end(), Part.begin(), Part.end());
  }
  return Out;
}

std::string Hex(const uint8_t *Data, size_t Length) {
  std::string Out;
  char Pair[3];
  for (size_t I = 0; I < Length; I++) {
    snprintf(Pair, sizeof(Pair), "%02x", Data[I]);
    Out += Pair;
  }
  return Out;
}

Bytes FromHex(const std::string &Text) {
  Bytes Out;
  for (size_t I = 0; I + 1 < Text.size(); I += 2) {
    Out.push_back(static_cast<uint8_t>(std::stoul(Text.substr(I, 2), nullptr, 16)));
  }
  return Out;
}

Bytes AvPair(uint16_t Id, const Bytes &Value) {
  return Concat({Le(Id, 2), Le(Value.size(), 2), Value});
}
Bytes AvEol() {
  return Bytes(4, 0);
}

Bytes DefaultTargetInfo(const std::string &Domain) {
  return Concat({AvPair(2, Utf16(Domain)), AvPair(1, Utf16("CIFSTESTSRV")),
                 AvPair(4, Utf16("localdomain")), AvPair(3, Utf16("cifstestsrv.localdomain")),
                 AvPair(7, Le(0x01DA1B2C3D4E5F60ULL, 8)), AvEol()});
}

Bytes Challenge(const ChallengeShape &Shape) {
  const size_t Fixed = Shape.WithVersion ? 56 : 48;
  const size_t First = Fixed;
  const size_t Second = Fixed + (Shape.InfoBeforeName ? Shape.TargetInfo : Shape.TargetName).size();
  size_t NameOffset = Shape.InfoBeforeName ? Second : First;
  size_t InfoOffset = Shape.InfoBeforeName ? First : Second;
  size_t InfoLength = Shape.InfoLength >= 0 ? size_t(Shape.InfoLength) : Shape.TargetInfo.size();
  Bytes Out = Concat({{'N', 'T', 'L', 'M', 'S', 'S', 'P', 0},
                      Le(Shape.MessageType, 4),
                      Le(Shape.TargetName.size(), 2),
                      Le(Shape.TargetName.size(), 2),
                      Le(Shape.NameOffset >= 0 ? size_t(Shape.NameOffset) : NameOffset, 4),
                      Le(Shape.Flags, 4),
                      Bytes(Shape.ServerChallenge.begin(), Shape.ServerChallenge.end()),
                      Le(0, 8),
                      Le(InfoLength, 2),
                      Le(Shape.InfoMaxLength >= 0 ? size_t(Shape.InfoMaxLength) : InfoLength, 2),
                      Le(Shape.InfoOffset >= 0 ? size_t(Shape.InfoOffset) : InfoOffset, 4)});
  if (Shape.WithVersion) {
    Out = Concat({Out, {6, 1, 0, 0, 0, 0, 0, 15}});
  }
  return Shape.InfoBeforeName ? Concat({Out, Shape.TargetInfo, Shape.TargetName})
                              : Concat({Out, Shape.TargetName, Shape.TargetInfo});
}

Bytes Header(const HeaderFields &Shape) {
  return Concat({{0xFE, 'S', 'M', 'B'},
                 Le(64, 2),
                 Le(0, 2),
                 Le(Shape.Status, 4),
                 Le(Shape.Command, 2),
                 Le(Shape.Credits, 2),
                 Le(Shape.Flags, 4),
                 Le(0, 4),
                 Le(Shape.MessageId, 8),
                 Le(0xFEFF, 4),
                 Le(Shape.TreeId, 4),
                 Le(Shape.SessionId, 8),
                 Bytes(16, 0)});
}

Bytes Frame(const Bytes &Message) {
  Bytes Prefix = Le(Message.size(), 4);
  return Concat({Bytes(Prefix.rbegin(), Prefix.rend()), Message});
}

uint32_t StreamLength(const Bytes &Framed) {
  return static_cast<uint32_t>(Framed.at(0)) << 24 | static_cast<uint32_t>(Framed.at(1)) << 16 |
         static_cast<uint32_t>(Framed.at(2)) << 8 | Framed.at(3);
}

Bytes NegotiateResponse(uint16_t Dialect, uint16_t SecurityMode, uint32_t Capabilities,
                        uint32_t MaxSize, uint16_t Credits) {
  HeaderFields Shape;
  Shape.Credits = Credits;
  Bytes Guid = FromHex("a0a1a2a3a4a5a6a7a8a9aaabacadaeaf");
  return Frame(Concat({Header(Shape), Le(65, 2), Le(SecurityMode, 2), Le(Dialect, 2), Le(0, 2),
                       Guid, Le(Capabilities, 4), Le(MaxSize, 4), Le(MaxSize, 4), Le(MaxSize, 4),
                       Le(0x01DA000000000000ULL, 8), Le(0, 8), Le(128, 2), Le(8, 2), Le(0, 4),
                       FromHex("600606042b060105")}));
}

Bytes SessionSetupResponse(uint32_t Status, uint64_t MessageId, uint64_t SessionId,
                           const Bytes &Blob) {
  HeaderFields Shape{1, Status, MessageId, SessionId, 0, 1, 1};
  return Frame(Concat(
      {Header(Shape), Le(9, 2), Le(0, 2), Le(Blob.empty() ? 0 : 72, 2), Le(Blob.size(), 2), Blob}));
}

Bytes TreeConnectResponse(uint64_t MessageId, uint64_t SessionId, uint32_t TreeId) {
  HeaderFields Shape{3, 0, MessageId, SessionId, TreeId, 1, 1};
  // Disk share, no flags or capabilities, full access.
  return Frame(Concat({Header(Shape), Le(16, 2), {1, 0}, Le(0, 4), Le(0, 4), Le(0x001F01FF, 4)}));
}

Bytes SimpleResponse(uint16_t Command, uint64_t MessageId, uint64_t SessionId, uint32_t TreeId) {
  HeaderFields Shape{Command, 0, MessageId, SessionId, TreeId, 1, 1};
  return Frame(Concat({Header(Shape), Le(4, 2), Le(0, 2)}));
}

Bytes ErrorResponse(uint16_t Command, uint32_t Status, uint64_t MessageId, uint64_t SessionId,
                    uint32_t TreeId) {
  HeaderFields Shape{Command, Status, MessageId, SessionId, TreeId, 1, 1};
  return Frame(Concat({Header(Shape), Le(9, 2), Le(0, 6), Bytes(1, 0)}));
}

// ---------------------------------------------------------------------------
// Server
// ---------------------------------------------------------------------------
Server::Server() {
  ListenFd = ListenOnLoopback(&ListenPort);
  if (ListenFd < 0) {
    Fail("no loopback listener");
  }
}

Server::~Server() {
  Join();
  if (ListenFd >= 0) {
    close(ListenFd);
  }
}

Server &Server::ExpectRequest() {
  return Add({Step::Expect, {}, {}, 0, nullptr});
}
Server &Server::Send(const Bytes &Data) {
  return Add({Step::SendBytes, Data, {}, 0, nullptr});
}
Server &Server::SendInPieces(const Bytes &Data, const std::vector<size_t> &Cuts, int PauseMs) {
  return Add({Step::SendBytes, Data, Cuts, PauseMs, nullptr});
}
Server &Server::Respond(std::function<Bytes(const Bytes &)> Reply) {
  return Add({Step::Expect, {}, {}, 0, std::move(Reply)});
}
Server &Server::Pause(int Milliseconds) {
  return Add({Step::Sleep, {}, {}, Milliseconds, nullptr});
}
Server &Server::Close() {
  return Add({Step::CloseFin, {}, {}, 0, nullptr});
}
Server &Server::Reset() {
  return Add({Step::CloseRst, {}, {}, 0, nullptr});
}

Server &Server::Add(Step S) {
  Steps.push_back(std::move(S));
  return *this;
}

Server &Server::DrainUntilClosed() {
  Drain = true;
  return *this;
}

Server &Server::ScriptConnect(uint16_t Dialect, const ChallengeShape &Shape,
                              uint32_t Capabilities) {
  ExpectRequest().Send(NegotiateResponse(Dialect, 1, Capabilities));
  ExpectRequest().Send(SessionSetupResponse(0xC0000016, 1, kSessionId, Challenge(Shape)));
  ExpectRequest().Send(SessionSetupResponse(0, 2, kSessionId, {}));
  ExpectRequest().Send(TreeConnectResponse(3, kSessionId, kTreeId));
  return *this;
}

Server &Server::ScriptDisconnect() {
  ExpectRequest().Send(SimpleResponse(4, 4, kSessionId, kTreeId));
  ExpectRequest().Send(SimpleResponse(2, 5, kSessionId, kTreeId));
  return *this;
}

void Server::Start() {
  if (ListenFd >= 0) {
    Worker = std::thread([this] { Run(); });
  }
}

void Server::Join() {
  if (Worker.joinable()) {
    Worker.join();
  }
}

std::vector<Bytes> Server::Requests() {
  std::lock_guard<std::mutex> Guard(Lock);
  return Received;
}

std::string Server::Failure() {
  std::lock_guard<std::mutex> Guard(Lock);
  return Failed;
}

void Server::Fail(const std::string &Why) {
  std::lock_guard<std::mutex> Guard(Lock);
  if (Failed.empty()) {
    Failed = Why;
  }
}

void Server::Run() {
  pollfd Wait = {ListenFd, POLLIN, 0};
  if (poll(&Wait, 1, kAcceptTimeoutMs) != 1) {
    Fail("no client connected");
    return;
  }
  int Fd = accept4(ListenFd, nullptr, nullptr, SOCK_CLOEXEC);
  if (Fd < 0) {
    Fail("accept failed");
    return;
  }
  timeval Limit = {kReadTimeoutMs / 1000, 0};
  setsockopt(Fd, SOL_SOCKET, SO_RCVTIMEO, &Limit, sizeof(Limit));
  bool Open = true;
  for (size_t I = 0; I < Steps.size() && Open; I++) {
    Step &S = Steps[I];
    switch (S.What) {
    case Step::Expect: {
      Bytes Request;
      if (!ReadFrame(Fd, Request)) {
        Fail("step " + std::to_string(I) + ": expected a request, connection ended");
        close(Fd);
        Open = false;
        break;
      }
      {
        std::lock_guard<std::mutex> Guard(Lock);
        Received.push_back(Request);
      }
      if (S.Reply) {
        Bytes Answer = S.Reply(Request);
        if (!WriteAll(Fd, Answer.data(), Answer.size())) {
          Fail("step " + std::to_string(I) + ": reply not sent");
        }
      }
      break;
    }
    case Step::SendBytes: {
      size_t From = 0;
      std::vector<size_t> Cuts = S.Cuts;
      Cuts.push_back(S.Data.size());
      for (size_t Cut : Cuts) {
        if (!WriteAll(Fd, S.Data.data() + From, Cut - From)) {
          Fail("step " + std::to_string(I) + ": send failed");
        }
        From = Cut;
        std::this_thread::sleep_for(std::chrono::milliseconds(S.Ms));
      }
      break;
    }
    case Step::Sleep:
      std::this_thread::sleep_for(std::chrono::milliseconds(S.Ms));
      break;
    case Step::CloseFin:
      close(Fd);
      Open = false;
      break;
    case Step::CloseRst: {
      linger Abort = {1, 0};
      setsockopt(Fd, SOL_SOCKET, SO_LINGER, &Abort, sizeof(Abort));
      close(Fd);
      Open = false;
      break;
    }
    }
  }
  if (!Open) {
    return;
  }
  if (Drain) {
    // Keep what the client still sends, without answering, until it has
    // been quiet for a moment or closes.
    Bytes Request;
    pollfd Idle = {Fd, POLLIN, 0};
    while (poll(&Idle, 1, kDrainIdleMs) == 1 && ReadFrame(Fd, Request)) {
      std::lock_guard<std::mutex> Guard(Lock);
      Received.push_back(Request);
    }
  }
  close(Fd);
}

} // namespace MockSmb
