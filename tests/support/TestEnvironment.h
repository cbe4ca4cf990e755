// A reporting environment wired entirely to test doubles, with a manual dispatch so that tests
// decide when queued work runs.
#pragma once

#include <memory>

#include "SXReportingEnvironment.h"
#include "fakes/FakeClock.h"
#include "fakes/FakeDevice.h"
#include "fakes/FakeFernReporting.h"
#include "fakes/FakeJoulebook.h"
#include "fakes/FakeKestrel.h"
#include "fakes/FakeLog.h"
#include "fakes/FakeNotifications.h"
#include "fakes/FakePreferences.h"
#include "fakes/FakeTallyvane.h"
#include "fakes/FakeTracer.h"
#include "fakes/ManualDispatch.h"
#include "platform/Random.h"

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

struct TestEnvironment {
  explicit TestEnvironment(SXValue deviceProperties = SXValue::object(),
                           std::set<std::string> verboseScopes = {"sxrs", "sxrr", "sxrd"});
  ~TestEnvironment();

  std::shared_ptr<FakeLog> log;
  std::shared_ptr<FakeTracer> tracer = std::make_shared<FakeTracer>();
  std::shared_ptr<FakeClock> clock = std::make_shared<FakeClock>();
  std::shared_ptr<ManualDispatch> dispatch = std::make_shared<ManualDispatch>();
  std::shared_ptr<FixedRandom> random = std::make_shared<FixedRandom>(59);
  std::shared_ptr<FakeProcessInfo> process = std::make_shared<FakeProcessInfo>();
  std::shared_ptr<FakeDeviceProperties> device;
  std::shared_ptr<FakeFileSystem> fileSystem = std::make_shared<FakeFileSystem>();
  std::shared_ptr<FakeTallyvane> tallyvane = std::make_shared<FakeTallyvane>();
  std::shared_ptr<FakeJoulebook> joulebook = std::make_shared<FakeJoulebook>();
  std::shared_ptr<FakeFernReporting> fern = std::make_shared<FakeFernReporting>();
  std::shared_ptr<FakeKestrel> kestrel = std::make_shared<FakeKestrel>();
  std::shared_ptr<FakeOrientationService> orientation = std::make_shared<FakeOrientationService>();
  std::shared_ptr<FakePreferences> preferences = std::make_shared<FakePreferences>();
  std::shared_ptr<FakeNotifications> notifications = std::make_shared<FakeNotifications>();
  std::shared_ptr<SXReportingEnvironment> environment;

  SXPlatform platform() const;
  // Runs queued work until nothing is left.
  size_t drain() { return dispatch->runAll(); }
};
