// The clock of the platform facade in the firmware image: the real-time
// clock through the runtime services' GetTime.
#include "EfiTime.h"
#include "NwBaseLib.h"
#include "NwPlatform.h"

int32_t NwGetTimeOfDay(NwTimeVal *Tv) {
  if (Tv == nullptr) {
    NwSetErrno(NwErrno::EFAULT_);
    return -1;
  }
  EFI_TIME Now = {};
  INT64 Seconds = 0;
  if (gRT == nullptr || EFI_ERROR(gRT->GetTime(&Now, nullptr)) ||
      !EfiTimeToUnixSeconds(Now, &Seconds)) {
    NwSetErrno(NwErrno::EIO_);
    return -1;
  }
  Tv->tv_sec = Seconds;
  Tv->tv_usec = Now.Nanosecond / 1000;
  return 0;
}
