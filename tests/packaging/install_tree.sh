# cmake --install lays out a system library: the real file with the full
# version, the soname and development links, the public headers only,
# quelta.pc, the CMake package, the example's source, the probe with its
# manual page, and nothing else (the Debian files go into packages only).
source "$(dirname "$0")/common.sh"

prefix="$SCRATCH/prefix"
install_into "$prefix"
lib="$prefix/$LIBDIR"

# The whole tree, file by file: catches a missing piece as well as anything
# installed that must not be (internal library or headers, tests, tools).
{
  expected_runtime_files
  expected_development_files
  if [ "${HAS_PROBE:-0}" = 1 ]; then expected_tools_files; fi
} | LC_ALL=C sort >"$SCRATCH/expected.txt"
tree_of "$prefix" >"$SCRATCH/found.txt"
expect_same_list "installed tree" "$SCRATCH/found.txt" "$SCRATCH/expected.txt"

# The library: one real file, two links in the soname chain.
real="$lib/libquelta.so.$VERSION"
if [ -f "$real" ] && [ ! -L "$real" ]; then pass "libquelta.so.$VERSION is a regular file"
else fail "libquelta.so.$VERSION is not a regular file"; fi
expect_eq "soname" "$(soname_of "$real")" "libquelta.so.$MAJOR"
expect_eq "soname link" "$(readlink "$lib/libquelta.so.$MAJOR" || true)" "libquelta.so.$VERSION"
expect_eq "development link" "$(readlink "$lib/libquelta.so" || true)" "libquelta.so.$MAJOR"
if readelf -d "$real" | grep -E '\((RPATH|RUNPATH)\)' >/dev/null; then
  fail "installed library keeps a run path: $(readelf -d "$real" | grep -E 'RPATH|RUNPATH')"
else
  pass "installed library has no run path"
fi

# The headers are the source's public headers, unchanged.
while read -r h; do
  cmp -s "$SOURCE_DIR/include/$h" "$prefix/$INCLUDEDIR/$h" || fail "header $h differs from the source"
done < <(public_headers)

# The generated version header names this version.
expect_eq "version.h" "$(sed -n 's/^#define QUELTA_VERSION_STRING "\(.*\)"$/\1/p' "$prefix/$INCLUDEDIR/quelta/version.h")" "$VERSION"

# quelta.pc names the prefix it was installed under.
pc="$lib/pkgconfig/quelta.pc"
expect_eq "quelta.pc prefix" "$(sed -n 's/^prefix=//p' "$pc")" "$prefix"
if command -v pkg-config >/dev/null; then
  export PKG_CONFIG_LIBDIR="$lib/pkgconfig" PKG_CONFIG_PATH=""
  expect_eq "pkg-config version" "$(pkg-config --modversion quelta)" "$VERSION"
  expect_eq "pkg-config cflags" "$(pkg-config --cflags quelta | xargs)" "-I$prefix/$INCLUDEDIR"
  expect_eq "pkg-config libs" "$(pkg-config --libs quelta | xargs)" "-L$lib -lquelta"
else
  fail "pkg-config is not installed"
fi

finish
