# cpack -G DEB makes libquelta6 (the shared library), libquelta-dev (the
# development files) and quelta-tools (the probe), with the right fields,
# computed dependencies, the ldconfig trigger, each file in the right package
# and Debian's copyright and changelog in each; unpacked together they give a
# usable library.
source "$(dirname "$0")/common.sh"

out="$SCRATCH/out"
make_debs "$out"

{ echo "$runtime_deb"; echo "$dev_deb"; if [ "${HAS_PROBE:-0}" = 1 ]; then echo "$tools_deb"; fi; } \
  | LC_ALL=C sort >"$SCRATCH/expected-debs.txt"
(cd "$out" && ls -1 -- *.deb 2>/dev/null | LC_ALL=C sort) >"$SCRATCH/found-debs.txt" || true
expect_same_list "packages made" "$SCRATCH/found-debs.txt" "$SCRATCH/expected-debs.txt"
[ -f "$out/$runtime_deb" ] && [ -f "$out/$dev_deb" ] || finish
debs=("$runtime_deb" "$dev_deb")
[ "${HAS_PROBE:-0}" = 1 ] && [ -f "$out/$tools_deb" ] && debs+=("$tools_deb")

field() { dpkg-deb --field "$out/$1" "$2"; }
# Files and links of a package, relative to /usr, targets named CONFIG.
contents() {
  dpkg-deb --fsys-tarfile "$out/$1" | tar -t | grep -v '/$' | sed 's|^\./usr/||' \
    | normalise_config | LC_ALL=C sort
}
# depends_on what deb regex: one entry of the package's Depends matches.
depends_on() {
  local depends
  depends=$(field "$2" Depends)
  if tr ',' '\n' <<<"$depends" | sed 's/^ *//' | grep -Ex -- "$3" >/dev/null; then
    pass "$1"
  else
    fail "$1: Depends is '$depends'"
  fi
}

# Control fields.
expect_eq "runtime package name" "$(field "$runtime_deb" Package)" "libquelta6"
expect_eq "development package name" "$(field "$dev_deb" Package)" "libquelta-dev"
for deb in "${debs[@]}"; do
  expect_eq "$deb version" "$(field "$deb" Version)" "$DEB_VERSION"
  expect_eq "$deb architecture" "$(field "$deb" Architecture)" "$DEB_ARCH"
  expect_eq "$deb source" "$(field "$deb" Source)" "quelta"
  [ -n "$(field "$deb" Maintainer)" ] && pass "$deb has a maintainer" || fail "$deb has no maintainer"
  [ -n "$(field "$deb" Description)" ] && pass "$deb has a description" || fail "$deb has no description"
done
expect_eq "runtime section" "$(field "$runtime_deb" Section)" "libs"
expect_eq "development section" "$(field "$dev_deb" Section)" "libdevel"

# Dependencies: computed by dpkg-shlibdeps (versioned, from the C library's
# shlibs), plus libquelta6 itself where it is loaded with dlopen. A cross
# build has no package database of the target to compute them from and
# names the C and C++ runtime without versions.
versioned=' \([<>=]+ [^)]+\)'
[ "${CROSS:-0}" = 1 ] && versioned=''
depends_on "libquelta-dev depends on libquelta6 (= $DEB_VERSION)" "$dev_deb" "libquelta6 \(= ${DEB_VERSION//./\\.}\)"
depends_on "libquelta6 depends on the C library" "$runtime_deb" "libc6$versioned"
depends_on "libquelta6 depends on the C++ library" "$runtime_deb" "libstdc\+\+6$versioned"
if [ "${#debs[@]}" = 3 ]; then
  expect_eq "tools section" "$(field "$tools_deb" Section)" "utils"
  depends_on "quelta-tools depends on libquelta6 (= $DEB_VERSION)" "$tools_deb" "libquelta6 \(= ${DEB_VERSION//./\\.}\)"
  depends_on "quelta-tools depends on the C library" "$tools_deb" "libc6$versioned"
  depends_on "quelta-tools depends on the C++ library" "$tools_deb" "libstdc\+\+6$versioned"
fi

# The runtime package registers its soname and symbols and has dpkg run
# ldconfig through a trigger, with no maintainer scripts of its own.
dpkg-deb -e "$out/$runtime_deb" "$SCRATCH/control"
expect_eq "shlibs" "$(cat "$SCRATCH/control/shlibs" 2>/dev/null)" \
  "libquelta $MAJOR libquelta6 (>= $VERSION)"
# The symbols file lists exactly what the library exports.
sed -n 's/^ \([^@ ]*\)@Base [0-9].*/\1/p' "$SCRATCH/control/symbols" 2>/dev/null | LC_ALL=C sort >"$SCRATCH/symbols-listed.txt"
dpkg-deb -x "$out/$runtime_deb" "$SCRATCH/runtime-root"
readelf --dyn-syms -W "$SCRATCH/runtime-root/usr/$LIBDIR/libquelta.so.$VERSION" \
  | awk '$7 != "UND" && $7 != "Ndx" && $8 != "" && ($5 == "GLOBAL" || $5 == "WEAK") {print $8}' \
  | sed 's/@.*//' | LC_ALL=C sort -u >"$SCRATCH/symbols-exported.txt"
expect_same_list "symbols file lists the library's exports" "$SCRATCH/symbols-listed.txt" "$SCRATCH/symbols-exported.txt"
expect_eq "symbols file header" "$(head -1 "$SCRATCH/control/symbols" 2>/dev/null)" "libquelta.so.$MAJOR libquelta6 #MINVER#"
expect_eq "ldconfig trigger" "$(cat "$SCRATCH/control/triggers" 2>/dev/null)" "activate-noawait ldconfig"
for script in preinst postinst prerm postrm; do
  [ -e "$SCRATCH/control/$script" ] && fail "libquelta6 has a $script script: $(cat "$SCRATCH/control/$script")"
done
pass "libquelta6 has no maintainer scripts"

# Each file in its package, Debian's own files in every package.
{ expected_runtime_files; expected_debian_files libquelta6; } | LC_ALL=C sort >"$SCRATCH/expected-runtime.txt"
{ expected_development_files; expected_debian_files libquelta-dev; } | LC_ALL=C sort >"$SCRATCH/expected-dev.txt"
contents "$runtime_deb" >"$SCRATCH/runtime.txt"
contents "$dev_deb" >"$SCRATCH/dev.txt"
expect_same_list "libquelta6 contents" "$SCRATCH/runtime.txt" "$SCRATCH/expected-runtime.txt"
expect_same_list "libquelta-dev contents" "$SCRATCH/dev.txt" "$SCRATCH/expected-dev.txt"
if [ "${#debs[@]}" = 3 ]; then
  { expected_tools_files; expected_debian_files quelta-tools; } | LC_ALL=C sort >"$SCRATCH/expected-tools.txt"
  contents "$tools_deb" >"$SCRATCH/tools.txt"
  expect_same_list "quelta-tools contents" "$SCRATCH/tools.txt" "$SCRATCH/expected-tools.txt"
fi

# Unpacked together into a scratch root: the link chain resolves to the
# stripped, non-executable library, the documents are Debian's, quelta.pc
# names /usr, and a program builds and runs.
root="$SCRATCH/root"
for deb in "${debs[@]}"; do dpkg-deb -x "$out/$deb" "$root"; done
lib="$root/usr/$LIBDIR"
real="$lib/libquelta.so.$VERSION"
expect_eq "libquelta.so resolves to the real file" "$(readlink -f "$lib/libquelta.so")" "$(readlink -f "$real")"
expect_eq "packaged soname" "$(soname_of "$real")" "libquelta.so.$MAJOR"
expect_eq "packaged library mode" "$(stat -c %a "$real")" "644"
if readelf -S "$real" | grep '\.debug_info' >/dev/null; then
  fail "packaged library is not stripped"
else
  pass "packaged library is stripped"
fi
# Built with stack canaries (lintian checks the other hardening flags).
if readelf --dyn-syms -W "$real" | grep ' __stack_chk_fail' >/dev/null; then
  pass "packaged library has stack canaries"
else
  fail "packaged library is built without -fstack-protector-strong"
fi
for deb in "${debs[@]}"; do
  pkg=$(field "$deb" Package)
  doc="$root/usr/$DATAROOTDIR/doc/$pkg"
  expect_eq "$pkg copyright is machine-readable" "$(head -1 "$doc/copyright")" \
    "Format: https://www.debian.org/doc/packaging-manuals/copyright-format/1.0/"
  grep -qx "License: Apache-2.0" "$doc/copyright" && pass "$pkg copyright: Apache-2.0" \
    || fail "$pkg copyright does not name Apache-2.0"
  gzip -dc "$doc/changelog.Debian.gz" >"$SCRATCH/changelog"
  expect_eq "$pkg changelog's newest entry is this version" \
    "$(dpkg-parsechangelog -l "$SCRATCH/changelog" -S Version)" "$DEB_VERSION"
done
expect_eq "packaged quelta.pc prefix" "$(sed -n 's/^prefix=//p' "$lib/pkgconfig/quelta.pc")" "/usr"
if command -v pkg-config >/dev/null; then
  flags=$(PKG_CONFIG_SYSROOT_DIR="$root" PKG_CONFIG_LIBDIR="$lib/pkgconfig" PKG_CONFIG_PATH="" \
          pkg-config --cflags --libs quelta)
  run_quiet "$CXX" -std=c++17 "$HERE/consumer/main.cpp" $flags ${EXE_LDFLAGS:-} -o "$SCRATCH/consumer"
  expect_eq "program built against the unpacked packages runs" \
    "$(LD_LIBRARY_PATH="$lib" ${RUN_WITH:-} "$SCRATCH/consumer" 2>&1)" "OK"
fi

finish
