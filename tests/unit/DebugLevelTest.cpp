// The debug levels, their initialisers (the two variables read from the
// hosted store) and the standard console lines.
#include "HostImageFixture.h"

#include <regex>
#include <string>

namespace {

const EFI_GUID LevelGuid = {
    0x47C7B224, 0xC42A, 0x11D2, {0x8E, 0x57, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B}};

class DebugLevelTest : public HostImageTest {
protected:
  void TearDown() override {
    gSMB2DebugLevel = 0;
    HostImageTest::TearDown();
  }
  // Stores the variable with Data as its text, or deletes it.
  static void Store(const CHAR16 *Name, const char *Data) {
    std::string Text = Data != nullptr ? Data : "";
    gRT->SetVariable(Name, &LevelGuid, 3, Text.size(), Text.data());
  }
};
using DiagLogTest = DebugLevelTest;

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
    Store(u"QVUIkestDebugLevel", Case.Data);
    UINT8 Level = 99;
    std::string Out =
        Console([&] { EXPECT_EQ(QVUIkestDebugLevelInitialize(&Level), Case.Status); });
    EXPECT_EQ(Level, Case.Level) << (Case.Data ? Case.Data : "absent");
    EXPECT_TRUE(std::regex_match(Out, std::regex(Case.Console))) << Out;
  }
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
    Store(u"SMB2DebugLevel", Case.Data);
    gSMB2DebugLevel = Case.Before;
    UINT8 Level = 99;
    std::string Out = Console([&] { EXPECT_EQ(SMB2DebugLevelInitialize(&Level), Case.Status); });
    EXPECT_EQ(Level, Case.Level) << (Case.Data ? Case.Data : "absent") << " " << +Case.Before;
    EXPECT_EQ(gSMB2DebugLevel, Case.Level);
    EXPECT_TRUE(std::regex_match(Out, std::regex(Case.Console))) << Out;
  }
}

TEST_F(DiagLogTest, StandardLines) {
  static_assert(DiagStatusNumber(EFI_NOT_FOUND) == 14 && DiagStatusValue(EFI_NOT_FOUND) == 0xe);
  static_assert(DiagStatusNumber(EFI_SUCCESS) == 0 && DiagStatusValue(EFI_SUCCESS) == 0);
  gDriverDebugLevel = 5;
  gSMB2DebugLevel = 2;
  std::string Out = Console([] {
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
  });
  EXPECT_EQ(Out, "Function: main, Line no.: = 221 - \nGetVariable returned, Status = 14 (0xe)\n"
                 "Function: MountStaticFileSystem, Line no.: = 7 - ok, Status = 0 (0x0)\n"
                 "\nFunction: main, Line no.: = 10. Entered\n"
                 "Function: SMB2_Connect, Line no.: = 20. Exiting! Status = 14 (0xe)\n"
                 "Entering MountStaticFileSystem\n"
                 "Exiting MountStaticFileSystem, Status = 0xe\n"
                 "Exiting UnmountStaticFileSystem. Status = 0x0\n"
                 "Function: SMB2HeaderConstruct, Line no.: = 9, Input parameter is NULL!\n"
                 "Guid = {47C7B224-C42A-11D2-8E57-00A0C969723B}\n"
                 "main (221): Guid = {47C7B224-C42A-11D2-8E57-00A0C969723B}\n");

  const UINT32 Line = __LINE__ + 1;
  Out = Console([] { DiagError("x", EFI_ABORTED); });
  EXPECT_EQ(Out, "Function: operator(), Line no.: = " + std::to_string(Line) +
                     " - x, Status = 21 (0x15)\n");
}

} // namespace
