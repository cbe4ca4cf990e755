// The figures of a benchmark run as JSON (for scripts) and as text (for people).
#pragma once

#include <optional>
#include <string>

#include "BenchRunner.h"
#include "sxreporting/types.h"

struct ScenarioResult {
  ScenarioKind kind;
  size_t window = 0;
  TargetFigures daemon;
  std::optional<TargetFigures> baseline;

  bool ok() const { return daemon.errors.empty() && (!baseline || baseline->errors.empty()); }
};

SXValue ScenarioResultJson(const ScenarioResult& result, const BenchOptions& options);
std::string ScenarioResultText(const ScenarioResult& result, const BenchOptions& options);
