#!/usr/bin/env bash
# Installs what a job needs on Debian 12, as root, when missing.
# Usage: install-deps.sh [--list] [probe|test]      (default: test)
#   probe   building libquelta and quelta-probe: the main job, scripts/probe.sh
#   test    the whole test suite, scripts/test.sh: probe's packages and the rest
#   --list  prints the job's packages, one a line, and installs nothing
set -euo pipefail
# The library needs nothing but the C++ standard library; the probe adds its
# JSON and command-line libraries (nlohmann-json, CLI11; header-only).
probe=(cmake g++ ninja-build nlohmann-json3-dev libcli11-dev)
# The test suite adds GoogleTest and Google Benchmark, the cross compilers of
# the 32-bit stages and the emulator that runs ARMv7 programs, dpkg-dev,
# file and lintian to check the packages, and doxygen for the API reference.
# The 32-bit x86 stage uses its own cross compiler and libc6-i386, never the
# host compiler's 32-bit add-on packages: on Debian 12 those remove the ARM
# cross compiler.
test=(make pkg-config googletest libgtest-dev libbenchmark-dev
      g++-arm-linux-gnueabihf libc6-dev-armhf-cross qemu-user util-linux binutils
      g++-i686-linux-gnu libc6-dev-i386-cross libc6-i386
      dpkg-dev file lintian doxygen relacy-dev)

list=0
[ "${1:-}" = --list ] && { list=1; shift; }
case ${1:-test} in
  probe) want=("${probe[@]}") ;;
  test)  want=("${probe[@]}" "${test[@]}") ;;
  *) echo "usage: $0 [--list] [probe|test]" >&2; exit 2 ;;
esac
if ((list)); then printf '%s\n' "${want[@]}"; exit 0; fi

missing=()
for p in "${want[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if ((${#missing[@]})); then
  echo "installing: ${missing[*]}"
  if [ "$(id -u)" -ne 0 ]; then echo "need root to install packages" >&2; exit 1; fi
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq "${missing[@]}"
fi
