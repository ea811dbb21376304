#!/usr/bin/env bash
# The main command: builds the library and its tools (native, RelWithDebInfo)
# and runs a 10-second timing survey of this machine through the library.
# Results: the tables on the terminal, and in build/: probe.json (results),
# probe.svg (tail plot), probe-histogram.txt (one row per microsecond),
# probe-samples.csv (every sample) and probe-trace.json (open in
# ui.perfetto.dev or chrome://tracing). Extra arguments go to quelta-probe
# (see --help or man docs/quelta-probe.1) and, coming last, win, e.g.
#   bash scripts/probe.sh --duration 60
#   bash scripts/probe.sh --duration 0 --cpu 1     # until Ctrl-C
# Exit status: that of quelta-probe (0 ok, also without real-time privilege,
# 1 usage, 2 library, 3 a wait returned early, 4 output not written), or the build's when even the
# library and the probe alone do not build (a failing full build only warns).
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
bash "$root/scripts/install-deps.sh"
cmake -S "$root" -B "$root/build/native" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
if ! cmake --build "$root/build/native" -j "$(nproc)"; then
  # The survey needs only the library and the probe; do not let a broken
  # test or benchmark stand in its way, but say so.
  echo "warning: the full build failed (see above); building only libquelta and quelta-probe" >&2
  cmake --build "$root/build/native" -j "$(nproc)" --target quelta quelta-probe
fi
if [ "$(id -u)" -ne 0 ]; then
  echo "note: not root; the survey runs under SCHED_FIFO only if this user may (ulimit -r)"
fi
exec "$root/build/native/tools/quelta-probe" --duration 10 \
  --json "$root/build/probe.json" --svg "$root/build/probe.svg" \
  --histogram "$root/build/probe-histogram.txt" --csv "$root/build/probe-samples.csv" \
  --trace "$root/build/probe-trace.json" "$@"
