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
