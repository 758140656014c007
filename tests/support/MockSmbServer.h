// A scripted, misbehaving SMB2 server for tests: a loopback listener on a
// free port that accepts one connection in a thread and plays a script of
// steps (read a request, send crafted bytes, pause, close, reset). Together
// with HostSetConnectPortOverride the client dials it while still asking
// for the SMB port.
//
// The byte builders below craft well-formed responses that tests then bend.
#pragma once

#include <stdint.h>

#include <array>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace MockSmb {

using Bytes = std::vector<uint8_t>;

// ---------------------------------------------------------------------------
// Byte builders
// ---------------------------------------------------------------------------
// Value as Width little-endian bytes.
Bytes Le(uint64_t Value, size_t Width);
void SetLe16(Bytes &Out, size_t At, uint16_t Value);
uint16_t GetLe16(const Bytes &In, size_t At);
uint32_t GetLe32(const Bytes &In, size_t At);
uint64_t GetLe64(const Bytes &In, size_t At);
Bytes Utf16(const std::string &Text);
Bytes Concat(std::initializer_list<Bytes> Parts);
std::string Hex(const uint8_t *Data, size_t Length);
Bytes FromHex(const std::string &Text);

// One AV pair; the target info is a run of these ending with AvEol().
Bytes AvPair(uint16_t Id, const Bytes &Value);
Bytes AvEol();
// NbComputerName, NbDomainName, DnsComputerName, DnsDomainName, Timestamp,
// EOL: what a standalone Samba server sends.
Bytes DefaultTargetInfo(const std::string &Domain = "CIFSTESTSRV");

struct ChallengeShape {
  uint32_t Flags = 0x628A0215; // includes NEGOTIATE_TARGET_INFO
  Bytes TargetName = Utf16("CIFSTESTSRV");
  Bytes TargetInfo = DefaultTargetInfo();
  std::array<uint8_t, 8> ServerChallenge = {0x01, 0x23, 0x45, 0x67, 0x89, 0xAB, 0xCD, 0xEF};
  uint32_t MessageType = 2;
  bool WithVersion = true;     // 8 version bytes after the fixed part
  bool InfoBeforeName = false; // payload order
  int64_t NameOffset = -1;     // overrides of the computed fields
  int64_t InfoOffset = -1;
  int64_t InfoLength = -1;
  int64_t InfoMaxLength = -1;
};
// A raw NTLMSSP CHALLENGE message.
Bytes Challenge(const ChallengeShape &Shape);

// SMB2 responses, framed with their 4-byte stream length.
struct HeaderFields {
  uint16_t Command = 0;
  uint32_t Status = 0;
  uint64_t MessageId = 0;
  uint64_t SessionId = 0;
  uint32_t TreeId = 0;
  uint16_t Credits = 1;
  uint32_t Flags = 1; // SERVER_TO_REDIR
};
Bytes Header(const HeaderFields &Shape); // 64 bytes, unframed
Bytes Frame(const Bytes &Message);       // prefix + message
// The stream length announced by a framed message.
uint32_t StreamLength(const Bytes &Framed);

Bytes NegotiateResponse(uint16_t Dialect, uint16_t SecurityMode = 1, uint32_t Capabilities = 6,
                        uint32_t MaxSize = 0x800000, uint16_t Credits = 1);
Bytes SessionSetupResponse(uint32_t Status, uint64_t MessageId, uint64_t SessionId,
                           const Bytes &Blob);
Bytes TreeConnectResponse(uint64_t MessageId, uint64_t SessionId, uint32_t TreeId);
// TREE_DISCONNECT or LOGOFF answer (StructureSize 4).
Bytes SimpleResponse(uint16_t Command, uint64_t MessageId, uint64_t SessionId, uint32_t TreeId);
// An error answer with the 9-byte error body.
Bytes ErrorResponse(uint16_t Command, uint32_t Status, uint64_t MessageId, uint64_t SessionId = 0,
                    uint32_t TreeId = 0);

constexpr uint64_t kSessionId = 0x0000A1B2C3D40001ULL;
constexpr uint32_t kTreeId = 0x00000005;

// Sockets: whole writes and reads (false once the peer is gone), one framed
// message of at most 16 MiB, and a listener on a free loopback port (-1 when
// there is none).
bool WriteAll(int Fd, const uint8_t *Data, size_t Length);
bool ReadAll(int Fd, uint8_t *Data, size_t Length);
bool ReadFrame(int Fd, Bytes &Out);
int ListenOnLoopback(uint16_t *Port);

// ---------------------------------------------------------------------------
// The server
// ---------------------------------------------------------------------------
class Server {
public:
  Server();
  ~Server();
  Server(const Server &) = delete;
  Server &operator=(const Server &) = delete;

  uint16_t Port() const { return ListenPort; }

  // Script steps, played in order once Start() is called.
  Server &ExpectRequest();         // read one framed request and keep it
  Server &Send(const Bytes &Data); // send bytes as they are
  Server &SendInPieces(const Bytes &Data, const std::vector<size_t> &Cuts, int PauseMs);
  // Reads one request and answers with what Reply builds from it.
  Server &Respond(std::function<Bytes(const Bytes &Request)> Reply);
  Server &Pause(int Milliseconds);
  Server &Close(); // orderly close (FIN)
  Server &Reset(); // abortive close (RST)
  // At the end of the script the server keeps reading (and keeping)
  // requests without answering until the client closes or stays quiet for
  // 200 ms; unless set, it closes at once.
  Server &DrainUntilClosed();

  // The standard answers of a successful connect for a dialect, up to and
  // including the tree connect (message ids 0 to 3).
  Server &ScriptConnect(uint16_t Dialect, const ChallengeShape &Shape = ChallengeShape(),
                        uint32_t Capabilities = 6);
  // The answers of a disconnect after a tree connect (ids 4 and 5).
  Server &ScriptDisconnect();

  void Start();
  // Waits for the script to finish (the thread ends by itself after its
  // last step, or when its time limit runs out).
  void Join();

  std::vector<Bytes> Requests();
  std::string Failure(); // empty when the script ran as written

private:
  struct Step {
    enum Kind { Expect, SendBytes, Sleep, CloseFin, CloseRst } What;
    Bytes Data;
    std::vector<size_t> Cuts; // SendBytes: send in pieces cut here, Ms apart
    int Ms = 0;
    std::function<Bytes(const Bytes &)> Reply; // Expect: the answer to the request
  };
  Server &Add(Step S);
  void Run();
  void Fail(const std::string &Why);

  int ListenFd = -1;
  uint16_t ListenPort = 0;
  bool Drain = false;
  std::vector<Step> Steps;
  std::thread Worker;
  std::mutex Lock;
  std::vector<Bytes> Received;
  std::string Failed;
};

} // namespace MockSmb
