#include "CtlArgs.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <chrono>
#include <cmath>
#include <ctime>
#include <iomanip>
#include <limits>
#include <map>
#include <sstream>

#include "SXVersion.h"
#include "common/SXCommandLine.h"
#include "common/SXServiceTypes.h"

namespace {

constexpr const char* kDescription =
    "Talks to the reporting service and reads its local stores; `sxreportctl COMMAND --help`\n"
    "tells more of each command.\n"
    "Commands joined by `then` run in order on one connection, stopping at the first that\n"
    "fails. A session lives as long as the connection that created it, so create and start\n"
    "it in one run: sxreportctl create 42 then set-type telephony 42 then start 42";

constexpr const char* kFooter =
    "Exit status:\n"
    "  0  done: the service replied true or answered, or the local command did its job\n"
    "  1  the service replied false, or did not deliver the message (send)\n"
    "  2  usage error: the command line is wrong\n"
    "  3  the service cannot be reached, or closed the connection before replying\n"
    "  4  no reply within the time-out\n"
    "  5  defaults read KEY: the key is not set\n"
    "  6  the service refused the request as malformed, or its reply made no sense\n"
    "  7  a local store or file could not be read or written\n"
    "A chain stops at the first command that does not end with 0 and exits with its status.\n"
    "\n"
    "Environment:\n"
    "  SXREPORTING_SOCKET, SXREPORTING_STATE_DIR, SXREPORTING_CONFIG_DIR, SXREPORTING_RUNTIME_DIR\n"
    "  and SXREPORTING_PREFERENCES_DIR stand in for the options of the same name.";

constexpr const char* kCommandFooter =
    "Global options: --socket PATH, --state-dir DIR, --config-dir DIR, --runtime-dir DIR,\n"
    "--preferences-dir DIR, --json, --timeout SECONDS (0: no limit); see sxreportctl --help\n"
    "(also for the exit statuses).";

// A usage error about `what`, for the callbacks CLI11 runs while it parses.
[[noreturn]] void bad(const std::string& what, const std::string& why) {
  throw CLI::ValidationError(what, why);
}

// A JSON object, or null where `orNull` (then nothing).
std::optional<SXValue> jsonObject(const std::string& what, const std::string& text, bool orNull) {
  SXValue value = SXValue::parse(text, nullptr, false);
  if (value.is_discarded()) bad(what, "not valid JSON: " + text);
  if (value.is_object()) return value;
  if (!orNull || !value.is_null())
    bad(what, orNull ? "not a JSON object or null" : "not a JSON object");
  return std::nullopt;
}

const CLI::Validator kReporterID =
    SXNumber<int64_t>(INT64_MIN, INT64_MAX, "a reporter ID (a signed 64-bit number)");

std::vector<int64_t> idList(const std::string& text) {
  std::vector<int64_t> ids;
  std::istringstream items(text);
  for (std::string item; std::getline(items, item, ',');) {
    if (std::string error = kReporterID(item); !error.empty()) bad("--ids", error);
    ids.push_back(std::stoll(item));
  }
  return ids;
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

SXValue typedValue(const std::string& text, bool isBool, bool isInt) {
  if (isBool) {
    std::string lower(text);
    std::transform(lower.begin(), lower.end(), lower.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    if (lower == "true" || lower == "yes" || lower == "1") return true;
    if (lower == "false" || lower == "no" || lower == "0") return false;
    bad("VALUE", "not a boolean: '" + text + "' (true, false, yes, no, 1 or 0)");
  }
  if (!isInt) return text;
  std::string number = text;
  if (std::string error = SXNumber<int64_t>(INT64_MIN, INT64_MAX, "an integer")(number);
      !error.empty()) {
    bad("VALUE", error);
  }
  return std::stoll(number);
}

// A flag that binds nothing; its count tells whether it was given.
CLI::Option* flag(CLI::App* c, const std::string& name, const std::string& help) {
  return c->add_flag(name, help);
}

// One command: `summary` in the overview and atop its help, `details` below its options.
CLI::App* command(CLI::App& parent, const char* name, const char* summary, const char* details) {
  CLI::App* c = parent.add_subcommand(name, summary);
  c->group("Commands");
  c->footer(std::string(details) + "\n\n" + kCommandFooter);
  return c;
}

void addGlobalOptions(CLI::App& app, SXCtlRequest& r) {
  app.add_option("--socket", r.socketPath,
                 "the service's socket\n"
                 "(default <runtime-dir>/com.vendra.audio.kitbench.reporting.service)")
      ->type_name("PATH");
  app.add_option("--state-dir", r.stateDir,
                 "where tallyvane.db is (default ./var/lib;\nas root /var/lib/sxreportingd)")
      ->type_name("DIR");
  app.add_option("--config-dir", r.configDir,
                 "the service's configuration (default ./var/etc;\nas root /etc/sxreportingd)")
      ->type_name("DIR");
  app.add_option("--preferences-dir", r.preferencesDir,
                 "where the defaults domain is (default <config-dir>/preferences;\n"
                 "as root <state-dir>/preferences, where the service keeps it)")
      ->type_name("DIR");
  app.add_option("--runtime-dir", r.runtimeDir,
                 "where the socket and notify/ are (default ./var/run;\nas root /run/sxreportingd)")
      ->type_name("DIR");
  app.add_flag("--json", r.json, "print the reply as JSON");
  app.add_option("--timeout", r.timeoutSeconds,
                 "wait this long for a reply; 0 waits without limit\n"
                 "(default 5, and no limit for start)")
      ->type_name("SECONDS")
      ->transform(SXNumber<double>(0, std::numeric_limits<double>::max(), "a time-out in seconds"));
}

void addSessionCommands(CLI::App& app, SXCtlRequest& r) {
  auto id = [&r](CLI::App* c) {
    c->add_option("ID", r.reporterID, "the session's reporter ID")
        ->required()
        ->transform(kReporterID);
  };
  id(command(app, "create", "create a reporting session",
             "Creates a session with reporter ID ID (a signed 64-bit number of your choosing).\n"
             "Replies true. The session belongs to this connection and goes when it closes, so\n"
             "chain the commands that need it: create 42 then start 42."));
  CLI::App* setType =
      command(app, "set-type", "set a session's service type",
              "TYPE is a number (0-65535) or a name: generic, vokira, telephony, haptics, alarms,\n"
              "standalone, soundautoconfig, longformaudio, nonlongformaudio, audiodeviceusage,\n"
              "alerts, test, unknown (65535), or servicetype<N>. Replies true; sends no reply "
              "for ID 0.");
  setType->add_option("TYPE", r.serviceType, "a number or a name")
      ->required()
      ->transform(CLI::Validator(
          [](std::string& text) -> std::string {
            auto type = SXServiceTypeFromText(text);
            if (!type) {
              return "not a service type: '" + text +
                     "' (0-65535 or a name: " + SXServiceTypeNameList() + ")";
            }
            text = std::to_string(*type);
            return "";
          },
          ""));
  id(setType);
  id(command(app, "get-type", "print a session's service type",
             "Prints the service type and its name, e.g. \"2 (telephony)\";\n"
             "65535 (unknown) when there is no such session."));
  CLI::App* configure = command(app, "configure", "set a session's configuration", "Replies true.");
  configure
      ->add_option_function<std::string>(
          "--config",
          [&r](const std::string& text) { r.configuration = jsonObject("--config", text, true); },
          "a JSON object, or null to send no configuration")
      ->type_name("JSON")
      ->required();
  id(configure);
  id(command(
      app, "start", "start a session and wait until it stops",
      "The service replies when the session stops (true), or at once with false when there\n"
      "is no such session; it never replies for ID 0 or a session already started. So start\n"
      "waits without limit unless --timeout is given: run `sxreportctl stop ID` elsewhere."));

  CLI::App* send =
      command(app, "send", "send a message to sessions",
              "Needs either --ids or --broadcast. Prints \"delivered\", or the error the service\n"
              "replied with when reporting is disabled.");
  send->add_option("--category", r.category, "decimal or 0x-hexadecimal (default 3, Playback)")
      ->type_name("N")
      ->transform(SXNumber<uint32_t>(0, UINT32_MAX, "a category (0 to 4294967295)", 0));
  send->add_option("--type", r.messageType, "the message type, likewise (default 1, Start)")
      ->type_name("N")
      ->transform(SXNumber<uint16_t>(0, UINT16_MAX, "a message type (0 to 65535)", 0));
  send->add_option_function<std::string>(
          "--ids", [&r](const std::string& text) { r.reporterIDs = idList(text); },
          "the sessions to send to (--ids '' sends to none)")
      ->type_name("ID,ID,...");
  flag(send, "--broadcast", "send to every started session");
  send->add_option_function<std::string>(
          "PAYLOAD_JSON",
          [&r](const std::string& text) { r.payload = *jsonObject("PAYLOAD_JSON", text, false); },
          "a JSON object")
      ->required();
  send->callback([send] {
    if (send->count("--ids") == send->count("--broadcast")) {
      throw CLI::ValidationError(
          "send needs either --ids ID,ID,... (--ids '' for none) or --broadcast");
    }
  });

  id(command(app, "stop", "stop a session",
             "Replies true (and the session's `start` returns); no reply for ID 0."));
  id(command(app, "destroy", "destroy a session", "Replies true; sends no reply for ID 0."));
  id(command(app, "valid", "tell whether a session exists",
             "Prints the reporter ID and service type of the session, or\n"
             "\"reporterID 0, serviceType 65535 (unknown)\" when there is none."));
  command(app, "list", "list every session's reporter ID",
          "One reporter ID a line, client by client; \"(none)\" when there are none.");
  command(app, "kill", "make the service exit",
          "The service exits with status 2 and never replies: kill ends with exit status 0 when\n"
          "the service closes the connection, or 4 when it is still there after the time-out.");
  command(app, "status", "show clients, sessions, the enable switch and the defaults",
          "Read-only: changes nothing in the service.")
      ->add_flag("--metrics", r.metrics,
                 "print the service's counters and gauges in the Prometheus\n"
                 "text format (version 0.0.4) instead, for a metrics\n"
                 "collector; --json does not apply to it");
}

void addLocalCommands(CLI::App& app, SXCtlRequest& r) {
  CLI::App* events =
      command(app, "events", "print the stored analytics events",
              "Reads <state-dir>/tallyvane.db: id, time, name and payload of each event, oldest\n"
              "first.");
  events
      ->add_option("--name", r.eventName,
                   "keep one event name, or the names a shell-style pattern\n"
                   "matches (com.vendra.*)")
      ->type_name("NAME");
  events
      ->add_option_function<std::string>(
          "--since",
          [&r](const std::string& text) {
            const double now =
                std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch())
                    .count();
            std::string error;
            if (!SXCtlParseSince(text, now, r.since.emplace(), error)) bad("--since", error);
          },
          "keep the events from WHEN on, a UTC time\n"
          "(2026-11-25T06:30:00Z, 2026-11-25T06:30, 2026-11-25)\n"
          "or an age (90s, 10m, 2h, 3d)")
      ->type_name("WHEN");
  events->add_option("--limit", r.limit, "keep the newest N of those")
      ->type_name("N")
      ->transform(SXNumber<int64_t>(0, INT64_MAX, "a count (0 or more)"));
  command(app, "sizes", "show how much each local store holds",
          "Reads tallyvane.db, joulebook.db and fernreporting.db in <state-dir>: rows, the oldest\n"
          "row's time, the bytes their pages hold (what the retention caps) and the bytes of\n"
          "the files and their write-ahead logs on disk.");

  CLI::App* defaults =
      command(app, "defaults", "read and change the preferences",
              "The domain com.vendra.sonex, kept in <preferences-dir>/com.vendra.sonex.json.");
  defaults->require_subcommand(1);
  command(*defaults, "read", "print the whole domain, or one key",
          "Exit status 5 when the key is not set.")
      ->add_option("KEY", r.key, "the key");
  CLI::App* write = command(*defaults, "write", "store a value",
                            "VALUE is stored as a string unless --bool or --int says otherwise.");
  CLI::Option* isBool = flag(write, "--bool", "VALUE is true, false, yes, no, 1 or 0");
  CLI::Option* isInt = flag(write, "--int", "VALUE is an integer")->excludes(isBool);
  flag(write, "--string", "VALUE is a string")->excludes(isBool)->excludes(isInt);
  write->add_option("KEY", r.key, "the key")->required();
  write
      ->add_option_function<std::string>(
          "VALUE", [&r](const std::string& text) { r.value = text; }, "the value")
      ->required();
  write->callback([&r, isBool, isInt] {
    r.value = typedValue(r.value.get<std::string>(), isBool->count() > 0, isInt->count() > 0);
  });
  command(*defaults, "delete", "remove a key", "Removes KEY from the domain.")
      ->add_option("KEY", r.key, "the key")
      ->required();

  command(app, "notify", "post a named notification",
          "Touches <runtime-dir>/notify/NAME, which wakes every process watching that name.")
      ->add_option("NAME", r.notificationName, "the notification's name")
      ->required()
      ->check([](const std::string& name) {
        const bool ok =
            !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos;
        return ok ? "" : "not a notification name: '" + name + "'";
      });
}

// Names the command a usage error is about, and says what CLI11 leaves vague: a missing or
// unknown command, and an option of a command written before it.
void reword(SXCommandLineEnd& end, const CLI::App& app, const std::vector<std::string>& args) {
  std::string command;  // "create", "defaults read"
  const CLI::App* last = &app;
  for (; !last->get_subcommands().empty(); last = last->get_subcommands()[0]) {
    command += (command.empty() ? "" : " ") + last->get_subcommands()[0]->get_name();
  }
  const std::string prefix = "sxreportctl: ";
  std::string why = end.text.substr(prefix.size(), end.text.size() - prefix.size() - 1);
  if (why.starts_with("unknown option ")) {
    const auto option = std::find(args.begin(), args.end(), why.substr(why.find('-')));
    const auto named = std::find(args.begin(), args.end(), command.substr(0, command.find(' ')));
    if (!command.empty() && option < named) {
      why += " (a command's own options follow it)";
      command.clear();
    }
  } else if (why == CLI::RequiredError::Subcommand(1).what()) {
    const auto extra = app.remaining(true);
    std::string names;
    for (const CLI::App* c : last->get_subcommands({})) {
      names += (names.empty() ? "" : ", ") + c->get_name();
    }
    why = !extra.empty()    ? "unknown command '" + extra[0] + "'"
          : command.empty() ? "no command given; see sxreportctl --help"
                            : "needs one of: " + names;
  }
  end.text = prefix + (command.empty() ? "" : command + ": ") + why + "\n";
}

// One command of a chain into `r`; what to print and exit with instead, if anything.
std::optional<SXCommandLineEnd> parseCommand(std::vector<std::string> args, SXCtlRequest& r) {
  CLI::App app(kDescription, "sxreportctl");
  SXSetUpCommandLine(app, kSXVersion);
  app.footer(kFooter);
  app.fallthrough();  // global options after the command too
  app.require_subcommand(1);
  addGlobalOptions(app, r);
  addSessionCommands(app, r);
  addLocalCommands(app, r);
  if (!args.empty() && args[0] == "help") {  // help [COMMAND]: COMMAND --help
    args.erase(args.begin());
    if (!args.empty() &&
        app.get_subcommands([&args](const CLI::App* c) { return c->get_name() == args[0]; })
            .empty()) {
      args.clear();
    }
    args.push_back("--help");
  }
  auto end = SXParseCommandLine(app, args);
  if (end && end->status != 0) reword(*end, app, args);
  if (end) return end;
  const CLI::App* chosen = app.get_subcommands()[0];
  r.command = chosen->get_name();
  if (r.command == "defaults") r.defaultsAction = chosen->get_subcommands()[0]->get_name();
  return std::nullopt;
}

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

SXCtlCommandLine SXCtlParseChain(const std::vector<std::string>& args) {
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
  SXCtlCommandLine line;
  const bool gap = std::any_of(segments.begin(), segments.end(),
                               [](const auto& segment) { return segment.empty(); });
  if (segments.size() > 1 && gap) {
    line.exitStatus = kSXCtlUsage;
    line.text = "sxreportctl: 'then' must stand between two commands\n";
    return line;
  }
  SXCtlRequest globals;
  for (const auto& segment : segments) {
    if (auto end = parseCommand(segment, line.requests.emplace_back())) {
      line.requests.clear();
      line.exitStatus = end->status;
      line.text = end->text;
      return line;
    }
    applyGlobals(line.requests.back(), globals);
  }
  for (auto& request : line.requests) applyGlobals(globals, request);
  return line;
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
