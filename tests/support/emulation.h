// The cross build runs its suites under qemu's user-mode emulator and says
// so in PLOVO_EMULATOR (cmake/aarch64-linux-gnu.cmake). A test program
// emulated that way can start host programs (/bin/sh, nm), but a program of
// the build (plovod, plovo-api, ...) only when the kernel hands aarch64
// executables to the emulator through a binfmt_misc handler; without one the
// exec fails with "Exec format error". The tests that start such a program
// skip themselves then, with this reason.
#ifndef PLOVO_TESTS_SUPPORT_EMULATION_H
#define PLOVO_TESTS_SUPPORT_EMULATION_H

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <string>

namespace plovo_test {

// Why the build's programs cannot be started from here; empty when they can.
inline std::string TargetProgramsCannotRun() {
  const char* emulator = std::getenv("PLOVO_EMULATOR");
  if (emulator == nullptr || *emulator == '\0') return "";
  std::ifstream handler(std::string("/proc/sys/fs/binfmt_misc/") + emulator);
  std::string state;
  if (handler >> state && state == "enabled") return "";
  return std::string("runs under ") + emulator + " without a binfmt_misc handler for it: " +
         "the build's own programs, which this test starts, cannot be executed";
}

}  // namespace plovo_test

// Skips the current test when it would start one of the build's programs
// and they cannot run here.
#define PLOVO_SKIP_UNLESS_TARGET_PROGRAMS_RUN()                                      \
  do {                                                                               \
    const std::string plovo_skip_reason_ = plovo_test::TargetProgramsCannotRun();    \
    if (!plovo_skip_reason_.empty()) GTEST_SKIP() << plovo_skip_reason_;             \
  } while (0)

#endif
