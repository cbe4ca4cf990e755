#include "support/TestEnvironment.h"

TestEnvironment::TestEnvironment(SXValue deviceProperties, std::set<std::string> verboseScopes)
    : log(std::make_shared<FakeLog>(std::move(verboseScopes))),
      device(std::make_shared<FakeDeviceProperties>(std::move(deviceProperties))) {
  environment = makeEnvironment();
}

std::shared_ptr<SXReportingEnvironment> TestEnvironment::makeEnvironment(
    SXReportingLimits limits, std::optional<SXPlatform> platform) const {
  auto made = std::make_shared<SXReportingEnvironment>(platform.value_or(this->platform()), limits);
  made->setServerQueue(dispatch->createSerialQueue("com.vendra.sonex.reporting.server",
                                                   SXQualityOfService::kUserInteractive));
  // The manual dispatch runs a backend wait's timer as soon as it is set, so the fake's
  // backends are known before the setup task looks for them (its configuration is inline).
  made->setBackendWaitSeconds(0.3);
  return made;
}

TestEnvironment::~TestEnvironment() {
  // Queued work holds sessions strongly; run it so nothing outlives the fakes.
  dispatch->runAll();
  orientation->clear();  // callbacks hold their sessions
}

SXPlatform TestEnvironment::platform() const {
  return {.log = log,
          .tracer = tracer,
          .clock = clock,
          .dispatch = dispatch,
          .random = random,
          .process = process,
          .device = device,
          .fileSystem = fileSystem,
          .tallyvane = tallyvane,
          .joulebook = joulebook,
          .fernReporting = fern,
          .kestrel = nullptr,  // no driver counters: sessions subscribe to nothing
          .orientation = orientation,
          .preferences = preferences,
          .notifications = notifications,
          .diagnosticLogsDirectory = "/diag"};
}
