#!/usr/bin/env bash
# Runs the whole test suite: native, i686 (32-bit x86, run natively), ARMv7
# under qemu-arm, and the sanitizer builds.
# Usage: scripts/test.sh [native|i686|armv7|asan|tsan|all]... (default all)
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
bash "$root/scripts/install-deps.sh"
stages=("$@"); [ ${#stages[@]} -eq 0 ] && stages=(all)
[ "${stages[0]}" = all ] && stages=(native i686 armv7 asan tsan)

build() {  # name, extra cmake args...
  local name=$1; shift
  cmake -S "$root" -B "$root/build/$name" -G Ninja "$@" >/dev/null
  cmake --build "$root/build/$name" -j "$(nproc)"
}
run() {  # name, extra ctest args...
  local name=$1; shift
  echo "=== tests: $name ==="
  # Not by default: the minutes-long soak, and the tests that change the
  # machine's own clock (ctest -L hostclock runs those on purpose).
  ctest --test-dir "$root/build/$name" --output-on-failure -LE 'long|hostclock' "$@"
}

for s in "${stages[@]}"; do
  case $s in
    native) build native -DCMAKE_BUILD_TYPE=RelWithDebInfo; run native ;;
    i686)   build i686 -DCMAKE_TOOLCHAIN_FILE="$root/cmake/i686-linux-gnu.cmake" \
                  -DCMAKE_BUILD_TYPE=RelWithDebInfo -DQUELTA_BUILD_BENCH=OFF -DQUELTA_BUILD_TOOLS=OFF
            run i686 ;;
    armv7)  build armv7 -DCMAKE_TOOLCHAIN_FILE="$root/cmake/arm-linux-gnueabihf.cmake" \
                  -DCMAKE_BUILD_TYPE=RelWithDebInfo -DQUELTA_BUILD_BENCH=OFF -DQUELTA_BUILD_TOOLS=OFF
            run armv7 ;;
    asan)   build asan -DCMAKE_BUILD_TYPE=Debug -DQUELTA_SANITIZE=address,undefined -DQUELTA_BUILD_BENCH=OFF
            ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1 run asan ;;
    tsan)   build tsan -DCMAKE_BUILD_TYPE=RelWithDebInfo -DQUELTA_SANITIZE=thread -DQUELTA_BUILD_BENCH=OFF
            TSAN_OPTIONS="halt_on_error=1 second_deadlock_stack=1" run tsan ;;
    *) echo "unknown stage: $s" >&2; exit 2 ;;
  esac
done
