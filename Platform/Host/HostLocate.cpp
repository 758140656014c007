// The lookup services of the handle database: handles by protocol, by
// registration or all of them (always in creation order), the first
// interface of a protocol, the handle owning the longest prefix of a device
// path, and protocol-install notifications.
#include "HostProtocolDb.h"

#include <string.h>

#include <algorithm>

using namespace HostDb;

namespace {

NotifyRegistration *FindRegistration(const void *Key) {
  for (NotifyRegistration *R : gRegistrations) {
    if (R == Key) {
      return R;
    }
  }
  return nullptr;
}

EFI_STATUS EFIAPI BsRegisterProtocolNotify(const EFI_GUID *Protocol, EFI_EVENT Event,
                                           void **Registration) {
  HostServicePoll();
  if (Protocol == nullptr || Event == nullptr || Registration == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  gRegistrations.push_back(new NotifyRegistration{Intern(*Protocol), Event, {}});
  *Registration = gRegistrations.back();
  return EFI_SUCCESS;
}

// The handles a search selects, in creation order. A registration search
// yields one handle installed since the previous search, without consuming it.
EFI_STATUS SelectHandles(EFI_LOCATE_SEARCH_TYPE SearchType, const EFI_GUID *Protocol,
                         void *SearchKey, std::vector<EFI_HANDLE> &Result) {
  switch (SearchType) {
  case AllHandles:
    for (HostHandle *H : gHandles) {
      if (!H->Protocols.empty()) {
        Result.push_back(H);
      }
    }
    return EFI_SUCCESS;
  case ByProtocol:
    if (Protocol == nullptr) {
      return EFI_INVALID_PARAMETER;
    }
    for (HostHandle *H : gHandles) {
      if (FindProtocol(H, *Protocol) != nullptr) {
        Result.push_back(H);
      }
    }
    return EFI_SUCCESS;
  case ByRegisterNotify: {
    NotifyRegistration *R = FindRegistration(SearchKey);
    if (R == nullptr) {
      return EFI_INVALID_PARAMETER;
    }
    if (!R->Fresh.empty()) {
      Result.push_back(R->Fresh.front());
    }
    return EFI_SUCCESS;
  }
  }
  return EFI_INVALID_PARAMETER;
}

void ConsumeFresh(EFI_LOCATE_SEARCH_TYPE SearchType, void *SearchKey) {
  if (SearchType == ByRegisterNotify) {
    FindRegistration(SearchKey)->Fresh.pop_front();
  }
}

EFI_STATUS EFIAPI BsLocateHandle(EFI_LOCATE_SEARCH_TYPE SearchType, const EFI_GUID *Protocol,
                                 void *SearchKey, UINTN *BufferSize, EFI_HANDLE *Buffer) {
  HostServicePoll();
  if (BufferSize == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  std::vector<EFI_HANDLE> Found;
  EFI_STATUS Status = SelectHandles(SearchType, Protocol, SearchKey, Found);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  UINTN Needed = Found.size() * sizeof(EFI_HANDLE);
  if (Found.empty()) {
    *BufferSize = 0;
    return EFI_NOT_FOUND;
  }
  if (*BufferSize < Needed) {
    *BufferSize = Needed;
    return EFI_BUFFER_TOO_SMALL;
  }
  if (Buffer == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  std::copy(Found.begin(), Found.end(), Buffer);
  *BufferSize = Needed;
  ConsumeFresh(SearchType, SearchKey);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsLocateHandleBuffer(EFI_LOCATE_SEARCH_TYPE SearchType, const EFI_GUID *Protocol,
                                       void *SearchKey, UINTN *NoHandles, EFI_HANDLE **Buffer) {
  HostServicePoll();
  if (NoHandles == nullptr || Buffer == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  *NoHandles = 0;
  *Buffer = nullptr;
  std::vector<EFI_HANDLE> Found;
  EFI_STATUS Status = SelectHandles(SearchType, Protocol, SearchKey, Found);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  if (Found.empty()) {
    return EFI_NOT_FOUND;
  }
  auto *Handles = static_cast<EFI_HANDLE *>(HostPoolAllocate(Found.size() * sizeof(EFI_HANDLE)));
  if (Handles == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  std::copy(Found.begin(), Found.end(), Handles);
  *Buffer = Handles;
  *NoHandles = Found.size();
  ConsumeFresh(SearchType, SearchKey);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI BsLocateProtocol(const EFI_GUID *Protocol, void *Registration, void **Interface) {
  HostServicePoll();
  if (Interface == nullptr || Protocol == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  *Interface = nullptr;
  if (Registration != nullptr) {
    NotifyRegistration *R = FindRegistration(Registration);
    while (R != nullptr && !R->Fresh.empty()) {
      HostHandle *H = static_cast<HostHandle *>(R->Fresh.front());
      R->Fresh.pop_front();
      if (ProtocolEntry *Entry = FindProtocol(H, *Protocol)) {
        *Interface = Entry->Interface;
        return EFI_SUCCESS;
      }
    }
    return EFI_NOT_FOUND;
  }
  for (HostHandle *H : gHandles) {
    if (ProtocolEntry *Entry = FindProtocol(H, *Protocol)) {
      *Interface = Entry->Interface;
      return EFI_SUCCESS;
    }
  }
  return EFI_NOT_FOUND;
}

// The longest device path among the handles carrying Protocol that is a
// prefix of *DevicePath; *DevicePath moves past it.
EFI_STATUS EFIAPI BsLocateDevicePath(const EFI_GUID *Protocol,
                                     EFI_DEVICE_PATH_PROTOCOL **DevicePath, EFI_HANDLE *Device) {
  HostServicePoll();
  if (Protocol == nullptr || DevicePath == nullptr || *DevicePath == nullptr || Device == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  size_t SourceSize = DevicePathSize(*DevicePath);
  if (SourceSize == 0) {
    return EFI_INVALID_PARAMETER;
  }
  SourceSize -= sizeof(EFI_DEVICE_PATH_PROTOCOL); // without the end node
  HostHandle *Best = nullptr;
  size_t BestSize = 0;
  for (HostHandle *H : gHandles) {
    ProtocolEntry *Path = FindProtocol(H, gEfiDevicePathProtocolGuid);
    if (Path == nullptr || Path->Interface == nullptr || FindProtocol(H, *Protocol) == nullptr) {
      continue;
    }
    size_t Size = DevicePathSize(static_cast<EFI_DEVICE_PATH_PROTOCOL *>(Path->Interface));
    if (Size == 0) {
      continue;
    }
    Size -= sizeof(EFI_DEVICE_PATH_PROTOCOL);
    if (Size <= SourceSize && (Best == nullptr || Size > BestSize) &&
        memcmp(Path->Interface, *DevicePath, Size) == 0) {
      Best = H;
      BestSize = Size;
    }
  }
  if (Best == nullptr) {
    return EFI_NOT_FOUND;
  }
  *Device = Best;
  *DevicePath = reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(
      reinterpret_cast<UINT8 *>(*DevicePath) + BestSize);
  return EFI_SUCCESS;
}

} // namespace

void HostDb::FillLocateServices(EFI_BOOT_SERVICES *Bs) {
  Bs->RegisterProtocolNotify = BsRegisterProtocolNotify;
  Bs->LocateHandle = BsLocateHandle;
  Bs->LocateHandleBuffer = BsLocateHandleBuffer;
  Bs->LocateProtocol = BsLocateProtocol;
  Bs->LocateDevicePath = BsLocateDevicePath;
}
