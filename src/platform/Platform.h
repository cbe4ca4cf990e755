// The platform a reporting service runs on: one adapter per facility. `main` wires the
// production adapters; tests wire doubles from tests/fakes. Nothing below `main` reaches the
// operating system except through these.
#pragma once

#include <memory>
#include <string>

#include "platform/Clock.h"
#include "platform/DeviceProperties.h"
#include "platform/Dispatch.h"
#include "platform/FernReporting.h"
#include "platform/FileSystem.h"
#include "platform/Joulebook.h"
#include "platform/Kestrel.h"
#include "platform/Log.h"
#include "platform/Notify.h"
#include "platform/Orientation.h"
#include "platform/Preferences.h"
#include "platform/ProcessInfo.h"
#include "platform/Random.h"
#include "platform/Tallyvane.h"
#include "platform/Trace.h"

struct SXPlatform {
  std::shared_ptr<SXLogFacility> log;
  std::shared_ptr<SXTracer> tracer;
  std::shared_ptr<SXClock> clock;
  std::shared_ptr<SXDispatch> dispatch;
  std::shared_ptr<SXRandom> random;
  std::shared_ptr<SXProcessInfo> process;
  std::shared_ptr<SXDeviceProperties> device;
  std::shared_ptr<SXFileSystem> fileSystem;
  std::shared_ptr<SXTallyvane> tallyvane;
  std::shared_ptr<SXJoulebook> joulebook;
  std::shared_ptr<FernReporting> fernReporting;
  std::shared_ptr<Kestrel> kestrel;
  std::shared_ptr<SXOrientationService> orientation;
  std::shared_ptr<SXPreferences> preferences;
  std::shared_ptr<SXNotifications> notifications;
  // Where internal builds write session summary files.
  std::string diagnosticLogsDirectory =
      "/private/var/mobile/Library/Logs/Faultkeep/DiagnosticLogs/Audio/Reporting";
};
