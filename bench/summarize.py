#!/usr/bin/env python3
"""Medians of the sxreport-bench JSON files in a directory, as markdown tables.

    bench/summarize.py DIR

Files are named <configuration>.<run>.json (as bench/run-all.sh writes them); each metric's
median is taken over the runs of one configuration. Exit status 1 when any run failed.
"""
import json
import pathlib
import statistics
import sys


def load(directory):
    configs = {}
    failed = []
    for path in sorted(pathlib.Path(directory).glob("*.json")):
        name = path.name.rsplit(".", 2)[0]
        try:
            data = json.loads(path.read_text())
        except ValueError:
            failed.append(f"{path.name}: no JSON (the run crashed?)")
            continue
        if not data.get("ok"):
            failed.append(f"{path.name}: " + "; ".join(
                e.splitlines()[0] for r in data["results"]
                for t in ("daemon", "baseline") if r.get(t) for e in r[t]["errors"]))
        configs.setdefault(name, []).extend(data["results"])
    return configs, failed


def median(results, *path):
    values = []
    for r in results:
        v = r
        for key in path:
            v = v.get(key) if isinstance(v, dict) else None
        if isinstance(v, (int, float)):
            values.append(v)
    return statistics.median(values) if values else None


def fmt(value, pattern):
    return "-" if value is None else format(value, pattern)


def missing(results):
    worst = 0
    for r in results:
        rows = (r.get("daemon") or {}).get("rows") or {}
        for store in ("tallyvane", "fernreporting"):
            worst = max(worst, (rows.get(store) or {}).get("missing", 0))
    return worst


def order(name):
    scenario, clients, sessions = (name.split("-") + ["", "", ""])[:3]
    rank = ["addressed", "broadcast", "standalone", "lifecycle", "rpc", "idle", "nogrowth"]
    return (rank.index(scenario) if scenario in rank else 99,
            int(sessions[1:] or 0), int(clients[1:] or 0))


def main():
    configs, failed = load(sys.argv[1])
    runs = max((len(v) for v in configs.values()), default=0)
    print(f"Medians of {runs} run(s) each.\n")
    print("| scenario | clients | sessions/client | msgs/s | baseline msgs/s | ratio | "
          "p50 µs | p99 µs | baseline p99 µs | p99 ratio | CPU s per M msgs | peak RSS MiB | "
          "missing rows |")
    print("|---|---:|---:|---:|---:|---:|---:|---:|---:|---:|---:|---:|---:|")
    idle, nogrowth = [], []
    for name in sorted(configs, key=order):
        results = configs[name]
        first = results[0]
        if first["scenario"] == "idle":
            idle.append((name, results))
            continue
        if name.startswith("nogrowth"):
            nogrowth.append((name, results))
        peak = median(results, "daemon", "peakRssKiB")
        print(f"| {first['scenario']} | {first['clients']} | {first['sessionsPerClient']} | "
              f"{fmt(median(results, 'daemon', 'messagesPerSecond'), ',.0f')} | "
              f"{fmt(median(results, 'baseline', 'messagesPerSecond'), ',.0f')} | "
              f"{fmt(median(results, 'ratio', 'throughput'), '.3f')} | "
              f"{fmt(median(results, 'daemon', 'latencyMicros', 'p50'), '.0f')} | "
              f"{fmt(median(results, 'daemon', 'latencyMicros', 'p99'), '.0f')} | "
              f"{fmt(median(results, 'baseline', 'latencyMicros', 'p99'), '.0f')} | "
              f"{fmt(median(results, 'ratio', 'p99'), '.1f')} | "
              f"{fmt(median(results, 'daemon', 'cpuSecondsPerMillion'), '.2f')} | "
              f"{fmt(peak / 1024 if peak else None, '.1f')} | {missing(results)} |")
    if idle:
        print("\n| idle | sessions | idle RSS MiB | RSS with sessions MiB | added KiB per session | "
              "RSS after close MiB |")
        print("|---|---:|---:|---:|---:|---:|")
        for name, results in idle:
            mib = lambda key: fmt((median(results, "daemon", key) or 0) / 1024, ".1f")
            print(f"| {name} | {results[0]['daemon']['sessions']} | {mib('idleRssKiB')} | "
                  f"{mib('rssWithSessionsKiB')} | "
                  f"{fmt(median(results, 'daemon', 'addedKiBPerSession'), '.2f')} | "
                  f"{mib('rssAfterCloseKiB')} |")
    for name, results in nogrowth:
        samples = results[0]["daemon"]["rssSamples"]
        print(f"\nNo-growth run {name}: RSS by messages replied: " + ", ".join(
            f"{s['messages']:,}: {s['rssKiB'] / 1024:.1f} MiB" for s in samples) +
            f" (growth first to last: {fmt(median(results, 'daemon', 'rssGrowthPercent'), '+.1f')} %)")
    if failed:
        print("\nRuns with errors:")
        for line in failed:
            print(f"- {line}")
    return 1 if failed else 0


if __name__ == "__main__":
    sys.exit(main())
