// A reporting environment wired to test doubles and a real spool (no driver counters), with a
// manual dispatch so that tests decide when queued work runs.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "Statistics/SXReportingEnvironment.h"
#include "fakes/FakeClock.h"
#include "fakes/FakeDevice.h"
#include "fakes/FakeFernReporting.h"
#include "fakes/FakeLog.h"
#include "fakes/ManualDispatch.h"
#include "linux/JsonPreferences.h"
#include "linux/UsdtTracer.h"
#include "platform/Notify.h"
#include "platform/Random.h"
#include "platform/Trace.h"
#include "support/SqliteTestSupport.h"

// Always draws the same number (below its bound).
class FixedRandom final : public SXRandom {
 public:
  explicit FixedRandom(uint32_t value) : value_(value) {}
  uint32_t uniform(uint32_t upperBound) override {
    return upperBound ? std::min(value_, upperBound - 1) : 0;
  }

 private:
  uint32_t value_;
};

// Registrations succeed and nothing is ever delivered: the defaults' notification is tested
// through the real daemon, and a registration kept here would keep the service alive.
class SilentNotifications final : public SXNotifications {
 public:
  int registerDispatch(const std::string&, int& token, std::shared_ptr<SXWorkQueue>,
                       SXNotifyHandler) override {
    token = 1;
    return 0;
  }
  int post(const std::string&) override { return 0; }
};

struct TestEnvironment {
  explicit TestEnvironment(SXValue deviceProperties = SXValue::object(),
                           std::set<std::string> verboseScopes = {"sxrs", "sxrr", "sxrd"});
  ~TestEnvironment();

  std::shared_ptr<FakeLog> log;
  std::shared_ptr<SXTracer> tracer = std::make_shared<SXUsdtTracer>();
  std::shared_ptr<FakeClock> clock = std::make_shared<FakeClock>();
  std::shared_ptr<ManualDispatch> dispatch = std::make_shared<ManualDispatch>();
  std::shared_ptr<FixedRandom> random = std::make_shared<FixedRandom>(59);
  std::shared_ptr<FakeProcessInfo> process = std::make_shared<FakeProcessInfo>();
  std::shared_ptr<FakeDeviceProperties> device;
  std::shared_ptr<FakeFileSystem> fileSystem = std::make_shared<FakeFileSystem>();
  std::shared_ptr<FakeTallyvane> tallyvane = std::make_shared<FakeTallyvane>();
  std::shared_ptr<FakeJoulebook> joulebook = std::make_shared<FakeJoulebook>();
  std::shared_ptr<FakeFernReporting> fern = std::make_shared<FakeFernReporting>();
  std::shared_ptr<FakeOrientationService> orientation = std::make_shared<FakeOrientationService>();
  const SXTestTempDir temp;  // removed with the environment
  const std::string directory = temp.path();
  std::shared_ptr<SXJsonPreferences> preferences =
      std::make_shared<SXJsonPreferences>(directory + "/preferences", log);
  std::shared_ptr<SilentNotifications> notifications = std::make_shared<SilentNotifications>();
  std::shared_ptr<SXReportingEnvironment> environment;

  SXPlatform platform() const;
  // An environment of `platform` (these facilities when none) under `limits`, its server queue
  // one of the manual dispatch's.
  std::shared_ptr<SXReportingEnvironment> makeEnvironment(
      SXReportingLimits limits = {}, std::optional<SXPlatform> platform = {}) const;
  // Runs queued work until nothing is left.
  size_t drain() { return dispatch->runAll(); }
};
