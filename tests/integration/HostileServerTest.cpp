// Whole runs of the program against a relay in front of Samba that breaks,
// bends or delays the server's answers. The outcome must tell the truth:
// VerifyStatus 00 only with the file whole, no partial file left in ramfs:,
// a run that ends within 11 s of the server's last byte, and no sanitizer
// report or leftover. Legal variations complete byte-identical.
#include "SambaServer.h"
#include "SmbRelay.h"

#include <gtest/gtest.h>

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <fstream>
#include <random>
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

// Rewrites that bend one answer.
Fault Bend(uint16_t Command, int Occurrence,
           std::function<void(Bytes &Answer, const Bytes &Request)> Edit) {
  Fault F;
  F.What = Fault::Rewrite;
  F.Command = Command;
  F.Occurrence = Occurrence;
  F.Edit = std::move(Edit);
  return F;
}

Fault Hit(Fault::Kind What, uint16_t Command, int Occurrence, size_t Count = 0) {
  Fault F;
  F.What = What;
  F.Command = Command;
  F.Occurrence = Occurrence;
  F.Count = Count;
  return F;
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
  const char *Proto;
  const char *Signing = ""; // "mandatory": the server requires signing
};

const Case kCases[] = {
    // A transfer broken midway.
    {"read reset", 'I', {Hit(Fault::ResetAfter, kRead, 3, 100)}, 7, false, "SMB2_10"},
    {"read close", 'I', {Hit(Fault::CloseAfter, kRead, 3, 100)}, 7, false, "SMB2_10"},
    {"read silence", 'I', {Hit(Fault::Silence, kRead, 3)}, 7, false, "SMB2_10"},
    {"catalog read reset", 'G', {Hit(Fault::ResetAfter, kRead, 2, 70)}, 7, false, "SMB2_10"},
    {"write reset", 'e', {Hit(Fault::ResetAfter, kWrite, 2, 10)}, 7, false, "SMB2_10"},
    {"write close", 'e', {Hit(Fault::CloseAfter, kWrite, 2, 10)}, 7, false, "SMB2_10"},
    {"write silence", 'e', {Hit(Fault::Silence, kWrite, 2)}, 7, false, "SMB2_10"},
    // Malformed READ and WRITE answers.
    {"DataLength past the frame",
     'I',
     {ReadData(2, [](Bytes &A) { Put(A, 72, GetLe32(A, 72) + 4096, 4); })},
     7,
     false,
     "SMB2_10"},
    {"DataLength past the request",
     'I',
     {ReadData(2,
               [](Bytes &A) {
                 Put(A, 72, GetLe32(A, 72) + 100, 4);
                 A.resize(A.size() + 100);
               })},
     7,
     false,
     "SMB2_10"},
    {"READ body cut short",
     'I',
     {ReadData(2, [](Bytes &A) { A.resize(76); })},
     7,
     false,
     "SMB2_10"},
    {"DataOffset in the header",
     'I',
     {ReadData(2, [](Bytes &A) { A[70] = 0x40; })},
     7,
     false,
     "SMB2_10"},
    {"DataOffset past the frame",
     'I',
     {ReadData(2, [](Bytes &A) { A[70] = 0xF0; })},
     7,
     false,
     "SMB2_10"},
    {"no data before the end",
     'I',
     {ReadData(2, [](Bytes &A) { KeepData(A, 0); })},
     7,
     false,
     "SMB2_10"},
    {"WRITE Count 0", 'e', {WriteCount(1, [](uint32_t) { return 0u; })}, 7, false, "SMB2_10"},
    {"WRITE Count past what was sent",
     'e',
     {WriteCount(1, [](uint32_t Sent) { return Sent + 1; })},
     7,
     false,
     "SMB2_10"},
    // Answers out of step.
    {"command mismatch",
     'I',
     {Bend(kCreate, 2, [](Bytes &A, const Bytes &) { Put(A, 16, 6, 2); })},
     7,
     false,
     "SMB2_10"},
    {"pending forever", 'I', {Hit(Fault::PendingForever, kRead, 2)}, 7, false, "SMB2_10"},
    // Hostile session and listing answers.
    {"maximum sizes of 0",
     'm',
     {Bend(kNegotiate, 1,
           [](Bytes &A, const Bytes &) {
             Put(A, 100, 0, 4);
             Put(A, 104, 0, 4);
           })},
     0x18,
     false,
     "SMB2_10"},
    {"AV pair overrun", 'm', {Bend(kSessionSetup, 1, OverrunAvPair)}, 7, false, "SMB2_10"},
    {"OutputBufferOffset past the frame",
     'I',
     {Bend(kQueryDirectory, 0, [](Bytes &A, const Bytes &) { Put(A, 70, 0xFFF0, 2); })},
     14,
     false,
     "SMB2_10"},
    {"odd name length",
     'I',
     {Bend(kQueryDirectory, 0,
           [](Bytes &A, const Bytes &) {
             Put(A, 4 + GetLe16(A, 70) + 60, GetLe32(A, 4 + GetLe16(A, 70) + 60) + 1, 4);
           })},
     14,
     false,
     "SMB2_10"},
    // Legal variations.
    {"short READs",
     'I',
     {ReadData(0, [](Bytes &A) { KeepData(A, Halved(GetLe32(A, 72))); })},
     0,
     true,
     "SMB2_10"},
    {"short WRITE Counts", 'e', {WriteCount(0, Halved)}, 0, true, "SMB2_10"},
    {"interim answer", 'I', {Hit(Fault::PendingFirst, kRead, 2)}, 0, true, "SMB2_10"},
    {"notification first", 'I', {Hit(Fault::NotifyFirst, kCreate, 2)}, 0, true, "SMB2_10"},
    {"answers in pieces",
     'I',
     {Hit(Fault::InPieces, kNegotiate, 1, 5), Hit(Fault::InPieces, kRead, 2, 1500)},
     0,
     true,
     "SMB2_10"},
    {"dialect 0x0202", 'G', {}, 0, true, "SMB2_02"},
    // A server that requires signing.
    {"signed", 'e', {}, 0, true, "SMB2_02", "mandatory"},
    {"signed answer with a byte changed",
     'I',
     {ReadData(2, [](Bytes &A) { A[100] ^= 1; })},
     7,
     false,
     "SMB2_10",
     "mandatory"},
    {"unsigned answer", 'I', {ReadData(2, Unsign)}, 7, false, "SMB2_10", "mandatory"},
    {"maximum sizes of 16384",
     'e',
     {Bend(kNegotiate, 1,
           [](Bytes &A, const Bytes &) {
             Put(A, 100, 16384, 4);
             Put(A, 104, 16384, 4);
           })},
     0,
     true,
     "SMB2_10"},
    {"maximum sizes of 16384, import",
     'I',
     {Bend(kNegotiate, 1,
           [](Bytes &A, const Bytes &) {
             Put(A, 100, 16384, 4);
             Put(A, 104, 16384, 4);
           })},
     0,
     true,
     "SMB2_10"},
};

std::string ReadFile(const std::string &Path) {
  std::ifstream In(Path, std::ios::binary);
  std::stringstream Out;
  Out << In.rdbuf();
  return Out.str();
}

void WriteRandom(const std::string &Path, size_t Size, unsigned Seed) {
  std::string Data(Size, '\0');
  std::mt19937 Random(Seed);
  for (char &C : Data) {
    C = static_cast<char>(Random());
  }
  std::ofstream(Path, std::ios::binary) << Data;
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
  std::string Found;
  if (DIR *D = opendir(Dir.c_str())) {
    while (dirent *E = readdir(D)) {
      if (std::string(E->d_name).find("_VelmorLog_") != std::string::npos) {
        Found = ReadFile(Dir + "/" + E->d_name);
      }
    }
    closedir(D);
  }
  return Found;
}

TEST(HostileServerTest, TheOutcomeTellsTheTruth) {
  const std::string Work = "/tmp/cifsdrv-hostile";
  for (const Case &C : kCases) {
    SCOPED_TRACE(C.Name);
    ASSERT_TRUE(SambaServer::Start(C.Proto, C.Signing));
    const std::string Share = SambaServer::ShareDir(C.Proto);
    SambaServer::RunShell("rm -rf " + Work + " " + Share + "/exports && mkdir -p " + Work +
                          "/ramfs " + Share + "/exports && chmod 0777 " + Share + "/exports");
    WriteRandom(Share + "/big.bin", 1 << 20, 7);
    WriteRandom(Share + "/catalog.xml.gz", 300000, 8);
    WriteRandom(Work + "/ramfs/VelmorLog.xml", 200000, 9);
    SambaServer::RunShell("chmod -R a+rwX " + Share);
    Relay R(C.Faults);
    std::string Args = C.Action == 'e' ? "e cifsshare 127.0.0.1 Export VML " + SambaServer::kUser +
                                             " " + SambaServer::kPassword + " exports"
                                       : std::string(1, C.Action) + " cifsshare 127.0.0.1 " +
                                             SambaServer::kUser + " " + SambaServer::kPassword +
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
    std::string Source = C.Action == 'I'   ? ReadFile(Share + "/big.bin")
                         : C.Action == 'G' ? ReadFile(Share + "/catalog.xml.gz")
                                           : ReadFile(Work + "/ramfs/VelmorLog.xml");
    std::string Arrived = C.Action == 'I'   ? ReadFile(Work + "/ramfs/big.bin")
                          : C.Action == 'G' ? ReadFile(Work + "/ramfs/catalog.xml.gz")
                                            : ExportedLog(Share + "/exports");
    struct stat Info;
    if (C.Whole) {
      EXPECT_TRUE(Arrived == Source) << "the file did not arrive whole\n" << Out;
    } else if (C.Action == 'I' || C.Action == 'G') {
      EXPECT_NE(stat((Work + "/ramfs/" + (C.Action == 'I' ? "big.bin" : "catalog.xml.gz")).c_str(),
                     &Info),
                0)
          << "a partial file was left in ramfs:\n"
          << Out;
    }
  }
}

} // namespace
