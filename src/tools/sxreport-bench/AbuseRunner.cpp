// The abuse scenario: a quiet second, then each attack alone, then all of them at once, with the
// prober timing reporterID:valid: throughout and the daemon's RSS sampled every 50 ms.
#include <algorithm>
#include <fstream>
#include <sstream>
#include <thread>

#include "BenchRunner.h"
#include "ProcStats.h"

namespace {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

constexpr auto kQuietPhase = 1s;
constexpr auto kRssSampleInterval = 50ms;
constexpr auto kFinalRoundTripTimeout = 5s;
constexpr long kMaxRssBrakeKiB = 4L << 20;  // 4 GiB

// The daemon's RSS beyond which the attacks stop: far past any target, and short of hurting
// the rest of the machine.
long rssBrakeKiB() {
  std::ifstream in("/proc/meminfo");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("MemAvailable:", 0) != 0) continue;
    std::istringstream fields(line.substr(13));
    long available = 0;
    if (fields >> available && available > 0) return std::min(kMaxRssBrakeKiB, available / 4);
  }
  return 1L << 20;
}

struct PhasePlan {
  std::string name;
  std::vector<AttackKind> attacks;
};

std::vector<PhasePlan> phasePlans() {
  std::vector<PhasePlan> plans = {{"quiet", {}}};
  for (AttackKind kind : kAllAttacks) plans.push_back({AttackName(kind), {kind}});
  plans.push_back({"all at once", {std::begin(kAllAttacks), std::end(kAllAttacks)}});
  return plans;
}

std::chrono::milliseconds millis(double seconds) {
  return std::chrono::milliseconds(static_cast<int64_t>(seconds * 1000));
}

// Runs one phase's attacks until their deadline, sampling the RSS meanwhile; raises `stop`
// when the RSS passes the brake.
void runPhase(const PhasePlan& plan, const AttackPlan& attackPlan, Clock::duration length,
              pid_t pid, long brakeKiB, std::atomic<bool>& stop, AbusePhase& phase) {
  auto start = Clock::now();
  auto deadline = start + length;
  std::vector<AttackCounters> results(plan.attacks.size());
  std::atomic<size_t> finished{0};
  std::vector<std::thread> threads;
  for (size_t i = 0; i < plan.attacks.size(); ++i) {
    threads.emplace_back([&, i] {
      results[i] = RunAttack(plan.attacks[i], attackPlan, deadline, stop);
      finished.fetch_add(1);
    });
  }
  auto sample = [&] {
    if (pid <= 0) return;
    auto rss = ProcStatusKiB(pid, "VmRSS");
    if (!rss) return;
    phase.maxRssKiB = std::max(phase.maxRssKiB.value_or(0), *rss);
    if (*rss > brakeKiB && !stop.exchange(true)) phase.braked = true;
  };
  // Each attack bounds its own time (partial frames: past the deadline by their timeout and a
  // margin); the stop after that only guards against a slip in one of them.
  auto hardStop = deadline + attackPlan.partialFrameTimeout + 10s;
  while (finished.load() < threads.size() || Clock::now() < deadline) {
    sample();
    if (Clock::now() > hardStop) stop.store(true);
    if (stop.load() && finished.load() == threads.size()) break;
    std::this_thread::sleep_for(kRssSampleInterval);
  }
  for (auto& thread : threads) thread.join();
  sample();
  phase.seconds = std::chrono::duration<double>(Clock::now() - start).count();
  if (pid > 0) phase.endRssKiB = ProcStatusKiB(pid, "VmRSS");
  for (const auto& result : results) phase.attacks.merge(result);
}

// After a phase stopped by the brake: whether the daemon let go of enough memory, within two
// seconds, for the next phase to mean something.
bool rssFellBack(pid_t pid, long brakeKiB) {
  auto deadline = Clock::now() + 2s;
  while (Clock::now() < deadline) {
    auto rss = ProcStatusKiB(pid, "VmRSS");
    if (!rss || *rss < brakeKiB / 2) return true;
    std::this_thread::sleep_for(100ms);
  }
  return false;
}

}  // namespace

TargetFigures RunAbuse(const BenchScenario& scenario, const BenchOptions& options,
                       const BenchTarget& target) {
  TargetFigures figures;
  figures.target = target.name;
  std::string error;
  if (!Prober::RoundTrip(target.socketPath, scenario.sessionID(0, 0), 5000ms, error)) {
    figures.errors.push_back("the daemon does not answer before the attacks: " + error);
    return figures;
  }
  pid_t pid = target.pid > 0 ? target.pid : AbusePeerPid(target.socketPath);

  AbuseFigures abuse;
  abuse.attackSeconds = options.attackSeconds;
  abuse.partialFrameTimeoutMs = BenchScenario::kAbusePartialFrameTimeoutMs;
  abuse.rssBrakeKiB = rssBrakeKiB();
  AttackPlan plan;
  plan.socketPath = target.socketPath;
  plan.scenario = &scenario;
  plan.partialConnections = options.partialConnections;
  plan.partialFrameTimeout = std::chrono::milliseconds(abuse.partialFrameTimeoutMs);
  abuse.partialConnections = plan.partialConnections;

  auto plans = phasePlans();
  Prober prober(target.socketPath, scenario, plans.size());
  prober.start();
  std::atomic<bool> stop{false};
  size_t ran = 0;
  for (; ran < plans.size(); ++ran) {
    AbusePhase phase;
    phase.name = plans[ran].name;
    prober.setPhase(ran);
    Clock::duration length =
        ran == 0 ? Clock::duration(kQuietPhase) : Clock::duration(millis(options.attackSeconds));
    runPhase(plans[ran], plan, length, pid, abuse.rssBrakeKiB, stop, phase);
    bool braked = phase.braked;
    abuse.phases.push_back(std::move(phase));
    if (pid > 0 && !ProcIsRunning(pid)) {
      abuse.notes.push_back("the daemon exited during " + plans[ran].name);
      ++ran;
      break;
    }
    if (braked) {
      abuse.notes.push_back("attacks stopped early in " + plans[ran].name + ": daemon RSS passed " +
                            std::to_string(abuse.rssBrakeKiB / 1024) + " MiB");
      if (!rssFellBack(pid, abuse.rssBrakeKiB)) {
        ++ran;
        break;
      }
      stop.store(false);
    }
  }
  if (ran < plans.size()) {
    abuse.notes.push_back("skipped: " + std::to_string(plans.size() - ran) +
                          " phase(s) after the daemon's RSS or exit");
  }
  prober.stop();
  for (size_t i = 0; i < abuse.phases.size(); ++i) {
    abuse.phases[i].probes = prober.latency(i);
    abuse.phases[i].unansweredProbes = prober.unanswered(i);
    abuse.probes.merge(prober.latency(i));
    abuse.unansweredProbes += prober.unanswered(i);
  }
  abuse.proberReconnects = prober.reconnects();

  abuse.alive = pid > 0 ? ProcIsRunning(pid) : true;
  if (abuse.alive) {
    abuse.finalRoundTripNanoseconds = Prober::RoundTrip(target.socketPath, scenario.sessionID(0, 0),
                                                        kFinalRoundTripTimeout, error);
    if (!abuse.finalRoundTripNanoseconds) abuse.finalRoundTripError = error;
  } else {
    abuse.finalRoundTripError = "the daemon has exited";
  }
  if (target.logBytes) abuse.logBytes = target.logBytes();
  if (pid > 0 && abuse.alive) {
    figures.peakRssKiB = ProcStatusKiB(pid, "VmHWM");
    figures.rssKiB = ProcStatusKiB(pid, "VmRSS");
  }
  // A daemon that died has no VmHWM left: the highest sample stands in.
  if (!figures.peakRssKiB) {
    for (const auto& phase : abuse.phases) {
      if (phase.maxRssKiB)
        figures.peakRssKiB = std::max(figures.peakRssKiB.value_or(0), *phase.maxRssKiB);
    }
  }
  figures.latency = abuse.probes;
  figures.requests = abuse.probes.count();
  for (const auto& phase : abuse.phases) figures.seconds += phase.seconds;
  figures.abuse = std::move(abuse);
  return figures;
}
