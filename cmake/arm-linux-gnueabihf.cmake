# Cross build for ARMv7 (32-bit, glibc); tests run under qemu-arm.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR arm)
set(CMAKE_C_COMPILER arm-linux-gnueabihf-gcc)
set(CMAKE_CXX_COMPILER arm-linux-gnueabihf-g++)
set(CMAKE_FIND_ROOT_PATH /usr/arm-linux-gnueabihf)
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)
set(CMAKE_CROSSCOMPILING_EMULATOR qemu-arm -L /usr/arm-linux-gnueabihf)
# GCC 7.1 fixed how C++ class objects of some template types are passed by
# value under the ARM procedure call standard (GCC 5 and 6 passed them
# differently), and notes every call that might be affected. Such a call
# matters only across a boundary with code built by GCC 5 or 6. Every note
# here is a standard-library iterator passed inside the tools and tests;
# the library's own code draws none, and its exported interface passes
# scalars, pointers and ClockTime (two 32-bit words, 4-byte aligned), which
# the change leaves alone. The notes ran to pages and buried real warnings.
set(CMAKE_CXX_FLAGS_INIT "-Wno-psabi")
