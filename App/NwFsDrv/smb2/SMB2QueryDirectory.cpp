// SMB2 QUERY_DIRECTORY: one request per listing (at most one 16384-byte
// answer, by design), and the walk that turns the answer into directory
// nodes.
//
// The walk trusts nothing in the answer: every entry's fixed part and name
// must lie inside the answer, a name must fit inside its own entry, and
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
  UINT32 NameLength = SMB2ReadLe32(Entry + SMB2_FULL_DIR_NAME_LENGTH);
  *Next = SMB2ReadLe32(Entry + SMB2_FULL_DIR_NEXT_OFFSET);
  if (NameLength > kNameLimit) {
    Smb2Log(DIAG_ALWAYS, "Error! FileNameLength %d is greater than limited %d length\n", NameLength,
            kNameLimit);
    return EFI_SECURITY_VIOLATION;
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
  UINT32 NameLength = SMB2ReadLe32(Entry + SMB2_FULL_DIR_NAME_LENGTH);
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

} // namespace

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
  SMB2HeaderFill(&Packet->Header, SMB2_QUERY_DIRECTORY, Total, Details);
  Packet->StructureSize = SMB2_QUERY_DIRECTORY_STRUCTURE_SIZE;
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

UINT32 SMB2QueryDirInfoRequest(SMB2_QUERY_DIRECTORY_REQUEST *Packet, TRANSACT_DETAILS *Details,
                               const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access,
                               INT32 SockFd) {
  UINT32 Total = 0;
  EFI_STATUS Status = SMB2QueryDirPacketConstruct(Packet, Details, Query, Access, &Total);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2QueryDirPacketConstruct failed!", Status);
    return SMB2ConstructFailureCode(Status);
  }
  const SMB2_SEND_PIECE Pieces[] = {{Packet, sizeof(*Packet)},
                                    {Query->Buffer, Packet->FileNameLength}};
  SMB2TraceRequest(&Packet->Header, Total, 0);
  return SMB2SendFileRequest(SockFd, Pieces, Packet->FileNameLength != 0 ? 2 : 1, Total,
                             "Query Directory");
}

UINT32 SMB2QueryDirInfoResponse(SMB2_QUERY_RESPONSE *Packet, TRANSACT_DETAILS *Details,
                                const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access,
                                INT32 SockFd) {
  if (Packet == nullptr || Details == nullptr || Query == nullptr || Access == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  // A header status such as STATUS_NO_MORE_FILES fails the header check,
  // and with it the listing.
  const SMB2_QUERY_ANSWER_TEXTS Texts = {
      SMB2_QUERY_DIRECTORY_OUTPUT_LENGTH, "QueryDirResp->OutputBufferLength is 0!\n",
      "SMB2VerifyQueryDirResponse failed!", "SMB2VerifyQueryDirResponse logon failed!"};
  return SMB2ReadQueryResponse(SockFd, Packet, Query, Access, Texts);
}

EFI_STATUS SMB2_DirInfo(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                        const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access) {
  DiagEntry(DiagChannel::Smb2);
  if (Share == nullptr || Session == nullptr || Query == nullptr || Access == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  SMB2_QUERY_DIRECTORY_REQUEST Request;
  SMB2_QUERY_RESPONSE Response;
  EFI_STATUS Status = SMB2RunFileOperation(
      Access,
      [&] {
        return SMB2QueryDirInfoRequest(&Request, &TransactDetails, Query, Access, gSMB2SockFd);
      },
      "SMB2QueryDirInfoRequest",
      [&] {
        return SMB2QueryDirInfoResponse(&Response, &TransactDetails, Query, Access, gSMB2SockFd);
      },
      "SMB2QueryDirInfoResponse");
  Share->LastStatus = TransactDetails.ResponseStatus;
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
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
  UINT32 NameLength = SMB2ReadLe32(Entry + SMB2_FULL_DIR_NAME_LENGTH);
  if (NameLength >= kNodeNameRefusal) {
    return EFI_INVALID_PARAMETER;
  }
  Node->FileIndex = SMB2ReadLe32(Entry + SMB2_FULL_DIR_FILE_INDEX);
  Node->CreationTime = SMB2ReadLe64(Entry + SMB2_FULL_DIR_CREATION_TIME);
  Node->LastAccessTime = SMB2ReadLe64(Entry + SMB2_FULL_DIR_LAST_ACCESS_TIME);
  Node->LastWriteTime = SMB2ReadLe64(Entry + SMB2_FULL_DIR_LAST_WRITE_TIME);
  Node->ChangeTime = SMB2ReadLe64(Entry + SMB2_FULL_DIR_CHANGE_TIME);
  Node->EndOfFile = SMB2ReadLe64(Entry + SMB2_FULL_DIR_END_OF_FILE);
  Node->AllocationSize = SMB2ReadLe64(Entry + SMB2_FULL_DIR_ALLOCATION_SIZE);
  Node->FileAttributes = SMB2ReadLe32(Entry + SMB2_FULL_DIR_ATTRIBUTES);
  Node->FileNameLength = NameLength;
  Node->EaSize = SMB2ReadLe32(Entry + SMB2_FULL_DIR_EA_SIZE);
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
