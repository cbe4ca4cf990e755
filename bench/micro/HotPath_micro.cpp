// Micro benchmarks of the functions every client message passes through: decoding a request,
// encoding a reply, naming its category and type, serialising its payload, and storing rows.
#include <benchmark/benchmark.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <thread>

#include "Statistics/SXReportingTallyvaneBridge.h"
#include "Statistics/SXReportingUtility.h"
#include "common/MsgpackValue.h"
#include "common/RpcCodec.h"
#include "sqlite/SqliteFernReporting.h"
#include "sqlite/SqliteTallyvane.h"

namespace {

SXValue payload() {
  return {{"route name", "speaker-builtin-primary-output"},
          {"peak_level", -12.5},
          {"sample_rate", 48000},
          {"buffer_frames", 512},
          {"HostApplicationDisplayID", "com.example.player"},
          {"session_note", "steady playback; no underruns seen in the last interval"}};
}

std::string encodedSendRequests(int count) {
  msgpack::sbuffer out;
  SXValue params = SXValue::array({payload(), 0x08000003, 1, SXValue::array({42})});
  for (int i = 0; i < count; ++i) {
    RpcEncodeRequest(out, i, sxr::method::kSendMessage, params);
  }
  return std::string(out.data(), out.size());
}

// A scratch directory removed when the benchmark ends.
struct ScratchDir {
  ScratchDir() {
    path = std::filesystem::temp_directory_path() / ("sxr-micro-" + std::to_string(::getpid()));
    std::filesystem::create_directories(path);
  }
  ~ScratchDir() { std::filesystem::remove_all(path); }
  std::filesystem::path path;
};

void BM_DecodeRequests(benchmark::State& state) {
  const std::string bytes = encodedSendRequests(256);
  SXValue message;
  for (auto _ : state) {
    RpcStreamDecoder decoder;
    std::memcpy(decoder.prepare(bytes.size()), bytes.data(), bytes.size());
    decoder.commit(bytes.size());
    while (decoder.next(message) == RpcStreamDecoder::Status::kMessage) {
      std::string why;
      std::optional<uint32_t> msgid;
      benchmark::DoNotOptimize(RpcParseRequest(message, why, msgid));
    }
  }
  state.SetItemsProcessed(state.iterations() * 256);
}
BENCHMARK(BM_DecodeRequests);

void BM_EncodeReplies(benchmark::State& state) {
  std::string out;
  const SXValue nil;
  for (auto _ : state) {
    out.clear();
    for (uint32_t i = 0; i < 256; ++i) RpcEncodeResponse(out, i, nil, nil);
    benchmark::DoNotOptimize(out.data());
  }
  state.SetItemsProcessed(state.iterations() * 256);
}
BENCHMARK(BM_EncodeReplies);

void BM_EventName(benchmark::State& state) {
  uint32_t category = 0x08000003;
  for (auto _ : state) {
    benchmark::DoNotOptimize(SXReportingTallyvaneBridge::eventName(category, 1));
    category ^= 0x00000004;  // alternate between two categories
  }
}
BENCHMARK(BM_EventName);

void BM_CategoryName(benchmark::State& state) {
  uint32_t category = 0x40000007;
  for (auto _ : state) {
    benchmark::DoNotOptimize(SXReportingUtilityCategoryName(category));
  }
}
BENCHMARK(BM_CategoryName);

void BM_PayloadJson(benchmark::State& state) {
  const SXValue value = payload();
  for (auto _ : state) {
    benchmark::DoNotOptimize(value.dump(-1, ' ', false, SXValue::error_handler_t::replace));
  }
}
BENCHMARK(BM_PayloadJson);

// Sends from `threads` sessions at once; each send returns only once its row is committed.
void BM_SpoolSend(benchmark::State& state) {
  ScratchDir dir;
  SXSqliteFernReporting fern((dir.path / "fern.db").string(), (dir.path / "none.json").string(),
                             nullptr);
  const int threads = static_cast<int>(state.range(0));
  std::vector<std::shared_ptr<FernReportingSession>> sessions;
  for (int i = 0; i < threads; ++i) {
    sessions.push_back(fern.openSession(SXValue::object(), SXValue::object(), SXValue()));
  }
  const SXValue value = payload();
  constexpr int kPerThread = 200;
  for (auto _ : state) {
    std::vector<std::thread> senders;
    for (int t = 0; t < threads; ++t) {
      senders.emplace_back([&, t] {
        std::optional<FernError> error;
        for (int i = 0; i < kPerThread; ++i) sessions[t]->sendMessage(3, 1, value, error);
      });
    }
    for (auto& sender : senders) sender.join();
  }
  state.SetItemsProcessed(state.iterations() * threads * kPerThread);
}
BENCHMARK(BM_SpoolSend)->Arg(1)->Arg(4)->UseRealTime()->Unit(benchmark::kMillisecond);

void BM_TallyvaneEvents(benchmark::State& state) {
  ScratchDir dir;
  SXSqliteTallyvane tallyvane((dir.path / "tallyvane.db").string(), nullptr);
  auto value = std::make_shared<const SXValue>(payload());
  for (auto _ : state) {
    for (int i = 0; i < 1000; ++i) {
      tallyvane.sendEventLazy("com.vendra.sonex.Session_Playback.Start",
                              [value] { return *value; });
    }
    tallyvane.flush();
  }
  state.SetItemsProcessed(state.iterations() * 1000);
}
BENCHMARK(BM_TallyvaneEvents)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
