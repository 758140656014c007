// The network library: every GEE_NW... operation forwards to the back end
// through its table and, for most of them, records its status in the
// volatile provisioning variable. Also the network busy lock.
#include "volume/NWLib.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "ProvisioningVars.h"

NETWORK_BUSY_LOCK NetworkBusyLock;
const NW_BACKEND *gNwBackend = &gSMB2FsBackend;

namespace {

// Records the status of an operation; the recording's own result is
// deliberately not passed on.
EFI_STATUS Recorded(EFI_STATUS Status) {
  SetOperationStatus(Status);
  return Status;
}

} // namespace

// ---------------------------------------------------------------------------
// Status record
// ---------------------------------------------------------------------------
EFI_STATUS SetOperationStatus(EFI_STATUS Status) {
  DiagEntry(DiagChannel::Driver, "SetOperationStatus");
  DiagGuid(DIAG_VERBOSE, nullptr, gProvisioningEnvGuid);
  if (gRT == nullptr) {
    DiagLog(DIAG_ALWAYS, "pRT is NULL!\n");
    return EFI_INVALID_PARAMETER;
  }
  NW_OPERATION_STATUS_RECORD Record;
  ZeroMem(&Record, sizeof(Record));
  UINTN Size = sizeof(Record);
  UINT32 Attributes = 0;
  EFI_STATUS Read = gRT->GetVariable(PROVISIONING_VOLATILE_VAR_NAME, &gProvisioningEnvGuid,
                                     &Attributes, &Size, &Record);
  if (EFI_ERROR(Read) || Size == 0) {
    DiagError("GetVariable failed!", Read);
  }
  DiagLog(DIAG_VERBOSE, "Operation returned. %d\n", static_cast<INT32>(Status));
  // A record that already holds this status is left as it is: the variable
  // reads the same, and a transfer does not rewrite it for every request.
  if (!EFI_ERROR(Read) && Size == sizeof(Record) && Record.Status == Status) {
    return EFI_SUCCESS;
  }
  Record.Status = Status;
  Size = sizeof(Record);
  return gRT->SetVariable(PROVISIONING_VOLATILE_VAR_NAME, &gProvisioningEnvGuid,
                          PROVISIONING_VOLATILE_ATTRIBUTES, Size, &Record);
}

// ---------------------------------------------------------------------------
// Operations
// ---------------------------------------------------------------------------
EFI_STATUS GEE_NWInit(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable, UINT64 ShareType) {
  (void)ImageHandle;
  (void)SystemTable;
  (void)ShareType; // every share type reaches the one back end
  // The initialised flag is the mount code's, set there on success.
  if (EFI_ERROR(gNwBackend->Reset())) {
    return EFI_DEVICE_ERROR;
  }
  return EFI_SUCCESS;
}

EFI_STATUS GEE_NWDeInit(UINT64 ShareType) {
  (void)ShareType;
  return gNwBackend->Reset();
}

EFI_STATUS GEE_NWFSConnect(NW_CONNECTION_PARAMS *Params, NW_SHARE_INFO *Share) {
  EFI_STATUS Status = gNwBackend->Connect(Params, Share);
  DiagShortExit(Status, '.', DiagChannel::Driver, "GEE_NWFSConnect");
  return Status;
}

EFI_STATUS GEE_NWFSDisconnect(NW_SHARE_INFO *Share, const void *Unused) {
  (void)Share;
  (void)Unused;
  return gNwBackend->Disconnect();
}

EFI_STATUS GEE_NWFOpen(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, UINT64 OpenMode,
                       UINT64 Attributes) {
  return Recorded(gNwBackend->Open(Share, File, OpenMode, Attributes));
}

EFI_STATUS GEE_NWFRead(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, void *Buffer, UINTN *Length,
                       UINT64 *Offset, UINTN *ReadCount) {
  if (Length == nullptr || Offset == nullptr || ReadCount == nullptr) {
    return Recorded(EFI_INVALID_PARAMETER);
  }
  UINTN Count = *Length;
  EFI_STATUS Status = gNwBackend->Read(Share, File, Buffer, &Count, *Offset);
  *ReadCount = Count;
  return Recorded(Status);
}

EFI_STATUS GEE_NWFWrite(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, const void *Buffer,
                        UINTN *Length, UINT64 Offset) {
  return Recorded(gNwBackend->Write(Share, File, Buffer, Length, Offset));
}

EFI_STATUS GEE_NWFClose(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File) {
  return gNwBackend->Close(Share, File);
}

EFI_STATUS GEE_NWGetFSInfo(NW_SHARE_INFO *Share, EFI_FILE_SYSTEM_INFO *Info) {
  return Recorded(gNwBackend->GetFSInfo(Share, Info));
}

EFI_STATUS GEE_NWFindFirst(NW_SHARE_INFO *Share, const CHAR16 *Pattern, EFI_FILE_INFO **Entry) {
  return gNwBackend->FindFirst(Share, Pattern, Entry);
}

EFI_STATUS GEE_NWFindNext(NW_SHARE_INFO *Share, EFI_FILE_INFO **Entry) {
  (void)Share;
  return Recorded(gNwBackend->FindNext(Entry));
}

// The operations below are acknowledged locally and send nothing to the
// server; their callers rely on the success.
EFI_STATUS GEE_NWFindClose(NW_SHARE_INFO *Share, EFI_FILE_INFO *Entry) {
  (void)Share;
  (void)Entry;
  return Recorded(EFI_SUCCESS);
}

EFI_STATUS GEE_NWMkdir(NW_SHARE_INFO *Share, const CHAR16 *Path) {
  (void)Share;
  (void)Path;
  return Recorded(EFI_SUCCESS);
}

EFI_STATUS GEE_NWRemove(NW_SHARE_INFO *Share, const CHAR16 *Path) {
  (void)Share;
  (void)Path;
  return Recorded(EFI_SUCCESS);
}

EFI_STATUS GEE_NWGetFileStat(NW_SHARE_INFO *Share, const CHAR16 *Path, EFI_FILE_INFO *Stat) {
  return Recorded(gNwBackend->GetFileStat(Share, Path, Stat));
}

EFI_STATUS GEE_NWFSetSize(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, UINT32 Size) {
  (void)Share;
  (void)File;
  (void)Size;
  return Recorded(EFI_SUCCESS);
}

EFI_STATUS GEE_NWFCommit(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, UINT32 Flags) {
  (void)Share;
  (void)File;
  (void)Flags;
  return Recorded(EFI_SUCCESS);
}

// ---------------------------------------------------------------------------
// Network busy lock
// ---------------------------------------------------------------------------
BOOLEAN AcquireNetworkBusyLock(UINT8 *Busy, EFI_EVENT *Event, BOOLEAN Wait) {
  if (Busy == nullptr || Event == nullptr) {
    return FALSE;
  }
  if (*Busy != 0) {
    if (!Wait) {
      return FALSE;
    }
    UINTN Index = 0;
    if (EFI_ERROR(gBS->WaitForEvent(1, Event, &Index))) {
      return FALSE;
    }
  }
  if (*Busy == 0) {
    EFI_EVENT Created = nullptr;
    if (EFI_ERROR(gBS->CreateEvent(EVT_TIMER, TPL_CALLBACK, nullptr, nullptr, &Created))) {
      return FALSE;
    }
    *Event = Created;
    *Busy = 1;
  }
  return *Busy != 0 ? TRUE : FALSE;
}

BOOLEAN ReleaseNetworkBusyLock(UINT8 *Busy, EFI_EVENT *Event) {
  if (Busy == nullptr || Event == nullptr) {
    return FALSE;
  }
  if (*Busy != 0) {
    gBS->SignalEvent(*Event);
    gBS->CloseEvent(*Event);
    *Event = nullptr;
    *Busy = 0;
  }
  return *Busy != 0 ? TRUE : FALSE;
}
