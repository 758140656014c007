// SMB2 QUERY_DIRECTORY: one request per listing (at most one 16384-byte
// answer, by design): the encoder, the decoder, and the walk that turns the
// answer into directory nodes.
//
// The walk trusts nothing in the answer: every entry's fixed part and name
// must lie inside the answer, a name (UTF-16, so an even number of bytes)
// must fit inside its own entry, and
// NextEntryOffset must lead forward past the current entry to a point
// inside the answer. Offsets are summed in 64 bits, so no value can wrap
// back onto an earlier entry; since each step moves forward by at least one
// entry's fixed part, the walk always ends.
#include "smb2/SMB2FileAccess.h"

#include "DiagLog.h"
#include "NwBaseLib.h"

namespace {

// Names longer than this many bytes end a listing (so more than 127 UTF-16
// characters), deliberately tested on the byte count.
constexpr UINT32 kNameLimit = 255;
// SMB2_PopulateDirInfo refuses names from this many bytes on.
constexpr UINT32 kNodeNameRefusal = 511;
constexpr UINT32 kNodeNameField = sizeof(static_cast<SMB2_DIR_NODE *>(nullptr)->FileName);

UINTN ComputedNodeSize(UINT32 NameLength) {
  return (static_cast<UINTN>(NameLength) + 71 + 7) / 8 * 8;
}

// Checks the entry at Offset of an answer of Length bytes. Returns
// EFI_SUCCESS and the entry's NextEntryOffset when it may be used.
EFI_STATUS CheckEntry(const UINT8 *Base, UINT64 Length, UINT64 Offset, UINT32 *Next) {
  if (Offset + SMB2_FULL_DIR_NAME > Length) {
    Smb2Log(DIAG_ALWAYS, "Error! Directory entry at offset %ld runs past the answer of %ld bytes\n",
            static_cast<INT64>(Offset), static_cast<INT64>(Length));
    return EFI_PROTOCOL_ERROR;
  }
  const UINT8 *Entry = Base + Offset;
  UINT32 NameLength = SMB2ReadLe32(Entry + offsetof(SMB2_FULL_DIR_ENTRY, FileNameLength));
  *Next = SMB2ReadLe32(Entry + offsetof(SMB2_FULL_DIR_ENTRY, NextEntryOffset));
  if (NameLength > kNameLimit) {
    Smb2Log(DIAG_ALWAYS, "Error! FileNameLength %d is greater than limited %d length\n", NameLength,
            kNameLimit);
    return EFI_SECURITY_VIOLATION;
  }
  if (NameLength % 2 != 0) {
    Smb2Log(DIAG_ALWAYS, "Error! FileNameLength %u of the entry at offset %ld is odd\n", NameLength,
            static_cast<INT64>(Offset));
    return EFI_PROTOCOL_ERROR;
  }
  UINT64 EntryRoom = *Next != 0 ? *Next : Length - Offset;
  if (SMB2_FULL_DIR_NAME + static_cast<UINT64>(NameLength) > EntryRoom ||
      Offset + SMB2_FULL_DIR_NAME + NameLength > Length) {
    Smb2Log(DIAG_ALWAYS,
            "Error! FileNameLength %u runs past its entry at offset %ld (entry %ld, answer %ld "
            "bytes)\n",
            NameLength, static_cast<INT64>(Offset), static_cast<INT64>(EntryRoom),
            static_cast<INT64>(Length));
    return EFI_PROTOCOL_ERROR;
  }
  if (*Next != 0 && Offset + *Next >= Length) {
    Smb2Log(DIAG_ALWAYS,
            "Error! NextEntryOffset %u at offset %ld points outside the answer of %ld bytes\n",
            *Next, static_cast<INT64>(Offset), static_cast<INT64>(Length));
    return EFI_PROTOCOL_ERROR;
  }
  return EFI_SUCCESS;
}

// Makes one node of a checked entry and appends it.
EFI_STATUS AppendEntry(const UINT8 *Entry, SMB2_DIR_NODE **Head) {
  UINT32 NameLength = SMB2ReadLe32(Entry + offsetof(SMB2_FULL_DIR_ENTRY, FileNameLength));
  UINTN NodeSize = ComputedNodeSize(NameLength);
  Smb2Log(DIAG_VERBOSE, "NodeSize = %ld\n", static_cast<INT64>(NodeSize));
  Smb2Log(DIAG_VERBOSE, "TotalNodeSize = %ld\n", static_cast<INT64>(NodeSize));
  SMB2_DIR_NODE *Node = nullptr;
  EFI_STATUS Status = SMB2_CreateDirNode(&Node, NodeSize);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2_CreateDirNode failed!", Status);
    return Status;
  }
  Status = SMB2_AddDirNode(Head, Node);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2_AddDirNode failed!", Status);
    FreePool(Node);
    return Status;
  }
  return SMB2_PopulateDirInfo(Entry, Node);
}

UINT32 EncodeQueryDirectory(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  SMB2_QUERY_DIRECTORY_REQUEST *Packet = &File->Packet.QueryDirectory;
  UINT32 Total = 0;
  UINT32 Code = SMB2ConstructResult(
      SMB2QueryDirPacketConstruct(Packet, Details, File->Query, File->Access, &Total),
      "SMB2QueryDirPacketConstruct failed!", "SMB2QueryDirInfoRequest");
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
  }
  SMB2LayRequest(Request, Packet, sizeof(*Packet), Total);
  SMB2AddPiece(Request, File->Query->Buffer, Packet->FileNameLength);
  return SMB2_NT_SUCCESS;
}

} // namespace

const SMB2_COMMAND gSMB2QueryDirectoryCommand = {
    SMB2_QUERY_DIRECTORY,
    0,
    sizeof(SMB2_QUERY_RESPONSE_BODY),
    SMB2_QUERY_DIRECTORY_OUTPUT_LENGTH + SMB2_QUERY_OUTPUT_PADDING,
    "SMB2QueryDirInfoRequest",
    "SMB2QueryDirInfoResponse",
    "Query Directory request send failed!",
    &gSMB2FileReceiveTexts,
    EncodeQueryDirectory,
    nullptr,
    SMB2DecodeQueryAnswer,
};

const SMB2_QUERY_ANSWER_TEXTS gSMB2QueryDirectoryTexts = {
    SMB2_QUERY_DIRECTORY_OUTPUT_LENGTH, "QueryDirResp->OutputBufferLength is 0!\n",
    "SMB2VerifyQueryDirResponse failed!", "SMB2VerifyQueryDirResponse logon failed!",
    "SMB2QueryDirInfoResponse"};

// ---------------------------------------------------------------------------
// The exchange
// ---------------------------------------------------------------------------
EFI_STATUS SMB2QueryDirPacketConstruct(SMB2_QUERY_DIRECTORY_REQUEST *Packet,
                                       const TRANSACT_DETAILS *Details, const QUERY_DETAILS *Query,
                                       const FILE_ACCESS_DETAILS *Access, UINT32 *TotalBytes) {
  if (Packet == nullptr || Details == nullptr || Query == nullptr || Access == nullptr ||
      TotalBytes == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  bool WithPattern = Query->InputBufferLength != 0 && Query->Buffer != nullptr;
  UINT16 NameLength = WithPattern ? static_cast<UINT16>(Query->InputBufferLength) : 0;
  UINT32 Total = sizeof(SMB2_QUERY_DIRECTORY_REQUEST) + NameLength;
  ZeroMem(Packet, sizeof(*Packet));
  SMB2HeaderConstruct(&Packet->Header);
  Packet->StructureSize = SMB2_REQUEST_STRUCTURE_SIZE[SMB2_QUERY_DIRECTORY];
  Packet->FileInformationClass = Query->FileInfoClass;
  Packet->Flags = static_cast<UINT8>(Query->Flags);
  Packet->FileIndex = 0;
  CopyMem(Packet->FileId, Access->FileId, SMB2_FILE_ID_SIZE);
  Packet->FileNameOffset = WithPattern ? SMB2_QUERY_DIRECTORY_NAME_OFFSET : 0;
  Packet->FileNameLength = NameLength;
  Packet->OutputBufferLength = SMB2_QUERY_DIRECTORY_OUTPUT_LENGTH;
  Smb2Log(DIAG_VERBOSE, "Sending FileInformationClass = 0x%x\n", Query->FileInfoClass);
  *TotalBytes = Total;
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// Directory nodes
// ---------------------------------------------------------------------------
EFI_STATUS SMB2_CreateDirNode(SMB2_DIR_NODE **Node, UINTN Size) {
  if (Node == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  if (Size == 0) {
    Smb2Log(DIAG_ALWAYS, "Size is 0\n");
    return EFI_OUT_OF_RESOURCES;
  }
  // Every node takes the fixed allocation, whatever the computed size.
  *Node = static_cast<SMB2_DIR_NODE *>(AllocateZeroPool(SMB2_DIR_NODE_ALLOCATION));
  if (*Node == nullptr) {
    Smb2Log(DIAG_ALWAYS, "%05d %s Memory allocation failed!\n", __LINE__, __func__);
    return EFI_OUT_OF_RESOURCES;
  }
  return EFI_SUCCESS;
}

EFI_STATUS SMB2_AddDirNode(SMB2_DIR_NODE **Head, SMB2_DIR_NODE *Node) {
  if (Node == nullptr || Head == nullptr) {
    Smb2Log(DIAG_ALWAYS, "NewNode is NULL!\n");
    return EFI_INVALID_PARAMETER;
  }
  Node->Next = nullptr;
  SMB2_DIR_NODE **Link = Head;
  while (*Link != nullptr) {
    Link = &(*Link)->Next;
  }
  *Link = Node;
  return EFI_SUCCESS;
}

EFI_STATUS SMB2_PopulateDirInfo(const UINT8 *Entry, SMB2_DIR_NODE *Node) {
  if (Entry == nullptr || Node == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  UINT32 NameLength = SMB2ReadLe32(Entry + offsetof(SMB2_FULL_DIR_ENTRY, FileNameLength));
  if (NameLength >= kNodeNameRefusal) {
    return EFI_INVALID_PARAMETER;
  }
  Node->FileIndex = SMB2ReadLe32(Entry + offsetof(SMB2_FULL_DIR_ENTRY, FileIndex));
  Node->CreationTime = SMB2ReadLe64(Entry + offsetof(SMB2_FULL_DIR_ENTRY, CreationTime));
  Node->LastAccessTime = SMB2ReadLe64(Entry + offsetof(SMB2_FULL_DIR_ENTRY, LastAccessTime));
  Node->LastWriteTime = SMB2ReadLe64(Entry + offsetof(SMB2_FULL_DIR_ENTRY, LastWriteTime));
  Node->ChangeTime = SMB2ReadLe64(Entry + offsetof(SMB2_FULL_DIR_ENTRY, ChangeTime));
  Node->EndOfFile = SMB2ReadLe64(Entry + offsetof(SMB2_FULL_DIR_ENTRY, EndOfFile));
  Node->AllocationSize = SMB2ReadLe64(Entry + offsetof(SMB2_FULL_DIR_ENTRY, AllocationSize));
  Node->FileAttributes = SMB2ReadLe32(Entry + offsetof(SMB2_FULL_DIR_ENTRY, FileAttributes));
  Node->FileNameLength = NameLength;
  Node->EaSize = SMB2ReadLe32(Entry + offsetof(SMB2_FULL_DIR_ENTRY, EaSize));
  ZeroMem(Node->FileName, kNodeNameField);
  CopyMem(Node->FileName, Entry + SMB2_FULL_DIR_NAME, NameLength);
  Smb2Log(DIAG_VERBOSE, "File Length = %d\n", NameLength);
  return EFI_SUCCESS;
}

EFI_STATUS SMB2WalkDirectoryAnswer(FILE_ACCESS_DETAILS *Access, SMB2_DIR_NODE **Head) {
  if (Access == nullptr || Head == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  if (Access->FullDirInfoPtr == nullptr) {
    // No answer to walk (an empty output, or its copy could not be made):
    // the walk stops without nodes and without failing; the caller finds
    // the list empty.
    Smb2Log(DIAG_ALWAYS, "FileAccessDetails.FullDirInfoPtr is NULL!\n");
    return EFI_SUCCESS;
  }
  const UINT8 *Base = Access->FullDirInfoPtr;
  UINT64 Length = Access->FullDirInfoLength;
  UINT64 Offset = 0;
  UINT32 Count = 0;
  EFI_STATUS Status = EFI_SUCCESS;
  for (;;) {
    UINT32 Next = 0;
    Status = CheckEntry(Base, Length, Offset, &Next);
    if (EFI_ERROR(Status)) {
      break;
    }
    Count++;
    Status = AppendEntry(Base + Offset, Head);
    if (EFI_ERROR(Status) || Next == 0) {
      break;
    }
    Offset += Next;
  }
  Smb2Log(DIAG_VERBOSE, "DirListCnt = %d\n", Count);
  FreePool(Access->FullDirInfoPtr);
  Access->FullDirInfoPtr = nullptr;
  Access->FullDirInfoLength = 0;
  return Status;
}
