// TREE_CONNECT to the share path, and the two teardown exchanges that share
// one 72-byte request layout: TREE_DISCONNECT and LOGOFF. Their encoders and
// decoders.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Session.h"

namespace {

constexpr UINT16 kTreePathOffset = sizeof(SMB2_TREE_CONNECT_REQUEST) - SMB2_STREAM_PREFIX_SIZE;
constexpr UINT16 kTreeResponseBody = sizeof(SMB2_TREE_CONNECT_RESPONSE) - SMB2_FRAMED_HEADER_SIZE;
constexpr UINT32 kPathTerminatorBytes = 2;

void SimpleRequestConstruct(SMB2_SIMPLE_REQUEST *Request, UINT16 StructureSize) {
  ZeroMem(Request, sizeof(*Request));
  SMB2HeaderConstruct(&Request->Header);
  Request->StructureSize = StructureSize;
}

UINT32 EncodeTreeConnect(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  SMB2_TREE_CONTEXT *Tree = static_cast<SMB2_TREE_CONTEXT *>(Context);
  UINT32 Total = 0;
  EFI_STATUS Status =
      SMB2TreeConnectPacketConstruct(Tree->SharePath, Details, &Tree->Packet, &Total);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2TreeConnectPacketConstruct failed!", Status, "SMB2TreeConnectRequest", __LINE__);
    return Status == EFI_OUT_OF_RESOURCES ? STATUS_NO_MEMORY : STATUS_UNSUCCESSFUL;
  }
  SMB2LayRequest(Request, Tree->Packet, Total, Total);
  return SMB2_NT_SUCCESS;
}

UINT32 DecodeTreeConnect(void *Context, const SMB2_RESPONSE *Answer) {
  (void)Context;
  SMB2_TREE_CONNECT_RESPONSE Response;
  CopyMem(&Response.Header, &Answer->Header, sizeof(Response.Header));
  CopyMem(reinterpret_cast<UINT8 *>(&Response) + sizeof(SMB2_HEADER), Answer->Fixed,
          kTreeResponseBody);
  // The share's type, flags, capabilities and access are shown, not kept.
  Smb2Log(DIAG_VERBOSE, "TreeConnectResp->ShareType = 0x%x\n", Response.ShareType);
  Smb2Log(DIAG_VERBOSE, "TreeConnectResp->ShareFlags = 0x%x\n", Response.ShareFlags);
  Smb2Log(DIAG_VERBOSE, "TreeConnectResp->Capabilities = 0x%x\n", Response.Capabilities);
  Smb2Log(DIAG_VERBOSE, "TreeConnectResp->MaximalAccess = 0x%x\n", Response.MaximalAccess);
  TransactDetails.TreeId = Response.Header.TreeId;
  Smb2Log(DIAG_VERBOSE, "TransactDetails->TreeId = 0x%x\n", TransactDetails.TreeId);
  return SMB2_NT_SUCCESS;
}

// TREE_DISCONNECT and LOGOFF: the context is the caller's 72-byte request.
UINT32 EncodeSimple(void *Context, SMB2_REQUEST *Request,
                    EFI_STATUS (*Construct)(SMB2_SIMPLE_REQUEST *, const TRANSACT_DETAILS *),
                    const CHAR8 *Failed, const CHAR8 *Function) {
  SMB2_SIMPLE_REQUEST *Packet = static_cast<SMB2_SIMPLE_REQUEST *>(Context);
  EFI_STATUS Status = Construct(Packet, &TransactDetails);
  if (EFI_ERROR(Status)) {
    DiagError(Failed, Status, Function, __LINE__);
    return STATUS_UNSUCCESSFUL;
  }
  SMB2LayRequest(Request, Packet, sizeof(*Packet), sizeof(*Packet));
  return SMB2_NT_SUCCESS;
}

UINT32 EncodeTreeDisconnect(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  (void)Details;
  return EncodeSimple(Context, Request, SMB2TreeDisconnectPacketConstruct,
                      "SMB2TreeDisconnectPacketConstruct failed!", "SMB2TreeDisconnectRequest");
}

UINT32 EncodeLogOff(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  (void)Details;
  return EncodeSimple(Context, Request, SMB2LogOffPacketConstruct,
                      "SMB2LogOffPacketConstruct failed!", "SMB2LogOffRequest");
}

constexpr const CHAR8 *kReceiveFailed =
    "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Status = 0x%x\n";

const SMB2_RECEIVE_TEXTS kTeardownTexts = {
    nullptr, kReceiveFailed, nullptr, DIAG_ALWAYS, kReceiveFailed, false, nullptr,
};

} // namespace

const SMB2_COMMAND gSMB2TreeConnectCommand = {
    SMB2_TREE_CONNECT,
    SMB2_COMMAND_SESSION_CODES,
    kTreeResponseBody,
    0,
    "SMB2TreeConnectRequest",
    "SMB2TreeConnectResponse",
    "Tree connect request send failed!",
    &gSMB2SessionReceiveTexts,
    EncodeTreeConnect,
    nullptr,
    DecodeTreeConnect,
};

const SMB2_COMMAND gSMB2TreeDisconnectCommand = {
    SMB2_TREE_DISCONNECT,
    SMB2_COMMAND_SESSION_CODES,
    0,
    0,
    "SMB2TreeDisconnectRequest",
    "SMB2TreeDisconnectResponse",
    "Tree disconnect send failed!",
    &kTeardownTexts,
    EncodeTreeDisconnect,
    nullptr,
    SMB2DecodeNothing,
};

const SMB2_COMMAND gSMB2LogOffCommand = {
    SMB2_LOGOFF,
    SMB2_COMMAND_SESSION_CODES,
    0,
    0,
    "SMB2LogOffRequest",
    "SMB2LogOffResponse",
    "Logoff request send failed!",
    &kTeardownTexts,
    EncodeLogOff,
    nullptr,
    SMB2DecodeNothing,
};

EFI_STATUS SMB2TreeConnectPacketConstruct(const CHAR8 *SharePath, const TRANSACT_DETAILS *Details,
                                          UINT8 **Packet, UINT32 *Total) {
  if (SharePath == nullptr || Details == nullptr || Packet == nullptr || Total == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  UINTN Chars = AsciiStrnLen(SharePath, SMB2_SHARE_PATH_LIMIT);
  if (Chars >= SMB2_SHARE_PATH_LIMIT) {
    Smb2Log(
        DIAG_ALWAYS,
        "Function: %s, Line no.: = %d, Share name length %d is longer than expected length %d\n",
        __func__, __LINE__, static_cast<INT32>(AsciiStrLen(SharePath)),
        static_cast<INT32>(SMB2_SHARE_PATH_LIMIT));
    return EFI_INVALID_PARAMETER;
  }
  UINT32 Capacity =
      sizeof(SMB2_TREE_CONNECT_REQUEST) + static_cast<UINT32>(Chars) * 2 + kPathTerminatorBytes;
  UINT8 *Buffer = static_cast<UINT8 *>(AllocateZeroPool(Capacity + 1));
  if (Buffer == nullptr) {
    SMB2PrintAllocFailure();
    return EFI_OUT_OF_RESOURCES;
  }
  UINT16 PathLength = static_cast<UINT16>(
      strtoUTF16(Buffer + sizeof(SMB2_TREE_CONNECT_REQUEST), SharePath, Chars, "default") * 2);
  SMB2_TREE_CONNECT_REQUEST *Request = reinterpret_cast<SMB2_TREE_CONNECT_REQUEST *>(Buffer);
  SMB2HeaderConstruct(&Request->Header);
  Request->StructureSize = SMB2_REQUEST_STRUCTURE_SIZE[SMB2_TREE_CONNECT];
  Request->Reserved = 0;
  Request->PathOffset = kTreePathOffset;
  Request->PathLength = PathLength;
  *Packet = Buffer;
  *Total = PathLength + sizeof(SMB2_TREE_CONNECT_REQUEST) + kPathTerminatorBytes;
  return EFI_SUCCESS;
}

EFI_STATUS SMB2TreeDisconnectPacketConstruct(SMB2_SIMPLE_REQUEST *Request,
                                             const TRANSACT_DETAILS *Details) {
  if (Request == nullptr || Details == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  SimpleRequestConstruct(Request, SMB2_REQUEST_STRUCTURE_SIZE[SMB2_TREE_DISCONNECT]);
  Smb2Log(DIAG_VERBOSE, "SMB2_TREE_DISCONNECT_STRUCTURE_SIZE = 0x%x\n", Request->StructureSize);
  return EFI_SUCCESS;
}

EFI_STATUS SMB2LogOffPacketConstruct(SMB2_SIMPLE_REQUEST *Request,
                                     const TRANSACT_DETAILS *Details) {
  if (Request == nullptr || Details == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  SimpleRequestConstruct(Request, SMB2_REQUEST_STRUCTURE_SIZE[SMB2_LOGOFF]);
  Smb2Log(DIAG_VERBOSE, "SMB2_LOGOFF_STRUCTURE_SIZE = 0x%x\n", Request->StructureSize);
  return EFI_SUCCESS;
}
