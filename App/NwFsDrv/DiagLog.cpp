// Console diagnostics: the gated prints and the standard lines.
//
// Lines are formatted into a stack buffer that is handed to ConOut whenever it
// fills, so long lines are printed whole and the console sees few, large
// writes. Nothing is added to the text (no CR before LF).
#include "DiagLog.h"
#include "Library/FormatCore.h"
#include "NwBaseLib.h"

namespace {

constexpr UINTN ConsoleChunk = 256; // characters per OutputString call

EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *Console() {
  return gST != nullptr ? gST->ConOut : nullptr;
}

void FlushToConsole(FormatSink<CHAR16> *Sink) {
  auto *Out = static_cast<EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *>(Sink->Context);
  Sink->Buffer[Sink->Length] = 0;
  if (Sink->Length != 0 && Out->OutputString != nullptr) {
    Out->OutputString(Out, Sink->Buffer);
  }
  Sink->Length = 0;
}

template <typename TFmt>
void ConsoleWriteV(const TFmt *Format, va_list Args) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *Out = Console();
  if (Out == nullptr || Format == nullptr) {
    return;
  }
  CHAR16 Buffer[ConsoleChunk + 1];
  FormatSink<CHAR16> Sink = {Buffer, ConsoleChunk, 0, FlushToConsole, Out};
  FormatToSink(&Sink, Format, Args);
  FlushToConsole(&Sink);
}

// Unconditional 8-bit print, for the standard lines below.
void ConsoleWrite(const CHAR8 *Format, ...) {
  va_list Args;
  va_start(Args, Format);
  ConsoleWriteV(Format, Args);
  va_end(Args);
}

UINT8 ChannelLevel(DiagChannel Channel) {
  switch (Channel) {
  case DiagChannel::Smb2:
    return gSMB2DebugLevel;
  case DiagChannel::Tcp:
    return gTcpDebugLevel;
  default:
    return gDriverDebugLevel;
  }
}

constexpr const CHAR8 *ErrorLine = "Function: %s, Line no.: = %d - %s, Status = %lld (0x%llx)\n";

} // namespace

bool DiagEnabled(DiagChannel Channel, UINT8 Threshold) {
  return ChannelLevel(Channel) >= Threshold;
}

void DiagLogV(DiagChannel Channel, UINT8 Threshold, const CHAR8 *Format, va_list Args) {
  if (DiagEnabled(Channel, Threshold)) {
    ConsoleWriteV(Format, Args);
  }
}

void DiagLog(UINT8 Threshold, const CHAR8 *Format, ...) {
  va_list Args;
  va_start(Args, Format);
  DiagLogV(DiagChannel::Driver, Threshold, Format, Args);
  va_end(Args);
}

void DiagLogW(UINT8 Threshold, const CHAR16 *Format, ...) {
  if (!DiagEnabled(DiagChannel::Driver, Threshold)) {
    return;
  }
  va_list Args;
  va_start(Args, Format);
  ConsoleWriteV(Format, Args);
  va_end(Args);
}

void Smb2Log(UINT8 Threshold, const CHAR8 *Format, ...) {
  va_list Args;
  va_start(Args, Format);
  DiagLogV(DiagChannel::Smb2, Threshold, Format, Args);
  va_end(Args);
}

void TcpLog(UINT8 Threshold, const CHAR8 *Format, ...) {
  va_list Args;
  va_start(Args, Format);
  DiagLogV(DiagChannel::Tcp, Threshold, Format, Args);
  va_end(Args);
}

void DiagError(const CHAR8 *Message, EFI_STATUS Status, const CHAR8 *Function, UINT32 Line) {
  ConsoleWrite(ErrorLine, Function, static_cast<int>(Line), Message, DiagStatusNumber(Status),
               DiagStatusValue(Status));
}

void DiagErrorAt(DiagChannel Channel, UINT8 Threshold, const CHAR8 *Message, EFI_STATUS Status,
                 const CHAR8 *Function, UINT32 Line) {
  if (DiagEnabled(Channel, Threshold)) {
    DiagError(Message, Status, Function, Line);
  }
}

void DiagEntry(DiagChannel Channel, const CHAR8 *Function, UINT32 Line) {
  if (DiagEnabled(Channel, DIAG_TRACE)) {
    ConsoleWrite("\nFunction: %s, Line no.: = %d. Entered\n", Function, static_cast<int>(Line));
  }
}

void DiagExit(EFI_STATUS Status, DiagChannel Channel, const CHAR8 *Function, UINT32 Line) {
  if (DiagEnabled(Channel, DIAG_TRACE)) {
    ConsoleWrite("Function: %s, Line no.: = %d. Exiting! Status = %lld (0x%llx)\n", Function,
                 static_cast<int>(Line), DiagStatusNumber(Status), DiagStatusValue(Status));
  }
}

void DiagNullInput(DiagChannel Channel, const CHAR8 *Function, UINT32 Line) {
  if (DiagEnabled(Channel, DIAG_ALWAYS)) {
    ConsoleWrite("Function: %s, Line no.: = %d, Input parameter is NULL!\n", Function,
                 static_cast<int>(Line));
  }
}

void DiagShortEntry(DiagChannel Channel, const CHAR8 *Function) {
  if (DiagEnabled(Channel, DIAG_TRACE)) {
    ConsoleWrite("Entering %s\n", Function);
  }
}

void DiagShortExit(EFI_STATUS Status, CHAR8 Separator, DiagChannel Channel, const CHAR8 *Function) {
  if (DiagEnabled(Channel, DIAG_TRACE)) {
    ConsoleWrite("Exiting %s%c Status = 0x%x\n", Function, Separator, static_cast<UINT32>(Status));
  }
}

void DiagGuid(UINT8 Threshold, const CHAR8 *Prefix, const EFI_GUID &Guid) {
  if (!DiagEnabled(DiagChannel::Driver, Threshold)) {
    return;
  }
  // %l takes 64-bit values here, so Data1 is widened before it is passed.
  ConsoleWrite("%aGuid = "
               "{%08lX-%04hX-%04hX-%02hhX%02hhX-%02hhX%02hhX%02hhX%02hhX%02hhX%02hhX}\n",
               Prefix != nullptr ? Prefix : "", static_cast<UINT64>(Guid.Data1), Guid.Data2,
               Guid.Data3, Guid.Data4[0], Guid.Data4[1], Guid.Data4[2], Guid.Data4[3],
               Guid.Data4[4], Guid.Data4[5], Guid.Data4[6], Guid.Data4[7]);
}
