#!/usr/bin/env bash
# Installs what building and testing need on Debian 12, as root, when missing.
set -euo pipefail
want=(cmake g++ make ninja-build pkg-config googletest libgtest-dev libbenchmark-dev
      g++-arm-linux-gnueabihf libc6-dev-armhf-cross qemu-user util-linux binutils
      g++-i686-linux-gnu libc6-dev-i386-cross libc6-i386
      nlohmann-json3-dev libcli11-dev dpkg-dev file lintian doxygen)
# (nlohmann-json and CLI11 are the tools' JSON and command-line libraries,
# dpkg-dev, file and lintian check the packages, doxygen builds the API
# reference; the library itself needs nothing but the C++ standard library.)
# The 32-bit x86 stage uses its own cross compiler and libc6-i386, never the
# host compiler's 32-bit add-on packages: on Debian 12 those remove the ARM
# cross compiler.
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
