// The formatter: one engine, parameterised by the format's character type and
// by the output sink, behind the buffer printers of NwBaseLib.h and the
// console lines of DiagLog.h.
#include "Library/CharCode.h"
#include "Library/FormatCore.h"
#include "NwBaseLib.h"

namespace {

// The variable arguments, wrapped so that helpers can consume them: va_list
// is an array on some ABIs and a plain pointer on others, and only a wrapped
// copy advances the same way on both.
struct ArgCursor {
  va_list Ap;
};

constexpr UINT8 FlagLeft = 0x01;
constexpr UINT8 FlagZero = 0x02;
constexpr UINT8 FlagPlus = 0x04;
constexpr UINT8 FlagSpace = 0x08;
constexpr UINT8 FlagAlternate = 0x10;

enum class LengthModifier : UINT8 { None, Char, Short, Long };

struct Directive {
  UINT8 Flags;
  UINT32 Width;
  INT32 Precision; // negative: none given
  LengthModifier Length;
};

constexpr UINT32 MaxField = 0x7FFFFFFF;

// ---------------------------------------------------------------------------
// Output
// ---------------------------------------------------------------------------
template <typename TOut>
void Put(FormatSink<TOut> *Sink, UINT32 C) {
  if (Sink->Length >= Sink->Capacity) {
    if (Sink->Flush == nullptr) {
      return;
    }
    Sink->Flush(Sink);
    if (Sink->Length >= Sink->Capacity) {
      return;
    }
  }
  Sink->Buffer[Sink->Length++] = CharFromCode<TOut>(C);
}

template <typename TOut>
void PutRepeated(FormatSink<TOut> *Sink, UINT32 C, UINTN Count) {
  for (UINTN I = 0; I < Count; I++) {
    if (Sink->Flush == nullptr && Sink->Length >= Sink->Capacity) {
      return; // a full buffer takes nothing more; skip the rest of a wide field
    }
    Put(Sink, C);
  }
}

// Spaces before right-aligned content of the given length.
template <typename TOut>
void PadBefore(FormatSink<TOut> *Sink, const Directive &Conv, UINTN Content) {
  if ((Conv.Flags & FlagLeft) == 0 && Conv.Width > Content) {
    PutRepeated(Sink, ' ', Conv.Width - Content);
  }
}

// Spaces after left-aligned content of the given length.
template <typename TOut>
void PadAfter(FormatSink<TOut> *Sink, const Directive &Conv, UINTN Content) {
  if ((Conv.Flags & FlagLeft) != 0 && Conv.Width > Content) {
    PutRepeated(Sink, ' ', Conv.Width - Content);
  }
}

template <typename TOut, typename TStr>
void EmitString(FormatSink<TOut> *Sink, const Directive &Conv, const TStr *String) {
  if (String == nullptr) {
    EmitString(Sink, Conv, "(null)");
    return;
  }
  const UINTN Max =
      Conv.Precision < 0 ? ~static_cast<UINTN>(0) : static_cast<UINTN>(Conv.Precision);
  UINTN Length = 0;
  while (Length < Max && String[Length] != 0) {
    Length++;
  }
  PadBefore(Sink, Conv, Length);
  for (UINTN I = 0; I < Length; I++) {
    Put(Sink, CharCode(String[I]));
  }
  PadAfter(Sink, Conv, Length);
}

template <typename TOut>
void EmitCharacter(FormatSink<TOut> *Sink, const Directive &Conv, UINT32 C) {
  PadBefore(Sink, Conv, 1);
  Put(Sink, C);
  PadAfter(Sink, Conv, 1);
}

struct IntegerForm {
  UINT32 Base;
  bool Upper;
  bool Signed;
  bool ForcePrefix; // "0x" even without '#' and for 0 (pointers)
};

template <typename TOut>
void EmitInteger(FormatSink<TOut> *Sink, const Directive &Conv, const IntegerForm &Form,
                 UINT64 Magnitude, bool Negative) {
  const CHAR8 *DigitSet = Form.Upper ? "0123456789ABCDEF" : "0123456789abcdef";
  const bool Zero = Magnitude == 0;
  CHAR8 Digits[24]; // 64 bits in octal is 22 digits
  UINTN Count = 0;
  if (!(Zero && Conv.Precision == 0)) {
    do {
      Digits[Count++] = DigitSet[Magnitude % Form.Base];
      Magnitude /= Form.Base;
    } while (Magnitude != 0);
  }

  UINTN Zeros = Conv.Precision > 0 && static_cast<UINTN>(Conv.Precision) > Count
                    ? static_cast<UINTN>(Conv.Precision) - Count
                    : 0;
  if (Form.Base == 8 && (Conv.Flags & FlagAlternate) != 0 && Zeros == 0 &&
      (Count == 0 || Digits[Count - 1] != '0')) {
    Zeros = 1;
  }
  CHAR8 Sign = 0;
  if (Form.Signed) {
    Sign = Negative                        ? '-'
           : (Conv.Flags & FlagPlus) != 0  ? '+'
           : (Conv.Flags & FlagSpace) != 0 ? ' '
                                           : 0;
  }
  const bool Prefix =
      Form.Base == 16 && (Form.ForcePrefix || ((Conv.Flags & FlagAlternate) != 0 && !Zero));

  UINTN Content = (Sign != 0 ? 1 : 0) + (Prefix ? 2 : 0) + Zeros + Count;
  if ((Conv.Flags & (FlagZero | FlagLeft)) == FlagZero && Conv.Precision < 0 &&
      Conv.Width > Content) {
    Zeros += Conv.Width - Content;
    Content = Conv.Width;
  }
  PadBefore(Sink, Conv, Content);
  if (Sign != 0) {
    Put(Sink, static_cast<UINT32>(Sign));
  }
  if (Prefix) {
    Put(Sink, '0');
    Put(Sink, Form.Upper ? 'X' : 'x');
  }
  PutRepeated(Sink, '0', Zeros);
  while (Count > 0) {
    Put(Sink, static_cast<UINT32>(Digits[--Count]));
  }
  PadAfter(Sink, Conv, Content);
}

// ---------------------------------------------------------------------------
// Addresses
// ---------------------------------------------------------------------------
struct TextBuilder {
  CHAR8 Text[48]; // the longest IPv6 text is 45 characters
  UINTN Length;
};

void Append(TextBuilder &B, CHAR8 C) {
  if (B.Length + 1 < sizeof(B.Text)) {
    B.Text[B.Length++] = C;
  }
  B.Text[B.Length] = 0;
}

void AppendNumber(TextBuilder &B, UINT32 Value, UINT32 Base) {
  CHAR8 Digits[8];
  UINTN Count = 0;
  do {
    Digits[Count++] = "0123456789abcdef"[Value % Base];
    Value /= Base;
  } while (Value != 0 && Count < sizeof(Digits));
  while (Count > 0) {
    Append(B, Digits[--Count]);
  }
}

void AppendIpv4(TextBuilder &B, const UINT8 *Bytes) {
  for (UINTN I = 0; I < 4; I++) {
    if (I != 0) {
      Append(B, '.');
    }
    AppendNumber(B, Bytes[I], 10);
  }
}

// RFC 5952 text: the longest run of two or more zero groups (the first of
// equal runs) becomes "::", groups in lower-case hex without leading zeros,
// and IPv4-mapped (::ffff:a.b.c.d) and IPv4-compatible (::a.b.c.d) addresses
// end in dotted decimal, as inet_ntop writes them.
void AppendIpv6(TextBuilder &B, const UINT8 *Bytes) {
  UINT32 Groups[8];
  for (UINTN I = 0; I < 8; I++) {
    Groups[I] = (static_cast<UINT32>(Bytes[2 * I]) << 8) | Bytes[2 * I + 1];
  }
  INTN BestBase = -1;
  INTN BestLength = 0;
  INTN RunBase = -1;
  for (INTN I = 0; I < 8; I++) {
    if (Groups[I] != 0) {
      RunBase = -1;
      continue;
    }
    RunBase = RunBase < 0 ? I : RunBase;
    if (I - RunBase + 1 > BestLength) {
      BestBase = RunBase;
      BestLength = I - RunBase + 1;
    }
  }
  if (BestLength < 2) {
    BestBase = -1;
  }
  for (INTN I = 0; I < 8; I++) {
    if (BestBase >= 0 && I >= BestBase && I < BestBase + BestLength) {
      if (I == BestBase) {
        Append(B, ':');
      }
      continue;
    }
    if (I != 0) {
      Append(B, ':');
    }
    if (I == 6 && BestBase == 0 && (BestLength == 6 || (BestLength == 5 && Groups[5] == 0xFFFF))) {
      AppendIpv4(B, Bytes + 12);
      return;
    }
    AppendNumber(B, Groups[I], 16);
  }
  if (BestBase >= 0 && BestBase + BestLength == 8) {
    Append(B, ':');
  }
}

template <typename TOut>
void EmitAddress(FormatSink<TOut> *Sink, const Directive &Conv, const UINT8 *Bytes, bool Ipv6) {
  if (Bytes == nullptr) {
    EmitString(Sink, Conv, "(null)");
    return;
  }
  TextBuilder B;
  B.Length = 0;
  B.Text[0] = 0;
  if (Ipv6) {
    AppendIpv6(B, Bytes);
  } else {
    AppendIpv4(B, Bytes);
  }
  EmitString(Sink, Conv, B.Text);
}

// ---------------------------------------------------------------------------
// Conversion directives
// ---------------------------------------------------------------------------
template <typename TFmt>
UINT32 ParseNumber(const TFmt *&Format) {
  UINT32 Value = 0;
  for (; *Format >= '0' && *Format <= '9'; Format++) {
    const UINT32 Digit = CharCode(*Format) - '0';
    Value = Value > (MaxField - Digit) / 10 ? MaxField : Value * 10 + Digit;
  }
  return Value;
}

// Reads flags, width, precision and length modifier; leaves Format at the
// conversion character.
template <typename TFmt>
Directive ParseDirective(const TFmt *&Format, ArgCursor &Args) {
  Directive Conv = {0, 0, -1, LengthModifier::None};
  for (;; Format++) {
    const UINT32 C = CharCode(*Format);
    const UINT8 Flag = C == '-'   ? FlagLeft
                       : C == '0' ? FlagZero
                       : C == '+' ? FlagPlus
                       : C == ' ' ? FlagSpace
                       : C == '#' ? FlagAlternate
                                  : 0;
    if (Flag == 0) {
      break;
    }
    Conv.Flags |= Flag;
  }
  if (*Format == '*') {
    Format++;
    const INT32 Width = va_arg(Args.Ap, int);
    if (Width < 0) {
      Conv.Flags |= FlagLeft;
      Conv.Width = Width == -0x7FFFFFFF - 1 ? MaxField : static_cast<UINT32>(-Width);
    } else {
      Conv.Width = static_cast<UINT32>(Width);
    }
  } else {
    Conv.Width = ParseNumber(Format);
  }
  if (*Format == '.') {
    Format++;
    if (*Format == '*') {
      Format++;
      const INT32 Precision = va_arg(Args.Ap, int);
      Conv.Precision = Precision < 0 ? -1 : Precision;
    } else {
      Conv.Precision = static_cast<INT32>(ParseNumber(Format));
    }
  }
  if (*Format == 'h') {
    Format++;
    Conv.Length = LengthModifier::Short;
    if (*Format == 'h') {
      Format++;
      Conv.Length = LengthModifier::Char;
    }
  } else if (*Format == 'l' || *Format == 'z' || *Format == 'j' || *Format == 't') {
    Conv.Length = LengthModifier::Long;
    if (*Format++ == 'l' && *Format == 'l') {
      Format++;
    }
  }
  return Conv;
}

UINT64 FetchUnsigned(ArgCursor &Args, LengthModifier Length) {
  switch (Length) {
  case LengthModifier::Long:
    return va_arg(Args.Ap, UINT64);
  case LengthModifier::Short:
    return static_cast<UINT16>(va_arg(Args.Ap, unsigned int));
  case LengthModifier::Char:
    return static_cast<UINT8>(va_arg(Args.Ap, unsigned int));
  default:
    return va_arg(Args.Ap, unsigned int);
  }
}

INT64 FetchSigned(ArgCursor &Args, LengthModifier Length) {
  switch (Length) {
  case LengthModifier::Long:
    return va_arg(Args.Ap, INT64);
  case LengthModifier::Short:
    return static_cast<INT16>(va_arg(Args.Ap, int));
  case LengthModifier::Char:
    return static_cast<INT8>(va_arg(Args.Ap, int));
  default:
    return va_arg(Args.Ap, int);
  }
}

// Handles the conversion at Format and moves past it. False when the
// conversion is unknown (nothing consumed beyond the directive's '*' arguments).
template <typename TFmt, typename TOut>
bool Convert(FormatSink<TOut> *Sink, const Directive &Conv, const TFmt *&Format, ArgCursor &Args) {
  const UINT32 C = CharCode(*Format);
  switch (C) {
  case 'd':
  case 'i': {
    const INT64 Value = FetchSigned(Args, Conv.Length);
    const UINT64 Magnitude =
        Value < 0 ? 0 - static_cast<UINT64>(Value) : static_cast<UINT64>(Value);
    EmitInteger(Sink, Conv, {10, false, true, false}, Magnitude, Value < 0);
    break;
  }
  case 'u':
  case 'x':
  case 'X':
  case 'o': {
    const UINT32 Base = C == 'u' ? 10 : C == 'o' ? 8 : 16;
    EmitInteger(Sink, Conv, {Base, C == 'X', false, false}, FetchUnsigned(Args, Conv.Length),
                false);
    break;
  }
  case 'c':
    EmitCharacter(Sink, Conv, static_cast<UINT32>(va_arg(Args.Ap, int)) & 0xFFFF);
    break;
  case 's':
    if (Conv.Length == LengthModifier::Long ||
        (sizeof(TFmt) == 2 && Conv.Length == LengthModifier::None)) {
      EmitString(Sink, Conv, va_arg(Args.Ap, const CHAR16 *));
    } else {
      EmitString(Sink, Conv, va_arg(Args.Ap, const CHAR8 *));
    }
    break;
  case 'S':
    EmitString(Sink, Conv, va_arg(Args.Ap, const CHAR16 *));
    break;
  case 'a':
    EmitString(Sink, Conv, va_arg(Args.Ap, const CHAR8 *));
    break;
  case 'p':
    if (Format[1] == 'I' && (Format[2] == '4' || Format[2] == '6')) {
      EmitAddress(Sink, Conv, va_arg(Args.Ap, const UINT8 *), Format[2] == '6');
      Format += 2;
    } else {
      Directive Pointer = Conv;
      Pointer.Precision = -1;
      EmitInteger(Sink, Pointer, {16, false, false, true},
                  reinterpret_cast<uintptr_t>(va_arg(Args.Ap, const void *)), false);
    }
    break;
  case '%':
    Put(Sink, '%');
    break;
  default:
    return false;
  }
  Format++;
  return true;
}

template <typename TFmt, typename TOut>
void FormatEngine(FormatSink<TOut> *Sink, const TFmt *Format, ArgCursor &Args) {
  if (Format == nullptr) {
    return;
  }
  while (*Format != 0) {
    if (*Format != '%') {
      Put(Sink, CharCode(*Format++));
      continue;
    }
    const TFmt *Start = Format++;
    const Directive Conv = ParseDirective(Format, Args);
    if (Convert(Sink, Conv, Format, Args)) {
      continue;
    }
    // Unknown: the whole directive is printed as written.
    if (*Format != 0) {
      Format++;
    }
    for (; Start < Format; Start++) {
      Put(Sink, CharCode(*Start));
    }
  }
}

template <typename TFmt, typename TOut>
void FormatWithCopy(FormatSink<TOut> *Sink, const TFmt *Format, va_list Args) {
  ArgCursor Cursor;
  va_copy(Cursor.Ap, Args);
  FormatEngine(Sink, Format, Cursor);
  va_end(Cursor.Ap);
}

template <typename TFmt, typename TOut>
UINTN PrintToBuffer(TOut *Buffer, UINTN BufferSize, const TFmt *Format, va_list Args) {
  if (Buffer == nullptr || BufferSize == 0) {
    return 0;
  }
  FormatSink<TOut> Sink = {Buffer, BufferSize - 1, 0, nullptr, nullptr};
  FormatWithCopy(&Sink, Format, Args);
  Buffer[Sink.Length] = 0;
  return Sink.Length;
}

} // namespace

void FormatToSink(FormatSink<CHAR8> *Sink, const CHAR8 *Format, va_list Args) {
  FormatWithCopy(Sink, Format, Args);
}
void FormatToSink(FormatSink<CHAR16> *Sink, const CHAR8 *Format, va_list Args) {
  FormatWithCopy(Sink, Format, Args);
}
void FormatToSink(FormatSink<CHAR16> *Sink, const CHAR16 *Format, va_list Args) {
  FormatWithCopy(Sink, Format, Args);
}

UINTN AsciiVSPrint(CHAR8 *Buffer, UINTN BufferSize, const CHAR8 *Format, va_list Args) {
  return PrintToBuffer(Buffer, BufferSize, Format, Args);
}

UINTN AsciiSPrint(CHAR8 *Buffer, UINTN BufferSize, const CHAR8 *Format, ...) {
  va_list Args;
  va_start(Args, Format);
  const UINTN Count = PrintToBuffer(Buffer, BufferSize, Format, Args);
  va_end(Args);
  return Count;
}

UINTN UnicodeSPrintAsciiFormat(CHAR16 *Buffer, UINTN BufferChars, const CHAR8 *Format, ...) {
  va_list Args;
  va_start(Args, Format);
  const UINTN Count = PrintToBuffer(Buffer, BufferChars, Format, Args);
  va_end(Args);
  return Count;
}

UINTN UnicodeSPrint(CHAR16 *Buffer, UINTN BufferChars, const CHAR16 *Format, ...) {
  va_list Args;
  va_start(Args, Format);
  const UINTN Count = PrintToBuffer(Buffer, BufferChars, Format, Args);
  va_end(Args);
  return Count;
}
