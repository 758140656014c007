// The hosted UEFI environment seen through its tables, the way the image sees
// it: the counted pool, events and timers under TPL rules, the handle
// database and driver model, the variable store file and Unicode Collation.
#include "HostImageFixture.h"

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
  void SetUp() override {
    HostImageTest::SetUp();
    St = gST;
    Bs = gBS;
    Rt = gRT;
  }

  std::string ReadStore() { return ReadFile(VarStore); }

  EFI_SYSTEM_TABLE *St = nullptr;
  EFI_BOOT_SERVICES *Bs = nullptr;
  EFI_RUNTIME_SERVICES *Rt = nullptr;
};

// ---------------------------------------------------------------------------
// Pool
// ---------------------------------------------------------------------------
TEST_F(HostEnv, PoolCountsBlocksAndBytesAndRejectsForeignPointers) {
  uint64_t Blocks = HostPoolOutstanding();
  uint64_t Bytes = HostPoolOutstandingBytes();
  void *A = nullptr;
  void *B = nullptr;
  ASSERT_EQ(Bs->AllocatePool(EfiBootServicesData, 100, &A), EFI_SUCCESS);
  ASSERT_EQ(Bs->AllocatePool(EfiBootServicesData, 28, &B), EFI_SUCCESS);
  EXPECT_EQ(HostPoolOutstanding(), Blocks + 2);
  EXPECT_EQ(HostPoolOutstandingBytes(), Bytes + 128);

  int OnStack = 0;
  EXPECT_EQ(Bs->FreePool(&OnStack), EFI_INVALID_PARAMETER);
  EXPECT_EQ(Bs->FreePool(nullptr), EFI_INVALID_PARAMETER);
  EXPECT_EQ(Bs->FreePool(A), EFI_SUCCESS);
  EXPECT_EQ(Bs->FreePool(A), EFI_INVALID_PARAMETER); // double free is caught
  EXPECT_EQ(Bs->FreePool(B), EFI_SUCCESS);
  EXPECT_EQ(HostPoolOutstanding(), Blocks);
  EXPECT_EQ(HostPoolOutstandingBytes(), Bytes);
}

// ---------------------------------------------------------------------------
// Events, timers and TPL
// ---------------------------------------------------------------------------
struct NotifyLog {
  int Count = 0;
  EFI_TPL TplSeen = 0;
  EFI_BOOT_SERVICES *Bs = nullptr;
};

void EFIAPI CountNotify(EFI_EVENT, void *Context) {
  NotifyLog *Log = static_cast<NotifyLog *>(Context);
  Log->Count++;
  // The level a notification runs at is the one RaiseTPL reports as current.
  Log->TplSeen = Log->Bs->RaiseTPL(TPL_HIGH_LEVEL);
  Log->Bs->RestoreTPL(Log->TplSeen);
}

// Like the keep-alive: cancels itself and re-arms for later.
void EFIAPI RearmNotify(EFI_EVENT Event, void *Context) {
  NotifyLog *Log = static_cast<NotifyLog *>(Context);
  Log->Count++;
  Log->Bs->SetTimer(Event, TimerCancel, 0);
  Log->Bs->SetTimer(Event, TimerRelative, 100000); // 10 ms
}

TEST_F(HostEnv, RelativeTimerNotifiesOnceInsideStallAtItsOwnLevel) {
  NotifyLog Log;
  Log.Bs = Bs;
  EFI_EVENT Timer = nullptr;
  ASSERT_EQ(Bs->CreateEvent(EVT_TIMER | EVT_NOTIFY_SIGNAL, TPL_CALLBACK, CountNotify, &Log, &Timer),
            EFI_SUCCESS);
  ASSERT_EQ(Bs->SetTimer(Timer, TimerRelative, 100000), EFI_SUCCESS); // 10 ms
  EXPECT_EQ(Log.Count, 0);
  Bs->Stall(40000);
  EXPECT_EQ(Log.Count, 1);
  EXPECT_EQ(Log.TplSeen, TPL_CALLBACK);
  Bs->Stall(30000);
  EXPECT_EQ(Log.Count, 1);
  EXPECT_EQ(Bs->CloseEvent(Timer), EFI_SUCCESS);
  EXPECT_EQ(Bs->CloseEvent(Timer), EFI_INVALID_PARAMETER);
}

TEST_F(HostEnv, PeriodicTimerAndSelfRearmingTimerKeepFiring) {
  NotifyLog Periodic, Rearm;
  Periodic.Bs = Rearm.Bs = Bs;
  EFI_EVENT P = nullptr;
  EFI_EVENT R = nullptr;
  ASSERT_EQ(
      Bs->CreateEvent(EVT_TIMER | EVT_NOTIFY_SIGNAL, TPL_CALLBACK, CountNotify, &Periodic, &P),
      EFI_SUCCESS);
  ASSERT_EQ(Bs->CreateEvent(EVT_TIMER | EVT_NOTIFY_SIGNAL, TPL_CALLBACK, RearmNotify, &Rearm, &R),
            EFI_SUCCESS);
  Bs->SetTimer(P, TimerPeriodic, 100000);
  Bs->SetTimer(R, TimerRelative, 100000);
  Bs->Stall(65000);
  // Missed periods are not made up, so a loaded machine may see fewer.
  EXPECT_GE(Periodic.Count, 2);
  EXPECT_LE(Periodic.Count, 6);
  EXPECT_GE(Rearm.Count, 2);
  Bs->SetTimer(P, TimerCancel, 0);
  int Frozen = Periodic.Count;
  Bs->Stall(25000);
  EXPECT_EQ(Periodic.Count, Frozen);
  Bs->CloseEvent(P);
  Bs->CloseEvent(R);
}

TEST_F(HostEnv, RaisedTplHoldsNotificationsUntilRestore) {
  NotifyLog Log;
  Log.Bs = Bs;
  EFI_EVENT Timer = nullptr;
  ASSERT_EQ(Bs->CreateEvent(EVT_TIMER | EVT_NOTIFY_SIGNAL, TPL_CALLBACK, CountNotify, &Log, &Timer),
            EFI_SUCCESS);
  EFI_TPL Old = Bs->RaiseTPL(TPL_CALLBACK); // equal level masks too
  EXPECT_EQ(Old, TPL_APPLICATION);
  Bs->SetTimer(Timer, TimerRelative, 0);
  Bs->Stall(5000);
  HostDispatchTimers();
  EXPECT_EQ(Log.Count, 0);
  Bs->RestoreTPL(Old);
  EXPECT_EQ(Log.Count, 1);

  // A signalled notify event at a higher level runs at once.
  EFI_EVENT Signal = nullptr;
  ASSERT_EQ(Bs->CreateEvent(EVT_NOTIFY_SIGNAL, TPL_NOTIFY, CountNotify, &Log, &Signal),
            EFI_SUCCESS);
  Old = Bs->RaiseTPL(TPL_CALLBACK);
  EXPECT_EQ(Bs->SignalEvent(Signal), EFI_SUCCESS);
  EXPECT_EQ(Log.Count, 2);
  EXPECT_EQ(Log.TplSeen, TPL_NOTIFY);
  Bs->RestoreTPL(Old);
  EXPECT_EQ(Bs->CheckEvent(Signal), EFI_INVALID_PARAMETER); // not for notify-signal events
  Bs->CloseEvent(Timer);
  Bs->CloseEvent(Signal);
}

// ---------------------------------------------------------------------------
// Handle database
// ---------------------------------------------------------------------------
std::vector<EFI_HANDLE> HandlesWith(EFI_BOOT_SERVICES *Bs, const EFI_GUID &Guid) {
  UINTN Count = 0;
  EFI_HANDLE *Buffer = nullptr;
  std::vector<EFI_HANDLE> Result;
  if (Bs->LocateHandleBuffer(ByProtocol, &Guid, nullptr, &Count, &Buffer) == EFI_SUCCESS) {
    Result.assign(Buffer, Buffer + Count);
    Bs->FreePool(Buffer);
  }
  return Result;
}

TEST_F(HostEnv, HandlesAreListedInCreationOrderAndVanishWithTheirLastProtocol) {
  int Ia = 1, Ib = 2, Ic = 3;
  EFI_HANDLE H1 = nullptr, H2 = nullptr, H3 = nullptr;
  ASSERT_EQ(Bs->InstallProtocolInterface(&H1, &kGuidA, EFI_NATIVE_INTERFACE, &Ia), EFI_SUCCESS);
  ASSERT_EQ(Bs->InstallProtocolInterface(&H2, &kGuidB, EFI_NATIVE_INTERFACE, &Ib), EFI_SUCCESS);
  ASSERT_EQ(Bs->InstallProtocolInterface(&H3, &kGuidA, EFI_NATIVE_INTERFACE, &Ic), EFI_SUCCESS);
  EXPECT_EQ(HandlesWith(Bs, kGuidA), (std::vector<EFI_HANDLE>{H1, H3}));
  EXPECT_EQ(Bs->InstallProtocolInterface(&H1, &kGuidA, EFI_NATIVE_INTERFACE, &Ic),
            EFI_INVALID_PARAMETER);

  void *Found = nullptr;
  EXPECT_EQ(Bs->LocateProtocol(&kGuidA, nullptr, &Found), EFI_SUCCESS);
  EXPECT_EQ(Found, &Ia);

  // LocateHandle reports the size it needs.
  UINTN Size = sizeof(EFI_HANDLE);
  EFI_HANDLE Two[2] = {};
  EXPECT_EQ(Bs->LocateHandle(ByProtocol, &kGuidA, nullptr, &Size, Two), EFI_BUFFER_TOO_SMALL);
  EXPECT_EQ(Size, 2 * sizeof(EFI_HANDLE));
  EXPECT_EQ(Bs->LocateHandle(ByProtocol, &kGuidA, nullptr, &Size, Two), EFI_SUCCESS);

  EXPECT_EQ(Bs->UninstallProtocolInterface(H1, &kGuidA, &Ib), EFI_NOT_FOUND); // wrong interface
  EXPECT_EQ(Bs->UninstallProtocolInterface(H1, &kGuidA, &Ia), EFI_SUCCESS);
  EXPECT_EQ(Bs->HandleProtocol(H1, &kGuidA, &Found), EFI_INVALID_PARAMETER); // handle gone
  EXPECT_EQ(HandlesWith(Bs, kGuidA), (std::vector<EFI_HANDLE>{H3}));
  EXPECT_EQ(Bs->LocateProtocol(&kGuidA, nullptr, &Found), EFI_SUCCESS);
  EXPECT_EQ(Found, &Ic);
  EXPECT_EQ(Bs->HandleProtocol(H2, &kGuidA, &Found), EFI_UNSUPPORTED);

  Bs->UninstallProtocolInterface(H2, &kGuidB, &Ib);
  Bs->UninstallProtocolInterface(H3, &kGuidA, &Ic);
  EXPECT_TRUE(HandlesWith(Bs, kGuidA).empty());
}

TEST_F(HostEnv, InstallMultipleIsAllOrNothing) {
  int Ia = 1, Ib = 2;
  // A GUID twice in one call fails on the second and takes the first back.
  EFI_HANDLE Fresh = nullptr;
  EXPECT_EQ(Bs->InstallMultipleProtocolInterfaces(&Fresh, &kGuidA, &Ia, &kGuidB, &Ib, &kGuidA, &Ia,
                                                  nullptr),
            EFI_INVALID_PARAMETER);
  EXPECT_EQ(Fresh, nullptr);
  EXPECT_TRUE(HandlesWith(Bs, kGuidA).empty());
  EXPECT_TRUE(HandlesWith(Bs, kGuidB).empty());

  EFI_HANDLE H = nullptr;
  ASSERT_EQ(Bs->InstallMultipleProtocolInterfaces(&H, &kGuidA, &Ia, nullptr), EFI_SUCCESS);
  EXPECT_EQ(Bs->InstallMultipleProtocolInterfaces(&H, &kGuidB, &Ib, &kGuidA, &Ia, nullptr),
            EFI_INVALID_PARAMETER);
  EXPECT_TRUE(HandlesWith(Bs, kGuidB).empty());

  // Uninstall: one wrong interface puts the others back.
  ASSERT_EQ(Bs->InstallMultipleProtocolInterfaces(&H, &kGuidB, &Ib, nullptr), EFI_SUCCESS);
  EXPECT_EQ(Bs->UninstallMultipleProtocolInterfaces(H, &kGuidA, &Ia, &kGuidB, &Ia, nullptr),
            EFI_INVALID_PARAMETER);
  EXPECT_EQ(HandlesWith(Bs, kGuidA), std::vector<EFI_HANDLE>{H});
  EXPECT_EQ(Bs->UninstallMultipleProtocolInterfaces(H, &kGuidA, &Ia, &kGuidB, &Ib, nullptr),
            EFI_SUCCESS);
  EXPECT_TRUE(HandlesWith(Bs, kGuidA).empty());
}

// A driver that takes kGuidA on a controller by driver and lets go in Stop.
struct FakeDriver {
  EFI_DRIVER_BINDING_PROTOCOL Binding; // first: the interface is the record
  EFI_BOOT_SERVICES *Bs;
  int Started, Stopped;
  bool CloseOnStop;
};

EFI_STATUS EFIAPI FakeSupported(EFI_DRIVER_BINDING_PROTOCOL *This, EFI_HANDLE Controller,
                                EFI_DEVICE_PATH_PROTOCOL *) {
  FakeDriver *D = reinterpret_cast<FakeDriver *>(This);
  return D->Bs->OpenProtocol(Controller, &kGuidA, nullptr, This->DriverBindingHandle, Controller,
                             EFI_OPEN_PROTOCOL_TEST_PROTOCOL);
}

EFI_STATUS EFIAPI FakeStart(EFI_DRIVER_BINDING_PROTOCOL *This, EFI_HANDLE Controller,
                            EFI_DEVICE_PATH_PROTOCOL *) {
  FakeDriver *D = reinterpret_cast<FakeDriver *>(This);
  void *Interface = nullptr;
  EFI_STATUS Status =
      D->Bs->OpenProtocol(Controller, &kGuidA, &Interface, This->DriverBindingHandle, Controller,
                          EFI_OPEN_PROTOCOL_BY_DRIVER);
  D->Started += Status == EFI_SUCCESS;
  return Status;
}

EFI_STATUS EFIAPI FakeStop(EFI_DRIVER_BINDING_PROTOCOL *This, EFI_HANDLE Controller, UINTN,
                           EFI_HANDLE *) {
  FakeDriver *D = reinterpret_cast<FakeDriver *>(This);
  D->Stopped++;
  if (D->CloseOnStop) {
    D->Bs->CloseProtocol(Controller, &kGuidA, This->DriverBindingHandle, Controller);
  }
  return EFI_SUCCESS;
}

FakeDriver MakeDriver(EFI_BOOT_SERVICES *Bs) {
  return FakeDriver{{FakeSupported, FakeStart, FakeStop, 0x10, nullptr, nullptr}, Bs, 0, 0, true};
}

void InstallDriver(EFI_BOOT_SERVICES *Bs, FakeDriver &D, EFI_HANDLE *Handle) {
  ASSERT_EQ(Bs->InstallProtocolInterface(Handle, &gEfiDriverBindingProtocolGuid,
                                         EFI_NATIVE_INTERFACE, &D.Binding),
            EFI_SUCCESS);
  D.Binding.ImageHandle = D.Binding.DriverBindingHandle = *Handle;
}

TEST_F(HostEnv, ConnectStartsSupportingDriversAndDisconnectStopsThem) {
  int Ia = 1;
  EFI_HANDLE Controller = nullptr, Bare = nullptr, Driver1 = nullptr, Driver2 = nullptr;
  ASSERT_EQ(Bs->InstallProtocolInterface(&Controller, &kGuidA, EFI_NATIVE_INTERFACE, &Ia),
            EFI_SUCCESS);
  ASSERT_EQ(Bs->InstallProtocolInterface(&Bare, &kGuidB, EFI_NATIVE_INTERFACE, &Ia), EFI_SUCCESS);
  FakeDriver D1 = MakeDriver(Bs), D2 = MakeDriver(Bs);
  InstallDriver(Bs, D1, &Driver1);
  InstallDriver(Bs, D2, &Driver2);

  EXPECT_EQ(Bs->ConnectController(Bare, nullptr, nullptr, FALSE), EFI_NOT_FOUND);
  EXPECT_EQ(Bs->ConnectController(Controller, nullptr, nullptr, FALSE), EFI_SUCCESS);
  EXPECT_EQ(D1.Started + D2.Started, 1); // the first driver holds it by driver

  // Nothing to stop is success; a foreign driver filter stops nobody.
  EXPECT_EQ(Bs->DisconnectController(Bare, nullptr, nullptr), EFI_SUCCESS);
  EFI_HANDLE Holder = D1.Started ? Driver1 : Driver2;
  EFI_HANDLE Idle = D1.Started ? Driver2 : Driver1;
  EXPECT_EQ(Bs->DisconnectController(Controller, Idle, nullptr), EFI_SUCCESS);
  EXPECT_EQ(D1.Stopped + D2.Stopped, 0);
  EXPECT_EQ(Bs->DisconnectController(Controller, Holder, nullptr), EFI_SUCCESS);
  EXPECT_EQ(D1.Stopped + D2.Stopped, 1);

  // Uninstalling a protocol held by driver asks the driver to stop first;
  // a driver that does not let go makes the uninstall fail.
  EFI_HANDLE Only[2] = {Driver1, nullptr};
  ASSERT_EQ(Bs->ConnectController(Controller, Only, nullptr, FALSE), EFI_SUCCESS);
  D1.CloseOnStop = false;
  EXPECT_EQ(Bs->UninstallProtocolInterface(Controller, &kGuidA, &Ia), EFI_ACCESS_DENIED);
  D1.CloseOnStop = true;
  int StoppedBefore = D1.Stopped;
  EXPECT_EQ(Bs->UninstallProtocolInterface(Controller, &kGuidA, &Ia), EFI_SUCCESS);
  EXPECT_GT(D1.Stopped, StoppedBefore);

  Bs->UninstallProtocolInterface(Bare, &kGuidB, &Ia);
  Bs->UninstallProtocolInterface(Driver1, &gEfiDriverBindingProtocolGuid, &D1.Binding);
  Bs->UninstallProtocolInterface(Driver2, &gEfiDriverBindingProtocolGuid, &D2.Binding);
}

// ---------------------------------------------------------------------------
// Variables
// ---------------------------------------------------------------------------
TEST_F(HostEnv, VariablesRoundTripThroughTheStoreFile) {
  const uint8_t Record[4] = {0x00, 0xFF, 0x10, 0xAB};
  ASSERT_EQ(Rt->SetVariable(u"PROVISIONING_ENV_VAR", &kProvisioningGuid, 3, sizeof Record, Record),
            EFI_SUCCESS);
  const uint8_t Other[1] = {0x5A};
  ASSERT_EQ(Rt->SetVariable(u"odd name%é", &kGuidA, 2, 1, Other), EFI_SUCCESS);

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
  ASSERT_EQ(Rt->GetVariable(u"Seeded", &kGuidB, &Attributes, &Size, Buffer), EFI_SUCCESS);
  EXPECT_EQ(Attributes, 7u);
  EXPECT_EQ(Size, 2u);
  EXPECT_EQ(Buffer[1], 0x02);
  Size = sizeof Buffer;
  ASSERT_EQ(Rt->GetVariable(u"odd name%é", &kGuidA, nullptr, &Size, Buffer), EFI_SUCCESS);
  EXPECT_EQ(Buffer[0], 0x5A);

  // A fresh environment on the same file sees the same store, the volatile
  // change made last included (written at shutdown).
  const uint8_t Late[1] = {0x77};
  ASSERT_EQ(Rt->SetVariable(u"Late", &kGuidA, 2, 1, Late), EFI_SUCCESS);
  EXPECT_EQ(ReadStore().find(" Late "), std::string::npos);
  HostShutdown();
  EXPECT_NE(ReadStore().find(" Late 2 77\n"), std::string::npos);
  HostConfig Config;
  Config.RamfsDir = RamfsDir.c_str();
  Config.VarStore = VarStore.c_str();
  St = HostInitialize(Config);
  Rt = St->RuntimeServices;
  Size = sizeof Buffer;
  ASSERT_EQ(Rt->GetVariable(u"PROVISIONING_ENV_VAR", &kProvisioningGuid, nullptr, &Size, Buffer),
            EFI_SUCCESS);
  EXPECT_EQ(0, memcmp(Buffer, Record, sizeof Record));
}

TEST_F(HostEnv, VariableServicesFollowFirmwareRules) {
  const uint8_t Data[6] = {1, 2, 3, 4, 5, 6};
  ASSERT_EQ(Rt->SetVariable(u"V", &kGuidA, 3, 6, Data), EFI_SUCCESS);
  uint8_t Small[2];
  UINTN Size = sizeof Small;
  EXPECT_EQ(Rt->GetVariable(u"V", &kGuidA, nullptr, &Size, Small), EFI_BUFFER_TOO_SMALL);
  EXPECT_EQ(Size, 6u);
  EXPECT_EQ(Rt->GetVariable(u"V", &kGuidB, nullptr, &Size, Small), EFI_NOT_FOUND);
  EXPECT_EQ(Rt->GetVariable(u"V", &kGuidA, nullptr, &Size, nullptr), EFI_INVALID_PARAMETER);

  EXPECT_EQ(Rt->SetVariable(u"V", &kGuidA, 2, 6, Data), EFI_INVALID_PARAMETER); // other attributes
  EXPECT_EQ(Rt->SetVariable(u"V", &kGuidA, EFI_VARIABLE_RUNTIME_ACCESS, 6, Data),
            EFI_INVALID_PARAMETER);
  EXPECT_EQ(Rt->SetVariable(u"", &kGuidA, 3, 6, Data), EFI_INVALID_PARAMETER);
  EXPECT_EQ(Rt->SetVariable(u"V", &kGuidA, 3, 6, nullptr), EFI_INVALID_PARAMETER);

  EXPECT_EQ(Rt->SetVariable(u"V", &kGuidA, 3 | 0x40, 2, Data), EFI_SUCCESS); // append
  uint8_t Big[16];
  Size = sizeof Big;
  EXPECT_EQ(Rt->GetVariable(u"V", &kGuidA, nullptr, &Size, Big), EFI_SUCCESS);
  EXPECT_EQ(Size, 8u);
  EXPECT_EQ(Big[7], 2);

  EXPECT_EQ(Rt->SetVariable(u"V", &kGuidA, 3, 0, nullptr), EFI_SUCCESS); // delete by size 0
  EXPECT_EQ(Rt->SetVariable(u"V", &kGuidA, 3, 0, nullptr), EFI_NOT_FOUND);
  ASSERT_EQ(Rt->SetVariable(u"W", &kGuidA, 2, 1, Data), EFI_SUCCESS);
  EXPECT_EQ(Rt->SetVariable(u"W", &kGuidA, 0, 1, Data), EFI_SUCCESS); // delete by attributes 0
  EXPECT_EQ(ReadStore().find(" W "), std::string::npos);
}

TEST_F(HostEnv, CollationMatchesCaseInsensitively) {
  EFI_UNICODE_COLLATION_PROTOCOL *Coll = nullptr;
  ASSERT_EQ(Bs->LocateProtocol(&gEfiUnicodeCollation2ProtocolGuid, nullptr,
                               reinterpret_cast<void **>(&Coll)),
            EFI_SUCCESS);
  EXPECT_EQ(strncmp(Coll->SupportedLanguages, "eng", 3), 0);

  CHAR16 A[] = u"Catalog.XML", B[] = u"catalog.xml", C[] = u"catalog.xmm";
  EXPECT_EQ(Coll->StriColl(Coll, A, B), 0);
  EXPECT_LT(Coll->StriColl(Coll, B, C), 0);

  struct Case {
    const char16_t *String, *Pattern;
    bool Match;
  } Cases[] = {{u"catalog.xml.gz", u"*.XML.GZ", true},
               {u"catalog.xml", u"*.xml.gz", false},
               {u"ac", u"a?c", false},
               {u"file7", u"file[0-9]", true},
               {u"Bx", u"[abc]x", true},
               {u"a", u"[a", false},
               {u"", u"*", true},
               {u"mississippi", u"m*iss*ppi", true}};
  for (const Case &K : Cases) {
    std::u16string S = K.String, P = K.Pattern;
    EXPECT_EQ(Coll->MetaiMatch(Coll, &S[0], &P[0]) != 0, K.Match)
        << std::string(S.begin(), S.end()) << " ~ " << std::string(P.begin(), P.end());
  }

  CHAR16 Mixed[] = u"MiXeD\u00e9";
  Coll->StrUpr(Coll, Mixed);
  EXPECT_EQ(std::u16string(Mixed), u"MIXED\u00c9");
  Coll->StrLwr(Coll, Mixed);
  EXPECT_EQ(std::u16string(Mixed), u"mixed\u00e9");

  CHAR8 Fat[12] = {};
  CHAR16 Name[] = u"a b.c*d";
  EXPECT_TRUE(Coll->StrToFat(Coll, Name, 11, Fat));
  EXPECT_STREQ(Fat, "ABC_D");
  CHAR16 Back[12];
  Coll->FatToStr(Coll, 3, Fat, Back);
  EXPECT_EQ(std::u16string(Back), u"ABC");
}

} // namespace
