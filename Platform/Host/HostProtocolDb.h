// The records of the handle database, shared by the database itself
// (HostProtocolDb.cpp) and its lookup services (HostLocate.cpp).
#pragma once

#include "HostCore.h"

#include <deque>
#include <vector>

namespace HostDb {

struct OpenRecord {
  EFI_HANDLE Agent;
  EFI_HANDLE Controller;
  UINT32 Attributes;
  UINT32 OpenCount;
};

struct ProtocolEntry {
  const EFI_GUID *Guid; // interned
  void *Interface;
  std::vector<OpenRecord> Opens;
};

struct HostHandle {
  bool Permanent;
  std::vector<ProtocolEntry> Protocols;
};

struct NotifyRegistration {
  const EFI_GUID *Guid;
  EFI_EVENT Event;
  std::deque<EFI_HANDLE> Fresh; // handles installed since the last lookup
};

extern std::vector<HostHandle *> gHandles; // creation order
extern std::vector<NotifyRegistration *> gRegistrations;

// The one stored copy of a GUID; its address stays valid.
const EFI_GUID *Intern(const EFI_GUID &Guid);
HostHandle *FindHandle(EFI_HANDLE Handle);
ProtocolEntry *FindProtocol(HostHandle *H, const EFI_GUID &Guid);
// Bytes of a device path including its end node; 0 when malformed.
size_t DevicePathSize(const EFI_DEVICE_PATH_PROTOCOL *Path);

// The lookup slots: LocateHandle, LocateHandleBuffer, LocateProtocol,
// LocateDevicePath and RegisterProtocolNotify.
void FillLocateServices(EFI_BOOT_SERVICES *Bs);

} // namespace HostDb
