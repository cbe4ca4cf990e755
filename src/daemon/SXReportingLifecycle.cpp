#include "SXReportingLifecycle.h"

#include <signal.h>
#include <unistd.h>

#include <asio/post.hpp>

#include "platform/DiscardLog.h"

SXReportingLifecycle::SXReportingLifecycle(asio::any_io_executor io, Hooks hooks,
                                           SXServiceManager& manager,
                                           std::chrono::milliseconds drainTimeout,
                                           std::shared_ptr<SXLogFacility> log)
    : io_(io),
      hooks_(std::move(hooks)),
      manager_(manager),
      drainTimeout_(drainTimeout),
      log_(SXLogOrDiscard(std::move(log))),
      signals_(io, SIGTERM, SIGINT, SIGHUP),
      drainTimer_(io),
      watchdogTimer_(io) {}

SXReportingLifecycle::~SXReportingLifecycle() {
  if (drainThread_.joinable()) drainThread_.join();
}

void SXReportingLifecycle::start() {
  awaitSignal();
  if (auto interval = SXServiceManager::keepAliveInterval()) keepAlive(*interval);
}

void SXReportingLifecycle::awaitSignal() {
  signals_.async_wait([this](const std::error_code& ec, int signal) {
    if (ec) return;
    onSignal(signal);
    awaitSignal();
  });
}

void SXReportingLifecycle::onSignal(int signal) {
  const char* name = signal == SIGHUP ? "SIGHUP" : signal == SIGINT ? "SIGINT" : "SIGTERM";
  if (signal != SIGHUP) {
    if (stopping_) cutShort(std::string("a second ") + name + " came during the stop drain");
    beginStop(name);
    return;
  }
  if (stopping_) return;  // the configuration no longer matters
  SXLOG(*log_, nullptr, SXLogLevel::kDefault, "reloading the configuration on SIGHUP");
  manager_.reloading();
  hooks_.reload();
  manager_.ready("serving; configuration reloaded");
}

void SXReportingLifecycle::beginStop(const char* signal) {
  stopping_ = true;
  SXLOG(*log_, nullptr, SXLogLevel::kDefault,
        "stopping on %s: no new connections or requests; draining (at most %lli ms)", signal,
        static_cast<int64_t>(drainTimeout_.count()));
  manager_.stopping("draining");
  watchdogTimer_.cancel();
  hooks_.stopReading();
  drainTimer_.expires_after(drainTimeout_);
  drainTimer_.async_wait([this](const std::error_code& ec) {
    if (!ec) cutShort("the stop drain took longer than its limit");
  });
  auto begun = std::chrono::steady_clock::now();
  drainThread_ = std::thread([this, begun] {
    std::string drained = hooks_.drain();
    auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(
        std::chrono::steady_clock::now() - begun);
    asio::post(io_, [this, drained, ms] {
      drainTimer_.cancel();
      SXLOG(*log_, nullptr, SXLogLevel::kDefault, "stopped after a drain of %lli ms: %@",
            static_cast<int64_t>(ms.count()), drained);
      drained_.store(true);
      hooks_.finish();
    });
  });
}

void SXReportingLifecycle::cutShort(const std::string& why) {
  // Committed rows are safe in the stores' logs; what the drain had not reached is named here.
  SXLOG(*log_, nullptr, SXLogLevel::kError, "exiting now: %@; left: %@", why, hooks_.leftovers());
  log_->flush();
  ::_exit(1);
}

void SXReportingLifecycle::keepAlive(std::chrono::microseconds interval) {
  watchdogTimer_.expires_after(interval);
  watchdogTimer_.async_wait([this, interval](const std::error_code& ec) {
    if (ec || stopping_) return;
    if (!pingOut_.exchange(true)) {
      hooks_.throughServerQueue([this] {
        asio::post(io_, [this] {
          pingOut_.store(false);
          if (!stopping_) manager_.watchdogAlive();
        });
      });
    }
    keepAlive(interval);
  });
}
