// Replays every input under tests/fuzz/corpus/<target>/ (the seed corpus and each input a
// fuzzer once failed on) through the same checks the fuzz targets run, in the normal build.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#define SXR_FUZZ_FAILED(what) ADD_FAILURE() << "broken: " << (what)
#include "fuzz/FuzzTargets.h"

namespace {

using Target = void (*)(const uint8_t*, size_t);

size_t replayCorpus(const std::string& target, Target run) {
  std::string dir = std::string(SXR_SOURCE_DIR) + "/tests/fuzz/corpus/" + target;
  size_t inputs = 0;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) {
    std::ifstream in(entry.path(), std::ios::binary);
    std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    SCOPED_TRACE(entry.path().string());
    run(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
    ++inputs;
  }
  return inputs;
}

}  // namespace

TEST(FuzzCorpus, EveryTargetTakesItsCorpusAndTinyInputs) {
  const std::pair<const char*, Target> targets[] = {{"fuzz_rpc_decoder", SXFuzzRpcDecoder},
                                                    {"fuzz_msgpack_value", SXFuzzMsgpackValue},
                                                    {"fuzz_payload", SXFuzzPayload}};
  const uint8_t bytes[] = {0, 1, 2};
  for (const auto& [name, run] : targets) {
    EXPECT_GT(replayCorpus(name, run), 0u) << name;
    for (size_t n = 0; n <= sizeof bytes; ++n) run(bytes, n);
  }
}
