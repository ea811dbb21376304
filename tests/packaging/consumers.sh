# Programs built against the installed tree, once through pkg-config and once
# through find_package(quelta), link libquelta.so.6 from there and run.
source "$(dirname "$0")/common.sh"

prefix="$SCRATCH/prefix"
install_into "$prefix"
lib="$prefix/$LIBDIR"
consumer="$HERE/consumer"

# The library a program resolves, and its output, with lib on the path.
loaded_from() {
  LD_TRACE_LOADED_OBJECTS=1 LD_LIBRARY_PATH="$lib" "$1" | sed -n 's/.*libquelta\.so\.[0-9]* => \([^ ]*\).*/\1/p'
}
check_runs() {  # what program
  expect_eq "$1 loads the installed library" "$(loaded_from "$2")" "$lib/libquelta.so.$MAJOR"
  expect_eq "$1 runs" "$(LD_LIBRARY_PATH="$lib" "$2" 2>&1)" "OK"
}

# 1. pkg-config, with only the scratch tree on its path.
if command -v pkg-config >/dev/null; then
  flags=$(PKG_CONFIG_LIBDIR="$lib/pkgconfig" PKG_CONFIG_PATH="" pkg-config --cflags --libs quelta)
  run_quiet "$CXX" -std=c++17 -Wall -Wextra -Werror "$consumer/main.cpp" $flags -o "$SCRATCH/consumer-pc"
  check_runs "pkg-config consumer" "$SCRATCH/consumer-pc"
else
  fail "pkg-config is not installed"
fi

# 2. CMake: find_package(quelta 6) with the scratch prefix.
gen=(-G "$GENERATOR")
[ -n "${MAKE_PROGRAM:-}" ] && gen+=(-DCMAKE_MAKE_PROGRAM="$MAKE_PROGRAM")
run_quiet "$CMAKE" -S "$consumer" -B "$SCRATCH/cmake-build" "${gen[@]}" \
  -DCMAKE_CXX_COMPILER="$CXX" -DCMAKE_PREFIX_PATH="$prefix" \
  -DCMAKE_FIND_USE_PACKAGE_REGISTRY=OFF -DCMAKE_FIND_USE_SYSTEM_PACKAGE_REGISTRY=OFF
expect_eq "find_package found the installed package" \
  "$(sed -n 's/^quelta_DIR:PATH=//p' "$SCRATCH/cmake-build/CMakeCache.txt")" "$lib/cmake/quelta"
run_quiet "$CMAKE" --build "$SCRATCH/cmake-build"
check_runs "CMake consumer" "$SCRATCH/cmake-build/consumer"

# 3. The package's version and imported target, without compiling (so
# without a library architecture: the package directory is named): a request
# for another major version or a newer minor is refused, and quelta::quelta
# points into the prefix.
mkdir -p "$SCRATCH/query"
cat >"$SCRATCH/query/CMakeLists.txt" <<'CMAKE'
cmake_minimum_required(VERSION 3.16)
project(query LANGUAGES NONE)
foreach(refused 5 7 6.1)
  find_package(quelta ${refused} CONFIG QUIET PATHS ${package_dir} NO_DEFAULT_PATH)
  if(quelta_FOUND)
    message(STATUS "QUERY accepted ${refused}")
  endif()
  unset(quelta_DIR CACHE)
endforeach()
find_package(quelta 6.0 CONFIG REQUIRED PATHS ${package_dir} NO_DEFAULT_PATH)
message(STATUS "QUERY version=${quelta_VERSION}")
get_target_property(inc quelta::quelta INTERFACE_INCLUDE_DIRECTORIES)
message(STATUS "QUERY include=${inc}")
get_target_property(configs quelta::quelta IMPORTED_CONFIGURATIONS)
list(GET configs 0 config)
get_target_property(location quelta::quelta IMPORTED_LOCATION_${config})
get_target_property(soname quelta::quelta IMPORTED_SONAME_${config})
message(STATUS "QUERY location=${location}")
message(STATUS "QUERY soname=${soname}")
get_target_property(links quelta::quelta INTERFACE_LINK_LIBRARIES)
message(STATUS "QUERY links=${links}")
CMAKE
"$CMAKE" -S "$SCRATCH/query" -B "$SCRATCH/query/build" -Dpackage_dir="$lib/cmake/quelta" >"$SCRATCH/query.log" 2>&1 || { cat "$SCRATCH/query.log"; fail "version query"; }
q() { sed -n "s/^-- QUERY $1=//p" "$SCRATCH/query.log"; }
if grep -q "QUERY accepted" "$SCRATCH/query.log"; then
  fail "package accepted an incompatible version: $(grep 'QUERY accepted' "$SCRATCH/query.log")"
else
  pass "versions 5, 7 and 6.1 refused"
fi
expect_eq "package version" "$(q version)" "$VERSION"
expect_eq "quelta::quelta include directory" "$(q include)" "$prefix/$INCLUDEDIR"
expect_eq "quelta::quelta location" "$(q location)" "$lib/libquelta.so.$VERSION"
expect_eq "quelta::quelta soname" "$(q soname)" "libquelta.so.$MAJOR"
expect_eq "quelta::quelta brings no link dependencies" "$(q links)" "links-NOTFOUND"

finish
