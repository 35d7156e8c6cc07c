// The boot step: the number in the file boot_step of the host directory.
#include <string>

#include "host_error.h"
#include "host_io.h"
#include "host_ops.h"

namespace quvahost {

int SystemGetBootStepImpl() {
  std::string text;
  int error = ReadWholeFile(HostEtcFile(kBootStepName).c_str(), 64, &text);
  // No file: nothing is booting on this machine, so it counts as booted.
  if (error == ENOENT) return QUVA_BOOT_STEP_READY;
  if (error == EFBIG) error = EINVAL;
  if (error != 0) return HOST_FAIL(error);
  int step = 0;
  if (!ParseDecimalText(text, &step)) return HOST_FAIL(EINVAL);
  return step;
}

}  // namespace quvahost
