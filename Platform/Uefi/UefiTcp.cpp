// One TCP connection over the firmware's EFI_TCP4_PROTOCOL or
// EFI_TCP6_PROTOCOL, reached through the family's service binding.
//
// Written against the firmware's own protocol headers; nothing here may
// include the image's Uefi.h (the two declare the same types), so the socket
// facade reaches this file only through UefiTcp.h.
//
// Every asynchronous call gets a completion token whose event has no notify
// function; the wait polls it. Each round calls the protocol's Poll (which
// moves received frames up the stack at once), checks the token and checks
// the time limit (a timer event, so the limit is real time whatever the speed
// of the processor), with no pause between rounds: a frame is taken up as
// soon as the network card has it, which is what bounds the speed of one
// request at a time. A pause buys nothing: Stall itself spins on a hardware
// timer, and measured steps of 5 us to 10 ms were all as slow or slower.
// A token that is already complete is taken without arming the timer.
//
// Data passes through buffers owned by the connection, never through the
// caller's: a receive still posted when its wait runs out keeps filling the
// connection's own buffer, and the next read takes the bytes from there, so
// a time-out loses nothing and leaves no firmware pointer into freed memory.
// A receive is posted again as soon as the buffer has been handed out, so
// that one is always waiting for data while the image does other work.
#include <efi.h>
#include <stddef.h>

#include "NwPlatform.h"
#include "UefiTcp.h"

namespace {

constexpr uint64_t kTimerUnitsPerMs = 10000; // timer periods are in 100 ns units
// How long an interface may take to get its station address (DHCP, or IPv6
// address configuration) before the connect gives up.
constexpr uint32_t kMappingWaitMs = 15000;
constexpr uint64_t kMappingRetryUs = 100000;
// A graceful close waits this long for the firmware to finish it, then the
// instance is reset, which aborts the connection.
constexpr uint32_t kCloseWaitMs = 1000;
constexpr uint32_t kRxBufferSize = 65536;
constexpr uint32_t kTxBufferSize = 65536;
constexpr uint32_t kMaxInterfaces = 8;
constexpr uint32_t kEmptyReceiveLimit = 4;
constexpr UINT8 kHopLimit = 64;

EFI_GUID gTcp4ServiceBindingGuid = EFI_TCP4_SERVICE_BINDING_PROTOCOL;
EFI_GUID gTcp4ProtocolGuid = EFI_TCP4_PROTOCOL;
EFI_GUID gTcp6ServiceBindingGuid = EFI_TCP6_SERVICE_BINDING_PROTOCOL;
EFI_GUID gTcp6ProtocolGuid = EFI_TCP6_PROTOCOL;

// The two families' tokens and data records are the same records under two
// names; the connection keeps the TCP4 ones and hands them to either family.
static_assert(sizeof(EFI_TCP4_IO_TOKEN) == sizeof(EFI_TCP6_IO_TOKEN), "IO token");
static_assert(offsetof(EFI_TCP4_IO_TOKEN, Packet) == offsetof(EFI_TCP6_IO_TOKEN, Packet),
              "IO token packet");
static_assert(sizeof(EFI_TCP4_CONNECTION_TOKEN) == sizeof(EFI_TCP6_CONNECTION_TOKEN),
              "connection token");
static_assert(sizeof(EFI_TCP4_CLOSE_TOKEN) == sizeof(EFI_TCP6_CLOSE_TOKEN), "close token");
static_assert(offsetof(EFI_TCP4_CLOSE_TOKEN, AbortOnClose) ==
                  offsetof(EFI_TCP6_CLOSE_TOKEN, AbortOnClose),
              "close token abort flag");
static_assert(sizeof(EFI_TCP4_RECEIVE_DATA) == sizeof(EFI_TCP6_RECEIVE_DATA), "receive data");
static_assert(offsetof(EFI_TCP4_RECEIVE_DATA, FragmentTable) ==
                  offsetof(EFI_TCP6_RECEIVE_DATA, FragmentTable),
              "receive fragments");
static_assert(sizeof(EFI_TCP4_TRANSMIT_DATA) == sizeof(EFI_TCP6_TRANSMIT_DATA), "transmit data");
static_assert(offsetof(EFI_TCP4_TRANSMIT_DATA, FragmentTable) ==
                  offsetof(EFI_TCP6_TRANSMIT_DATA, FragmentTable),
              "transmit fragments");

// A TCP child on one network interface.
struct TcpLink {
  EFI_SERVICE_BINDING *Binding;
  EFI_HANDLE Child;
  void *Tcp; // EFI_TCP4 or EFI_TCP6, after the connection's family
};

struct StatusErrno {
  EFI_STATUS Status;
  int32_t Errno;
};

// Firmware completion statuses as BSD errors.
constexpr StatusErrno kStatusErrnos[] = {
    {EFI_CONNECTION_RESET, NwErrno::ECONNRESET_},
    {EFI_CONNECTION_REFUSED, NwErrno::ECONNREFUSED_},
    {EFI_CONNECTION_FIN, NwErrno::EPIPE_},
    {EFI_TIMEOUT, NwErrno::ETIMEDOUT_},
    {EFI_ABORTED, NwErrno::ECONNABORTED_},
    {EFI_NETWORK_UNREACHABLE, NwErrno::ENETUNREACH_},
    {EFI_HOST_UNREACHABLE, NwErrno::EHOSTUNREACH_},
    {EFI_PROTOCOL_UNREACHABLE, NwErrno::ECONNREFUSED_},
    {EFI_PORT_UNREACHABLE, NwErrno::ECONNREFUSED_},
    {EFI_ICMP_ERROR, NwErrno::EHOSTUNREACH_},
    {EFI_NO_MAPPING, NwErrno::ENETDOWN_},
    {EFI_NO_MEDIA, NwErrno::ENETDOWN_},
    {EFI_NOT_STARTED, NwErrno::ENOTCONN_},
    {EFI_ACCESS_DENIED, NwErrno::EPIPE_},
    {EFI_OUT_OF_RESOURCES, NwErrno::ENOMEM_},
    {EFI_INVALID_PARAMETER, NwErrno::EINVAL_},
    {EFI_UNSUPPORTED, NwErrno::EAFNOSUPPORT_},
};

int32_t ErrnoOf(EFI_STATUS Status) {
  for (const StatusErrno &Entry : kStatusErrnos) {
    if (Entry.Status == Status) {
      return Entry.Errno;
    }
  }
  return NwErrno::EIO_;
}

// A reset in answer to the connection request is a closed port: the firmware
// reports it as a connection reset, the socket interface as a refusal.
int32_t ErrnoOfConnect(EFI_STATUS Status) {
  return Status == EFI_CONNECTION_RESET ? NwErrno::ECONNREFUSED_ : ErrnoOf(Status);
}

// A receive or transmit refused outright on a connection this side has not
// closed means the stack has already torn the connection down; it reports
// the reason (nearly always the peer's reset) only to a token that was
// waiting at the time. Once the peer had closed its side too, the connection
// simply ended.
int32_t ErrnoOfRefusedIo(EFI_STATUS Status, bool PeerClosed) {
  if (Status == EFI_ACCESS_DENIED) {
    return PeerClosed ? NwErrno::EPIPE_ : NwErrno::ECONNRESET_;
  }
  return ErrnoOf(Status);
}

} // namespace

struct UefiTcpConnection {
  EFI_BOOT_SERVICES *Bs;
  int32_t Family;
  TcpLink Link; // Child is null until the connect has bound an interface
  EFI_EVENT Timer;
  int32_t Failure; // once set, the connection is unusable and reports it
  bool Connected;
  bool PeerClosed;
  bool ConnectPending;
  bool RxPending;
  bool TxPending;
  EFI_TCP4_CONNECTION_TOKEN ConnectToken;
  EFI_TCP4_CLOSE_TOKEN CloseToken;
  EFI_TCP4_IO_TOKEN RxToken;
  EFI_TCP4_RECEIVE_DATA RxData;
  EFI_TCP4_IO_TOKEN TxToken;
  EFI_TCP4_TRANSMIT_DATA TxData;
  uint8_t *RxBuffer;
  uint32_t RxStart; // bytes RxStart..RxEnd of RxBuffer are received, not yet read
  uint32_t RxEnd;
  uint8_t *TxBuffer;
};

namespace {

bool IsInet4(int32_t Family) {
  return Family == NW_AF_INET;
}

EFI_GUID *ServiceBindingGuid(int32_t Family) {
  return IsInet4(Family) ? &gTcp4ServiceBindingGuid : &gTcp6ServiceBindingGuid;
}

EFI_GUID *ProtocolGuid(int32_t Family) {
  return IsInet4(Family) ? &gTcp4ProtocolGuid : &gTcp6ProtocolGuid;
}

int32_t Fail(UefiTcpConnection *C, int32_t Errno) {
  if (C->Failure == 0) {
    C->Failure = Errno;
  }
  return Errno;
}

// --- The protocol calls, for either family ---------------------------------

EFI_STATUS TcpPoll(const UefiTcpConnection *C) {
  if (IsInet4(C->Family)) {
    EFI_TCP4 *Tcp = static_cast<EFI_TCP4 *>(C->Link.Tcp);
    return Tcp->Poll(Tcp);
  }
  EFI_TCP6 *Tcp = static_cast<EFI_TCP6 *>(C->Link.Tcp);
  return Tcp->Poll(Tcp);
}

EFI_STATUS TcpConnect(UefiTcpConnection *C) {
  if (IsInet4(C->Family)) {
    EFI_TCP4 *Tcp = static_cast<EFI_TCP4 *>(C->Link.Tcp);
    return Tcp->Connect(Tcp, &C->ConnectToken);
  }
  EFI_TCP6 *Tcp = static_cast<EFI_TCP6 *>(C->Link.Tcp);
  return Tcp->Connect(Tcp, reinterpret_cast<EFI_TCP6_CONNECTION_TOKEN *>(&C->ConnectToken));
}

EFI_STATUS TcpTransmit(UefiTcpConnection *C) {
  if (IsInet4(C->Family)) {
    EFI_TCP4 *Tcp = static_cast<EFI_TCP4 *>(C->Link.Tcp);
    return Tcp->Transmit(Tcp, &C->TxToken);
  }
  EFI_TCP6 *Tcp = static_cast<EFI_TCP6 *>(C->Link.Tcp);
  return Tcp->Transmit(Tcp, reinterpret_cast<EFI_TCP6_IO_TOKEN *>(&C->TxToken));
}

EFI_STATUS TcpReceive(UefiTcpConnection *C) {
  if (IsInet4(C->Family)) {
    EFI_TCP4 *Tcp = static_cast<EFI_TCP4 *>(C->Link.Tcp);
    return Tcp->Receive(Tcp, &C->RxToken);
  }
  EFI_TCP6 *Tcp = static_cast<EFI_TCP6 *>(C->Link.Tcp);
  return Tcp->Receive(Tcp, reinterpret_cast<EFI_TCP6_IO_TOKEN *>(&C->RxToken));
}

EFI_STATUS TcpClose(UefiTcpConnection *C) {
  if (IsInet4(C->Family)) {
    EFI_TCP4 *Tcp = static_cast<EFI_TCP4 *>(C->Link.Tcp);
    return Tcp->Close(Tcp, &C->CloseToken);
  }
  EFI_TCP6 *Tcp = static_cast<EFI_TCP6 *>(C->Link.Tcp);
  return Tcp->Close(Tcp, reinterpret_cast<EFI_TCP6_CLOSE_TOKEN *>(&C->CloseToken));
}

// The connection's TCP options. Zero sizes, retries and time limits keep the
// firmware's defaults, with two deliberate exceptions: no Nagle delay (every
// request goes out whole at once, as the SMB2 exchange wants) and no
// TIME_WAIT after a close, so that an orderly close completes as soon as the
// peer's FIN arrives instead of holding the socket for the firmware's
// TIME_WAIT period.
void FillOptions(EFI_TCP4_OPTION *Option) {
  *Option = EFI_TCP4_OPTION{};
  Option->TimeWaitTimeout = 0;
  Option->EnableNagle = FALSE;
  Option->EnableTimeStamp = TRUE;
  Option->EnableWindowScaling = TRUE;
}

// The two families' option records are the same record.
static_assert(sizeof(EFI_TCP4_OPTION) == sizeof(EFI_TCP6_OPTION), "TCP options");

// An active open towards Address:Port from the interface's default station
// address and an ephemeral port; a null Address resets the instance, which
// also aborts its connection and completes its tokens.
EFI_STATUS TcpConfigure(int32_t Family, void *Protocol, const uint8_t *Address, uint16_t Port) {
  EFI_TCP4_OPTION Option;
  FillOptions(&Option);
  if (IsInet4(Family)) {
    EFI_TCP4 *Tcp = static_cast<EFI_TCP4 *>(Protocol);
    if (Address == nullptr) {
      return Tcp->Configure(Tcp, nullptr);
    }
    EFI_TCP4_CONFIG_DATA Config = {};
    Config.TimeToLive = kHopLimit;
    Config.AccessPoint.UseDefaultAddress = TRUE;
    for (uint32_t I = 0; I < 4; I++) {
      Config.AccessPoint.RemoteAddress.Addr[I] = Address[I];
    }
    Config.AccessPoint.RemotePort = Port;
    Config.AccessPoint.ActiveFlag = TRUE;
    Config.ControlOption = &Option;
    return Tcp->Configure(Tcp, &Config);
  }
  EFI_TCP6 *Tcp = static_cast<EFI_TCP6 *>(Protocol);
  if (Address == nullptr) {
    return Tcp->Configure(Tcp, nullptr);
  }
  // An all-zero station address lets the firmware choose the source address.
  EFI_TCP6_CONFIG_DATA Config = {};
  Config.HopLimit = kHopLimit;
  for (uint32_t I = 0; I < 16; I++) {
    Config.AccessPoint.RemoteAddress.Addr[I] = Address[I];
  }
  Config.AccessPoint.RemotePort = Port;
  Config.AccessPoint.ActiveFlag = TRUE;
  Config.ControlOption = reinterpret_cast<EFI_TCP6_OPTION *>(&Option);
  return Tcp->Configure(Tcp, &Config);
}

// --- Waiting ------------------------------------------------------------------

// Arms the connection's timer to fire once, WaitMs from now; a signal left
// over from an earlier wait is cleared first.
void StartTimer(UefiTcpConnection *C, uint32_t WaitMs) {
  C->Bs->SetTimer(C->Timer, TimerCancel, 0);
  C->Bs->CheckEvent(C->Timer);
  C->Bs->SetTimer(C->Timer, TimerRelative, WaitMs * kTimerUnitsPerMs);
}

// True when Event was signalled within WaitMs.
bool WaitFor(UefiTcpConnection *C, EFI_EVENT Event, uint32_t WaitMs) {
  TcpPoll(C);
  if (C->Bs->CheckEvent(Event) == EFI_SUCCESS) {
    return true;
  }
  StartTimer(C, WaitMs);
  for (;;) {
    TcpPoll(C);
    if (C->Bs->CheckEvent(Event) == EFI_SUCCESS) {
      return true;
    }
    if (C->Bs->CheckEvent(C->Timer) == EFI_SUCCESS) {
      return false;
    }
  }
}

// --- Interface selection ------------------------------------------------------

void ReleaseLink(TcpLink *Link) {
  if (Link->Child != nullptr) {
    Link->Binding->DestroyChild(Link->Binding, Link->Child);
  }
  Link->Child = nullptr;
  Link->Tcp = nullptr;
}

// A TCP child on the interface behind ServiceHandle.
bool CreateLink(EFI_BOOT_SERVICES *Bs, int32_t Family, EFI_HANDLE ServiceHandle, TcpLink *Link) {
  Link->Binding = nullptr;
  Link->Child = nullptr;
  Link->Tcp = nullptr;
  void *Binding = nullptr;
  if (EFI_ERROR(Bs->HandleProtocol(ServiceHandle, ServiceBindingGuid(Family), &Binding)) ||
      Binding == nullptr) {
    return false;
  }
  Link->Binding = static_cast<EFI_SERVICE_BINDING *>(Binding);
  if (EFI_ERROR(Link->Binding->CreateChild(Link->Binding, &Link->Child))) {
    Link->Child = nullptr;
    return false;
  }
  if (EFI_ERROR(Bs->HandleProtocol(Link->Child, ProtocolGuid(Family), &Link->Tcp)) ||
      Link->Tcp == nullptr) {
    ReleaseLink(Link);
    return false;
  }
  return true;
}

// The handles that carry the family's TCP service binding, for the caller
// to free; null when there is none.
EFI_HANDLE *LocateServices(EFI_BOOT_SERVICES *Bs, int32_t Family, UINTN *Count) {
  EFI_HANDLE *Handles = nullptr;
  *Count = 0;
  if (EFI_ERROR(Bs->LocateHandleBuffer(ByProtocol, ServiceBindingGuid(Family), nullptr, Count,
                                       &Handles))) {
    return nullptr;
  }
  if (*Count == 0 && Handles != nullptr) {
    Bs->FreePool(Handles);
    return nullptr;
  }
  return Handles;
}

// TCP children on every interface of the family (at most kMaxInterfaces).
uint32_t CreateLinks(EFI_BOOT_SERVICES *Bs, int32_t Family, TcpLink *Links) {
  UINTN Count = 0;
  EFI_HANDLE *Handles = LocateServices(Bs, Family, &Count);
  if (Handles == nullptr) {
    return 0;
  }
  uint32_t Created = 0;
  for (UINTN I = 0; I < Count && Created < kMaxInterfaces; I++) {
    if (CreateLink(Bs, Family, Handles[I], &Links[Created])) {
      Created++;
    }
  }
  Bs->FreePool(Handles);
  return Created;
}

// Binds the connection to the first interface that accepts the configuration.
// An interface without its address yet (EFI_NO_MAPPING) is asked again until
// kMappingWaitMs has passed; one that refuses otherwise is dropped.
int32_t BindInterface(UefiTcpConnection *C, const uint8_t *Address, uint16_t Port) {
  TcpLink Links[kMaxInterfaces];
  uint32_t Count = CreateLinks(C->Bs, C->Family, Links);
  if (Count == 0) {
    return NwErrno::ENETDOWN_;
  }
  EFI_STATUS LastError = EFI_NO_MAPPING;
  int32_t Chosen = -1;
  StartTimer(C, kMappingWaitMs);
  for (;;) {
    bool Waiting = false;
    for (uint32_t I = 0; I < Count && Chosen < 0; I++) {
      if (Links[I].Child == nullptr) {
        continue;
      }
      EFI_STATUS Status = TcpConfigure(C->Family, Links[I].Tcp, Address, Port);
      if (Status == EFI_SUCCESS) {
        Chosen = static_cast<int32_t>(I);
      } else if (Status == EFI_NO_MAPPING) {
        Waiting = true;
      } else {
        LastError = Status;
        ReleaseLink(&Links[I]);
      }
    }
    if (Chosen >= 0 || !Waiting || C->Bs->CheckEvent(C->Timer) == EFI_SUCCESS) {
      break;
    }
    C->Bs->Stall(kMappingRetryUs);
  }
  for (uint32_t I = 0; I < Count; I++) {
    if (static_cast<int32_t>(I) == Chosen) {
      C->Link = Links[I];
    } else {
      ReleaseLink(&Links[I]);
    }
  }
  return Chosen >= 0 ? 0 : ErrnoOf(LastError);
}

// --- Record -----------------------------------------------------------------

void *Allocate(EFI_BOOT_SERVICES *Bs, UINTN Size) {
  void *Buffer = nullptr;
  if (EFI_ERROR(Bs->AllocatePool(EfiBootServicesData, Size, &Buffer))) {
    return nullptr;
  }
  Bs->SetMem(Buffer, Size, 0);
  return Buffer;
}

bool CreateEvents(UefiTcpConnection *C) {
  EFI_EVENT *Events[] = {&C->ConnectToken.CompletionToken.Event,
                         &C->CloseToken.CompletionToken.Event, &C->RxToken.CompletionToken.Event,
                         &C->TxToken.CompletionToken.Event};
  if (EFI_ERROR(C->Bs->CreateEvent(EVT_TIMER, 0, nullptr, nullptr, &C->Timer))) {
    C->Timer = nullptr;
    return false;
  }
  for (EFI_EVENT *Event : Events) {
    if (EFI_ERROR(C->Bs->CreateEvent(0, 0, nullptr, nullptr, Event))) {
      *Event = nullptr;
      return false;
    }
  }
  return true;
}

void FreeRecord(UefiTcpConnection *C) {
  EFI_EVENT Events[] = {C->Timer, C->ConnectToken.CompletionToken.Event,
                        C->CloseToken.CompletionToken.Event, C->RxToken.CompletionToken.Event,
                        C->TxToken.CompletionToken.Event};
  for (EFI_EVENT Event : Events) {
    if (Event != nullptr) {
      C->Bs->CloseEvent(Event);
    }
  }
  if (C->RxBuffer != nullptr) {
    C->Bs->FreePool(C->RxBuffer);
  }
  if (C->TxBuffer != nullptr) {
    C->Bs->FreePool(C->TxBuffer);
  }
  C->Bs->FreePool(C);
}

// Ends the connection and gives the child back. False when the firmware
// would not destroy the child: it may then still complete our tokens, so the
// record must stay allocated.
bool Unbind(UefiTcpConnection *C) {
  if (C->Link.Child == nullptr) {
    return true;
  }
  if (C->Connected || C->ConnectPending) {
    // A connection that failed, or with a token still out, is reset rather
    // than closed in order.
    C->CloseToken.AbortOnClose = C->Failure != 0 || C->ConnectPending || C->TxPending;
    if (!EFI_ERROR(TcpClose(C))) {
      WaitFor(C, C->CloseToken.CompletionToken.Event, kCloseWaitMs);
    }
  }
  TcpConfigure(C->Family, C->Link.Tcp, nullptr, 0);
  if (EFI_ERROR(C->Link.Binding->DestroyChild(C->Link.Binding, C->Link.Child))) {
    return false;
  }
  C->Link.Child = nullptr;
  return true;
}

// Hands out buffered bytes, up to Length.
uint64_t TakeBuffered(UefiTcpConnection *C, uint8_t *Buffer, uint64_t Length) {
  uint64_t Available = C->RxEnd - C->RxStart;
  uint64_t Count = Length < Available ? Length : Available;
  C->Bs->CopyMem(Buffer, C->RxBuffer + C->RxStart, Count);
  C->RxStart += static_cast<uint32_t>(Count);
  return Count;
}

// Posts a receive into the connection's buffer. A peer that has already
// closed its side ends the posting with PeerClosed set.
int32_t PostReceive(UefiTcpConnection *C) {
  C->RxData.UrgentFlag = FALSE;
  C->RxData.DataLength = kRxBufferSize;
  C->RxData.FragmentCount = 1;
  C->RxData.FragmentTable[0].FragmentLength = kRxBufferSize;
  C->RxData.FragmentTable[0].FragmentBuffer = C->RxBuffer;
  C->RxToken.Packet.RxData = &C->RxData;
  C->RxToken.CompletionToken.Status = EFI_NOT_READY;
  EFI_STATUS Status = TcpReceive(C);
  if (Status == EFI_CONNECTION_FIN) {
    C->PeerClosed = true;
    return 0;
  }
  if (EFI_ERROR(Status)) {
    return Fail(C, ErrnoOfRefusedIo(Status, C->PeerClosed));
  }
  C->RxPending = true;
  return 0;
}

// Hands out buffered bytes, up to Length; once the buffer is empty, the next
// receive is posted at once. Its failure, if any, is recorded on the
// connection and reported by the next call, after these bytes.
uint64_t HandOut(UefiTcpConnection *C, uint8_t *Buffer, uint64_t Length) {
  const uint64_t Count = TakeBuffered(C, Buffer, Length);
  if (C->RxStart == C->RxEnd && C->Failure == 0 && C->Connected && !C->PeerClosed &&
      !C->RxPending) {
    PostReceive(C);
  }
  return Count;
}

} // namespace

int32_t UefiTcpCreate(void *BootServices, int32_t Family, UefiTcpConnection **Connection) {
  if (BootServices == nullptr || Connection == nullptr) {
    return NwErrno::EINVAL_;
  }
  if (Family != NW_AF_INET && Family != NW_AF_INET6) {
    return NwErrno::EAFNOSUPPORT_;
  }
  EFI_BOOT_SERVICES *Bs = static_cast<EFI_BOOT_SERVICES *>(BootServices);
  UINTN Count = 0;
  EFI_HANDLE *Handles = LocateServices(Bs, Family, &Count);
  if (Handles == nullptr) {
    return NwErrno::ENETDOWN_;
  }
  Bs->FreePool(Handles);
  UefiTcpConnection *C = static_cast<UefiTcpConnection *>(Allocate(Bs, sizeof(UefiTcpConnection)));
  if (C == nullptr) {
    return NwErrno::ENOMEM_;
  }
  C->Bs = Bs;
  C->Family = Family;
  C->RxBuffer = static_cast<uint8_t *>(Allocate(Bs, kRxBufferSize));
  C->TxBuffer = static_cast<uint8_t *>(Allocate(Bs, kTxBufferSize));
  if (C->RxBuffer == nullptr || C->TxBuffer == nullptr || !CreateEvents(C)) {
    FreeRecord(C);
    return NwErrno::ENOMEM_;
  }
  *Connection = C;
  return 0;
}

int32_t UefiTcpConnect(UefiTcpConnection *C, const uint8_t *Address, uint16_t Port,
                       uint32_t WaitMs) {
  if (C == nullptr || Address == nullptr) {
    return NwErrno::EINVAL_;
  }
  if (C->Failure != 0) {
    return C->Failure;
  }
  if (C->Link.Child != nullptr) {
    return NwErrno::EINVAL_; // already connected, or a connect is under way
  }
  int32_t Error = BindInterface(C, Address, Port);
  if (Error != 0) {
    return Error; // nothing bound: the socket may try again
  }
  C->ConnectToken.CompletionToken.Status = EFI_NOT_READY;
  EFI_STATUS Status = TcpConnect(C);
  if (EFI_ERROR(Status)) {
    return Fail(C, ErrnoOfConnect(Status));
  }
  C->ConnectPending = true;
  if (!WaitFor(C, C->ConnectToken.CompletionToken.Event, WaitMs)) {
    return Fail(C, NwErrno::ETIMEDOUT_);
  }
  C->ConnectPending = false;
  Status = C->ConnectToken.CompletionToken.Status;
  if (EFI_ERROR(Status)) {
    return Fail(C, ErrnoOfConnect(Status));
  }
  C->Connected = true;
  return 0;
}

int32_t UefiTcpSend(UefiTcpConnection *C, const uint8_t *Data, uint64_t Length, uint32_t WaitMs) {
  if (C == nullptr || (Data == nullptr && Length != 0)) {
    return NwErrno::EINVAL_;
  }
  if (C->Failure != 0) {
    return C->Failure;
  }
  if (!C->Connected) {
    return NwErrno::ENOTCONN_;
  }
  uint64_t Done = 0;
  while (Done < Length) {
    const uint32_t Chunk =
        Length - Done < kTxBufferSize ? static_cast<uint32_t>(Length - Done) : kTxBufferSize;
    C->Bs->CopyMem(C->TxBuffer, const_cast<uint8_t *>(Data + Done), Chunk);
    C->TxData.Push = TRUE;
    C->TxData.Urgent = FALSE;
    C->TxData.DataLength = Chunk;
    C->TxData.FragmentCount = 1;
    C->TxData.FragmentTable[0].FragmentLength = Chunk;
    C->TxData.FragmentTable[0].FragmentBuffer = C->TxBuffer;
    C->TxToken.Packet.TxData = &C->TxData;
    C->TxToken.CompletionToken.Status = EFI_NOT_READY;
    EFI_STATUS Status = TcpTransmit(C);
    if (EFI_ERROR(Status)) {
      return Fail(C, ErrnoOfRefusedIo(Status, C->PeerClosed));
    }
    C->TxPending = true;
    // A transmit that does not complete still owns the send buffer, so the
    // connection cannot send again: the time-out is final.
    if (!WaitFor(C, C->TxToken.CompletionToken.Event, WaitMs)) {
      return Fail(C, NwErrno::ETIMEDOUT_);
    }
    C->TxPending = false;
    if (EFI_ERROR(C->TxToken.CompletionToken.Status)) {
      return Fail(C, ErrnoOf(C->TxToken.CompletionToken.Status));
    }
    Done += Chunk;
  }
  return 0;
}

int32_t UefiTcpReceive(UefiTcpConnection *C, uint8_t *Buffer, uint64_t Length, uint32_t WaitMs,
                       uint64_t *Received) {
  if (C == nullptr || Received == nullptr || (Buffer == nullptr && Length != 0)) {
    return NwErrno::EINVAL_;
  }
  *Received = 0;
  if (Length == 0) {
    return 0;
  }
  // Bytes already here are handed out before any error or end of stream.
  if (C->RxStart < C->RxEnd) {
    *Received = HandOut(C, Buffer, Length);
    return 0;
  }
  if (C->Failure != 0) {
    return C->Failure;
  }
  if (!C->Connected) {
    return NwErrno::ENOTCONN_;
  }
  if (C->PeerClosed) {
    return 0;
  }
  // A completion that stored nothing (which the firmware should never give)
  // is posted again rather than mistaken for the end of the stream.
  for (uint32_t Attempt = 0; Attempt < kEmptyReceiveLimit; Attempt++) {
    if (!C->RxPending) {
      int32_t Error = PostReceive(C);
      if (Error != 0 || C->PeerClosed) {
        return Error;
      }
    }
    if (!WaitFor(C, C->RxToken.CompletionToken.Event, WaitMs)) {
      return NwErrno::ETIMEDOUT_; // the receive stays posted for the next read
    }
    C->RxPending = false;
    EFI_STATUS Status = C->RxToken.CompletionToken.Status;
    if (Status == EFI_CONNECTION_FIN) {
      C->PeerClosed = true;
      return 0;
    }
    if (EFI_ERROR(Status)) {
      return Fail(C, ErrnoOf(Status));
    }
    // The firmware reports how much it stored; never believe more than the
    // buffer holds.
    const uint32_t Stored = C->RxData.DataLength;
    C->RxStart = 0;
    C->RxEnd = Stored < kRxBufferSize ? Stored : kRxBufferSize;
    if (C->RxEnd > 0) {
      *Received = HandOut(C, Buffer, Length);
      return 0;
    }
  }
  return NwErrno::EIO_;
}

void UefiTcpDestroy(UefiTcpConnection *C) {
  if (C == nullptr) {
    return;
  }
  // Deliberately leaked when the firmware keeps the child: its tokens and
  // buffers may still be written.
  if (Unbind(C)) {
    FreeRecord(C);
  }
}
