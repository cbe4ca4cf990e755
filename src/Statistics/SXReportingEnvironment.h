// The platform together with the state this service keeps once per process: the log scope
// handles, the server queue, the internal-build flag, the guardrail limits and the counters.
// One environment per service; tests make a fresh one per case, so "once per process" means
// once per environment.
#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <vector>

#include "SXReportingCounters.h"
#include "SXReportingLimits.h"
#include "common/SXThreadSafety.h"
#include "platform/Platform.h"

class SXReportingEnvironment {
 public:
  // Power-log entries reach the platform's power log through a counting forwarder.
  explicit SXReportingEnvironment(SXPlatform platform, SXReportingLimits limits = {});
  SXReportingEnvironment(const SXReportingEnvironment&) = delete;
  SXReportingEnvironment& operator=(const SXReportingEnvironment&) = delete;

  const SXPlatform& platform() const { return platform_; }
  SXLogFacility& log() const { return *platform_.log; }
  SXTracer& tracer() const { return *platform_.tracer; }

  // The service scope "sxrs"; set by the service delegate's init (nullptr before it).
  const SXLogScope* serviceLogScope() const { return serviceScope_.load(); }
  void setServiceLogScope(std::shared_ptr<const SXLogScope> scope) {
    serviceScope_.store(keep(std::move(scope)));
  }

  // The session scope "sxrr", registered by the first session created.
  const SXLogScope* sessionLogScope() const { return sessionScope_.load(); }
  void registerSessionLogScopeOnce();

  // The driver scope "sxrd"; set at every creation of a driver utility.
  const SXLogScope* driverLogScope() const { return driverScope_.load(); }
  void setDriverLogScope(std::shared_ptr<const SXLogScope> scope) {
    driverScope_.store(keep(std::move(scope)));
  }

  // The serial server queue "com.vendra.sonex.reporting.server"; set by the delegate's init,
  // before any client connects.
  const std::shared_ptr<SXWorkQueue>& serverQueue() const { return serverQueue_; }
  void setServerQueue(std::shared_ptr<SXWorkQueue> queue) { serverQueue_ = std::move(queue); }

  // The defaults notification token.
  int defaultsNotifyToken() const { return defaultsToken_.load(); }
  void setDefaultsNotifyToken(int token) { defaultsToken_.store(token); }

  // Whether the device runs an internal build; asked once, on first use.
  bool isInternalBuild();

  // How long one pass of a session start waits for the server-reporting backends. Tests
  // shorten it; the service keeps 9 seconds.
  double backendWaitSeconds() const { return backendWaitSeconds_.load(); }
  void setBackendWaitSeconds(double seconds) { backendWaitSeconds_.store(seconds); }

  // A copy of the limits in force, so that one request sees one consistent set while a reload
  // replaces them. Any thread.
  SXReportingLimits limits() const { return *limits_.load(); }
  void setLimits(const SXReportingLimits& limits) {
    limits_.store(std::make_shared<const SXReportingLimits>(limits));
  }
  SXReportingCounters& counters() const { return *counters_; }

 private:
  const std::shared_ptr<SXReportingCounters> counters_ = std::make_shared<SXReportingCounters>();
  SXPlatform platform_;
  std::atomic<std::shared_ptr<const SXReportingLimits>> limits_;
  // Keeps `scope` for as long as this lives and returns it.
  const SXLogScope* keep(std::shared_ptr<const SXLogScope> scope) {
    SXMutexLock lock(scopesMutex_);
    return keptScopes_.emplace_back(std::move(scope)).get();
  }

  // Scope handles are read from any thread, on every message: plain pointers, to handles kept
  // as long as this (one for each time a scope is set, which is once or twice a run).
  std::atomic<const SXLogScope*> serviceScope_{nullptr};
  std::atomic<const SXLogScope*> sessionScope_{nullptr};
  std::atomic<const SXLogScope*> driverScope_{nullptr};
  SXMutex scopesMutex_;
  std::vector<std::shared_ptr<const SXLogScope>> keptScopes_ SX_GUARDED_BY(scopesMutex_);
  std::once_flag sessionScopeOnce_;
  std::shared_ptr<SXWorkQueue> serverQueue_;
  std::atomic<int> defaultsToken_{-1};
  std::once_flag internalBuildOnce_;
  bool internalBuild_ = false;  // written once under internalBuildOnce_
  std::atomic<double> backendWaitSeconds_{9.0};
};

// The scope every subsystem registers: subsystem "com.vendra.sonex", option value 31.
SXLogScope SXReportingLogScope(std::string_view shortName, std::string category);
