// The system table of the hosted environment and its life cycle: building
// the tables, installing the environment's own protocols, running the image
// with a shell-style command line, and tearing everything down again.
#include "HostCore.h"

#include <stdio.h>

#include <filesystem>
#include <string>
#include <vector>

extern "C" EFI_STATUS EFIAPI EfiMain(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable);

namespace {

constexpr UINT64 EFI_SYSTEM_TABLE_SIGNATURE = 0x5453595320494249ULL;     // "IBI SYST"
constexpr UINT64 EFI_BOOT_SERVICES_SIGNATURE = 0x56524553544F4F42ULL;    // "BOOTSERV"
constexpr UINT64 EFI_RUNTIME_SERVICES_SIGNATURE = 0x56524553544E5552ULL; // "RUNTSERV"
constexpr UINT32 EFI_2_70_REVISION = (2 << 16) | 70;
constexpr UINT32 EFI_LOADED_IMAGE_PROTOCOL_REVISION = 0x1000;
constexpr const char *DefaultRamfsDir = "./ramfs";
constexpr const char *DefaultVarStore = "./cifsdrv-vars.txt";

EFI_SYSTEM_TABLE gSystemTable;
EFI_BOOT_SERVICES gBootServices;
EFI_RUNTIME_SERVICES gRuntimeServices;
CHAR16 gFirmwareVendor[] = u"CIFSDrv Host Environment";
bool gInitialized = false;
EFI_HANDLE gImage = nullptr;

void SetHeader(EFI_TABLE_HEADER &Hdr, UINT64 Signature, UINT32 Size) {
  Hdr.Signature = Signature;
  Hdr.Revision = EFI_2_70_REVISION;
  Hdr.HeaderSize = Size;
  Hdr.CRC32 = 0;
  Hdr.Reserved = 0;
}

void UpdateCrc(EFI_TABLE_HEADER &Hdr) {
  Hdr.CRC32 = 0;
  UINT32 Crc = 0;
  HostCalculateCrc32(&Hdr, Hdr.HeaderSize, &Crc);
  Hdr.CRC32 = Crc;
}

bool EnsureDirectory(const char *Path) {
  std::error_code Error;
  std::filesystem::create_directories(Path, Error);
  return std::filesystem::is_directory(Path, Error);
}

const char *OrDefault(const char *Value, const char *Default) {
  return (Value != nullptr && Value[0] != 0) ? Value : Default;
}

} // namespace

EFI_SYSTEM_TABLE *HostInitialize(const HostConfig &Config) {
  if (gInitialized) {
    HostShutdown();
  }
  const char *RamfsDir = OrDefault(Config.RamfsDir, DefaultRamfsDir);
  if (!EnsureDirectory(RamfsDir)) {
    fprintf(stderr, "host: cannot create the ramfs directory %s\n", RamfsDir);
    return nullptr;
  }

  gBootServices = EFI_BOOT_SERVICES{};
  SetHeader(gBootServices.Hdr, EFI_BOOT_SERVICES_SIGNATURE, sizeof gBootServices);
  HostBootServicesFillCore(&gBootServices);
  HostBootServicesFillProtocols(&gBootServices);
  gBootServices.InstallConfigurationTable = HostInstallConfigurationTable;
  UpdateCrc(gBootServices.Hdr);

  gRuntimeServices = EFI_RUNTIME_SERVICES{};
  SetHeader(gRuntimeServices.Hdr, EFI_RUNTIME_SERVICES_SIGNATURE, sizeof gRuntimeServices);
  HostRuntimeFill(&gRuntimeServices);
  UpdateCrc(gRuntimeServices.Hdr);

  gSystemTable = EFI_SYSTEM_TABLE{};
  SetHeader(gSystemTable.Hdr, EFI_SYSTEM_TABLE_SIGNATURE, sizeof gSystemTable);
  gSystemTable.FirmwareVendor = gFirmwareVendor;
  gSystemTable.FirmwareRevision = 0x00010000;
  gSystemTable.ConOut = HostConsoleOut();
  gSystemTable.StdErr = HostConsoleErr();
  gSystemTable.RuntimeServices = &gRuntimeServices;
  gSystemTable.BootServices = &gBootServices;
  gInitialized = true;
  HostSystemTableChanged();

  HostVariablesOpen(OrDefault(Config.VarStore, DefaultVarStore));
  gImage = HostCreatePermanentHandle();
  HostConfigTablesInstall();
  HostCollationInstall();
  HostRamfsInstall(RamfsDir);
  HostShellInstall(&gSystemTable);
  return &gSystemTable;
}

void HostShutdown() {
  if (!gInitialized) {
    return;
  }
  HostShellUninstall();
  HostRamfsUninstall();
  HostCollationUninstall();
  HostConfigTablesUninstall();
  HostProtocolDbReset();
  HostEventsReset();
  HostVariablesClose();
  HostPoolFailAfter(UINT64_MAX);
  gImage = nullptr;
  gInitialized = false;
}

EFI_HANDLE HostImageHandle() {
  return gImage;
}

EFI_SYSTEM_TABLE *HostSystemTable() {
  return gInitialized ? &gSystemTable : nullptr;
}

void HostSystemTableChanged() {
  UpdateCrc(gSystemTable.Hdr);
}

EFI_STATUS HostRunImage(int Argc, char **Argv) {
  if (!gInitialized || Argc < 0 || (Argc > 0 && Argv == nullptr)) {
    return EFI_NOT_READY;
  }
  // The shell hands the image UCS-2 copies of its words and the whole
  // command line as load options.
  std::vector<std::u16string> Words;
  std::u16string CommandLine;
  for (int I = 0; I < Argc; I++) {
    Words.push_back(HostUtf8ToUcs2(Argv[I]));
    CommandLine += (I == 0 ? u"" : u" ") + Words.back();
  }
  std::vector<CHAR16 *> WordPointers;
  for (std::u16string &Word : Words) {
    WordPointers.push_back(&Word[0]);
  }
  WordPointers.push_back(nullptr);

  EFI_SHELL_PARAMETERS_PROTOCOL Parameters = {};
  Parameters.Argv = WordPointers.data();
  Parameters.Argc = static_cast<UINTN>(Argc);

  EFI_LOADED_IMAGE_PROTOCOL LoadedImage = {};
  LoadedImage.Revision = EFI_LOADED_IMAGE_PROTOCOL_REVISION;
  LoadedImage.SystemTable = &gSystemTable;
  LoadedImage.LoadOptionsSize = static_cast<UINT32>((CommandLine.size() + 1) * sizeof(CHAR16));
  LoadedImage.LoadOptions = &CommandLine[0];
  LoadedImage.ImageCodeType = EfiLoaderCode;
  LoadedImage.ImageDataType = EfiLoaderData;

  EFI_STATUS Status = gBootServices.InstallMultipleProtocolInterfaces(
      &gImage, &gEfiLoadedImageProtocolGuid, &LoadedImage, &gEfiShellParametersProtocolGuid,
      &Parameters, nullptr);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Status = EfiMain(gImage, &gSystemTable);
  // One at a time: the second must come off even when the first cannot.
  if (EFI_ERROR(gBootServices.UninstallProtocolInterface(gImage, &gEfiLoadedImageProtocolGuid,
                                                         &LoadedImage)) ||
      EFI_ERROR(gBootServices.UninstallProtocolInterface(gImage, &gEfiShellParametersProtocolGuid,
                                                         &Parameters))) {
    fprintf(stderr, "host: the image's protocols could not be removed from its handle\n");
  }
  return Status;
}
