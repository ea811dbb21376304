# Shared by the packaging tests. The test's CMake registration passes the
# build's facts in the environment: BUILD_DIR SOURCE_DIR LIBDIR INCLUDEDIR
# BINDIR MANDIR DATAROOTDIR VERSION DEB_VERSION DEB_ARCH HAS_PROBE CMAKE CPACK
# CXX GENERATOR MAKE_PROGRAM, and for programs built for the target CROSS
# (1 in a cross build), RUN_WITH (its emulator, if any) and EXE_LDFLAGS.
set -euo pipefail
# (With pipefail, never `cmd | grep -q`: grep quits at the first match and
# cmd, killed by SIGPIPE, fails the pipeline. Send grep's output to
# /dev/null instead.)

for v in BUILD_DIR SOURCE_DIR LIBDIR INCLUDEDIR BINDIR MANDIR DATAROOTDIR VERSION CMAKE CXX; do
  [ -n "${!v:-}" ] || { echo "packaging test: $v not set" >&2; exit 2; }
done
MAJOR=${VERSION%%.*}
HERE=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)

SCRATCH=$(mktemp -d "${TMPDIR:-/tmp}/quelta-packaging.XXXXXX")
trap 'rm -rf "$SCRATCH"' EXIT

failures=0
fail() { echo "FAIL: $*"; failures=$((failures + 1)); }
pass() { echo "ok: $*"; }
# expect_eq what actual expected
expect_eq() {
  if [ "$2" = "$3" ]; then pass "$1"; else fail "$1: got '$2', expected '$3'"; fi
}
# expect_same_list what actual-file expected-file (one entry a line)
expect_same_list() {
  if diff -u "$3" "$2" >"$SCRATCH/diff.txt"; then
    pass "$1"
  else
    fail "$1 (- expected, + found):"
    sed -n '3,$p' "$SCRATCH/diff.txt"
  fi
}
finish() {
  if [ "$failures" -eq 0 ]; then echo "all checks passed"; exit 0; fi
  echo "$failures check(s) failed"
  exit 1
}
# Runs a command quietly; on failure shows its output and stops the test.
run_quiet() {
  local log="$SCRATCH/command.log"
  if ! "$@" >"$log" 2>&1; then
    echo "FAIL: command failed: $*"
    cat "$log"
    exit 1
  fi
}

# cmake --install of the build tree into a scratch prefix.
install_into() { run_quiet "$CMAKE" --install "$BUILD_DIR" --prefix "$1"; }

# The installed files of the public headers, relative to an include dir.
public_headers() {
  (cd "$SOURCE_DIR/include" && find quelta -type f -name '*.h' | LC_ALL=C sort)
}

# Everything the development side installs, relative to the prefix, with
# the per-configuration targets file named quelta-targets-CONFIG.cmake.
expected_development_files() {
  public_headers | sed "s|^|$INCLUDEDIR/|"
  echo "$INCLUDEDIR/quelta/version.h"
  echo "$DATAROOTDIR/doc/libquelta-dev/examples/runtime_example.cpp"
  echo "$LIBDIR/libquelta.so"
  echo "$LIBDIR/pkgconfig/quelta.pc"
  echo "$LIBDIR/cmake/quelta/quelta-config.cmake"
  echo "$LIBDIR/cmake/quelta/quelta-config-version.cmake"
  echo "$LIBDIR/cmake/quelta/quelta-targets.cmake"
  echo "$LIBDIR/cmake/quelta/quelta-targets-CONFIG.cmake"
}
expected_runtime_files() {
  echo "$LIBDIR/libquelta.so.$MAJOR"
  echo "$LIBDIR/libquelta.so.$VERSION"
}
expected_tools_files() {
  echo "$BINDIR/quelta-probe"
  echo "$MANDIR/man1/quelta-probe.1.gz"
}
# The files Debian wants in every package: /usr/share/doc/<package> and the
# package's lintian overrides.
expected_debian_files() {
  echo "$DATAROOTDIR/doc/$1/changelog.Debian.gz"
  echo "$DATAROOTDIR/doc/$1/copyright"
  echo "$DATAROOTDIR/lintian/overrides/$1"
}

# cpack -G DEB of the build tree into a directory; sets the .deb names.
runtime_deb="libquelta6_${DEB_VERSION:-}_${DEB_ARCH:-}.deb"
dev_deb="libquelta-dev_${DEB_VERSION:-}_${DEB_ARCH:-}.deb"
tools_deb="quelta-tools_${DEB_VERSION:-}_${DEB_ARCH:-}.deb"
make_debs() {
  command -v dpkg-deb >/dev/null || { echo "FAIL: dpkg-deb is not installed"; exit 1; }
  [ -n "${CPACK:-}" ] && [ -n "${DEB_ARCH:-}" ] && [ -n "${DEB_VERSION:-}" ] \
    || { echo "packaging test: CPACK/DEB_ARCH/DEB_VERSION not set" >&2; exit 2; }
  run_quiet "$CPACK" -G DEB --config "$BUILD_DIR/CPackConfig.cmake" -B "$1"
}
normalise_config() { sed 's|/quelta-targets-[a-z]*\.cmake$|/quelta-targets-CONFIG.cmake|'; }

# Files and links below a directory, relative to it, sorted.
tree_of() {
  (cd "$1" && find . \( -type f -o -type l \) | sed 's|^\./||' | normalise_config | LC_ALL=C sort)
}

# SONAME of an ELF shared object.
soname_of() { readelf -d "$1" | sed -n 's/.*(SONAME).*\[\(.*\)\].*/\1/p'; }
