// A sandbox in which plovod can serve: one internal volume with its
// repository ("volume1/@Plovo" with "db" and "task") recorded in
// setting.conf, a NAS share "photo" on it, and a USB share "usbshare1" on
// a device image whose identity is stored on the device, as the module
// leaves it after the first task there. The daemon program is plovod, so
// that plovo-service starts it as a NAS would.
//
// The fixture also speaks to the daemon (Do: through the socket unless a
// suite answers in process), looks at what the repository and the
// scheduler hold, and runs the package's programs; no daemon a test started
// outlives it.
#ifndef PLOVO_TESTS_DAEMON_DAEMON_SANDBOX_H
#define PLOVO_TESTS_DAEMON_DAEMON_SANDBOX_H

#include <fcntl.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>
#include <velt/vlibc.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "common/paths.h"
#include "db/task-db.h"
#include "ipc/daemon-ipc.h"
#include "ipc/pobject.h"
#include "sandbox.h"

namespace plovo_test {

// Polls done, step apart, until it holds or a minute has passed; the
// caller checks the result, never how long it took.
template <class Done>
bool Eventually(Done done, std::chrono::microseconds step = std::chrono::milliseconds(1)) {
  const auto end = std::chrono::steady_clock::now() + std::chrono::minutes(1);
  for (; std::chrono::steady_clock::now() < end; std::this_thread::sleep_for(step))
    if (done()) return true;
  return false;
}

// Whether pid is a plovod that has not ended (a zombie has).
inline bool Running(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string stat;
  std::getline(in, stat);
  const size_t name = stat.find(" (plovod) ");
  return name != std::string::npos && stat.size() > name + 10 && stat[name + 10] != 'Z';
}

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
  void TearDown() override {
    DaemonPid();
    // A child's pid cannot be reused before it is collected; another's can.
    for (pid_t pid : children_) kill(pid, SIGKILL), waitpid(pid, nullptr, 0);
    for (pid_t pid : seen_)
      if (Running(pid)) kill(pid, SIGKILL);
    for (pid_t pid : seen_) EXPECT_TRUE(Eventually([pid] { return !Running(pid); })) << pid;
    SandboxTest::TearDown();
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
  static std::string TaskDir(unsigned long id) { return std::string(kRepo) + "/task/" + std::to_string(id); }
  static std::string EntryPath(int64_t id) { return "/velt-dev/scheduler/" + std::to_string(id) + ".json"; }
  std::string EntryField(int64_t id, const char* key) const {
    std::ifstream in(Path(EntryPath(id)));
    Json::Value entry;
    in >> entry;
    return entry[key].asString();
  }
  bool DeviceRow() const {
    TaskDB db;
    TaskDB::USBInfo row;
    return db.Initialize(RepoPath() + "/db/task-db.sqlite") == 0 && db.GetUSBInfoByUUID(kUuid, row) == 1;
  }
  // How many names lie below the folder, or only those with the extension.
  size_t Count(const std::string& systemDir, const char* extension = nullptr) const {
    std::error_code ec;
    size_t n = 0;
    using Walk = std::filesystem::recursive_directory_iterator;
    for (Walk it(Path(systemDir), ec), end; !ec && it != end; it.increment(ec))
      n += extension == nullptr || it->path().extension() == extension;
    return n;
  }

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
    for (const char* key : {"task_type", "copy_strategy", "keep_dir_structure", "conflict_policy", "rotation_policy"})
      r[key] = 1;
    // Not ejected after a run, so that one test can run a task twice.
    for (const char* key : {"smart_create_date_dir", "rename_photo_video", "remove_src_file", "enable_rotation",
                            "run_when_plug_in", "schedule_enabled", "eject_when_task_done"})
      r[key] = 0;
    r["max_version_count"] = 256;
    r["schedule_json_str"] = "{}";
    for (const char* key : {"white_name", "white_ext", "black_name", "black_ext", "custom_name", "custom_ext"})
      r[key].asArray();
    return r;
  }

  // One command through the socket, as the module sends it; the answer.
  static PObject Send(const PObject& request) {
    PObject answer;
    DaemonIPC().SendCommand(request, answer);
    return answer;
  }
  static PObject Num(uint64_t n) { return PObject(n); }
  static PObject Strings(const std::vector<std::string>& items) {
    PObject list;
    list.asArray();
    for (const std::string& item : items) list.asArray().push_back(item);
    return list;
  }
  static PObject With(PObject request, const char* key, const PObject& value) {
    request[key] = value;
    return request;
  }
  static PObject Action(const char* action) { return With(PObject(), "action", action); }
  static PObject OnTask(const char* action, unsigned long id) {
    return With(With(Action(action), "need_ack", Num(1)), "task_id", Num(id));
  }
  // A trigger with the timetable; plug-in on and eject off, or the reverse.
  static PObject Trigger(unsigned long id, const std::string& timetable, bool plugIn = false) {
    PObject r = With(OnTask("set_trigger_time_setting", id), "schedule_json_str", timetable);
    r["run_when_plug_in"] = plugIn;
    r["eject_when_task_done"] = !plugIn;
    r["schedule_enabled"] = 1;
    return r;
  }

  // The daemon's answer: through the socket, unless a suite asks it in process.
  virtual PObject Do(const PObject& request) { return Send(request); }
  testing::AssertionResult Ok(const PObject& request) {
    const PObject answer = Do(request);
    if (answer["ack"].asStringRef() == "ok" && !answer.hasMember("error")) return testing::AssertionSuccess();
    return testing::AssertionFailure() << request.toString() << " -> " << answer.toString();
  }
  int Code(const PObject& request) { return Do(request)["error_code"].asInt32(); }
  unsigned long Add(const PObject& request) {
    const PObject answer = Do(request);
    EXPECT_EQ(answer["ack"].asStringRef(), "ok") << answer.toString();
    return answer["task_id"].asUInt64();
  }
  PObject Get(unsigned long id) { return Do(OnTask("get_task_setting", id)); }
  // The task's map as list_task shows it.
  PObject Listed(unsigned long id) {
    const PObject answer = Do(Action("list_task"));
    for (const PObject& task : answer["task_list"].asArray())
      if (task["id"].asUInt64() == id) return task;
    return PObject();
  }
  // Polls list_task until the task is idle; its map.
  PObject WaitIdle(unsigned long id, std::chrono::microseconds step = std::chrono::milliseconds(1)) {
    PObject task;
    EXPECT_TRUE(Eventually([&] { return (task = Listed(id))["task_status"].asStringRef() == "idle"; }, step))
        << "task " << id << " still runs";
    return task;
  }

  // Runs a command line, its stderr added to /tools.err; its exit status,
  // -1 when a signal ended it, and its output in *out.
  int Run(const std::string& command, std::string* out = nullptr) const {
    FILE* pipe = popen((command + " 2>>" + Path("/tools.err")).c_str(), "r");
    if (pipe == nullptr) return -1;
    char buffer[4096];
    for (size_t n; (n = fread(buffer, 1, sizeof(buffer), pipe)) > 0;)
      if (out) out->append(buffer, n);
    const int status = pclose(pipe);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  int Service(const char* verb) const { return Run(std::string(PLOVO_SERVICE_PATH " ") + verb); }
  int Notify(const std::string& args) const { return Run(PLOVO_NOTIFIER_PATH " " + args); }
  // The module's answer to one web-API request.
  std::string Api(const std::string& method, const std::string& params = "") const {
    std::string out;
    Run(PLOVO_API_PATH " " + method + (params.empty() ? "" : " '" + params + "'"), &out);
    return out;
  }
  pid_t DaemonPid() {
    const pid_t pid = VLIBCReadPidFile(Plovo::Path::DaemonPidFile().c_str());
    if (pid > 0) seen_.push_back(pid);
    return pid;
  }
  // plovod --foreground, its log in /plovod.err.
  pid_t StartForeground() {
    const std::string log = Path("/plovod.err");
    const pid_t pid = fork();
    if (pid == 0) {
      dup2(open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644), STDERR_FILENO);
      execl(PLOVOD_PATH, PLOVOD_PATH, "--foreground", static_cast<char*>(nullptr));
      _exit(127);
    }
    children_.push_back(pid);
    seen_.push_back(pid);
    return pid;
  }
  // A child's exit status; -1 when a signal ended it or it did not end.
  int WaitExit(pid_t pid) {
    int status = 0;
    if (!Eventually([&] { return waitpid(pid, &status, WNOHANG) == pid; })) return -1;
    children_.erase(std::find(children_.begin(), children_.end(), pid));
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

  std::vector<pid_t> seen_, children_;
};

}  // namespace plovo_test

#endif
