// Where the service keeps its files. Each directory comes from its flag, else its environment
// twin, else a default: under ./var of the working directory for an ordinary user, the
// system's directories for root. The daemon and sxreportctl resolve them the same way.
#pragma once

#include <optional>
#include <string>

struct SXPaths {
  std::string stateDir;           // tallyvane.db, joulebook.db, fernreporting.db
  std::string configDir;          // device.json, fernreporting.json, preferences/
  std::string runtimeDir;         // the socket, notify/
  std::string diagnosticLogsDir;  // session summary files of internal builds
  std::string kestrelRoot;        // driver counters
  std::string socketPath;
  // The preferences domains; nothing means `<configDir>/preferences`, or for root
  // `<stateDir>/preferences`: the system's service keeps them with its state, since they change
  // at run time and /etc is the administrator's.
  std::optional<std::string> preferencesDir;
  bool preferencesWithState = false;

  std::string preferencesDirectory() const {
    return preferencesDir.value_or((preferencesWithState ? stateDir : configDir) + "/preferences");
  }

  // Defaults with the environment twins applied (SXREPORTING_STATE_DIR, SXREPORTING_CONFIG_DIR,
  // SXREPORTING_RUNTIME_DIR, SXREPORTING_DIAGNOSTIC_LOGS_DIR, SXREPORTING_KESTREL_ROOT,
  // SXREPORTING_SOCKET, SXREPORTING_PREFERENCES_DIR). The socket follows the runtime directory
  // unless set itself.
  static SXPaths fromEnvironment();
  // Call after a flag changed runtimeDir, so that the socket follows it (unless set itself).
  void runtimeDirChanged();

  bool socketPathExplicit = false;
};

inline constexpr const char* kSXServiceIdentifier = "com.vendra.audio.kitbench.reporting.service";
