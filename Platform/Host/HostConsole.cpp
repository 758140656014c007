// The console: ConOut writes to stdout and StdErr to stderr, converting the
// firmware's UCS-2 to UTF-8 byte for byte as printed. No CR is inserted and
// nothing is added: the host program's output is exactly the image's text.
// Each string is flushed at once so that it interleaves correctly with any
// other output of the process.
#include "HostCore.h"

#include <stdio.h>

namespace {

constexpr CHAR16 ReplacementCharacter = 0xFFFD;

struct HostTextOut {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL Protocol; // first: the interface is the record
  SIMPLE_TEXT_OUTPUT_MODE Mode;
  FILE *(*Stream)();
};

FILE *StdoutStream() {
  return stdout;
}
FILE *StderrStream() {
  return stderr;
}

bool gCapturing = false;
std::string gCaptured;
std::string gCaptureResult;

HostTextOut *TextOutOf(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This) {
  return reinterpret_cast<HostTextOut *>(This);
}

void AppendUtf8(std::string &Out, uint32_t CodePoint) {
  if (CodePoint < 0x80) {
    Out.push_back(static_cast<char>(CodePoint));
  } else if (CodePoint < 0x800) {
    Out.push_back(static_cast<char>(0xC0 | (CodePoint >> 6)));
    Out.push_back(static_cast<char>(0x80 | (CodePoint & 0x3F)));
  } else {
    Out.push_back(static_cast<char>(0xE0 | (CodePoint >> 12)));
    Out.push_back(static_cast<char>(0x80 | ((CodePoint >> 6) & 0x3F)));
    Out.push_back(static_cast<char>(0x80 | (CodePoint & 0x3F)));
  }
}

EFI_STATUS EFIAPI TextReset(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, BOOLEAN) {
  if (This == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  This->Mode->CursorColumn = 0;
  This->Mode->CursorRow = 0;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI TextOutputString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String) {
  if (This == nullptr || String == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  HostTextOut *Out = TextOutOf(This);
  std::string Text = HostUcs2ToUtf8(String);
  for (const CHAR16 *P = String; *P != 0; P++) {
    if (*P == u'\n') {
      Out->Mode.CursorRow++;
    } else if (*P == u'\r') {
      Out->Mode.CursorColumn = 0;
    } else {
      Out->Mode.CursorColumn++;
    }
  }
  if (gCapturing && Out->Stream == StdoutStream) {
    gCaptured += Text;
    return EFI_SUCCESS;
  }
  FILE *Stream = Out->Stream();
  if (!Text.empty() && fwrite(Text.data(), 1, Text.size(), Stream) != Text.size()) {
    return EFI_DEVICE_ERROR;
  }
  fflush(Stream);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI TextTestString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String) {
  return (This == nullptr || String == nullptr) ? EFI_INVALID_PARAMETER : EFI_SUCCESS;
}

constexpr UINTN ConsoleColumns = 80;
constexpr UINTN ConsoleRows = 25;

EFI_STATUS EFIAPI TextQueryMode(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN ModeNumber,
                                UINTN *Columns, UINTN *Rows) {
  if (This == nullptr || Columns == nullptr || Rows == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (ModeNumber != 0) {
    return EFI_UNSUPPORTED;
  }
  *Columns = ConsoleColumns;
  *Rows = ConsoleRows;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI TextSetMode(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN ModeNumber) {
  if (This == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  return ModeNumber == 0 ? EFI_SUCCESS : EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI TextSetAttribute(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN Attribute) {
  if (This == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  This->Mode->Attribute = static_cast<INT32>(Attribute & 0x7F);
  return EFI_SUCCESS;
}

// Clearing and cursor moves leave no trace in the output stream: a captured
// or redirected console must hold only the text the image printed.
EFI_STATUS EFIAPI TextClearScreen(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This) {
  return TextReset(This, FALSE);
}

EFI_STATUS EFIAPI TextSetCursorPosition(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN Column,
                                        UINTN Row) {
  if (This == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (Column >= ConsoleColumns || Row >= ConsoleRows) {
    return EFI_UNSUPPORTED;
  }
  This->Mode->CursorColumn = static_cast<INT32>(Column);
  This->Mode->CursorRow = static_cast<INT32>(Row);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI TextEnableCursor(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, BOOLEAN Visible) {
  if (This == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  This->Mode->CursorVisible = Visible;
  return EFI_SUCCESS;
}

constexpr SIMPLE_TEXT_OUTPUT_MODE InitialMode = {1, 0, 0x07, 0, 0, TRUE};

HostTextOut gConOut = {{TextReset, TextOutputString, TextTestString, TextQueryMode, TextSetMode,
                        TextSetAttribute, TextClearScreen, TextSetCursorPosition, TextEnableCursor,
                        &gConOut.Mode},
                       InitialMode,
                       StdoutStream};
HostTextOut gStdErr = {{TextReset, TextOutputString, TextTestString, TextQueryMode, TextSetMode,
                        TextSetAttribute, TextClearScreen, TextSetCursorPosition, TextEnableCursor,
                        &gStdErr.Mode},
                       InitialMode,
                       StderrStream};

} // namespace

EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *HostConsoleOut() {
  gConOut.Mode = InitialMode;
  return &gConOut.Protocol;
}

EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *HostConsoleErr() {
  gStdErr.Mode = InitialMode;
  return &gStdErr.Protocol;
}

void HostConsoleCaptureBegin() {
  gCaptured.clear();
  gCapturing = true;
}

const char *HostConsoleCaptureEnd() {
  gCapturing = false;
  gCaptureResult.swap(gCaptured);
  gCaptured.clear();
  return gCaptureResult.c_str();
}

std::string HostUcs2ToUtf8(const CHAR16 *Text, size_t Length) {
  std::string Out;
  if (Text == nullptr) {
    return Out;
  }
  Out.reserve(Length);
  for (size_t I = 0; I < Length; I++) {
    AppendUtf8(Out, Text[I]);
  }
  return Out;
}

std::string HostUcs2ToUtf8(const CHAR16 *Text) {
  size_t Length = 0;
  while (Text != nullptr && Text[Length] != 0) {
    Length++;
  }
  return HostUcs2ToUtf8(Text, Length);
}

std::u16string HostUtf8ToUcs2(const char *Text) {
  std::u16string Out;
  if (Text == nullptr) {
    return Out;
  }
  const unsigned char *P = reinterpret_cast<const unsigned char *>(Text);
  while (*P != 0) {
    unsigned Lead = *P++;
    int Continuation = 0;
    uint32_t CodePoint = 0;
    uint32_t Minimum = 0;
    if (Lead < 0x80) {
      Out.push_back(static_cast<CHAR16>(Lead));
      continue;
    } else if ((Lead & 0xE0) == 0xC0) {
      Continuation = 1, CodePoint = Lead & 0x1F, Minimum = 0x80;
    } else if ((Lead & 0xF0) == 0xE0) {
      Continuation = 2, CodePoint = Lead & 0x0F, Minimum = 0x800;
    } else if ((Lead & 0xF8) == 0xF0) {
      Continuation = 3, CodePoint = Lead & 0x07, Minimum = 0x10000;
    } else {
      Out.push_back(ReplacementCharacter);
      continue;
    }
    bool Valid = true;
    for (int I = 0; I < Continuation; I++) {
      if ((*P & 0xC0) != 0x80) { // also stops at the terminator
        Valid = false;
        break;
      }
      CodePoint = (CodePoint << 6) | (*P++ & 0x3F);
    }
    if (!Valid || CodePoint < Minimum || CodePoint > 0xFFFF) {
      Out.push_back(ReplacementCharacter);
    } else {
      Out.push_back(static_cast<CHAR16>(CodePoint));
    }
  }
  return Out;
}
