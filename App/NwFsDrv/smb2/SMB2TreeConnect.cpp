// TREE_CONNECT to the share path, and the two teardown exchanges that
// share one 72-byte request layout: TREE_DISCONNECT and LOGOFF.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Session.h"

namespace {

constexpr UINT16 kTreePathOffset = sizeof(SMB2_TREE_CONNECT_REQUEST) - SMB2_STREAM_PREFIX_SIZE;
constexpr UINT32 kTreeResponseBody = sizeof(SMB2_TREE_CONNECT_RESPONSE) - SMB2_FRAMED_HEADER_SIZE;
constexpr UINT32 kPathTerminatorBytes = 2;

void SimpleRequestConstruct(SMB2_SIMPLE_REQUEST *Request, UINT16 Command, UINT16 StructureSize,
                            const TRANSACT_DETAILS *Details) {
  SMB2HeaderConstruct(&Request->Header);
  SMB2HeaderFill(&Request->Header, Command, sizeof(*Request), Details);
  Request->StructureSize = StructureSize;
  Request->Reserved = 0;
}

// Raises the message id, builds and sends a TREE_DISCONNECT or LOGOFF.
UINT32 SimpleRequest(UINT16 Command, TRANSACT_DETAILS *Details, INT32 SockFd) {
  if (Details == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  Details->MessageId++;
  SMB2_SIMPLE_REQUEST Request;
  EFI_STATUS Status = Command == SMB2_LOGOFF ? SMB2LogOffPacketConstruct(&Request, Details)
                                             : SMB2TreeDisconnectPacketConstruct(&Request, Details);
  if (EFI_ERROR(Status)) {
    DiagError(Command == SMB2_LOGOFF ? "SMB2LogOffPacketConstruct failed!"
                                     : "SMB2TreeDisconnectPacketConstruct failed!",
              Status);
    return STATUS_UNSUCCESSFUL;
  }
  UINT32 Sent = SMB2SendRequest(SockFd, &Request, sizeof(Request), &Details->TransportStatus);
  if (Sent != SMB2_NT_SUCCESS) {
    Smb2Log(DIAG_ALWAYS,
            Command == SMB2_LOGOFF
                ? "Function: %s, Line no.: = %d, Logoff request send failed! Status = 0x%x (%d)\n"
                : "Function: %s, Line no.: = %d, Tree disconnect send failed! Status = 0x%x (%d)\n",
            __func__, __LINE__, Sent, Sent);
  }
  return SMB2SendVerdict(Sent);
}

// Reads a TREE_DISCONNECT or LOGOFF response: the checked header, then the
// rest of the message, which carries nothing the client uses.
UINT32 SimpleResponse(TRANSACT_DETAILS *Details, INT32 SockFd, const CHAR8 *Function) {
  if (Details == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  SMB2_HEADER Header;
  UINT32 Nt = STATUS_UNSUCCESSFUL;
  EFI_STATUS Status = SMB2ReadVerifyHeader(&Header, Details, SockFd, &Nt);
  if (EFI_ERROR(Status)) {
    if (Status == EFI_PROTOCOL_ERROR) {
      SMB2PrintReceiveFailure(Details->TransportStatus, Function, __LINE__);
    }
  } else if (SMB2DrainBytes(SockFd, SMB2BodyLength(&Header), Details) != SMB2_NT_SUCCESS) {
    Nt = STATUS_UNSUCCESSFUL;
  }
  Smb2Log(DIAG_TRACE, "Exiting %s, Status = 0x%lx\n", Function, static_cast<UINT64>(Nt));
  return Nt;
}

} // namespace

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
  UINT32 Length = PathLength + sizeof(SMB2_TREE_CONNECT_REQUEST) + kPathTerminatorBytes;
  SMB2_TREE_CONNECT_REQUEST *Request = reinterpret_cast<SMB2_TREE_CONNECT_REQUEST *>(Buffer);
  SMB2HeaderConstruct(&Request->Header);
  SMB2HeaderFill(&Request->Header, SMB2_TREE_CONNECT, Length, Details);
  Request->StructureSize = SMB2_TREE_CONNECT_STRUCTURE_SIZE;
  Request->Reserved = 0;
  Request->PathOffset = kTreePathOffset;
  Request->PathLength = PathLength;
  *Packet = Buffer;
  *Total = Length;
  return EFI_SUCCESS;
}

UINT32 SMB2TreeConnectRequest(const CHAR8 *SharePath, TRANSACT_DETAILS *Details, INT32 SockFd) {
  if (SharePath == nullptr || Details == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  UINT8 *Packet = nullptr;
  UINT32 Total = 0;
  EFI_STATUS Status = SMB2TreeConnectPacketConstruct(SharePath, Details, &Packet, &Total);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2TreeConnectPacketConstruct failed!", Status);
    return Status == EFI_OUT_OF_RESOURCES ? STATUS_NO_MEMORY : STATUS_UNSUCCESSFUL;
  }
  UINT32 Sent = SMB2SendAndFree(SockFd, Packet, Total, &Details->TransportStatus);
  if (Sent != SMB2_NT_SUCCESS) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Tree connect request send failed! Status = 0x%x (%d)\n",
            __func__, __LINE__, Sent, Sent);
  }
  return SMB2SendVerdict(Sent);
}

UINT32 SMB2TreeConnectResponse(TRANSACT_DETAILS *Details, INT32 SockFd) {
  if (Details == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  SMB2_TREE_CONNECT_RESPONSE Response;
  UINT32 Nt = STATUS_UNSUCCESSFUL;
  EFI_STATUS Status = SMB2ReadVerifyHeader(&Response.Header, Details, SockFd, &Nt);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2ReadVerifyHeader failed!", Status);
    return Nt;
  }
  UINT32 Body = SMB2BodyLength(&Response.Header);
  if (Body < kTreeResponseBody) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Tree connect response of 0x%x bytes is too short!\n",
            __func__, __LINE__, Body);
    SMB2DrainBytes(SockFd, Body, Details);
    return STATUS_UNSUCCESSFUL;
  }
  UINT8 *Fixed = reinterpret_cast<UINT8 *>(&Response) + SMB2_FRAMED_HEADER_SIZE;
  if (SMB2ReceiveAll(SockFd, Fixed, kTreeResponseBody, Details) != 0 ||
      SMB2DrainBytes(SockFd, Body - kTreeResponseBody, Details) != SMB2_NT_SUCCESS) {
    SMB2PrintReceiveFailure(Details->TransportStatus);
    return STATUS_UNSUCCESSFUL;
  }
  // The share's type, flags, capabilities and access are shown, not kept.
  Smb2Log(DIAG_VERBOSE, "TreeConnectResp->ShareType = 0x%x\n", Response.ShareType);
  Smb2Log(DIAG_VERBOSE, "TreeConnectResp->ShareFlags = 0x%x\n", Response.ShareFlags);
  Smb2Log(DIAG_VERBOSE, "TreeConnectResp->Capabilities = 0x%x\n", Response.Capabilities);
  Smb2Log(DIAG_VERBOSE, "TreeConnectResp->MaximalAccess = 0x%x\n", Response.MaximalAccess);
  Details->TreeId = Response.Header.TreeId;
  Smb2Log(DIAG_VERBOSE, "TransactDetails->TreeId = 0x%x\n", Details->TreeId);
  return SMB2_NT_SUCCESS;
}

UINT32 SMB2TreeConnect(const CHAR8 *SharePath, TRANSACT_DETAILS *Details, INT32 SockFd) {
  DiagEntry(DiagChannel::Smb2);
  UINT32 Nt = SMB2TreeConnectRequest(SharePath, Details, SockFd);
  EFI_STATUS Status = SMB2MapNtStatus(Nt, "SMB2TreeConnectRequest");
  if (!EFI_ERROR(Status)) {
    Nt = SMB2TreeConnectResponse(Details, SockFd);
    Status = SMB2MapNtStatus(Nt, "SMB2TreeConnectResponse");
  }
  if (!EFI_ERROR(Status)) {
    SMB2ConnectionState = SMB2_STATE_TREE;
  }
  DiagExit(Status, DiagChannel::Smb2);
  return Nt;
}

EFI_STATUS SMB2TreeDisconnectPacketConstruct(SMB2_SIMPLE_REQUEST *Request,
                                             const TRANSACT_DETAILS *Details) {
  if (Request == nullptr || Details == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  SimpleRequestConstruct(Request, SMB2_TREE_DISCONNECT, SMB2_TREE_DISCONNECT_STRUCTURE_SIZE,
                         Details);
  Smb2Log(DIAG_VERBOSE, "SMB2_TREE_DISCONNECT_STRUCTURE_SIZE = 0x%x\n", Request->StructureSize);
  return EFI_SUCCESS;
}

EFI_STATUS SMB2LogOffPacketConstruct(SMB2_SIMPLE_REQUEST *Request,
                                     const TRANSACT_DETAILS *Details) {
  if (Request == nullptr || Details == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  SimpleRequestConstruct(Request, SMB2_LOGOFF, SMB2_LOGOFF_STRUCTURE_SIZE, Details);
  Smb2Log(DIAG_VERBOSE, "SMB2_LOGOFF_STRUCTURE_SIZE = 0x%x\n", Request->StructureSize);
  return EFI_SUCCESS;
}

UINT32 SMB2TreeDisconnectRequest(TRANSACT_DETAILS *Details, INT32 SockFd) {
  return SimpleRequest(SMB2_TREE_DISCONNECT, Details, SockFd);
}

UINT32 SMB2TreeDisconnectResponse(TRANSACT_DETAILS *Details, INT32 SockFd) {
  return SimpleResponse(Details, SockFd, __func__);
}

UINT32 SMB2LogOffRequest(TRANSACT_DETAILS *Details, INT32 SockFd) {
  return SimpleRequest(SMB2_LOGOFF, Details, SockFd);
}

UINT32 SMB2LogOffResponse(TRANSACT_DETAILS *Details, INT32 SockFd) {
  return SimpleResponse(Details, SockFd, __func__);
}

UINT32 SMB2TreeDisconnect(TRANSACT_DETAILS *Details, INT32 SockFd) {
  UINT32 Nt = SMB2TreeDisconnectRequest(Details, SockFd);
  if (EFI_ERROR(SMB2MapNtStatus(Nt, "SMB2TreeDisconnectRequest"))) {
    return Nt;
  }
  Nt = SMB2TreeDisconnectResponse(Details, SockFd);
  if (!EFI_ERROR(SMB2MapNtStatus(Nt, "SMB2TreeDisconnectResponse"))) {
    SMB2ConnectionState = SMB2_STATE_TREE_DISCONNECTED;
  }
  return Nt;
}

UINT32 SMB2LogOff(TRANSACT_DETAILS *Details, INT32 SockFd) {
  UINT32 Nt = SMB2LogOffRequest(Details, SockFd);
  if (EFI_ERROR(SMB2MapNtStatus(Nt, "SMB2LogOffRequest"))) {
    return Nt;
  }
  Nt = SMB2LogOffResponse(Details, SockFd);
  if (!EFI_ERROR(SMB2MapNtStatus(Nt, "SMB2LogOffResponse"))) {
    SMB2ConnectionState = SMB2_STATE_LOGGED_OFF;
  }
  return Nt;
}
