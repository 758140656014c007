// Login names: the splitting of "user@domain" and "domain\user" into their
// parts, for the connect of the network back end.
#include "DiagLog.h"
#include "NwBackend.h"

namespace {

void CopyPart(CHAR8 *Destination, const CHAR8 *Source, UINTN Length) {
  for (UINTN I = 0; I < Length; I++) {
    Destination[I] = Source[I];
  }
}

} // namespace

EFI_STATUS SearchUserAndDomainSeparator(const CHAR8 *Input, CHAR8 Separator, UINTN UserSize,
                                        CHAR8 *User, UINTN DomainSize, CHAR8 *Domain) {
  if (Input == nullptr || User == nullptr || Domain == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const CHAR8 *Found = AsciiStrChr(Input, Separator);
  DiagLog(DIAG_VERBOSE, "Ptr to find FindAtSign in Input = %s\n", Found);
  if (Found == nullptr) {
    DiagLog(DIAG_VERBOSE, "Ptr is NULL\n");
    UINTN Length = AsciiStrLen(Input);
    if (UserSize > Length) {
      CopyPart(User, Input, Length + 1);
      ZeroMem(Domain, DomainSize);
    }
    return EFI_NOT_FOUND;
  }
  UINTN Index = static_cast<UINTN>(Found - Input);
  DiagLog(DIAG_VERBOSE, "Index = %d\n", static_cast<INT32>(Index));
  const CHAR8 *After = Found + 1;
  UINTN AfterLength = AsciiStrLen(After);
  // With '@' the user comes first, with '\' the domain does.
  bool UserFirst = Separator != '\\';
  CHAR8 *BeforeTarget = UserFirst ? User : Domain;
  CHAR8 *AfterTarget = UserFirst ? Domain : User;
  UINTN BeforeRoom = UserFirst ? UserSize : DomainSize;
  UINTN AfterRoom = UserFirst ? DomainSize : UserSize;
  ZeroMem(User, UserSize);
  ZeroMem(Domain, DomainSize);
  // The size tests are tied to the position, deliberately: the part before
  // the separator is measured against the user size and the part after it
  // against the domain size, whichever buffer receives it. Neither part is
  // terminated here (the buffers were cleared). A part is also never copied
  // past the buffer it lands in.
  if (Index <= UserSize && Index <= BeforeRoom) {
    CopyPart(BeforeTarget, Input, Index);
  }
  if (DomainSize > AfterLength && AfterLength <= AfterRoom) {
    CopyPart(AfterTarget, After, AfterLength);
  }
  DiagLog(DIAG_VERBOSE, "Domainname = %s\n", Domain);
  return EFI_SUCCESS;
}

EFI_STATUS SplitUserAndDomain(const CHAR8 *Input, UINTN UserSize, CHAR8 *User, UINTN DomainSize,
                              CHAR8 *Domain) {
  if (Input == nullptr || User == nullptr || Domain == nullptr) {
    DiagLog(DIAG_ALWAYS, "Input is NULL!\n");
    return EFI_INVALID_PARAMETER;
  }
  EFI_STATUS Status = SearchUserAndDomainSeparator(Input, '@', UserSize, User, DomainSize, Domain);
  if (!EFI_ERROR(Status)) {
    return Status;
  }
  if (gDriverDebugLevel != 0) {
    DiagLog(DIAG_ALWAYS, "SearchUserAndDomainSeparator returned error 0x%x for %c\n",
            static_cast<UINT32>(Status), '@');
  }
  Status = SearchUserAndDomainSeparator(Input, '\\', UserSize, User, DomainSize, Domain);
  if (EFI_ERROR(Status) && gDriverDebugLevel != 0) {
    DiagLog(DIAG_ALWAYS, "SearchUserAndDomainSeparator returned error 0x%x for %c\n",
            static_cast<UINT32>(Status), '\\');
  }
  return Status;
}
