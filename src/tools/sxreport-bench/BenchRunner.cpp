#include "BenchRunner.h"

#include <unistd.h>

#include <functional>
#include <thread>

#include "ClientPool.h"
#include "ProcStats.h"

namespace {

using Clock = std::chrono::steady_clock;

std::chrono::milliseconds millis(double seconds) {
  return std::chrono::milliseconds(static_cast<int64_t>(seconds * 1000));
}

double secondsSince(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}

std::optional<double> cpuSeconds(const BenchTarget& target, pid_t pid) {
  if (target.inProcessCpuSeconds) return target.inProcessCpuSeconds();
  if (pid > 0) return ProcCpuSeconds(pid);
  return std::nullopt;
}

// The measured process's RSS; nothing for the baseline, which shares the benchmark's process.
std::optional<long> rssKiB(const BenchTarget& target, pid_t pid, const char* field = "VmRSS") {
  if (target.inProcessCpuSeconds || pid <= 0) return std::nullopt;
  return ProcStatusKiB(pid, field);
}

std::optional<std::string> connectPool(ClientPool& pool, const BenchScenario& scenario,
                                       const BenchOptions& options, const BenchTarget& target,
                                       pid_t& pid) {
  if (auto failed = pool.connect(target.socketPath, options.clients, scenario.window(),
                                 target.checkResults)) {
    return failed;
  }
  pid = target.pid > 0 ? target.pid : pool.peerPid();
  return std::nullopt;
}

// Samples the RSS each time the replies pass another 1/N of the messages.
class RssSampler {
 public:
  RssSampler(const BenchTarget& target, pid_t pid, uint64_t total, size_t samples,
             const ClientPool& pool, TargetFigures& figures)
      : target_(target),
        pid_(pid),
        step_(std::max<uint64_t>(1, total / samples)),
        next_(step_),
        pool_(pool),
        figures_(figures) {}

  void operator()() {
    uint64_t replied = pool_.measuredReplies();
    if (replied < next_) return;
    if (auto rss = rssKiB(target_, pid_)) figures_.rssSamples.emplace_back(replied, *rss);
    while (next_ <= replied) next_ += step_;
  }

 private:
  const BenchTarget& target_;
  const pid_t pid_;
  const uint64_t step_;
  uint64_t next_;
  const ClientPool& pool_;
  TargetFigures& figures_;
};

void checkRows(const StoreRows& rows, const BenchOptions& options, TargetFigures& figures) {
  std::string error;
  auto drainStart = Clock::now();
  figures.rowsCounted = true;
  figures.foundRows =
      rows.waitFor(figures.expectedRows, millis(options.drainTimeoutSeconds), error);
  figures.drainSeconds = secondsSince(drainStart);
  if (!error.empty()) figures.errors.push_back("cannot count the rows: " + error);
  auto missing = [&](const char* store, int64_t expected, int64_t found) {
    if (found >= expected) return;
    figures.errors.push_back(std::to_string(expected - found) + " rows missing from " + store +
                             " (expected " + std::to_string(expected) + ", found " +
                             std::to_string(found) + ")");
  };
  missing("tallyvane.db", figures.expectedRows.tallyvane, figures.foundRows.tallyvane);
  missing("fernreporting.db", figures.expectedRows.fernReporting, figures.foundRows.fernReporting);
}

}  // namespace

TargetFigures RunScenario(const BenchScenario& scenario, const BenchOptions& options,
                          const BenchTarget& target) {
  TargetFigures figures;
  figures.target = target.name;
  figures.messages = scenario.messagesPerClient() * options.clients;
  ClientPool pool;
  pid_t pid = -1;
  auto timeout = millis(options.replyTimeoutSeconds);
  auto fail = [&](const std::string& why) {
    figures.errors.push_back(why);
    return figures;
  };
  if (auto failed = connectPool(pool, scenario, options, target, pid)) return fail(*failed);
  auto setup = [&](size_t client) { return scenario.setup(client); };
  if (auto failed = pool.runPhase(setup, false, timeout)) return fail("setup: " + *failed);

  bool countRows = scenario.landsRows() && !target.stateDir.empty();
  StoreRows rows(target.stateDir, BenchScenario::eventName(), BenchScenario::kCategory & 0xFFFF,
                 BenchScenario::kType);
  if (countRows) {
    if (SXStatus marked = rows.mark(); !marked.ok()) {
      return fail("cannot read the stores: " + marked.error());
    }
  }
  auto cpuBefore = cpuSeconds(target, pid);
  RssSampler sampler(target, pid, figures.messages, options.rssSamples, pool, figures);
  auto start = Clock::now();
  auto measure = [&](size_t client) { return scenario.measure(client); };
  if (auto failed = pool.runPhase(measure, false, timeout, std::ref(sampler))) {
    return fail("measure: " + *failed);
  }
  figures.seconds = secondsSince(start);
  figures.requests = pool.measuredReplies();

  auto teardown = [&](size_t client) { return scenario.teardown(client); };
  if (auto failed = pool.runPhase(teardown, true, timeout)) return fail("teardown: " + *failed);
  if (countRows) {
    figures.expectedRows = scenario.expectedRows();
    checkRows(rows, options, figures);
  }
  auto cpuAfter = cpuSeconds(target, pid);
  if (cpuBefore && cpuAfter) figures.cpuSeconds = *cpuAfter - *cpuBefore;
  figures.rssKiB = rssKiB(target, pid);
  figures.peakRssKiB = rssKiB(target, pid, "VmHWM");
  pool.stop();
  figures.latency = pool.latency();
  figures.rejected = pool.rejected();
  if (figures.rejected > 0) {
    figures.errors.push_back(std::to_string(figures.rejected) +
                             " requests rejected; first: " + pool.firstRejection());
  }
  return figures;
}

TargetFigures RunIdle(const BenchScenario& scenario, const BenchOptions& options,
                      const BenchTarget& target) {
  TargetFigures figures;
  figures.target = target.name;
  figures.sessions = options.clients * options.sessions;
  auto timeout = millis(options.replyTimeoutSeconds);
  pid_t pid = target.pid;
  figures.idleRssKiB = rssKiB(target, pid);
  {
    ClientPool pool;
    if (auto failed = connectPool(pool, scenario, options, target, pid)) {
      figures.errors.push_back(*failed);
      return figures;
    }
    if (!figures.idleRssKiB) figures.idleRssKiB = rssKiB(target, pid);
    auto setup = [&](size_t client) { return scenario.setup(client); };
    if (auto failed = pool.runPhase(setup, true, timeout)) {
      figures.errors.push_back("setup: " + *failed);
      return figures;
    }
    figures.rssWithSessionsKiB = rssKiB(target, pid);
    pool.stop();
    figures.rejected = pool.rejected();
    if (figures.rejected > 0) figures.errors.push_back("rejected: " + pool.firstRejection());
  }
  // The sessions leave with their connections; give the daemon a moment to let them go.
  std::this_thread::sleep_for(std::chrono::milliseconds(500));
  figures.rssAfterCloseKiB = rssKiB(target, pid);
  figures.peakRssKiB = rssKiB(target, pid, "VmHWM");
  figures.rssKiB = figures.rssAfterCloseKiB;
  return figures;
}
