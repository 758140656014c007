// A hosted environment per test, with the image's globals pointing at it, a
// scratch directory for ramfs: and the variable store, and helpers to read
// variables and the console.
#pragma once

#include "DiagLog.h"
#include "HostUefi.h"
#include "NwBaseLib.h"

#include <gtest/gtest.h>

#include <stdlib.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <type_traits>
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

  // Runs Call with the console captured and dropped; returns what Call does.
  template <typename F>
  static auto Quiet(F Call) {
    if constexpr (std::is_void_v<decltype(Call())>) {
      Console(Call);
    } else {
      decltype(Call()) Result{};
      Console([&] { Result = Call(); });
      return Result;
    }
  }

  // Like Quiet, and keeps what was printed in *Out when Out is given.
  template <typename F>
  static auto Captured(std::string *Out, F Call) {
    decltype(Call()) Result{};
    std::string Text = Console([&] { Result = Call(); });
    if (Out != nullptr) {
      *Out = Text;
    }
    return Result;
  }

  // Runs the image with a command line (argument 0 included).
  static EFI_STATUS RunImage(std::vector<std::string> Args, std::string *Output = nullptr) {
    std::vector<char *> Argv;
    for (std::string &Arg : Args) {
      Argv.push_back(Arg.data());
    }
    Argv.push_back(nullptr);
    return Captured(Output,
                    [&] { return HostRunImage(static_cast<int>(Args.size()), Argv.data()); });
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

  // Whole host files as bytes in a string; writing makes the parents.
  static std::string ReadFile(const std::string &Path) {
    std::ifstream In(Path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(In), {});
  }
  static void WriteFile(const std::string &Path, const std::string &Text) {
    std::filesystem::create_directories(std::filesystem::path(Path).parent_path());
    std::ofstream(Path, std::ios::binary) << Text;
  }

  // A file information record with the fixed part of Base (zeros when Base
  // is empty) and Name; its Size field says how long it is.
  static std::vector<UINT8> NamedInfo(const std::vector<UINT8> &Base, const std::u16string &Name) {
    std::vector<UINT8> Out(SIZE_OF_EFI_FILE_INFO + 2 * (Name.size() + 1));
    std::copy_n(Base.begin(), std::min<size_t>(Base.size(), SIZE_OF_EFI_FILE_INFO), Out.begin());
    std::copy(Name.begin(), Name.end(),
              reinterpret_cast<CHAR16 *>(Out.data() + SIZE_OF_EFI_FILE_INFO));
    reinterpret_cast<EFI_FILE_INFO *>(Out.data())->Size = Out.size();
    return Out;
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
