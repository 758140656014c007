// The network library's own pieces: splitting a login into user and domain,
// the network busy lock, the status record, the fixed file time and the
// directory-node list helpers.
#include "HostImageFixture.h"
#include "ProvisioningVars.h"
#include "NwPlatform.h"
#include "smb2/SMB2FsAdapter.h"
#include "volume/NWLib.h"

#include <string.h>

namespace {

class NWLibTest : public HostImageTest {
protected:
  void SetUp() override {
    HostImageTest::SetUp();
    gDriverDebugLevel = 0;
  }

  static bool Contains(const std::string &Text, const std::string &Part) {
    return Text.find(Part) != std::string::npos;
  }

  struct Split {
    EFI_STATUS Status;
    std::string User;
    std::string Domain;
    std::string Out;
  };
  // Splits with 256-byte buffers followed by canaries.
  static Split Run(const std::string &Input, CHAR8 Separator = 0, UINTN UserSize = 256,
                   UINTN DomainSize = 256) {
    std::vector<CHAR8> User(UserSize + 16, '#');
    std::vector<CHAR8> Domain(DomainSize + 16, '#');
    Split S = {};
    S.Out = Console([&] {
      S.Status =
          Separator == 0
              ? SplitUserAndDomain(Input.c_str(), UserSize, User.data(), DomainSize, Domain.data())
              : SearchUserAndDomainSeparator(Input.c_str(), Separator, UserSize, User.data(),
                                             DomainSize, Domain.data());
    });
    for (UINTN I = 0; I < 16; I++) {
      EXPECT_EQ(User[UserSize + I], '#') << "user buffer overrun for " << Input;
      EXPECT_EQ(Domain[DomainSize + I], '#') << "domain buffer overrun for " << Input;
    }
    S.User.assign(User.data(), strnlen(User.data(), UserSize));
    S.Domain.assign(Domain.data(), strnlen(Domain.data(), DomainSize));
    return S;
  }

  static UINT64 RecordedStatus(std::vector<UINT8> *Whole = nullptr) {
    std::vector<UINT8> Data(64);
    UINTN Size = Data.size();
    UINT32 Attributes = 0;
    EFI_STATUS Status = gRT->GetVariable(PROVISIONING_VOLATILE_VAR_NAME, &gProvisioningEnvGuid,
                                         &Attributes, &Size, Data.data());
    EXPECT_EQ(Status, EFI_SUCCESS);
    EXPECT_EQ(Size, 40u);
    EXPECT_EQ(Attributes, 2u);
    Data.resize(Size);
    if (Whole != nullptr) {
      *Whole = Data;
    }
    UINT64 Value = 0;
    memcpy(&Value, Data.data(), sizeof(Value));
    return Value;
  }
};

TEST_F(NWLibTest, LoginsSplitAtTheirSeparators) {
  const std::string Full(256, 'u');
  struct Case {
    std::string Input;
    CHAR8 Separator; // 0: the splitter, '@' then '\'
    UINTN UserSize, DomainSize;
    EFI_STATUS Status;
    std::string User, Domain;
  } Cases[] = {
      {"alice@CORP", 0, 256, 256, EFI_SUCCESS, "alice", "CORP"},
      {"CORP\\bob", 0, 256, 256, EFI_SUCCESS, "bob", "CORP"},
      // '@' is tried first; the backslash stays with the user.
      {"CORP\\carol@WORK", 0, 256, 256, EFI_SUCCESS, "CORP\\carol", "WORK"},
      // No separator: the whole name is the user (not an error to the connect).
      {"dave", 0, 256, 256, EFI_NOT_FOUND, "dave", ""},
      // Exactly the user size before '@': filled without a terminator.
      {Full + "@D", 0, 256, 256, EFI_SUCCESS, Full, "D"},
      {Full + "u@D", 0, 256, 256, EFI_SUCCESS, "", "D"},
      // The part after must be shorter than the domain size.
      {"u@" + Full, 0, 256, 256, EFI_SUCCESS, "u", ""},
      // With '\' the part before (the domain) is measured against the user
      // size and the part after (the user) against the domain size; neither
      // is copied past the buffer it lands in.
      {std::string(20, 'd') + "\\" + std::string(10, 'u'), '\\', 32, 16, EFI_SUCCESS,
       std::string(10, 'u'), ""},
      {"dom\\" + std::string(20, 'u'), '\\', 32, 16, EFI_SUCCESS, "", "dom"},
  };
  for (const Case &C : Cases) {
    Split S = Run(C.Input, C.Separator, C.UserSize, C.DomainSize);
    EXPECT_EQ(S.Status, C.Status) << C.Input;
    EXPECT_EQ(S.User, C.User) << C.Input;
    EXPECT_EQ(S.Domain, C.Domain) << C.Input;
  }
  // The splitter's failure lines need a non-zero level.
  EXPECT_EQ(Run("dave").Out, "");
  gDriverDebugLevel = 1;
  EXPECT_EQ(Run("dave").Out, "SearchUserAndDomainSeparator returned error 0xe for @\n"
                             "SearchUserAndDomainSeparator returned error 0xe for \\\n");
  std::string Out = Console([] {
    CHAR8 User[8];
    EXPECT_EQ(SplitUserAndDomain(nullptr, sizeof(User), User, sizeof(User), User),
              EFI_INVALID_PARAMETER);
  });
  EXPECT_EQ(Out, "Input is NULL!\n");
}

TEST_F(NWLibTest, BusyLockIsTakenOnceAndWaitedForOnItsEvent) {
  UINT8 Busy = 0;
  EFI_EVENT Event = nullptr;
  EXPECT_TRUE(AcquireNetworkBusyLock(&Busy, &Event, FALSE));
  EXPECT_EQ(Busy, 1);
  ASSERT_NE(Event, nullptr);
  // Held: a try fails at once and leaves the holder's event.
  EFI_EVENT Held = Event;
  EXPECT_FALSE(AcquireNetworkBusyLock(&Busy, &Event, FALSE));
  EXPECT_EQ(Event, Held);
  EXPECT_FALSE(ReleaseNetworkBusyLock(&Busy, &Event));
  EXPECT_EQ(Busy, 0);
  EXPECT_EQ(Event, nullptr);
  EXPECT_EQ(gBS->CheckEvent(Held), EFI_INVALID_PARAMETER); // closed
  // Releasing a free lock does nothing.
  EXPECT_FALSE(ReleaseNetworkBusyLock(&Busy, &Event));

  // A waiter sleeps on the holder's event. With nothing that could release
  // the lock meanwhile the wait fails (the hosted firmware refuses a wait
  // that can never end) and the lock stays with its holder.
  ASSERT_TRUE(AcquireNetworkBusyLock(&Busy, &Event, FALSE));
  Held = Event;
  EXPECT_FALSE(AcquireNetworkBusyLock(&Busy, &Event, TRUE));
  EXPECT_EQ(Busy, 1);
  EXPECT_EQ(Event, Held);
  ReleaseNetworkBusyLock(&Busy, &Event);
  // Free with waiting: taken at once, each time with a fresh event.
  EXPECT_TRUE(AcquireNetworkBusyLock(&NetworkBusyLock.Busy, &NetworkBusyLock.Event, TRUE));
  EXPECT_NE(NetworkBusyLock.Event, nullptr);
  ReleaseNetworkBusyLock(&NetworkBusyLock.Busy, &NetworkBusyLock.Event);
  EXPECT_EQ(NetworkBusyLock.Busy, 0);
}

TEST_F(NWLibTest, StatusRecordKeepsTheRestOfTheVariable) {
  std::string Out = Console([] { EXPECT_EQ(SetOperationStatus(EFI_NOT_FOUND), EFI_SUCCESS); });
  // Absent at first: reported, then created.
  EXPECT_TRUE(Contains(Out, "GetVariable failed!, Status = 14 (0xe)")) << Out;
  EXPECT_EQ(RecordedStatus(), EFI_NOT_FOUND);

  std::vector<UINT8> Record(40);
  for (size_t I = 0; I < Record.size(); I++) {
    Record[I] = static_cast<UINT8>(0xA0 + I);
  }
  ASSERT_EQ(WriteVar(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningEnvGuid, 2, Record), EFI_SUCCESS);
  gDriverDebugLevel = 5;
  Out = Console([] { SetOperationStatus(EFI_SUCCESS); });
  EXPECT_TRUE(Contains(Out, "Guid = {4C4AC96B-DD0A-447E-8118-105900DA8629}\n")) << Out;
  EXPECT_TRUE(Contains(Out, "Operation returned. 0\n")) << Out;
  std::vector<UINT8> Whole;
  EXPECT_EQ(RecordedStatus(&Whole), EFI_SUCCESS);
  EXPECT_TRUE(std::equal(Record.begin() + 8, Record.end(), Whole.begin() + 8));

  // The operations that send nothing record their success.
  Console([] { SetOperationStatus(EFI_DEVICE_ERROR); });
  EXPECT_EQ(GEE_NWMkdir(nullptr, u"d"), EFI_SUCCESS);
  EXPECT_EQ(RecordedStatus(), EFI_SUCCESS);

  EFI_RUNTIME_SERVICES *Saved = gRT;
  gRT = nullptr;
  Out = Console([] { EXPECT_EQ(SetOperationStatus(EFI_SUCCESS), EFI_INVALID_PARAMETER); });
  gRT = Saved;
  EXPECT_TRUE(Contains(Out, "pRT is NULL!\n")) << Out;
}

TEST_F(NWLibTest, FixedTimeAndNodeListHelpers) {
  EFI_TIME Time;
  memset(&Time, 0x7F, sizeof(Time));
  FillDefaultFileTime(0xFFFFFFFF, &Time);
  EXPECT_EQ(Time.Year, 2018);
  EXPECT_EQ(Time.Month, 1);
  EXPECT_EQ(Time.Day, 1);
  EXPECT_EQ(Time.Hour, 10);
  EXPECT_EQ(Time.Minute, 10);
  EXPECT_EQ(Time.Second, 10);
  EXPECT_EQ(Time.Nanosecond, 0u);
  EXPECT_EQ(Time.TimeZone, 0x7F7F); // left as it was
  EXPECT_EQ(Time.Daylight, 0x7F);

  SMB2_DIR_NODE *Head = nullptr;
  for (int I = 0; I < 3; I++) {
    SMB2_DIR_NODE *Node = nullptr;
    ASSERT_EQ(SMB2_CreateDirNode(&Node, 80), EFI_SUCCESS);
    ASSERT_EQ(SMB2_AddDirNode(&Head, Node), EFI_SUCCESS);
  }
  FreeDirNodeList(&Head);
  EXPECT_EQ(Head, nullptr);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

TEST_F(NWLibTest, InitialisationDropsAConnectionLeftBehind) {
  // What a connect that failed part-way leaves: its buffers, the target-info
  // copy and an open socket.
  uint32_t Sockets = NwOpenSocketCount();
  gSMB2ConnectInfo.Username = static_cast<CHAR8 *>(AllocateZeroPool(257));
  gSMB2ShareDetails.Sharename = static_cast<CHAR8 *>(AllocateZeroPool(336));
  TransactDetails.ChallResponse = static_cast<UINT8 *>(AllocateZeroPool(40));
  TransactDetails.MessageId = 9;
  gSMB2SockFd = NwSocket(NW_AF_INET, NW_SOCK_STREAM, 0);
  ASSERT_GT(gSMB2SockFd, 0);
  EXPECT_EQ(GEE_NWInit(gImageHandle, gST, NW_SHARE_TYPE_NFS), EFI_SUCCESS);
  EXPECT_EQ(gSMB2SockFd, 0);
  EXPECT_EQ(NwOpenSocketCount(), Sockets);
  EXPECT_EQ(+TransactDetails.MessageId, 0u);
  EXPECT_EQ(gSMB2ConnectInfo.Username, nullptr);
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
  EXPECT_EQ(GEE_NWDeInit(NW_SHARE_TYPE_NFS), EFI_SUCCESS);
}

} // namespace
