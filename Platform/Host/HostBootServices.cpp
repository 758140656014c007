// Boot services of the hosted environment: the counted pool, task priority
// levels, events and timers, Stall and the small utility services.
//
// Firmware delivers timer ticks by interrupt; here they are delivered at the
// entry of every boot service (HostServicePoll), inside Stall and
// WaitForEvent, and when RestoreTPL lowers the level. Nothing ever runs from
// a signal handler, so a notification function always sees the image's code
// stopped at a boot-services call, as it would on firmware.
#include "HostCore.h"

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>

#include <algorithm>
#include <deque>
#include <unordered_map>
#include <vector>

namespace {

// ---------------------------------------------------------------------------
// Pool
// ---------------------------------------------------------------------------
std::unordered_map<void *, size_t> gPoolBlocks;
uint64_t gPoolBytes = 0;
uint64_t gPoolPeakBytes = 0;     // the most gPoolBytes has been since the last reset
uint64_t gPoolFailCountdown = 0; // 0: off; 1: the next allocation fails

std::unordered_map<void *, UINTN> gPages; // address -> page count
constexpr UINTN PageSize = 4096;

bool ValidMemoryType(EFI_MEMORY_TYPE Type) {
  // The OEM and OS ranges at the top of the type space are accepted as well.
  return Type < EfiMaxMemoryType || static_cast<uint32_t>(Type) >= 0x70000000u;
}

EFI_STATUS EFIAPI BsAllocatePool(EFI_MEMORY_TYPE PoolType, UINTN Size, void **Buffer) {
  HostServicePoll();
  if (Buffer == nullptr || !ValidMemoryType(PoolType) || PoolType == EfiConventionalMemory ||
      PoolType == EfiPersistentMemory) {
    return EFI_INVALID_PARAMETER;
  }
  *Buffer = HostPoolAllocate(Size);
  return *Buffer == nullptr ? EFI_OUT_OF_RESOURCES : EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsFreePool(void *Buffer) {
  HostServicePoll();
  auto Block = gPoolBlocks.find(Buffer);
  if (Buffer == nullptr || Block == gPoolBlocks.end()) {
    return EFI_INVALID_PARAMETER;
  }
  gPoolBytes -= Block->second;
  gPoolBlocks.erase(Block);
  free(Buffer);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsAllocatePages(EFI_ALLOCATE_TYPE Type, EFI_MEMORY_TYPE MemoryType, UINTN Pages,
                                  EFI_PHYSICAL_ADDRESS *Memory) {
  HostServicePoll();
  if (Memory == nullptr || !ValidMemoryType(MemoryType) || Type > AllocateAddress) {
    return EFI_INVALID_PARAMETER;
  }
  if (Type == AllocateAddress) {
    return EFI_NOT_FOUND; // no fixed addresses in a host process
  }
  if (Pages == 0 || Pages > (SIZE_MAX / PageSize)) {
    return EFI_OUT_OF_RESOURCES;
  }
  void *Block = aligned_alloc(PageSize, Pages * PageSize);
  if (Block == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  if (Type == AllocateMaxAddress &&
      reinterpret_cast<uintptr_t>(Block) + Pages * PageSize - 1 > *Memory) {
    free(Block);
    return EFI_NOT_FOUND;
  }
  gPages[Block] = Pages;
  *Memory = reinterpret_cast<uintptr_t>(Block);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsFreePages(EFI_PHYSICAL_ADDRESS Memory, UINTN Pages) {
  HostServicePoll();
  auto Block = gPages.find(reinterpret_cast<void *>(static_cast<uintptr_t>(Memory)));
  if (Block == gPages.end()) {
    return EFI_NOT_FOUND;
  }
  if (Block->second != Pages) {
    return EFI_INVALID_PARAMETER;
  }
  free(Block->first);
  gPages.erase(Block);
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// Clock
// ---------------------------------------------------------------------------
uint64_t NowNs() {
  timespec Ts;
  clock_gettime(CLOCK_MONOTONIC, &Ts);
  return static_cast<uint64_t>(Ts.tv_sec) * 1000000000u + static_cast<uint64_t>(Ts.tv_nsec);
}

void SleepNs(uint64_t Ns) {
  timespec Ts = {static_cast<time_t>(Ns / 1000000000u), static_cast<long>(Ns % 1000000000u)};
  while (nanosleep(&Ts, &Ts) != 0 && errno == EINTR) {
  }
}

// ---------------------------------------------------------------------------
// Events
// ---------------------------------------------------------------------------
struct HostEvent {
  UINT32 Type;
  EFI_TPL NotifyTpl;
  EFI_EVENT_NOTIFY Notify;
  void *Context;
  bool InGroup;
  EFI_GUID Group;
  uint32_t SignalCount;
  bool Queued;
  bool TimerArmed;
  uint64_t TriggerNs;
  uint64_t PeriodNs;
};

constexpr UINT32 KnownEventTypes = EVT_TIMER | EVT_RUNTIME | EVT_NOTIFY_WAIT | EVT_NOTIFY_SIGNAL;
// A periodic timer asked to fire on every tick fires at most once a
// millisecond, so that waiting on it cannot spin the host CPU.
constexpr uint64_t MinimumPeriodNs = 1000000;

std::vector<HostEvent *> gEvents; // creation order
std::deque<HostEvent *> gNotifyQueue[TPL_HIGH_LEVEL + 1];
EFI_TPL gCurrentTpl = TPL_APPLICATION;
bool gWarnedHopelessWait = false;

HostEvent *FindEvent(EFI_EVENT Event) {
  for (HostEvent *E : gEvents) {
    if (E == Event) {
      return E;
    }
  }
  return nullptr;
}

void Dequeue(HostEvent *E) {
  if (E->Queued) {
    auto &Queue = gNotifyQueue[E->NotifyTpl];
    Queue.erase(std::remove(Queue.begin(), Queue.end(), E), Queue.end());
    E->Queued = false;
  }
}

// Queues the notification function; a queued event moves to the tail.
void QueueNotify(HostEvent *E) {
  Dequeue(E);
  gNotifyQueue[E->NotifyTpl].push_back(E);
  E->Queued = true;
}

EFI_TPL HighestPendingTpl() {
  for (EFI_TPL Tpl = TPL_HIGH_LEVEL; Tpl > TPL_APPLICATION; Tpl--) {
    if (!gNotifyQueue[Tpl].empty()) {
      return Tpl;
    }
  }
  return TPL_APPLICATION;
}

// Runs the pending notifications whose level is above Level, highest first,
// each at its own level, and ends at Level.
void DispatchAbove(EFI_TPL Level) {
  for (EFI_TPL Tpl = HighestPendingTpl(); Tpl > Level; Tpl = HighestPendingTpl()) {
    gCurrentTpl = Tpl;
    HostEvent *E = gNotifyQueue[Tpl].front();
    gNotifyQueue[Tpl].pop_front();
    E->Queued = false;
    if ((E->Type & EVT_NOTIFY_SIGNAL) != 0) {
      E->SignalCount = 0;
    }
    // The notification may close this or any other event; nothing of E is
    // touched after the call.
    E->Notify(E, E->Context);
  }
  gCurrentTpl = Level;
}

void SignalOne(HostEvent *E) {
  if (E->SignalCount != 0) {
    return;
  }
  E->SignalCount = 1;
  if ((E->Type & EVT_NOTIFY_SIGNAL) != 0) {
    QueueNotify(E);
  }
}

// Signals the timers that are due (they are only queued here).
void CheckTimers() {
  uint64_t Now = NowNs();
  for (HostEvent *E : gEvents) {
    if (!E->TimerArmed || E->TriggerNs > Now) {
      continue;
    }
    if (E->PeriodNs != 0) {
      E->TriggerNs += E->PeriodNs;
      if (E->TriggerNs <= Now) {
        E->TriggerNs = Now + E->PeriodNs; // missed periods are not made up
      }
    } else {
      E->TimerArmed = false;
    }
    SignalOne(E);
  }
}

// The earliest armed timer, or UINT64_MAX.
uint64_t NextTimerNs() {
  uint64_t Next = UINT64_MAX;
  for (const HostEvent *E : gEvents) {
    if (E->TimerArmed) {
      Next = std::min(Next, E->TriggerNs);
    }
  }
  return Next;
}

EFI_STATUS EFIAPI BsCreateEventEx(UINT32 Type, EFI_TPL NotifyTpl, EFI_EVENT_NOTIFY NotifyFunction,
                                  const void *NotifyContext, const EFI_GUID *EventGroup,
                                  EFI_EVENT *Event) {
  HostServicePoll();
  if (Event == nullptr || (Type & ~KnownEventTypes) != 0) {
    return EFI_INVALID_PARAMETER;
  }
  bool NotifySignal = (Type & EVT_NOTIFY_SIGNAL) != 0;
  bool NotifyWait = (Type & EVT_NOTIFY_WAIT) != 0;
  if (NotifySignal && NotifyWait) {
    return EFI_INVALID_PARAMETER;
  }
  if (NotifySignal || NotifyWait) {
    if (NotifyFunction == nullptr || NotifyTpl <= TPL_APPLICATION || NotifyTpl >= TPL_HIGH_LEVEL) {
      return EFI_INVALID_PARAMETER;
    }
  } else {
    NotifyFunction = nullptr;
    NotifyTpl = TPL_APPLICATION;
  }
  HostEvent *E = new HostEvent{};
  E->Type = Type;
  E->NotifyTpl = NotifyTpl;
  E->Notify = NotifyFunction;
  E->Context = const_cast<void *>(NotifyContext);
  E->InGroup = EventGroup != nullptr;
  if (EventGroup != nullptr) {
    E->Group = *EventGroup;
  }
  gEvents.push_back(E);
  *Event = E;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsCreateEvent(UINT32 Type, EFI_TPL NotifyTpl, EFI_EVENT_NOTIFY NotifyFunction,
                                void *NotifyContext, EFI_EVENT *Event) {
  return BsCreateEventEx(Type, NotifyTpl, NotifyFunction, NotifyContext, nullptr, Event);
}

EFI_STATUS EFIAPI BsCloseEvent(EFI_EVENT Event) {
  HostServicePoll();
  HostEvent *E = FindEvent(Event);
  if (E == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  Dequeue(E);
  gEvents.erase(std::find(gEvents.begin(), gEvents.end(), E));
  delete E;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsSetTimer(EFI_EVENT Event, EFI_TIMER_DELAY Type, UINT64 TriggerTime) {
  HostServicePoll();
  HostEvent *E = FindEvent(Event);
  if (E == nullptr || (E->Type & EVT_TIMER) == 0 || Type > TimerRelative) {
    return EFI_INVALID_PARAMETER;
  }
  E->TimerArmed = false;
  if (Type == TimerCancel) {
    return EFI_SUCCESS;
  }
  // 100 ns units; saturate rather than wrap for absurd delays.
  uint64_t DelayNs = TriggerTime > UINT64_MAX / 200 ? UINT64_MAX / 2 : TriggerTime * 100;
  E->PeriodNs = Type == TimerPeriodic ? std::max(DelayNs, MinimumPeriodNs) : 0;
  E->TriggerNs = NowNs() + DelayNs;
  E->TimerArmed = true;
  return EFI_SUCCESS;
}

EFI_STATUS CheckEventInternal(HostEvent *E) {
  if ((E->Type & EVT_NOTIFY_SIGNAL) != 0) {
    return EFI_INVALID_PARAMETER;
  }
  if (E->SignalCount == 0 && (E->Type & EVT_NOTIFY_WAIT) != 0) {
    QueueNotify(E);
    DispatchAbove(gCurrentTpl);
  }
  if (E->SignalCount != 0) {
    E->SignalCount = 0;
    return EFI_SUCCESS;
  }
  return EFI_NOT_READY;
}

EFI_STATUS EFIAPI BsCheckEvent(EFI_EVENT Event) {
  HostServicePoll();
  HostEvent *E = FindEvent(Event);
  return E == nullptr ? EFI_INVALID_PARAMETER : CheckEventInternal(E);
}

// Whether waiting on E can end without outside help: it is signalled, it is
// an armed timer, or its wait notification may signal it.
bool CanComplete(const HostEvent *E) {
  return E->SignalCount != 0 || E->TimerArmed || (E->Type & EVT_NOTIFY_WAIT) != 0;
}

// WaitForEvent follows the firmware, with one deliberate difference. An
// event that is neither signalled, nor an armed timer, nor a wait-notify
// event can only be signalled by someone else's notification; on firmware
// waiting for it with nothing to signal it hangs the machine for good (the
// network busy lock waiting on itself would be such a case). The hosted
// environment refuses such a wait with EFI_INVALID_PARAMETER, which callers
// treat as a failed wait, so a deadlock shows up as an error instead of a hung
// test. Signalling a plain event from another timer's notification while the
// main line waits for it is therefore not supported here.
EFI_STATUS EFIAPI BsWaitForEvent(UINTN NumberOfEvents, EFI_EVENT *Events, UINTN *Index) {
  HostServicePoll();
  if (NumberOfEvents == 0 || Events == nullptr || Index == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (gCurrentTpl != TPL_APPLICATION) {
    return EFI_UNSUPPORTED;
  }
  for (;;) {
    bool Hopeful = false;
    bool Polling = false;
    for (UINTN I = 0; I < NumberOfEvents; I++) {
      HostEvent *E = FindEvent(Events[I]);
      EFI_STATUS Status = E == nullptr ? EFI_INVALID_PARAMETER : CheckEventInternal(E);
      if (Status != EFI_NOT_READY) {
        *Index = I;
        return Status;
      }
      E = FindEvent(Events[I]); // its wait notification may have closed it
      Hopeful = Hopeful || (E != nullptr && CanComplete(E));
      Polling = Polling || (E != nullptr && (E->Type & EVT_NOTIFY_WAIT) != 0);
    }
    if (!Hopeful) {
      if (!gWarnedHopelessWait) {
        gWarnedHopelessWait = true;
        fprintf(stderr, "host: WaitForEvent on events that nothing can signal; refused\n");
      }
      *Index = 0;
      return EFI_INVALID_PARAMETER;
    }
    uint64_t Now = NowNs();
    uint64_t Next = NextTimerNs();
    uint64_t Sleep = Next > Now ? Next - Now : 0;
    if (Polling) {
      Sleep = std::min<uint64_t>(Sleep, MinimumPeriodNs);
    }
    SleepNs(Sleep);
    HostServicePoll();
  }
}

EFI_STATUS EFIAPI BsStall(UINTN Microseconds) {
  HostServicePoll();
  uint64_t Deadline = NowNs() + std::min<uint64_t>(Microseconds, UINT64_MAX / 4000) * 1000;
  for (uint64_t Now = NowNs(); Now < Deadline; Now = NowNs()) {
    uint64_t Wake = gCurrentTpl < TPL_HIGH_LEVEL ? std::min(Deadline, NextTimerNs()) : Deadline;
    SleepNs(Wake > Now ? Wake - Now : 0);
    HostServicePoll();
  }
  return EFI_SUCCESS;
}

EFI_TPL EFIAPI BsRaiseTpl(EFI_TPL NewTpl) {
  EFI_TPL Old = gCurrentTpl;
  // Lowering through RaiseTPL is a caller bug on firmware; it is ignored.
  if (NewTpl > Old) {
    gCurrentTpl = std::min<EFI_TPL>(NewTpl, TPL_HIGH_LEVEL);
  }
  return Old;
}

void EFIAPI BsRestoreTpl(EFI_TPL OldTpl) {
  if (OldTpl > gCurrentTpl) {
    return; // raising through RestoreTPL: ignored like above
  }
  if (OldTpl < TPL_HIGH_LEVEL) {
    CheckTimers();
  }
  DispatchAbove(OldTpl);
}

// ---------------------------------------------------------------------------
// Miscellaneous services
// ---------------------------------------------------------------------------
uint64_t gMonotonicCount = 0;

EFI_STATUS EFIAPI BsGetNextMonotonicCount(UINT64 *Count) {
  HostServicePoll();
  if (Count == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  *Count = gMonotonicCount++;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsSetWatchdogTimer(UINTN, UINT64, UINTN, CHAR16 *) {
  HostServicePoll();
  return EFI_SUCCESS;
}

void EFIAPI BsCopyMem(void *Destination, const void *Source, UINTN Length) {
  if (Length != 0) {
    memmove(Destination, Source, Length);
  }
}

void EFIAPI BsSetMem(void *Buffer, UINTN Size, UINT8 Value) {
  if (Size != 0) {
    memset(Buffer, Value, Size);
  }
}

EFI_STATUS EFIAPI BsGetMemoryMap(UINTN *, void *, UINTN *, UINTN *, UINT32 *) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI BsLoadImage(BOOLEAN, EFI_HANDLE, EFI_DEVICE_PATH_PROTOCOL *, void *, UINTN,
                              EFI_HANDLE *) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI BsStartImage(EFI_HANDLE, UINTN *, CHAR16 **) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI BsExit(EFI_HANDLE, EFI_STATUS, UINTN, CHAR16 *) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI BsUnloadImage(EFI_HANDLE) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI BsExitBootServices(EFI_HANDLE, UINTN) {
  return EFI_UNSUPPORTED;
}

} // namespace

// ---------------------------------------------------------------------------
// Shared with the other pieces of the environment
// ---------------------------------------------------------------------------
void *HostPoolAllocate(size_t Size) {
  if (gPoolFailCountdown != 0 && --gPoolFailCountdown == 0) {
    return nullptr;
  }
  void *Block = malloc(Size == 0 ? 1 : Size);
  if (Block != nullptr) {
    gPoolBlocks[Block] = Size;
    gPoolBytes += Size;
    if (gPoolBytes > gPoolPeakBytes) {
      gPoolPeakBytes = gPoolBytes;
    }
  }
  return Block;
}

void HostServicePoll() {
  if (gCurrentTpl < TPL_HIGH_LEVEL) {
    CheckTimers();
    DispatchAbove(gCurrentTpl);
  }
}

void HostDispatchTimers() {
  HostServicePoll();
}

EFI_STATUS EFIAPI HostSignalEvent(EFI_EVENT Event) {
  HostServicePoll();
  HostEvent *E = FindEvent(Event);
  if (E == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (E->InGroup) {
    // Signalling one member of a group signals the whole group.
    for (HostEvent *Member : gEvents) {
      if (Member->InGroup && EfiGuidEqual(Member->Group, E->Group)) {
        SignalOne(Member);
      }
    }
  } else {
    SignalOne(E);
  }
  DispatchAbove(gCurrentTpl);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI HostCalculateCrc32(void *Data, UINTN DataSize, UINT32 *Crc32) {
  if (Data == nullptr || DataSize == 0 || Crc32 == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  uint32_t Crc = 0xFFFFFFFFu;
  const uint8_t *Bytes = static_cast<const uint8_t *>(Data);
  for (UINTN I = 0; I < DataSize; I++) {
    Crc ^= Bytes[I];
    for (int Bit = 0; Bit < 8; Bit++) {
      Crc = (Crc >> 1) ^ (0xEDB88320u & (0u - (Crc & 1u)));
    }
  }
  *Crc32 = ~Crc;
  return EFI_SUCCESS;
}

void HostBootServicesFillCore(EFI_BOOT_SERVICES *Bs) {
  Bs->RaiseTPL = BsRaiseTpl;
  Bs->RestoreTPL = BsRestoreTpl;
  Bs->AllocatePages = BsAllocatePages;
  Bs->FreePages = BsFreePages;
  Bs->GetMemoryMap = BsGetMemoryMap;
  Bs->AllocatePool = BsAllocatePool;
  Bs->FreePool = BsFreePool;
  Bs->CreateEvent = BsCreateEvent;
  Bs->SetTimer = BsSetTimer;
  Bs->WaitForEvent = BsWaitForEvent;
  Bs->SignalEvent = HostSignalEvent;
  Bs->CloseEvent = BsCloseEvent;
  Bs->CheckEvent = BsCheckEvent;
  Bs->LoadImage = BsLoadImage;
  Bs->StartImage = BsStartImage;
  Bs->Exit = BsExit;
  Bs->UnloadImage = BsUnloadImage;
  Bs->ExitBootServices = BsExitBootServices;
  Bs->GetNextMonotonicCount = BsGetNextMonotonicCount;
  Bs->Stall = BsStall;
  Bs->SetWatchdogTimer = BsSetWatchdogTimer;
  Bs->CalculateCrc32 = HostCalculateCrc32;
  Bs->CopyMem = BsCopyMem;
  Bs->SetMem = BsSetMem;
  Bs->CreateEventEx = BsCreateEventEx;
}

void HostEventsReset() {
  for (auto &Queue : gNotifyQueue) {
    Queue.clear();
  }
  for (HostEvent *E : gEvents) {
    delete E;
  }
  gEvents.clear();
  gCurrentTpl = TPL_APPLICATION;
  gWarnedHopelessWait = false;
}

uint64_t HostPoolOutstanding() {
  return gPoolBlocks.size();
}

uint64_t HostPoolOutstandingBytes() {
  return gPoolBytes;
}

uint64_t HostPoolPeakBytes() {
  return gPoolPeakBytes;
}

void HostPoolResetPeak() {
  gPoolPeakBytes = gPoolBytes;
}

void HostPoolFailAfter(uint64_t Allocations) {
  gPoolFailCountdown = Allocations == UINT64_MAX ? 0 : Allocations + 1;
}
