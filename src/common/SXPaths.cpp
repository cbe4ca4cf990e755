#include "common/SXPaths.h"

#include <unistd.h>

#include <cstdlib>

namespace {

std::string fromEnv(const char* name, std::string fallback) {
  const char* value = std::getenv(name);
  return value && *value ? std::string(value) : fallback;
}

}  // namespace

SXPaths SXPaths::fromEnvironment() {
  const bool root = ::geteuid() == 0;
  SXPaths p;
  p.stateDir = fromEnv("SXREPORTING_STATE_DIR", root ? "/var/lib/sxreportingd" : "./var/lib");
  p.configDir = fromEnv("SXREPORTING_CONFIG_DIR", root ? "/etc/sxreportingd" : "./var/etc");
  p.runtimeDir = fromEnv("SXREPORTING_RUNTIME_DIR", root ? "/run/sxreportingd" : "./var/run");
  p.diagnosticLogsDir =
      fromEnv("SXREPORTING_DIAGNOSTIC_LOGS_DIR",
              root ? "/private/var/mobile/Library/Logs/Faultkeep/DiagnosticLogs/Audio/Reporting"
                   : "./var/log/DiagnosticLogs/Audio/Reporting");
  p.kestrelRoot = fromEnv("SXREPORTING_KESTREL_ROOT", root ? "/run/kestrel" : "./var/kestrel");
  if (auto dir = fromEnv("SXREPORTING_PREFERENCES_DIR", ""); !dir.empty()) p.preferencesDir = dir;
  p.preferencesWithState = root;
  const char* socket = std::getenv("SXREPORTING_SOCKET");
  p.socketPathExplicit = socket && *socket;
  p.socketPath = p.socketPathExplicit ? std::string(socket) : std::string();
  p.runtimeDirChanged();
  return p;
}

void SXPaths::runtimeDirChanged() {
  if (!socketPathExplicit) socketPath = runtimeDir + "/" + kSXServiceIdentifier;
}
