// The SMB2 file operations: each checks its arguments, runs one command
// through the exchange path and reports its code (see SMB2FileAccess.h).
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2FileAccess.h"

namespace {

SMB2_FILE_CONTEXT FileContext(FILE_ACCESS_DETAILS *Access, const QUERY_DETAILS *Query = nullptr,
                              void *Data = nullptr) {
  SMB2_FILE_CONTEXT Context;
  ZeroMem(&Context, sizeof(Context));
  Context.Access = Access;
  Context.Query = Query;
  Context.Data = Data;
  return Context;
}

// The socket must be open; afterwards the record receives the transport
// status and the command's code is mapped naming the half that failed.
EFI_STATUS RunFileCommand(const SMB2_COMMAND *Command, SMB2_FILE_CONTEXT *Context,
                          const CHAR8 *Function, UINT32 Line) {
  if (gSMB2SockFd == 0) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, gSMB2SockFd is 0!\n", Function, Line);
    return EFI_NOT_FOUND;
  }
  SMB2_EXCHANGE_RESULT Result = SMB2Exchange(Command, Context);
  FreePool(Context->Allocated);
  Context->Allocated = nullptr;
  Context->Access->TransportStatus = TransactDetails.TransportStatus;
  return SMB2MapExchange(Result, Command, Function, Line);
}

// The argument check shared by READ and WRITE, which also clears the
// per-request channel fields.
EFI_STATUS CheckTransfer(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                         const QUERY_DETAILS *ChannelInfo, FILE_ACCESS_DETAILS *Access,
                         const void *Data, const CHAR8 *Function, UINT32 Line) {
  if (Share == nullptr || Session == nullptr || ChannelInfo == nullptr || Access == nullptr ||
      Data == nullptr) {
    DiagNullInput(DiagChannel::Smb2, Function, Line);
    return EFI_INVALID_PARAMETER;
  }
  SMB2_READ_WRITE_INFO &Rw = Access->ReadWriteInfo;
  Rw.MinimumCount = 0;
  Rw.Channel = 0;
  Rw.RemainingBytes = 0;
  Rw.ChannelInfoLength = 0;
  Rw.ChannelFlags = 0;
  return EFI_SUCCESS;
}

// QUERY_INFO and QUERY_DIRECTORY: the same arguments and the same run.
EFI_STATUS RunQuery(const SMB2_COMMAND *Command, const SMB2_QUERY_ANSWER_TEXTS *Texts,
                    SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                    const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access, const CHAR8 *Function,
                    UINT32 Line) {
  DiagEntry(DiagChannel::Smb2, Function, Line);
  if (Share == nullptr || Session == nullptr || Query == nullptr || Access == nullptr) {
    DiagNullInput(DiagChannel::Smb2, Function, Line);
    return EFI_INVALID_PARAMETER;
  }
  SMB2_FILE_CONTEXT Context = FileContext(Access, Query);
  Context.Answer = Texts;
  EFI_STATUS Status = RunFileCommand(Command, &Context, Function, Line);
  DiagExit(Status, DiagChannel::Smb2, Function, Line);
  return Status;
}

// CREATE and CLOSE: the arguments Given, one command on the file, and the
// connection's state when it succeeded.
EFI_STATUS RunOnFile(const SMB2_COMMAND *Command, bool Given, FILE_ACCESS_DETAILS *Access,
                     UINT8 State, const CHAR8 *Function, UINT32 Line) {
  DiagEntry(DiagChannel::Smb2, Function, Line);
  if (!Given) {
    DiagNullInput(DiagChannel::Smb2, Function, Line);
    return EFI_INVALID_PARAMETER;
  }
  SMB2_FILE_CONTEXT Context = FileContext(Access);
  EFI_STATUS Status = RunFileCommand(Command, &Context, Function, Line);
  if (!EFI_ERROR(Status)) {
    SMB2ConnectionState = State;
  }
  DiagExit(Status, DiagChannel::Smb2, Function, Line);
  return Status;
}

} // namespace

EFI_STATUS SMB2_Open(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                     FILE_ACCESS_DETAILS *Access) {
  bool Given = Share != nullptr && Session != nullptr && Access != nullptr;
  return RunOnFile(&gSMB2CreateCommand, Given, Access, SMB2_STATE_FILE_OPEN, __func__, __LINE__);
}

EFI_STATUS SMB2_Close(FILE_ACCESS_DETAILS *Access) {
  return RunOnFile(&gSMB2CloseCommand, Access != nullptr, Access, SMB2_STATE_FILE_CLOSED, __func__,
                   __LINE__);
}

EFI_STATUS SMB2_Read(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                     const QUERY_DETAILS *ChannelInfo, FILE_ACCESS_DETAILS *Access, void *Data) {
  DiagEntry(DiagChannel::Smb2);
  EFI_STATUS Status = CheckTransfer(Share, Session, ChannelInfo, Access, Data, __func__, __LINE__);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  // The share details' last status is deliberately left as the caller set
  // it: a read does not report the header's NT status there.
  SMB2_FILE_CONTEXT Context = FileContext(Access, ChannelInfo, Data);
  Status = RunFileCommand(&gSMB2ReadCommand, &Context, __func__, __LINE__);
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}

EFI_STATUS SMB2_Write(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                      const QUERY_DETAILS *ChannelInfo, FILE_ACCESS_DETAILS *Access,
                      const void *Data) {
  DiagEntry(DiagChannel::Smb2);
  EFI_STATUS Status = CheckTransfer(Share, Session, ChannelInfo, Access, Data, __func__, __LINE__);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  SMB2_FILE_CONTEXT Context = FileContext(Access, ChannelInfo, const_cast<void *>(Data));
  Status = RunFileCommand(&gSMB2WriteCommand, &Context, __func__, __LINE__);
  Share->LastStatus = TransactDetails.ResponseStatus;
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}

EFI_STATUS SMB2_FSInfo(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                       const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access) {
  return RunQuery(&gSMB2QueryInfoCommand, &gSMB2QueryInfoTexts, Share, Session, Query, Access,
                  __func__, __LINE__);
}

EFI_STATUS SMB2_DirInfo(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                        const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access) {
  EFI_STATUS Status = RunQuery(&gSMB2QueryDirectoryCommand, &gSMB2QueryDirectoryTexts, Share,
                               Session, Query, Access, __func__, __LINE__);
  if (Share != nullptr && Session != nullptr && Query != nullptr && Access != nullptr) {
    Share->LastStatus = TransactDetails.ResponseStatus;
  }
  return Status;
}
