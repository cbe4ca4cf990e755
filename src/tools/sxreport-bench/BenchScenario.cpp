#include "BenchScenario.h"

#include <unistd.h>

#include <chrono>
#include <memory>
#include <vector>

namespace {

const std::string kCreate = "createReportingSession:reply:";
const std::string kSetType = "setServiceType:reportingSession:reply:";
const std::string kConfigure = "setConfiguration:forReporterID:reply:";
const std::string kStart = "startReportingSessionForID:reply:";
const std::string kSend = "sendMessage:withCategory:andType:forReportingIDs:reply:";
const std::string kStop = "stopReportingSessionForID:reply:";
const std::string kDestroy = "destroyReportingSession:reply:";
const std::string kValid = "reporterID:valid:";

// Telephony: a real service type whose standalone messages go out without a random delay.
constexpr uint16_t kServiceType = 2;

enum class Op { kCreate, kSetType, kConfigure, kStart, kSend, kBroadcast, kStop, kDestroy, kValid };

struct Step {
  Op op;
  int64_t id;
  bool measured = false;
};

void packString(msgpack::packer<ByteSink>& packer, std::string_view text) {
  packer.pack_str(static_cast<uint32_t>(text.size()));
  packer.pack_str_body(text.data(), static_cast<uint32_t>(text.size()));
}

// A message of six keys, about 200 bytes packed, as an audio client sends them: some keys
// with spaces (which the service rewrites), strings, integers and a floating value.
void packMessage(msgpack::packer<ByteSink>& packer, const std::string& runID, size_t client,
                 uint64_t sequence) {
  packer.pack_map(6);
  packString(packer, "bench run");
  packString(packer, runID);
  packString(packer, "client");
  packer.pack_uint64(client);
  packString(packer, "sequence");
  packer.pack_uint64(sequence);
  packString(packer, "route");
  packString(packer, "Speaker; BuiltInSpeakerProtection; 48000 Hz; 2 ch");
  packString(packer, "peak level dBFS");
  packer.pack_double(-12.75 - static_cast<double>(sequence % 64) / 8.0);
  packString(packer, "IO buffer description");
  packString(packer, "512 frames, float32 interleaved");
}

void packStep(const Step& step, BenchRequest& request, const std::string& runID, size_t client,
              uint64_t sequence) {
  msgpack::packer<ByteSink> packer(request.params);
  request.measured = step.measured;
  request.expect = BenchExpect::kTrue;
  switch (step.op) {
    case Op::kCreate:
    case Op::kStart:
    case Op::kStop:
    case Op::kDestroy:
    case Op::kValid: {
      static const std::string* const kMethods[] = {&kCreate, nullptr, nullptr,   &kStart, nullptr,
                                                    nullptr,  &kStop,  &kDestroy, &kValid};
      request.method = kMethods[static_cast<int>(step.op)];
      packer.pack_array(1);
      packer.pack_int64(step.id);
      // A start's reply is held until the session stops, so it must not fill the window.
      request.windowed = step.op != Op::kStart;
      if (step.op == Op::kValid) request.expect = BenchExpect::kAnything;
      return;
    }
    case Op::kSetType:
      request.method = &kSetType;
      packer.pack_array(2);
      packer.pack_uint16(kServiceType);
      packer.pack_int64(step.id);
      return;
    case Op::kConfigure:
      request.method = &kConfigure;
      packer.pack_array(2);
      packer.pack_map(1);
      packString(packer, "HostApplicationDisplayID");
      packString(packer, "sxreport-bench");
      packer.pack_int64(step.id);
      return;
    case Op::kSend:
    case Op::kBroadcast:
      request.method = &kSend;
      request.expect = BenchExpect::kNil;
      packer.pack_array(4);
      packMessage(packer, runID, client, sequence);
      packer.pack_uint32(BenchScenario::kCategory);
      packer.pack_uint16(BenchScenario::kType);
      if (step.op == Op::kBroadcast) {
        packer.pack_nil();
      } else {
        packer.pack_array(1);
        packer.pack_int64(step.id);
      }
      return;
  }
}

// A source that sends `steps` in order.
RequestSource fromSteps(std::vector<Step> steps, const std::string& runID, size_t client) {
  auto list = std::make_shared<std::vector<Step>>(std::move(steps));
  return [list, next = size_t{0}, &runID, client](BenchRequest& request) mutable {
    if (next >= list->size()) return false;
    packStep((*list)[next], request, runID, client, next);
    ++next;
    return true;
  };
}

std::string makeRunID() {
  auto now = std::chrono::system_clock::now().time_since_epoch();
  return "sxreport-bench " + std::to_string(::getpid()) + " " +
         std::to_string(std::chrono::duration_cast<std::chrono::seconds>(now).count());
}

}  // namespace

BenchScenario::BenchScenario(ScenarioKind kind, const BenchOptions& options)
    : kind_(kind),
      options_(options),
      idBase_((static_cast<int64_t>(::getpid()) & 0x3FFFFF) << 40),
      runID_(makeRunID()) {}

int64_t BenchScenario::sessionID(size_t client, uint64_t index) const {
  return idBase_ + (static_cast<int64_t>(client) << 28) + static_cast<int64_t>(index) + 1;
}

uint64_t BenchScenario::lifecycleLoops() const { return (options_.messages + 9) / 10; }

size_t BenchScenario::window() const { return kind_ == ScenarioKind::kRpc ? 1 : options_.window; }

uint64_t BenchScenario::messagesPerClient() const {
  return kind_ == ScenarioKind::kLifecycle ? lifecycleLoops() * 10 : options_.messages;
}

bool BenchScenario::landsRows() const {
  return kind_ != ScenarioKind::kRpc && kind_ != ScenarioKind::kIdle &&
         kind_ != ScenarioKind::kAbuse;
}

std::vector<DaemonFlag> BenchScenario::daemonFlags() const {
  if (kind_ != ScenarioKind::kAbuse) return {};
  // Optional: a daemon older than the flag refuses it, and then runs with its own default.
  return {{"--partial-frame-timeout-ms", std::to_string(kAbusePartialFrameTimeoutMs), true}};
}

StoreCounts BenchScenario::expectedRows() const {
  if (!landsRows()) return {};
  auto perStore = static_cast<int64_t>(messagesPerClient() * options_.clients);
  // A broadcast reaches every client's started session.
  if (kind_ == ScenarioKind::kBroadcast) perStore *= static_cast<int64_t>(options_.clients);
  return {perStore, perStore};
}

RequestSource BenchScenario::setup(size_t client) const {
  std::vector<Step> steps;
  const int64_t active = sessionID(client, 0);
  bool hasActive = kind_ != ScenarioKind::kLifecycle && kind_ != ScenarioKind::kIdle;
  if (hasActive) {
    steps.push_back({Op::kCreate, active});
    steps.push_back({Op::kSetType, active});
    steps.push_back({Op::kConfigure, active});
  }
  for (uint64_t k = hasActive ? 1 : 0; k < options_.sessions; ++k) {
    steps.push_back({Op::kCreate, sessionID(client, k)});
  }
  if (hasActive && kind_ != ScenarioKind::kStandalone) {
    steps.push_back({Op::kStart, active});
    // Its reply proves the start was applied before any client measures (for broadcasts).
    steps.push_back({Op::kValid, active});
  }
  return fromSteps(std::move(steps), runID_, client);
}

RequestSource BenchScenario::measure(size_t client) const {
  const int64_t active = sessionID(client, 0);
  const uint64_t count = options_.messages;
  const uint64_t stopEvery = options_.stopEvery;
  const ScenarioKind kind = kind_;
  if (kind == ScenarioKind::kLifecycle) {
    // create, start, 10 sends, stop, destroy: 14 requests per loop.
    uint64_t total = lifecycleLoops() * 14;
    uint64_t firstID = options_.sessions;
    return [this, client, total, firstID, i = uint64_t{0}](BenchRequest& request) mutable {
      if (i >= total) return false;
      uint64_t loop = i / 14, slot = i % 14;
      int64_t id = sessionID(client, firstID + loop);
      Op op = slot == 0    ? Op::kCreate
              : slot == 1  ? Op::kStart
              : slot <= 11 ? Op::kSend
              : slot == 12 ? Op::kStop
                           : Op::kDestroy;
      packStep({op, id, op != Op::kStart}, request, runID_, client, i);
      ++i;
      return true;
    };
  }
  // Each message, then after every `stopEvery` of them a stop and a fresh start.
  return [this, client, active, count, stopEvery, kind, i = uint64_t{0},
          pendingRestart = 0](BenchRequest& request) mutable {
    if (pendingRestart > 0) {
      packStep({pendingRestart == 2 ? Op::kStop : Op::kStart, active}, request, runID_, client, i);
      --pendingRestart;
      return true;
    }
    if (i >= count) return false;
    Op op = kind == ScenarioKind::kRpc         ? Op::kValid
            : kind == ScenarioKind::kBroadcast ? Op::kBroadcast
                                               : Op::kSend;
    packStep({op, active, true}, request, runID_, client, i);
    ++i;
    // Only addressed sends restart: a broadcast reaches the sessions started at that moment,
    // so another client's stop/start window would make its row count depend on timing.
    if (kind == ScenarioKind::kAddressed && stopEvery > 0 && i % stopEvery == 0 && i < count) {
      pendingRestart = 2;
    }
    return true;
  };
}

RequestSource BenchScenario::teardown(size_t client) const {
  std::vector<Step> steps;
  bool hasActive = kind_ != ScenarioKind::kLifecycle && kind_ != ScenarioKind::kIdle;
  if (hasActive && kind_ != ScenarioKind::kStandalone) {
    steps.push_back({Op::kStop, sessionID(client, 0)});
  }
  for (uint64_t k = 0; k < options_.sessions; ++k) {
    steps.push_back({Op::kDestroy, sessionID(client, k)});
  }
  return fromSteps(std::move(steps), runID_, client);
}
