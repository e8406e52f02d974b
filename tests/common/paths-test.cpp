#include "common/paths.h"

#include "sandbox.h"

namespace {

// The sandbox fixture restores PLOVO_ROOT after each case.
using PathsTest = plovo_test::SandboxTest;

TEST_F(PathsTest, RootPrefixesTheSystemPathsAndIsReadOnEachCall) {
  unsetenv("PLOVO_ROOT");
  EXPECT_EQ(Plovo::Path::StatusLockFile(), "/var/packages/Plovo/etc/status.lock");
  EXPECT_EQ(Plovo::Path::RegVolumeFile(), "/var/packages/Plovo/etc/veltpkg_conf/reg_volume");
  EXPECT_EQ(Plovo::Path::DaemonSocket(), "/tmp/plovo-socket");
  setenv("PLOVO_ROOT", "/", 1);
  EXPECT_EQ(Plovo::Path::DaemonPidFile(), "/var/run/plovod.pid");
  setenv("PLOVO_ROOT", "/tmp/sb/", 1);
  EXPECT_EQ(Plovo::Path::StatusFile(), "/tmp/sb/var/packages/Plovo/etc/status");
  setenv("PLOVO_ROOT", "/tmp/other", 1);
  EXPECT_EQ(Plovo::Path::PlatformDefaultInfoFile(), "/tmp/other/etc.defaults/veltinfo.conf");
}

}  // namespace
