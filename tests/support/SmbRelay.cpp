// The misbehaving relay (see SmbRelay.h).
#include "SmbRelay.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>

namespace MockSmb {

namespace {

constexpr uint32_t kStatusPending = 0x00000103;
constexpr uint16_t kOplockBreak = 0x12;
constexpr int kIdleLimitMs = 30000;

int64_t NowNs() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

// An answer carrying only a header (and the 9-byte error body) in place of
// Frame's: an interim answer, or an unsolicited notification.
Bytes Companion(const Bytes &Answer, uint32_t Status, uint16_t Command, uint64_t MessageId) {
  Bytes Message(Answer.begin() + 4, Answer.begin() + 68);
  SetLe16(Message, 12, Command);
  for (int I = 0; I < 4; I++) {
    Message[8 + I] = static_cast<uint8_t>(Status >> (8 * I));
  }
  for (int I = 0; I < 8; I++) {
    Message[24 + I] = static_cast<uint8_t>(MessageId >> (8 * I));
  }
  std::fill(Message.begin() + 48, Message.end(), 0); // no signature
  Message[16] &= static_cast<uint8_t>(~0x08);
  Bytes Body = {9, 0, 0, 0, 0, 0, 0, 0, 0};
  Message.insert(Message.end(), Body.begin(), Body.end());
  return MockSmb::Frame(Message);
}

int Dial(uint16_t Port) {
  int Fd = socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in Addr = {};
  Addr.sin_family = AF_INET;
  Addr.sin_port = htons(Port);
  Addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (connect(Fd, reinterpret_cast<sockaddr *>(&Addr), sizeof(Addr)) != 0) {
    close(Fd);
    return -1;
  }
  return Fd;
}

} // namespace

Relay::Relay(std::vector<Fault> List, uint16_t Server)
    : Faults(std::move(List)), ServerPort(Server) {
  ListenFd = ListenOnLoopback(&ListenPort);
  LastByteNs = NowNs();
  Worker = std::thread([this] { Run(); });
}

Relay::~Relay() {
  Stop = true;
  if (Worker.joinable()) {
    Worker.join();
  }
  if (ListenFd >= 0) {
    close(ListenFd);
  }
}

double Relay::SecondsSinceLastByte() const {
  return static_cast<double>(NowNs() - LastByteNs.load()) / 1e9;
}

void Relay::SendToClient(int Client, const Bytes &Data) {
  WriteAll(Client, Data.data(), Data.size());
  LastByteNs = NowNs();
}

// Passes one answer of the server on, bent as the faults say. False when
// the client's connection is gone.
bool Relay::Answer(int Client, Bytes &Frame) {
  uint16_t Command = GetLe16(Frame, 16);
  uint64_t MessageId = GetLe64(Frame, 28);
  if (Mute) {
    return true;
  }
  if (GetLe32(Frame, 12) == kStatusPending || Command >= 32) {
    SendToClient(Client, Frame);
    return true;
  }
  Seen[Command]++;
  Bytes Request;
  for (auto &P : Pending) {
    if (P.first == MessageId) {
      Request = P.second;
    }
  }
  const Fault *Hit = nullptr;
  for (const Fault &F : Faults) {
    if (F.What != Fault::None && F.Command == Command &&
        (F.Occurrence == 0 || F.Occurrence == Seen[Command])) {
      Hit = &F;
    }
  }
  if (Hit == nullptr) {
    SendToClient(Client, Frame);
    return true;
  }
  Hits++;
  size_t Part = Hit->Count < Frame.size() ? Hit->Count : Frame.size();
  switch (Hit->What) {
  case Fault::ResetAfter:
  case Fault::CloseAfter: {
    SendToClient(Client, Bytes(Frame.begin(), Frame.begin() + static_cast<long>(Part)));
    if (Hit->What == Fault::ResetAfter) {
      linger Abort = {1, 0};
      setsockopt(Client, SOL_SOCKET, SO_LINGER, &Abort, sizeof(Abort));
    }
    return false;
  }
  case Fault::Silence:
    Mute = true;
    return true;
  case Fault::PendingForever:
    SendToClient(Client, Companion(Frame, kStatusPending, Command, MessageId));
    Mute = true;
    return true;
  case Fault::PendingFirst:
    SendToClient(Client, Companion(Frame, kStatusPending, Command, MessageId));
    break;
  case Fault::NotifyFirst:
    SendToClient(Client, Companion(Frame, 0, kOplockBreak, ~0ULL));
    break;
  case Fault::InPieces:
    for (size_t At = 0; At < Frame.size(); At += Part) {
      size_t End = At + Part < Frame.size() ? At + Part : Frame.size();
      SendToClient(Client, Bytes(Frame.begin() + static_cast<long>(At),
                                 Frame.begin() + static_cast<long>(End)));
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
  case Fault::Rewrite: {
    Hit->Edit(Frame, Request);
    Bytes Message(Frame.begin() + 4, Frame.end());
    Frame = MockSmb::Frame(Message);
    break;
  }
  case Fault::None:
    break;
  }
  SendToClient(Client, Frame);
  return true;
}

void Relay::Run() {
  // One connection after the other (a mount retries once), each with the
  // same faults.
  while (!Stop && ListenFd >= 0) {
    pollfd Wait = {ListenFd, POLLIN, 0};
    if (poll(&Wait, 1, 100) != 1) {
      continue;
    }
    int Client = accept(ListenFd, nullptr, nullptr);
    int Server = Dial(ServerPort);
    Serve(Client, Server);
    if (Client >= 0) {
      close(Client);
    }
    if (Server >= 0) {
      close(Server);
    }
  }
}

void Relay::Serve(int Client, int Server) {
  Pending.clear();
  std::fill(std::begin(Seen), std::end(Seen), 0);
  Mute = false;
  int64_t Idle = NowNs();
  while (!Stop && Client >= 0 && Server >= 0 && NowNs() - Idle < kIdleLimitMs * 1000000LL) {
    pollfd Fds[2] = {{Client, POLLIN, 0}, {Server, POLLIN, 0}};
    if (poll(Fds, 2, 50) <= 0) {
      continue;
    }
    Idle = NowNs();
    Bytes Frame;
    if (Fds[0].revents != 0) {
      if (!ReadFrame(Client, Frame)) {
        return;
      }
      Pending.emplace_back(GetLe64(Frame, 28), Frame);
      WriteAll(Server, Frame.data(), Frame.size());
    }
    if (Fds[1].revents != 0 && (!ReadFrame(Server, Frame) || !Answer(Client, Frame))) {
      return;
    }
  }
}

} // namespace MockSmb
