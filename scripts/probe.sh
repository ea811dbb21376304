#!/usr/bin/env bash
# The main command: builds the library and its tools (native, RelWithDebInfo)
# and runs a 10-second timing survey of this machine through the library.
# Results: the tables on the terminal, build/probe.json, build/probe.svg
# (latency histogram) and build/probe-trace.json (open in ui.perfetto.dev or
# chrome://tracing). Extra arguments go to quelta-probe (see --help), e.g.
#   bash scripts/probe.sh --duration 60
# Exit status: that of quelta-probe (0 ok, 1 usage, 2 library, 3 a wait
# returned early, 4 output not written), or the build's on a build failure.
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
bash "$root/scripts/install-deps.sh"
cmake -S "$root" -B "$root/build/native" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$root/build/native" -j "$(nproc)"
if [ "$(id -u)" -ne 0 ]; then
  echo "note: not root; the survey runs under SCHED_FIFO only if this user may (ulimit -r)"
fi
exec "$root/build/native/tools/quelta-probe" --duration 10 \
  --json "$root/build/probe.json" --svg "$root/build/probe.svg" \
  --trace "$root/build/probe-trace.json" "$@"
