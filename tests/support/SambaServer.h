// The Samba test server for integration tests: scripts/samba-test-server.sh
// run with the settings a suite wants (highest protocol, share directory),
// and shell helpers. Include once per test program; the server a program
// started is stopped when the program ends, and programs take turns.
#pragma once

#include <gtest/gtest.h>

#include <fcntl.h>
#include <stdio.h>
#include <sys/file.h>
#include <sys/wait.h>

#include <algorithm>
#include <string>

namespace SambaServer {

inline const std::string kUser = "cifstest";
inline const std::string kPassword = "Cifs-Test-Pw1";
inline const std::string kShare = "cifsshare";
inline const std::string kStateDir = "/tmp/cifsdrv-samba";

inline std::string RepoRoot() {
  std::string File = __FILE__; // <root>/tests/support/SambaServer.h
  for (int I = 0; I < 3; I++) {
    File = File.substr(0, File.rfind('/'));
  }
  return File;
}

// Runs a shell command; returns its exit status and (optionally) output.
inline int RunShell(const std::string &Command, std::string *Output = nullptr) {
  FILE *Pipe = popen((Command + " 2>&1").c_str(), "r");
  if (Pipe == nullptr) {
    return -1;
  }
  std::string Text;
  char Buffer[4096];
  size_t Got;
  while ((Got = fread(Buffer, 1, sizeof(Buffer), Pipe)) > 0) {
    Text.append(Buffer, Got);
  }
  int Status = pclose(Pipe);
  if (Output != nullptr) {
    *Output = Text;
  }
  return WIFEXITED(Status) ? WEXITSTATUS(Status) : -1;
}

// The share directory used with a highest protocol ("SMB2_02", "SMB2_10").
inline std::string ShareDir(const std::string &MaxProto) {
  std::string Lower = MaxProto;
  std::transform(Lower.begin(), Lower.end(), Lower.begin(), ::tolower);
  return kStateDir + "/share-" + Lower;
}

// Signing: "mandatory" for a server that requires signed requests, empty
// for Samba's default.
inline std::string Script(const std::string &Action, const std::string &MaxProto = "SMB2_10",
                          const std::string &Signing = "") {
  return "SMB_STATE_DIR=" + kStateDir + " SMB_SIGNING=" + Signing +
         " SMB_MIN_PROTO=SMB2_02 SMB_MAX_PROTO=" + MaxProto + " SMB_USER=" + kUser +
         " SMB_PASS=" + kPassword + " SMB_SHARE=" + kShare + " SMB_DIR=" + ShareDir(MaxProto) +
         " bash " + RepoRoot() + "/scripts/samba-test-server.sh " + Action;
}

// Test programs that share the one server on port 445 take turns: the
// first start in a program waits for this lock and holds it until the
// program ends.
inline void TakeTurn() {
  static int Fd = -1;
  if (Fd < 0) {
    Fd = open((kStateDir + ".lock").c_str(), O_CREAT | O_RDWR | O_CLOEXEC, 0644);
    if (Fd >= 0) {
      flock(Fd, LOCK_EX);
    }
  }
}

// Starts the server, or keeps it when it already runs with these settings.
inline ::testing::AssertionResult Start(const std::string &MaxProto,
                                        const std::string &Signing = "") {
  TakeTurn();
  std::string Out;
  if (RunShell(Script("start", MaxProto, Signing), &Out) != 0) {
    return ::testing::AssertionFailure() << "samba-test-server.sh start failed: " << Out;
  }
  return ::testing::AssertionSuccess();
}

class StopAtExit : public ::testing::Environment {
public:
  void TearDown() override { RunShell(Script("stop")); }
};
inline ::testing::Environment *const gStopAtExit =
    ::testing::AddGlobalTestEnvironment(new StopAtExit);

} // namespace SambaServer
