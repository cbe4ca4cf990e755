#include "linux/UsdtTracer.h"

#include <sys/sdt.h>

void SXUsdtTracer::trace(uint32_t code) {
  uint32_t zero = 0;
  DTRACE_PROBE5(sxreporting, trace, code, zero, zero, zero, zero);
}
