# cpack -G DEB makes libquelta6 (the shared library) and libquelta-dev (the
# development files), with the right fields and each file in the right
# package; unpacked together they give a usable library.
source "$(dirname "$0")/common.sh"

command -v dpkg-deb >/dev/null || { echo "FAIL: dpkg-deb is not installed"; exit 1; }
[ -n "${CPACK:-}" ] && [ -n "${DEB_ARCH:-}" ] || { echo "packaging test: CPACK/DEB_ARCH not set" >&2; exit 2; }

out="$SCRATCH/out"
run_quiet "$CPACK" -G DEB --config "$BUILD_DIR/CPackConfig.cmake" -B "$out"

runtime_deb="libquelta6_${VERSION}_${DEB_ARCH}.deb"
dev_deb="libquelta-dev_${VERSION}_${DEB_ARCH}.deb"
tools_deb="quelta-tools_${VERSION}_${DEB_ARCH}.deb"
{ echo "$runtime_deb"; echo "$dev_deb"; if [ "${HAS_PROBE:-0}" = 1 ]; then echo "$tools_deb"; fi; } \
  | LC_ALL=C sort >"$SCRATCH/expected-debs.txt"
(cd "$out" && ls -1 -- *.deb 2>/dev/null | LC_ALL=C sort) >"$SCRATCH/found-debs.txt" || true
expect_same_list "packages made" "$SCRATCH/found-debs.txt" "$SCRATCH/expected-debs.txt"
[ -f "$out/$runtime_deb" ] && [ -f "$out/$dev_deb" ] || finish

field() { dpkg-deb --field "$out/$1" "$2"; }
# Files and links of a package, relative to /usr, targets named CONFIG.
contents() {
  dpkg-deb --fsys-tarfile "$out/$1" | tar -t | grep -v '/$' | sed 's|^\./usr/||' \
    | normalise_config | LC_ALL=C sort
}

# Control fields.
expect_eq "runtime package name" "$(field "$runtime_deb" Package)" "libquelta6"
expect_eq "development package name" "$(field "$dev_deb" Package)" "libquelta-dev"
for deb in "$runtime_deb" "$dev_deb"; do
  expect_eq "$deb version" "$(field "$deb" Version)" "$VERSION"
  expect_eq "$deb architecture" "$(field "$deb" Architecture)" "$DEB_ARCH"
  [ -n "$(field "$deb" Maintainer)" ] && pass "$deb has a maintainer" || fail "$deb has no maintainer"
  [ -n "$(field "$deb" Description)" ] && pass "$deb has a description" || fail "$deb has no description"
done
expect_eq "runtime section" "$(field "$runtime_deb" Section)" "libs"
expect_eq "development section" "$(field "$dev_deb" Section)" "libdevel"
case ", $(field "$dev_deb" Depends), " in
  *", libquelta6 (= $VERSION), "*) pass "libquelta-dev depends on libquelta6 (= $VERSION)" ;;
  *) fail "libquelta-dev depends on '$(field "$dev_deb" Depends)'" ;;
esac
case "$(field "$runtime_deb" Depends)" in
  *libc6*) pass "libquelta6 depends on the C library" ;;
  *) fail "libquelta6 depends on '$(field "$runtime_deb" Depends)'" ;;
esac

# The runtime package registers its soname and runs ldconfig.
dpkg-deb -e "$out/$runtime_deb" "$SCRATCH/control"
expect_eq "shlibs" "$(cat "$SCRATCH/control/shlibs" 2>/dev/null)" \
  "libquelta $MAJOR libquelta6 (>= $VERSION)"
grep -q ldconfig "$SCRATCH/control/postinst" 2>/dev/null && pass "postinst runs ldconfig" \
  || fail "postinst does not run ldconfig"

# Each file in its package.
expected_runtime_files | LC_ALL=C sort >"$SCRATCH/expected-runtime.txt"
expected_development_files | LC_ALL=C sort >"$SCRATCH/expected-dev.txt"
contents "$runtime_deb" >"$SCRATCH/runtime.txt"
contents "$dev_deb" >"$SCRATCH/dev.txt"
expect_same_list "libquelta6 contents" "$SCRATCH/runtime.txt" "$SCRATCH/expected-runtime.txt"
expect_same_list "libquelta-dev contents" "$SCRATCH/dev.txt" "$SCRATCH/expected-dev.txt"
if [ "${HAS_PROBE:-0}" = 1 ] && [ -f "$out/$tools_deb" ]; then
  printf "%s\n" "$BINDIR/quelta-probe" "share/man/man1/quelta-probe.1.gz" >"$SCRATCH/expected-tools.txt"
  contents "$tools_deb" >"$SCRATCH/tools.txt"
  expect_same_list "quelta-tools contents" "$SCRATCH/tools.txt" "$SCRATCH/expected-tools.txt"
fi

# Unpacked together into a scratch root: the link chain resolves to the
# stripped library, quelta.pc names /usr, and a program builds and runs.
root="$SCRATCH/root"
dpkg-deb -x "$out/$runtime_deb" "$root"
dpkg-deb -x "$out/$dev_deb" "$root"
lib="$root/usr/$LIBDIR"
expect_eq "libquelta.so resolves to the real file" "$(readlink -f "$lib/libquelta.so")" \
  "$(readlink -f "$lib/libquelta.so.$VERSION")"
expect_eq "packaged soname" "$(soname_of "$lib/libquelta.so.$VERSION")" "libquelta.so.$MAJOR"
if readelf -S "$lib/libquelta.so.$VERSION" | grep -q '\.debug_info'; then
  fail "packaged library is not stripped"
else
  pass "packaged library is stripped"
fi
expect_eq "packaged quelta.pc prefix" "$(sed -n 's/^prefix=//p' "$lib/pkgconfig/quelta.pc")" "/usr"
if command -v pkg-config >/dev/null; then
  flags=$(PKG_CONFIG_SYSROOT_DIR="$root" PKG_CONFIG_LIBDIR="$lib/pkgconfig" PKG_CONFIG_PATH="" \
          pkg-config --cflags --libs quelta)
  run_quiet "$CXX" -std=c++17 "$HERE/consumer/main.cpp" $flags -o "$SCRATCH/consumer"
  expect_eq "program built against the unpacked packages runs" \
    "$(LD_LIBRARY_PATH="$lib" "$SCRATCH/consumer" 2>&1)" "OK"
fi

finish
