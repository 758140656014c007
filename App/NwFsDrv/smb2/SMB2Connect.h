// The two entry points through which the rest of the system opens and closes
// the one SMB2 connection, and the records they take.
//
//   SMB2_Connect:    fill the share details, negotiate, session setup,
//                    tree connect.
//   SMB2_Disconnect: tree disconnect, logoff, close the socket.
#pragma once

#include "smb2/SMB2Header.h"

// Connect parameters given by the caller (single-byte strings).
struct SMB2ConnectInfo {
  UINT8 Connected;  // set to 1 once the negotiate has succeeded
  CHAR8 *IpAddress; // IPv4 or IPv6 address text
  CHAR8 *Username;  // required
  CHAR8 *Password;  // password or account key; required
  CHAR8 *Domain;    // optional; "0" or empty counts as none
};

// The share record handed in beside the connect parameters.
struct SMB2ShareDetails {
  CHAR8 *Sharename;       // "\\\\server\\share", required, shorter than 336 characters
  UINT32 MaxTransactSize; // filled on success from the negotiate
  UINT32 MaxReadSize;
  UINT32 MaxWriteSize;
  UINT32 LastStatus; // NT status of the last response header, filled by connect and disconnect
};

EFI_STATUS SMB2_Connect(SMB2ConnectInfo *ConnectInfo, SMB2ShareDetails *Share);
EFI_STATUS SMB2_Disconnect(SMB2ConnectInfo *ConnectInfo, SMB2ShareDetails *Share);
EFI_STATUS FillShareDetails(const SMB2ConnectInfo *ConnectInfo, const SMB2ShareDetails *Share,
                            TRANSACT_DETAILS *Details);
