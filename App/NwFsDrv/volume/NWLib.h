// The network library: the GEE_NW... operations through which the volume
// and the mount code reach the share, the status record in
// "PROVISIONING_ENV_VOLATILE_VAR" and the network busy lock. The records the operations exchange
// (share record, connection parameters, remote file record) are the back end's (NwBackend.h).
//
// Every operation forwards to one back end through its table, whatever the
// share type: CIFS (1) and NFS (2) both reach the SMB2 file-system adapter;
// there is deliberately no second back end. Directory creation, removal, the
// end of a listing, size changes and commits are acknowledged locally and
// send nothing.
#pragma once

#include "NwBackend.h"
#include "Uefi.h"

#pragma pack(push, 1)
// The outcome record in "PROVISIONING_ENV_VOLATILE_VAR": the status of the
// last recorded network operation, then 32 bytes that are kept as read.
struct NW_OPERATION_STATUS_RECORD {
  UINT64 Status;
  UINT8 Preserved[32];
};

#pragma pack(pop)

// The network busy lock: a flag and the event a waiter sleeps on. Not
// packed: its fields are handed out by address.
struct NETWORK_BUSY_LOCK {
  UINT8 Busy; // 0 free, 1 held
  EFI_EVENT Event;
};

static_assert(sizeof(NW_OPERATION_STATUS_RECORD) == 40, "status record is 40 bytes");
static_assert(offsetof(NETWORK_BUSY_LOCK, Event) == 8, "busy lock: flag, then event");

extern NETWORK_BUSY_LOCK NetworkBusyLock;
// The back end every operation forwards to: the SMB2 file-system adapter's
// table (a test may put a scripted one in its place).
extern const NW_BACKEND *gNwBackend;

// ---------------------------------------------------------------------------
// Operations (in calling order: init, connect, file operations, disconnect,
// de-init). Those marked "recorded" write their status into the status
// record; the recording never changes the status returned.
// ---------------------------------------------------------------------------
// Clears the adapter's connection state; sets the layer's initialised flag.
EFI_STATUS GEE_NWInit(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable, UINT64 ShareType);
EFI_STATUS GEE_NWDeInit(UINT64 ShareType);
EFI_STATUS GEE_NWFSConnect(NW_CONNECTION_PARAMS *Params, NW_SHARE_INFO *Share);
// The second argument is not used.
EFI_STATUS GEE_NWFSDisconnect(NW_SHARE_INFO *Share, const void *Unused);
// Recorded. Attributes carries 0x8 when the caller asked to create.
EFI_STATUS GEE_NWFOpen(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, UINT64 OpenMode,
                       UINT64 Attributes);
// Recorded. Reads *Length bytes at *Offset; *ReadCount receives the bytes
// read (also when a request fails part-way).
EFI_STATUS GEE_NWFRead(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, void *Buffer, UINTN *Length,
                       UINT64 *Offset, UINTN *ReadCount);
// Recorded. *Length: in, bytes to write; out, bytes written.
EFI_STATUS GEE_NWFWrite(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, const void *Buffer,
                        UINTN *Length, UINT64 Offset);
EFI_STATUS GEE_NWFClose(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File);
// Recorded.
EFI_STATUS GEE_NWGetFSInfo(NW_SHARE_INFO *Share, EFI_FILE_SYSTEM_INFO *Info);
// Lists the directory named by Share->FilePath. *Entry receives a pool
// EFI_FILE_INFO (at least 88 bytes) that the caller owns and frees.
EFI_STATUS GEE_NWFindFirst(NW_SHARE_INFO *Share, const CHAR16 *Pattern, EFI_FILE_INFO **Entry);
// Recorded. *Entry receives the next entry (the caller's previous one is
// left to the caller); EFI_NOT_FOUND past the end, which also releases the
// listing.
EFI_STATUS GEE_NWFindNext(NW_SHARE_INFO *Share, EFI_FILE_INFO **Entry);
// Recorded; local only.
EFI_STATUS GEE_NWFindClose(NW_SHARE_INFO *Share, EFI_FILE_INFO *Entry);
EFI_STATUS GEE_NWMkdir(NW_SHARE_INFO *Share, const CHAR16 *Path);
EFI_STATUS GEE_NWRemove(NW_SHARE_INFO *Share, const CHAR16 *Path);
// Recorded. Fills attributes, sizes and times of Path into *Stat (the name
// is not touched).
EFI_STATUS GEE_NWGetFileStat(NW_SHARE_INFO *Share, const CHAR16 *Path, EFI_FILE_INFO *Stat);
// Recorded; local only.
EFI_STATUS GEE_NWFSetSize(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, UINT32 Size);
EFI_STATUS GEE_NWFCommit(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, UINT32 Flags);

// Writes Status into the first field of "PROVISIONING_ENV_VOLATILE_VAR".
EFI_STATUS SetOperationStatus(EFI_STATUS Status);

// ---------------------------------------------------------------------------
// Network busy lock
// ---------------------------------------------------------------------------
// True when the caller holds the lock. With Wait, a held lock is waited for
// on its event.
BOOLEAN AcquireNetworkBusyLock(UINT8 *Busy, EFI_EVENT *Event, BOOLEAN Wait);
// Signals and closes the event and frees the lock; returns the flag (false).
BOOLEAN ReleaseNetworkBusyLock(UINT8 *Busy, EFI_EVENT *Event);
