#include "FuzzTargets.h"  // the checks; this is the libFuzzer entry point
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  SXFuzzPayload(data, size);
  return 0;
}
