// The package enabled, its folders, plovod as its daemon program and two
// volumes: where the service start and the repository move tests begin.
#ifndef PLOVO_TESTS_SERVICE_SERVICE_SANDBOX_H
#define PLOVO_TESTS_SERVICE_SERVICE_SANDBOX_H

#include <signal.h>
#include <sys/mount.h>
#include <unistd.h>
#include <velt/vlibc.h>

#include "common/paths.h"
#include "sandbox.h"
#include "service/service-ctrl.h"

namespace plovo_test {

class ServiceSandboxTest : public SandboxTest {
 protected:
  static constexpr const char* kDaemon = "/var/packages/Plovo/target/sbin/plovod";
  void SetUp() override {
    SandboxTest::SetUp();
    for (const char* dir : {"/var/packages/Plovo/target/sbin", "/var/packages/Plovo/etc", "/var/run", "/tmp", "/volume1",
                            "/volume2"})
      MakeDir(dir);
    WriteFile("/var/packages/Plovo/enabled", "");
    WriteFile("/etc.defaults/veltinfo.conf", "plovo=\"yes\"\n");
    symlink(PLOVOD_PATH, Path(kDaemon).c_str());
    DeclareVolumes({{"volume1"}, {"volume2"}});
  }
  // A daemon a test started, and a tmpfs it mounted on volume2, go before its sandbox.
  void TearDown() override {
    if (StatusService() == 0) kill(Pid(), SIGKILL);
    umount2(Path("/volume2").c_str(), MNT_DETACH);
    SetStopServiceWait(std::chrono::milliseconds(0));
    SandboxTest::TearDown();
  }
  static int Pid() { return VLIBCReadPidFile(Plovo::Path::DaemonPidFile().c_str()); }
  std::string Status() const { return ReadFile("/var/packages/Plovo/etc/status"); }
  static std::string StateIs(int state, const std::string& error = "") {
    return "state=\"" + std::to_string(state) + "\"\nerror=\"" + error + "\"\n";
  }
  // Whether the package manager's record names volume.
  bool Recorded(const std::string& volume) const {
    return ReadFile("/var/packages/Plovo/etc/veltpkg_conf/reg_volume") == "[\"" + volume + "\"]\n";
  }
};

}  // namespace plovo_test

#endif
