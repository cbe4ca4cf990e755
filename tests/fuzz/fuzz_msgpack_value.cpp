// libFuzzer entry point; the checks live in FuzzTargets.h.
#include "FuzzTargets.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  SXFuzzMsgpackValue(data, size);
  return 0;
}
