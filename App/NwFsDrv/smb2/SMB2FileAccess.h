// SMB2 file operations on the connected share: CREATE and CLOSE, READ and
// WRITE, QUERY_INFO and QUERY_DIRECTORY, with the program-wide records they
// fill (FileAccessDetails, QueryDetails) and the directory nodes a listing is
// turned into.
//
// Each command file holds the encoder and the decoder of its command; the
// operations (SMB2FileOps.cpp) run them through the exchange path
// (SMB2Exchange.h), which frames, sends, receives, checks and drains.
//
// Every length and offset a server sends is checked against the bytes that
// arrived, against what the client asked for and against the buffer it lands
// in before it is used; a violation fails the operation with a message naming
// the field.
#pragma once

#include "NwBackend.h"
#include "smb2/SMB2Connect.h"
#include "smb2/SMB2Exchange.h"

// ---------------------------------------------------------------------------
// Records
// ---------------------------------------------------------------------------
constexpr UINTN SMB2_FILE_ID_SIZE = 16;
constexpr UINTN SMB2_FILE_NAME_FIELD = 592;

#pragma pack(push, 1)
// Byte image of FileAllInformation up to its first four name bytes; the
// Basic (40 bytes) and Standard (24 bytes) answers land at its start and at
// AllocationSize.
struct SMB2_FILE_INFO_IMAGE {
  UINT64 CreationTime;
  UINT64 LastAccessTime;
  UINT64 LastWriteTime;
  UINT64 ChangeTime;
  UINT32 FileAttributes;
  UINT32 Reserved;
  UINT64 AllocationSize;
  UINT64 EndOfFile;
  UINT32 NumberOfLinks;
  UINT8 DeletePending;
  UINT8 Directory;
  UINT16 Reserved2;
  UINT64 InternalIndexNumber;
  UINT32 EaSize;
  UINT32 AccessInformation;
  UINT64 PositionInformation;
  UINT32 ModeInformation;
  UINT32 AlignmentInformation;
  UINT32 NameInformation;
  UINT8 NameBytes[4];
};

// FileFsSizeInformation.
struct SMB2_FS_SIZE_INFO {
  UINT64 TotalAllocationUnits;
  UINT64 AvailableAllocationUnits;
  UINT32 SectorsPerAllocationUnit;
  UINT32 BytesPerSector;
};

struct SMB2_READ_WRITE_INFO {
  UINT32 Length; // bytes asked for in this request
  UINT32 MinimumCount;
  UINT64 FileOffset;
  UINT64 BytesRead;    // file data received by the last READ
  UINT64 BytesWritten; // file data sent by the last WRITE
  UINT32 Channel;
  UINT32 RemainingBytes;
  UINT32 ChannelInfoLength;
  UINT8 ChannelFlags; // cleared before every read and write
  UINT8 *ChannelInfo;
};

// The record of one file operation. The first nine fields mirror the CREATE
// request body.
struct FILE_ACCESS_DETAILS {
  UINT8 SecurityFlags; // CREATE SecurityFlags; CLOSE sends it widened as Flags
  UINT8 RequestedOplockLevel;
  UINT32 ImpersonationLevel;
  UINT64 SmbCreateFlags;
  UINT32 DesiredAccess;
  UINT32 FileAttributes;
  UINT32 ShareAccess;
  UINT32 CreateDisposition;
  UINT32 CreateOptions;
  UINT8 FileId[SMB2_FILE_ID_SIZE]; // persistent + volatile id from CREATE
  UINT32 AccessFlags;              // FileAccessInformation
  UINT32 OpenMode;                 // 1 read-only, 2 read-write
  UINT32 LeaseContextLength;       // 56 once a lease context was built; never reset by a create
  UINT32 DurableContextLength;     // 40 once a durable context was built
  SMB2_FILE_INFO_IMAGE FileInfo;
  UINT64 IndexNumber; // FileInternalInformation
  SMB2_FS_SIZE_INFO FsSize;
  SMB2_READ_WRITE_INFO ReadWriteInfo;
  UINT8 *DirInfoPtr;     // copy of a FileDirectoryInformation answer
  UINT8 *FullDirInfoPtr; // copy of a FileFullDirectoryInformation answer
  UINT8 *RawFileInfo;    // the raw output while it is verified, else null
  UINT32 TransportStatus;
  CHAR8 FileName[SMB2_FILE_NAME_FIELD]; // relative to the share root; empty = root
  UINT8 *LeaseContext;
  UINT8 *DurableContext;
  // Bytes of answer held by DirInfoPtr and FullDirInfoPtr (the copies carry
  // a zeroed tail beyond them).
  UINT32 DirInfoLength;
  UINT32 FullDirInfoLength;
};

// The parameters of a query. For QUERY_DIRECTORY the input buffer is the
// UTF-16 search pattern.
struct QUERY_DETAILS {
  UINT8 InfoType; // 1 file, 2 file system
  UINT8 FileInfoClass;
  UINT32 InputBufferLength;
  UINT32 AdditionalInformation;
  UINT32 Flags;
  UINT32 FileIndex;
  UINT8 *Buffer;
};

// The client session record passed beside the share details; its content is
// never read, the operations only require it to be present.
struct SMB2_CLIENT_SESSION {
  UINT8 Reserved[40];
};
#pragma pack(pop)

static_assert(sizeof(SMB2_FILE_INFO_IMAGE) == 104, "file information image is 104 bytes");
static_assert(offsetof(SMB2_FILE_INFO_IMAGE, FileAttributes) == 32, "FileAttributes offset");
static_assert(offsetof(SMB2_FILE_INFO_IMAGE, AllocationSize) == 40, "AllocationSize offset");
static_assert(offsetof(SMB2_FILE_INFO_IMAGE, EndOfFile) == 48, "EndOfFile offset");
static_assert(offsetof(SMB2_FILE_INFO_IMAGE, NumberOfLinks) == 56, "NumberOfLinks offset");
static_assert(offsetof(SMB2_FILE_INFO_IMAGE, InternalIndexNumber) == 64, "index offset");
static_assert(offsetof(SMB2_FILE_INFO_IMAGE, EaSize) == 72, "EaSize offset");
static_assert(offsetof(SMB2_FILE_INFO_IMAGE, PositionInformation) == 80, "position offset");
static_assert(offsetof(SMB2_FILE_INFO_IMAGE, NameInformation) == 96, "name length offset");
static_assert(sizeof(SMB2_FS_SIZE_INFO) == 24, "FileFsSizeInformation is 24 bytes");
static_assert(sizeof(SMB2_READ_WRITE_INFO) == 53, "read/write record");
static_assert(offsetof(SMB2_READ_WRITE_INFO, ChannelInfo) == 45, "ChannelInfo offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, ImpersonationLevel) == 2, "ImpersonationLevel");
static_assert(offsetof(FILE_ACCESS_DETAILS, SmbCreateFlags) == 6, "SmbCreateFlags offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, CreateOptions) == 30, "CreateOptions offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, FileId) == 34, "FileId offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, AccessFlags) == 50, "AccessFlags offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, OpenMode) == 54, "OpenMode offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, FileInfo) == 66, "file information image offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, IndexNumber) == 170, "IndexNumber offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, FsSize) == 178, "file-system size offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, ReadWriteInfo) == 202, "ReadWriteInfo offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, DirInfoPtr) == 255, "DirInfoPtr offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, TransportStatus) == 279, "TransportStatus offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, FileName) == 283, "FileName offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, LeaseContext) == 875, "LeaseContext offset");
static_assert(offsetof(FILE_ACCESS_DETAILS, DurableContext) == 883, "DurableContext offset");
static_assert(sizeof(FILE_ACCESS_DETAILS) == 899, "FileAccessDetails size");
static_assert(sizeof(QUERY_DETAILS) == 26, "QueryDetails size");
static_assert(offsetof(QUERY_DETAILS, InputBufferLength) == 2, "InputBufferLength offset");
static_assert(offsetof(QUERY_DETAILS, Buffer) == 18, "QueryDetails buffer offset");

// Every node is allocated at this fixed size, whatever its name needs.
constexpr UINTN SMB2_DIR_NODE_ALLOCATION = 1204;
static_assert(sizeof(SMB2_DIR_NODE) <= SMB2_DIR_NODE_ALLOCATION, "node fits its allocation");

// ---------------------------------------------------------------------------
// Wire structures (framed offsets: the SMB2 header starts at 4)
// ---------------------------------------------------------------------------
#pragma pack(push, 1)
struct SMB2_CREATE_REQUEST {
  SMB2_HEADER Header;
  UINT16 StructureSize; // 57
  UINT8 SecurityFlags;
  UINT8 RequestedOplockLevel;
  UINT32 ImpersonationLevel;
  UINT64 SmbCreateFlags;
  UINT64 Reserved;
  UINT32 DesiredAccess;
  UINT32 FileAttributes;
  UINT32 ShareAccess;
  UINT32 CreateDisposition;
  UINT32 CreateOptions;
  UINT16 NameOffset; // 120, from the SMB2 header
  UINT16 NameLength;
  UINT32 CreateContextsOffset;
  UINT32 CreateContextsLength;
};

struct SMB2_CREATE_RESPONSE_BODY {
  UINT16 StructureSize;
  UINT8 OplockLevel;
  UINT8 Flags;
  UINT32 CreateAction;
  UINT64 CreationTime;
  UINT64 LastAccessTime;
  UINT64 LastWriteTime;
  UINT64 ChangeTime;
  UINT64 AllocationSize;
  UINT64 EndofFile;
  UINT32 FileAttributes;
  UINT32 Reserved2;
  UINT8 FileId[SMB2_FILE_ID_SIZE];
  UINT32 CreateContextsOffset;
  UINT32 CreateContextsLength;
};

// A create context with a 4-byte name, then its data.
struct SMB2_CREATE_CONTEXT_HEADER {
  UINT32 Next;
  UINT16 NameOffset; // 16
  UINT16 NameLength; // 4
  UINT16 Reserved;
  UINT16 DataOffset; // 24
  UINT32 DataLength;
  CHAR8 Name[4];
  UINT8 Padding[4];
};

struct SMB2_CREATE_LEASE_CONTEXT {
  SMB2_CREATE_CONTEXT_HEADER Header; // "RqLs"
  UINT8 LeaseKey[16];
  UINT32 LeaseState;
  UINT32 LeaseFlags;
  UINT64 LeaseDuration;
};

struct SMB2_CREATE_DURABLE_CONTEXT {
  SMB2_CREATE_CONTEXT_HEADER Header; // "DHnQ"
  UINT8 Data[16];
};

struct SMB2_CLOSE_REQUEST {
  SMB2_HEADER Header;
  UINT16 StructureSize; // 24
  UINT16 Flags;
  UINT32 Reserved;
  UINT8 FileId[SMB2_FILE_ID_SIZE];
};

struct SMB2_READ_REQUEST {
  SMB2_HEADER Header;
  UINT16 StructureSize; // 49
  UINT8 Padding;
  UINT8 Flags;
  UINT32 Length;
  UINT64 Offset;
  UINT8 FileId[SMB2_FILE_ID_SIZE];
  UINT32 MinimumCount;
  UINT32 Channel;
  UINT32 RemainingBytes;
  UINT16 ReadChannelInfoOffset;
  // Written as 32 bits, so that it also covers the first two buffer bytes.
  UINT32 ReadChannelInfoLength;
  UINT8 BufferTail;
};

struct SMB2_READ_RESPONSE_BODY {
  UINT16 StructureSize;
  UINT8 DataOffset;
  UINT8 Reserved;
  UINT32 DataLength;
  UINT32 DataRemaining;
  UINT32 Reserved2;
};

struct SMB2_WRITE_REQUEST {
  SMB2_HEADER Header;
  UINT16 StructureSize; // 49
  UINT16 DataOffset;    // 112, from the SMB2 header
  UINT32 Length;
  UINT64 Offset;
  UINT8 FileId[SMB2_FILE_ID_SIZE];
  UINT32 Channel;
  UINT32 RemainingBytes;
  UINT16 WriteChannelInfoOffset;
  UINT16 WriteChannelInfoLength;
  UINT32 Flags;
};

struct SMB2_WRITE_RESPONSE_BODY {
  UINT16 StructureSize;
  UINT16 Reserved;
  UINT32 Count;
  UINT32 Remaining;
  UINT16 WriteChannelInfoOffset;
  UINT16 WriteChannelInfoLength;
};

struct SMB2_QUERY_INFO_REQUEST {
  SMB2_HEADER Header;
  UINT16 StructureSize; // 41
  UINT8 InfoType;
  UINT8 FileInfoClass;
  UINT32 OutputBufferLength;
  UINT16 InputBufferOffset;
  UINT16 Reserved;
  UINT32 InputBufferLength;
  UINT32 AdditionalInformation;
  UINT32 Flags;
  UINT8 FileId[SMB2_FILE_ID_SIZE];
  UINT8 Buffer;
};

struct SMB2_QUERY_DIRECTORY_REQUEST {
  SMB2_HEADER Header;
  UINT16 StructureSize; // 33
  UINT8 FileInformationClass;
  UINT8 Flags;
  UINT32 FileIndex;
  UINT8 FileId[SMB2_FILE_ID_SIZE];
  UINT16 FileNameOffset; // 96, from the SMB2 header, when a pattern is sent
  UINT16 FileNameLength;
  UINT32 OutputBufferLength;
};

// The fixed body of QUERY_INFO and QUERY_DIRECTORY answers.
struct SMB2_QUERY_RESPONSE_BODY {
  UINT16 StructureSize;
  UINT16 OutputBufferOffset;
  UINT32 OutputBufferLength;
};

// The framed header with a response's fixed body, as a decoder checks it.
struct SMB2_CREATE_RESPONSE {
  SMB2_HEADER Header;
  SMB2_CREATE_RESPONSE_BODY Body;
};
struct SMB2_QUERY_RESPONSE {
  SMB2_HEADER Header;
  SMB2_QUERY_RESPONSE_BODY Body;
};
#pragma pack(pop)

static_assert(sizeof(SMB2_CREATE_REQUEST) == 124, "CREATE request fixed part");
static_assert(offsetof(SMB2_CREATE_REQUEST, StructureSize) == 68, "CREATE StructureSize");
static_assert(offsetof(SMB2_CREATE_REQUEST, SecurityFlags) == 70, "CREATE SecurityFlags");
static_assert(offsetof(SMB2_CREATE_REQUEST, RequestedOplockLevel) == 71, "CREATE oplock");
static_assert(offsetof(SMB2_CREATE_REQUEST, ImpersonationLevel) == 72, "CREATE impersonation");
static_assert(offsetof(SMB2_CREATE_REQUEST, SmbCreateFlags) == 76, "CREATE SmbCreateFlags");
static_assert(offsetof(SMB2_CREATE_REQUEST, Reserved) == 84, "CREATE Reserved");
static_assert(offsetof(SMB2_CREATE_REQUEST, DesiredAccess) == 92, "CREATE DesiredAccess");
static_assert(offsetof(SMB2_CREATE_REQUEST, FileAttributes) == 96, "CREATE FileAttributes");
static_assert(offsetof(SMB2_CREATE_REQUEST, ShareAccess) == 100, "CREATE ShareAccess");
static_assert(offsetof(SMB2_CREATE_REQUEST, CreateDisposition) == 104, "CREATE disposition");
static_assert(offsetof(SMB2_CREATE_REQUEST, CreateOptions) == 108, "CREATE CreateOptions");
static_assert(offsetof(SMB2_CREATE_REQUEST, NameOffset) == 112, "CREATE NameOffset");
static_assert(offsetof(SMB2_CREATE_REQUEST, NameLength) == 114, "CREATE NameLength");
static_assert(offsetof(SMB2_CREATE_REQUEST, CreateContextsOffset) == 116, "CREATE ctx offset");
static_assert(offsetof(SMB2_CREATE_REQUEST, CreateContextsLength) == 120, "CREATE ctx length");
static_assert(sizeof(SMB2_CREATE_RESPONSE_BODY) == 88, "CREATE response fixed body");
static_assert(offsetof(SMB2_CREATE_RESPONSE_BODY, CreateAction) == 4, "CreateAction offset");
static_assert(offsetof(SMB2_CREATE_RESPONSE_BODY, AllocationSize) == 40, "AllocationSize");
static_assert(offsetof(SMB2_CREATE_RESPONSE_BODY, FileAttributes) == 56, "FileAttributes");
static_assert(offsetof(SMB2_CREATE_RESPONSE_BODY, FileId) == 64, "response FileId offset");
static_assert(offsetof(SMB2_CREATE_RESPONSE_BODY, CreateContextsOffset) == 80, "ctx offset");
static_assert(offsetof(SMB2_CREATE_RESPONSE_BODY, CreateContextsLength) == 84, "ctx length");
static_assert(sizeof(SMB2_CREATE_CONTEXT_HEADER) == 24, "create context header");
static_assert(offsetof(SMB2_CREATE_CONTEXT_HEADER, NameOffset) == 4, "context NameOffset");
static_assert(offsetof(SMB2_CREATE_CONTEXT_HEADER, NameLength) == 6, "context NameLength");
static_assert(offsetof(SMB2_CREATE_CONTEXT_HEADER, DataOffset) == 10, "context DataOffset");
static_assert(offsetof(SMB2_CREATE_CONTEXT_HEADER, DataLength) == 12, "context DataLength");
static_assert(offsetof(SMB2_CREATE_CONTEXT_HEADER, Name) == 16, "context Name offset");
static_assert(sizeof(SMB2_CREATE_LEASE_CONTEXT) == 56, "lease context is 56 bytes");
static_assert(offsetof(SMB2_CREATE_LEASE_CONTEXT, LeaseKey) == 24, "LeaseKey offset");
static_assert(offsetof(SMB2_CREATE_LEASE_CONTEXT, LeaseState) == 40, "LeaseState offset");
static_assert(offsetof(SMB2_CREATE_LEASE_CONTEXT, LeaseFlags) == 44, "LeaseFlags offset");
static_assert(offsetof(SMB2_CREATE_LEASE_CONTEXT, LeaseDuration) == 48, "LeaseDuration");
static_assert(sizeof(SMB2_CREATE_DURABLE_CONTEXT) == 40, "durable context is 40 bytes");
static_assert(sizeof(SMB2_CLOSE_REQUEST) == 92, "CLOSE request");
static_assert(offsetof(SMB2_CLOSE_REQUEST, Flags) == 70, "CLOSE Flags offset");
static_assert(offsetof(SMB2_CLOSE_REQUEST, FileId) == 76, "CLOSE FileId offset");
static_assert(sizeof(SMB2_READ_REQUEST) == 119, "READ request fixed part");
static_assert(offsetof(SMB2_READ_REQUEST, Padding) == 70, "READ Padding offset");
static_assert(offsetof(SMB2_READ_REQUEST, Length) == 72, "READ Length offset");
static_assert(offsetof(SMB2_READ_REQUEST, Offset) == 76, "READ Offset offset");
static_assert(offsetof(SMB2_READ_REQUEST, FileId) == 84, "READ FileId offset");
static_assert(offsetof(SMB2_READ_REQUEST, MinimumCount) == 100, "READ MinimumCount offset");
static_assert(offsetof(SMB2_READ_REQUEST, Channel) == 104, "READ Channel offset");
static_assert(offsetof(SMB2_READ_REQUEST, RemainingBytes) == 108, "READ RemainingBytes");
static_assert(offsetof(SMB2_READ_REQUEST, ReadChannelInfoOffset) == 112, "READ channel offset");
static_assert(offsetof(SMB2_READ_REQUEST, ReadChannelInfoLength) == 114, "READ channel length");
static_assert(sizeof(SMB2_READ_RESPONSE_BODY) == 16, "READ response fixed body");
static_assert(offsetof(SMB2_READ_RESPONSE_BODY, DataLength) == 4, "DataLength offset");
static_assert(offsetof(SMB2_READ_RESPONSE_BODY, DataRemaining) == 8, "DataRemaining offset");
static_assert(sizeof(SMB2_WRITE_REQUEST) == 116, "WRITE request fixed part");
static_assert(offsetof(SMB2_WRITE_REQUEST, DataOffset) == 70, "WRITE DataOffset offset");
static_assert(offsetof(SMB2_WRITE_REQUEST, Length) == 72, "WRITE Length offset");
static_assert(offsetof(SMB2_WRITE_REQUEST, Offset) == 76, "WRITE Offset offset");
static_assert(offsetof(SMB2_WRITE_REQUEST, FileId) == 84, "WRITE FileId offset");
static_assert(offsetof(SMB2_WRITE_REQUEST, Channel) == 100, "WRITE Channel offset");
static_assert(offsetof(SMB2_WRITE_REQUEST, RemainingBytes) == 104, "WRITE RemainingBytes");
static_assert(offsetof(SMB2_WRITE_REQUEST, WriteChannelInfoOffset) == 108, "WRITE ch offset");
static_assert(offsetof(SMB2_WRITE_REQUEST, WriteChannelInfoLength) == 110, "WRITE ch length");
static_assert(offsetof(SMB2_WRITE_REQUEST, Flags) == 112, "WRITE Flags offset");
static_assert(sizeof(SMB2_WRITE_RESPONSE_BODY) == 16, "WRITE response fixed body");
static_assert(sizeof(SMB2_QUERY_INFO_REQUEST) == 109, "QUERY_INFO request fixed part");
static_assert(offsetof(SMB2_QUERY_INFO_REQUEST, InfoType) == 70, "InfoType offset");
static_assert(offsetof(SMB2_QUERY_INFO_REQUEST, FileInfoClass) == 71, "FileInfoClass offset");
static_assert(offsetof(SMB2_QUERY_INFO_REQUEST, OutputBufferLength) == 72, "output length");
static_assert(offsetof(SMB2_QUERY_INFO_REQUEST, InputBufferOffset) == 76, "input offset");
static_assert(offsetof(SMB2_QUERY_INFO_REQUEST, InputBufferLength) == 80, "input length");
static_assert(offsetof(SMB2_QUERY_INFO_REQUEST, AdditionalInformation) == 84, "additional");
static_assert(offsetof(SMB2_QUERY_INFO_REQUEST, Flags) == 88, "QUERY_INFO Flags offset");
static_assert(offsetof(SMB2_QUERY_INFO_REQUEST, FileId) == 92, "QUERY_INFO FileId offset");
static_assert(offsetof(SMB2_QUERY_INFO_REQUEST, Buffer) == 108, "QUERY_INFO buffer offset");
static_assert(sizeof(SMB2_QUERY_DIRECTORY_REQUEST) == 100, "QUERY_DIRECTORY fixed part");
static_assert(offsetof(SMB2_QUERY_DIRECTORY_REQUEST, FileInformationClass) == 70, "class");
static_assert(offsetof(SMB2_QUERY_DIRECTORY_REQUEST, Flags) == 71, "QUERY_DIRECTORY Flags");
static_assert(offsetof(SMB2_QUERY_DIRECTORY_REQUEST, FileIndex) == 72, "FileIndex offset");
static_assert(offsetof(SMB2_QUERY_DIRECTORY_REQUEST, FileId) == 76, "QUERY_DIRECTORY FileId");
static_assert(offsetof(SMB2_QUERY_DIRECTORY_REQUEST, FileNameOffset) == 92, "name offset");
static_assert(offsetof(SMB2_QUERY_DIRECTORY_REQUEST, FileNameLength) == 94, "name length");
static_assert(offsetof(SMB2_QUERY_DIRECTORY_REQUEST, OutputBufferLength) == 96, "output length");
static_assert(sizeof(SMB2_QUERY_RESPONSE_BODY) == 8, "query response fixed body");
static_assert(offsetof(SMB2_QUERY_RESPONSE_BODY, OutputBufferLength) == 4, "output length");
static_assert(sizeof(SMB2_CREATE_RESPONSE) == 156, "CREATE response header and body");
static_assert(sizeof(SMB2_QUERY_RESPONSE) == 76, "query response header and body");

// FileFullDirectoryInformation entry: the fixed part before the name.
#pragma pack(push, 1)
struct SMB2_FULL_DIR_ENTRY {
  UINT32 NextEntryOffset;
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
};
#pragma pack(pop)
static_assert(offsetof(SMB2_FULL_DIR_ENTRY, FileIndex) == 4, "entry FileIndex offset");
static_assert(offsetof(SMB2_FULL_DIR_ENTRY, EndOfFile) == 40, "entry EndOfFile offset");
static_assert(offsetof(SMB2_FULL_DIR_ENTRY, FileAttributes) == 56, "entry attributes offset");
static_assert(offsetof(SMB2_FULL_DIR_ENTRY, FileNameLength) == 60, "entry name length offset");
static_assert(sizeof(SMB2_FULL_DIR_ENTRY) == 68, "the name follows at 68");
// Where an entry's name begins.
constexpr UINT32 SMB2_FULL_DIR_NAME = sizeof(SMB2_FULL_DIR_ENTRY);

// ---------------------------------------------------------------------------
// Constants
// ---------------------------------------------------------------------------
// CREATE accepts names shorter than this many characters.
constexpr UINTN SMB2_FILE_NAME_LIMIT = 255;
constexpr UINT16 SMB2_CREATE_NAME_OFFSET = 120; // from the SMB2 header
constexpr UINT32 SMB2_CREATE_NAME_ALIGN = 8;
constexpr UINT32 SMB2_CREATE_TRAILER = 2; // zero bytes after the contexts
constexpr UINT32 SMB2_LEASE_CONTEXT_SIZE = sizeof(SMB2_CREATE_LEASE_CONTEXT);
constexpr UINT32 SMB2_DURABLE_CONTEXT_SIZE = sizeof(SMB2_CREATE_DURABLE_CONTEXT);
constexpr UINT32 SMB2_GLOBAL_CAP_LEASING = 0x2;

constexpr UINT8 SMB2_OPLOCK_LEVEL_NONE = 0;
constexpr UINT8 SMB2_OPLOCK_LEVEL_II = 1;
constexpr UINT8 SMB2_OPLOCK_LEVEL_EXCLUSIVE = 8;
constexpr UINT8 SMB2_OPLOCK_LEVEL_BATCH = 9;

constexpr UINT16 SMB2_WRITE_DATA_OFFSET = 112; // from the SMB2 header
constexpr UINT32 SMB2_QUERY_INFO_OUTPUT_LENGTH = 8293;
// The input buffer's offset from the SMB2 header: right behind the fixed part.
constexpr UINT16 SMB2_QUERY_INFO_INPUT_OFFSET = offsetof(SMB2_QUERY_INFO_REQUEST, Buffer) - 4;
constexpr UINT32 SMB2_QUERY_DIRECTORY_OUTPUT_LENGTH = 16384;
// Room kept for alignment padding between a query answer's fixed body and
// its output.
constexpr UINT32 SMB2_QUERY_OUTPUT_PADDING = 8;
constexpr UINT16 SMB2_QUERY_DIRECTORY_NAME_OFFSET = 96; // from the SMB2 header
// Extra zeroed bytes behind a stored directory answer.
constexpr UINT32 SMB2_DIR_INFO_SLACK = 72;

constexpr UINT8 SMB2_INFO_FILE = 1;
constexpr UINT8 SMB2_INFO_FILESYSTEM = 2;
constexpr UINT8 FILE_DIRECTORY_INFORMATION = 1;
constexpr UINT8 FILE_FULL_DIRECTORY_INFORMATION = 2;
constexpr UINT8 FILE_BASIC_INFORMATION = 4;
constexpr UINT8 FILE_STANDARD_INFORMATION = 5;
constexpr UINT8 FILE_INTERNAL_INFORMATION = 6;
constexpr UINT8 FILE_ACCESS_INFORMATION = 8;
constexpr UINT8 FILE_ALL_INFORMATION = 18;
constexpr UINT8 FILE_END_OF_FILE_INFORMATION = 20;
constexpr UINT8 FILE_FS_SIZE_INFORMATION = 3;

// ---------------------------------------------------------------------------
// The file operations. Each runs one command through the exchange path: it
// checks its arguments and the socket (else "gSMB2SockFd is 0!" and
// EFI_NOT_FOUND), runs the exchange, copies the transport status into
// FileAccessDetails and maps the command's code naming the half that failed.
// ---------------------------------------------------------------------------
EFI_STATUS SMB2_Open(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                     FILE_ACCESS_DETAILS *Access);
EFI_STATUS SMB2_Close(FILE_ACCESS_DETAILS *Access);
// READ and WRITE move at most one request's worth per call. The channel info
// travels in a query record's input buffer (length and bytes); callers pass
// a record whose length is 0.
EFI_STATUS SMB2_Read(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                     const QUERY_DETAILS *ChannelInfo, FILE_ACCESS_DETAILS *Access, void *Data);
EFI_STATUS SMB2_Write(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                      const QUERY_DETAILS *ChannelInfo, FILE_ACCESS_DETAILS *Access,
                      const void *Data);
EFI_STATUS SMB2_FSInfo(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                       const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access);
EFI_STATUS SMB2_DirInfo(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                        const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access);

// ---------------------------------------------------------------------------
// The commands: what their encoders and decoders work on, and the command
// records the operations run.
// ---------------------------------------------------------------------------
struct SMB2_FILE_CONTEXT {
  FILE_ACCESS_DETAILS *Access;
  const QUERY_DETAILS *Query; // QUERY_INFO, QUERY_DIRECTORY; channel info of READ
  void *Data;                 // READ destination, WRITE source
  union {
    SMB2_CREATE_REQUEST Create;
    SMB2_CLOSE_REQUEST Close;
    SMB2_READ_REQUEST Read;
    SMB2_WRITE_REQUEST Write;
    SMB2_QUERY_INFO_REQUEST QueryInfo;
    SMB2_QUERY_DIRECTORY_REQUEST QueryDirectory;
  } Packet;
  UINT8 *Allocated; // a buffer the encoder made for this request (name, channel info)
  const struct SMB2_QUERY_ANSWER_TEXTS *Answer; // QUERY_INFO, QUERY_DIRECTORY
};
extern const SMB2_COMMAND gSMB2CreateCommand;
extern const SMB2_COMMAND gSMB2CloseCommand;
extern const SMB2_COMMAND gSMB2ReadCommand;
extern const SMB2_COMMAND gSMB2WriteCommand;
extern const SMB2_COMMAND gSMB2QueryInfoCommand;
extern const SMB2_COMMAND gSMB2QueryDirectoryCommand;

// Dialects 2.0.2 and 2.1 know no channels: READ and WRITE send none.
inline bool SMB2DialectWithoutChannels(UINT16 Dialect) {
  return Dialect == SMB2_DIALECT_202 || Dialect == SMB2_DIALECT_210;
}
// True when all 16 bytes of a file id are zero (no file open).
bool SMB2IsZeroFileId(const UINT8 *FileId);
// The code an encoder returns for its packet construct's Status: 0, or (with
// "<Failed>" reported under the request half's name) invalid parameter, no
// memory, or unsuccessful.
UINT32 SMB2ConstructResult(EFI_STATUS Status, const CHAR8 *Failed, const CHAR8 *RequestName,
                           UINT32 Line = __builtin_LINE());

// ---------------------------------------------------------------------------
// CREATE and CLOSE
// ---------------------------------------------------------------------------
// Fills the 124-byte fixed part, allocates the padded UTF-16 name (*Name,
// *NameSize bytes, null for the root) and builds the create contexts.
EFI_STATUS SMB2CreateContextRequestPacketConstruct(SMB2_CREATE_REQUEST *Packet,
                                                   const TRANSACT_DETAILS *Details,
                                                   FILE_ACCESS_DETAILS *Access, UINT8 **Name,
                                                   UINT32 *NameSize, UINT32 *TotalBytes);
EFI_STATUS SMB2CreateLeaseBuf(const UINT8 *LeaseKey, UINT8 OplockLevel, UINT8 **Context);
EFI_STATUS SMB2CreateDurableBuf(const UINT8 *LeaseKey, UINT8 OplockLevel, UINT8 **Context);
EFI_STATUS SMB2VerifyCreateResponse(const SMB2_CREATE_RESPONSE *Packet,
                                    const TRANSACT_DETAILS *Details, FILE_ACCESS_DETAILS *Access);
EFI_STATUS SMB2ClosePacketConstruct(SMB2_CLOSE_REQUEST *Packet, const TRANSACT_DETAILS *Details,
                                    const FILE_ACCESS_DETAILS *Access);
// Frees the create contexts the record references and clears their
// pointers and lengths.
void SMB2FreeCreateContexts(FILE_ACCESS_DETAILS *Access);

// ---------------------------------------------------------------------------
// READ and WRITE
// ---------------------------------------------------------------------------
EFI_STATUS SMB2ReadPacketConstruct(SMB2_READ_REQUEST *Packet, const TRANSACT_DETAILS *Details,
                                   FILE_ACCESS_DETAILS *Access, UINT8 **ChannelCopy,
                                   UINT32 *TotalBytes);
EFI_STATUS SMB2WritePacketConstruct(SMB2_WRITE_REQUEST *Packet, const TRANSACT_DETAILS *Details,
                                    const FILE_ACCESS_DETAILS *Access, UINT32 *TotalBytes);

// ---------------------------------------------------------------------------
// QUERY_INFO and QUERY_DIRECTORY
// ---------------------------------------------------------------------------
EFI_STATUS SMB2QueryInfoPacketConstruct(SMB2_QUERY_INFO_REQUEST *Packet,
                                        const TRANSACT_DETAILS *Details, const QUERY_DETAILS *Query,
                                        const FILE_ACCESS_DETAILS *Access, UINT32 *TotalBytes);
EFI_STATUS SMB2QueryDirPacketConstruct(SMB2_QUERY_DIRECTORY_REQUEST *Packet,
                                       const TRANSACT_DETAILS *Details, const QUERY_DETAILS *Query,
                                       const FILE_ACCESS_DETAILS *Access, UINT32 *TotalBytes);
// Stores an answer of Packet->Body.OutputBufferLength bytes at Output into
// the record's result fields. A fixed-size class whose answer is shorter
// than the class's structure is refused (EFI_PROTOCOL_ERROR).
EFI_STATUS SMB2VerifyInfoStructure(const SMB2_QUERY_RESPONSE *Packet, UINT8 *Output,
                                   const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access);
// What distinguishes the two kinds of query answer: the most output the
// request allowed and the texts of an empty and of a refused answer.
struct SMB2_QUERY_ANSWER_TEXTS {
  UINT32 Limit;
  const CHAR8 *Empty;
  const CHAR8 *Failed;
  const CHAR8 *LogonFailed;
  const CHAR8 *Function; // the answer half the lines name
};
extern const SMB2_QUERY_ANSWER_TEXTS gSMB2QueryInfoTexts;
extern const SMB2_QUERY_ANSWER_TEXTS gSMB2QueryDirectoryTexts;
// The decoder of both: a QUERY_INFO or QUERY_DIRECTORY answer (with the
// context's texts); the output must fit what arrived and the limit, and is
// stored with SMB2VerifyInfoStructure.
UINT32 SMB2DecodeQueryAnswer(void *Context, const SMB2_RESPONSE *Answer);

// ---------------------------------------------------------------------------
// Directory nodes
// ---------------------------------------------------------------------------
EFI_STATUS SMB2_CreateDirNode(SMB2_DIR_NODE **Node, UINTN Size);
// Appends Node at the end of the list at *Head.
EFI_STATUS SMB2_AddDirNode(SMB2_DIR_NODE **Head, SMB2_DIR_NODE *Node);
// Copies one FileFullDirectoryInformation entry (its fixed part and
// FileNameLength name bytes, which the caller has checked lie inside the
// answer) into a node.
EFI_STATUS SMB2_PopulateDirInfo(const UINT8 *Entry, SMB2_DIR_NODE *Node);
// Turns the answer held by Access->FullDirInfoPtr into nodes appended at
// *Head, checking every entry against the answer's bounds, and releases the
// answer copy whatever the outcome. Without an answer it succeeds and
// appends nothing.
EFI_STATUS SMB2WalkDirectoryAnswer(FILE_ACCESS_DETAILS *Access, SMB2_DIR_NODE **Head);
