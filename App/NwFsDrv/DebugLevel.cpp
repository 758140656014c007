// The three debug levels and the two initialisers that read theirs from UEFI
// variables at start.
#include "DiagLog.h"
#include "NwBaseLib.h"

// Until the variable has been read the driver prints at its most verbose.
UINT8 gDriverDebugLevel = 5;
UINT8 gSMB2DebugLevel = 0;
UINT8 gTcpDebugLevel = 0;

const EFI_GUID gDebugLevelVariableGuid = {
    0x47C7B224, 0xC42A, 0x11D2, {0x8E, 0x57, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B}};

namespace {

constexpr UINTN LevelDataSize = 6;
constexpr INT64 DriverLevelMax = 5;
constexpr INT64 Smb2LevelMax = 6;

constexpr const CHAR8 *WronglySet = "Debuglevel %d is wrongly set. Setting to highest value!\n";
// The SMB2 initialiser reports its failure with the driver variable's name;
// the message is deliberately shared word for word with the driver's.
constexpr const CHAR8 *ReadFailed = "Failed to get QVUIkestDebugLevel!";

struct LevelRead {
  EFI_STATUS Status;
  bool Asked;  // GetVariable was called (runtime services present)
  INT64 Value; // 0 unless the variable was read
};

// Reads at most 6 bytes of the variable into a zero-filled buffer and parses
// them as a decimal number. Failure leaves the value 0; printing is left to
// the caller, whose rules differ.
LevelRead ReadLevelVariable(const CHAR16 *Name) {
  LevelRead Result = {EFI_SUCCESS, false, 0};
  CHAR8 Data[LevelDataSize + 1]; // one more for the terminator of a full value
  ZeroMem(Data, sizeof(Data));
  if (gRT == nullptr || gRT->GetVariable == nullptr) {
    DiagLog(DIAG_ALWAYS, "RT variable is NULL!\n");
    Result.Status = EFI_INVALID_PARAMETER;
    return Result;
  }
  UINTN Size = LevelDataSize;
  Result.Asked = true;
  Result.Status = gRT->GetVariable(Name, &gDebugLevelVariableGuid, nullptr, &Size, Data);
  if (!EFI_ERROR(Result.Status)) {
    Result.Value = AsciiStrDecimalToInt(Data);
  }
  return Result;
}

// A negative number counts as out of range, like one too large.
bool AboveMax(INT64 Value, INT64 Max) {
  return Value < 0 || Value > Max;
}

} // namespace

EFI_STATUS QVUIkestDebugLevelInitialize(UINT8 *DebugLevel) {
  if (DebugLevel == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const LevelRead Read = ReadLevelVariable(u"QVUIkestDebugLevel");
  if (Read.Asked && EFI_ERROR(Read.Status)) {
    DiagError(ReadFailed, Read.Status, "QVUIkestDebugLevelInitialize");
  }
  if (AboveMax(Read.Value, DriverLevelMax)) {
    DiagLog(DIAG_ALWAYS, WronglySet, static_cast<int>(Read.Value));
    *DebugLevel = static_cast<UINT8>(DriverLevelMax);
  } else {
    *DebugLevel = static_cast<UINT8>(Read.Value);
  }
  return Read.Status;
}

EFI_STATUS SMB2DebugLevelInitialize(UINT8 *DebugLevel) {
  const LevelRead Read = ReadLevelVariable(u"SMB2DebugLevel");
  if (Read.Asked && EFI_ERROR(Read.Status)) {
    DiagErrorAt(DiagChannel::Smb2, DIAG_VERBOSE, ReadFailed, Read.Status,
                "SMB2DebugLevelInitialize");
  }
  if (AboveMax(Read.Value, Smb2LevelMax)) {
    if (gSMB2DebugLevel != 0) {
      DiagLog(DIAG_ALWAYS, WronglySet, static_cast<int>(Read.Value));
    }
    gSMB2DebugLevel = static_cast<UINT8>(Smb2LevelMax);
  } else if (Read.Status != EFI_NOT_FOUND) {
    // An absent variable leaves the level as it is; any other failure reads 0.
    gSMB2DebugLevel = static_cast<UINT8>(Read.Value);
  }
  if (DebugLevel != nullptr) {
    *DebugLevel = gSMB2DebugLevel;
  }
  return Read.Status;
}
