# Debian packages made by cpack -G DEB from the install components:
#   libquelta6     runtime      the shared library
#   libquelta-dev  development  headers, libquelta.so, quelta.pc, CMake
#                               package, the example runtime
#   quelta-tools   tools        quelta-probe and its manual page
# Included by the top CMakeLists.txt after the install rules. The Debian
# files themselves live in cmake/debian/.

set(QUELTA_PACKAGE_MAINTAINER "libquelta maintainers <maintainers@libquelta.invalid>"
  CACHE STRING "Maintainer field of the Debian packages")
set(QUELTA_DEB_REVISION 1 CACHE STRING
  "Debian revision of the packages; cmake/debian/changelog's newest entry must match")
set(QUELTA_DEB_ARCHITECTURE "" CACHE STRING
  "Debian architecture of the packages (empty: this machine's, or the cross target's)")
set(QUELTA_DEB_VERSION ${PROJECT_VERSION}-${QUELTA_DEB_REVISION})
if(NOT QUELTA_DEB_ARCHITECTURE)
  if(CMAKE_CROSSCOMPILING)
    if(CMAKE_SYSTEM_PROCESSOR MATCHES "^arm")
      set(QUELTA_DEB_ARCHITECTURE armhf)
    elseif(CMAKE_SYSTEM_PROCESSOR MATCHES "^(aarch64|arm64)$")
      set(QUELTA_DEB_ARCHITECTURE arm64)
    elseif(CMAKE_SYSTEM_PROCESSOR MATCHES "^i[3-6]86$")
      set(QUELTA_DEB_ARCHITECTURE i386)
    elseif(CMAKE_SYSTEM_PROCESSOR MATCHES "^(x86_64|amd64)$")
      set(QUELTA_DEB_ARCHITECTURE amd64)
    endif()
  else()
    find_program(QUELTA_DPKG_PROGRAM dpkg)
    if(QUELTA_DPKG_PROGRAM)
      execute_process(COMMAND ${QUELTA_DPKG_PROGRAM} --print-architecture
        OUTPUT_VARIABLE QUELTA_DEB_ARCHITECTURE OUTPUT_STRIP_TRAILING_WHITESPACE
        ERROR_QUIET)
    endif()
  endif()
  if(NOT QUELTA_DEB_ARCHITECTURE)
    set(QUELTA_DEB_ARCHITECTURE ${CMAKE_SYSTEM_PROCESSOR})
  endif()
endif()

# --- files of /usr/share/doc/<package>, lintian overrides -------------------
# Debian compresses changelogs and manual pages with gzip -9n: no name and no
# time stamp inside, so the same text always gives the same bytes.
find_program(QUELTA_GZIP gzip REQUIRED)
function(quelta_gzip_file source output)
  set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS ${source})
  get_filename_component(dir ${output} DIRECTORY)
  file(MAKE_DIRECTORY ${dir})
  execute_process(COMMAND ${QUELTA_GZIP} -9nc INPUT_FILE ${source} OUTPUT_FILE ${output}
    RESULT_VARIABLE rc)
  if(NOT rc EQUAL 0)
    message(FATAL_ERROR "gzip of ${source} failed: ${rc}")
  endif()
endfunction()

set(QUELTA_DEB_DIR ${PROJECT_BINARY_DIR}/debian)
quelta_gzip_file(${PROJECT_SOURCE_DIR}/cmake/debian/changelog ${QUELTA_DEB_DIR}/changelog.Debian.gz)

set(quelta_deb_packages runtime ${QUELTA_DEB_RUNTIME} development ${QUELTA_DEB_DEVELOPMENT})
if(TARGET quelta-probe)
  list(APPEND quelta_deb_packages tools ${QUELTA_DEB_TOOLS})
endif()
set(quelta_deb_components)
while(quelta_deb_packages)
  list(POP_FRONT quelta_deb_packages component package)
  list(APPEND quelta_deb_components ${component})
  install(FILES ${PROJECT_SOURCE_DIR}/cmake/debian/copyright ${QUELTA_DEB_DIR}/changelog.Debian.gz
    DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/doc/${package}
    COMPONENT ${component} EXCLUDE_FROM_ALL)
  set(quelta_deb_package ${package})
  configure_file(${PROJECT_SOURCE_DIR}/cmake/debian/lintian-overrides.in
    ${QUELTA_DEB_DIR}/lintian/${package} @ONLY)
  install(FILES ${QUELTA_DEB_DIR}/lintian/${package}
    DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/lintian/overrides
    COMPONENT ${component} EXCLUDE_FROM_ALL)
endwhile()

# --- control data -----------------------------------------------------------
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME quelta)
set(CPACK_PACKAGE_VENDOR "libquelta")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT "${QUELTA_PACKAGE_MAINTAINER}")
set(CPACK_RESOURCE_FILE_LICENSE ${PROJECT_SOURCE_DIR}/LICENSE)
# Each package's description comes from CPACK_DEBIAN_<COMPONENT>_DESCRIPTION,
# its first line the summary; a CPACK_PACKAGE_DESCRIPTION_SUMMARY would be put
# in front of every one of them.

# Packages install under /usr, with DESTDIR, so that quelta.pc names /usr.
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_INSTALL_PREFIX /usr)
set(CPACK_SET_DESTDIR ON)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL ${quelta_deb_components})
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SOURCE quelta)
set(CPACK_DEBIAN_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_DEBIAN_PACKAGE_RELEASE ${QUELTA_DEB_REVISION})
set(CPACK_DEBIAN_PACKAGE_MAINTAINER "${QUELTA_PACKAGE_MAINTAINER}")
set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE ${QUELTA_DEB_ARCHITECTURE})
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
# Control files with the modes Debian prescribes (0644, scripts 0755).
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)

# libquelta6. Its shlibs and symbols files let packages built against
# libquelta depend on libquelta6 (>= the version they need); its trigger has dpkg run ldconfig once after
# all packages of a run are unpacked, instead of maintainer scripts (which
# CPack would add for any package with a shared library in /usr/lib, were it
# left to compute shlibs and dependencies itself: it is not, see
# cmake/QueltaCPackProject.cmake.in).
set(CPACK_DEBIAN_RUNTIME_PACKAGE_NAME ${QUELTA_DEB_RUNTIME})
set(CPACK_DEBIAN_RUNTIME_PACKAGE_SECTION libs)
file(WRITE ${QUELTA_DEB_DIR}/shlibs
  "libquelta ${PROJECT_VERSION_MAJOR} ${QUELTA_DEB_RUNTIME} (>= ${PROJECT_VERSION})\n")
configure_file(${PROJECT_SOURCE_DIR}/cmake/debian/libquelta6.triggers ${QUELTA_DEB_DIR}/triggers COPYONLY)
# The symbols file names every exported symbol with the version that brought
# it, so that a package built against libquelta depends on the oldest
# libquelta6 that has what it uses; a new export needs a line there (the
# packaging test compares it with the library).
configure_file(${PROJECT_SOURCE_DIR}/cmake/debian/libquelta6.symbols ${QUELTA_DEB_DIR}/symbols COPYONLY)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_CONTROL_EXTRA
  "${QUELTA_DEB_DIR}/shlibs;${QUELTA_DEB_DIR}/symbols;${QUELTA_DEB_DIR}/triggers")
set(CPACK_DEBIAN_RUNTIME_DESCRIPTION "time services for a real-time application runtime
libquelta.so.6 supplies time to a real-time application runtime: waits on
the monotonic and the global clock, event waits with timeouts, callbacks
at a time, clock conversion and rate control, and a lock-free per-CPU event
log. Loading the library starts a SCHED_FIFO timer thread that keeps a 1 ms
tick.")

set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_NAME ${QUELTA_DEB_DEVELOPMENT})
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_DEPENDS "${QUELTA_DEB_RUNTIME} (= ${QUELTA_DEB_VERSION}), libc6-dev")
set(CPACK_DEBIAN_DEVELOPMENT_DESCRIPTION "time services for a real-time application runtime - development files
The headers of libquelta's interface (exported functions, the timing engine
and log engine interfaces, ClockTime, the shared PalSemaphore record and the
version macros), the libquelta.so link, quelta.pc for pkg-config, the CMake
package (find_package(quelta) gives the imported target quelta::quelta) and
an example runtime.")

# quelta-tools: the probe loads libquelta.so.6 with dlopen, so the library is
# named here; dpkg-shlibdeps adds what the program links (libc, libstdc++).
set(CPACK_DEBIAN_TOOLS_PACKAGE_NAME ${QUELTA_DEB_TOOLS})
set(CPACK_DEBIAN_TOOLS_PACKAGE_SECTION utils)
set(CPACK_DEBIAN_TOOLS_PACKAGE_DEPENDS "${QUELTA_DEB_RUNTIME} (= ${QUELTA_DEB_VERSION})")
set(CPACK_DEBIAN_TOOLS_DESCRIPTION "time services for a real-time application runtime - tools
quelta-probe measures how late the waits of libquelta wake up on this
machine, next to the machine's own clock_nanosleep, and what the library's
calls cost.")

# Computed dependencies need dpkg-shlibdeps and this machine's own
# architecture; a cross build names the C and C++ runtime itself.
find_program(QUELTA_DPKG_SHLIBDEPS dpkg-shlibdeps)
if(QUELTA_DPKG_SHLIBDEPS AND NOT CMAKE_CROSSCOMPILING)
  set(CPACK_DEBIAN_TOOLS_PACKAGE_SHLIBDEPS ON)
  set(CPACK_QUELTA_SHLIBDEPS ${QUELTA_DPKG_SHLIBDEPS})
else()
  set(CPACK_DEBIAN_RUNTIME_PACKAGE_DEPENDS "libc6, libgcc-s1, libstdc++6")
  string(APPEND CPACK_DEBIAN_TOOLS_PACKAGE_DEPENDS ", libc6, libgcc-s1, libstdc++6")
endif()
set(CPACK_QUELTA_SHLIBDEPS_DIR ${QUELTA_DEB_DIR}/shlibdeps)
file(GENERATE OUTPUT ${QUELTA_DEB_DIR}/CPackProject.cmake
  INPUT ${PROJECT_SOURCE_DIR}/cmake/QueltaCPackProject.cmake.in)
set(CPACK_PROJECT_CONFIG_FILE ${QUELTA_DEB_DIR}/CPackProject.cmake)

# A source package (make package_source) leaves out builds and the history.
set(CPACK_SOURCE_GENERATOR TGZ)
set(CPACK_SOURCE_IGNORE_FILES "/build[^/]*/" "/\\.git/" "\\.swp$")

include(CPack)
