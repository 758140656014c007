// The platform's IPMI transport, found in the system configuration table.
#pragma once

#include "Uefi.h"

// {4F6B6541-ADD6-4B0F-A503-D78ABDA0851E}
extern const EFI_GUID gIpmiTransportTableGuid;

struct IPMI_TRANSPORT {
  UINT64 Revision;
  // Sends one request and waits for its answer. ResponseDataSize is the
  // buffer's size on input and the answer's size on output.
  EFI_STATUS(EFIAPI *SendIpmiCommand)
  (IPMI_TRANSPORT *This, UINT8 NetFunction, UINT8 Lun, UINT8 Command, UINT8 *CommandData,
   UINT32 CommandDataSize, UINT8 *ResponseData, UINT32 *ResponseDataSize);
  // Completion code of the last command.
  UINT8 CommandCompletionCode;
};
