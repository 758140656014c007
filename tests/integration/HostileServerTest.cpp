// Whole runs of the program against a relay in front of Samba that breaks,
// bends or delays the server's answers. The outcome must tell the truth:
// VerifyStatus 00 only with the file whole, no partial file left in ramfs:,
// a run that ends within 11 s of the server's last byte, and no sanitizer
// report or leftover. Legal variations complete byte-identical.
#include "SambaServer.h"
#include "SmbRelay.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

namespace {

using namespace MockSmb;

constexpr uint16_t kNegotiate = 0, kSessionSetup = 1, kCreate = 5, kRead = 8, kWrite = 9,
                   kQueryDirectory = 14;

// Sets Width little-endian bytes at a framed offset.
void Put(Bytes &Frame, size_t At, uint64_t Value, int Width) {
  for (int I = 0; I < Width; I++) {
    Frame[At + I] = static_cast<uint8_t>(Value >> (8 * I));
  }
}

// Rewrites that bend one answer, and the other faults.
Fault Bend(uint16_t Command, int Occurrence,
           std::function<void(Bytes &Answer, const Bytes &Request)> Edit) {
  return {Fault::Rewrite, Command, Occurrence, 0, std::move(Edit)};
}
Fault Hit(Fault::Kind What, uint16_t Command, int Occurrence, size_t Count = 0) {
  return {What, Command, Occurrence, Count, nullptr};
}

// READ answers (framed): DataOffset at 70, DataLength at 72, data at 84.
Fault ReadData(int Occurrence, std::function<void(Bytes &)> Edit) {
  return Bend(kRead, Occurrence, [Edit](Bytes &A, const Bytes &) { Edit(A); });
}

// A READ answer that carries only Keep of its bytes.
void KeepData(Bytes &A, uint32_t Keep) {
  Put(A, 72, Keep, 4);
  A.resize(84 + Keep);
}

// WRITE answers: Count at 72; WRITE requests: Length at 72.
Fault WriteCount(int Occurrence, std::function<uint32_t(uint32_t Sent)> Count) {
  return Bend(kWrite, Occurrence,
              [Count](Bytes &A, const Bytes &R) { Put(A, 72, Count(GetLe32(R, 72)), 4); });
}

// Half of a large transfer's answer (a small one whole).
uint32_t Halved(uint32_t Length) {
  return Length >= 8192 ? Length / 2 : Length;
}

// The first AV pair of the challenge's target info runs past its end.
void OverrunAvPair(Bytes &A, const Bytes &) {
  size_t Blob = 4 + GetLe16(A, 72);
  size_t Info = Blob + GetLe32(A, Blob + 44);
  Put(A, Info + 2, 0xFFF0, 2);
}

// A signed READ answer without its signature: the flag cleared, the
// signature zeroed.
void Unsign(Bytes &A) {
  A[4 + 16] &= ~0x08;
  std::fill(A.begin() + 4 + 48, A.begin() + 4 + 64, 0);
}

struct Case {
  const char *Name;
  char Action; // I import, G catalog, e export VML, m mount only
  std::vector<Fault> Faults;
  int Status; // the VerifyStatus the run records
  bool Whole; // the file arrived whole (else: none left behind in ramfs:)
  const char *Proto = "SMB2_10";
  const char *Signing = ""; // "mandatory": the server requires signing
};

// A run that must fail with Status, and one that must complete.
Case Fails(const char *Name, char Action, std::vector<Fault> Faults, int Status = 7,
           const char *Signing = "") {
  return {Name, Action, std::move(Faults), Status, false, "SMB2_10", Signing};
}
Case Completes(const char *Name, char Action, std::vector<Fault> Faults,
               const char *Proto = "SMB2_10", const char *Signing = "") {
  return {Name, Action, std::move(Faults), 0, true, Proto, Signing};
}

// A negotiate answer offering MaxReadSize and MaxWriteSize of Size.
Fault MaxSizes(uint32_t Size) {
  return Bend(kNegotiate, 1, [Size](Bytes &A, const Bytes &) {
    Put(A, 100, Size, 4);
    Put(A, 104, Size, 4);
  });
}

// QUERY_DIRECTORY answers: OutputBufferOffset at 70, the first entry's
// FileNameLength 60 bytes into it.
void OddNameLength(Bytes &A, const Bytes &) {
  size_t Length = 4 + GetLe16(A, 70) + 60;
  Put(A, Length, GetLe32(A, Length) + 1, 4);
}

const Case kCases[] = {
    // A transfer broken midway.
    Fails("read reset", 'I', {Hit(Fault::ResetAfter, kRead, 3, 100)}),
    Fails("read close", 'I', {Hit(Fault::CloseAfter, kRead, 3, 100)}),
    Fails("read silence", 'I', {Hit(Fault::Silence, kRead, 3)}),
    Fails("catalog read reset", 'G', {Hit(Fault::ResetAfter, kRead, 2, 70)}),
    Fails("write reset", 'e', {Hit(Fault::ResetAfter, kWrite, 2, 10)}),
    Fails("write close", 'e', {Hit(Fault::CloseAfter, kWrite, 2, 10)}),
    Fails("write silence", 'e', {Hit(Fault::Silence, kWrite, 2)}),
    // Malformed READ and WRITE answers.
    Fails("DataLength past the frame", 'I',
          {ReadData(2, [](Bytes &A) { Put(A, 72, GetLe32(A, 72) + 4096, 4); })}),
    Fails("DataLength past the request", 'I',
          {ReadData(2,
                    [](Bytes &A) {
                      Put(A, 72, GetLe32(A, 72) + 100, 4);
                      A.resize(A.size() + 100);
                    })}),
    Fails("READ body cut short", 'I', {ReadData(2, [](Bytes &A) { A.resize(76); })}),
    Fails("DataOffset in the header", 'I', {ReadData(2, [](Bytes &A) { A[70] = 0x40; })}),
    Fails("DataOffset past the frame", 'I', {ReadData(2, [](Bytes &A) { A[70] = 0xF0; })}),
    Fails("no data before the end", 'I', {ReadData(2, [](Bytes &A) { KeepData(A, 0); })}),
    Fails("WRITE Count 0", 'e', {WriteCount(1, [](uint32_t) { return 0u; })}),
    Fails("WRITE Count past what was sent", 'e',
          {WriteCount(1, [](uint32_t Sent) { return Sent + 1; })}),
    // Answers out of step.
    Fails("command mismatch", 'I',
          {Bend(kCreate, 2, [](Bytes &A, const Bytes &) { Put(A, 16, 6, 2); })}),
    Fails("pending forever", 'I', {Hit(Fault::PendingForever, kRead, 2)}),
    // Hostile session and listing answers.
    Fails("maximum sizes of 0", 'm', {MaxSizes(0)}, 0x18),
    Fails("AV pair overrun", 'm', {Bend(kSessionSetup, 1, OverrunAvPair)}),
    Fails("OutputBufferOffset past the frame", 'I',
          {Bend(kQueryDirectory, 0, [](Bytes &A, const Bytes &) { Put(A, 70, 0xFFF0, 2); })}, 14),
    Fails("odd name length", 'I', {Bend(kQueryDirectory, 0, OddNameLength)}, 14),
    // A server that requires signing: a signed answer changed, or unsigned.
    Fails("signed answer with a byte changed", 'I', {ReadData(2, [](Bytes &A) { A[100] ^= 1; })}, 7,
          "mandatory"),
    Fails("unsigned answer", 'I', {ReadData(2, Unsign)}, 7, "mandatory"),
    // Legal variations.
    Completes("short READs", 'I',
              {ReadData(0, [](Bytes &A) { KeepData(A, Halved(GetLe32(A, 72))); })}),
    Completes("short WRITE Counts", 'e', {WriteCount(0, Halved)}),
    Completes("interim answer", 'I', {Hit(Fault::PendingFirst, kRead, 2)}),
    Completes("notification first", 'I', {Hit(Fault::NotifyFirst, kCreate, 2)}),
    Completes("answers in pieces", 'I',
              {Hit(Fault::InPieces, kNegotiate, 1, 5), Hit(Fault::InPieces, kRead, 2, 1500)}),
    Completes("dialect 0x0202", 'G', {}, "SMB2_02"),
    Completes("signed", 'e', {}, "SMB2_02", "mandatory"),
    Completes("maximum sizes of 16384", 'e', {MaxSizes(16384)}),
    Completes("maximum sizes of 16384, import", 'I', {MaxSizes(16384)}),
};

std::string ReadFile(const std::string &Path) {
  std::ifstream In(Path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(In), {});
}

// The first byte of the outcome record in the variable store.
int VerifyStatus(const std::string &Store) {
  std::istringstream In(ReadFile(Store));
  std::string Line;
  while (std::getline(In, Line)) {
    if (Line.find("{4C4AC96B-DD0A-447E-8118-105900DA8629} PROVISIONING_ENV_VOLATILE_VAR") == 0) {
      return std::stoi(Line.substr(Line.rfind(' ') + 1, 2), nullptr, 16);
    }
  }
  return -1;
}

// The exported log on the share, empty when there is none.
std::string ExportedLog(const std::string &Dir) {
  for (const auto &Entry : std::filesystem::directory_iterator(Dir)) {
    if (Entry.path().filename().string().find("_VelmorLog_") != std::string::npos) {
      return ReadFile(Entry.path());
    }
  }
  return "";
}

TEST(HostileServerTest, TheOutcomeTellsTheTruth) {
  const std::string Work = "/tmp/cifsdrv-hostile";
  for (const Case &C : kCases) {
    SCOPED_TRACE(C.Name);
    ASSERT_TRUE(SambaServer::Start(C.Proto, C.Signing));
    const std::string Share = SambaServer::ShareDir(C.Proto);
    SambaServer::RunShell("rm -rf " + Work + " " + Share + "/exports && mkdir -p " + Work +
                          "/ramfs " + Share + "/exports && cd " + Share +
                          " && head -c 1048576 /dev/urandom > big.bin && head -c 300000 "
                          "/dev/urandom > catalog.xml.gz && head -c 200000 /dev/urandom > " +
                          Work + "/ramfs/VelmorLog.xml && chmod -R a+rwX " + Share);
    Relay R(C.Faults);
    const std::string Login = SambaServer::kUser + " " + SambaServer::kPassword;
    const std::string Args = C.Action == 'e'
                                 ? "e cifsshare 127.0.0.1 Export VML " + Login + " exports"
                                 : std::string(1, C.Action) + " cifsshare 127.0.0.1 " + Login +
                                       (C.Action == 'I' ? " big.bin" : "");
    std::string Out;
    SambaServer::RunShell("cd " + Work + " && CIFSDRV_SMB_PORT=" + std::to_string(R.Port()) +
                              " CIFSDRV_VARSTORE=vars.txt CIFSDRV_RAMFS=ramfs timeout 60 " +
                              CIFSDRV_PROGRAM + " " + Args,
                          &Out);
    EXPECT_LE(R.SecondsSinceLastByte(), 11.0);
    EXPECT_EQ(Out.find("runtime error"), std::string::npos) << Out;
    EXPECT_EQ(Out.find("AddressSanitizer"), std::string::npos) << Out;
    EXPECT_EQ(Out.find("left behind"), std::string::npos) << Out;
    EXPECT_EQ(VerifyStatus(Work + "/vars.txt"), C.Status) << Out;
    if (*C.Signing != 0 && !C.Faults.empty()) { // refused with a line naming the command
      size_t Line = Out.rfind('\n', Out.find("signature is missing or wrong!, Status = 26"));
      EXPECT_EQ(Out.compare(Line + 1, 26, "Function: SMB2ReadResponse"), 0) << Out;
    }
    if (!C.Faults.empty()) {
      EXPECT_GT(R.Applied(), 0);
    }
    const std::string Name = C.Action == 'I' ? "big.bin" : "catalog.xml.gz";
    if (C.Action != 'e') {
      EXPECT_EQ(access((Work + "/ramfs/" + Name).c_str(), F_OK) == 0, C.Whole)
          << "a partial file was left in ramfs:, or none arrived\n"
          << Out;
    }
    if (C.Whole) {
      EXPECT_TRUE(C.Action == 'e'
                      ? ExportedLog(Share + "/exports") == ReadFile(Work + "/ramfs/VelmorLog.xml")
                      : ReadFile(Work + "/ramfs/" + Name) == ReadFile(Share + "/" + Name))
          << "the file did not arrive whole\n"
          << Out;
    }
  }
}

} // namespace
