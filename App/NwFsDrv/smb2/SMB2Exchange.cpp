// The one exchange path of the SMB2 client (see SMB2Exchange.h).
//
// Every byte of an answer is read through one frame reader that knows how
// much of the announced frame is left, so that no read ever runs into the
// next message and whatever the command does not take is drained before the
// next exchange.
#include "smb2/SMB2Exchange.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "NwPlatform.h"
#include "smb2/SMB2Signing.h"

SMB2_REQUEST_TRACE gSMB2RequestTrace[SMB2_REQUEST_TRACE_SLOTS];
UINT64 gSMB2RequestCount;

namespace {

// 0 while the connection is healthy, else the code it broke with.
UINT32 gBrokenCode;

void MarkBroken(UINT32 Code) {
  if (gBrokenCode == SMB2_NT_SUCCESS) {
    gBrokenCode = Code != SMB2_NT_SUCCESS ? Code : STATUS_UNSUCCESSFUL;
  }
}

bool SessionCodes(const SMB2_COMMAND *Command) {
  return (Command->Flags & SMB2_COMMAND_SESSION_CODES) != 0;
}

// The code a transport failure is reported with.
UINT32 TransportFailureCode(const SMB2_COMMAND *Command, INT32 Transport) {
  if (SessionCodes(Command) || Transport == 0) {
    return STATUS_UNSUCCESSFUL;
  }
  return static_cast<UINT32>(Transport);
}

UINT32 NoMemoryCode(const SMB2_COMMAND *Command) {
  return SessionCodes(Command) ? STATUS_NO_MEMORY : SMB2_NT_OUT_OF_MEMORY;
}

void TraceRequest(const SMB2_HEADER *Header, const SMB2_REQUEST &Request) {
  SMB2_REQUEST_TRACE &Slot = gSMB2RequestTrace[gSMB2RequestCount % SMB2_REQUEST_TRACE_SLOTS];
  bool Transfer = Header->Command == SMB2_READ || Header->Command == SMB2_WRITE;
  Slot.Command = Header->Command;
  Slot.CreditCharge = Header->CreditCharge;
  Slot.Length = Transfer ? Request.DataLength : Request.Total;
  Slot.Offset = Transfer ? Request.Offset : 0;
  gSMB2RequestCount++;
}

// Builds, frames and sends one request.
UINT32 SendRequest(const SMB2_COMMAND *Command, void *Context) {
  SMB2_REQUEST Request;
  ZeroMem(&Request, sizeof(Request));
  UINT32 Code = Command->Encode(Context, &TransactDetails, &Request);
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
  }
  if (Request.Count == 0 || Request.Total < SMB2_FRAMED_HEADER_SIZE ||
      Request.Pieces[0].Length < SMB2_FRAMED_HEADER_SIZE) {
    DiagNullInput(DiagChannel::Smb2, Command->RequestName, __LINE__);
    return SMB2_NT_INVALID_PARAMETER;
  }
  // One copy per request: the pieces are laid out in a send buffer of the
  // message's length plus one.
  UINT8 *Buffer = static_cast<UINT8 *>(AllocateZeroPool(static_cast<UINTN>(Request.Total) + 1));
  if (Buffer == nullptr) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Buffer memory allocation failed!\n",
            Command->RequestName, __LINE__);
    return STATUS_NO_MEMORY;
  }
  UINT64 At = 0;
  for (UINT32 I = 0; I < Request.Count && I < SMB2_MAX_REQUEST_PIECES; I++) {
    const SMB2_SEND_PIECE &Piece = Request.Pieces[I];
    UINT64 Length = Piece.Length < Request.Total - At ? Piece.Length : Request.Total - At;
    if (Piece.Bytes != nullptr) {
      CopyMem(Buffer + At, Piece.Bytes, Length);
    }
    At += Length;
  }
  SMB2_HEADER *Header = reinterpret_cast<SMB2_HEADER *>(Buffer);
  SMB2HeaderFill(Header, Command->Command, Request.Total, &TransactDetails, Request.DataLength);
  TraceRequest(Header, Request);
  if (SMB2SigningActive() && Command->Command != SMB2_SESSION_SETUP) {
    SMB2SignRequest(Buffer, Request.Total);
  }
  Code = SMB2SendAll(gSMB2SockFd, Buffer, Request.Total, &TransactDetails.TransportStatus);
  // A session setup carries the authentication blob: nothing of a request
  // stays behind in the pool.
  ZeroMem(Buffer, Request.Total);
  FreePool(Buffer);
  if (Code == SMB2_NT_SUCCESS) {
    return Code;
  }
  if (Command->SendFailed != nullptr) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, %s Status = 0x%x (%d)\n",
            Command->RequestName, __LINE__, Command->SendFailed, Code, static_cast<INT32>(Code));
  }
  if (Code == STATUS_NO_MEMORY || Code == SMB2_NT_INVALID_PARAMETER) {
    return Code;
  }
  Code = TransportFailureCode(Command, static_cast<INT32>(Code));
  MarkBroken(Code);
  return Code;
}

// The bytes of one answer's frame that are still to come.
struct FRAME_READER {
  UINT64 Left;
  bool Failed;                 // a read of the frame failed
  SMB2_SIGNATURE_CHECK *Check; // the frame's signature, when answers are verified
};

// Reads exactly Length bytes of the frame into Destination.
INT32 FrameRead(FRAME_READER *Frame, void *Destination, UINT64 Length, UINT64 *Got = nullptr) {
  if (Got != nullptr) {
    *Got = 0;
  }
  if (Length == 0) {
    return 0;
  }
  INT64 Received = 0;
  INT32 Rx = SMB2ReceiveAll(gSMB2SockFd, Destination, Length, &TransactDetails, &Received);
  UINT64 Taken = Received > 0 ? static_cast<UINT64>(Received) : 0;
  Frame->Left -= Taken < Frame->Left ? Taken : Frame->Left;
  Frame->Failed = Frame->Failed || Rx != 0;
  if (Frame->Check != nullptr) {
    SMB2SignatureUpdate(Frame->Check, Destination, Taken);
  }
  if (Got != nullptr) {
    *Got = Taken;
  }
  return Rx;
}

// Reads and drops Length bytes of the frame.
INT32 FrameSkip(FRAME_READER *Frame, UINT64 Length) {
  UINT8 Scratch[512];
  while (Length > 0) {
    UINT64 Piece = Length < sizeof(Scratch) ? Length : sizeof(Scratch);
    INT32 Rx = FrameRead(Frame, Scratch, Piece);
    if (Rx != 0) {
      return Rx;
    }
    Length -= Piece;
  }
  return 0;
}

// A body read that did not complete: its lines, and the code it ends with.
// (The frame reader has noted the failure: the connection is given up.)
UINT32 BodyFailure(const SMB2_COMMAND *Command, INT32 Rx) {
  const SMB2_RECEIVE_TEXTS *Texts = Command->Receive;
  if (Rx == NwErrno::ETIMEDOUT_ && Texts->BodyTimedOut != nullptr) {
    Smb2Log(DIAG_ALWAYS, Texts->BodyTimedOut, Command->ResponseName, __LINE__, Rx);
  }
  if (Texts->WideStatus) {
    Smb2Log(DIAG_ALWAYS, Texts->BodyNotReceived, Command->ResponseName, __LINE__,
            static_cast<INT64>(Rx));
  } else {
    Smb2Log(DIAG_ALWAYS, Texts->BodyNotReceived, Command->ResponseName, __LINE__, Rx);
  }
  return TransportFailureCode(Command, Rx);
}

// The header read failed: the command's own lines.
void ReportHeaderFailure(const SMB2_COMMAND *Command, EFI_STATUS Status) {
  const SMB2_RECEIVE_TEXTS *Texts = Command->Receive;
  const CHAR8 *Name = Command->ResponseName;
  if (Status == EFI_PROTOCOL_ERROR && Texts->HeaderNotReceived != nullptr) {
    Smb2Log(DIAG_ALWAYS, Texts->HeaderNotReceived, Name, __LINE__, TransactDetails.TransportStatus);
  } else if (Status != EFI_PROTOCOL_ERROR && Texts->HeaderRefused != nullptr) {
    Smb2Log(Texts->RefusedLevel, Texts->HeaderRefused, Name, __LINE__);
  }
  if (Texts->HeaderFailed != nullptr) {
    DiagError(Texts->HeaderFailed, Status, Name, __LINE__);
  }
}

// Takes in what follows the fixed body: placed by the command, or kept (up
// to the command's limit) for its decoder.
UINT32 ReadVariablePart(const SMB2_COMMAND *Command, void *Context, FRAME_READER *Frame,
                        SMB2_RESPONSE *Response, UINT8 **Kept) {
  if (Command->Place != nullptr) {
    SMB2_PLACEMENT Placement;
    ZeroMem(&Placement, sizeof(Placement));
    UINT32 Code = Command->Place(Context, Response, &Placement);
    if (Code != SMB2_NT_SUCCESS) {
      return Code;
    }
    if (static_cast<UINT64>(Placement.Skip) + Placement.Length > Frame->Left ||
        (Placement.Length != 0 && Placement.Destination == nullptr)) {
      Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Data lies outside the response!\n",
              Command->ResponseName, __LINE__);
      return STATUS_UNSUCCESSFUL;
    }
    INT32 Rx = FrameSkip(Frame, Placement.Skip);
    if (Rx == 0) {
      Rx = FrameRead(Frame, Placement.Destination, Placement.Length, &Response->PlacedLength);
    }
    return Rx == 0 ? SMB2_NT_SUCCESS : BodyFailure(Command, Rx);
  }
  UINT64 Keep = Frame->Left < Command->VariableLimit ? Frame->Left : Command->VariableLimit;
  if (Keep == 0) {
    return SMB2_NT_SUCCESS;
  }
  *Kept = static_cast<UINT8 *>(AllocateZeroPool(static_cast<UINTN>(Keep) + 1));
  if (*Kept == nullptr) {
    SMB2PrintAllocFailure(Command->ResponseName, __LINE__);
    return NoMemoryCode(Command);
  }
  UINT64 Got = 0;
  INT32 Rx = FrameRead(Frame, *Kept, Keep, &Got);
  Response->Variable = *Kept;
  Response->VariableLength = static_cast<UINT32>(Got);
  return Rx == 0 ? SMB2_NT_SUCCESS : BodyFailure(Command, Rx);
}

// Reads what follows the header of an accepted answer: the fixed body and
// the variable part.
UINT32 ReadBody(const SMB2_COMMAND *Command, void *Context, FRAME_READER *Frame,
                SMB2_RESPONSE *Response, UINT8 **Kept) {
  if (Response->BodyLength < Command->FixedSize) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Response body of %u bytes is shorter than its fixed "
            "part of %u bytes!\n",
            Command->ResponseName, __LINE__, Response->BodyLength, Command->FixedSize);
    return STATUS_UNSUCCESSFUL;
  }
  INT32 Rx = FrameRead(Frame, Response->Fixed, Command->FixedSize);
  Response->FixedLength = Command->FixedSize;
  return Rx == 0 ? ReadVariablePart(Command, Context, Frame, Response, Kept)
                 : BodyFailure(Command, Rx);
}

// Reads, checks and decodes the answer of the request just sent.
UINT32 ReceiveAnswer(const SMB2_COMMAND *Command, void *Context) {
  SMB2_RESPONSE Response;
  ZeroMem(&Response, sizeof(Response));
  EFI_STATUS Status =
      SMB2ReadVerifyHeader(&Response.Header, &TransactDetails, gSMB2SockFd, Command->Command);
  if (Status == EFI_PROTOCOL_ERROR || Status == EFI_COMPROMISED_DATA) {
    ReportHeaderFailure(Command, Status);
    MarkBroken(STATUS_UNSUCCESSFUL);
    return STATUS_UNSUCCESSFUL;
  }
  // The answer belongs to this request; all of its frame is read, through
  // its signature when answers are verified.
  SMB2_SIGNATURE_CHECK Check;
  Response.BodyLength = SMB2BodyLength(&Response.Header);
  FRAME_READER Frame = {Response.BodyLength, false, nullptr};
  if (SMB2SigningActive()) {
    SMB2SignatureBegin(&Check, &Response.Header);
    Frame.Check = &Check;
  }
  UINT8 *Kept = nullptr;
  UINT32 Code = STATUS_UNSUCCESSFUL;
  if (EFI_ERROR(Status)) {
    ReportHeaderFailure(Command, Status);
  } else {
    Code = ReadBody(Command, Context, &Frame, &Response, &Kept);
  }
  // Whatever the frame holds beyond what was taken is consumed, so that the
  // next exchange starts on a message boundary; a frame that cannot be
  // consumed fails the exchange. After a transport failure nothing more is
  // read: the transport status of that failure stands, and the connection
  // is given up.
  if (Frame.Left > 0 && !Frame.Failed) {
    Smb2Log(DIAG_VERBOSE, "Reading pending bytes %ld\n", static_cast<INT64>(Frame.Left));
    INT32 Rx = FrameSkip(&Frame, Frame.Left);
    if (Rx != 0 && Code == SMB2_NT_SUCCESS) {
      Code = BodyFailure(Command, Rx);
    }
  }
  if (Frame.Failed) {
    MarkBroken(Code);
  }
  if (Frame.Check != nullptr && !SMB2SignatureMatches(&Check) && !Frame.Failed) {
    DiagError("The answer's signature is missing or wrong!", EFI_SECURITY_VIOLATION,
              Command->ResponseName, __LINE__);
    Code = STATUS_INVALID_SIGNATURE;
    MarkBroken(Code);
  }
  if (Code == SMB2_NT_SUCCESS) {
    Code = Command->Decode(Context, &Response);
  }
  FreePool(Kept);
  Smb2Log(DIAG_TRACE, "Exiting %s, Status = 0x%lx\n", Command->ResponseName,
          static_cast<UINT64>(Code));
  return Code;
}

} // namespace

const SMB2_RECEIVE_TEXTS gSMB2FileReceiveTexts = {
    "SMB2ReadVerifyHeader failed!",
    nullptr,
    nullptr,
    DIAG_ALWAYS,
    "Function: %s, Line no.: = %d, TCP_PollAndTryToRxAllData failed! Status = %ld\n",
    true,
    nullptr,
};

const SMB2_RECEIVE_TEXTS gSMB2SessionReceiveTexts = {
    "SMB2ReadVerifyHeader failed!",
    nullptr,
    nullptr,
    DIAG_ALWAYS,
    "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Status = 0x%x\n",
    false,
    nullptr,
};

UINT32 SMB2DecodeNothing(void *Context, const SMB2_RESPONSE *Response) {
  (void)Context;
  (void)Response;
  return SMB2_NT_SUCCESS;
}

void SMB2LayRequest(SMB2_REQUEST *Request, const void *Packet, UINT32 PacketSize, UINT32 Total) {
  Request->Pieces[0] = {Packet, PacketSize};
  Request->Count = 1;
  Request->Total = Total;
}

void SMB2AddPiece(SMB2_REQUEST *Request, const void *Bytes, UINT64 Length) {
  if (Request->Count < SMB2_MAX_REQUEST_PIECES) {
    Request->Pieces[Request->Count++] = {Bytes, Length};
  }
}

const UINT8 *SMB2ResponseRange(const SMB2_RESPONSE *Response, UINT64 Offset, UINT64 Length) {
  UINT64 Start = static_cast<UINT64>(SMB2_HEADER_STRUCTURE_SIZE) + Response->FixedLength;
  if (Response->Variable == nullptr || Offset < Start ||
      Offset - Start + Length > Response->VariableLength) {
    return nullptr;
  }
  return Response->Variable + (Offset - Start);
}

bool SMB2ConnectionBroken() {
  return gBrokenCode != SMB2_NT_SUCCESS;
}

void SMB2ResetConnectionHealth() {
  gBrokenCode = SMB2_NT_SUCCESS;
}

SMB2_EXCHANGE_RESULT SMB2Exchange(const SMB2_COMMAND *Command, void *Context) {
  SMB2_EXCHANGE_RESULT Result = {SMB2_NT_SUCCESS, SMB2_NT_SUCCESS};
  if (SMB2ConnectionBroken()) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, The connection is broken: not sent!\n",
            Command->RequestName, __LINE__);
    Result.RequestCode = gBrokenCode;
    return Result;
  }
  Result.RequestCode = SendRequest(Command, Context);
  if (Result.RequestCode == SMB2_NT_SUCCESS) {
    Result.ResponseCode = ReceiveAnswer(Command, Context);
  }
  // Every exchange uses up its message id, whatever its outcome.
  TransactDetails.MessageId++;
  return Result;
}

EFI_STATUS SMB2MapExchange(const SMB2_EXCHANGE_RESULT &Result, const SMB2_COMMAND *Command,
                           const CHAR8 *Function, UINT32 Line) {
  if (Result.RequestCode != SMB2_NT_SUCCESS) {
    return SMB2MapNtStatus(Result.RequestCode, Command->RequestName, Function, Line);
  }
  return SMB2MapNtStatus(Result.ResponseCode, Command->ResponseName, Function, Line);
}
