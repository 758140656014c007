// Connection orchestration: SMB2_Connect and SMB2_Disconnect, and the steps
// they run (negotiate, session setup, tree connect, tree disconnect,
// logoff), each of which runs its commands through the exchange path and
// reports their codes.
//
// Nothing is retried and nothing is undone when a connect fails: the socket
// stays open (gSMB2SockFd set) for the disconnect to close, and a disconnect
// carries on to the socket close whatever fails on its way.
#include "smb2/SMB2Connect.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Negotiate.h"
#include "smb2/SMB2Session.h"
#include "smb2/SMB2Signing.h"
#include "smb2/TcpTransport.h"

namespace {

constexpr UINTN kDomainMeasureLimit = SMB2_DOMAIN_FIELD + 2;

// Copies a required connect parameter into its field; a missing one clears
// the field and is reported.
EFI_STATUS CopyRequired(CHAR8 *Field, UINTN FieldSize, const CHAR8 *Value, const CHAR8 *Missing,
                        UINT32 Line) {
  if (Value == nullptr) {
    ZeroMem(Field, FieldSize);
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, %s\n", "FillShareDetails", Line, Missing);
    return EFI_INVALID_PARAMETER;
  }
  AsciiStrCpyS(Field, FieldSize, Value);
  return EFI_SUCCESS;
}

void PrintMessageId(const CHAR8 *Function) {
  Smb2Log(DIAG_ALWAYS, "%s: TransactDetails.MessageId = %ld\n", Function,
          static_cast<INT64>(TransactDetails.MessageId));
}

void PrintNegotiated(const TRANSACT_DETAILS *Details) {
  Smb2Log(DIAG_VERBOSE, "TransactDetails.DialectRevision = 0x%x\n", Details->DialectRevision);
  Smb2Log(DIAG_VERBOSE, "TransactDetails.CreditRequest = 0x%x\n", Details->CreditRequest);
  Smb2Log(DIAG_VERBOSE, "TransactDetails.MaxTransactSize = 0x%x\n", Details->MaxTransactSize);
  Smb2Log(DIAG_VERBOSE, "TransactDetails.MaxReadSize = 0x%x\n", Details->MaxReadSize);
  Smb2Log(DIAG_VERBOSE, "TransactDetails.MaxWriteSize = 0x%x\n", Details->MaxWriteSize);
  Smb2Log(DIAG_VERBOSE, "TransactDetails.Flags = 0x%x\n", Details->Flags);
  Smb2Log(DIAG_VERBOSE, "TransactDetails.SecurityMode = 0x%x\n", Details->SecurityMode);
  Smb2Log(DIAG_VERBOSE, "TransactDetails.Capabilities = 0x%x\n", Details->Capabilities);
  Smb2Log(DIAG_VERBOSE, "TransactDetails.Channel = 0x%x\n", Details->Channel);
  Smb2Log(DIAG_VERBOSE, "TransactDetails.SecurityBufferLength = 0x%x\n",
          Details->SecurityBufferLength);
}

void PrintChallenge(const SMB2_SESSION_SETUP_RESPONSE *Response,
                    const SMB2_NTLM_CHALLENGE *Challenge) {
  Smb2Log(DIAG_VERBOSE, "SessionSetupResp.Header.Status = 0x%x\n", Response->Header.Status);
  Smb2Log(DIAG_VERBOSE, "SessionSetupResp.Header.CreditRequest = 0x%x\n",
          Response->Header.CreditRequest);
  Smb2Log(DIAG_VERBOSE, "SessionSetupResp.StrutureSize = 0x%x\n", Response->StructureSize);
  Smb2Log(DIAG_VERBOSE, "SessionSetupResp.SecurityBufferLength = 0x%x\n",
          Response->SecurityBufferLength);
  Smb2Log(DIAG_VERBOSE, "NTLMChallengeMessage->Signature = %s\n",
          reinterpret_cast<const CHAR8 *>(Challenge->Message));
  Smb2Log(DIAG_VERBOSE, "NTLMChallengeMessage->MessageType = 0x%x\n",
          SMB2ReadLe32(Challenge->Message + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, MessageType)));
}

// The CHALLENGE copy and the AUTHENTICATE blob are scrubbed before they go.
void ReleaseSession(SMB2_SESSION_CONTEXT *Session) {
  if (Session->Challenge.Message != nullptr) {
    ZeroMem(const_cast<UINT8 *>(Session->Challenge.Message), Session->Challenge.Length);
    FreePool(const_cast<UINT8 *>(Session->Challenge.Message));
  }
  if (Session->Authenticate != nullptr) {
    ZeroMem(Session->Authenticate, Session->AuthenticateLength);
    FreePool(Session->Authenticate);
  }
  ZeroMem(Session, sizeof(*Session));
  // ChallAttributes pointed into the challenge.
  TransactDetails.ChallAttributes = nullptr;
}

// A tree disconnect or logoff: one exchange whose two halves are reported,
// and the state it reaches.
UINT32 RunTeardown(const SMB2_COMMAND *Command, UINT8 Reached) {
  SMB2_SIMPLE_REQUEST Request;
  SMB2_EXCHANGE_RESULT Result = SMB2Exchange(Command, &Request);
  if (EFI_ERROR(SMB2MapNtStatus(Result.RequestCode, Command->RequestName))) {
    return Result.RequestCode;
  }
  if (!EFI_ERROR(SMB2MapNtStatus(Result.ResponseCode, Command->ResponseName))) {
    SMB2ConnectionState = Reached;
  }
  return Result.ResponseCode;
}

} // namespace

EFI_STATUS SMB2Negotiate(const CHAR8 *IpAddress, SMB2_NEGOTIATE_REQUEST *Request, INT32 *SockFd,
                         TRANSACT_DETAILS *Details) {
  DiagEntry(DiagChannel::Smb2);
  if (IpAddress == nullptr || Request == nullptr || Details == nullptr || SockFd == nullptr) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Invalid Parameter!\n", __func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  EFI_STATUS Status = SMB2NegotiateConnect(IpAddress, SockFd, Details);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2NegotiateConnect failed!", Status);
    return Status;
  }
  Smb2Log(DIAG_VERBOSE, "SockFd = %d\n", *SockFd);
  SMB2_NEGOTIATE_CONTEXT Negotiate = {Request, EFI_SUCCESS};
  SMB2_EXCHANGE_RESULT Result = SMB2Exchange(&gSMB2NegotiateCommand, &Negotiate);
  if (Result.RequestCode != SMB2_NT_SUCCESS) {
    return Result.RequestCode == SMB2_NT_INVALID_PARAMETER ? EFI_INVALID_PARAMETER
                                                           : EFI_DEVICE_ERROR;
  }
  if (EFI_ERROR(Negotiate.Verdict)) {
    Status = Negotiate.Verdict;
    DiagError("SMB2VerifyExtractNegotiateResponse failed!", Status);
  } else if (Result.ResponseCode != SMB2_NT_SUCCESS) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, SMB2NegotiateResponse failed! 0x%x (%d), TCP status = "
            "%d\n",
            __func__, __LINE__, Result.ResponseCode, Result.ResponseCode, Details->TransportStatus);
    Status = EFI_PROTOCOL_ERROR;
  } else {
    PrintNegotiated(Details);
  }
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}

EFI_STATUS SMB2SessionSetUp(INT32 SockFd, SMB2_SESSION_SETUP_RESPONSE *Response,
                            TRANSACT_DETAILS *Details) {
  DiagEntry(DiagChannel::Smb2);
  (void)SockFd; // the exchange path uses the connection's socket
  if (Response == nullptr || Details == nullptr) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Invalid Parameter!\n", __func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  SMB2_SESSION_CONTEXT Session;
  ZeroMem(&Session, sizeof(Session));
  Session.First = Response;
  EFI_STATUS Status = SMB2MapExchange(SMB2Exchange(&gSMB2SessionNegotiateCommand, &Session),
                                      &gSMB2SessionNegotiateCommand);
  if (!EFI_ERROR(Status)) {
    PrintChallenge(Response, &Session.Challenge);
    Status = SMB2MapExchange(SMB2Exchange(&gSMB2SessionAuthenticateCommand, &Session),
                             &gSMB2SessionAuthenticateCommand);
  }
  ReleaseSession(&Session);
  if (!EFI_ERROR(Status)) {
    SMB2ConnectionState = SMB2_STATE_SESSION;
  }
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}

UINT32 SMB2TreeConnect(const CHAR8 *SharePath, TRANSACT_DETAILS *Details, INT32 SockFd) {
  DiagEntry(DiagChannel::Smb2);
  (void)Details;
  (void)SockFd;
  SMB2_TREE_CONTEXT Tree = {SharePath, nullptr};
  UINT32 Nt = SMB2_NT_INVALID_PARAMETER;
  EFI_STATUS Status = EFI_INVALID_PARAMETER;
  if (SharePath == nullptr) {
    DiagNullInput();
    SMB2MapNtStatus(Nt, gSMB2TreeConnectCommand.RequestName);
  } else {
    SMB2_EXCHANGE_RESULT Result = SMB2Exchange(&gSMB2TreeConnectCommand, &Tree);
    Nt = SMB2ExchangeCode(Result);
    Status = SMB2MapExchange(Result, &gSMB2TreeConnectCommand);
  }
  FreePool(Tree.Packet);
  if (!EFI_ERROR(Status)) {
    SMB2ConnectionState = SMB2_STATE_TREE;
  }
  DiagExit(Status, DiagChannel::Smb2);
  return Nt;
}

UINT32 SMB2TreeDisconnect(TRANSACT_DETAILS *Details, INT32 SockFd) {
  (void)Details;
  (void)SockFd;
  return RunTeardown(&gSMB2TreeDisconnectCommand, SMB2_STATE_TREE_DISCONNECTED);
}

UINT32 SMB2LogOff(TRANSACT_DETAILS *Details, INT32 SockFd) {
  (void)Details;
  (void)SockFd;
  return RunTeardown(&gSMB2LogOffCommand, SMB2_STATE_LOGGED_OFF);
}

EFI_STATUS FillShareDetails(const SMB2ConnectInfo *ConnectInfo, const SMB2ShareDetails *Share,
                            TRANSACT_DETAILS *Details) {
  if (ConnectInfo == nullptr || Share == nullptr || Details == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  SHARE_DETAILS &Fields = Details->ShareDetails;
  EFI_STATUS Status = EFI_SUCCESS;
  if (EFI_ERROR(CopyRequired(Fields.UserName, SMB2_USER_FIELD, ConnectInfo->Username,
                             "Username is NULL!", __LINE__))) {
    Status = EFI_INVALID_PARAMETER;
  }
  if (EFI_ERROR(CopyRequired(Fields.Password, SMB2_PASSWORD_FIELD, ConnectInfo->Password,
                             "Password/ account key is NULL!", __LINE__))) {
    Status = EFI_INVALID_PARAMETER;
  }
  if (EFI_ERROR(CopyRequired(Fields.ShareName, SMB2_SHARE_FIELD, Share->Sharename,
                             "Sharename is NULL!", __LINE__))) {
    Status = EFI_INVALID_PARAMETER;
  }

  const CHAR8 *Domain = ConnectInfo->Domain;
  UINTN DomainLength = Domain == nullptr ? 0 : AsciiStrnLen(Domain, kDomainMeasureLimit);
  if (Domain != nullptr && Domain[0] != '0' && DomainLength >= 1 &&
      DomainLength < SMB2_DOMAIN_FIELD) {
    AsciiStrCpyS(Fields.DomainName, SMB2_DOMAIN_FIELD, Domain);
    Smb2Log(DIAG_VERBOSE, "TransactDetails->ShareDetails.DomainName = %s\n", Fields.DomainName);
    return Status;
  }
  if (DomainLength > SMB2_DOMAIN_FIELD) {
    CHAR8 Actual[24];
    CHAR8 Expected[24];
    AsciiSPrint(Actual, sizeof(Actual), "%d", static_cast<INT32>(AsciiStrLen(Domain)));
    AsciiSPrint(Expected, sizeof(Expected), "%d", static_cast<INT32>(SMB2_DOMAIN_FIELD));
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Domain length %s is greater isexpected length %s. "
            "Exiting!\n",
            __func__, __LINE__, Actual, Expected);
    Status = EFI_INVALID_PARAMETER;
  } else {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Domain is NULL! Continue to check using the domain sent "
            "by the server.\n",
            __func__, __LINE__);
  }
  // The server's domain is chosen later, from its challenge. The address
  // text kept here is deliberately filled only on this path; nothing reads it.
  ZeroMem(Fields.DomainName, sizeof(Fields.DomainName));
  ZeroMem(Fields.ServerAddress, sizeof(Fields.ServerAddress));
  if (ConnectInfo->IpAddress != nullptr) {
    AsciiStrCpyS(Fields.ServerAddress, SMB2_SERVER_ADDRESS_COPY + 1, ConnectInfo->IpAddress);
  }
  return Status;
}

EFI_STATUS SMB2_Connect(SMB2ConnectInfo *ConnectInfo, SMB2ShareDetails *Share) {
  DiagEntry(DiagChannel::Smb2);
  // The target-info copy of an earlier connect is the one thing the record
  // owns; it goes before the record is cleared.
  FreePool(TransactDetails.ChallResponse);
  ZeroMem(&TransactDetails, sizeof(TransactDetails));
  SMB2ConnectionState = SMB2_STATE_CLOSED;
  SMB2ResetConnectionHealth();
  SMB2SigningReset();
  if (ConnectInfo == nullptr || Share == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  EFI_STATUS Status = FillShareDetails(ConnectInfo, Share, &TransactDetails);
  if (EFI_ERROR(Status)) {
    DiagError("FillShareDetails failed! Input details are incorrect!", Status);
  } else {
    SMB2_NEGOTIATE_REQUEST Request;
    INT32 SockFd = 0;
    Status = SMB2Negotiate(ConnectInfo->IpAddress, &Request, &SockFd, &TransactDetails);
    if (EFI_ERROR(Status)) {
      DiagError("SMB2Negotiate failed!", Status);
    } else {
      ConnectInfo->Connected = 1;
      PrintMessageId(__func__);
      SMB2_SESSION_SETUP_RESPONSE SetupResponse;
      Status = SMB2SessionSetUp(SockFd, &SetupResponse, &TransactDetails);
      if (EFI_ERROR(Status)) {
        DiagError("SMB2SessionSetup failed!", Status);
      } else {
        PrintMessageId(__func__);
        Status = SMB2MapNtStatus(SMB2TreeConnect(Share->Sharename, &TransactDetails, SockFd),
                                 "SMB2TreeConnect");
        if (!EFI_ERROR(Status)) {
          Share->MaxTransactSize = TransactDetails.MaxTransactSize;
          Share->MaxReadSize = TransactDetails.MaxReadSize;
          Share->MaxWriteSize = TransactDetails.MaxWriteSize;
        }
      }
    }
  }
  Share->LastStatus = TransactDetails.ResponseStatus;
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}

EFI_STATUS SMB2_Disconnect(SMB2ConnectInfo *ConnectInfo, SMB2ShareDetails *Share) {
  DiagEntry(DiagChannel::Smb2);
  if (ConnectInfo == nullptr || Share == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  if (gSMB2SockFd == 0) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, gSMB2SockFd is 0!\n", __func__, __LINE__);
    return EFI_NOT_FOUND;
  }
  INT32 SockFd = gSMB2SockFd;
  EFI_STATUS Status = EFI_SUCCESS;
  if (SMB2ConnectionBroken()) {
    // Nothing more goes out on a broken connection: the socket is closed
    // without the tree disconnect and the logoff.
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, The connection is broken: closing it without a tree "
            "disconnect and a logoff.\n",
            __func__, __LINE__);
    Status = EFI_DEVICE_ERROR;
  } else {
    if (SMB2ConnectionState >= SMB2_STATE_TREE) {
      EFI_STATUS Tree =
          SMB2MapNtStatus(SMB2TreeDisconnect(&TransactDetails, SockFd), "SMB2TreeDisconnect");
      if (EFI_ERROR(Tree)) {
        Status = Tree;
      }
    }
    EFI_STATUS LogOff = SMB2MapNtStatus(SMB2LogOff(&TransactDetails, SockFd), "SMB2LogOff");
    if (EFI_ERROR(LogOff)) {
      Status = LogOff;
    }
  }
  INT32 Closed = TCP_CloseSocket(SockFd);
  if (Closed != 0) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, TCP_CloseSocket failed! %d\n", __func__,
            __LINE__, Closed);
  }
  gSMB2SockFd = 0;
  SMB2ConnectionState = SMB2_STATE_CLOSED;
  Share->LastStatus = TransactDetails.ResponseStatus;
  // Nothing reads the target-info copy after the session is set up; it is
  // released with the connection so that a finished run holds no pool.
  FreePool(TransactDetails.ChallResponse);
  TransactDetails.ChallResponse = nullptr;
  // The session key goes with the session.
  SMB2SigningReset();
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}
