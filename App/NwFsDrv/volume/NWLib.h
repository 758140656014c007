// The network library: the GEE_NW... operations through which the volume
// and the mount code reach the share, the records they exchange (share
// record, connection parameters, remote file record), the status record in
// "PROVISIONING_ENV_VOLATILE_VAR", the network busy lock, the login
// splitter, the fixed file time and the directory-node list helpers.
//
// Every operation forwards to the SMB2 file-system adapter whatever the
// share type: CIFS (1) and NFS (2) both reach the same SMB2 code; there is
// deliberately no second back end. Directory creation, removal, the end of a
// listing, size changes and commits are acknowledged locally and send
// nothing.
#pragma once

#include "Uefi.h"

struct SMB2_DIR_NODE;

constexpr UINT64 NW_SHARE_TYPE_CIFS = 1;
constexpr UINT64 NW_SHARE_TYPE_NFS = 2;

// The share record's current file path (8-bit, from the share's root).
constexpr UINTN NW_SHARE_FILE_PATH_FIELD = 336;
constexpr UINTN NW_SHARE_RECORD_SIZE = 632;

#pragma pack(push, 1)
// The share record: built by the mount, owned by the volume, first argument
// of every per-share operation. Everything after the keep-alive event
// belongs to the adapter.
struct NW_SHARE_INFO {
  CHAR16 *sharename; // as given on the command line
  void *Reserved;
  UINT64 shareType; // NW_SHARE_TYPE_CIFS or NW_SHARE_TYPE_NFS
  void *Reserved2;
  EFI_EVENT KeepAliveEvent;
  // Adapter area: the directory a listing is taken of, and room kept free.
  CHAR8 FilePath[NW_SHARE_FILE_PATH_FIELD];
  UINT8 AdapterReserved[NW_SHARE_RECORD_SIZE - 40 - NW_SHARE_FILE_PATH_FIELD];
};

// The connection parameters handed to GEE_NWFSConnect (and kept by the
// volume as its ConnectionInfo).
struct NW_CONNECTION_PARAMS {
  CHAR16 *ipAddress;
  CHAR16 *username; // CIFS; may carry a domain: "user@domain" or "domain\user"
  CHAR16 *password; // CIFS
  UINT32 uid;       // NFS: the user argument as a number
  UINT32 gid;       // NFS: the password argument as a number
};

// The remote file record each file handle embeds: what the adapter needs to
// open, read, write and close one file.
struct NW_REMOTE_FILE {
  UINT16 Reserved;
  UINT8 OplockLevel; // SMB2 oplock level asked for at open
  UINT8 Reserved2;
  UINT8 FileId[16]; // filled by GEE_NWFOpen, zeroed by GEE_NWFClose
  UINT32 Reserved3;
  CHAR16 *FileName; // from the share's root
};

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

static_assert(sizeof(NW_SHARE_INFO) == NW_SHARE_RECORD_SIZE, "share record is 632 bytes");
static_assert(offsetof(NW_SHARE_INFO, Reserved) == 8, "share record: reserved pointer");
static_assert(offsetof(NW_SHARE_INFO, shareType) == 16, "share record: share type");
static_assert(offsetof(NW_SHARE_INFO, Reserved2) == 24, "share record: second pointer");
static_assert(offsetof(NW_SHARE_INFO, KeepAliveEvent) == 32, "share record: keep-alive event");
static_assert(offsetof(NW_SHARE_INFO, FilePath) == 40, "share record: adapter area");
static_assert(sizeof(NW_CONNECTION_PARAMS) == 32, "connection parameters are 32 bytes");
static_assert(offsetof(NW_CONNECTION_PARAMS, uid) == 24, "connection parameters: uid");
static_assert(offsetof(NW_CONNECTION_PARAMS, gid) == 28, "connection parameters: gid");
static_assert(offsetof(NW_REMOTE_FILE, OplockLevel) == 2, "remote file: oplock byte");
static_assert(offsetof(NW_REMOTE_FILE, FileId) == 4, "remote file: file id");
static_assert(offsetof(NW_REMOTE_FILE, FileName) == 24, "remote file: name pointer");
static_assert(sizeof(NW_REMOTE_FILE) == 32, "remote file record size");
static_assert(sizeof(NW_OPERATION_STATUS_RECORD) == 40, "status record is 40 bytes");
static_assert(offsetof(NETWORK_BUSY_LOCK, Event) == 8, "busy lock: flag, then event");

extern NETWORK_BUSY_LOCK NetworkBusyLock;

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

// ---------------------------------------------------------------------------
// Login names
// ---------------------------------------------------------------------------
// Splits Input at the first Separator: with '@' user before, domain after;
// with '\' domain before, user after. EFI_NOT_FOUND without the separator
// (the whole input becomes the user when it fits).
EFI_STATUS SearchUserAndDomainSeparator(const CHAR8 *Input, CHAR8 Separator, UINTN UserSize,
                                        CHAR8 *User, UINTN DomainSize, CHAR8 *Domain);
// Tries '@', then '\'.
EFI_STATUS SplitUserAndDomain(const CHAR8 *Input, UINTN UserSize, CHAR8 *User, UINTN DomainSize,
                              CHAR8 *Domain);

// ---------------------------------------------------------------------------
// Shared helpers of the adapter
// ---------------------------------------------------------------------------
// Every remote time is reported as 2018-01-01 10:10:10; the first argument
// is ignored, time zone and daylight are left as they are.
void FillDefaultFileTime(UINT32 Ignored, EFI_TIME *Time);
// Frees every node of the list and clears *Head.
void FreeDirNodeList(SMB2_DIR_NODE **Head);
EFI_STATUS DumpDirNodeList(const SMB2_DIR_NODE *Head);
