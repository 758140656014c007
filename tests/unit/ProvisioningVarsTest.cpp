// The provisioning variables, the image's environment copy and the
// platform-status request.
#include "HostImageFixture.h"
#include "ProvisioningVars.h"
#include "ShellCommand.h"

#include <string.h>

namespace {

class ProvisioningVarsTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    gIpmiTransport = nullptr;
  }

  void TearDown() override {
    ReleaseProvisioningEnv();
    gIpmiTransport = nullptr;
    HostImageTest::TearDown();
  }

  // Installs the fake transport and makes the image find it.
  static void UseIpmi(std::vector<UINT8> Response, EFI_STATUS SendStatus = EFI_SUCCESS,
                      uint32_t FailCount = 0) {
    HostIpmiConfig Config;
    Config.Enabled = true;
    memcpy(Config.Response, Response.data(), Response.size());
    Config.ResponseLength = static_cast<uint32_t>(Response.size());
    Config.SendStatus = SendStatus;
    Config.FailCount = FailCount;
    HostSetIpmi(Config);
    gIpmiTransport = LocateIpmiTransport(gST);
    ASSERT_NE(gIpmiTransport, nullptr);
  }

  static std::vector<UINT8> Bytes(const PU_PROVISIONING_RECORD &Record) {
    const UINT8 *Raw = reinterpret_cast<const UINT8 *>(&Record);
    return {Raw, Raw + sizeof(Record)};
  }

  static PU_PROVISIONING_RECORD ValidRecord() {
    PU_PROVISIONING_RECORD Record = {};
    strcpy(Record.DownloadServer, "mirror.test");
    strcpy(Record.CifsCatalogPath, "CIFS:\\catalog");
    memset(Record.LongText, 'L', 200);
    return Record;
  }
};

TEST_F(ProvisioningVarsTest, StartUpCreatesMissingVariablesAndKeepsExistingOnes) {
  std::string Out =
      Console([] { EXPECT_EQ(InitializeProvisioningEnv(gImageHandle, gST), EFI_SUCCESS); });
  EXPECT_NE(Out.find("\nGetting PROVISIONING_ENV_VOLATILE_VAR failed E\n"), std::string::npos);

  Variable Settings = ReadVar(PROVISIONING_ENV_VAR_NAME, gProvisioningEnvGuid);
  ASSERT_EQ(Settings.Data.size(), 396u);
  EXPECT_EQ(Settings.Attributes, 3u);
  std::vector<UINT8> Expected(396, 0);
  memcpy(Expected.data() + 140, PROVISIONING_DOWNLOAD_HOST, strlen(PROVISIONING_DOWNLOAD_HOST));
  EXPECT_EQ(Settings.Data, Expected);
  Variable Outcome = ReadVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningVolatileInitGuid);
  EXPECT_EQ(Outcome.Data, std::vector<UINT8>(40, 0));
  EXPECT_EQ(Outcome.Attributes, 2u);
  // Only the start-up GUID is created here; main uses the other one.
  EXPECT_EQ(ReadVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid).Status, EFI_NOT_FOUND);

  // Existing records are left alone.
  Settings.Data[0] = 0x5A;
  WriteVar(PROVISIONING_ENV_VAR_NAME, gProvisioningEnvGuid, 3, Settings.Data);
  ReleaseProvisioningEnv();
  Out = Console([] { EXPECT_EQ(InitializeProvisioningEnv(gImageHandle, gST), EFI_SUCCESS); });
  EXPECT_NE(Out.find("\nPROVISIONING_ENV_VAR already initialized"), std::string::npos);
  EXPECT_NE(Out.find("\nPROVISIONING_ENV_VOLATILE_VAR already initialized"), std::string::npos);
  EXPECT_EQ(ReadVar(PROVISIONING_ENV_VAR_NAME, gProvisioningEnvGuid).Data[0], 0x5A);
}

TEST_F(ProvisioningVarsTest, EnvironmentCopyTakesTextVariablesAndMappings) {
  const EFI_GUID Other = {0x11111111, 0x2222, 0x3333, {4, 4, 4, 4, 4, 4, 4, 4}};
  std::u16string Wide = u"wide value";
  std::vector<UINT8> WideBytes(reinterpret_cast<const UINT8 *>(Wide.c_str()),
                               reinterpret_cast<const UINT8 *>(Wide.c_str() + Wide.size() + 1));
  WriteVar(u"WideVar", Other, 3, WideBytes);
  std::string Narrow = "narrow value";
  WriteVar(u"NarrowVar", Other, 3, {Narrow.begin(), Narrow.end()});
  std::string Big(700, 'b'); // beyond the first data buffer
  WriteVar(u"BigVar", Other, 3, {Big.begin(), Big.end()});
  WriteVar(u"BinaryVar", Other, 3, {0x01, 0x02, 0xFF});
  std::vector<UINT8> Path = {0x01, 0x04, 0x08, 0x00, 0xAA, 0xBB,
                             0xCC, 0xDD, 0x7F, 0xFF, 0x04, 0x00};
  WriteVar(u"fs9", gNwShellMapGuid, 3, Path);

  Console([] { EXPECT_EQ(_InitializeEnv(), EFI_SUCCESS); });
  ASSERT_NE(NwGetEnv("WideVar"), nullptr);
  EXPECT_STREQ(NwGetEnv("WideVar"), "wide value");
  ASSERT_NE(NwGetEnv("NarrowVar"), nullptr);
  EXPECT_STREQ(NwGetEnv("NarrowVar"), "narrow value");
  ASSERT_NE(NwGetEnv("BigVar"), nullptr);
  EXPECT_EQ(std::string(NwGetEnv("BigVar")), Big);
  EXPECT_EQ(NwGetEnv("BinaryVar"), nullptr);
  EXPECT_EQ(NwGetEnv("fs9"), nullptr);
  ASSERT_NE(gMapDeviceList, nullptr);
  EXPECT_STREQ(gMapDeviceList->MapName, "fs9:");
  ASSERT_EQ(gMapDeviceList->DevicePathSize, Path.size());
  EXPECT_EQ(memcmp(gMapDeviceList->DevicePath, Path.data(), Path.size()), 0);

  ReleaseProvisioningEnv();
  EXPECT_EQ(gMapDeviceList, nullptr);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

TEST_F(ProvisioningVarsTest, NvramStringCheckRefusesControlCharactersWithinTheFirst128Bytes) {
  gDriverDebugLevel = 0;
  std::string Out = Console([] {
    EXPECT_TRUE(IsNvramStringValid(nullptr));
    EXPECT_TRUE(IsNvramStringValid("host.example"));
    EXPECT_FALSE(IsNvramStringValid("bad\x07name"));
    EXPECT_FALSE(IsNvramStringValid("del\x7f"));
    EXPECT_TRUE(IsNvramStringValid("\xe9t\xe9")); // bytes above 127 are text
  });
  EXPECT_EQ(Count(Out, "Corruption in NVRAM\n"), 2u);
  EXPECT_NE(Out.find("Returned Null String\n"), std::string::npos);

  char Full[129];
  memset(Full, 'a', 128);
  Full[128] = 0x07; // beyond the scanned part
  EXPECT_TRUE(IsNvramStringValid(Full, 128));
  EXPECT_TRUE(IsNvramStringValid(Full, 129));
}

TEST_F(ProvisioningVarsTest, CorruptedTextFieldRecordIsRewrittenWithDefaults) {
  UseIpmi({0x00, 0x00, 0x11, 0x00, 0x00, 0x00, 0x00, 0x00});
  PU_PROVISIONING_RECORD Stored = ValidRecord();
  Stored.DownloadServer[3] = 0x07;
  WriteVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid, 3, Bytes(Stored));

  PU_PROVISIONING_RECORD Read;
  std::string Out = Console([&] { ASSERT_EQ(GetPUProvisioningEnvVar(&Read), &Read); });
  EXPECT_NE(Out.find("Corruption in NVRAM\n"), std::string::npos);
  PU_PROVISIONING_RECORD Expected = {};
  strcpy(Expected.DownloadServer, PROVISIONING_DOWNLOAD_HOST);
  EXPECT_EQ(Bytes(Read), Bytes(Expected));
  Variable Rewritten = ReadVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid);
  EXPECT_EQ(Rewritten.Data, Bytes(Expected));
  EXPECT_EQ(Rewritten.Attributes, 3u);

  // A non-zero first platform status leaves the host field empty.
  UseIpmi({0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x01});
  Stored.LongText[0] = 0x1B;
  WriteVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid, 3, Bytes(Stored));
  Console([&] { ASSERT_EQ(GetPUProvisioningEnvVar(&Read), &Read); });
  EXPECT_EQ(Bytes(Read), std::vector<UINT8>(sizeof(Read), 0));
}

TEST_F(ProvisioningVarsTest, TextFieldRecordWithoutPlatformStatusOrVariableIsNull) {
  PU_PROVISIONING_RECORD Read;
  std::string Out = Console([&] { EXPECT_EQ(GetPUProvisioningEnvVar(&Read), nullptr); });
  EXPECT_NE(Out.find("Getting PUPROVISIONING_ENV_VAR failed E\n"), std::string::npos);

  PU_PROVISIONING_RECORD Stored = ValidRecord();
  Stored.NfsCatalogPath[0] = 0x01;
  WriteVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid, 3, Bytes(Stored));
  Out = Console([&] { EXPECT_EQ(GetPUProvisioningEnvVar(&Read), nullptr); });
  EXPECT_NE(Out.find("Error on Getting PM Status. Status = 0xE\n"), std::string::npos);
  EXPECT_EQ(ReadVar(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid).Data, Bytes(Stored));
}

TEST_F(ProvisioningVarsTest, PlatformStatusRequestAndAnswer) {
  UINT8 First = 0xEE, Second = 0xEE;
  std::string Out = Console([&] { EXPECT_EQ(GetPMStatus(&First, &Second), EFI_NOT_FOUND); });
  EXPECT_EQ(First, 0);
  EXPECT_EQ(Second, 0);
  EXPECT_NE(Out.find("\n GetPMStatus(): failed, returning EFI_NOT_FOUND"), std::string::npos);

  UseIpmi({0xC1, 0x00, 0x22, 0x33, 0x44, 0x55, 0x66, 0x77});
  uint32_t Before = HostIpmiRequestCount();
  gDriverDebugLevel = 0; // its lines print whatever the level
  Out = Console([&] { EXPECT_EQ(GetPMStatus(&First, &Second), EFI_SUCCESS); });
  EXPECT_EQ(HostIpmiRequestCount(), Before + 1);
  HostIpmiRequest Request = HostIpmiLastRequest();
  EXPECT_EQ(Request.NetFn, 0x30);
  EXPECT_EQ(Request.Command, 0xA9);
  ASSERT_EQ(Request.DataLength, 4u);
  EXPECT_EQ(std::vector<UINT8>(Request.Data, Request.Data + 4),
            (std::vector<UINT8>{0x12, 0x00, 0x00, 0x00}));
  EXPECT_EQ(First, 0x66);
  EXPECT_EQ(Second, 0x22);
  EXPECT_NE(Out.find("Entering GetPMStatus()\nCommand Data 0:12, 1:0, 2:0  3:0\n"),
            std::string::npos);
  EXPECT_NE(Out.find("ResponseData : [0]= 0xC1 [1]= 0x0 [2]= 0x22"), std::string::npos) << Out;

  // A refused request (byte 1 non-zero) leaves both outputs clear.
  UseIpmi({0x00, 0xC9, 0x22, 0x33, 0x44, 0x55, 0x66});
  Console([&] { EXPECT_EQ(GetPMStatus(&First, &Second), EFI_SUCCESS); });
  EXPECT_EQ(First, 0);
  EXPECT_EQ(Second, 0);

  // A short answer: only the bytes received are taken.
  UseIpmi({0x00, 0x00, 0x22});
  Console([&] { EXPECT_EQ(GetPMStatus(&First, &Second), EFI_SUCCESS); });
  EXPECT_EQ(First, 0);
  EXPECT_EQ(Second, 0x22);
}

TEST_F(ProvisioningVarsTest, PlatformStatusRetriesAfterAFailedSend) {
  UseIpmi({0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x05}, EFI_DEVICE_ERROR, 1);
  uint32_t Before = HostIpmiRequestCount();
  UINT8 First = 0, Second = 0;
  std::string Out = Console([&] { EXPECT_EQ(GetPMStatus(&First, &Second), EFI_SUCCESS); });
  EXPECT_EQ(HostIpmiRequestCount(), Before + 2);
  EXPECT_EQ(Count(Out, "GetPMStatus: IPMIPassthru return status = 0x7 \n"), 1u);
  EXPECT_EQ(First, 5);
}

} // namespace
