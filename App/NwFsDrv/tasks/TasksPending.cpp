// The provisioning actions are not attached in this build yet: each of these
// definitions only reports that plainly and fails with EFI_UNSUPPORTED, so that
// main's dispatch links and behaves honestly until the real tasks replace this
// file.
#include "DiagLog.h"
#include "Tasks.h"

namespace {
EFI_STATUS TaskNotAttached(const CHAR8 *Function) {
  DiagError("\nThis provisioning action is not attached in this build yet!", EFI_UNSUPPORTED,
            Function);
  return EFI_UNSUPPORTED;
}
} // namespace

EFI_STATUS GetCatalogFromNwFS(UINT32, const CHAR16 *, BOOLEAN) {
  return TaskNotAttached("GetCatalogFromNwFS");
}

EFI_STATUS GetFileFromNWFS(UINT32, const CHAR16 *, const CHAR16 *) {
  return TaskNotAttached("GetFileFromNWFS");
}

EFI_STATUS CopyCatalogSignatureToRamfs() {
  return TaskNotAttached("CopyCatalogSignatureToRamfs");
}

EFI_STATUS ExporttoNWShare(UINT32, const CHAR16 *, const CHAR16 *, const CHAR16 *) {
  return TaskNotAttached("ExporttoNWShare");
}
