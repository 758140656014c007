// The debug levels, their initialisers and the console lines, with a console
// that records what is written and runtime services that serve the two level
// variables from a small map.
#include "DiagLog.h"
#include "NwBaseLib.h"

#include <gtest/gtest.h>

#include <cstring>
#include <map>
#include <regex>
#include <string>

namespace {

EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL gConsole;
std::u16string gConsoleText;
int gConsoleCalls;

EFI_STATUS EFIAPI CaptureOutput(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, const CHAR16 *String) {
  gConsoleCalls++;
  gConsoleText += String;
  return EFI_SUCCESS;
}

const EFI_GUID LevelGuid = {
    0x47C7B224, 0xC42A, 0x11D2, {0x8E, 0x57, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B}};
std::map<std::u16string, std::string> gVariables;

EFI_STATUS EFIAPI ServeVariable(const CHAR16 *Name, const EFI_GUID *Guid, UINT32 *Attributes,
                                UINTN *DataSize, void *Data) {
  EXPECT_EQ(*DataSize, 6u);
  EXPECT_EQ(Attributes, nullptr);
  auto Found = gVariables.find(Name);
  if (Found == gVariables.end() || !EfiGuidEqual(*Guid, LevelGuid)) {
    return EFI_NOT_FOUND;
  }
  const UINTN Size = *DataSize;
  *DataSize = Found->second.size();
  if (Found->second.size() > Size) {
    return EFI_BUFFER_TOO_SMALL;
  }
  memcpy(Data, Found->second.data(), Found->second.size());
  return EFI_SUCCESS;
}

class DiagTest : public ::testing::Test {
protected:
  void SetUp() override {
    memset(&System, 0, sizeof(System));
    memset(&Runtime, 0, sizeof(Runtime));
    gConsole = {};
    gConsole.OutputString = CaptureOutput;
    gConsoleText.clear();
    gConsoleCalls = 0;
    gVariables.clear();
    Runtime.GetVariable = ServeVariable;
    System.ConOut = &gConsole;
    gST = &System;
    gRT = &Runtime;
  }
  void TearDown() override {
    gST = SavedST;
    gRT = SavedRT;
    gDriverDebugLevel = SavedLevels[0];
    gSMB2DebugLevel = SavedLevels[1];
    gTcpDebugLevel = SavedLevels[2];
  }
  static std::string Console() { return std::string(gConsoleText.begin(), gConsoleText.end()); }

  EFI_SYSTEM_TABLE *SavedST = gST;
  EFI_RUNTIME_SERVICES *SavedRT = gRT;
  UINT8 SavedLevels[3] = {gDriverDebugLevel, gSMB2DebugLevel, gTcpDebugLevel};
  EFI_SYSTEM_TABLE System;
  EFI_RUNTIME_SERVICES Runtime;
};

using DebugLevelTest = DiagTest;
using DiagLogTest = DiagTest;

const char *const Absent = nullptr;
const char *const Clamped = "Debuglevel [-0-9]+ is wrongly set\\. Setting to highest value!\n";
std::string FailedLine(const char *Function, const char *Status) {
  return std::string("Function: ") + Function +
         ", Line no\\.: = [0-9]+ - Failed to get QVUIkestDebugLevel!, Status = " + Status + "\n";
}

TEST_F(DebugLevelTest, DriverLevel) {
  const std::string Failed = FailedLine("QVUIkestDebugLevelInitialize", "14 \\(0xe\\)");
  const struct {
    const char *Data;
    UINT8 Level;
    EFI_STATUS Status;
    std::string Console;
  } Cases[] = {
      {"3", 3, EFI_SUCCESS, ""},
      {" +4", 4, EFI_SUCCESS, ""},
      {"000005", 5, EFI_SUCCESS, ""}, // six characters are read whole
      {"junk!", 0, EFI_SUCCESS, ""},
      {"6", 5, EFI_SUCCESS, Clamped},
      {"9", 5, EFI_SUCCESS, Clamped},
      {"-2", 5, EFI_SUCCESS, Clamped},
      {Absent, 0, EFI_NOT_FOUND, Failed},
      {"0000003", 0, EFI_BUFFER_TOO_SMALL,
       FailedLine("QVUIkestDebugLevelInitialize", "5 \\(0x5\\)")},
  };
  for (const auto &Case : Cases) {
    gVariables.clear();
    if (Case.Data != nullptr) {
      gVariables[u"QVUIkestDebugLevel"] = Case.Data;
    }
    gConsoleText.clear();
    UINT8 Level = 99;
    EXPECT_EQ(QVUIkestDebugLevelInitialize(&Level), Case.Status);
    EXPECT_EQ(Level, Case.Level) << (Case.Data ? Case.Data : "absent");
    EXPECT_TRUE(std::regex_match(Console(), std::regex(Case.Console))) << Console();
  }
  gVariables[u"QVUIkestDebugLevel"] = "9";
  gConsoleText.clear();
  UINT8 Level = 0;
  QVUIkestDebugLevelInitialize(&Level);
  EXPECT_EQ(Console(), "Debuglevel 9 is wrongly set. Setting to highest value!\n");
}

TEST_F(DebugLevelTest, Smb2Level) {
  // The driver variable's name in the failure text is deliberate.
  const std::string Failed = FailedLine("SMB2DebugLevelInitialize", "14 \\(0xe\\)");
  const struct {
    const char *Data;
    UINT8 Before;
    UINT8 Level;
    EFI_STATUS Status;
    std::string Console;
  } Cases[] = {
      {"3", 1, 3, EFI_SUCCESS, ""},
      {"6", 1, 6, EFI_SUCCESS, ""}, // 6 is accepted here, unlike the driver level
      {"9", 0, 6, EFI_SUCCESS, ""}, // clamped silently while the level is 0
      {"9", 2, 6, EFI_SUCCESS, Clamped},
      {Absent, 3, 3, EFI_NOT_FOUND, ""}, // kept; the failure line needs level 5
      {Absent, 5, 5, EFI_NOT_FOUND, Failed},
      {Absent, 0, 0, EFI_NOT_FOUND, ""},
      {"1234567", 4, 0, EFI_BUFFER_TOO_SMALL, ""}, // other failures read 0
  };
  for (const auto &Case : Cases) {
    gVariables.clear();
    if (Case.Data != nullptr) {
      gVariables[u"SMB2DebugLevel"] = Case.Data;
    }
    gConsoleText.clear();
    gSMB2DebugLevel = Case.Before;
    UINT8 Level = 99;
    EXPECT_EQ(SMB2DebugLevelInitialize(&Level), Case.Status);
    EXPECT_EQ(Level, Case.Level) << (Case.Data ? Case.Data : "absent") << " " << +Case.Before;
    EXPECT_EQ(gSMB2DebugLevel, Case.Level);
    EXPECT_TRUE(std::regex_match(Console(), std::regex(Case.Console))) << Console();
  }
}

TEST_F(DiagLogTest, StandardLines) {
  static_assert(DiagStatusNumber(EFI_NOT_FOUND) == 14 && DiagStatusValue(EFI_NOT_FOUND) == 0xe);
  static_assert(DiagStatusNumber(EFI_SUCCESS) == 0 && DiagStatusValue(EFI_SUCCESS) == 0);
  gDriverDebugLevel = 5;
  gSMB2DebugLevel = 2;
  DiagError("\nGetVariable returned", EFI_NOT_FOUND, "main", 221);
  DiagError("ok", EFI_SUCCESS, "MountStaticFileSystem", 7);
  DiagEntry(DiagChannel::Driver, "main", 10);
  DiagExit(EFI_NOT_FOUND, DiagChannel::Smb2, "SMB2_Connect", 20);
  DiagShortEntry(DiagChannel::Driver, "MountStaticFileSystem");
  DiagShortExit(EFI_NOT_FOUND, ',', DiagChannel::Driver, "MountStaticFileSystem");
  DiagShortExit(EFI_SUCCESS, '.', DiagChannel::Driver, "UnmountStaticFileSystem");
  DiagNullInput(DiagChannel::Smb2, "SMB2HeaderConstruct", 9);
  DiagGuid(DIAG_VERBOSE, nullptr, LevelGuid);
  DiagGuid(DIAG_VERBOSE, "main (221): ", LevelGuid);
  EXPECT_EQ(Console(),
            "Function: main, Line no.: = 221 - \nGetVariable returned, Status = 14 (0xe)\n"
            "Function: MountStaticFileSystem, Line no.: = 7 - ok, Status = 0 (0x0)\n"
            "\nFunction: main, Line no.: = 10. Entered\n"
            "Function: SMB2_Connect, Line no.: = 20. Exiting! Status = 14 (0xe)\n"
            "Entering MountStaticFileSystem\n"
            "Exiting MountStaticFileSystem, Status = 0xe\n"
            "Exiting UnmountStaticFileSystem. Status = 0x0\n"
            "Function: SMB2HeaderConstruct, Line no.: = 9, Input parameter is NULL!\n"
            "Guid = {47C7B224-C42A-11D2-8E57-00A0C969723B}\n"
            "main (221): Guid = {47C7B224-C42A-11D2-8E57-00A0C969723B}\n");

  gConsoleText.clear();
  const UINT32 Line = __LINE__ + 1;
  DiagError("x", EFI_ABORTED);
  EXPECT_EQ(Console(), "Function: TestBody, Line no.: = " + std::to_string(Line) +
                           " - x, Status = 21 (0x15)\n");
}

} // namespace
