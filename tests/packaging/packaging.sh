# packaging.sh install_tree|debian_packages|lintian, the build's facts in the environment (CMakeLists.txt). With pipefail, never `cmd | grep -q`.
set -euo pipefail
MAJOR=${VERSION%%.*}
HERE=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
SCRATCH=$(mktemp -d "${TMPDIR:-/tmp}/quelta-packaging.XXXXXX")
trap 'rm -rf "$SCRATCH"' EXIT
failures=0
fail() { echo "FAIL: $*"; failures=$((failures + 1)); }
check() { if eval "$2"; then echo "ok: $1"; else fail "$1"; fi; }  # what condition
expect_eq() { if [ "$2" = "$3" ]; then echo "ok: $1"; else fail "$1: got '$2', expected '$3'"; fi; }
expect_list() {  # what expected-lines found-lines
  diff -u <(LC_ALL=C sort <<<"$2") <(LC_ALL=C sort <<<"$3") >"$SCRATCH/diff" && echo "ok: $1" \
    || { fail "$1 (- expected, + found):"; sed -n '3,$p' "$SCRATCH/diff"; }
}
run_quiet() { "$@" >"$SCRATCH/log" 2>&1 || { echo "FAIL: command failed: $*"; cat "$SCRATCH/log"; exit 1; }; }
soname_of() { readelf -d "$1" | sed -n 's/.*(SONAME).*\[\(.*\)\].*/\1/p'; }
tree_of() { (cd "$1" && find . \( -type f -o -type l \) | sed 's|^\./||'); }
# What each part installs under the prefix (per-config targets file as CONFIG); Debian's files in package $1.
runtime_files() { printf '%s\n' "$LIBDIR/libquelta.so.$MAJOR" "$LIBDIR/libquelta.so.$VERSION"; }
dev_files() {
  (cd "$SOURCE_DIR/include" && find quelta -type f -name '*.h' | sed "s|^|$INCLUDEDIR/|")
  printf '%s\n' "$INCLUDEDIR/quelta/version.h" "$DATAROOTDIR/doc/libquelta-dev/examples/runtime_example.cpp" \
    "$LIBDIR/libquelta.so" "$LIBDIR/pkgconfig/quelta.pc" "$LIBDIR/cmake/quelta/quelta-config.cmake" \
    "$LIBDIR/cmake/quelta/quelta-config-version.cmake" "$LIBDIR/cmake/quelta/quelta-targets.cmake" \
    "$LIBDIR/cmake/quelta/quelta-targets-CONFIG.cmake"
}
tools_files() { [ "${HAS_PROBE:-0}" != 1 ] || printf '%s\n' "$BINDIR/quelta-probe" "$MANDIR/man1/quelta-probe.1.gz"; }
debian_files() { printf '%s\n' "$DATAROOTDIR/doc/$1/changelog.Debian.gz" "$DATAROOTDIR/doc/$1/copyright" "$DATAROOTDIR/lintian/overrides/$1"; }
config() { sed 's|/quelta-targets-[a-z]*\.cmake$|/quelta-targets-CONFIG.cmake|'; }
# Program $3 loads libquelta.so.6 from $2 (natively: asked of the loader) and prints OK.
runs_from() {
  [ -n "${RUN_WITH:-}" ] || expect_eq "$1 loads the library from $2" "$(LD_TRACE_LOADED_OBJECTS=1 LD_LIBRARY_PATH="$2" "$3" \
    | sed -n 's/.*libquelta\.so\.[0-9]* => \([^ ]*\).*/\1/p')" "$2/libquelta.so.$MAJOR"
  expect_eq "$1 runs" "$(LD_LIBRARY_PATH="$2" ${RUN_WITH:-} "$3" 2>&1)" "OK"
}
consumer_runs() {  # what lib pkg-config-flags
  run_quiet "$CXX" -std=c++17 -Wall -Wextra -Wpedantic -Werror -DQUELTA_EXPECTED_VERSION="\"$VERSION\"" "$HERE/c_api.cpp" $3 ${EXE_LDFLAGS:-} -o "$SCRATCH/$1"
  runs_from "$1" "$2" "$SCRATCH/$1"
}
debs=("libquelta6" "libquelta-dev")
[ "${HAS_PROBE:-0}" = 1 ] && debs+=("quelta-tools")
deb_of() { echo "$SCRATCH/debs/${1}_${DEB_VERSION}_${DEB_ARCH}.deb"; }
make_debs() {
  run_quiet "$CPACK" -G DEB --config "$BUILD_DIR/CPackConfig.cmake" -B "$SCRATCH/debs"
  expect_list "packages made" "$(for p in "${debs[@]}"; do basename "$(deb_of "$p")"; done)" \
    "$(cd "$SCRATCH/debs" && ls -1 -- *.deb)"
  [ "$failures" = 0 ] || exit 1
}

# cmake --install lays out the library (file, two links, no run path), the headers unchanged, version.h, quelta.pc, nothing else.
install_tree() {
  local prefix="$SCRATCH/prefix" lib="$SCRATCH/prefix/$LIBDIR"
  run_quiet "$CMAKE" --install "$BUILD_DIR" --prefix "$prefix"
  expect_list "installed tree" "$(runtime_files; dev_files; tools_files)" "$(tree_of "$prefix" | config)"
  expect_eq "library file, soname, links" "$(stat -c %F "$lib/libquelta.so.$VERSION") $(soname_of "$lib/libquelta.so.$VERSION") $(readlink \
    "$lib/libquelta.so.$MAJOR") $(readlink "$lib/libquelta.so")" "regular file libquelta.so.$MAJOR libquelta.so.$VERSION libquelta.so.$MAJOR"
  check "no run path" "! readelf -d '$lib/libquelta.so.$VERSION' | grep -E 'RPATH|RUNPATH' >/dev/null"
  check "headers unchanged" "(cd '$SOURCE_DIR/include' && find quelta -name '*.h' | while read -r h; do cmp \"\$h\" '$prefix/$INCLUDEDIR/'\"\$h\" || exit 1; done)"
  expect_eq "version.h" "$(sed -n 's/^#define QUELTA_VERSION_STRING "\(.*\)"$/\1/p' "$prefix/$INCLUDEDIR/quelta/version.h")" "$VERSION"
  export PKG_CONFIG_LIBDIR="$lib/pkgconfig" PKG_CONFIG_PATH=""
  expect_eq "pkg-config" "$(pkg-config --modversion quelta) $(pkg-config --cflags --libs quelta | xargs)" "$VERSION -I$prefix/$INCLUDEDIR -L$lib -lquelta"
  [ "${CROSS:-0}" = 1 ] && return  # the consumers build with the host's CMake and pkg-config: natively
  # Programs built against it through pkg-config and find_package(quelta 6)
  # load libquelta.so.6 from there and run; the package refuses versions 5,
  # 7 and 6.1 and brings no link dependencies.
  local gen=(-G "$GENERATOR")
  consumer_runs pkg-config-consumer "$lib" "$(PKG_CONFIG_LIBDIR="$lib/pkgconfig" PKG_CONFIG_PATH="" pkg-config --cflags --libs quelta)"
  [ -n "${MAKE_PROGRAM:-}" ] && gen+=(-DCMAKE_MAKE_PROGRAM="$MAKE_PROGRAM")
  run_quiet "$CMAKE" -S "$HERE/consumer" -B "$SCRATCH/cm" "${gen[@]}" -DCMAKE_CXX_COMPILER="$CXX" -DCMAKE_PREFIX_PATH="$prefix" \
    -DCMAKE_FIND_USE_PACKAGE_REGISTRY=OFF -DCMAKE_FIND_USE_SYSTEM_PACKAGE_REGISTRY=OFF
  run_quiet "$CMAKE" --build "$SCRATCH/cm"
  expect_eq "find_package found the installed package" "$(sed -n 's/^quelta_DIR:PATH=//p' "$SCRATCH/cm/CMakeCache.txt")" "$lib/cmake/quelta"
  runs_from cmake-consumer "$lib" "$SCRATCH/cm/consumer"
  mkdir -p "$SCRATCH/q" && cat >"$SCRATCH/q/CMakeLists.txt" <<'CMAKE'
cmake_minimum_required(VERSION 3.16)
project(query LANGUAGES NONE)
foreach(refused 5 7 6.1)
  find_package(quelta ${refused} CONFIG QUIET PATHS ${dir} NO_DEFAULT_PATH)
  if(quelta_FOUND)
    message(STATUS "QUERY accepted ${refused}")
  endif()
  unset(quelta_DIR CACHE)
endforeach()
find_package(quelta 6.0 CONFIG REQUIRED PATHS ${dir} NO_DEFAULT_PATH)
get_target_property(c quelta::quelta IMPORTED_CONFIGURATIONS)
foreach(p INTERFACE_INCLUDE_DIRECTORIES IMPORTED_LOCATION_${c} IMPORTED_SONAME_${c} INTERFACE_LINK_LIBRARIES)
  get_target_property(v quelta::quelta ${p})
  set(all "${all} ${v}")
endforeach()
message(STATUS "QUERY ${quelta_VERSION}${all}")
CMAKE
  "$CMAKE" -S "$SCRATCH/q" -B "$SCRATCH/q/b" -Ddir="$lib/cmake/quelta" >"$SCRATCH/q.log" 2>&1 || cat "$SCRATCH/q.log"
  expect_eq "CMake package: version, include dir, location, soname, no link dependencies, 5/7/6.1 refused" \
    "$(sed -n 's/^-- QUERY //p' "$SCRATCH/q.log")" \
    "$VERSION $prefix/$INCLUDEDIR $lib/libquelta.so.$VERSION libquelta.so.$MAJOR v-NOTFOUND"
}

# cpack's three packages: fields, computed dependencies, symbols, ldconfig trigger, files; unpacked, a usable library.
debian_packages() {
  make_debs
  local root="$SCRATCH/root" lib="$SCRATCH/root/usr/$LIBDIR" c="$SCRATCH/control" ver=${DEB_VERSION//./\\.} v=' \([<>=]+ [^)]+\)'
  [ "${CROSS:-0}" = 1 ] && v=''  # no package database of the target: the C and C++ runtime unversioned
  local -A want=([libquelta6]="libs|libc6$v,libstdc\+\+6$v" [libquelta-dev]="libdevel|libquelta6 \(= $ver\)"
                 [quelta-tools]="utils|libquelta6 \(= $ver\),libc6$v,libstdc\+\+6$v")
  for p in "${debs[@]}"; do
    f() { dpkg-deb --field "$(deb_of "$p")" "$1"; }
    expect_eq "$p fields" "$(f Package) $(f Version) $(f Architecture) $(f Source) $(f Section)" \
      "$p $DEB_VERSION $DEB_ARCH quelta ${want[$p]%%|*}"
    check "$p has a maintainer and a description" "[ -n \"\$(f Maintainer)\" ] && [ -n \"\$(f Description)\" ]"
    IFS=, read -ra deps <<<"${want[$p]#*|}"
    for d in "${deps[@]}"; do
      check "$p depends on $d" "f Depends | tr ',' '\n' | sed 's/^ *//' | grep -Ex -- '$d' >/dev/null"
    done
    expect_list "$p contents" "$( { case $p in libquelta6) runtime_files ;; libquelta-dev) dev_files ;; *) tools_files ;; esac
      debian_files "$p"; } )" "$(dpkg-deb --fsys-tarfile "$(deb_of "$p")" | tar -t | grep -v '/$' | sed 's|^\./usr/||' | config)"
    dpkg-deb -x "$(deb_of "$p")" "$root"
    local doc="$root/usr/$DATAROOTDIR/doc/$p"
    expect_eq "$p copyright" "$(head -1 "$doc/copyright") $(grep -x 'License: Apache-2.0' "$doc/copyright" | head -1)" \
      "Format: https://www.debian.org/doc/packaging-manuals/copyright-format/1.0/ License: Apache-2.0"
    gzip -dc "$doc/changelog.Debian.gz" >"$SCRATCH/changelog"
    expect_eq "$p changelog's newest entry" "$(dpkg-parsechangelog -l "$SCRATCH/changelog" -S Version)" "$DEB_VERSION"
  done
  dpkg-deb -e "$(deb_of libquelta6)" "$c"
  expect_eq "shlibs, symbols header" "$(cat "$c/shlibs"; head -1 "$c/symbols")" "libquelta $MAJOR libquelta6 (>= $VERSION)
libquelta.so.$MAJOR libquelta6 #MINVER#"
  expect_list "symbols file lists the library's exports" \
    "$(readelf --dyn-syms -W "$lib/libquelta.so.$VERSION" | awk '$7 != "UND" && $7 != "Ndx" && $8 != "" && ($5 == "GLOBAL" || $5 == "WEAK") {print $8}' | sed 's/@.*//' | sort -u)" \
    "$(sed -n 's/^ \([^@ ]*\)@Base [0-9].*/\1/p' "$c/symbols")"
  expect_eq "ldconfig trigger, no maintainer scripts" "$(cat "$c/triggers"; ls "$c" | grep -E '^(pre|post)(inst|rm)$' || true)" "activate-noawait ldconfig"
  local real="$lib/libquelta.so.$VERSION"
  expect_eq "library: link chain, soname, mode" "$(readlink -f "$lib/libquelta.so") $(soname_of "$real") $(stat -c %a "$real")" \
    "$(readlink -f "$real") libquelta.so.$MAJOR 644"
  check "library stripped" "! readelf -S '$real' | grep '\.debug_info' >/dev/null"
  check "library has stack canaries" "readelf --dyn-syms -W '$real' | grep ' __stack_chk_fail' >/dev/null"
  expect_eq "packaged quelta.pc prefix" "$(sed -n 's/^prefix=//p' "$lib/pkgconfig/quelta.pc")" "/usr"
  consumer_runs unpacked-consumer "$lib" \
    "$(PKG_CONFIG_SYSROOT_DIR="$root" PKG_CONFIG_LIBDIR="$lib/pkgconfig" PKG_CONFIG_PATH="" pkg-config --cflags --libs quelta)"
}

# lintian: no error, no warning, no hardening tag (overrides in cmake/debian/lintian-overrides.in, each proved there).
lintian_clean() {
  make_debs
  local rc=0
  lintian --display-info --fail-on error,warning --tag-display-limit 0 "$SCRATCH"/debs/*.deb >"$SCRATCH/l.txt" 2>&1 || rc=$?
  cat "$SCRATCH/l.txt"
  check "lintian: no errors or warnings (exit $rc)" "[ $rc = 0 ] && ! grep -Eq '^[EW]: ' '$SCRATCH/l.txt'"
  check "lintian: packaged binaries hardened" "! grep -Eq '^.: [^ ]+ hardening-' '$SCRATCH/l.txt'"
}

case $1 in lintian) lintian_clean ;; *) "$1" ;; esac
[ "$failures" = 0 ] && echo "all checks passed" || { echo "$failures check(s) failed"; exit 1; }
