// The SMB2 file-system adapter: what the network volume sees of the SMB2
// client, through the back-end table it fills (gSMB2FsBackend, NwBackend.h). It connects and
// disconnects a share, opens, reads, writes and closes one file at a time, lists a directory one
// entry at a time and reports file and volume information in UEFI terms.
//
// All client-side state lives in program-wide records, so the adapter is
// not re-entrant and only one file may be open at a time.
//
// Who frees what:
// - The EFI_FILE_INFO entries SMB2_FindFirst and SMB2_FindNext hand out are
//   pool blocks that pass to the caller, which frees them with FreePool
//   (the network volume keeps them as its cached directory entries).
// - The stat and file-system records of SMB2_GetFileStat and
//   SMB2_GetFSInfo are the caller's; nothing is allocated for them.
// - The directory-node list belongs to the adapter. It lives from
//   SMB2_FindFirst until SMB2_FindNext runs off its end; a listing left
//   unfinished is released by the next SMB2_FindFirst or by the disconnect,
//   and a failed listing is released at once.
// - The directory answer copies and the create contexts belong to
//   FileAccessDetails and are released when the adapter lets go of it
//   (disconnect and re-initialisation).
// - The five connect buffers are allocated by SMB2_FSConnect and released by
//   SMB2_FSDisconnect or SMB2_FSResetState.
// A run of connect, any operations and disconnect therefore returns the
// pool to where it started.
#pragma once

#include "NwBackend.h"
#include "smb2/SMB2FileAccess.h"

// Connect buffer sizes (bytes). The user and domain buffers carry one byte
// beyond what the login splitter may fill, so that a name of the full length
// stays terminated.
constexpr UINTN SMB2_FS_IP_BUFFER = 46;
constexpr UINTN SMB2_FS_USER_BUFFER = 256;
constexpr UINTN SMB2_FS_PASSWORD_BUFFER = 512;
constexpr UINTN SMB2_FS_DOMAIN_BUFFER = 256;
constexpr UINTN SMB2_FS_SHARENAME_BUFFER = 336;
constexpr UINTN SMB2_FS_LOGIN_CHARS = 510;
constexpr UINTN SMB2_FS_SHARE_CHARS = 80;
// Transfers are cut into requests of at most this many bytes, or of the
// server's negotiated maximum when that is smaller (the volume hands over
// writes of at most this much, so a write is one request on most servers).
// A server may answer a request with less than asked; at most this many
// such short answers are taken in one transfer.
constexpr UINT32 SMB2_FS_MAX_CHUNK = 64512;
constexpr UINT32 SMB2_FS_MAX_SHORT_ANSWERS = 16;
// The least an EFI_FILE_INFO handed out occupies: the volume copies this
// much of it as its directory-entry record.
constexpr UINTN SMB2_FS_MIN_FILE_INFO_ALLOCATION = 88;
// The adapter state word after a successful connect or open.
constexpr UINT32 SMB2_FS_STATE_READY = 2;

// SMB2 file attributes the adapter maps.
constexpr UINT32 SMB2_ATTR_READONLY = 0x01;
constexpr UINT32 SMB2_ATTR_HIDDEN = 0x02;
constexpr UINT32 SMB2_ATTR_DIRECTORY = 0x10;
constexpr UINT32 SMB2_ATTR_ARCHIVE = 0x20;
constexpr UINT32 SMB2_ATTR_NORMAL = 0x80;

extern SMB2ConnectInfo gSMB2ConnectInfo;
extern SMB2ShareDetails gSMB2ShareDetails;
extern SMB2_CLIENT_SESSION gSMB2ClientSession;
extern FILE_ACCESS_DETAILS gFileAccessDetails;
extern QUERY_DETAILS gQueryDetails;
extern UINT32 gSMB2AdapterState;
extern SMB2_DIR_NODE *gDirNodePtr;    // head of the current listing
extern SMB2_DIR_NODE *gDirNodeCursor; // next node to hand out

EFI_STATUS SMB2_FSConnect(const NW_CONNECTION_PARAMS *Params, const NW_SHARE_INFO *Share);
EFI_STATUS SMB2_FSDisconnect();
// Drops the whole connection state: the connect buffers, the records, the
// listing, and a socket left open by a failed connect.
EFI_STATUS SMB2_FSResetState();

// OpenFlags carries 0x8 when the caller asked to create.
EFI_STATUS SMB2_FOpen(NW_SHARE_INFO *Volume, NW_REMOTE_FILE *File, UINT64 OpenMode,
                      UINT64 OpenFlags);
// *Size: in, bytes wanted; out, bytes moved (also when a request fails).
EFI_STATUS SMB2_FRead(NW_SHARE_INFO *Volume, NW_REMOTE_FILE *File, void *Buffer, UINTN *Size,
                      UINT64 Offset);
EFI_STATUS SMB2_FWrite(NW_SHARE_INFO *Volume, NW_REMOTE_FILE *File, const void *Buffer, UINTN *Size,
                       UINT64 Offset);
EFI_STATUS SMB2_FClose(NW_SHARE_INFO *Volume, NW_REMOTE_FILE *File);
EFI_STATUS SMB2_GetFSInfo(NW_SHARE_INFO *Volume, EFI_FILE_SYSTEM_INFO *Info);
EFI_STATUS SMB2_FindFirst(NW_SHARE_INFO *Share, const CHAR16 *Pattern, EFI_FILE_INFO **Entry);
EFI_STATUS SMB2_FindNext(EFI_FILE_INFO **Entry);
EFI_STATUS SMB2_GetFileStat(NW_SHARE_INFO *Volume, const CHAR16 *Path, EFI_FILE_INFO *Stat);

// Builds the EFI_FILE_INFO of one node into a new pool block.
EFI_STATUS SMB2_PopulateDirFileInfo(const SMB2_DIR_NODE *Node, EFI_FILE_INFO **Info);
UINT64 SMB2MapAttributes(UINT32 Attributes);
// Every SMB2 time is reported as the fixed time; the input is ignored.
void SMB2ConvertFileTime(UINT64 FileTime, EFI_TIME *Time);
