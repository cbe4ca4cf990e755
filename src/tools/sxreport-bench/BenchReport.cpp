#include "BenchReport.h"

#include <algorithm>
#include <cmath>
#include <functional>

#include "common/SXFormat.h"

namespace {

double perSecond(uint64_t count, double seconds) { return seconds > 0 ? count / seconds : 0; }

double micros(uint64_t nanoseconds) { return std::round(nanoseconds / 100.0) / 10.0; }

// Rounded so that the JSON stays readable: four significant digits are plenty for a benchmark.
double rounded(double value) {
  if (value == 0 || !std::isfinite(value)) return value;
  double scale = std::pow(10.0, 3 - static_cast<int>(std::floor(std::log10(std::fabs(value)))));
  return std::round(value * scale) / scale;
}

template <typename T>
SXValue orNull(const std::optional<T>& value) {
  return value ? SXValue(*value) : SXValue();
}

std::optional<double> cpuPerMillion(const TargetFigures& figures) {
  if (!figures.cpuSeconds || figures.messages == 0) return std::nullopt;
  return rounded(*figures.cpuSeconds * 1e6 / static_cast<double>(figures.messages));
}

std::optional<double> rssGrowthPercent(const TargetFigures& figures) {
  if (figures.rssSamples.size() < 2 || figures.rssSamples.front().second <= 0) return std::nullopt;
  double first = static_cast<double>(figures.rssSamples.front().second);
  return rounded((static_cast<double>(figures.rssSamples.back().second) - first) * 100 / first);
}

SXValue rowsJson(const TargetFigures& figures) {
  if (!figures.rowsCounted) return nullptr;
  auto store = [](int64_t expected, int64_t found) {
    return SXValue{{"expected", expected},
                   {"found", found},
                   {"missing", expected > found ? expected - found : 0}};
  };
  return {
      {"tallyvane", store(figures.expectedRows.tallyvane, figures.foundRows.tallyvane)},
      {"fernreporting", store(figures.expectedRows.fernReporting, figures.foundRows.fernReporting)},
      {"drainSeconds", rounded(figures.drainSeconds)}};
}

SXValue idleJson(const TargetFigures& figures) {
  SXValue json = {{"target", figures.target},
                  {"sessions", figures.sessions},
                  {"idleRssKiB", orNull(figures.idleRssKiB)},
                  {"rssWithSessionsKiB", orNull(figures.rssWithSessionsKiB)},
                  {"rssAfterCloseKiB", orNull(figures.rssAfterCloseKiB)},
                  {"peakRssKiB", orNull(figures.peakRssKiB)},
                  {"addedKiB", nullptr},
                  {"addedKiBPerSession", nullptr},
                  {"errors", figures.errors}};
  if (figures.idleRssKiB && figures.rssWithSessionsKiB) {
    long added = *figures.rssWithSessionsKiB - *figures.idleRssKiB;
    json["addedKiB"] = added;
    if (figures.sessions > 0)
      json["addedKiBPerSession"] = rounded(double(added) / figures.sessions);
  }
  return json;
}

// The abuse scenario's targets: what a daemon that defends itself keeps to under every attack.
constexpr long kAbusePeakRssKiB = 128 * 1024;
constexpr double kAbuseValidP99Millis = 50;
constexpr uint64_t kAbuseLogBytes = 1'000'000;

struct AbuseTarget {
  const char* key;  // in the JSON
  const char* name;
  std::string goal;
  SXValue limit;             // the goal as a number, in the unit of the JSON figure it judges
  std::string measured;      // as text
  std::optional<bool> pass;  // empty: not measured
};

double millis(uint64_t nanoseconds) { return static_cast<double>(nanoseconds) / 1e6; }

std::vector<AbuseTarget> abuseTargets(const TargetFigures& figures) {
  const AbuseFigures& abuse = *figures.abuse;
  std::vector<AbuseTarget> targets;
  AbuseTarget rss{
      "peakRss",        "daemon peak RSS", SXFormat("<= %li MiB", kAbusePeakRssKiB / 1024),
      kAbusePeakRssKiB, "not measured",    {}};
  if (figures.peakRssKiB) {
    rss.measured = SXFormat("%.1f MiB", static_cast<double>(*figures.peakRssKiB) / 1024.0);
    rss.pass = *figures.peakRssKiB <= kAbusePeakRssKiB;
  }
  targets.push_back(rss);
  double p99 = millis(abuse.probes.percentileNanoseconds(0.99));
  targets.push_back({"validP99", "reporterID:valid: p99",
                     SXFormat("< %.0f ms", kAbuseValidP99Millis), kAbuseValidP99Millis * 1000,
                     abuse.probes.count() ? SXFormat("%.2f ms", p99) : std::string("no reply"),
                     abuse.probes.count() > 0 && p99 < kAbuseValidP99Millis});
  AbuseTarget log{"log",
                  "daemon log",
                  SXFormat("< %.0f MB", kAbuseLogBytes / 1e6),
                  kAbuseLogBytes,
                  "not measured (not spawned)",
                  {}};
  if (abuse.logBytes) {
    log.measured = SXFormat("%.2f MB", static_cast<double>(*abuse.logBytes) / 1e6);
    log.pass = *abuse.logBytes < kAbuseLogBytes;
  }
  targets.push_back(log);
  bool answering = abuse.alive && abuse.finalRoundTripNanoseconds.has_value();
  targets.push_back({"aliveAndAnswering", "alive and answering at the end", "", true,
                     answering
                         ? SXFormat("yes, in %.2f ms", millis(*abuse.finalRoundTripNanoseconds))
                         : "no: " + abuse.finalRoundTripError,
                     answering});
  return targets;
}

bool abusePasses(const std::vector<AbuseTarget>& targets) {
  return std::all_of(targets.begin(), targets.end(),
                     [](const AbuseTarget& target) { return target.pass.value_or(true); });
}

SXValue latencyJson(const LatencyHistogram& latency) {
  return {{"p50", micros(latency.percentileNanoseconds(0.50))},
          {"p99", micros(latency.percentileNanoseconds(0.99))},
          {"max", micros(latency.maxNanoseconds())}};
}

SXValue closeDelaysJson(std::vector<double> delays) {
  if (delays.empty()) return nullptr;
  std::sort(delays.begin(), delays.end());
  return {{"min", rounded(delays.front())},
          {"median", rounded(delays[delays.size() / 2])},
          {"max", rounded(delays.back())}};
}

SXValue attacksJson(const AttackCounters& attacks) {
  return {{"connections", attacks.connections},
          {"connectFailures", attacks.connectFailures},
          {"requests", attacks.requests},
          {"bytesWritten", attacks.bytesWritten},
          {"replies", attacks.replies},
          {"errorReplies", attacks.errorReplies},
          {"refused", attacks.refused},
          {"closedByDaemon", attacks.closedByDaemon},
          {"unanswered", attacks.unanswered},
          {"partialConnections", attacks.partialConnections},
          {"partialPrefixes", attacks.partialPrefixes},
          {"partialPrefixBytes", attacks.partialPrefixBytes},
          {"partialFrameBytes", attacks.partialFrameBytes},
          {"closeDelaySeconds", closeDelaysJson(attacks.closeDelays)},
          {"firstError", attacks.firstError.empty() ? SXValue() : SXValue(attacks.firstError)}};
}

SXValue abuseJson(const TargetFigures& figures) {
  if (!figures.abuse) return {{"target", figures.target}, {"errors", figures.errors}};
  const AbuseFigures& abuse = *figures.abuse;
  SXValue phases = SXValue::array();
  for (const auto& phase : abuse.phases) {
    phases.push_back({{"name", phase.name},
                      {"seconds", rounded(phase.seconds)},
                      {"probes", phase.probes.count()},
                      {"unansweredProbes", phase.unansweredProbes},
                      {"latencyMicros", latencyJson(phase.probes)},
                      {"maxRssKiB", orNull(phase.maxRssKiB)},
                      {"endRssKiB", orNull(phase.endRssKiB)},
                      {"braked", phase.braked},
                      {"attacks", attacksJson(phase.attacks)}});
  }
  auto targets = abuseTargets(figures);
  SXValue targetsJson = SXValue::object();
  for (const auto& target : targets) {
    targetsJson[target.key] = {{"goal", target.goal},
                               {"limit", target.limit},
                               {"measured", target.measured},
                               {"pass", target.pass ? SXValue(*target.pass) : SXValue()}};
  }
  return {{"target", figures.target},
          {"attackSeconds", abuse.attackSeconds},
          {"partialConnections", abuse.partialConnections},
          {"partialFrameTimeoutMs", abuse.partialFrameTimeoutMs},
          {"rssBrakeKiB", abuse.rssBrakeKiB},
          {"phases", phases},
          {"probes", abuse.probes.count()},
          {"unansweredProbes", abuse.unansweredProbes},
          {"proberReconnects", abuse.proberReconnects},
          {"latencyMicros", latencyJson(abuse.probes)},
          {"peakRssKiB", orNull(figures.peakRssKiB)},
          {"rssKiB", orNull(figures.rssKiB)},
          {"logBytes", orNull(abuse.logBytes)},
          {"alive", abuse.alive},
          {"finalRoundTripMicros", abuse.finalRoundTripNanoseconds
                                       ? SXValue(micros(*abuse.finalRoundTripNanoseconds))
                                       : SXValue()},
          {"targets", targetsJson},
          {"pass", abusePasses(targets)},
          {"notes", abuse.notes},
          {"errors", figures.errors}};
}

SXValue figuresJson(const TargetFigures& figures) {
  SXValue samples = SXValue::array();
  for (const auto& [messages, rss] : figures.rssSamples) {
    samples.push_back({{"messages", messages}, {"rssKiB", rss}});
  }
  return {{"target", figures.target},
          {"messages", figures.messages},
          {"requests", figures.requests},
          {"seconds", rounded(figures.seconds)},
          {"messagesPerSecond", rounded(perSecond(figures.messages, figures.seconds))},
          {"requestsPerSecond", rounded(perSecond(figures.requests, figures.seconds))},
          {"latencyMicros",
           {{"p50", micros(figures.latency.percentileNanoseconds(0.50))},
            {"p99", micros(figures.latency.percentileNanoseconds(0.99))},
            {"max", micros(figures.latency.maxNanoseconds())}}},
          {"cpuSeconds", figures.cpuSeconds ? SXValue(rounded(*figures.cpuSeconds)) : SXValue()},
          {"cpuSecondsPerMillion", orNull(cpuPerMillion(figures))},
          {"peakRssKiB", orNull(figures.peakRssKiB)},
          {"rssKiB", orNull(figures.rssKiB)},
          {"rssSamples", samples},
          {"rssGrowthPercent", orNull(rssGrowthPercent(figures))},
          {"rows", rowsJson(figures)},
          {"rejected", figures.rejected},
          {"errors", figures.errors}};
}

SXValue ratioJson(const TargetFigures& daemon, const TargetFigures& baseline) {
  double daemonRate = perSecond(daemon.messages, daemon.seconds);
  double baselineRate = perSecond(baseline.messages, baseline.seconds);
  double daemonP99 = static_cast<double>(daemon.latency.percentileNanoseconds(0.99));
  double baselineP99 = static_cast<double>(baseline.latency.percentileNanoseconds(0.99));
  return {
      {"throughput", baselineRate > 0 ? SXValue(rounded(daemonRate / baselineRate)) : SXValue()},
      {"p99", baselineP99 > 0 ? SXValue(rounded(daemonP99 / baselineP99)) : SXValue()}};
}

std::string optionalText(const std::optional<double>& value, const char* format) {
  return value ? SXFormat(format, *value) : std::string("-");
}

std::string mib(const std::optional<long>& kib) {
  return kib ? SXFormat("%.1f MiB", static_cast<double>(*kib) / 1024.0) : std::string("-");
}

}  // namespace

SXValue ScenarioResultJson(const ScenarioResult& result, const BenchOptions& options) {
  bool idle = result.kind == ScenarioKind::kIdle;
  if (result.kind == ScenarioKind::kAbuse) {
    return {{"scenario", ScenarioName(result.kind)},
            {"daemon", abuseJson(result.daemon)},
            {"baseline", nullptr},
            {"ok", result.ok()}};
  }
  SXValue json = {{"scenario", ScenarioName(result.kind)},
                  {"clients", options.clients},
                  {"messagesPerClient", options.messages},
                  {"sessionsPerClient", options.sessions},
                  {"window", result.window},
                  {"stopEvery", options.stopEvery},
                  {"daemon", idle ? idleJson(result.daemon) : figuresJson(result.daemon)},
                  {"baseline", nullptr},
                  {"ratio", nullptr},
                  {"ok", result.ok()}};
  if (result.baseline) {
    json["baseline"] = figuresJson(*result.baseline);
    json["ratio"] = ratioJson(result.daemon, *result.baseline);
  }
  return json;
}

namespace {

// One line of the text table: a label, then the daemon's and the baseline's column.
std::string row(const std::string& label, const std::string& daemon,
                const std::string& baseline = "") {
  auto padLeft = [](const std::string& text, size_t width) {
    return text.size() < width ? std::string(width - text.size(), ' ') + text : text;
  };
  std::string line = "  " + label;
  line.resize(std::max<size_t>(line.size(), 28), ' ');
  line += padLeft(daemon, 18) + padLeft(baseline, 18);
  while (!line.empty() && line.back() == ' ') line.pop_back();
  return line + "\n";
}

std::string storeLine(const char* store, int64_t expected, int64_t found) {
  std::string line = SXFormat("%lli of %lli", found, expected);
  if (found < expected) line += SXFormat(" (%lli MISSING)", expected - found);
  return row(store, line);
}

std::string idleText(const TargetFigures& figures) {
  std::string text = row("idle RSS", mib(figures.idleRssKiB));
  text += row(SXFormat("RSS, %llu sessions", figures.sessions), mib(figures.rssWithSessionsKiB));
  if (figures.idleRssKiB && figures.rssWithSessionsKiB && figures.sessions > 0) {
    double per = double(*figures.rssWithSessionsKiB - *figures.idleRssKiB) * 1024 /
                 static_cast<double>(figures.sessions);
    text += row("per session", SXFormat("%.0f bytes", per));
  }
  text += row("RSS after close", mib(figures.rssAfterCloseKiB));
  return text;
}

std::string padLeft(const std::string& text, size_t width) {
  return text.size() < width ? std::string(width - text.size(), ' ') + text : text;
}

std::string padRight(std::string text, size_t width) {
  if (text.size() < width) text.resize(width, ' ');
  return text;
}

std::string count(uint64_t value) { return value ? SXFormat("%llu", value) : std::string("-"); }

std::string abuseText(const TargetFigures& figures) {
  if (!figures.abuse) return "";
  const AbuseFigures& abuse = *figures.abuse;
  // phase, then the prober's figures, the daemon's RSS, and what the attacks met.
  const std::vector<std::pair<const char*, size_t>> columns = {
      {"phase", 16}, {"s", 6},       {"probes", 8}, {"p50 ms", 9},   {"p99 ms", 9},
      {"max ms", 9}, {"RSS MiB", 9}, {"conns", 7},  {"requests", 9}, {"replies", 8},
      {"errors", 7}, {"refused", 8}, {"closed", 7}, {"no reply", 9}};
  auto line = [&](const std::vector<std::string>& cells) {
    std::string text = "  ";
    for (size_t i = 0; i < cells.size(); ++i) {
      text += i == 0 ? padRight(cells[i], columns[i].second) : padLeft(cells[i], columns[i].second);
    }
    while (!text.empty() && text.back() == ' ') text.pop_back();
    return text + "\n";
  };
  std::vector<std::string> header;
  for (const auto& [name, width] : columns) header.push_back(name);
  std::string text = line(header);
  for (const auto& phase : abuse.phases) {
    const AttackCounters& a = phase.attacks;
    auto ms = [&](uint64_t ns) {
      return phase.probes.count() ? SXFormat("%.2f", millis(ns)) : std::string("-");
    };
    std::string probes = SXFormat("%llu", phase.probes.count());
    if (phase.unansweredProbes) probes += SXFormat("+%llu", phase.unansweredProbes);
    std::string rss = phase.maxRssKiB
                          ? SXFormat("%.0f", static_cast<double>(*phase.maxRssKiB) / 1024.0)
                          : std::string("-");
    if (phase.braked) rss += "!";
    text +=
        line({phase.name, SXFormat("%.1f", phase.seconds), probes,
              ms(phase.probes.percentileNanoseconds(0.5)),
              ms(phase.probes.percentileNanoseconds(0.99)), ms(phase.probes.maxNanoseconds()), rss,
              count(a.connections), count(a.requests), count(a.replies), count(a.errorReplies),
              count(a.refused), count(a.closedByDaemon), count(a.unanswered)});
  }
  text +=
      "  (probes: answered+unanswered; RSS: highest sample, ! = attacks stopped at the brake;\n"
      "  requests, replies: each connection's setup included; errors: error replies; refused:\n"
      "  false or an error result; closed: connections the daemon ended; no reply: in flight\n"
      "  when the attack or its connection ended)\n";
  for (const auto& phase : abuse.phases) {
    const AttackCounters& a = phase.attacks;
    if (a.partialPrefixBytes > 0) {
      std::string closes = "none closed by the daemon";
      if (!a.closeDelays.empty()) {
        std::vector<double> delays = a.closeDelays;
        std::sort(delays.begin(), delays.end());
        closes = SXFormat("%llu closed by the daemon %.1f-%.1f s after their last byte",
                          static_cast<uint64_t>(delays.size()), delays.front(), delays.back());
      }
      text += SXFormat(
          "  %s: %llu connections left mid-request, %llu of them all but the last %llu bytes of a "
          "%llu-byte request; %s\n",
          phase.name, a.partialConnections, a.partialPrefixes,
          a.partialFrameBytes - a.partialPrefixBytes, a.partialFrameBytes, closes);
    }
    if (a.connectFailures) {
      text += SXFormat("  %s: %llu connection attempts failed\n", phase.name, a.connectFailures);
    }
    if (!a.firstError.empty()) {
      text += SXFormat("  %s: first refusal: %s\n", phase.name, a.firstError);
    }
  }
  text += SXFormat(
      "  reporterID:valid: every %lli ms: p50 %.2f ms, p99 %.2f ms, max %.2f ms (%llu answered, "
      "%llu unanswered, %llu reconnects)\n",
      static_cast<int64_t>(Prober::kInterval.count()),
      millis(abuse.probes.percentileNanoseconds(0.5)),
      millis(abuse.probes.percentileNanoseconds(0.99)), millis(abuse.probes.maxNanoseconds()),
      abuse.probes.count(), abuse.unansweredProbes, abuse.proberReconnects);
  if (abuse.logBytes) text += SXFormat("  daemon log: %llu bytes\n", *abuse.logBytes);
  for (const auto& note : abuse.notes) text += "  note: " + note + "\n";
  auto targets = abuseTargets(figures);
  size_t missed = 0;
  text += "  targets:\n";
  for (const auto& target : targets) {
    std::string verdict = !target.pass ? "-" : *target.pass ? "PASS" : "FAIL";
    if (target.pass && !*target.pass) ++missed;
    std::string label = target.goal.empty() ? target.name : target.name + (" " + target.goal);
    text += "    " + padRight(verdict, 6) + padRight(label, 34) + target.measured + "\n";
  }
  text += abusePasses(targets)
              ? std::string("  abuse: PASS\n")
              : SXFormat("  abuse: FAIL (%llu of %llu targets missed)\n",
                         static_cast<uint64_t>(missed), static_cast<uint64_t>(targets.size()));
  return text;
}

std::string figuresText(const TargetFigures& daemon, const TargetFigures* baseline) {
  auto both = [&](const std::string& label,
                  const std::function<std::string(const TargetFigures&)>& f) {
    return row(label, f(daemon), baseline ? f(*baseline) : "");
  };
  auto latency = [](double fraction) {
    return [fraction](const TargetFigures& f) {
      uint64_t ns =
          fraction > 1 ? f.latency.maxNanoseconds() : f.latency.percentileNanoseconds(fraction);
      return SXFormat("%.1f us", micros(ns));
    };
  };
  std::string text = row("", "daemon", baseline ? "baseline" : "");
  text += both("messages/s", [](const TargetFigures& f) {
    return SXFormat("%.0f", perSecond(f.messages, f.seconds));
  });
  text += both("latency p50", latency(0.5));
  text += both("latency p99", latency(0.99));
  text += both("latency max", latency(2));
  text += both("CPU s per M messages",
               [](const TargetFigures& f) { return optionalText(cpuPerMillion(f), "%.2f"); });
  text += row("daemon peak RSS", mib(daemon.peakRssKiB));
  if (auto growth = rssGrowthPercent(daemon)) {
    text += row("RSS first/last sample",
                SXFormat("%s / %s", mib(daemon.rssSamples.front().second),
                         mib(daemon.rssSamples.back().second)),
                SXFormat("%+.1f %%", *growth));
  }
  if (daemon.rowsCounted) {
    text += storeLine("rows in tallyvane.db", daemon.expectedRows.tallyvane,
                      daemon.foundRows.tallyvane);
    text += storeLine("rows in fernreporting.db", daemon.expectedRows.fernReporting,
                      daemon.foundRows.fernReporting);
    text += row("drained after", SXFormat("%.2f s", daemon.drainSeconds));
  }
  if (baseline && baseline->seconds > 0 && daemon.seconds > 0) {
    SXValue ratio = ratioJson(daemon, *baseline);
    text += row("daemon / baseline", "", "");
    text += row("  throughput", ratio["throughput"].is_null()
                                    ? "-"
                                    : SXFormat("%.3f", ratio["throughput"].get<double>()));
    text += row("  p99 latency",
                ratio["p99"].is_null() ? "-" : SXFormat("%.2f", ratio["p99"].get<double>()));
  }
  return text;
}

}  // namespace

std::string ScenarioResultText(const ScenarioResult& result, const BenchOptions& options) {
  if (result.kind == ScenarioKind::kAbuse) {
    std::string text = SXFormat(
        "abuse: %.1f s per attack, one after another, then all at once; %llu partial-frame "
        "connections\n",
        options.attackSeconds, options.partialConnections);
    text += abuseText(result.daemon);
    for (const auto& error : result.daemon.errors) {
      text += SXFormat("  ERROR (%s): %s\n", result.daemon.target, error);
    }
    return text;
  }
  std::string text = SXFormat(
      "%s: %llu clients x %llu messages, window %llu, %llu session(s) per client%s\n",
      ScenarioName(result.kind), options.clients, options.messages, result.window, options.sessions,
      options.stopEvery ? SXFormat(", stop every %llu", options.stopEvery) : std::string());
  if (result.kind == ScenarioKind::kIdle) {
    text += idleText(result.daemon);
  } else {
    text += figuresText(result.daemon, result.baseline ? &*result.baseline : nullptr);
  }
  for (const auto* figures : {&result.daemon, result.baseline ? &*result.baseline : nullptr}) {
    if (!figures) continue;
    for (const auto& error : figures->errors) {
      text += SXFormat("  ERROR (%s): %s\n", figures->target, error);
    }
  }
  return text;
}
