// The back end under the network volume: the records the volume and its
// network back end exchange, and the table of functions through which the
// network library reaches the back end. The volume sees nothing of the back
// end but this header; the back end (the SMB2 file-system adapter) fills the
// table and sees nothing of the volume.
#pragma once

#include "NwBaseLib.h"
#include "Uefi.h"

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

// One directory entry of a listing, in the back end's singly linked list.
struct SMB2_DIR_NODE {
  SMB2_DIR_NODE *Next;
  UINT32 FileIndex;
  UINT64 CreationTime;
  UINT64 LastAccessTime;
  UINT64 LastWriteTime;
  UINT64 ChangeTime;
  UINT64 EndOfFile;
  UINT64 AllocationSize;
  UINT32 FileAttributes;
  UINT32 FileNameLength; // bytes
  UINT32 EaSize;
  UINT8 FileName[512]; // UTF-16, zero-filled beyond the name
};
#pragma pack(pop)

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
static_assert(offsetof(SMB2_DIR_NODE, FileIndex) == 8, "node FileIndex offset");
static_assert(offsetof(SMB2_DIR_NODE, EndOfFile) == 44, "node EndOfFile offset");
static_assert(offsetof(SMB2_DIR_NODE, FileAttributes) == 60, "node FileAttributes offset");
static_assert(offsetof(SMB2_DIR_NODE, FileName) == 72, "node FileName offset");
static_assert(sizeof(SMB2_DIR_NODE) == 584, "directory node size");

// Every remote time is reported as 2018-01-01 10:10:10; the first argument
// is ignored, time zone and daylight are left as they are.
inline void FillDefaultFileTime(UINT32 Ignored, EFI_TIME *Time) {
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

// Frees every node of the list and clears *Head.
inline void FreeDirNodeList(SMB2_DIR_NODE **Head) {
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

// ---------------------------------------------------------------------------
// Login names: the connection parameters' user name may carry a domain
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
// The back-end table. Every function returns EFI_STATUS; what each takes
// and gives is told at the network library's operation that forwards to it
// (volume/NWLib.h).
// ---------------------------------------------------------------------------
constexpr UINT64 NW_BACKEND_REVISION = 0x00010000;

typedef EFI_STATUS (*NW_BACKEND_RESET)();
typedef EFI_STATUS (*NW_BACKEND_CONNECT)(const NW_CONNECTION_PARAMS *Params,
                                         const NW_SHARE_INFO *Share);
typedef EFI_STATUS (*NW_BACKEND_DISCONNECT)();
typedef EFI_STATUS (*NW_BACKEND_OPEN)(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, UINT64 OpenMode,
                                      UINT64 OpenFlags);
typedef EFI_STATUS (*NW_BACKEND_READ)(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File, void *Buffer,
                                      UINTN *Size, UINT64 Offset);
typedef EFI_STATUS (*NW_BACKEND_WRITE)(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File,
                                       const void *Buffer, UINTN *Size, UINT64 Offset);
typedef EFI_STATUS (*NW_BACKEND_CLOSE)(NW_SHARE_INFO *Share, NW_REMOTE_FILE *File);
typedef EFI_STATUS (*NW_BACKEND_GET_FS_INFO)(NW_SHARE_INFO *Share, EFI_FILE_SYSTEM_INFO *Info);
typedef EFI_STATUS (*NW_BACKEND_FIND_FIRST)(NW_SHARE_INFO *Share, const CHAR16 *Pattern,
                                            EFI_FILE_INFO **Entry);
typedef EFI_STATUS (*NW_BACKEND_FIND_NEXT)(EFI_FILE_INFO **Entry);
typedef EFI_STATUS (*NW_BACKEND_GET_FILE_STAT)(NW_SHARE_INFO *Share, const CHAR16 *Path,
                                               EFI_FILE_INFO *Stat);

struct NW_BACKEND {
  UINT64 Revision;
  // Drops the whole connection state (the network library's init and
  // de-init).
  NW_BACKEND_RESET Reset;
  NW_BACKEND_CONNECT Connect;
  NW_BACKEND_DISCONNECT Disconnect;
  NW_BACKEND_OPEN Open;
  // *Size: in, bytes wanted; out, bytes moved (also when a request fails).
  NW_BACKEND_READ Read;
  NW_BACKEND_WRITE Write;
  NW_BACKEND_CLOSE Close;
  NW_BACKEND_GET_FS_INFO GetFSInfo;
  NW_BACKEND_FIND_FIRST FindFirst;
  NW_BACKEND_FIND_NEXT FindNext;
  NW_BACKEND_GET_FILE_STAT GetFileStat;
};

// The SMB2 file-system adapter's table; every share type is served by it.
extern const NW_BACKEND gSMB2FsBackend;
