// The network volume: a connected share served to the firmware through
// EFI_SIMPLE_FILE_SYSTEM_PROTOCOL and EFI_FILE_PROTOCOL.
//
// Three records carry it, all packed and all allocated through the volume's
// own allocator (which zeroes every block and counts the bytes it hands out):
//
//   NW_VOLUME       one per mounted share; its first member is the installed
//                   Simple File System interface.
//   NW_OPEN_FILE    one per open path; what every handle on that path shares
//                   (name, attributes, sizes, the cached directory listing).
//   NW_FILE_HANDLE  one per Open; its first member is the EFI_FILE_PROTOCOL
//                   handed to the caller.
//
// Data-transfer offsets are process-wide on purpose: the program reads one
// file and writes one file at a time, so the read offset, the write offset
// and the directory-read index live in globals rather than in the handles.
#pragma once

#include "DiagLog.h"
#include "Uefi.h"
#include "volume/NWLib.h"
#include "volume/NwList.h"

// Limits of path resolution, in characters.
constexpr UINTN NW_MAX_REMAINING_PATH = 260;
constexpr UINTN NW_MAX_FULL_PATH = 512;
// The share record's current file path holds at most this many characters.
constexpr UINTN NW_MAX_SHARE_FILE_PATH = 335;

// The volume label buffer, in bytes, and the volume identifier, in characters
// (room for the longest name a volume-label entry can give it: 11 characters
// and the terminator).
constexpr UINTN NW_VOLUME_LABEL_BYTES = 512;
constexpr UINTN NW_VOLUME_ID_CHARS = 12;

// The most one Read returns, and the largest single write request.
constexpr UINT64 NW_MAX_READ_PER_CALL = 0x100000;
constexpr UINT64 NW_MAX_WRITE_CHUNK = 0xFC00;

// Entry marker of a deleted record.
constexpr UINT8 NW_ENTRY_DELETED = 0xE5;

// The attribute a file's open is refused with when it carries exactly the
// read-only and directory bits.
constexpr UINT64 NW_READ_ONLY_DIRECTORY = EFI_FILE_READ_ONLY | EFI_FILE_DIRECTORY;

struct NW_VOLUME;
struct NW_OPEN_FILE;

#pragma pack(push, 1)
// The fixed part of an EFI_FILE_INFO (plus the first name characters of the
// published 88-byte record): what a listing entry and an open-file record keep
// of a remote file. The name itself is held separately.
struct NW_DIRECTORY_ENTRY {
  UINT64 Size;
  UINT64 FileSize;
  UINT64 PhysicalSize;
  EFI_TIME CreateTime;
  EFI_TIME LastAccessTime;
  EFI_TIME ModificationTime;
  UINT64 Attribute;
  CHAR16 NameStart[4];
};

// One entry of a directory's cached listing.
struct NW_DIR_ENTRY {
  NW_DIRECTORY_ENTRY Entry;
  CHAR16 *FileName; // owned by the entry
  NW_LIST_LINK Link;
};

struct NW_OPEN_FILE {
  NW_VOLUME *Volume;
  EFI_STATUS Error;
  UINT8 ROOTDIR;
  CHAR16 *FileName; // last path component; "\" for the root
  CHAR16 *FullPath; // from the share's root, as the last handle opened on it saw it
  NW_DIRECTORY_ENTRY DirectoryEntry;
  UINT8 EntryMarker;
  UINT8 Deleted;
  UINT16 HandleCount;
  UINT8 DirtyListing;
  NW_OPEN_FILE *Parent;
  NW_LIST_HEAD DirEntries; // NW_DIR_ENTRY.Link
  UINT8 ReadInProgress;
  NW_LIST_LINK VolumeLink; // in NW_VOLUME.OpenFiles
  NW_LIST_LINK ChildLink;  // in Parent->Children
  NW_LIST_HEAD Children;   // NW_OPEN_FILE.ChildLink
};

struct NW_FILE_HANDLE {
  EFI_FILE_PROTOCOL Protocol;
  EFI_STATUS HandleStatus;
  NW_OPEN_FILE *OpenFile;
  NW_REMOTE_FILE shareFileInfo; // passed to every per-file network call
  CHAR16 *FullPath;             // owned by the handle
  UINT64 OpenMode;
  UINT64 Position; // directories only
  UINT8 Flag;
  NW_VOLUME *Volume;       // kept when the record reference is lost
  NW_LIST_LINK VolumeLink; // in NW_VOLUME.FileHandles
};

struct NW_VOLUME {
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL Sfs;
  EFI_HANDLE Handle;
  EFI_STATUS VolumeStatus;
  UINT8 ReadOnly; // here rather than with the other statistics: keeps VolumeID aligned
  UINT8 Valid;
  CHAR16 VolumeID[NW_VOLUME_ID_CHARS];
  CHAR16 *VolumeLabel;
  UINT64 TotalSize;
  UINT64 FreeSpace;
  UINT32 BlockSize;
  CHAR8 Language[10];
  CHAR16 *ControllerName;
  UINT64 CachedEntryCount;
  UINT8 Reserved[5];
  EFI_UNICODE_COLLATION_PROTOCOL *Collation;
  NW_SHARE_INFO *shareInfo;
  NW_CONNECTION_PARAMS *ConnectionInfo;
  UINT64 AllocatedBytes;
  NW_OPEN_FILE *Root;
  NW_LIST_HEAD OpenFiles;   // NW_OPEN_FILE.VolumeLink
  NW_LIST_HEAD FileHandles; // NW_FILE_HANDLE.VolumeLink
};
#pragma pack(pop)

static_assert(sizeof(NW_DIRECTORY_ENTRY) == 88, "directory entry is the 88-byte info record");
static_assert(offsetof(NW_DIRECTORY_ENTRY, FileSize) == offsetof(EFI_FILE_INFO, FileSize),
              "entry FileSize matches EFI_FILE_INFO");
static_assert(offsetof(NW_DIRECTORY_ENTRY, CreateTime) == offsetof(EFI_FILE_INFO, CreateTime),
              "entry times match EFI_FILE_INFO");
static_assert(offsetof(NW_DIRECTORY_ENTRY, Attribute) == offsetof(EFI_FILE_INFO, Attribute),
              "entry Attribute matches EFI_FILE_INFO");
static_assert(offsetof(NW_DIRECTORY_ENTRY, NameStart) == SIZE_OF_EFI_FILE_INFO,
              "entry name starts where EFI_FILE_INFO's does");

static_assert(offsetof(NW_FILE_HANDLE, Protocol) == 0, "the handle is its file protocol");

static_assert(sizeof(NW_VOLUME) == 205, "volume record is 205 bytes");
static_assert(offsetof(NW_VOLUME, Sfs) == 0, "the volume is its Simple File System interface");
static_assert(offsetof(NW_VOLUME, Handle) == 16, "volume: handle");
static_assert(offsetof(NW_VOLUME, VolumeStatus) == 24, "volume: status");
static_assert(offsetof(NW_VOLUME, ReadOnly) == 32, "volume: read-only flag");
static_assert(offsetof(NW_VOLUME, Valid) == 33, "volume: valid flag");
static_assert(offsetof(NW_VOLUME, VolumeID) == 34, "volume: identifier, CHAR16-aligned");
static_assert(offsetof(NW_VOLUME, VolumeLabel) == 58, "volume: label");
static_assert(offsetof(NW_VOLUME, TotalSize) == 66, "volume: statistics");
static_assert(offsetof(NW_VOLUME, BlockSize) == 82, "volume: block size");
static_assert(offsetof(NW_VOLUME, Language) == 86, "volume: language");
static_assert(offsetof(NW_VOLUME, ControllerName) == 96, "volume: controller name");
static_assert(offsetof(NW_VOLUME, CachedEntryCount) == 104, "volume: cached entry count");
static_assert(offsetof(NW_VOLUME, Collation) == 117, "volume: collation");
static_assert(offsetof(NW_VOLUME, shareInfo) == 125, "volume: share record");
static_assert(offsetof(NW_VOLUME, ConnectionInfo) == 133, "volume: connection info");
static_assert(offsetof(NW_VOLUME, AllocatedBytes) == 141, "volume: allocated bytes");
static_assert(offsetof(NW_VOLUME, Root) == 149, "volume: root record");
static_assert(offsetof(NW_VOLUME, OpenFiles) == 157, "volume: open-file list");
static_assert(offsetof(NW_VOLUME, FileHandles) == 181, "volume: handle list");

// ---------------------------------------------------------------------------
// Process-wide transfer and listing state
// ---------------------------------------------------------------------------
extern UINT64 gTotalByteRead;   // offset of the next read in the file being read
extern UINT8 *gPrevReadOffset;  // staging address of the last chunk read (diagnostics)
extern UINT8 *gReadBuffer;      // the buffer the current Read fills (the caller's)
extern UINT64 gWriteOffset;     // offset of the next write; never reset
extern UINT32 gDirReadIndex;    // cached-listing index the next directory Read delivers
extern UINT8 gDirRewind;        // set by SetPosition(0) on a directory
extern UINT8 gDirFirstReadDone; // 1 after the first successful directory Read

// Unicode Collation 2 interface found at mount; copied into every new volume.
extern EFI_UNICODE_COLLATION_PROTOCOL *gUnicodeCollationInterface;

// ---------------------------------------------------------------------------
// Volume install and removal
// ---------------------------------------------------------------------------
// For an NFS share the user name and password are the decimal uid and gid.
EFI_STATUS DetectInstallVolume(EFI_HANDLE Handle, const CHAR8 *Language, NW_SHARE_INFO *ShareInfo,
                               const CHAR16 *IpAddress, const CHAR16 *UserName,
                               const CHAR16 *Password);
// A decimal number given as text (an NFS uid or gid); 0 for no text.
UINT32 NwParseDecimal(const CHAR16 *Text);
// Uninstalls the volume's Simple File System interface and frees everything
// the volume owns: handles, open-file records, listings, label, connection
// strings, controller name and the record itself. The share record stays the
// caller's. When the uninstall fails nothing is freed.
EFI_STATUS RemoveInstalledVolume(NW_VOLUME *Volume);

// ---------------------------------------------------------------------------
// Records (NwOpenVolume.cpp)
// ---------------------------------------------------------------------------
EFI_STATUS EFIAPI OpenVolume(EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *This, EFI_FILE_PROTOCOL **Root);

// The volume's allocator: zeroed blocks, counted in Volume->AllocatedBytes.
EFI_STATUS fsAllocateMemory(NW_VOLUME *Volume, UINTN Size, void **Buffer);
void fsFreeMemory(NW_VOLUME *Volume, void *Buffer);
// A copy of String (Characters long) in a block of ExtraChars more characters.
CHAR16 *fsStrDup(NW_VOLUME *Volume, const CHAR16 *String, UINTN ExtraChars = 0);

EFI_STATUS CreateRootRecord(NW_VOLUME *Volume, NW_OPEN_FILE **Root);
EFI_STATUS CreateFileHandleInstance(NW_OPEN_FILE *OpenFile, NW_FILE_HANDLE **Handle,
                                    UINT64 OpenMode);
EFI_STATUS ValidateCurrentStatus(NW_FILE_HANDLE *Handle);
// ValidateCurrentStatus with a failure reported as "ValidateCurrentStatus
// failed!" under the protocol operation's own name (given explicitly: the
// operations run their bodies inside NwTraced's lambda).
EFI_STATUS NwValidateHandle(NW_FILE_HANDLE *Handle, const CHAR8 *Function,
                            UINT32 Line = __builtin_LINE());
// Frees a record that no handle, cached listing or child record refers to,
// unlinking it from the volume and its parent, and then tries its parent the
// same way. A record still in use (or the volume's root) is left alone and
// EFI_ACCESS_DENIED is returned.
EFI_STATUS ReleaseOpenFile(NW_OPEN_FILE *OpenFile);
// Unlinks a handle from the volume's list and frees it with its full path.
void FreeFileHandle(NW_VOLUME *Volume, NW_FILE_HANDLE *Handle);
// Invalidates every handle and frees every record of the volume (media gone).
void CleanupVolume(NW_VOLUME *Volume, EFI_STATUS Status);

// The handle behind a protocol pointer (null for null).
inline NW_FILE_HANDLE *NwHandleOf(EFI_FILE_PROTOCOL *This) {
  return reinterpret_cast<NW_FILE_HANDLE *>(This);
}
inline bool NwIsDirectory(const NW_OPEN_FILE *OpenFile) {
  return (OpenFile->DirectoryEntry.Attribute & EFI_FILE_DIRECTORY) != 0;
}

// Runs one protocol operation between its entry and exit trace lines.
template <typename Body>
EFI_STATUS NwTraced(Body &&Run, const CHAR8 *Function = __builtin_FUNCTION(),
                    UINT32 Line = __builtin_LINE()) {
  DiagEntry(DiagChannel::Driver, Function, Line);
  EFI_STATUS Status = Run();
  DiagExit(Status, DiagChannel::Driver, Function, Line);
  return Status;
}

// The network busy lock around one network call: taken with waiting.
bool NwAcquireBusyLock();
void NwReleaseBusyLock();

// ---------------------------------------------------------------------------
// Path resolution and open (NwOpen.cpp)
// ---------------------------------------------------------------------------
EFI_STATUS EFIAPI OpenFileHandle(EFI_FILE_PROTOCOL *This, EFI_FILE_PROTOCOL **NewHandle,
                                 const CHAR16 *FileName, UINT64 OpenMode, UINT64 Attributes);
EFI_STATUS ProcessOpenFileHandle(NW_FILE_HANDLE *Handle, const CHAR16 *FileName,
                                 NW_FILE_HANDLE **NewHandle, UINT64 OpenMode, UINT64 Attributes);
// Splits the next component off *Cursor into Component (at least
// NW_MAX_REMAINING_PATH + 1 characters) and advances the cursor.
EFI_STATUS GetNextCompName(const CHAR16 **Cursor, CHAR16 *Component);
// Names are equal when they match with ASCII letters folded to upper case.
bool NwNamesEqual(const CHAR16 *A, const CHAR16 *B);
EFI_STATUS FindMatchingFH(NW_VOLUME *Volume, const CHAR16 *Component, NW_OPEN_FILE *Directory,
                          NW_OPEN_FILE **Match);
bool FindMatchingDirEntry(NW_OPEN_FILE *Directory, const CHAR16 *Component, NW_DIR_ENTRY **Entry);
EFI_STATUS CreateDirectoryEntry(NW_OPEN_FILE *Directory, const CHAR16 *Name, NW_OPEN_FILE **Record,
                                UINT64 Attribute);
// The record's path on the share, without a leading separator (the share's
// root is the empty path), in a block of the volume's allocator.
EFI_STATUS FindCurrentLocation(NW_OPEN_FILE *OpenFile, CHAR16 **FullPath);
CHAR16 NwShareSeparator(const NW_VOLUME *Volume);

// ---------------------------------------------------------------------------
// File data (NwReadWrite.cpp)
// ---------------------------------------------------------------------------
EFI_STATUS EFIAPI ReadFileHandle(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, void *Buffer);
EFI_STATUS EFIAPI WriteFileHandle(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, void *Buffer);
EFI_STATUS EFIAPI GetPositionFileHandle(EFI_FILE_PROTOCOL *This, UINT64 *Position);
EFI_STATUS EFIAPI SetPositionFileHandle(EFI_FILE_PROTOCOL *This, UINT64 Position);
EFI_STATUS EFIAPI FlushFileHandle(EFI_FILE_PROTOCOL *This);
EFI_STATUS EFIAPI CloseFileHandle(EFI_FILE_PROTOCOL *This);
EFI_STATUS EFIAPI DeleteFileHandle(EFI_FILE_PROTOCOL *This);

// ---------------------------------------------------------------------------
// Directory listing (NwDirectory.cpp)
// ---------------------------------------------------------------------------
EFI_STATUS ReadAllDirectoryEntries(NW_OPEN_FILE *Directory);
// The directory's cached listing, fetched when it is empty or marked dirty.
EFI_STATUS LoadDirEntries(NW_OPEN_FILE *Directory);
EFI_STATUS AddToDirList(NW_OPEN_FILE *Directory, const NW_DIRECTORY_ENTRY *Entry,
                        const CHAR16 *FileName, NW_DIR_ENTRY **Added = nullptr);
EFI_STATUS CreateFHFromDirEntryList(NW_DIR_ENTRY *Entry, NW_OPEN_FILE *Directory,
                                    NW_OPEN_FILE **Child);
EFI_STATUS GetDirEntryByIndex(NW_LIST_HEAD *List, UINT32 Index, NW_DIR_ENTRY **Entry);
void DiscardDirEntries(NW_OPEN_FILE *Directory);
// Drops the cached listings of every record of the volume but Keep.
void DiscardListingsExcept(NW_VOLUME *Volume, const NW_OPEN_FILE *Keep);
// Read on a directory handle: one EFI_FILE_INFO per call.
EFI_STATUS ReadDirectory(NW_FILE_HANDLE *Handle, UINTN *BufferSize, void *Buffer);

// ---------------------------------------------------------------------------
// Information (NwInfo.cpp)
// ---------------------------------------------------------------------------
EFI_STATUS EFIAPI GetInfoFileHandle(EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType,
                                    UINTN *BufferSize, void *Buffer);
EFI_STATUS EFIAPI SetInfoFileHandle(EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType,
                                    UINTN BufferSize, void *Buffer);
EFI_STATUS GetFileInfoFromFH(NW_OPEN_FILE *OpenFile, UINTN *BufferSize, void *Buffer);
EFI_STATUS GetVolumeLabel(NW_VOLUME *Volume, UINTN *BufferSize, void *Buffer);
EFI_STATUS GetSystemInfo(NW_VOLUME *Volume, UINTN *BufferSize, void *Buffer);
