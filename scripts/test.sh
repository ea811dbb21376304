#!/usr/bin/env bash
# Runs the whole test suite: native, i686 (32-bit x86, run natively), ARMv7
# under qemu-arm, and the sanitizer builds. Every stage but the sanitizer
# ones builds the library, quelta-probe and the example, and (with the
# packaging label) the Debian packages for its architecture.
# Usage: scripts/test.sh [native|i686|armv7|asan|tsan|all]... (default all)
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
bash "$root/scripts/install-deps.sh" test
stages=("$@"); [ ${#stages[@]} -eq 0 ] && stages=(all)
[ "${stages[0]}" = all ] && stages=(native i686 armv7 asan tsan)

build() {  # name, extra cmake args...
  local name=$1; shift
  # Tests and tools are asked for by name: scripts/probe.sh may have made
  # build/native without tests, and a tree of an older run keeps its cache.
  cmake -S "$root" -B "$root/build/$name" -G Ninja \
    -DQUELTA_BUILD_TESTS=ON -DQUELTA_BUILD_TOOLS=ON "$@" >/dev/null
  cmake --build "$root/build/$name" -j "$(nproc)"
}
run() {  # name, extra ctest args...
  local name=$1; shift
  echo "=== tests: $name ==="
  # Not by default: the minutes-long soak, and the tests that change the
  # machine's own clock (ctest -L hostclock runs those on purpose).
  ctest --test-dir "$root/build/$name" --output-on-failure -LE 'long|hostclock' "$@"
}
cross() {  # name, toolchain, extra ctest args...: the benchmarks skip
  # themselves without a Google Benchmark for the target
  local name=$1 toolchain=$2; shift 2
  build "$name" -DCMAKE_TOOLCHAIN_FILE="$root/cmake/$toolchain.cmake" \
    -DCMAKE_BUILD_TYPE=RelWithDebInfo -DQUELTA_BUILD_BENCH=ON
  run "$name" "$@"
}

stage() {
  case $1 in
    native) build native -DCMAKE_BUILD_TYPE=RelWithDebInfo -DQUELTA_BUILD_BENCH=ON; run native ;;
    i686)   cross i686 i686-linux-gnu ;;
    armv7)  cross armv7 arm-linux-gnueabihf ;;
    asan)   build asan -DCMAKE_BUILD_TYPE=Debug -DQUELTA_SANITIZE=address,undefined -DQUELTA_BUILD_BENCH=OFF
            ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1 run asan ;;
    tsan)   build tsan -DCMAKE_BUILD_TYPE=RelWithDebInfo -DQUELTA_SANITIZE=thread -DQUELTA_BUILD_BENCH=OFF
            TSAN_OPTIONS="halt_on_error=1 second_deadlock_stack=1" run tsan ;;
  esac
}
for s in "${stages[@]}"; do
  case $s in native|i686|armv7|asan|tsan) ;; *) echo "unknown stage: $s" >&2; exit 2 ;; esac
done

# Every stage runs, also after one has failed, so that one run shows them
# all; the status is 1 when any failed.
times=() failed=()
for s in "${stages[@]}"; do
  start=$SECONDS
  set +e; (set -e; stage "$s"); rc=$?; set -e
  [ "$rc" -eq 0 ] || failed+=("$s")
  times+=("$s=$((SECONDS - start))")
done
echo "stage times (s): ${times[*]}"
if ((${#failed[@]})); then echo "failed stages: ${failed[*]}"; exit 1; fi
