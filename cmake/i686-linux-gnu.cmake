# Cross build for 32-bit x86 (glibc), run natively: the kernel runs i686
# programs directly (the loader comes from libc6-i386), so signal delivery and
# timing are real, unlike under emulation. Pointers, the default time_t and
# glibc's 32-bit wrappers are those of the ARMv7 target.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR i686)
set(CMAKE_C_COMPILER i686-linux-gnu-gcc)
set(CMAKE_CXX_COMPILER i686-linux-gnu-g++)
set(CMAKE_FIND_ROOT_PATH /usr/i686-linux-gnu)
# Doubles in SSE2 registers: IEEE binary64 arithmetic like ARMv7's VFP, so the
# clock-rate and statistics formulas give the same bits on every target (the
# x87 unit's 80-bit intermediates would round differently).
set(CMAKE_C_FLAGS_INIT "-msse2 -mfpmath=sse")
set(CMAKE_CXX_FLAGS_INIT "-msse2 -mfpmath=sse")
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)
# The programs run on the system's own 32-bit C library and loader
# (libc6-i386). The cross toolchain's libstdc++ and libgcc_s are found through
# a directory that holds only those two: the cross C library beside them is a
# different build of glibc, and mixing it with the system's loader hangs.
set(QUELTA_I686_RUNTIME_DIR "${CMAKE_BINARY_DIR}/i686-runtime")
file(MAKE_DIRECTORY "${QUELTA_I686_RUNTIME_DIR}")
foreach(lib libstdc++.so.6 libgcc_s.so.1)
  file(CREATE_LINK "/usr/i686-linux-gnu/lib/${lib}" "${QUELTA_I686_RUNTIME_DIR}/${lib}" SYMBOLIC)
endforeach()
# The build tree's programs find them through their run path, the library
# relative to itself, so that it carries no path of the build machine (it
# lies beside that directory). Both are build-tree run paths, which
# installing removes: the installed and packaged files name no such
# directory (the target system has a C++ runtime of its own).
set(CMAKE_BUILD_RPATH "${QUELTA_I686_RUNTIME_DIR}")
set(QUELTA_LIBRARY_BUILD_RPATH "$ORIGIN/i686-runtime")
