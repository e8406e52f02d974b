// Every fixed path of the system, in one place.
//
// Each function returns the system's path, placed under the sandbox root
// when the environment variable PLOVO_ROOT names a folder: with
// PLOVO_ROOT=/tmp/sb, StatusFile() is "/tmp/sb/var/packages/Plovo/etc/status";
// with PLOVO_ROOT unset or empty it is "/var/packages/Plovo/etc/status".
// The variable is read on every call, so a test may change it between
// calls. Safe to call from several threads while nobody changes the
// environment.
#ifndef PLOVO_COMMON_PATHS_H
#define PLOVO_COMMON_PATHS_H

#include <string>

namespace Plovo::Path {

// The sandbox root ("" when none) and any system path placed under it.
std::string Root();
std::string Rooted(const std::string& systemPath);

std::string PackageDir();       // /var/packages/Plovo
std::string StatusFile();       // /var/packages/Plovo/etc/status
std::string StatusLockFile();   // /var/packages/Plovo/etc/status.lock
std::string ServiceLockFile();  // /var/packages/Plovo/etc/service.lock
std::string SettingFile();      // /var/packages/Plovo/etc/setting.conf
std::string RegVolumeFile();    // /var/packages/Plovo/etc/veltpkg_conf/reg_volume
std::string EnabledFile();      // /var/packages/Plovo/enabled
std::string DaemonPidFile();    // /var/run/plovod.pid
std::string DaemonSocket();     // /tmp/plovo-socket
std::string DaemonProgram();    // /var/packages/Plovo/target/sbin/plovod
std::string NotifierProgram();  // /var/packages/Plovo/target/bin/plovo-notifier
std::string PlatformInfoFile();         // /etc/veltinfo.conf
std::string PlatformDefaultInfoFile();  // /etc.defaults/veltinfo.conf

}  // namespace Plovo::Path

#endif
