# Cross build for a 64-bit ARM NAS with Debian's cross compiler
# (g++-aarch64-linux-gnu) and the arm64 multiarch -dev packages of the
# dependencies (libsqlite3-dev:arm64, ...), which install beside the host's
# under /usr/lib/aarch64-linux-gnu. scripts/cross-test installs them.
#
#   cmake -S . -B build-aarch64 -G Ninja -DPLOVO_BUILD_BENCH=OFF \
#     -DCMAKE_TOOLCHAIN_FILE=cmake/aarch64-linux-gnu.cmake
#
# The test programs run under qemu-aarch64, both when CTest runs them and
# when gtest_discover_tests lists their cases at build time.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR aarch64)
set(CMAKE_LIBRARY_ARCHITECTURE aarch64-linux-gnu)

set(CMAKE_C_COMPILER aarch64-linux-gnu-gcc)
set(CMAKE_CXX_COMPILER aarch64-linux-gnu-g++)

# The cross C library lives under /usr/aarch64-linux-gnu; the multiarch
# packages live under / in lib/aarch64-linux-gnu, which the library
# architecture above selects instead of the host's lib/x86_64-linux-gnu.
# Programs (pkg-config, qemu) are the host's.
set(CMAKE_FIND_ROOT_PATH /usr/aarch64-linux-gnu /)
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)

# pkg-config reads only the target's .pc files: jsoncpp, uuid and blkid come
# from there, and FindOpenSSL takes its hints from it.
set(ENV{PKG_CONFIG_LIBDIR} /usr/lib/aarch64-linux-gnu/pkgconfig:/usr/share/pkgconfig)
set(ENV{PKG_CONFIG_PATH} "")
set(ENV{PKG_CONFIG_SYSROOT_DIR} "")

# The programs run with the arm64 C library that the -dev:arm64 packages
# install beside the host's (-L /): the cross compiler's own copy under
# /usr/aarch64-linux-gnu is of another Debian revision, and its loader with
# the multiarch libc.so.6, which the loader's cache names first, hangs a
# program at its first thread or child process.
#
# PLOVO_EMULATOR tells a test that it runs under user-mode emulation: a
# target program it starts cannot run unless the kernel hands aarch64
# executables to qemu (binfmt_misc), which tests/support/emulation.h checks.
# Without qemu only -DPLOVO_BUILD_TESTS=OFF builds: listing a suite's cases
# runs it.
find_program(PLOVO_QEMU NAMES qemu-aarch64 qemu-aarch64-static)
if(PLOVO_QEMU)
  set(CMAKE_CROSSCOMPILING_EMULATOR ${PLOVO_QEMU} -L / -E PLOVO_EMULATOR=qemu-aarch64)
endif()
