#!/usr/bin/env bash
# The main command: builds the library and quelta-probe (native,
# RelWithDebInfo; no tests, no benchmarks) and runs a 10-second timing survey
# of this machine through the library. It installs only what those two need
# (scripts/install-deps.sh probe); scripts/test.sh brings the rest.
# Results: the tables on the terminal, and in build/: probe.json (results),
# probe.svg (tail plot), probe-histogram.txt (one row per microsecond),
# probe-samples.csv (every sample) and probe-trace.json (open in
# ui.perfetto.dev or chrome://tracing). Extra arguments go to quelta-probe
# (see --help or man docs/quelta-probe.1) and, coming last, win, e.g.
#   bash scripts/probe.sh --duration 60
#   bash scripts/probe.sh --duration 0 --cpu 1     # until Ctrl-C
# Exit status: that of quelta-probe (0 ok, also without real-time privilege,
# 1 usage, 2 library, 3 a wait returned early, 4 output not written), or the
# build's when the library or the probe does not build.
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
build=$root/build/native
bash "$root/scripts/install-deps.sh" probe
# A new build tree is configured without tests and benchmarks, whose
# packages the survey does not need. An existing one keeps its settings:
# the test suite's native stage shares it, and only the two targets below
# are built either way.
opts=(-DCMAKE_BUILD_TYPE=RelWithDebInfo -DQUELTA_BUILD_TOOLS=ON)
[ -f "$build/CMakeCache.txt" ] || opts+=(-DQUELTA_BUILD_TESTS=OFF -DQUELTA_BUILD_BENCH=OFF)
cmake -S "$root" -B "$build" -G Ninja "${opts[@]}" >/dev/null
cmake --build "$build" -j "$(nproc)" --target quelta quelta-probe
if [ "$(id -u)" -ne 0 ]; then
  echo "note: not root; the survey runs under SCHED_FIFO only if this user may (ulimit -r)"
fi
exec "$build/tools/quelta-probe" --duration 10 \
  --json "$root/build/probe.json" --svg "$root/build/probe.svg" \
  --histogram "$root/build/probe-histogram.txt" --csv "$root/build/probe-samples.csv" \
  --trace "$root/build/probe-trace.json" "$@"
