// The handle and protocol database of the hosted environment, with the
// open-protocol bookkeeping and the driver-model calls that depend on it.
//
// Handles are the addresses of HostHandle records and are kept in creation
// order, which is the order every lookup reports. A handle disappears with
// its last protocol, except a permanent one (the image handle), which
// survives being emptied as the image's handle does on firmware while the
// image is loaded. Protocol GUIDs are interned so that ProtocolsPerHandle can
// hand out pointers that stay valid.
#include "HostProtocolDb.h"

#include <stdarg.h>
#include <string.h>

#include <algorithm>
#include <deque>
#include <vector>

namespace HostDb {

std::vector<HostHandle *> gHandles;
std::vector<NotifyRegistration *> gRegistrations;

namespace {
std::deque<EFI_GUID> gGuids; // deque: addresses survive growth
constexpr size_t MaxDevicePathBytes = 0x10000;
} // namespace

const EFI_GUID *Intern(const EFI_GUID &Guid) {
  for (const EFI_GUID &Known : gGuids) {
    if (EfiGuidEqual(Known, Guid)) {
      return &Known;
    }
  }
  gGuids.push_back(Guid);
  return &gGuids.back();
}

HostHandle *FindHandle(EFI_HANDLE Handle) {
  if (Handle == nullptr) {
    return nullptr;
  }
  for (HostHandle *H : gHandles) {
    if (H == Handle) {
      return H;
    }
  }
  return nullptr;
}

ProtocolEntry *FindProtocol(HostHandle *H, const EFI_GUID &Guid) {
  for (ProtocolEntry &Entry : H->Protocols) {
    if (EfiGuidEqual(*Entry.Guid, Guid)) {
      return &Entry;
    }
  }
  return nullptr;
}

size_t DevicePathSize(const EFI_DEVICE_PATH_PROTOCOL *Path) {
  const UINT8 *Start = reinterpret_cast<const UINT8 *>(Path);
  size_t Offset = 0;
  while (Offset + sizeof(EFI_DEVICE_PATH_PROTOCOL) <= MaxDevicePathBytes) {
    const EFI_DEVICE_PATH_PROTOCOL *Node =
        reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(Start + Offset);
    size_t Length = Node->Length[0] | (Node->Length[1] << 8);
    if (Length < sizeof(EFI_DEVICE_PATH_PROTOCOL)) {
      return 0;
    }
    Offset += Length;
    if (Node->Type == END_DEVICE_PATH_TYPE && Node->SubType == END_ENTIRE_DEVICE_PATH_SUBTYPE) {
      return Offset;
    }
  }
  return 0;
}

} // namespace HostDb

using namespace HostDb;

namespace {

constexpr UINT32 OpenByDriverOrExclusive =
    EFI_OPEN_PROTOCOL_BY_DRIVER | EFI_OPEN_PROTOCOL_EXCLUSIVE;

void DropIfEmpty(HostHandle *H) {
  if (H->Permanent || !H->Protocols.empty()) {
    return;
  }
  gHandles.erase(std::find(gHandles.begin(), gHandles.end(), H));
  for (NotifyRegistration *R : gRegistrations) {
    R->Fresh.erase(std::remove(R->Fresh.begin(), R->Fresh.end(), H), R->Fresh.end());
  }
  delete H;
}

HostHandle *NewHandle(bool Permanent) {
  HostHandle *H = new HostHandle{};
  H->Permanent = Permanent;
  gHandles.push_back(H);
  return H;
}

// The protocol's entry on the handle, looked up afresh: every call into a
// driver may have changed the database, so no entry is kept across one.
ProtocolEntry *FindEntry(EFI_HANDLE Handle, const EFI_GUID &Guid) {
  HostHandle *H = FindHandle(Handle);
  return H == nullptr ? nullptr : FindProtocol(H, Guid);
}

bool DevicePathInstalled(const void *Interface) {
  size_t Size = DevicePathSize(static_cast<const EFI_DEVICE_PATH_PROTOCOL *>(Interface));
  for (HostHandle *H : gHandles) {
    ProtocolEntry *Entry = FindProtocol(H, gEfiDevicePathProtocolGuid);
    if (Entry == nullptr || Entry->Interface == nullptr) {
      continue;
    }
    auto *Other = static_cast<const EFI_DEVICE_PATH_PROTOCOL *>(Entry->Interface);
    if (Size != 0 && DevicePathSize(Other) == Size && memcmp(Other, Interface, Size) == 0) {
      return true;
    }
  }
  return false;
}

void NotifyInstalled(EFI_HANDLE Handle, const EFI_GUID &Guid) {
  std::vector<EFI_EVENT> Events;
  for (NotifyRegistration *R : gRegistrations) {
    if (EfiGuidEqual(*R->Guid, Guid)) {
      R->Fresh.push_back(Handle);
      Events.push_back(R->Event);
    }
  }
  for (EFI_EVENT Event : Events) {
    HostSignalEvent(Event);
  }
}

EFI_STATUS InstallOne(EFI_HANDLE *Handle, const EFI_GUID *Protocol, void *Interface) {
  if (Handle == nullptr || Protocol == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  HostHandle *H = nullptr;
  if (*Handle != nullptr) {
    H = FindHandle(*Handle);
    if (H == nullptr || FindProtocol(H, *Protocol) != nullptr) {
      return EFI_INVALID_PARAMETER;
    }
  } else {
    H = NewHandle(false);
  }
  H->Protocols.push_back(ProtocolEntry{Intern(*Protocol), Interface, {}});
  *Handle = H;
  return EFI_SUCCESS;
}

std::vector<EFI_HANDLE> DriverAgents(HostHandle *H, EFI_HANDLE OnlyAgent, UINT32 Mask) {
  std::vector<EFI_HANDLE> Agents;
  for (const ProtocolEntry &Entry : H->Protocols) {
    for (const OpenRecord &Open : Entry.Opens) {
      if ((Open.Attributes & Mask) != 0 && (OnlyAgent == nullptr || Open.Agent == OnlyAgent) &&
          std::find(Agents.begin(), Agents.end(), Open.Agent) == Agents.end()) {
        Agents.push_back(Open.Agent);
      }
    }
  }
  return Agents;
}

std::vector<EFI_HANDLE> ChildrenOf(HostHandle *H, EFI_HANDLE Agent) {
  std::vector<EFI_HANDLE> Children;
  for (const ProtocolEntry &Entry : H->Protocols) {
    for (const OpenRecord &Open : Entry.Opens) {
      if ((Open.Attributes & EFI_OPEN_PROTOCOL_BY_CHILD_CONTROLLER) != 0 && Open.Agent == Agent &&
          std::find(Children.begin(), Children.end(), Open.Controller) == Children.end()) {
        Children.push_back(Open.Controller);
      }
    }
  }
  return Children;
}

EFI_DRIVER_BINDING_PROTOCOL *BindingOn(EFI_HANDLE Handle) {
  ProtocolEntry *Entry = FindEntry(Handle, gEfiDriverBindingProtocolGuid);
  return Entry == nullptr ? nullptr : static_cast<EFI_DRIVER_BINDING_PROTOCOL *>(Entry->Interface);
}

EFI_STATUS DisconnectInternal(EFI_HANDLE Controller, EFI_HANDLE DriverImageHandle,
                              EFI_HANDLE ChildHandle) {
  HostHandle *H = FindHandle(Controller);
  if (H == nullptr || (DriverImageHandle != nullptr && FindHandle(DriverImageHandle) == nullptr) ||
      (ChildHandle != nullptr && FindHandle(ChildHandle) == nullptr)) {
    return EFI_INVALID_PARAMETER;
  }
  for (EFI_HANDLE Agent : DriverAgents(H, DriverImageHandle, EFI_OPEN_PROTOCOL_BY_DRIVER)) {
    EFI_DRIVER_BINDING_PROTOCOL *Binding = BindingOn(Agent);
    H = FindHandle(Controller); // a previous Stop may have changed the database
    if (Binding == nullptr || H == nullptr) {
      continue;
    }
    std::vector<EFI_HANDLE> Children = ChildrenOf(H, Agent);
    bool StopController = true;
    if (ChildHandle != nullptr) {
      if (std::find(Children.begin(), Children.end(), ChildHandle) == Children.end()) {
        continue;
      }
      StopController = Children.size() == 1;
      Children.assign(1, ChildHandle);
    }
    EFI_STATUS Status = EFI_SUCCESS;
    if (!Children.empty()) {
      Status = Binding->Stop(Binding, Controller, Children.size(), Children.data());
    }
    if (!EFI_ERROR(Status) && StopController) {
      Status = Binding->Stop(Binding, Controller, 0, nullptr);
    }
    if (EFI_ERROR(Status)) {
      return Status;
    }
  }
  return EFI_SUCCESS;
}

EFI_STATUS ConnectInternal(EFI_HANDLE Controller, EFI_HANDLE *DriverImageHandle,
                           EFI_DEVICE_PATH_PROTOCOL *RemainingDevicePath, BOOLEAN Recursive,
                           int Depth) {
  if (FindHandle(Controller) == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  std::vector<EFI_DRIVER_BINDING_PROTOCOL *> Bindings;
  if (DriverImageHandle != nullptr) {
    for (EFI_HANDLE *Image = DriverImageHandle; *Image != nullptr; Image++) {
      if (EFI_DRIVER_BINDING_PROTOCOL *Binding = BindingOn(*Image)) {
        Bindings.push_back(Binding);
      }
    }
  } else {
    for (HostHandle *H : gHandles) {
      if (EFI_DRIVER_BINDING_PROTOCOL *Binding = BindingOn(H)) {
        Bindings.push_back(Binding);
      }
    }
    // Highest version first, as the firmware orders drivers of equal rank.
    std::stable_sort(Bindings.begin(), Bindings.end(),
                     [](const EFI_DRIVER_BINDING_PROTOCOL *A,
                        const EFI_DRIVER_BINDING_PROTOCOL *B) { return A->Version > B->Version; });
  }
  bool Started = false;
  for (EFI_DRIVER_BINDING_PROTOCOL *Binding : Bindings) {
    if (FindHandle(Controller) == nullptr) {
      break;
    }
    if (Binding->Supported(Binding, Controller, RemainingDevicePath) == EFI_SUCCESS &&
        Binding->Start(Binding, Controller, RemainingDevicePath) == EFI_SUCCESS) {
      Started = true;
    }
  }
  HostHandle *H = FindHandle(Controller);
  if (Recursive && H != nullptr && Depth < 16) {
    std::vector<EFI_HANDLE> Children;
    for (EFI_HANDLE Agent : DriverAgents(H, nullptr, EFI_OPEN_PROTOCOL_BY_DRIVER)) {
      std::vector<EFI_HANDLE> More = ChildrenOf(H, Agent);
      Children.insert(Children.end(), More.begin(), More.end());
    }
    for (EFI_HANDLE Child : Children) {
      ConnectInternal(Child, nullptr, nullptr, Recursive, Depth + 1);
    }
  }
  return Started ? EFI_SUCCESS : EFI_NOT_FOUND;
}

// Asks the drivers that opened the protocol by driver to stop; true when
// nobody holds it by driver or exclusively afterwards.
bool ReleaseDriverOpens(EFI_HANDLE Handle, const EFI_GUID &Protocol) {
  ProtocolEntry *Entry = FindEntry(Handle, Protocol);
  if (Entry == nullptr) {
    return true;
  }
  std::vector<EFI_HANDLE> Agents;
  for (const OpenRecord &Open : Entry->Opens) {
    if ((Open.Attributes & EFI_OPEN_PROTOCOL_BY_DRIVER) != 0 &&
        std::find(Agents.begin(), Agents.end(), Open.Agent) == Agents.end()) {
      Agents.push_back(Open.Agent);
    }
  }
  for (EFI_HANDLE Agent : Agents) {
    DisconnectInternal(Handle, Agent, nullptr);
  }
  Entry = FindEntry(Handle, Protocol);
  if (Entry == nullptr) {
    return true;
  }
  for (const OpenRecord &Open : Entry->Opens) {
    if ((Open.Attributes & OpenByDriverOrExclusive) != 0) {
      return false;
    }
  }
  return true;
}

EFI_STATUS UninstallOne(EFI_HANDLE Handle, const EFI_GUID *Protocol, void *Interface) {
  HostHandle *H = FindHandle(Handle);
  if (H == nullptr || Protocol == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  ProtocolEntry *Entry = FindProtocol(H, *Protocol);
  if (Entry == nullptr || Entry->Interface != Interface) {
    return EFI_NOT_FOUND;
  }
  if (!ReleaseDriverOpens(Handle, *Protocol)) {
    ConnectInternal(Handle, nullptr, nullptr, TRUE, 0);
    return EFI_ACCESS_DENIED;
  }
  H = FindHandle(Handle);
  Entry = FindEntry(Handle, *Protocol);
  if (Entry == nullptr || Entry->Interface != Interface) {
    return EFI_NOT_FOUND; // a stopping driver removed it already
  }
  H->Protocols.erase(H->Protocols.begin() + (Entry - H->Protocols.data()));
  DropIfEmpty(H);
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// Boot services
// ---------------------------------------------------------------------------
EFI_STATUS EFIAPI BsInstallProtocolInterface(EFI_HANDLE *Handle, const EFI_GUID *Protocol,
                                             EFI_INTERFACE_TYPE InterfaceType, void *Interface) {
  HostServicePoll();
  if (InterfaceType != EFI_NATIVE_INTERFACE) {
    return EFI_INVALID_PARAMETER;
  }
  EFI_STATUS Status = InstallOne(Handle, Protocol, Interface);
  if (Status == EFI_SUCCESS) {
    NotifyInstalled(*Handle, *Protocol);
  }
  return Status;
}

EFI_STATUS EFIAPI BsUninstallProtocolInterface(EFI_HANDLE Handle, const EFI_GUID *Protocol,
                                               void *Interface) {
  HostServicePoll();
  return UninstallOne(Handle, Protocol, Interface);
}

EFI_STATUS EFIAPI BsReinstallProtocolInterface(EFI_HANDLE Handle, const EFI_GUID *Protocol,
                                               void *OldInterface, void *NewInterface) {
  HostServicePoll();
  HostHandle *H = FindHandle(Handle);
  if (H == nullptr || Protocol == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  ProtocolEntry *Entry = FindProtocol(H, *Protocol);
  if (Entry == nullptr || Entry->Interface != OldInterface) {
    return EFI_NOT_FOUND;
  }
  bool Released = ReleaseDriverOpens(Handle, *Protocol);
  Entry = FindEntry(Handle, *Protocol);
  if (Entry == nullptr || Entry->Interface != OldInterface) {
    return EFI_NOT_FOUND;
  }
  if (Released) {
    Entry->Interface = NewInterface;
    NotifyInstalled(Handle, *Protocol);
  }
  ConnectInternal(Handle, nullptr, nullptr, TRUE, 0);
  return Released ? EFI_SUCCESS : EFI_ACCESS_DENIED;
}

EFI_STATUS EFIAPI BsOpenProtocol(EFI_HANDLE Handle, const EFI_GUID *Protocol, void **Interface,
                                 EFI_HANDLE AgentHandle, EFI_HANDLE ControllerHandle,
                                 UINT32 Attributes) {
  HostServicePoll();
  if (Protocol == nullptr ||
      (Interface == nullptr && Attributes != EFI_OPEN_PROTOCOL_TEST_PROTOCOL)) {
    return EFI_INVALID_PARAMETER;
  }
  if (Interface != nullptr && Attributes != EFI_OPEN_PROTOCOL_TEST_PROTOCOL) {
    *Interface = nullptr;
  }
  HostHandle *H = FindHandle(Handle);
  if (H == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  bool AgentAndController = FindHandle(AgentHandle) != nullptr && FindHandle(ControllerHandle);
  switch (Attributes) {
  case EFI_OPEN_PROTOCOL_BY_CHILD_CONTROLLER:
    if (!AgentAndController || ControllerHandle == Handle) {
      return EFI_INVALID_PARAMETER;
    }
    break;
  case EFI_OPEN_PROTOCOL_BY_DRIVER:
  case EFI_OPEN_PROTOCOL_BY_DRIVER | EFI_OPEN_PROTOCOL_EXCLUSIVE:
    if (!AgentAndController) {
      return EFI_INVALID_PARAMETER;
    }
    break;
  case EFI_OPEN_PROTOCOL_EXCLUSIVE:
    if (FindHandle(AgentHandle) == nullptr) {
      return EFI_INVALID_PARAMETER;
    }
    break;
  case EFI_OPEN_PROTOCOL_BY_HANDLE_PROTOCOL:
  case EFI_OPEN_PROTOCOL_GET_PROTOCOL:
  case EFI_OPEN_PROTOCOL_TEST_PROTOCOL:
    break;
  default:
    return EFI_INVALID_PARAMETER;
  }
  ProtocolEntry *Entry = FindProtocol(H, *Protocol);
  if (Entry == nullptr) {
    return EFI_UNSUPPORTED;
  }
  bool ByDriver = false;
  bool Exclusive = false;
  for (const OpenRecord &Open : Entry->Opens) {
    bool Exact = Open.Agent == AgentHandle && Open.Controller == ControllerHandle &&
                 Open.Attributes == Attributes;
    if ((Open.Attributes & EFI_OPEN_PROTOCOL_BY_DRIVER) != 0) {
      ByDriver = true;
      if (Exact) {
        *Interface = Entry->Interface;
        return EFI_ALREADY_STARTED;
      }
    }
    Exclusive = Exclusive || (Open.Attributes & EFI_OPEN_PROTOCOL_EXCLUSIVE) != 0;
  }
  if ((Attributes & OpenByDriverOrExclusive) != 0) {
    if (Exclusive) {
      return EFI_ACCESS_DENIED;
    }
    if (ByDriver) {
      // Exclusive access asks the other drivers to let go; plain by-driver
      // access never takes a protocol from another driver.
      if ((Attributes & EFI_OPEN_PROTOCOL_EXCLUSIVE) == 0 ||
          !ReleaseDriverOpens(Handle, *Protocol)) {
        return EFI_ACCESS_DENIED;
      }
      Entry = FindEntry(Handle, *Protocol);
      if (Entry == nullptr) {
        return EFI_UNSUPPORTED;
      }
    }
  }
  if (Attributes == EFI_OPEN_PROTOCOL_TEST_PROTOCOL) {
    return EFI_SUCCESS;
  }
  *Interface = Entry->Interface;
  for (OpenRecord &Open : Entry->Opens) {
    if (Open.Agent == AgentHandle && Open.Controller == ControllerHandle &&
        Open.Attributes == Attributes) {
      Open.OpenCount++;
      return EFI_SUCCESS;
    }
  }
  Entry->Opens.push_back(OpenRecord{AgentHandle, ControllerHandle, Attributes, 1});
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsHandleProtocol(EFI_HANDLE Handle, const EFI_GUID *Protocol, void **Interface) {
  return BsOpenProtocol(Handle, Protocol, Interface, nullptr, nullptr,
                        EFI_OPEN_PROTOCOL_BY_HANDLE_PROTOCOL);
}

EFI_STATUS EFIAPI BsCloseProtocol(EFI_HANDLE Handle, const EFI_GUID *Protocol,
                                  EFI_HANDLE AgentHandle, EFI_HANDLE ControllerHandle) {
  HostServicePoll();
  HostHandle *H = FindHandle(Handle);
  if (H == nullptr || Protocol == nullptr || FindHandle(AgentHandle) == nullptr ||
      (ControllerHandle != nullptr && FindHandle(ControllerHandle) == nullptr)) {
    return EFI_INVALID_PARAMETER;
  }
  ProtocolEntry *Entry = FindProtocol(H, *Protocol);
  if (Entry == nullptr) {
    return EFI_NOT_FOUND;
  }
  size_t Before = Entry->Opens.size();
  Entry->Opens.erase(std::remove_if(Entry->Opens.begin(), Entry->Opens.end(),
                                    [&](const OpenRecord &Open) {
                                      return Open.Agent == AgentHandle &&
                                             Open.Controller == ControllerHandle;
                                    }),
                     Entry->Opens.end());
  return Entry->Opens.size() == Before ? EFI_NOT_FOUND : EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsOpenProtocolInformation(EFI_HANDLE Handle, const EFI_GUID *Protocol,
                                            EFI_OPEN_PROTOCOL_INFORMATION_ENTRY **EntryBuffer,
                                            UINTN *EntryCount) {
  HostServicePoll();
  HostHandle *H = FindHandle(Handle);
  if (H == nullptr || Protocol == nullptr || EntryBuffer == nullptr || EntryCount == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  ProtocolEntry *Entry = FindProtocol(H, *Protocol);
  if (Entry == nullptr) {
    return EFI_NOT_FOUND;
  }
  size_t Count = Entry->Opens.size();
  auto *Buffer = static_cast<EFI_OPEN_PROTOCOL_INFORMATION_ENTRY *>(
      HostPoolAllocate(std::max<size_t>(Count, 1) * sizeof(EFI_OPEN_PROTOCOL_INFORMATION_ENTRY)));
  if (Buffer == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  for (size_t I = 0; I < Count; I++) {
    const OpenRecord &Open = Entry->Opens[I];
    Buffer[I] = {Open.Agent, Open.Controller, Open.Attributes, Open.OpenCount};
  }
  *EntryBuffer = Buffer;
  *EntryCount = Count;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsProtocolsPerHandle(EFI_HANDLE Handle, EFI_GUID ***ProtocolBuffer,
                                       UINTN *ProtocolBufferCount) {
  HostServicePoll();
  HostHandle *H = FindHandle(Handle);
  if (H == nullptr || ProtocolBuffer == nullptr || ProtocolBufferCount == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  size_t Count = H->Protocols.size();
  auto **Buffer =
      static_cast<EFI_GUID **>(HostPoolAllocate(std::max<size_t>(Count, 1) * sizeof(EFI_GUID *)));
  if (Buffer == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  for (size_t I = 0; I < Count; I++) {
    Buffer[I] = const_cast<EFI_GUID *>(H->Protocols[I].Guid);
  }
  *ProtocolBuffer = Buffer;
  *ProtocolBufferCount = Count;
  return EFI_SUCCESS;
}

struct GuidInterfacePair {
  const EFI_GUID *Guid;
  void *Interface;
};

std::vector<GuidInterfacePair> CollectPairs(va_list Args) {
  std::vector<GuidInterfacePair> Pairs;
  for (;;) {
    const EFI_GUID *Guid = va_arg(Args, const EFI_GUID *);
    if (Guid == nullptr) {
      return Pairs;
    }
    Pairs.push_back({Guid, va_arg(Args, void *)});
  }
}

EFI_STATUS EFIAPI BsInstallMultipleProtocolInterfaces(EFI_HANDLE *Handle, ...) {
  HostServicePoll();
  if (Handle == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  va_list Args;
  va_start(Args, Handle);
  std::vector<GuidInterfacePair> Pairs = CollectPairs(Args);
  va_end(Args);
  for (const GuidInterfacePair &Pair : Pairs) {
    if (EfiGuidEqual(*Pair.Guid, gEfiDevicePathProtocolGuid) &&
        DevicePathInstalled(Pair.Interface)) {
      return EFI_ALREADY_STARTED;
    }
  }
  EFI_HANDLE Original = *Handle;
  size_t Installed = 0;
  EFI_STATUS Status = EFI_SUCCESS;
  for (; Installed < Pairs.size(); Installed++) {
    Status = InstallOne(Handle, Pairs[Installed].Guid, Pairs[Installed].Interface);
    if (EFI_ERROR(Status)) {
      break;
    }
  }
  if (EFI_ERROR(Status)) {
    // All or nothing: nobody has seen the new protocols yet, so they come
    // off again without any driver being involved.
    while (Installed-- > 0) {
      UninstallOne(*Handle, Pairs[Installed].Guid, Pairs[Installed].Interface);
    }
    *Handle = Original;
    return Status;
  }
  for (const GuidInterfacePair &Pair : Pairs) {
    NotifyInstalled(*Handle, *Pair.Guid);
  }
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsUninstallMultipleProtocolInterfaces(EFI_HANDLE Handle, ...) {
  HostServicePoll();
  va_list Args;
  va_start(Args, Handle);
  std::vector<GuidInterfacePair> Pairs = CollectPairs(Args);
  va_end(Args);
  HostHandle *H = FindHandle(Handle);
  if (H == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  // The handle must outlive a partial removal so that it can be restored.
  bool WasPermanent = H->Permanent;
  H->Permanent = true;
  size_t Removed = 0;
  for (; Removed < Pairs.size(); Removed++) {
    if (EFI_ERROR(UninstallOne(Handle, Pairs[Removed].Guid, Pairs[Removed].Interface))) {
      break;
    }
  }
  bool Failed = Removed < Pairs.size();
  if (Failed) {
    while (Removed-- > 0) {
      EFI_HANDLE Same = Handle;
      InstallOne(&Same, Pairs[Removed].Guid, Pairs[Removed].Interface);
    }
  }
  H->Permanent = WasPermanent;
  DropIfEmpty(H);
  return Failed ? EFI_INVALID_PARAMETER : EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsConnectController(EFI_HANDLE ControllerHandle, EFI_HANDLE *DriverImageHandle,
                                      EFI_DEVICE_PATH_PROTOCOL *RemainingDevicePath,
                                      BOOLEAN Recursive) {
  HostServicePoll();
  return ConnectInternal(ControllerHandle, DriverImageHandle, RemainingDevicePath, Recursive, 0);
}

EFI_STATUS EFIAPI BsDisconnectController(EFI_HANDLE ControllerHandle, EFI_HANDLE DriverImageHandle,
                                         EFI_HANDLE ChildHandle) {
  HostServicePoll();
  return DisconnectInternal(ControllerHandle, DriverImageHandle, ChildHandle);
}

} // namespace

EFI_HANDLE HostCreatePermanentHandle() {
  return NewHandle(true);
}

void HostProtocolDbReset() {
  for (HostHandle *H : gHandles) {
    delete H;
  }
  gHandles.clear();
  for (NotifyRegistration *R : gRegistrations) {
    delete R;
  }
  gRegistrations.clear();
}

void HostBootServicesFillProtocols(EFI_BOOT_SERVICES *Bs) {
  Bs->InstallProtocolInterface = BsInstallProtocolInterface;
  Bs->ReinstallProtocolInterface = BsReinstallProtocolInterface;
  Bs->UninstallProtocolInterface = BsUninstallProtocolInterface;
  Bs->HandleProtocol = BsHandleProtocol;
  Bs->ConnectController = BsConnectController;
  Bs->DisconnectController = BsDisconnectController;
  Bs->OpenProtocol = BsOpenProtocol;
  Bs->CloseProtocol = BsCloseProtocol;
  Bs->OpenProtocolInformation = BsOpenProtocolInformation;
  Bs->ProtocolsPerHandle = BsProtocolsPerHandle;
  FillLocateServices(Bs);
  Bs->InstallMultipleProtocolInterfaces = BsInstallMultipleProtocolInterfaces;
  Bs->UninstallMultipleProtocolInterfaces = BsUninstallMultipleProtocolInterfaces;
}
