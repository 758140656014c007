// The formatter's engine, shared by the buffer printers (Print.cpp) and the
// console (DiagLog.cpp). Not for general use: callers go through NwBaseLib.h
// and DiagLog.h.
#pragma once

#include "Uefi.h"

// Where formatted characters go. The engine appends to Buffer; when the
// buffer is full it calls Flush, which must empty it (Length = 0) and may use
// Context. Without Flush the rest of the output is dropped. Capacity leaves no
// room for a terminator: the owner reserves one more slot if it needs one.
template <typename TOut>
struct FormatSink {
  TOut *Buffer;
  UINTN Capacity;
  UINTN Length;
  void (*Flush)(FormatSink *Sink);
  void *Context;
};

// Formats into the sink; does not terminate and does not flush the last part.
void FormatToSink(FormatSink<CHAR8> *Sink, const CHAR8 *Format, va_list Args);
void FormatToSink(FormatSink<CHAR16> *Sink, const CHAR8 *Format, va_list Args);
void FormatToSink(FormatSink<CHAR16> *Sink, const CHAR16 *Format, va_list Args);
