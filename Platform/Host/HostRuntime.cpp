// Runtime services of the hosted environment: UEFI variables kept in a text
// file, and the clock.
//
// The variable store file is a contract with the tests and scripts that run
// the host program, and it holds every variable, volatile ones included (so
// that the outcome of a run can be read afterwards):
//
//   # comment lines start with '#'
//   {4C4AC96B-DD0A-447E-8118-105900DA8629} PROVISIONING_ENV_VAR 3 00ff...
//
// one variable per line: the vendor GUID in upper case with braces, the name
// in UTF-8, the attributes in hexadecimal and the data as hexadecimal bytes.
// In the name, '%', space and control characters are written as %XX escapes
// of their UTF-8 bytes. Empty data is written as "-". The file is rewritten
// whole, through a temporary file and a rename, so that a reader never sees
// half a store: at once after every change to a non-volatile variable, and
// at exit (HostShutdown or ResetSystem) after changes to volatile ones only,
// which live in memory until then. A run records its status in a volatile
// variable after every network operation; writing the file each time would
// cost more than the operation.
#include "HostCore.h"

#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

namespace {

struct HostVariable {
  EFI_GUID Guid;
  std::u16string Name;
  UINT32 Attributes;
  std::vector<uint8_t> Data;
};

constexpr UINT32 EFI_VARIABLE_HARDWARE_ERROR_RECORD = 0x00000008;
constexpr UINT32 EFI_VARIABLE_AUTHENTICATED_WRITE_ACCESS = 0x00000010;
constexpr UINT32 EFI_VARIABLE_TIME_BASED_AUTHENTICATED_WRITE_ACCESS = 0x00000020;
constexpr UINT32 EFI_VARIABLE_APPEND_WRITE = 0x00000040;
constexpr UINT32 StorableAttributes =
    EFI_VARIABLE_NON_VOLATILE | EFI_VARIABLE_BOOTSERVICE_ACCESS | EFI_VARIABLE_RUNTIME_ACCESS;
constexpr UINT32 AuthenticationAttributes = EFI_VARIABLE_AUTHENTICATED_WRITE_ACCESS |
                                            EFI_VARIABLE_TIME_BASED_AUTHENTICATED_WRITE_ACCESS |
                                            EFI_VARIABLE_HARDWARE_ERROR_RECORD;
// Name (with terminator) plus data of one variable, as a firmware store limits it.
constexpr size_t MaxVariableSize = 0x10000;
constexpr uint64_t StoreCapacity = 0x100000;
constexpr INT16 EFI_UNSPECIFIED_TIMEZONE = 0x07FF;
constexpr const char *StoreHeader =
    "# CIFSDrv variable store: {GUID} Name ATTRIBUTES_HEX DATA_HEX (\"-\" for no data)\n";

std::vector<HostVariable> gVariables; // creation order, the order of GetNextVariableName
std::string gStorePath;
bool gStoreDirty = false; // volatile changes not yet in the file
uint32_t gHighMonotonicCount = 0;

size_t NameLength(const CHAR16 *Name) {
  size_t Length = 0;
  while (Name[Length] != 0) {
    Length++;
  }
  return Length;
}

HostVariable *FindVariable(const CHAR16 *Name, const EFI_GUID &Guid) {
  for (HostVariable &V : gVariables) {
    if (EfiGuidEqual(V.Guid, Guid) && V.Name == Name) {
      return &V;
    }
  }
  return nullptr;
}

// ---------------------------------------------------------------------------
// The store file
// ---------------------------------------------------------------------------
std::string FormatGuid(const EFI_GUID &G) {
  char Text[40];
  snprintf(Text, sizeof Text, "{%08X-%04X-%04X-%02X%02X-%02X%02X%02X%02X%02X%02X}", G.Data1,
           G.Data2, G.Data3, G.Data4[0], G.Data4[1], G.Data4[2], G.Data4[3], G.Data4[4], G.Data4[5],
           G.Data4[6], G.Data4[7]);
  return Text;
}

int HexDigit(char C) {
  if (C >= '0' && C <= '9') {
    return C - '0';
  }
  if (C >= 'a' && C <= 'f') {
    return C - 'a' + 10;
  }
  if (C >= 'A' && C <= 'F') {
    return C - 'A' + 10;
  }
  return -1;
}

// Parses Digits hex digits at Text into Value.
bool ParseHex(const std::string &Text, size_t Offset, size_t Digits, uint64_t &Value) {
  if (Offset + Digits > Text.size()) {
    return false;
  }
  Value = 0;
  for (size_t I = 0; I < Digits; I++) {
    int D = HexDigit(Text[Offset + I]);
    if (D < 0) {
      return false;
    }
    Value = (Value << 4) | static_cast<unsigned>(D);
  }
  return true;
}

bool ParseGuid(const std::string &Text, EFI_GUID &Guid) {
  // {XXXXXXXX-XXXX-XXXX-XXXX-XXXXXXXXXXXX}
  if (Text.size() != 38 || Text[0] != '{' || Text[37] != '}' || Text[9] != '-' || Text[14] != '-' ||
      Text[19] != '-' || Text[24] != '-') {
    return false;
  }
  uint64_t Value = 0;
  if (!ParseHex(Text, 1, 8, Value)) {
    return false;
  }
  Guid.Data1 = static_cast<UINT32>(Value);
  if (!ParseHex(Text, 10, 4, Value)) {
    return false;
  }
  Guid.Data2 = static_cast<UINT16>(Value);
  if (!ParseHex(Text, 15, 4, Value)) {
    return false;
  }
  Guid.Data3 = static_cast<UINT16>(Value);
  static constexpr size_t ByteOffsets[8] = {20, 22, 25, 27, 29, 31, 33, 35};
  for (int I = 0; I < 8; I++) {
    if (!ParseHex(Text, ByteOffsets[I], 2, Value)) {
      return false;
    }
    Guid.Data4[I] = static_cast<UINT8>(Value);
  }
  return true;
}

std::string EscapeName(const std::u16string &Name) {
  std::string Utf8 = HostUcs2ToUtf8(Name.data(), Name.size());
  std::string Out;
  for (unsigned char C : Utf8) {
    if (C <= ' ' || C == '%' || C == 0x7F) {
      char Escape[4];
      snprintf(Escape, sizeof Escape, "%%%02X", C);
      Out += Escape;
    } else {
      Out.push_back(static_cast<char>(C));
    }
  }
  return Out;
}

bool UnescapeName(const std::string &Text, std::u16string &Name) {
  std::string Utf8;
  for (size_t I = 0; I < Text.size(); I++) {
    uint64_t Byte = 0;
    if (Text[I] != '%') {
      Utf8.push_back(Text[I]);
    } else if (ParseHex(Text, I + 1, 2, Byte) && Byte != 0) {
      Utf8.push_back(static_cast<char>(Byte));
      I += 2;
    } else {
      return false;
    }
  }
  Name = HostUtf8ToUcs2(Utf8.c_str());
  return !Name.empty();
}

bool ParseData(const std::string &Text, std::vector<uint8_t> &Data) {
  Data.clear();
  if (Text == "-") {
    return true;
  }
  if (Text.size() % 2 != 0) {
    return false;
  }
  for (size_t I = 0; I < Text.size(); I += 2) {
    uint64_t Byte = 0;
    if (!ParseHex(Text, I, 2, Byte)) {
      return false;
    }
    Data.push_back(static_cast<uint8_t>(Byte));
  }
  return true;
}

std::vector<std::string> SplitFields(const std::string &Line) {
  std::vector<std::string> Fields;
  size_t I = 0;
  while (I < Line.size()) {
    while (I < Line.size() && (Line[I] == ' ' || Line[I] == '\t')) {
      I++;
    }
    size_t Start = I;
    while (I < Line.size() && Line[I] != ' ' && Line[I] != '\t') {
      I++;
    }
    if (I > Start) {
      Fields.push_back(Line.substr(Start, I - Start));
    }
  }
  return Fields;
}

bool ParseLine(const std::string &Line, HostVariable &V) {
  std::vector<std::string> Fields = SplitFields(Line);
  if (Fields.size() != 4 || Fields[2].empty() || Fields[2].size() > 8) {
    return false;
  }
  uint64_t Attributes = 0;
  if (!ParseGuid(Fields[0], V.Guid) || !UnescapeName(Fields[1], V.Name) ||
      !ParseHex(Fields[2], 0, Fields[2].size(), Attributes) || !ParseData(Fields[3], V.Data)) {
    return false;
  }
  V.Attributes = static_cast<UINT32>(Attributes);
  return true;
}

void LoadStore() {
  gVariables.clear();
  FILE *File = fopen(gStorePath.c_str(), "r");
  if (File == nullptr) {
    return; // no file yet: an empty store
  }
  std::string Line;
  unsigned LineNumber = 0;
  for (int C = fgetc(File);; C = fgetc(File)) {
    if (C != EOF && C != '\n') {
      Line.push_back(static_cast<char>(C));
      continue;
    }
    LineNumber++;
    if (!Line.empty() && Line.back() == '\r') {
      Line.pop_back();
    }
    HostVariable V{};
    bool Blank = Line.find_first_not_of(" \t") == std::string::npos;
    if (!Blank && Line[0] != '#') {
      if (!ParseLine(Line, V)) {
        fprintf(stderr, "host: %s:%u: malformed variable line ignored\n", gStorePath.c_str(),
                LineNumber);
      } else if (HostVariable *Old = FindVariable(V.Name.c_str(), V.Guid)) {
        *Old = V; // the last line for a variable wins
      } else {
        gVariables.push_back(V);
      }
    }
    Line.clear();
    if (C == EOF) {
      break;
    }
  }
  fclose(File);
}

bool WriteStore() {
  if (gStorePath.empty()) {
    return true;
  }
  std::string Text = StoreHeader;
  for (const HostVariable &V : gVariables) {
    char Attributes[16];
    snprintf(Attributes, sizeof Attributes, "%X", V.Attributes);
    Text += FormatGuid(V.Guid) + " " + EscapeName(V.Name) + " " + Attributes + " ";
    if (V.Data.empty()) {
      Text += "-";
    }
    for (uint8_t Byte : V.Data) {
      static constexpr char Digits[] = "0123456789abcdef";
      Text.push_back(Digits[Byte >> 4]);
      Text.push_back(Digits[Byte & 0xF]);
    }
    Text += "\n";
  }
  std::string Temporary = gStorePath + ".tmp." + std::to_string(getpid());
  FILE *File = fopen(Temporary.c_str(), "w");
  if (File == nullptr) {
    return false;
  }
  bool Written = fwrite(Text.data(), 1, Text.size(), File) == Text.size();
  Written = (fclose(File) == 0) && Written;
  if (!Written || rename(Temporary.c_str(), gStorePath.c_str()) != 0) {
    unlink(Temporary.c_str());
    return false;
  }
  gStoreDirty = false;
  return true;
}

void FlushStore() {
  if (gStoreDirty && !WriteStore()) {
    fprintf(stderr, "host: cannot write the variable store %s\n", gStorePath.c_str());
  }
}

// ---------------------------------------------------------------------------
// Variable services
// ---------------------------------------------------------------------------
EFI_STATUS EFIAPI RtGetVariable(const CHAR16 *VariableName, const EFI_GUID *VendorGuid,
                                UINT32 *Attributes, UINTN *DataSize, void *Data) {
  if (VariableName == nullptr || VendorGuid == nullptr || DataSize == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const HostVariable *V = VariableName[0] == 0 ? nullptr : FindVariable(VariableName, *VendorGuid);
  if (V == nullptr) {
    return EFI_NOT_FOUND;
  }
  if (Attributes != nullptr) {
    *Attributes = V->Attributes;
  }
  if (*DataSize < V->Data.size()) {
    *DataSize = V->Data.size();
    return EFI_BUFFER_TOO_SMALL;
  }
  if (Data == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (!V->Data.empty()) {
    memcpy(Data, V->Data.data(), V->Data.size());
  }
  *DataSize = V->Data.size();
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI RtGetNextVariableName(UINTN *VariableNameSize, CHAR16 *VariableName,
                                        EFI_GUID *VendorGuid) {
  if (VariableNameSize == nullptr || VariableName == nullptr || VendorGuid == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  // The name given must be terminated within the buffer size given.
  size_t Capacity = *VariableNameSize / sizeof(CHAR16);
  size_t Length = 0;
  while (Length < Capacity && VariableName[Length] != 0) {
    Length++;
  }
  if (Length == Capacity) {
    return EFI_INVALID_PARAMETER;
  }
  size_t Next = 0;
  if (Length != 0) {
    const HostVariable *Current = FindVariable(VariableName, *VendorGuid);
    if (Current == nullptr) {
      return EFI_INVALID_PARAMETER;
    }
    Next = static_cast<size_t>(Current - gVariables.data()) + 1;
  }
  if (Next >= gVariables.size()) {
    return EFI_NOT_FOUND;
  }
  const HostVariable &V = gVariables[Next];
  UINTN Needed = (V.Name.size() + 1) * sizeof(CHAR16);
  if (*VariableNameSize < Needed) {
    *VariableNameSize = Needed;
    return EFI_BUFFER_TOO_SMALL;
  }
  memcpy(VariableName, V.Name.c_str(), Needed);
  *VendorGuid = V.Guid;
  *VariableNameSize = Needed;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI RtSetVariable(const CHAR16 *VariableName, const EFI_GUID *VendorGuid,
                                UINT32 Attributes, UINTN DataSize, const void *Data) {
  if (VariableName == nullptr || VendorGuid == nullptr || VariableName[0] == 0 ||
      (DataSize != 0 && Data == nullptr)) {
    return EFI_INVALID_PARAMETER;
  }
  if ((Attributes & AuthenticationAttributes) != 0) {
    return EFI_UNSUPPORTED;
  }
  UINT32 Stored = Attributes & ~EFI_VARIABLE_APPEND_WRITE;
  bool Append = (Attributes & EFI_VARIABLE_APPEND_WRITE) != 0;
  if ((Stored & ~StorableAttributes) != 0 ||
      (Stored & (EFI_VARIABLE_RUNTIME_ACCESS | EFI_VARIABLE_BOOTSERVICE_ACCESS)) ==
          EFI_VARIABLE_RUNTIME_ACCESS) {
    return EFI_INVALID_PARAMETER;
  }
  size_t NameBytes = (NameLength(VariableName) + 1) * sizeof(CHAR16);
  if (NameBytes + DataSize > MaxVariableSize) {
    return EFI_INVALID_PARAMETER;
  }
  HostVariable *V = FindVariable(VariableName, *VendorGuid);
  if (V != nullptr && Stored != 0 && Stored != V->Attributes) {
    return EFI_INVALID_PARAMETER; // rewriting with other attributes is refused
  }
  bool Delete = Stored == 0 || (DataSize == 0 && !Append);
  if (Delete && V == nullptr) {
    return EFI_NOT_FOUND;
  }
  if (Append && DataSize == 0) {
    return EFI_SUCCESS; // appending nothing changes nothing
  }
  const uint8_t *Bytes = static_cast<const uint8_t *>(Data);
  if (!Delete && Append && V != nullptr &&
      V->Data.size() + NameBytes + DataSize > MaxVariableSize) {
    return EFI_OUT_OF_RESOURCES;
  }
  // A change that touches a non-volatile variable (a deletion included) goes
  // to the file at once; any other waits for the exit.
  const bool NonVolatile =
      ((Stored | (V != nullptr ? V->Attributes : 0)) & EFI_VARIABLE_NON_VOLATILE) != 0;
  std::vector<HostVariable> Previous;
  if (NonVolatile) {
    Previous = gVariables;
  }
  if (Delete) {
    gVariables.erase(gVariables.begin() + (V - gVariables.data()));
  } else if (V == nullptr) {
    gVariables.push_back(
        HostVariable{*VendorGuid, VariableName, Stored, {Bytes, Bytes + DataSize}});
  } else if (Append) {
    V->Data.insert(V->Data.end(), Bytes, Bytes + DataSize);
  } else {
    V->Data.assign(Bytes, Bytes + DataSize);
  }
  if (!NonVolatile) {
    gStoreDirty = true;
    return EFI_SUCCESS;
  }
  if (!WriteStore()) {
    fprintf(stderr, "host: cannot write the variable store %s\n", gStorePath.c_str());
    gVariables.swap(Previous);
    return EFI_DEVICE_ERROR;
  }
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI RtQueryVariableInfo(UINT32 Attributes, UINT64 *MaximumVariableStorageSize,
                                      UINT64 *RemainingVariableStorageSize,
                                      UINT64 *MaximumVariableSize) {
  if (MaximumVariableStorageSize == nullptr || RemainingVariableStorageSize == nullptr ||
      MaximumVariableSize == nullptr || (Attributes & StorableAttributes) == 0) {
    return EFI_INVALID_PARAMETER;
  }
  uint64_t Used = 0;
  for (const HostVariable &V : gVariables) {
    Used += (V.Name.size() + 1) * sizeof(CHAR16) + V.Data.size();
  }
  *MaximumVariableStorageSize = StoreCapacity;
  *RemainingVariableStorageSize = Used < StoreCapacity ? StoreCapacity - Used : 0;
  *MaximumVariableSize = MaxVariableSize;
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// Clock and the remaining slots
// ---------------------------------------------------------------------------
EFI_STATUS EFIAPI RtGetTime(EFI_TIME *Time, EFI_TIME_CAPABILITIES *Capabilities) {
  if (Time == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  timespec Now;
  clock_gettime(CLOCK_REALTIME, &Now);
  tm Local;
  if (localtime_r(&Now.tv_sec, &Local) == nullptr) {
    return EFI_DEVICE_ERROR;
  }
  *Time = EFI_TIME{};
  Time->Year = static_cast<UINT16>(Local.tm_year + 1900);
  Time->Month = static_cast<UINT8>(Local.tm_mon + 1);
  Time->Day = static_cast<UINT8>(Local.tm_mday);
  Time->Hour = static_cast<UINT8>(Local.tm_hour);
  Time->Minute = static_cast<UINT8>(Local.tm_min);
  Time->Second = static_cast<UINT8>(Local.tm_sec > 59 ? 59 : Local.tm_sec);
  Time->Nanosecond = static_cast<UINT32>(Now.tv_nsec);
  Time->TimeZone = EFI_UNSPECIFIED_TIMEZONE;
  Time->Daylight = 0;
  if (Capabilities != nullptr) {
    Capabilities->Resolution = 1;
    Capabilities->Accuracy = 50000000; // 50 ppm, in units of 1e-6 ppm
    Capabilities->SetsToZero = FALSE;
  }
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI RtSetTime(EFI_TIME *) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI RtGetWakeupTime(BOOLEAN *, BOOLEAN *, EFI_TIME *) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI RtSetWakeupTime(BOOLEAN, EFI_TIME *) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI RtSetVirtualAddressMap(UINTN, UINTN, UINT32, void *) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI RtConvertPointer(UINTN, void **) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI RtGetNextHighMonotonicCount(UINT32 *HighCount) {
  if (HighCount == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  *HighCount = ++gHighMonotonicCount;
  return EFI_SUCCESS;
}

// A reset ends the host program; the status's low byte is its exit code.
void EFIAPI RtResetSystem(EFI_RESET_TYPE ResetType, EFI_STATUS ResetStatus, UINTN, void *) {
  FlushStore();
  fflush(stdout);
  fprintf(stderr, "host: ResetSystem(%u) with status 0x%llx\n", static_cast<unsigned>(ResetType),
          static_cast<unsigned long long>(ResetStatus));
  exit(static_cast<int>(ResetStatus & 0xFF));
}

EFI_STATUS EFIAPI RtUpdateCapsule(void **, UINTN, EFI_PHYSICAL_ADDRESS) {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI RtQueryCapsuleCapabilities(void **, UINTN, UINT64 *, UINT32 *) {
  return EFI_UNSUPPORTED;
}

} // namespace

void HostRuntimeFill(EFI_RUNTIME_SERVICES *Rt) {
  Rt->GetTime = RtGetTime;
  Rt->SetTime = RtSetTime;
  Rt->GetWakeupTime = RtGetWakeupTime;
  Rt->SetWakeupTime = RtSetWakeupTime;
  Rt->SetVirtualAddressMap = RtSetVirtualAddressMap;
  Rt->ConvertPointer = RtConvertPointer;
  Rt->GetVariable = RtGetVariable;
  Rt->GetNextVariableName = RtGetNextVariableName;
  Rt->SetVariable = RtSetVariable;
  Rt->GetNextHighMonotonicCount = RtGetNextHighMonotonicCount;
  Rt->ResetSystem = RtResetSystem;
  Rt->UpdateCapsule = RtUpdateCapsule;
  Rt->QueryCapsuleCapabilities = RtQueryCapsuleCapabilities;
  Rt->QueryVariableInfo = RtQueryVariableInfo;
}

void HostVariablesOpen(const char *Path) {
  gStorePath = Path;
  gStoreDirty = false;
  LoadStore();
}

void HostVariablesClose() {
  FlushStore();
  gVariables.clear();
  gStorePath.clear();
}

void HostVariablesReload() {
  LoadStore();
  gStoreDirty = false;
}

void HostVariablesFlush() {
  if (!WriteStore()) {
    fprintf(stderr, "host: cannot write the variable store %s\n", gStorePath.c_str());
  }
}
