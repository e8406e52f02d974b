// A sandbox in which plovod can serve: one internal volume with its
// repository ("volume1/@Plovo" with "db" and "task") recorded in
// setting.conf, a NAS share "photo" on it, and a USB share "usbshare1" on
// a device image whose identity is stored on the device, as the module
// leaves it after the first task there. The daemon program is plovod, so
// that plovo-service starts it as a NAS would.
#ifndef PLOVO_TESTS_DAEMON_DAEMON_SANDBOX_H
#define PLOVO_TESTS_DAEMON_DAEMON_SANDBOX_H

#include <unistd.h>

#include <string>

#include "ipc/daemon-ipc.h"
#include "ipc/pobject.h"
#include "sandbox.h"

namespace plovo_test {

class DaemonSandboxTest : public SandboxTest {
 protected:
  static constexpr const char* kUuid = "0d7c3c55-5b1e-4a53-9d4c-0a1b2c3d4e5f";
  static constexpr const char* kRepo = "/volume1/@Plovo";

  void SetUp() override {
    SandboxTest::SetUp();
    for (const char* dir : {"/var/packages/Plovo/target/sbin", "/var/packages/Plovo/target/bin",
                            "/var/packages/Plovo/etc", "/var/run", "/tmp", "/volume1/@Plovo/db",
                            "/volume1/@Plovo/task", "/volume1/photo", "/usbshare1/DCIM", "/dev"})
      MakeDir(dir);
    WriteFile("/var/packages/Plovo/enabled", "");
    WriteFile("/etc.defaults/veltinfo.conf", "");
    WriteFile("/var/packages/Plovo/etc/setting.conf",
              "repo_vol_path=\"" + Root() + "/volume1\"\nbeep=\"no\"\n");
    WriteFile("/dev/usb1", "");
    WriteFile("/usbshare1/@eaDir/.VeltraPlovo.config", std::string("uuid=\"") + kUuid + "\"\n");
    DeclareVolumes({{"volume1"}});
    PlugIn(true);
    symlink(PLOVOD_PATH, Path("/var/packages/Plovo/target/sbin/plovod").c_str());
    symlink(PLOVO_NOTIFIER_PATH, Path("/var/packages/Plovo/target/bin/plovo-notifier").c_str());
  }

  // Declares usbshare1 mounted (its device plugged in) or not.
  void PlugIn(bool mounted) const {
    WriteFile("/velt-dev/storage.json",
              std::string(R"({"shares": [{"name": "usbshare1", "path": "usbshare1", "dev_path": "dev/usb1", "mounted": )") +
                  (mounted ? "true" : "false") + R"(},
                  {"name": "photo", "path": "volume1/photo"}],
       "devices": [{"producer": "Acme", "product": "Card",
                    "partitions": [{"share_name": "usbshare1"}]}]})");
  }

  std::string RepoPath() const { return Path(kRepo); }

  // The "add_task" request the module sends for an import task from
  // usbshare1's folder to photo's, with every key and its defaults.
  static PObject AddTaskRequest(const std::string& name, const std::string& usbFolder = "/DCIM",
                                const std::string& nasFolder = "/card") {
    PObject r;
    r["action"] = "add_task";
    r["need_ack"] = 1;
    r["uuid"] = kUuid;
    r["usb_share_path"] = "usbshare1";
    r["producer"] = "Acme";
    r["product"] = "Card";
    r["nas_share_name"] = "photo";
    r["usb_folder_path"] = usbFolder;
    r["nas_folder_path"] = nasFolder;
    r["task_name"] = name;
    for (const char* key : {"task_type", "copy_strategy", "keep_dir_structure", "conflict_policy", "rotation_policy",
                            "eject_when_task_done"})
      r[key] = 1;
    for (const char* key : {"smart_create_date_dir", "rename_photo_video", "remove_src_file", "enable_rotation",
                            "run_when_plug_in", "schedule_enabled"})
      r[key] = 0;
    r["max_version_count"] = 256;
    r["schedule_json_str"] = "{}";
    for (const char* key : {"white_name", "white_ext", "black_name", "black_ext", "custom_name", "custom_ext"})
      r[key].asArray();
    return r;
  }

  // One command through the socket, as the module sends it; the answer.
  static PObject Send(const PObject& request, int* result = nullptr) {
    PObject answer;
    DaemonIPC ipc;
    const int sent = ipc.SendCommand(request, answer);
    if (result) *result = sent;
    return answer;
  }
  static PObject OnTask(const char* action, unsigned long id) {
    PObject r;
    r["action"] = action;
    r["need_ack"] = 1;
    r["task_id"] = id;
    return r;
  }
};

}  // namespace plovo_test

#endif
