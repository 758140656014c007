// ramfs:\sysInfo.xml: the service tag and the time stamp the backup image is
// named after. Only the two elements are read, by a deliberately small and
// strict reader rather than a general parser: what it does not understand it
// rejects with a clear message.
//
//   <SystemInfo>
//     <ServiceTag>7XK4Q2R</ServiceTag>
//     <TimeStamp>2026-11-22T18:51:00</TimeStamp>
//   </SystemInfo>
#include "ExportToNWFS/ExportTasks.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "ShellCommand.h"

namespace {

constexpr const CHAR8 *kServiceTagElement = "ServiceTag";
constexpr const CHAR8 *kTimeStampElement = "TimeStamp";
constexpr UINTN kMaxElementName = 32;
constexpr UINTN kNotFound = ~static_cast<UINTN>(0);
// "YYYY-MM-DDTHH:MM:SS"
constexpr UINTN kTimeStampLength = 19;
constexpr UINT16 kMinYear = 1900;
constexpr UINT16 kMaxYear = 9999;

bool IsNameCharacter(CHAR8 Character) {
  return (Character >= 'a' && Character <= 'z') || (Character >= 'A' && Character <= 'Z');
}

bool IsXmlSpace(CHAR8 Character) {
  return Character == ' ' || Character == '\t' || Character == '\r' || Character == '\n';
}

EFI_STATUS Malformed(const CHAR8 *Element, const CHAR8 *Why) {
  DiagLog(DIAG_ALWAYS, "\nsysInfo.xml: <%a> %a!\n", Element, Why);
  return EFI_INVALID_PARAMETER;
}

// The offset of the one start tag "<Element>"; kNotFound when absent.
// *Status is EFI_INVALID_PARAMETER for a second start tag or one with
// attributes or a self-closing one.
UINTN FindOnlyStartTag(const CHAR8 *Text, UINTN Length, const CHAR8 *Element, UINTN NameLength,
                       EFI_STATUS *Status) {
  UINTN Found = kNotFound;
  for (UINTN At = 0; At < Length; At++) {
    if (Text[At] != '<' || Length - At < NameLength + 2 ||
        CompareMem(Text + At + 1, Element, NameLength) != 0) {
      continue;
    }
    CHAR8 Next = Text[At + 1 + NameLength];
    if (IsXmlSpace(Next) || Next == '/') {
      *Status = Malformed(Element, "has attributes or no content");
      return kNotFound;
    }
    if (Next != '>') {
      continue; // a longer name that only begins like this one
    }
    if (Found != kNotFound) {
      *Status = Malformed(Element, "appears more than once");
      return kNotFound;
    }
    Found = At;
  }
  return Found;
}

bool IsTwoDigits(const CHAR8 *Text, UINT8 *Value) {
  if (Text[0] < '0' || Text[0] > '9' || Text[1] < '0' || Text[1] > '9') {
    return false;
  }
  *Value = static_cast<UINT8>((Text[0] - '0') * 10 + (Text[1] - '0'));
  return true;
}

bool IsLeapYear(UINT16 Year) {
  return (Year % 4 == 0 && Year % 100 != 0) || Year % 400 == 0;
}

UINT8 DaysInMonth(UINT16 Year, UINT8 Month) {
  constexpr UINT8 kDays[12] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  return Month == 2 && IsLeapYear(Year) ? 29 : kDays[Month - 1];
}

} // namespace

EFI_STATUS XmlReadElement(const CHAR8 *Text, UINTN Length, const CHAR8 *Element, CHAR8 *Value,
                          UINTN Size) {
  if ((Text == nullptr && Length != 0) || Element == nullptr || Value == nullptr || Size == 0) {
    return EFI_INVALID_PARAMETER;
  }
  Value[0] = 0;
  UINTN NameLength = AsciiStrnLen(Element, kMaxElementName + 1);
  if (NameLength == 0 || NameLength > kMaxElementName) {
    return EFI_INVALID_PARAMETER;
  }
  for (UINTN Index = 0; Index < NameLength; Index++) {
    if (!IsNameCharacter(Element[Index])) {
      return EFI_INVALID_PARAMETER;
    }
  }
  for (UINTN Index = 0; Index < Length; Index++) {
    if (Text[Index] == 0) {
      return Malformed(Element, "cannot be read: the file holds a NUL byte");
    }
  }

  EFI_STATUS Status = EFI_SUCCESS;
  UINTN Start = FindOnlyStartTag(Text, Length, Element, NameLength, &Status);
  if (Start == kNotFound) {
    if (Status == EFI_SUCCESS) {
      DiagLog(DIAG_ALWAYS, "\nsysInfo.xml: <%a> not found!\n", Element);
      Status = EFI_NOT_FOUND;
    }
    return Status;
  }
  UINTN ValueStart = Start + NameLength + 2;
  UINTN ValueEnd = ValueStart;
  while (ValueEnd < Length && Text[ValueEnd] != '<') {
    CHAR8 Character = Text[ValueEnd];
    if (Character == '&' || Character == '>' || static_cast<UINT8>(Character) < 0x20 ||
        static_cast<UINT8>(Character) >= 0x7F) {
      return Malformed(Element, "holds a character this reader does not accept");
    }
    ValueEnd++;
  }
  // The text must be followed directly by "</Element>".
  CHAR8 EndTag[kMaxElementName + 4];
  AsciiSPrint(EndTag, sizeof(EndTag), "</%a>", Element);
  UINTN EndTagLength = NameLength + 3;
  if (Length - ValueEnd < EndTagLength || CompareMem(Text + ValueEnd, EndTag, EndTagLength) != 0) {
    return Malformed(Element, "is not closed by its end tag");
  }
  if (ValueEnd == ValueStart) {
    return Malformed(Element, "is empty");
  }
  UINTN ValueLength = ValueEnd - ValueStart;
  if (ValueLength + 1 > Size) {
    DiagLog(DIAG_ALWAYS, "\nsysInfo.xml: <%a> is too long (%d characters)!\n", Element,
            static_cast<INT32>(ValueLength));
    return EFI_BUFFER_TOO_SMALL;
  }
  CopyMem(Value, Text + ValueStart, ValueLength);
  Value[ValueLength] = 0;
  return EFI_SUCCESS;
}

EFI_STATUS ParseXmlTimeStamp(const CHAR8 *Text, EFI_TIME *Time) {
  if (Text == nullptr || Time == nullptr ||
      AsciiStrnLen(Text, kTimeStampLength + 1) != kTimeStampLength || Text[4] != '-' ||
      Text[7] != '-' || Text[10] != 'T' || Text[13] != ':' || Text[16] != ':') {
    return EFI_INVALID_PARAMETER;
  }
  UINT8 Century = 0;
  UINT8 YearInCentury = 0;
  EFI_TIME Parsed = {};
  if (!IsTwoDigits(Text, &Century) || !IsTwoDigits(Text + 2, &YearInCentury) ||
      !IsTwoDigits(Text + 5, &Parsed.Month) || !IsTwoDigits(Text + 8, &Parsed.Day) ||
      !IsTwoDigits(Text + 11, &Parsed.Hour) || !IsTwoDigits(Text + 14, &Parsed.Minute) ||
      !IsTwoDigits(Text + 17, &Parsed.Second)) {
    return EFI_INVALID_PARAMETER;
  }
  Parsed.Year = static_cast<UINT16>(Century * 100 + YearInCentury);
  if (Parsed.Year < kMinYear || Parsed.Year > kMaxYear || Parsed.Month < 1 || Parsed.Month > 12 ||
      Parsed.Day < 1 || Parsed.Day > DaysInMonth(Parsed.Year, Parsed.Month) || Parsed.Hour > 23 ||
      Parsed.Minute > 59 || Parsed.Second > 59) {
    return EFI_INVALID_PARAMETER;
  }
  *Time = Parsed;
  return EFI_SUCCESS;
}

EFI_STATUS ParseSysInfo(const CHAR8 *Text, UINTN Length, CHAR8 *ServiceTag, UINTN Size,
                        EFI_TIME *Time) {
  EFI_STATUS Status = XmlReadElement(Text, Length, kServiceTagElement, ServiceTag, Size);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  for (const CHAR8 *Character = ServiceTag; *Character != 0; Character++) {
    if (!IsNameCharacter(*Character) && (*Character < '0' || *Character > '9')) {
      return Malformed(kServiceTagElement, "may hold only letters and digits");
    }
  }
  CHAR8 Stamp[kTimeStampLength + 1];
  Status = XmlReadElement(Text, Length, kTimeStampElement, Stamp, sizeof(Stamp));
  if (EFI_ERROR(Status)) {
    return Status == EFI_BUFFER_TOO_SMALL ? EFI_INVALID_PARAMETER : Status;
  }
  if (EFI_ERROR(ParseXmlTimeStamp(Stamp, Time))) {
    return Malformed(kTimeStampElement, "is not a time stamp YYYY-MM-DDTHH:MM:SS");
  }
  return EFI_SUCCESS;
}

EFI_STATUS ReadSysInfo(CHAR8 *ServiceTag, UINTN Size, EFI_TIME *Time) {
  EFI_SHELL_PROTOCOL *Shell = CurrentShell();
  if (Shell == nullptr) {
    return EFI_NOT_FOUND;
  }
  SHELL_FILE_HANDLE File = nullptr;
  EFI_STATUS Status = Shell->OpenFileByName(EXPORT_SYSINFO_FILE, &File, EFI_FILE_MODE_READ);
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "\n%ls cannot be opened!\n", EXPORT_SYSINFO_FILE);
    return Status;
  }
  UINT64 FileSize = 0;
  Status = Shell->GetFileSize(File, &FileSize);
  CHAR8 *Text = nullptr;
  if (!EFI_ERROR(Status) && (FileSize == 0 || FileSize > SYSINFO_MAX_BYTES)) {
    DiagLog(DIAG_ALWAYS, "\n%ls has %lld bytes, expected 1 to %d!\n", EXPORT_SYSINFO_FILE, FileSize,
            static_cast<INT32>(SYSINFO_MAX_BYTES));
    Status = EFI_INVALID_PARAMETER;
  }
  if (!EFI_ERROR(Status)) {
    Text = static_cast<CHAR8 *>(AllocateZeroPool(static_cast<UINTN>(FileSize) + 1));
    Status = Text != nullptr ? EFI_SUCCESS : EFI_OUT_OF_RESOURCES;
  }
  UINTN Done = 0;
  while (!EFI_ERROR(Status) && Done < FileSize) {
    UINTN Chunk = static_cast<UINTN>(FileSize) - Done;
    Status = Shell->ReadFile(File, &Chunk, Text + Done);
    if (!EFI_ERROR(Status) && (Chunk == 0 || Chunk > FileSize - Done)) {
      Status = EFI_DEVICE_ERROR; // shorter or longer than it said it was
    }
    Done += EFI_ERROR(Status) ? 0 : Chunk;
  }
  Shell->CloseFile(File);
  if (!EFI_ERROR(Status)) {
    Status = ParseSysInfo(Text, Done, ServiceTag, Size, Time);
  }
  FreePool(Text);
  return Status;
}
