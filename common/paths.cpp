#include "common/paths.h"

#include <cstdlib>

namespace Plovo::Path {

std::string Root() {
  const char* root = std::getenv("PLOVO_ROOT");
  std::string r = root ? root : "";
  while (r.size() > 1 && r.back() == '/') r.pop_back();
  return r == "/" ? std::string() : r;
}

std::string Rooted(const std::string& systemPath) { return Root() + systemPath; }

std::string PackageDir() { return Rooted("/var/packages/Plovo"); }
std::string StatusFile() { return Rooted("/var/packages/Plovo/etc/status"); }
std::string StatusLockFile() { return Rooted("/var/packages/Plovo/etc/status.lock"); }
std::string ServiceLockFile() { return Rooted("/var/packages/Plovo/etc/service.lock"); }
std::string SettingFile() { return Rooted("/var/packages/Plovo/etc/setting.conf"); }
std::string RegVolumeFile() { return Rooted("/var/packages/Plovo/etc/veltpkg_conf/reg_volume"); }
std::string EnabledFile() { return Rooted("/var/packages/Plovo/enabled"); }
std::string DaemonPidFile() { return Rooted("/var/run/plovod.pid"); }
std::string DaemonSocket() { return Rooted("/tmp/plovo-socket"); }
std::string DaemonProgram() { return Rooted("/var/packages/Plovo/target/sbin/plovod"); }
std::string NotifierProgram() { return Rooted("/var/packages/Plovo/target/bin/plovo-notifier"); }
std::string PlatformInfoFile() { return Rooted("/etc/veltinfo.conf"); }
std::string PlatformDefaultInfoFile() { return Rooted("/etc.defaults/veltinfo.conf"); }

}  // namespace Plovo::Path
