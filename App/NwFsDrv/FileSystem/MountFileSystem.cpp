// The share mount: a share name, a server address and credentials become a
// Simple File System volume on the image's handle with a shell name, kept
// alive by a timer, and are taken down again at unmount.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "NwFsDrv.h"
#include "ShellCommand.h"
#include "Tasks.h"
#include "volume/NWLib.h"
#include "volume/NwVolume.h"

// The share type of the current mount and whether the network library has
// been initialised for it.
UINT64 gMountShareType = 0;
BOOLEAN gNwLibInitialized = FALSE;

namespace {

constexpr const CHAR16 *kPlatformLangName = u"PlatformLang";
constexpr UINTN kLanguageBytes = 10;
constexpr UINTN kLanguageCompareChars = 3;
constexpr const CHAR8 *kDefaultLanguage = "eng";
// The rewritten share name of the retry holds at most this many characters.
constexpr UINTN kShareNameChars = 512;
// Keep-alive: first firing after 10 seconds, then every 60 seconds while the
// network is idle, or again after 10 seconds when it is busy (100 ns units).
constexpr UINT64 kKeepAliveFirst = 100000000;
constexpr UINT64 kKeepAliveIdle = 600000000;
constexpr UINT64 kKeepAliveBusy = 100000000;

// ---------------------------------------------------------------------------
// Language and collation
// ---------------------------------------------------------------------------
void ReadPlatformLanguage(CHAR8 *Language) {
  ZeroMem(Language, kLanguageBytes + 1);
  UINTN Size = kLanguageBytes;
  EFI_STATUS Status = gRT != nullptr ? gRT->GetVariable(kPlatformLangName, &gEfiGlobalVariableGuid,
                                                        nullptr, &Size, Language)
                                     : EFI_NOT_READY;
  if (EFI_ERROR(Status) || Language[0] == 0) {
    ZeroMem(Language, kLanguageBytes + 1);
    AsciiStrCpyS(Language, kLanguageBytes + 1, kDefaultLanguage);
  }
}

// True when one of the 3-character groups of Supported begins like Language.
bool SupportsLanguage(const CHAR8 *Supported, const CHAR8 *Language) {
  if (Supported == nullptr) {
    return false;
  }
  for (UINTN At = 0; AsciiStrnLen(Supported + At, kLanguageCompareChars) == kLanguageCompareChars;
       At += kLanguageCompareChars) {
    if (AsciiStrnCmp(Supported + At, Language, kLanguageCompareChars) == 0) {
      return true;
    }
  }
  return false;
}

// Finds the collation interface for Language once; later mounts reuse it.
// EFI_UNSUPPORTED only when the handles cannot be listed or opened; with
// handles but no match the mount goes on without one.
EFI_STATUS FindUnicodeCollation(const CHAR8 *Language) {
  if (gUnicodeCollationInterface != nullptr) {
    return EFI_SUCCESS;
  }
  UINTN Count = 0;
  EFI_HANDLE *Handles = nullptr;
  EFI_STATUS Status = gBS->LocateHandleBuffer(ByProtocol, &gEfiUnicodeCollation2ProtocolGuid,
                                              nullptr, &Count, &Handles);
  for (UINTN Index = 0; !EFI_ERROR(Status) && Index < Count; Index++) {
    EFI_UNICODE_COLLATION_PROTOCOL *Collation = nullptr;
    Status = gBS->OpenProtocol(Handles[Index], &gEfiUnicodeCollation2ProtocolGuid,
                               reinterpret_cast<void **>(&Collation), gImageHandle, nullptr,
                               EFI_OPEN_PROTOCOL_GET_PROTOCOL);
    if (!EFI_ERROR(Status) && SupportsLanguage(Collation->SupportedLanguages, Language)) {
      gUnicodeCollationInterface = Collation;
      break;
    }
  }
  FreePool(Handles);
  if (EFI_ERROR(Status)) {
    gBS->CloseProtocol(gImageHandle, &gEfiUnicodeCollation2ProtocolGuid, gImageHandle, nullptr);
    DiagError("Unicode Collation 2 not supported!", Status, "MountStaticFileSystem");
    return EFI_UNSUPPORTED;
  }
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// Connection parameters and the share record
// ---------------------------------------------------------------------------
void FreeConnectionParams(NW_CONNECTION_PARAMS *Params) {
  FreePool(Params->ipAddress);
  FreePool(Params->username);
  FreeClearedStr(Params->password);
  ZeroMem(Params, sizeof(*Params));
}

// Copies of the address and, for CIFS, of the credentials (absent ones as
// empty texts); for NFS the credentials are numbers.
EFI_STATUS BuildConnectionParams(const CHAR16 *IpAddress, UINT64 ShareType, const CHAR16 *UserName,
                                 const CHAR16 *Password, NW_CONNECTION_PARAMS *Params) {
  ZeroMem(Params, sizeof(*Params));
  Params->ipAddress = StrDup(IpAddress != nullptr ? IpAddress : u"");
  if (ShareType == NWFS_SHARE_TYPE_NFS) {
    Params->uid = NwParseDecimal(UserName);
    Params->gid = NwParseDecimal(Password);
  } else {
    Params->username = StrDup(UserName != nullptr ? UserName : u"");
    Params->password = StrDup(Password != nullptr ? Password : u"");
  }
  if (Params->ipAddress == nullptr ||
      (ShareType != NWFS_SHARE_TYPE_NFS &&
       (Params->username == nullptr || Params->password == nullptr))) {
    FreeConnectionParams(Params);
    DiagError("\nMemory allocation for the connection parameters failed!", EFI_OUT_OF_RESOURCES,
              "MountStaticFileSystem");
    return EFI_OUT_OF_RESOURCES;
  }
  return EFI_SUCCESS;
}

NW_SHARE_INFO *CreateShareRecord(const CHAR16 *ShareName, UINT64 ShareType) {
  auto *Share = static_cast<NW_SHARE_INFO *>(AllocateZeroPool(sizeof(NW_SHARE_INFO)));
  if (Share == nullptr) {
    return nullptr;
  }
  if (ShareName != nullptr) {
    Share->sharename = StrDup(ShareName);
    if (Share->sharename == nullptr) {
      FreePool(Share);
      return nullptr;
    }
  }
  Share->shareType = ShareType;
  return Share;
}

void FreeShareRecord(NW_SHARE_INFO *Share) {
  if (Share != nullptr) {
    FreePool(Share->sharename);
    FreePool(Share);
  }
}

// ---------------------------------------------------------------------------
// Keep-alive
// ---------------------------------------------------------------------------

// Tries the network busy lock without waiting; releases it again at once when
// it was free. The lock record is packed, so its fields go through aligned
// copies.
bool NetworkWasIdle() {
  UINT8 Busy = NetworkBusyLock.Busy;
  EFI_EVENT LockEvent = NetworkBusyLock.Event;
  bool Idle = AcquireNetworkBusyLock(&Busy, &LockEvent, FALSE) != FALSE;
  if (Idle) {
    ReleaseNetworkBusyLock(&Busy, &LockEvent);
  }
  NetworkBusyLock.Busy = Busy;
  NetworkBusyLock.Event = LockEvent;
  return Idle;
}

// Sends nothing: it only looks whether the network is in use and re-arms
// itself, sooner when it is.
void EFIAPI KeepAliveNotify(EFI_EVENT Event, void *) {
  gBS->SetTimer(Event, TimerCancel, 0);
  gBS->SetTimer(Event, TimerRelative, NetworkWasIdle() ? kKeepAliveIdle : kKeepAliveBusy);
}

EFI_STATUS StartKeepAlive(NW_SHARE_INFO *Share) {
  EFI_STATUS Status = gBS->CreateEvent(EVT_TIMER | EVT_NOTIFY_SIGNAL, TPL_CALLBACK, KeepAliveNotify,
                                       Share, &Share->KeepAliveEvent);
  if (!EFI_ERROR(Status)) {
    Status = gBS->SetTimer(Share->KeepAliveEvent, TimerRelative, kKeepAliveFirst);
  }
  if (EFI_ERROR(Status)) {
    DiagError("\nCreating the keep-alive timer failed!", Status, "MountStaticFileSystem");
  }
  return Status;
}

// The volume this image installed on its handle, or null.
NW_VOLUME *InstalledVolume() {
  void *Interface = nullptr;
  if (gBS->OpenProtocol(gImageHandle, &gEfiSimpleFileSystemProtocolGuid, &Interface, gImageHandle,
                        nullptr, EFI_OPEN_PROTOCOL_GET_PROTOCOL) != EFI_SUCCESS) {
    return nullptr;
  }
  return static_cast<NW_VOLUME *>(Interface);
}

// A mount is done only once the volume's root opens: a connection that dies
// at the first request on the share leaves a volume nobody can use. Looking
// up the volume's shell name opens the root already (OpenVolume, which asks
// the share for its statistics and keeps a failure as the volume's status),
// so what it found is taken; only a root nobody tried to open is opened now.
EFI_STATUS CheckVolumeRoot() {
  NW_VOLUME *Volume = InstalledVolume();
  if (Volume == nullptr) {
    return EFI_DEVICE_ERROR;
  }
  EFI_STATUS VolumeStatus = Volume->VolumeStatus;
  if (EFI_ERROR(VolumeStatus)) {
    return VolumeStatus;
  }
  if (Volume->Root != nullptr) {
    return EFI_SUCCESS;
  }
  EFI_FILE_PROTOCOL *Root = nullptr;
  EFI_STATUS Status = Volume->Sfs.OpenVolume(&Volume->Sfs, &Root);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  if (Root == nullptr) {
    return EFI_DEVICE_ERROR;
  }
  Root->Close(Root);
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// The retry's share name
// ---------------------------------------------------------------------------

// Every separator of the kind met first becomes the other kind ("\" to "/",
// or "/" to "\"). A name that mixes both is reported and still rewritten.
void SwapShareNameSlashes(CHAR16 *Name) {
  CHAR16 Separator = 0;
  for (const CHAR16 *Scan = Name; *Scan != 0; Scan++) {
    if (*Scan != u'\\' && *Scan != u'/') {
      continue;
    }
    if (Separator == 0) {
      Separator = *Scan;
    } else if (*Scan != Separator) {
      DiagLog(DIAG_ALWAYS, "Incorrent usage of slashes. Both '\\' and '/' are used.");
      break;
    }
  }
  if (Separator == 0) {
    return;
  }
  CHAR16 Other = Separator == u'\\' ? u'/' : u'\\';
  for (CHAR16 *Scan = Name; *Scan != 0; Scan++) {
    if (*Scan == Separator) {
      *Scan = Other;
    }
  }
}

// After a mount the new volume is given a shell name, and is also mapped
// under its identifier when that name differs. The map command's own result
// is deliberately not looked at: only a command that cannot be built fails.
constexpr SHARE_MAPPING_STYLE kMountMapping = {
    .AfterMount = true,
    .NoDriveText = "Drive name len %ls is zero!\n",
    .FailureEnds = false,
};

} // namespace

EFI_STATUS StartMountFileSystem(const CHAR16 *ShareName, const CHAR16 *IpAddress, UINT64 ShareType,
                                const CHAR16 *UserName, const CHAR16 *Password) {
  const CHAR16 *Identifier = ShareVolumeIdentifier(ShareType);
  EFI_STATUS Status = MountStaticFileSystem(ShareName, IpAddress, ShareType, UserName, Password);
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "MountStaticFileSystem failed! Status = 0x%x. Unmounting...\n",
            static_cast<UINT32>(Status));
    UnmountStaticFileSystem(ShareName, IpAddress);
    CHAR16 *Rewritten = static_cast<CHAR16 *>(AllocateZeroPool(kShareNameChars * sizeof(CHAR16)));
    if (Rewritten == nullptr) {
      DiagLog(DIAG_ALWAYS, "Memory allocation falied for modified shareName\n");
      return EFI_OUT_OF_RESOURCES;
    }
    StrCpyS(Rewritten, kShareNameChars, ShareName != nullptr ? ShareName : u"");
    SwapShareNameSlashes(Rewritten);
    Status = MountStaticFileSystem(Rewritten, IpAddress, ShareType, UserName, Password);
    FreePool(Rewritten);
    if (EFI_ERROR(Status)) {
      DiagLog(DIAG_ALWAYS, "Failed to mount: %ls, Status: 0x%X\n", ShareName,
              static_cast<UINT32>(Status));
      return Status;
    }
  }
  if (Status == EFI_SUCCESS) {
    CHAR16 DriveName[NWFS_DRIVE_NAME_CHARS + 1];
    EFI_STATUS NameStatus = EFI_SUCCESS;
    if (!MapShareUnderIdentifier(Identifier, kMountMapping, DriveName, &NameStatus)) {
      return NameStatus;
    }
    Status = CheckVolumeRoot();
    if (EFI_ERROR(Status)) {
      DiagLog(DIAG_ALWAYS, "The share's root could not be opened! Status = 0x%x. Unmounting...\n",
              static_cast<UINT32>(Status));
      UnmountStaticFileSystem(ShareName, IpAddress);
    }
  }
  DiagExit(Status, DiagChannel::Driver, "StartMountFileSystem");
  return Status;
}

EFI_STATUS EFIAPI MountStaticFileSystem(const CHAR16 *ShareName, const CHAR16 *IpAddress,
                                        UINT64 ShareType, const CHAR16 *UserName,
                                        const CHAR16 *Password) {
  DiagShortEntry(DiagChannel::Driver, "MountStaticFileSystem");
  DiagLog(DIAG_VERBOSE, "shareName = %ls\n", ShareName);
  DiagLog(DIAG_VERBOSE, "ipAddress = %ls\n", IpAddress);
  DiagLog(DIAG_VERBOSE, "shareType = %d\n", static_cast<INT32>(ShareType));

  CHAR8 Language[kLanguageBytes + 1];
  ReadPlatformLanguage(Language);
  EFI_STATUS Status = FindUnicodeCollation(Language);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  if (!gNwLibInitialized) {
    Status = GEE_NWInit(gImageHandle, gST, ShareType);
    if (EFI_ERROR(Status)) {
      DiagError("Couldn't Init NWLib!", Status, "MountStaticFileSystem");
      return EFI_DEVICE_ERROR;
    }
    gNwLibInitialized = TRUE;
  }

  NW_CONNECTION_PARAMS Params;
  Status = BuildConnectionParams(IpAddress, ShareType, UserName, Password, &Params);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  NW_SHARE_INFO *Share = CreateShareRecord(ShareName, ShareType);
  if (Share == nullptr) {
    FreeConnectionParams(&Params);
    DiagError("\nMemory allocation for the share record failed!", EFI_OUT_OF_RESOURCES,
              "MountStaticFileSystem");
    return EFI_OUT_OF_RESOURCES;
  }
  gMountShareType = ShareType;

  Status = GEE_NWFSConnect(&Params, Share);
  if (EFI_ERROR(Status)) {
    if (Status == EFI_DEVICE_ERROR) {
      // The retry initialises the library again.
      GEE_NWDeInit(ShareType);
      gNwLibInitialized = FALSE;
    }
    DiagLog(DIAG_ALWAYS, "Couldn't Connect to the share directory, Status: 0x%X\n",
            static_cast<UINT32>(Status));
    FreeShareRecord(Share); // nothing refers to it after a failed connect
  } else {
    // The arguments as given: for NFS the volume keeps the uid and gid they
    // spell, which the connection copies hold only as numbers.
    Status =
        DetectInstallVolume(gImageHandle, Language, Share, Params.ipAddress, UserName, Password);
    if (!EFI_ERROR(Status)) {
      Status = StartKeepAlive(Share);
    } else {
      DiagLog(DIAG_ALWAYS, "DetectInstallVolume failed! Status: 0x%x\n",
              static_cast<UINT32>(Status));
      if (InstalledVolume() == nullptr) {
        // Nothing for the unmount to find: let go of the connection here.
        GEE_NWFSDisconnect(Share, Params.ipAddress);
        FreeShareRecord(Share);
      }
    }
  }
  FreeConnectionParams(&Params);
  DiagShortExit(Status, ',', DiagChannel::Driver, "MountStaticFileSystem");
  return Status;
}

EFI_STATUS EFIAPI UnmountStaticFileSystem(const CHAR16 *, const CHAR16 *IpAddress) {
  DiagShortEntry(DiagChannel::Driver, "UnmountStaticFileSystem");
  EFI_STATUS Status = EFI_SUCCESS;
  NW_VOLUME *Volume = InstalledVolume();
  if (Volume != nullptr) {
    NW_SHARE_INFO *Share = Volume->shareInfo;
    Status = RemoveInstalledVolume(Volume);
    if (!EFI_ERROR(Status) && Share != nullptr) {
      GEE_NWFSDisconnect(Share, IpAddress);
      gMountShareType = Share->shareType;
      if (Share->KeepAliveEvent != nullptr) {
        EFI_STATUS CloseStatus = gBS->CloseEvent(Share->KeepAliveEvent);
        DiagErrorAt(DiagChannel::Driver, DIAG_VERBOSE, "CloseEvent returned. ", CloseStatus,
                    "UnmountStaticFileSystem");
        Share->KeepAliveEvent = nullptr;
      }
      FreeShareRecord(Share);
    }
  }
  GEE_NWDeInit(gMountShareType);
  gNwLibInitialized = FALSE;
  gMountShareType = 0;
  DiagShortExit(Status, '.', DiagChannel::Driver, "UnmountStaticFileSystem");
  return Status;
}
