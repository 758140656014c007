// A misbehaving relay for whole-program tests: it stands between the client
// and the real Samba server on loopback, passes every request on, and bends
// the answers a table of faults names: a reset, a close or silence in the
// middle of an answer, rewritten fields, an interim answer or a notification
// put in front of it, an answer cut into small pieces.
#pragma once

#include "MockSmbServer.h"

#include <atomic>
#include <chrono>
#include <functional>
#include <thread>

namespace MockSmb {

struct Fault {
  enum Kind {
    None,
    ResetAfter,     // pass Count bytes of the answer on, then reset
    CloseAfter,     // pass Count bytes of the answer on, then close
    Silence,        // pass nothing more on, keep the connection open
    Rewrite,        // pass the answer on as Edit leaves it
    PendingFirst,   // an interim STATUS_PENDING answer in front of it
    NotifyFirst,    // an unsolicited notification in front of it
    PendingForever, // an interim STATUS_PENDING answer instead of it, then silence
    InPieces,       // the answer in pieces of Count bytes, a little apart
  };
  Kind What = None;
  uint16_t Command = 0; // the command whose answer is hit
  int Occurrence = 1;   // its nth final answer; 0 for every one
  size_t Count = 0;
  // Rewrite: the framed answer, and the framed request it answers.
  std::function<void(Bytes &Answer, const Bytes &Request)> Edit;
};

class Relay {
public:
  explicit Relay(std::vector<Fault> Faults, uint16_t ServerPort = 445);
  ~Relay();
  Relay(const Relay &) = delete;
  Relay &operator=(const Relay &) = delete;

  uint16_t Port() const { return ListenPort; }
  // Seconds from the last byte passed to the client until now.
  double SecondsSinceLastByte() const;
  // How many answers a fault was applied to.
  int Applied() const { return Hits.load(); }

private:
  void Run();
  void Serve(int Client, int Server);
  bool Answer(int Client, Bytes &Frame);
  void SendToClient(int Client, const Bytes &Data);

  std::vector<Fault> Faults;
  uint16_t ServerPort;
  int ListenFd = -1;
  uint16_t ListenPort = 0;
  std::thread Worker;
  std::atomic<bool> Stop{false};
  std::atomic<int> Hits{0};
  std::atomic<int64_t> LastByteNs{0};
  std::vector<std::pair<uint64_t, Bytes>> Pending; // requests awaiting answers, by message id
  int Seen[32] = {};                               // final answers seen, by command
  bool Mute = false;                               // silence: nothing more reaches the client
};

} // namespace MockSmb
