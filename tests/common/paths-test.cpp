#include "common/paths.h"

#include <gtest/gtest.h>

#include <cstdlib>

namespace {

class PathsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    const char* old = std::getenv("PLOVO_ROOT");
    had_ = old != nullptr;
    if (had_) old_ = old;
  }
  void TearDown() override {
    if (had_) {
      setenv("PLOVO_ROOT", old_.c_str(), 1);
    } else {
      unsetenv("PLOVO_ROOT");
    }
  }

 private:
  bool had_ = false;
  std::string old_;
};

TEST_F(PathsTest, UnsetOrEmptyRootGivesTheSystemPaths) {
  unsetenv("PLOVO_ROOT");
  EXPECT_EQ(Plovo::Path::StatusFile(), "/var/packages/Plovo/etc/status");
  EXPECT_EQ(Plovo::Path::StatusLockFile(), "/var/packages/Plovo/etc/status.lock");
  EXPECT_EQ(Plovo::Path::SettingFile(), "/var/packages/Plovo/etc/setting.conf");
  EXPECT_EQ(Plovo::Path::RegVolumeFile(), "/var/packages/Plovo/etc/veltpkg_conf/reg_volume");
  EXPECT_EQ(Plovo::Path::EnabledFile(), "/var/packages/Plovo/enabled");
  EXPECT_EQ(Plovo::Path::DaemonPidFile(), "/var/run/plovod.pid");
  EXPECT_EQ(Plovo::Path::DaemonSocket(), "/tmp/plovo-socket");
  EXPECT_EQ(Plovo::Path::DaemonProgram(), "/var/packages/Plovo/target/sbin/plovod");
  EXPECT_EQ(Plovo::Path::NotifierProgram(), "/var/packages/Plovo/target/bin/plovo-notifier");
  EXPECT_EQ(Plovo::Path::PlatformInfoFile(), "/etc/veltinfo.conf");
  EXPECT_EQ(Plovo::Path::PlatformDefaultInfoFile(), "/etc.defaults/veltinfo.conf");
  setenv("PLOVO_ROOT", "", 1);
  EXPECT_EQ(Plovo::Path::DaemonSocket(), "/tmp/plovo-socket");
  setenv("PLOVO_ROOT", "/", 1);
  EXPECT_EQ(Plovo::Path::DaemonSocket(), "/tmp/plovo-socket");
}

TEST_F(PathsTest, RootPrefixesEveryPathAndIsReadOnEachCall) {
  setenv("PLOVO_ROOT", "/tmp/sb/", 1);
  EXPECT_EQ(Plovo::Path::StatusFile(), "/tmp/sb/var/packages/Plovo/etc/status");
  EXPECT_EQ(Plovo::Path::DaemonSocket(), "/tmp/sb/tmp/plovo-socket");
  setenv("PLOVO_ROOT", "/tmp/other", 1);
  EXPECT_EQ(Plovo::Path::EnabledFile(), "/tmp/other/var/packages/Plovo/enabled");
}

}  // namespace
