#!/bin/sh
# Runs every benchmark scenario several times against freshly spawned daemons (each with the
# echo-server baseline) and prints the medians as a markdown table for docs/performance.md.
#
#   bench/run-all.sh [BUILD_DIR]          default BUILD_DIR: build
#
# Environment:
#   REPEAT=3             runs of each configuration; the table shows medians
#   TOTAL=80000          messages per configuration, shared among the clients (a broadcast
#                        reaches every client, so it sends TOTAL / clients^2 per client)
#   CLIENTS="1 4 16 64"  client counts of the scaling runs
#   SESSIONS="1 100 10000"  sessions per client of the session-count runs (4 clients)
#   WINDOW=32            requests in flight per client
#   SCENARIOS="addressed broadcast standalone lifecycle rpc"
#   LONG=0               1: also the no-growth run (10 million messages, stopped every 10,000)
#   OUT=bench/results/<date>  where the raw JSON of every run goes
# Exit status 1 when any run reported an error (a missing row, a rejected request).
set -eu

BUILD=${1:-build}
BENCH=${BENCH:-$BUILD/sxreport-bench}
REPEAT=${REPEAT:-3}
TOTAL=${TOTAL:-80000}
CLIENTS=${CLIENTS:-"1 4 16 64"}
SESSIONS=${SESSIONS:-"1 100 10000"}
WINDOW=${WINDOW:-32}
SCENARIOS=${SCENARIOS:-"addressed broadcast standalone lifecycle rpc"}
LONG=${LONG:-0}
OUT=${OUT:-bench/results/$(date +%Y%m%d-%H%M%S)}

if [ ! -x "$BENCH" ]; then
  echo "run-all.sh: $BENCH not found; build it first (cmake --build $BUILD --target sxreport-bench sxreportingd)" >&2
  exit 2
fi
mkdir -p "$OUT"

# run NAME ARGS...: REPEAT runs of one configuration, each into $OUT/NAME.<i>.json
run() {
  name=$1
  shift
  i=1
  while [ "$i" -le "$REPEAT" ]; do
    echo "run-all.sh: $name ($i/$REPEAT): $*" >&2
    "$BENCH" --spawn --json --window "$WINDOW" "$@" >"$OUT/$name.$i.json" || true
    i=$((i + 1))
  done
}

per_client() {  # per_client TOTAL DIVISOR: at least 10
  n=$(($1 / $2))
  [ "$n" -ge 10 ] || n=10
  echo "$n"
}

for scenario in $SCENARIOS; do
  for clients in $CLIENTS; do
    divisor=$clients
    [ "$scenario" = broadcast ] && divisor=$((clients * clients))
    run "$scenario-c$clients-s1" --baseline --scenario "$scenario" --clients "$clients" \
      --messages "$(per_client "$TOTAL" "$divisor")"
  done
done
for sessions in $SESSIONS; do
  run "addressed-c4-s$sessions" --baseline --scenario addressed --clients 4 --sessions "$sessions" \
    --messages "$(per_client "$TOTAL" 4)"
done
run "idle-c1-s10000" --scenario idle --clients 1 --sessions 10000
if [ "$LONG" = 1 ]; then
  run "nogrowth-c4" --scenario addressed --clients 4 --messages 2500000 --stop-every 10000 \
    --rss-samples 10 --reply-timeout 120 --drain-timeout 300
fi

python3 "$(dirname "$0")/summarize.py" "$OUT"
