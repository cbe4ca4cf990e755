#include "support/TestEnvironment.h"

TestEnvironment::TestEnvironment(SXValue deviceProperties, std::set<std::string> verboseScopes)
    : log(std::make_shared<FakeLog>(std::move(verboseScopes))),
      device(std::make_shared<FakeDeviceProperties>(std::move(deviceProperties))) {
  environment = std::make_shared<SXReportingEnvironment>(platform());
  environment->setServerQueue(dispatch->createSerialQueue("com.vendra.sonex.reporting.server",
                                                          SXQualityOfService::kUserInteractive));
  environment->setBackendWaitSeconds(0.3);
  // The manual dispatch runs a backend wait's timer as soon as it is set, so the backends must
  // be known before the setup task looks for them.
  fern->setConfigurationDelivery(FakeFernReporting::Delivery::kInline);
}

TestEnvironment::~TestEnvironment() {
  // Queued work holds sessions strongly; run it so nothing outlives the fakes.
  dispatch->runAll();
  notifications->clear();  // registrations hold the service delegate
  orientation->clear();    // and callbacks their sessions
}

SXPlatform TestEnvironment::platform() const {
  SXPlatform p;
  p.log = log;
  p.tracer = tracer;
  p.clock = clock;
  p.dispatch = dispatch;
  p.random = random;
  p.process = process;
  p.device = device;
  p.fileSystem = fileSystem;
  p.tallyvane = tallyvane;
  p.joulebook = joulebook;
  p.fernReporting = fern;
  p.kestrel = kestrel;
  p.orientation = orientation;
  p.preferences = preferences;
  p.notifications = notifications;
  p.diagnosticLogsDirectory = "/diag";
  return p;
}
