// SMB2 CLOSE: the encoder (the file id) and the decoder (the 60-byte answer
// is read and its content ignored).
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2FileAccess.h"

namespace {

constexpr UINT16 kCloseResponseBody = 60;

UINT32 EncodeClose(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  SMB2_CLOSE_REQUEST *Packet = &File->Packet.Close;
  if (EFI_ERROR(SMB2ClosePacketConstruct(Packet, Details, File->Access))) {
    return SMB2_NT_INVALID_PARAMETER;
  }
  SMB2LayRequest(Request, Packet, sizeof(*Packet), sizeof(*Packet));
  return SMB2_NT_SUCCESS;
}

} // namespace

const SMB2_COMMAND gSMB2CloseCommand = {
    SMB2_CLOSE,
    0,
    kCloseResponseBody,
    0,
    "SMB2CloseRequest",
    "SMB2CloseResponse",
    "Close request send failed!",
    &gSMB2FileReceiveTexts,
    EncodeClose,
    nullptr,
    SMB2DecodeNothing,
};

EFI_STATUS SMB2ClosePacketConstruct(SMB2_CLOSE_REQUEST *Packet, const TRANSACT_DETAILS *Details,
                                    const FILE_ACCESS_DETAILS *Access) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  ZeroMem(Packet, sizeof(*Packet));
  SMB2HeaderConstruct(&Packet->Header);
  Packet->StructureSize = SMB2_REQUEST_STRUCTURE_SIZE[SMB2_CLOSE];
  Packet->Flags = Access->SecurityFlags;
  CopyMem(Packet->FileId, Access->FileId, SMB2_FILE_ID_SIZE);
  return EFI_SUCCESS;
}
