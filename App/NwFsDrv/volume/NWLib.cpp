// The network library: every GEE_NW... operation forwards to the SMB2
// file-system adapter and, for most of them, records its status in the
// volatile provisioning variable. Also the network busy lock, the login
// splitter, the fixed file time and the directory-node list helpers.
#include "volume/NWLib.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "ProvisioningVars.h"
#include "smb2/SMB2FsAdapter.h"

NETWORK_BUSY_LOCK NetworkBusyLock;

namespace {

// Records the status of an operation; the recording's own result is
// deliberately not passed on.
EFI_STATUS Recorded(EFI_STATUS Status) {
  SetOperationStatus(Status);
  return Status;
}

void CopyPart(CHAR8 *Destination, const CHAR8 *Source, UINTN Length) {
  for (UINTN I = 0; I < Length; I++) {
    Destination[I] = Source[I];
  }
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
  Record.Status = Status;
  Size = sizeof(Record);
  DiagLog(DIAG_VERBOSE, "Operation returned. %d\n", static_cast<INT32>(Status));
  return gRT->SetVariable(PROVISIONING_VOLATILE_VAR_NAME, &gProvisioningEnvGuid,
                          PROVISIONING_VOLATILE_ATTRIBUTES, Size, &Record);
}

// ---------------------------------------------------------------------------
// Operations
// ---------------------------------------------------------------------------
EFI_STATUS GEE_NWInit(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable, UINT64 ShareType) {
  (void)ImageHandle;
  (void)SystemTable;
  (void)ShareType; // every share type reaches the SMB2 adapter
  // The initialised flag is the mount code's, set there on success.
  if (EFI_ERROR(SMB2_FSResetState())) {
    return EFI_DEVICE_ERROR;
  }
  return EFI_SUCCESS;
}

EFI_STATUS GEE_NWDeInit(UINT64 ShareType) {
  (void)ShareType;
  return SMB2_FSResetState();
}

EFI_STATUS GEE_NWFSConnect(NW_CONNECTION_PARAMS *Params, NW_SHARE_INFO *Share) {
  EFI_STATUS Status = SMB2_FSConnect(Params, Share);
  DiagShortExit(Status, '.', DiagChannel::Driver, "GEE_NWFSConnect");
  return Status;
}

EFI_STATUS GEE_NWFSDisconnect(NW_SHARE_INFO *Share, const void *Unused) {
  (void)Share;
  (void)Unused;
  return SMB2_FSDisconnect();
}

EFI_STATUS GEE_NWFOpen(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, UINT64 OpenMode,
                       UINT64 Attributes) {
  return Recorded(SMB2_FOpen(Share, File, OpenMode, Attributes));
}

EFI_STATUS GEE_NWFRead(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, void *Buffer, UINTN *Length,
                       UINT64 *Offset, UINTN *ReadCount) {
  if (Length == nullptr || Offset == nullptr || ReadCount == nullptr) {
    return Recorded(EFI_INVALID_PARAMETER);
  }
  UINTN Count = *Length;
  EFI_STATUS Status = SMB2_FRead(Share, File, Buffer, &Count, *Offset);
  *ReadCount = Count;
  return Recorded(Status);
}

EFI_STATUS GEE_NWFWrite(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, const void *Buffer,
                        UINTN *Length, UINT64 Offset) {
  return Recorded(SMB2_FWrite(Share, File, Buffer, Length, Offset));
}

EFI_STATUS GEE_NWFClose(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File) {
  return SMB2_FClose(Share, File);
}

EFI_STATUS GEE_NWGetFSInfo(NW_SHARE_INFO *Share, EFI_FILE_SYSTEM_INFO *Info) {
  return Recorded(SMB2_GetFSInfo(Share, Info));
}

EFI_STATUS GEE_NWFindFirst(NW_SHARE_INFO *Share, const CHAR16 *Pattern, EFI_FILE_INFO **Entry) {
  return SMB2_FindFirst(Share, Pattern, Entry);
}

EFI_STATUS GEE_NWFindNext(NW_SHARE_INFO *Share, EFI_FILE_INFO **Entry) {
  (void)Share;
  return Recorded(SMB2_FindNext(Entry));
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
  return Recorded(SMB2_GetFileStat(Share, Path, Stat));
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

// ---------------------------------------------------------------------------
// Login names
// ---------------------------------------------------------------------------
EFI_STATUS SearchUserAndDomainSeparator(const CHAR8 *Input, CHAR8 Separator, UINTN UserSize,
                                        CHAR8 *User, UINTN DomainSize, CHAR8 *Domain) {
  if (Input == nullptr || User == nullptr || Domain == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const CHAR8 *Found = AsciiStrChr(Input, Separator);
  DiagLog(DIAG_VERBOSE, "Ptr to find FindAtSign in Input = %s\n", Found);
  if (Found == nullptr) {
    DiagLog(DIAG_VERBOSE, "Ptr is NULL\n");
    UINTN Length = AsciiStrLen(Input);
    if (UserSize > Length) {
      CopyPart(User, Input, Length + 1);
      ZeroMem(Domain, DomainSize);
    }
    return EFI_NOT_FOUND;
  }
  UINTN Index = static_cast<UINTN>(Found - Input);
  DiagLog(DIAG_VERBOSE, "Index = %d\n", static_cast<INT32>(Index));
  const CHAR8 *After = Found + 1;
  UINTN AfterLength = AsciiStrLen(After);
  // With '@' the user comes first, with '\' the domain does.
  bool UserFirst = Separator != '\\';
  CHAR8 *BeforeTarget = UserFirst ? User : Domain;
  CHAR8 *AfterTarget = UserFirst ? Domain : User;
  UINTN BeforeRoom = UserFirst ? UserSize : DomainSize;
  UINTN AfterRoom = UserFirst ? DomainSize : UserSize;
  ZeroMem(User, UserSize);
  ZeroMem(Domain, DomainSize);
  // The size tests are tied to the position, deliberately: the part before
  // the separator is measured against the user size and the part after it
  // against the domain size, whichever buffer receives it. Neither part is
  // terminated here (the buffers were cleared). A part is also never copied
  // past the buffer it lands in.
  if (Index <= UserSize && Index <= BeforeRoom) {
    CopyPart(BeforeTarget, Input, Index);
  }
  if (DomainSize > AfterLength && AfterLength <= AfterRoom) {
    CopyPart(AfterTarget, After, AfterLength);
  }
  DiagLog(DIAG_VERBOSE, "Domainname = %s\n", Domain);
  return EFI_SUCCESS;
}

EFI_STATUS SplitUserAndDomain(const CHAR8 *Input, UINTN UserSize, CHAR8 *User, UINTN DomainSize,
                              CHAR8 *Domain) {
  if (Input == nullptr || User == nullptr || Domain == nullptr) {
    DiagLog(DIAG_ALWAYS, "Input is NULL!\n");
    return EFI_INVALID_PARAMETER;
  }
  EFI_STATUS Status = SearchUserAndDomainSeparator(Input, '@', UserSize, User, DomainSize, Domain);
  if (!EFI_ERROR(Status)) {
    return Status;
  }
  if (gDriverDebugLevel != 0) {
    DiagLog(DIAG_ALWAYS, "SearchUserAndDomainSeparator returned error 0x%x for %c\n",
            static_cast<UINT32>(Status), '@');
  }
  Status = SearchUserAndDomainSeparator(Input, '\\', UserSize, User, DomainSize, Domain);
  if (EFI_ERROR(Status) && gDriverDebugLevel != 0) {
    DiagLog(DIAG_ALWAYS, "SearchUserAndDomainSeparator returned error 0x%x for %c\n",
            static_cast<UINT32>(Status), '\\');
  }
  return Status;
}

// ---------------------------------------------------------------------------
// Helpers of the adapter
// ---------------------------------------------------------------------------
void FillDefaultFileTime(UINT32 Ignored, EFI_TIME *Time) {
  (void)Ignored;
  if (Time == nullptr) {
    return;
  }
  Time->Year = 2018;
  Time->Month = 1;
  Time->Day = 1;
  Time->Hour = 10;
  Time->Minute = 10;
  Time->Second = 10;
  Time->Nanosecond = 0;
}

void FreeDirNodeList(SMB2_DIR_NODE **Head) {
  if (Head == nullptr) {
    return;
  }
  SMB2_DIR_NODE *Node = *Head;
  while (Node != nullptr) {
    SMB2_DIR_NODE *Next = Node->Next;
    FreePool(Node);
    Node = Next;
  }
  *Head = nullptr;
}

EFI_STATUS DumpDirNodeList(const SMB2_DIR_NODE *Head) {
  if (Head == nullptr) {
    DiagLog(DIAG_ALWAYS, "NewNode is NULL!\n");
    return EFI_INVALID_PARAMETER;
  }
  // The last node is deliberately not printed.
  for (const SMB2_DIR_NODE *Node = Head; Node->Next != nullptr; Node = Node->Next) {
    DiagLog(DIAG_VERBOSE, "File Size = %ld, Filename = %ls\n", static_cast<INT64>(Node->EndOfFile),
            reinterpret_cast<const CHAR16 *>(Node->FileName));
  }
  return EFI_SUCCESS;
}
