// The hosted UEFI environment seen through its tables, the way the image sees
// it: the counted pool every leak check relies on, timers under TPL rules
// (the keep-alive's) and the variable store file. (Its shell and RAM disk are
// tested through the image's commands and tasks.)
#include "HostImageFixture.h"
#include "HostInternal.h"

#include <gtest/gtest.h>

#include <stdlib.h>
#include <string.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

namespace {

const EFI_GUID kGuidA = {
    0x11111111, 0x2222, 0x3333, {0x44, 0x44, 0x55, 0x55, 0x55, 0x55, 0x55, 0x51}};
const EFI_GUID kGuidB = {
    0x11111111, 0x2222, 0x3333, {0x44, 0x44, 0x55, 0x55, 0x55, 0x55, 0x55, 0x52}};
const EFI_GUID kProvisioningGuid = {
    0x4C4AC96B, 0xDD0A, 0x447E, {0x81, 0x18, 0x10, 0x59, 0x00, 0xDA, 0x86, 0x29}};

class HostEnv : public HostImageTest {
protected:
  std::string ReadStore() { return ReadFile(VarStore); }
};

// ---------------------------------------------------------------------------
// Pool
// ---------------------------------------------------------------------------
TEST_F(HostEnv, PoolCountsBlocksAndBytesAndRejectsForeignPointers) {
  uint64_t Blocks = HostPoolOutstanding();
  uint64_t Bytes = HostPoolOutstandingBytes();
  void *A = nullptr;
  void *B = nullptr;
  ASSERT_EQ(gBS->AllocatePool(EfiBootServicesData, 100, &A), EFI_SUCCESS);
  ASSERT_EQ(gBS->AllocatePool(EfiBootServicesData, 28, &B), EFI_SUCCESS);
  EXPECT_EQ(HostPoolOutstanding(), Blocks + 2);
  EXPECT_EQ(HostPoolOutstandingBytes(), Bytes + 128);

  int OnStack = 0;
  EXPECT_EQ(gBS->FreePool(&OnStack), EFI_INVALID_PARAMETER);
  EXPECT_EQ(gBS->FreePool(nullptr), EFI_INVALID_PARAMETER);
  EXPECT_EQ(gBS->FreePool(A), EFI_SUCCESS);
  EXPECT_EQ(gBS->FreePool(A), EFI_INVALID_PARAMETER); // double free is caught
  EXPECT_EQ(gBS->FreePool(B), EFI_SUCCESS);
  EXPECT_EQ(HostPoolOutstanding(), Blocks);
  EXPECT_EQ(HostPoolOutstandingBytes(), Bytes);
}

// ---------------------------------------------------------------------------
// Events, timers and TPL
// ---------------------------------------------------------------------------
struct NotifyLog {
  int Count = 0;
  EFI_TPL TplSeen = 0;
};

void EFIAPI CountNotify(EFI_EVENT, void *Context) {
  NotifyLog *Log = static_cast<NotifyLog *>(Context);
  Log->Count++;
  // The level a notification runs at is the one RaiseTPL reports as current.
  Log->TplSeen = gBS->RaiseTPL(TPL_HIGH_LEVEL);
  gBS->RestoreTPL(Log->TplSeen);
}

TEST_F(HostEnv, TimersNotifyInsideStallAtTheirLevelAndWaitForARaisedTpl) {
  NotifyLog Log;
  EFI_EVENT Timer = nullptr;
  ASSERT_EQ(
      gBS->CreateEvent(EVT_TIMER | EVT_NOTIFY_SIGNAL, TPL_CALLBACK, CountNotify, &Log, &Timer),
      EFI_SUCCESS);
  ASSERT_EQ(gBS->SetTimer(Timer, TimerRelative, 100000), EFI_SUCCESS); // 10 ms
  gBS->Stall(40000);
  EXPECT_EQ(Log.Count, 1);
  EXPECT_EQ(Log.TplSeen, TPL_CALLBACK);
  gBS->Stall(30000); // relative: once
  EXPECT_EQ(Log.Count, 1);
  Log.Count = 0;
  EFI_TPL Old = gBS->RaiseTPL(TPL_CALLBACK); // equal level masks too
  EXPECT_EQ(Old, TPL_APPLICATION);
  gBS->SetTimer(Timer, TimerRelative, 0);
  gBS->Stall(5000);
  HostDispatchTimers();
  EXPECT_EQ(Log.Count, 0);
  gBS->RestoreTPL(Old);
  EXPECT_EQ(Log.Count, 1);

  // A signalled notify event at a higher level runs at once.
  EFI_EVENT Signal = nullptr;
  ASSERT_EQ(gBS->CreateEvent(EVT_NOTIFY_SIGNAL, TPL_NOTIFY, CountNotify, &Log, &Signal),
            EFI_SUCCESS);
  Old = gBS->RaiseTPL(TPL_CALLBACK);
  EXPECT_EQ(gBS->SignalEvent(Signal), EFI_SUCCESS);
  EXPECT_EQ(Log.Count, 2);
  EXPECT_EQ(Log.TplSeen, TPL_NOTIFY);
  gBS->RestoreTPL(Old);
  EXPECT_EQ(gBS->CloseEvent(Timer), EFI_SUCCESS);
  EXPECT_EQ(gBS->CloseEvent(Timer), EFI_INVALID_PARAMETER);
  gBS->CloseEvent(Signal);
}

// ---------------------------------------------------------------------------
// Variables
// ---------------------------------------------------------------------------
TEST_F(HostEnv, VariablesRoundTripThroughTheStoreFile) {
  const uint8_t Record[4] = {0x00, 0xFF, 0x10, 0xAB};
  ASSERT_EQ(gRT->SetVariable(u"PROVISIONING_ENV_VAR", &kProvisioningGuid, 3, sizeof Record, Record),
            EFI_SUCCESS);
  const uint8_t Other[1] = {0x5A};
  ASSERT_EQ(gRT->SetVariable(u"odd name%é", &kGuidA, 2, 1, Other), EFI_SUCCESS);

  // The non-volatile change wrote the file; the volatile one waits in memory.
  std::string Text = ReadStore();
  EXPECT_NE(Text.find(" PROVISIONING_ENV_VAR 3 "), std::string::npos) << Text;
  EXPECT_EQ(Text.find(" odd%20name"), std::string::npos) << Text;
  HostVariablesFlush();
  Text = ReadStore();
  EXPECT_EQ(Text[0], '#');
  EXPECT_NE(Text.find("\n{4C4AC96B-DD0A-447E-8118-105900DA8629} PROVISIONING_ENV_VAR 3 00ff10ab\n"),
            std::string::npos)
      << Text;
  EXPECT_NE(Text.find(" odd%20name%25\xC3\xA9 2 5a\n"), std::string::npos) << Text;

  // Edit the file behind the environment's back and reload.
  {
    std::ofstream Out(VarStore, std::ios::app);
    Out << "# a comment\n\nnot a variable line\n"
        << "{11111111-2222-3333-4444-555555555552} Seeded 7 0102\n";
  }
  HostVariablesReload();
  uint8_t Buffer[8] = {};
  UINTN Size = sizeof Buffer;
  UINT32 Attributes = 0;
  ASSERT_EQ(gRT->GetVariable(u"Seeded", &kGuidB, &Attributes, &Size, Buffer), EFI_SUCCESS);
  EXPECT_EQ(Attributes, 7u);
  EXPECT_EQ(Size, 2u);
  EXPECT_EQ(Buffer[1], 0x02);
  Size = sizeof Buffer;
  ASSERT_EQ(gRT->GetVariable(u"odd name%é", &kGuidA, nullptr, &Size, Buffer), EFI_SUCCESS);
  EXPECT_EQ(Buffer[0], 0x5A);

  // A fresh environment on the same file sees the same store, the volatile
  // change made last included (written at shutdown).
  const uint8_t Late[1] = {0x77};
  ASSERT_EQ(gRT->SetVariable(u"Late", &kGuidA, 2, 1, Late), EFI_SUCCESS);
  EXPECT_EQ(ReadStore().find(" Late "), std::string::npos);
  HostShutdown();
  EXPECT_NE(ReadStore().find(" Late 2 77\n"), std::string::npos);
  HostConfig Config;
  Config.RamfsDir = RamfsDir.c_str();
  Config.VarStore = VarStore.c_str();
  gRT = HostInitialize(Config)->RuntimeServices;
  Size = sizeof Buffer;
  ASSERT_EQ(gRT->GetVariable(u"PROVISIONING_ENV_VAR", &kProvisioningGuid, nullptr, &Size, Buffer),
            EFI_SUCCESS);
  EXPECT_EQ(0, memcmp(Buffer, Record, sizeof Record));
}

TEST_F(HostEnv, VariableServicesFollowFirmwareRules) {
  const uint8_t Data[6] = {1, 2, 3, 4, 5, 6};
  ASSERT_EQ(gRT->SetVariable(u"V", &kGuidA, 3, 6, Data), EFI_SUCCESS);
  uint8_t Small[2];
  UINTN Size = sizeof Small;
  EXPECT_EQ(gRT->GetVariable(u"V", &kGuidA, nullptr, &Size, Small), EFI_BUFFER_TOO_SMALL);
  EXPECT_EQ(Size, 6u);
  EXPECT_EQ(gRT->GetVariable(u"V", &kGuidB, nullptr, &Size, Small), EFI_NOT_FOUND);
  EXPECT_EQ(gRT->GetVariable(u"V", &kGuidA, nullptr, &Size, nullptr), EFI_INVALID_PARAMETER);

  EXPECT_EQ(gRT->SetVariable(u"V", &kGuidA, 2, 6, Data), EFI_INVALID_PARAMETER); // other attributes
  EXPECT_EQ(gRT->SetVariable(u"V", &kGuidA, EFI_VARIABLE_RUNTIME_ACCESS, 6, Data),
            EFI_INVALID_PARAMETER);
  EXPECT_EQ(gRT->SetVariable(u"", &kGuidA, 3, 6, Data), EFI_INVALID_PARAMETER);
  EXPECT_EQ(gRT->SetVariable(u"V", &kGuidA, 3, 6, nullptr), EFI_INVALID_PARAMETER);

  EXPECT_EQ(gRT->SetVariable(u"V", &kGuidA, 3 | 0x40, 2, Data), EFI_SUCCESS); // append
  uint8_t Big[16];
  Size = sizeof Big;
  EXPECT_EQ(gRT->GetVariable(u"V", &kGuidA, nullptr, &Size, Big), EFI_SUCCESS);
  EXPECT_EQ(Size, 8u);
  EXPECT_EQ(Big[7], 2);

  EXPECT_EQ(gRT->SetVariable(u"V", &kGuidA, 3, 0, nullptr), EFI_SUCCESS); // delete by size 0
  EXPECT_EQ(gRT->SetVariable(u"V", &kGuidA, 3, 0, nullptr), EFI_NOT_FOUND);
  ASSERT_EQ(gRT->SetVariable(u"W", &kGuidA, 2, 1, Data), EFI_SUCCESS);
  EXPECT_EQ(gRT->SetVariable(u"W", &kGuidA, 0, 1, Data), EFI_SUCCESS); // delete by attributes 0
  EXPECT_EQ(ReadStore().find(" W "), std::string::npos);
}

} // namespace
