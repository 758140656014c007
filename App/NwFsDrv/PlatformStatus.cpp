// The platform-status request to the management controller, sent over the
// IPMI transport that the firmware publishes in its configuration table.
#include "DiagLog.h"
#include "IpmiTransport.h"
#include "NwBaseLib.h"
#include "ProvisioningVars.h"

IPMI_TRANSPORT *gIpmiTransport = nullptr;

namespace {

constexpr UINT8 kPmNetFunction = 0x30;
constexpr UINT8 kPmLun = 0;
constexpr UINT8 kPmCommand = 0xA9;
constexpr UINT8 kPmRequest[] = {0x12, 0x00, 0x00, 0x00};
constexpr UINT32 kResponseBytes = 256;
constexpr UINT32 kResponseLength = 32;
// Response bytes: byte 1 must be 0; bytes 6 and 2 are the two status bytes.
constexpr UINT32 kResponseOkIndex = 1;
constexpr UINT32 kFirstStatusIndex = 6;
constexpr UINT32 kSecondStatusIndex = 2;

EFI_STATUS ExitGetPMStatus(EFI_STATUS Status) {
  DiagLog(DIAG_ALWAYS, "\nExiting GetPMStatus() with Success\n");
  return Status;
}

// Sends the request, retrying after a failure; Received gets the answer's
// size, never more than the buffer.
EFI_STATUS SendPmRequest(UINT8 *Response, UINT32 *Received) {
  EFI_STATUS Status = EFI_DEVICE_ERROR;
  for (UINT32 Attempt = 1; Attempt <= PM_STATUS_MAX_ATTEMPTS; Attempt++) {
    ZeroMem(Response, kResponseBytes);
    UINT8 Request[sizeof(kPmRequest)];
    CopyMem(Request, kPmRequest, sizeof(Request));
    *Received = kResponseLength;
    Status = gIpmiTransport->SendIpmiCommand(gIpmiTransport, kPmNetFunction, kPmLun, kPmCommand,
                                             Request, sizeof(Request), Response, Received);
    if (*Received > kResponseBytes) {
      *Received = kResponseBytes;
    }
    if (Status == EFI_SUCCESS) {
      break;
    }
    DiagLog(DIAG_ALWAYS, "GetPMStatus: IPMIPassthru return status = 0x%x \n",
            static_cast<UINT32>(Status));
    if (Attempt < PM_STATUS_MAX_ATTEMPTS && gBS != nullptr) {
      gBS->Stall(PM_STATUS_RETRY_MICROSECONDS);
    }
  }
  return Status;
}

} // namespace

IPMI_TRANSPORT *LocateIpmiTransport(EFI_SYSTEM_TABLE *SystemTable) {
  if (SystemTable == nullptr || SystemTable->ConfigurationTable == nullptr) {
    return nullptr;
  }
  for (UINTN Index = 0; Index < SystemTable->NumberOfTableEntries; Index++) {
    const EFI_CONFIGURATION_TABLE &Entry = SystemTable->ConfigurationTable[Index];
    if (EfiGuidEqual(Entry.VendorGuid, gIpmiTransportTableGuid)) {
      return static_cast<IPMI_TRANSPORT *>(Entry.VendorTable);
    }
  }
  return nullptr;
}

EFI_STATUS GetPMStatus(UINT8 *FirstStatus, UINT8 *SecondStatus) {
  DiagLog(DIAG_ALWAYS, "Entering GetPMStatus()\n");
  DiagLog(DIAG_ALWAYS, "Command Data 0:%x, 1:%x, 2:%x  3:%x\n", kPmRequest[0], kPmRequest[1],
          kPmRequest[2], kPmRequest[3]);
  if (FirstStatus == nullptr || SecondStatus == nullptr) {
    return ExitGetPMStatus(EFI_INVALID_PARAMETER);
  }
  *FirstStatus = 0;
  *SecondStatus = 0;
  if (gIpmiTransport == nullptr || gIpmiTransport->SendIpmiCommand == nullptr) {
    DiagLog(DIAG_ALWAYS, "\n GetPMStatus(): failed, returning EFI_NOT_FOUND");
    return ExitGetPMStatus(EFI_NOT_FOUND);
  }
  UINT8 Response[kResponseBytes];
  UINT32 Received = 0;
  EFI_STATUS Status = SendPmRequest(Response, &Received);
  if (Status != EFI_SUCCESS) {
    return ExitGetPMStatus(Status);
  }
  DiagLog(DIAG_ALWAYS, "SendIpmiCommand completion code: 0x%X\n",
          gIpmiTransport->CommandCompletionCode);
  DiagLog(DIAG_ALWAYS, "SendIpmiCommand EFI Status: 0x%X\n", static_cast<UINT32>(Status));
  if (Response[kResponseOkIndex] == 0) {
    DiagLog(DIAG_ALWAYS, "ResponseData :");
    for (UINT32 Index = 0; Index < Received; Index++) {
      DiagLog(DIAG_ALWAYS, " [%X]= 0x%X", Index, Response[Index]);
    }
    // Bytes the controller did not send stay 0.
    if (Received > kFirstStatusIndex) {
      *FirstStatus = Response[kFirstStatusIndex];
    }
    if (Received > kSecondStatusIndex) {
      *SecondStatus = Response[kSecondStatusIndex];
    }
  }
  return ExitGetPMStatus(Status);
}
