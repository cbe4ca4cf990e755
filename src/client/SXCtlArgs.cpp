#include "client/SXCtlArgs.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <chrono>
#include <cmath>
#include <ctime>
#include <iomanip>
#include <map>
#include <set>
#include <sstream>
#include <string_view>

#include "common/SXServiceTypes.h"

namespace {

// The arguments of one command line, sorted but not yet read.
struct RawArgs {
  std::vector<std::string> positional;  // after the command name
  std::map<std::string, std::string> options;
  std::set<std::string> flags;
};

using Builder = bool (*)(const RawArgs&, SXCtlRequest&, std::string&);

struct CommandDefinition {
  std::string_view name;
  std::string_view usage;    // what follows "sxreportctl"
  std::string_view summary;  // one line in the overview
  std::string_view details;  // the rest of the command's help
  size_t minArgs;
  size_t maxArgs;
  std::vector<std::string_view> valueOptions;
  std::vector<std::string_view> flagOptions;
  Builder build;
};

bool parseInt64(const std::string& text, const char* what, int64_t& out, std::string& error) {
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), out);
  if (text.empty() || ec != std::errc() || end != text.data() + text.size()) {
    error = std::string("not ") + what + ": '" + text + "'";
    return false;
  }
  return true;
}

// A decimal or 0x-hexadecimal number no larger than `max`.
bool parseUnsigned(const std::string& text, uint64_t max, const char* what, uint64_t& out,
                   std::string& error) {
  const bool hex = text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X');
  const char* begin = text.data() + (hex ? 2 : 0);
  auto [end, ec] = std::from_chars(begin, text.data() + text.size(), out, hex ? 16 : 10);
  if (text.empty() || ec != std::errc() || end != text.data() + text.size() || out > max) {
    error = std::string("not ") + what + ": '" + text + "' (0 to " + std::to_string(max) + ")";
    return false;
  }
  return true;
}

bool parseJson(const std::string& text, const char* what, SXValue& out, std::string& error) {
  out = SXValue::parse(text, nullptr, false);
  if (out.is_discarded()) {
    error = std::string(what) + " is not valid JSON: " + text;
    return false;
  }
  return true;
}

bool parseIDList(const std::string& text, std::vector<int64_t>& ids, std::string& error) {
  size_t start = 0;
  while (start < text.size()) {
    size_t comma = std::min(text.find(',', start), text.size());
    int64_t id = 0;
    if (!parseInt64(text.substr(start, comma - start), "a reporter ID", id, error)) return false;
    ids.push_back(id);
    start = comma + 1;
  }
  return true;
}

bool buildNothing(const RawArgs&, SXCtlRequest&, std::string&) { return true; }

bool buildStatus(const RawArgs& raw, SXCtlRequest& r, std::string&) {
  r.metrics = raw.flags.contains("--metrics");
  return true;
}

bool buildReporterID(const RawArgs& raw, SXCtlRequest& r, std::string& error) {
  return parseInt64(raw.positional.back(), "a reporter ID", r.reporterID, error);
}

bool buildSetType(const RawArgs& raw, SXCtlRequest& r, std::string& error) {
  auto type = SXServiceTypeFromText(raw.positional[0]);
  if (!type) {
    error = "not a service type: '" + raw.positional[0] +
            "' (0-65535 or a name: " + SXServiceTypeNameList() + ")";
    return false;
  }
  r.serviceType = *type;
  return buildReporterID(raw, r, error);
}

bool buildConfigure(const RawArgs& raw, SXCtlRequest& r, std::string& error) {
  auto it = raw.options.find("--config");
  if (it == raw.options.end()) {
    error = "configure needs --config JSON (a JSON object, or null for none)";
    return false;
  }
  SXValue config;
  if (!parseJson(it->second, "--config", config, error)) return false;
  if (!config.is_object() && !config.is_null()) {
    error = "--config must be a JSON object or null";
    return false;
  }
  if (config.is_object()) r.configuration = std::move(config);
  return buildReporterID(raw, r, error);
}

bool buildSend(const RawArgs& raw, SXCtlRequest& r, std::string& error) {
  uint64_t number = 0;
  if (auto it = raw.options.find("--category"); it != raw.options.end()) {
    if (!parseUnsigned(it->second, UINT32_MAX, "a category", number, error)) return false;
    r.category = static_cast<SXReportingCategory>(number);
  }
  if (auto it = raw.options.find("--type"); it != raw.options.end()) {
    if (!parseUnsigned(it->second, UINT16_MAX, "a message type", number, error)) return false;
    r.messageType = static_cast<SXReportingMessageType>(number);
  }
  auto ids = raw.options.find("--ids");
  const bool broadcast = raw.flags.contains("--broadcast");
  if ((ids == raw.options.end()) == !broadcast) {
    error = "send needs either --ids ID,ID,... (--ids '' for none) or --broadcast";
    return false;
  }
  if (!broadcast && !parseIDList(ids->second, r.reporterIDs.emplace(), error)) return false;
  if (!parseJson(raw.positional[0], "the payload", r.payload, error)) return false;
  if (!r.payload.is_object()) {
    error = "the payload must be a JSON object";
    return false;
  }
  return true;
}

bool buildEvents(const RawArgs& raw, SXCtlRequest& r, std::string& error) {
  if (auto it = raw.options.find("--name"); it != raw.options.end()) r.eventName = it->second;
  if (auto it = raw.options.find("--since"); it != raw.options.end()) {
    const double now =
        std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
    if (!SXCtlParseSince(it->second, now, r.since.emplace(), error)) return false;
  }
  if (auto it = raw.options.find("--limit"); it != raw.options.end()) {
    int64_t limit = 0;
    if (!parseInt64(it->second, "a count", limit, error)) return false;
    if (limit < 0) {
      error = "--limit must not be negative";
      return false;
    }
    r.limit = limit;
  }
  return true;
}

// "10m": a number and one of s, m, h, d.
std::optional<double> relativeSeconds(const std::string& text) {
  static const std::map<char, double> kUnits = {{'s', 1}, {'m', 60}, {'h', 3600}, {'d', 86400}};
  if (text.size() < 2 || !kUnits.contains(text.back())) return std::nullopt;
  double amount = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size() - 1, amount);
  if (ec != std::errc() || end != text.data() + text.size() - 1 || !std::isfinite(amount) ||
      amount < 0) {
    return std::nullopt;
  }
  return amount * kUnits.at(text.back());
}

// "2026-11-25", "2026-11-25T06:30" or "2026-11-25T06:30:15", with an optional Z: UTC.
std::optional<double> utcSeconds(std::string text) {
  if (text.ends_with('Z')) text.pop_back();
  if (text.size() > 10 && text[10] == ' ') text[10] = 'T';
  // get_time() stops quietly at the end of the text, so the length must match the format's.
  const std::pair<const char*, size_t> formats[] = {
      {"%Y-%m-%d", 10}, {"%Y-%m-%dT%H:%M", 16}, {"%Y-%m-%dT%H:%M:%S", 19}};
  for (const auto& [format, length] : formats) {
    if (text.size() != length) continue;
    std::tm utc{};
    std::istringstream in(text);
    in >> std::get_time(&utc, format);
    if (!in.fail() && in.peek() == std::char_traits<char>::eof()) {
      return static_cast<double>(::timegm(&utc));
    }
  }
  return std::nullopt;
}

bool parseBool(const std::string& text, bool& out) {
  std::string lower(text);
  std::transform(lower.begin(), lower.end(), lower.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  if (lower == "true" || lower == "yes" || lower == "1") return out = true, true;
  if (lower == "false" || lower == "no" || lower == "0") return out = false, true;
  return false;
}

bool buildDefaultsValue(const RawArgs& raw, SXCtlRequest& r, std::string& error) {
  const std::string& text = raw.positional[2];
  const size_t kinds =
      raw.flags.count("--bool") + raw.flags.count("--int") + raw.flags.count("--string");
  if (kinds > 1) {
    error = "give at most one of --bool, --int and --string";
    return false;
  }
  if (raw.flags.contains("--bool")) {
    bool flag = false;
    if (!parseBool(text, flag)) {
      error = "not a boolean: '" + text + "' (true, false, yes, no, 1 or 0)";
      return false;
    }
    r.value = flag;
  } else if (raw.flags.contains("--int")) {
    int64_t number = 0;
    if (!parseInt64(text, "an integer", number, error)) return false;
    r.value = number;
  } else {
    r.value = text;
  }
  return true;
}

bool buildDefaults(const RawArgs& raw, SXCtlRequest& r, std::string& error) {
  r.defaultsAction = raw.positional[0];
  const size_t keyAndValue = raw.positional.size() - 1;
  const bool typed =
      raw.flags.contains("--bool") || raw.flags.contains("--int") || raw.flags.contains("--string");
  if (keyAndValue >= 1) r.key = raw.positional[1];
  if (r.defaultsAction == "read" && keyAndValue <= 1 && !typed) return true;
  if (r.defaultsAction == "delete" && keyAndValue == 1 && !typed) return true;
  if (r.defaultsAction == "write" && keyAndValue == 2) return buildDefaultsValue(raw, r, error);
  error =
      "usage: sxreportctl defaults read [KEY] | write [--bool|--int|--string] KEY VALUE | "
      "delete KEY";
  return false;
}

bool buildNotify(const RawArgs& raw, SXCtlRequest& r, std::string& error) {
  r.notificationName = raw.positional[0];
  if (r.notificationName.empty() || r.notificationName == "." || r.notificationName == ".." ||
      r.notificationName.find('/') != std::string::npos) {
    error = "not a notification name: '" + r.notificationName + "'";
    return false;
  }
  return true;
}

const std::vector<CommandDefinition>& commandDefinitions();

const CommandDefinition* findDefinition(std::string_view name) {
  for (const auto& definition : commandDefinitions()) {
    if (definition.name == name) return &definition;
  }
  return nullptr;
}

bool contains(const std::vector<std::string_view>& names, std::string_view name) {
  return std::find(names.begin(), names.end(), name) != names.end();
}

bool isGlobalValueOption(std::string_view name) {
  return name == "--socket" || name == "--state-dir" || name == "--config-dir" ||
         name == "--runtime-dir" || name == "--preferences-dir" || name == "--timeout";
}

bool setGlobal(const std::string& name, const std::string& value, SXCtlRequest& r,
               std::string& error) {
  if (name == "--socket") r.socketPath = value;
  if (name == "--state-dir") r.stateDir = value;
  if (name == "--config-dir") r.configDir = value;
  if (name == "--runtime-dir") r.runtimeDir = value;
  if (name == "--preferences-dir") r.preferencesDir = value;
  if (name == "--timeout") {
    char* end = nullptr;
    double seconds = std::strtod(value.c_str(), &end);
    if (value.empty() || *end != '\0' || !std::isfinite(seconds) || seconds < 0) {
      error = "not a time-out in seconds: '" + value + "'";
      return false;
    }
    r.timeoutSeconds = seconds;
  }
  return true;
}

// One "--name[=value]" argument at `args[i]`; takes the next argument as the value when the
// option wants one and none was attached.
bool takeOption(const std::vector<std::string>& args, size_t& i,
                const CommandDefinition* definition, RawArgs& raw, SXCtlRequest& r,
                std::string& error) {
  const std::string& arg = args[i];
  const size_t equals = arg.find('=');
  const std::string name = arg.substr(0, equals);
  const bool wantsValue =
      isGlobalValueOption(name) || (definition && contains(definition->valueOptions, name));
  if (name == "--json" || name == "--help" || name == "--version" ||
      (definition && contains(definition->flagOptions, name))) {
    if (equals != std::string::npos) {
      error = name + " takes no value";
      return false;
    }
    if (name == "--json") r.json = true;
    if (name == "--help") r.help = true;
    if (name == "--version") r.version = true;
    raw.flags.insert(name);
    return true;
  }
  if (!wantsValue) {
    error = definition ? std::string(definition->name) + " has no option " + name
                       : "unknown option " + name + " (subcommand options follow the subcommand)";
    return false;
  }
  std::string value;
  if (equals != std::string::npos) {
    value = arg.substr(equals + 1);
  } else if (i + 1 < args.size()) {
    value = args[++i];
  } else {
    error = name + " needs a value";
    return false;
  }
  if (isGlobalValueOption(name)) return setGlobal(name, value, r, error);
  raw.options[name] = value;
  return true;
}

bool sortArguments(const std::vector<std::string>& args, RawArgs& raw, SXCtlRequest& r,
                   std::string& error) {
  const CommandDefinition* definition = nullptr;
  bool onlyPositional = false;
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string& arg = args[i];
    if (!onlyPositional && arg == "--") {
      onlyPositional = true;
    } else if (!onlyPositional && arg == "-h") {
      r.help = true;
    } else if (!onlyPositional && arg.starts_with("--")) {
      if (!takeOption(args, i, definition, raw, r, error)) return false;
    } else if (r.command.empty()) {
      r.command = arg;
      definition = findDefinition(arg);
      if (!definition && arg != "help") {
        error = "unknown command '" + arg + "'";
        return false;
      }
    } else {
      raw.positional.push_back(arg);
    }
  }
  return true;
}

}  // namespace

bool SXCtlParseSince(const std::string& text, double now, double& since, std::string& error) {
  if (auto ago = relativeSeconds(text)) {
    since = now - *ago;
    return true;
  }
  if (auto time = utcSeconds(text)) {
    since = *time;
    return true;
  }
  error = "not a time: '" + text +
          "' (a UTC time such as 2026-11-25T06:30:00Z or 2026-11-25, or an age such as 90s, 10m, "
          "2h, 3d)";
  return false;
}

bool SXCtlParse(const std::vector<std::string>& args, SXCtlRequest& r, std::string& error) {
  r = SXCtlRequest();
  RawArgs raw;
  if (!sortArguments(args, raw, r, error)) return false;
  if (r.command == "help") {  // "help [COMMAND]"
    r.help = true;
    r.command = raw.positional.empty() ? "" : raw.positional[0];
    return true;
  }
  if (r.help || r.version) return true;
  if (r.command.empty()) {
    error = "no command given; see sxreportctl --help";
    return false;
  }
  const CommandDefinition& definition = *findDefinition(r.command);
  if (raw.positional.size() < definition.minArgs || raw.positional.size() > definition.maxArgs) {
    error = "usage: sxreportctl " + std::string(definition.usage);
    return false;
  }
  return definition.build(raw, r, error);
}

namespace {

void applyGlobals(const SXCtlRequest& from, SXCtlRequest& to) {
  if (from.socketPath) to.socketPath = from.socketPath;
  if (from.stateDir) to.stateDir = from.stateDir;
  if (from.configDir) to.configDir = from.configDir;
  if (from.runtimeDir) to.runtimeDir = from.runtimeDir;
  if (from.preferencesDir) to.preferencesDir = from.preferencesDir;
  if (from.timeoutSeconds) to.timeoutSeconds = from.timeoutSeconds;
  to.json = to.json || from.json;
}

}  // namespace

bool SXCtlParseChain(const std::vector<std::string>& args, std::vector<SXCtlRequest>& requests,
                     std::string& error) {
  requests.clear();
  std::vector<std::vector<std::string>> segments(1);
  for (const auto& arg : args) {
    auto& segment = segments.back();
    const bool literal = std::find(segment.begin(), segment.end(), "--") != segment.end();
    if (arg == "then" && !literal) {
      segments.emplace_back();
    } else {
      segment.push_back(arg);
    }
  }
  const bool gap = std::any_of(segments.begin(), segments.end(),
                               [](const auto& segment) { return segment.empty(); });
  if (segments.size() > 1 && gap) {
    error = "'then' must stand between two commands";
    return false;
  }
  SXCtlRequest globals;
  for (const auto& segment : segments) {
    if (!SXCtlParse(segment, requests.emplace_back(), error)) return false;
    applyGlobals(requests.back(), globals);
  }
  for (auto& request : requests) applyGlobals(globals, request);
  return true;
}

SXCtlExit SXCtlExitFor(SXCallStatus status) {
  switch (status) {
    case SXCallStatus::kReplied:
      return kSXCtlOK;
    case SXCallStatus::kTimedOut:
      return kSXCtlNoReply;
    case SXCallStatus::kConnectionLost:
      return kSXCtlUnreachable;
    case SXCallStatus::kRemoteError:
    case SXCallStatus::kBadReply:
      break;
  }
  return kSXCtlRejected;
}

SXTimeout SXCtlTimeout(const SXCtlRequest& request) {
  if (!request.timeoutSeconds) {
    if (request.command == "start") return kSXWaitForever;
    return std::chrono::seconds(5);
  }
  if (*request.timeoutSeconds == 0) return kSXWaitForever;
  return std::chrono::milliseconds(
      std::max<int64_t>(1, std::llround(std::min(*request.timeoutSeconds, 1e12) * 1000)));
}

SXPaths SXCtlPaths(const SXCtlRequest& request) {
  SXPaths paths = SXPaths::fromEnvironment();
  if (request.stateDir) paths.stateDir = *request.stateDir;
  if (request.configDir) paths.configDir = *request.configDir;
  if (request.runtimeDir) {
    paths.runtimeDir = *request.runtimeDir;
    paths.runtimeDirChanged();
  }
  if (request.preferencesDir) paths.preferencesDir = *request.preferencesDir;
  if (request.socketPath) {
    paths.socketPath = *request.socketPath;
    paths.socketPathExplicit = true;
  }
  return paths;
}

namespace {

const std::vector<CommandDefinition>& commandDefinitions() {
  // clang-format off
  static const std::vector<CommandDefinition> definitions = {
      {"create", "create ID", "create a reporting session",
       "Creates a session with reporter ID ID (a signed 64-bit number of your choosing).\n"
       "Replies true. The session belongs to this connection and goes when it closes, so\n"
       "chain the commands that need it: create 42 then start 42.",
       1, 1, {}, {}, buildReporterID},
      {"set-type", "set-type TYPE ID", "set a session's service type",
       "TYPE is a number (0-65535) or a name: generic, vokira, telephony, haptics, alarms,\n"
       "standalone, soundautoconfig, longformaudio, nonlongformaudio, audiodeviceusage,\n"
       "alerts, test, unknown (65535), or servicetype<N>. Replies true; sends no reply for ID 0.",
       2, 2, {}, {}, buildSetType},
      {"get-type", "get-type ID", "print a session's service type",
       "Prints the service type and its name, e.g. \"2 (telephony)\";\n"
       "65535 (unknown) when there is no such session.",
       1, 1, {}, {}, buildReporterID},
      {"configure", "configure --config JSON ID", "set a session's configuration",
       "JSON is a JSON object, or null to send no configuration. Replies true.", 1, 1,
       {"--config"}, {}, buildConfigure},
      {"start", "start ID", "start a session and wait until it stops",
       "The service replies when the session stops (true), or at once with false when there\n"
       "is no such session; it never replies for ID 0 or a session already started. So start\n"
       "waits without limit unless --timeout is given: run `sxreportctl stop ID` elsewhere.",
       1, 1, {}, {}, buildReporterID},
      {"send", "send [--category N] [--type N] (--ids ID,ID,...|--broadcast) PAYLOAD_JSON",
       "send a message to sessions",
       "PAYLOAD_JSON is a JSON object. --category defaults to 3 (Playback), --type to 1\n"
       "(Start); both take decimal or 0x-hexadecimal numbers. --ids names the sessions\n"
       "(--ids '' sends to none); --broadcast sends to every started session.\n"
       "Prints \"delivered\", or the error the service replied with when reporting is disabled.",
       1, 1, {"--category", "--type", "--ids"}, {"--broadcast"}, buildSend},
      {"stop", "stop ID", "stop a session",
       "Replies true (and the session's `start` returns); no reply for ID 0.", 1, 1, {}, {},
       buildReporterID},
      {"destroy", "destroy ID", "destroy a session",
       "Replies true; sends no reply for ID 0.", 1, 1, {}, {}, buildReporterID},
      {"valid", "valid ID", "tell whether a session exists",
       "Prints the reporter ID and service type of the session, or\n"
       "\"reporterID 0, serviceType 65535 (unknown)\" when there is none.",
       1, 1, {}, {}, buildReporterID},
      {"list", "list", "list every session's reporter ID",
       "One reporter ID a line, client by client; \"(none)\" when there are none.", 0, 0, {},
       {}, buildNothing},
      {"kill", "kill", "make the service exit",
       "The service exits with status 2 and never replies: kill ends with exit status 0 when\n"
       "the service closes the connection, or 4 when it is still there after the time-out.",
       0, 0, {}, {}, buildNothing},
      {"status", "status [--metrics]",
       "show clients, sessions, the enable switch and the defaults",
       "Read-only: changes nothing in the service. --metrics prints the service's counters and\n"
       "gauges in the Prometheus text format (version 0.0.4) instead, for a metrics\n"
       "collector; --json does not apply to it.",
       0, 0, {}, {"--metrics"}, buildStatus},
      {"events", "events [--name NAME] [--since WHEN] [--limit N]",
       "print the stored analytics events",
       "Reads <state-dir>/tallyvane.db: id, time, name and payload of each event, oldest\n"
       "first. --name keeps one event name, or the names a shell-style pattern matches\n"
       "(com.vendra.*); --since keeps the events from WHEN on, a UTC time\n"
       "(2026-11-25T06:30:00Z, 2026-11-25T06:30, 2026-11-25) or an age (90s, 10m, 2h, 3d);\n"
       "--limit keeps the newest N of those.",
       0, 0, {"--name", "--since", "--limit"}, {}, buildEvents},
      {"sizes", "sizes", "show how much each local store holds",
       "Reads tallyvane.db, joulebook.db and fernreporting.db in <state-dir>: rows, the oldest\n"
       "row's time, the bytes their pages hold (what the retention caps) and the bytes of\n"
       "the files and their write-ahead logs on disk.",
       0, 0, {}, {}, buildNothing},
      {"defaults", "defaults read [KEY] | write [--bool|--int|--string] KEY VALUE | delete KEY",
       "read and change the preferences",
       "The domain com.vendra.sonex, kept in <preferences-dir>/com.vendra.sonex.json.\n"
       "read prints the whole domain or one key (exit status 5 when the key is not set);\n"
       "write stores VALUE as a string unless --bool or --int says otherwise.",
       1, 3, {}, {"--bool", "--int", "--string"}, buildDefaults},
      {"notify", "notify NAME", "post a named notification",
       "Touches <runtime-dir>/notify/NAME, which wakes every process watching that name.", 1, 1,
       {}, {}, buildNotify},
  };
  // clang-format on
  return definitions;
}

constexpr std::string_view kOptionsHelp =
    "Options:\n"
    "  --socket PATH       the service's socket\n"
    "                      (default <runtime-dir>/com.vendra.audio.kitbench.reporting.service)\n"
    "  --state-dir DIR     where tallyvane.db is (default ./var/lib;\n"
    "                      as root /var/lib/sxreportingd)\n"
    "  --config-dir DIR    the service's configuration (default ./var/etc;\n"
    "                      as root /etc/sxreportingd)\n"
    "  --preferences-dir DIR\n"
    "                      where the defaults domain is (default <config-dir>/preferences;\n"
    "                      as root <state-dir>/preferences, where the service keeps it)\n"
    "  --runtime-dir DIR   where the socket and notify/ are (default ./var/run;\n"
    "                      as root /run/sxreportingd)\n"
    "  --json              print the reply as JSON\n"
    "  --timeout SECONDS   wait this long for a reply; 0 waits without limit\n"
    "                      (default 5, and no limit for start)\n"
    "  -h, --help          show help; `sxreportctl COMMAND --help` for one command\n"
    "  --version           print the version\n"
    "\n"
    "Environment: SXREPORTING_SOCKET, SXREPORTING_STATE_DIR, SXREPORTING_CONFIG_DIR,\n"
    "SXREPORTING_RUNTIME_DIR and SXREPORTING_PREFERENCES_DIR stand in for the options of the\n"
    "same name.\n"
    "\n"
    "Exit status:\n"
    "  0  done: the service replied true or answered, or the local command did its job\n"
    "  1  the service replied false, or did not deliver the message (send)\n"
    "  2  usage error: the command line is wrong\n"
    "  3  the service cannot be reached, or closed the connection before replying\n"
    "  4  no reply within the time-out\n"
    "  5  defaults read KEY: the key is not set\n"
    "  6  the service refused the request as malformed, or its reply made no sense\n"
    "  7  a local store or file could not be read or written\n"
    "A chain stops at the first command that does not end with 0 and exits with its status.\n";

constexpr std::string_view kCommandOptionsHelp =
    "Options: --socket PATH, --state-dir DIR, --config-dir DIR, --runtime-dir DIR,\n"
    "--preferences-dir DIR, --json, --timeout SECONDS (0: no limit); see sxreportctl --help\n"
    "(also for the exit statuses).\n";

}  // namespace

std::string SXCtlHelp(const std::string& command) {
  if (const CommandDefinition* definition = findDefinition(command)) {
    std::string summary(definition->summary);
    summary[0] = static_cast<char>(std::toupper(static_cast<unsigned char>(summary[0])));
    return "usage: sxreportctl [options] " + std::string(definition->usage) + "\n\n" + summary +
           ".\n" + std::string(definition->details) + "\n\n" + std::string(kCommandOptionsHelp);
  }
  std::string text =
      "Usage: sxreportctl [options] COMMAND [ARGS]\n\n"
      "Talks to the reporting service and reads its local stores.\n"
      "Commands joined by `then` run in order on one connection, stopping at the first that\n"
      "fails. A session lives as long as the connection that created it, so create and start\n"
      "it in one run: sxreportctl create 42 then set-type telephony 42 then start 42\n"
      "\nCommands:\n";
  for (const auto& definition : commandDefinitions()) {
    std::string usage(definition.name == "send"       ? "send ... PAYLOAD_JSON"
                      : definition.name == "defaults" ? "defaults read|write|delete ..."
                                                      : definition.usage);
    usage.resize(std::max<size_t>(usage.size() + 2, 34), ' ');
    text += "  " + usage + std::string(definition.summary) + "\n";
  }
  return text + "\n" + std::string(kOptionsHelp);
}
