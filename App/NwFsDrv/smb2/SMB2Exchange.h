// The one exchange path of the SMB2 client: every request leaves and every
// answer arrives here.
//
// A command is described by an SMB2_COMMAND record: its code, the sizes of
// its answer, the names and texts its failure lines carry, and its encoder
// and decoder. SMB2Exchange gives the request the next message id, lets the
// encoder lay out the body, fills the per-request header fields (stream
// length, command, message id, credit charge, tree and session ids), sends
// the whole message with the send loop, reads and checks the framed header
// of the answer (skipping interim answers), reads the answer's fixed body and
// what follows it, drains whatever is left of the frame and hands the
// decoder a bounds-checked view of what arrived.
//
// Results follow the request layer's convention: 32-bit NT-style codes, one
// for the request half and one for the answer half, which the operation above
// maps to EFI_STATUS naming the half that failed.
//
// Message ids: a request carries TransactDetails.MessageId, and every
// exchange advances it by one afterwards, whatever its outcome; the connect
// clears it, so the negotiate carries 0.
#pragma once

#include "smb2/SMB2Header.h"

// ---------------------------------------------------------------------------
// Requests
// ---------------------------------------------------------------------------
// One piece of a request message; a null Bytes pointer stands for zeros.
struct SMB2_SEND_PIECE {
  const void *Bytes;
  UINT64 Length;
};

constexpr UINT32 SMB2_MAX_REQUEST_PIECES = 4;

// A request as its encoder lays it out. The pieces are copied one after the
// other into one zero-filled send buffer of Total bytes (a piece that would
// run past Total is cut). The first piece starts with the 68-byte framed
// header; the encoder fills only the body, the exchange the header.
struct SMB2_REQUEST {
  SMB2_SEND_PIECE Pieces[SMB2_MAX_REQUEST_PIECES];
  UINT32 Count;
  UINT32 Total;
  UINT32 DataLength; // READ/WRITE: the data length the credit charge counts
  UINT64 Offset;     // READ/WRITE: the file offset (request trace)
};

// ---------------------------------------------------------------------------
// Answers
// ---------------------------------------------------------------------------
// The largest fixed body of an answer the client reads (CREATE).
constexpr UINT32 SMB2_MAX_FIXED_BODY = 88;

// What arrived of an answer. Offsets a server gives count from the SMB2
// header, which is the framed header's byte 4.
struct SMB2_RESPONSE {
  SMB2_HEADER Header;
  UINT32 BodyLength;                // body bytes the frame announces
  UINT8 Fixed[SMB2_MAX_FIXED_BODY]; // the command's fixed body
  UINT32 FixedLength;
  const UINT8 *Variable; // what followed the fixed body, as far as it was kept
  UINT32 VariableLength; // bytes of it that arrived
  UINT64 PlacedLength;   // bytes received into a caller's buffer (READ)
};

// Where the bytes after the fixed body go when a command places them itself
// (READ data goes straight into the caller's buffer): Skip bytes are read
// and dropped, then Length bytes land at Destination. The rest of the frame
// is drained.
struct SMB2_PLACEMENT {
  UINT32 Skip;
  void *Destination;
  UINT32 Length;
};

// The bytes [Offset, Offset + Length) of an answer, Offset counted from the
// SMB2 header, when they lie within the variable part that arrived.
const UINT8 *SMB2ResponseRange(const SMB2_RESPONSE *Response, UINT64 Offset, UINT64 Length);

// ---------------------------------------------------------------------------
// Commands
// ---------------------------------------------------------------------------
// The session exchanges report any transport failure as STATUS_UNSUCCESSFUL
// and a failed allocation as STATUS_NO_MEMORY; the file operations pass the
// transport's status on and report a failed allocation as 0x8007000E.
constexpr UINT8 SMB2_COMMAND_SESSION_CODES = 0x01;

// How a family of commands reports an answer that did not arrive whole.
struct SMB2_RECEIVE_TEXTS {
  // Printed with DiagError under the answer half's name when the header
  // read fails.
  const CHAR8 *HeaderFailed;
  // Format (function, line, transport status) printed when the header did
  // not arrive.
  const CHAR8 *HeaderNotReceived;
  // Format (function, line) printed when the header arrived and was
  // refused, at RefusedLevel.
  const CHAR8 *HeaderRefused;
  UINT8 RefusedLevel;
  // Format (function, line, transport status) printed when the body did not
  // arrive, the status as a 64-bit number (%ld) when WideStatus is set and as
  // a 32-bit one (0x%x) otherwise; and the one printed before it when the
  // wait timed out (or null).
  const CHAR8 *BodyNotReceived;
  bool WideStatus;
  const CHAR8 *BodyTimedOut;
};

struct SMB2_COMMAND {
  UINT16 Command;
  UINT8 Flags;
  UINT16 FixedSize;     // fixed body of the answer
  UINT32 VariableLimit; // most bytes after the fixed body kept for the decoder
  // The names the failure lines carry: the request half, e.g.
  // "SMB2CreateRequest", and the answer half, e.g. "SMB2CreateResponse".
  const CHAR8 *RequestName;
  const CHAR8 *ResponseName;
  // "Function: %s, Line no.: = %d, <SendFailed> Status = 0x%x (%d)\n" when
  // the send fails (null: the send loop's own line only).
  const CHAR8 *SendFailed;
  const SMB2_RECEIVE_TEXTS *Receive;
  // Lays out the request body (and further pieces) behind the header.
  // Returns an NT-style code; a failure is the encoder's to report.
  UINT32 (*Encode)(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request);
  // Optional: where the bytes after the fixed body go. A non-zero code
  // refuses the answer (the frame is drained).
  UINT32 (*Place)(void *Context, const SMB2_RESPONSE *Response, SMB2_PLACEMENT *Placement);
  // Takes the answer in. Returns an NT-style code.
  UINT32 (*Decode)(void *Context, const SMB2_RESPONSE *Response);
};

// The receive texts of the file operations (all but READ) and of the
// session exchanges that report their receive failures alike.
extern const SMB2_RECEIVE_TEXTS gSMB2FileReceiveTexts;
extern const SMB2_RECEIVE_TEXTS gSMB2SessionReceiveTexts;
// A command whose answer carries nothing the client uses.
UINT32 SMB2DecodeNothing(void *Context, const SMB2_RESPONSE *Response);

struct SMB2_EXCHANGE_RESULT {
  UINT32 RequestCode;  // building or sending
  UINT32 ResponseCode; // receiving, checking or decoding; 0 when not reached
};

// The whole exchange of one command on the open connection.
SMB2_EXCHANGE_RESULT SMB2Exchange(const SMB2_COMMAND *Command, void *Context);

// Maps an exchange's result with the three messages, naming the half that
// failed.
EFI_STATUS SMB2MapExchange(const SMB2_EXCHANGE_RESULT &Result, const SMB2_COMMAND *Command,
                           const CHAR8 *Function = __builtin_FUNCTION(),
                           UINT32 Line = __builtin_LINE());
// The one code of an exchange: the request's, or when that was 0 the
// answer's.
inline UINT32 SMB2ExchangeCode(const SMB2_EXCHANGE_RESULT &Result) {
  return Result.RequestCode != SMB2_NT_SUCCESS ? Result.RequestCode : Result.ResponseCode;
}

// Lays out a request of Total bytes whose first piece is Packet (its framed
// header and fixed body, PacketSize bytes), and adds further pieces.
void SMB2LayRequest(SMB2_REQUEST *Request, const void *Packet, UINT32 PacketSize, UINT32 Total);
void SMB2AddPiece(SMB2_REQUEST *Request, const void *Bytes, UINT64 Length);

// ---------------------------------------------------------------------------
// The connection's health. After a transport failure (time-out, reset,
// close, short frame) or an answer that puts the stream out of step, the
// connection is broken: nothing more is sent on it, and every later exchange
// fails at once with the code the breaking one ended with. A connect starts
// a healthy connection.
// ---------------------------------------------------------------------------
bool SMB2ConnectionBroken();
void SMB2ResetConnectionHealth();

// ---------------------------------------------------------------------------
// The request trace: every request as it was sent, for tests and
// diagnostics (a ring of the most recent ones and a running count).
// ---------------------------------------------------------------------------
struct SMB2_REQUEST_TRACE {
  UINT16 Command;
  UINT16 CreditCharge;
  UINT32 Length; // READ/WRITE data length, else the message length
  UINT64 Offset; // READ/WRITE file offset, else 0
};
constexpr UINT32 SMB2_REQUEST_TRACE_SLOTS = 64;
extern SMB2_REQUEST_TRACE gSMB2RequestTrace[SMB2_REQUEST_TRACE_SLOTS];
extern UINT64 gSMB2RequestCount;
