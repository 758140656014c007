// A hosted environment per test, with the image's globals pointing at it, a
// scratch directory for ramfs: and the variable store, and helpers to read
// variables and the console.
#pragma once

#include "DiagLog.h"
#include "HostUefi.h"
#include "NwBaseLib.h"

#include <gtest/gtest.h>

#include <stdlib.h>

#include <filesystem>
#include <functional>
#include <string>
#include <vector>

class HostImageTest : public ::testing::Test {
protected:
  void SetUp() override {
    char Template[] = "/tmp/nwfs-image-XXXXXX";
    ASSERT_NE(mkdtemp(Template), nullptr);
    Dir = Template;
    RamfsDir = Dir + "/ramfs";
    VarStore = Dir + "/vars.txt";
    std::filesystem::create_directories(RamfsDir);
    HostConfig Config;
    Config.RamfsDir = RamfsDir.c_str();
    Config.VarStore = VarStore.c_str();
    ASSERT_NE(HostInitialize(Config), nullptr);
    gImageHandle = HostImageHandle();
    gST = HostSystemTable();
    gBS = gST->BootServices;
    gRT = gST->RuntimeServices;
    gDriverDebugLevel = 5;
    gSMB2DebugLevel = 0;
    PoolAtStart = HostPoolOutstanding();
  }

  void TearDown() override {
    HostSetIpmi(HostIpmiConfig{});
    HostShutdown();
    std::error_code Ignored;
    std::filesystem::remove_all(Dir, Ignored);
  }

  // Runs Body with the host console captured and returns what it printed.
  static std::string Console(const std::function<void()> &Body) {
    HostConsoleCaptureBegin();
    Body();
    return HostConsoleCaptureEnd();
  }

  // Runs the image with a command line (argument 0 included).
  static EFI_STATUS RunImage(std::vector<std::string> Args, std::string *Output = nullptr) {
    std::vector<char *> Argv;
    for (std::string &Arg : Args) {
      Argv.push_back(Arg.data());
    }
    Argv.push_back(nullptr);
    EFI_STATUS Status = EFI_SUCCESS;
    std::string Text =
        Console([&] { Status = HostRunImage(static_cast<int>(Args.size()), Argv.data()); });
    if (Output != nullptr) {
      *Output = Text;
    }
    return Status;
  }

  struct Variable {
    EFI_STATUS Status = EFI_NOT_FOUND;
    UINT32 Attributes = 0;
    std::vector<UINT8> Data;
  };

  static Variable ReadVar(const CHAR16 *Name, const EFI_GUID &Guid) {
    Variable Result;
    UINTN Size = 0;
    Result.Status = gRT->GetVariable(Name, &Guid, &Result.Attributes, &Size, nullptr);
    if (Result.Status == EFI_BUFFER_TOO_SMALL) {
      Result.Data.resize(Size);
      Result.Status = gRT->GetVariable(Name, &Guid, &Result.Attributes, &Size, Result.Data.data());
    }
    return Result;
  }

  static EFI_STATUS WriteVar(const CHAR16 *Name, const EFI_GUID &Guid, UINT32 Attributes,
                             const std::vector<UINT8> &Data) {
    return gRT->SetVariable(Name, &Guid, Attributes, Data.size(), Data.data());
  }

  static size_t Count(const std::string &Text, const std::string &Piece) {
    size_t Found = 0;
    for (size_t At = Text.find(Piece); At != std::string::npos; At = Text.find(Piece, At + 1)) {
      Found++;
    }
    return Found;
  }

  std::string Dir;
  std::string RamfsDir;
  std::string VarStore;
  uint64_t PoolAtStart = 0;
};
