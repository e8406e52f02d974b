// plovod-dev, the development daemon, run as its own process in a sandbox:
// driven with the module's command builders over the socket, then end to
// end through plovo-api.
#include <fcntl.h>
#include <json/json.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <sstream>
#include <thread>

#include "common/paths.h"
#include "ipc/daemon-ipc.h"
#include "ipc/plovo-command.h"
#include "sandbox.h"

namespace {

class DevDaemonTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/tmp");
    MakeDir("/usbshare1");
    WriteFile("/dev/usb1", "");
    WriteFile("/velt-dev/storage.json",
              R"({"shares": [{"name": "usbshare1", "path": "usbshare1", "dev_path": "dev/usb1"}],
                  "devices": [{"partitions": [{"share_name": "usbshare1"}]}]})");
  }
  void TearDown() override {
    if (pid_ > 0) Stop(SIGKILL);
    SandboxTest::TearDown();
  }

  // Starts the daemon, its stderr in the sandbox, and waits for its socket
  // (a plain file at that path does not count).
  void Start() {
    const std::string log = Path("/daemon.log");
    pid_ = fork();
    if (pid_ == 0) {
      dup2(open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644), 2);
      execl(PLOVOD_DEV_PATH, PLOVOD_DEV_PATH, static_cast<char*>(nullptr));
      _exit(127);
    }
    struct stat st {};
    for (int i = 0; i < 250; ++i) {
      if (stat(Plovo::Path::DaemonSocket().c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) return;
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    FAIL() << "no socket; " << ReadFile("/daemon.log");
  }
  // Signals the daemon (0: none) and returns its exit status once it has
  // ended; -1 when killed or still running after five seconds.
  int Stop(int signal) {
    if (signal != 0) kill(pid_, signal);
    int status = 0, waits = 0;
    while (waitpid(pid_, &status, WNOHANG) == 0 && ++waits < 250) {
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    if (waits == 250) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
    pid_ = -1;
    return waits < 250 && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

  static PObject Send(const PObject& request) {
    PObject reply;
    DaemonIPC().SendCommand(request, reply);
    return reply;
  }
  static PObject Send(int (*build)(unsigned long, PObject&), unsigned long id) {
    PObject request;
    build(id, request);
    return Send(request);
  }

  pid_t pid_ = -1;
};

// What the module's answers do not show: the raw paths of both directions,
// the fixed strategy and the codes of refusals.
TEST_F(DevDaemonTest, PathsStrategyAndRefusals) {
  Start();
  Plovo::TaskSetting task;
  task.usb_share_name = "usbshare1";
  task.usb_folder_path = "/DCIM";
  task.nas_share_name = "photo";
  PObject request;
  task.task_name = "Camera";
  task.nas_folder_path = "/camera";
  ASSERT_EQ(Plovo::CreateTaskCmd(task, {}, {}, request), 0);
  EXPECT_EQ(Send(request)["task_id"].asUInt64(), 1u);
  task.task_name = "Backup";
  task.task_type = Registry::TASK_TYPE_EXPORT_GENERAL;
  task.nas_folder_path = "/";
  ASSERT_EQ(Plovo::CreateTaskCmd(task, {}, {}, request), 0);
  EXPECT_EQ(Send(request)["task_id"].asUInt64(), 2u);

  PObject got = Send(Plovo::GetTaskSettingCmd, 1);
  EXPECT_EQ(got["source_path"].asString() + " " + got["destination_path"].asString(),
            "/DCIM /photo/camera");
  // An export goes the other way; a share's root shows as the share alone.
  got = Send(Plovo::GetTaskSettingCmd, 2);
  EXPECT_EQ(got["source_path"].asString() + " " + got["destination_path"].asString(),
            "/photo /DCIM");

  Plovo::SetTaskSettingCmd(1, task, request);  // "Backup" is task 2's name
  EXPECT_EQ(Send(request)["error_code"].asInt64(), 3);
  task.task_name = "Camera";  // its own name is no conflict
  Plovo::SetTaskSettingCmd(1, task, request);
  request["copy_strategy"] = 3;  // never sent by the module, never obeyed
  EXPECT_EQ(Send(request)["ack"].asString(), "ok");
  EXPECT_EQ(Send(Plovo::GetTaskSettingCmd, 1)["copy_strategy"].asUInt64(), 1u);

  EXPECT_EQ(Send(Plovo::DeleteTaskCmd, 1)["ack"].asString(), "ok");
  EXPECT_EQ(Send(Plovo::StartTaskCmd, 1)["error_code"].asInt64(), 4);
  request.clear();
  request["action"] = "format_usb";
  EXPECT_EQ(Send(request)["error_code"].asInt64(), 1);
}

TEST_F(DevDaemonTest, EndsOnStopOrSignalAndRemovesItsSocket) {
  Start();
  PObject stop, none;
  stop["action"] = "stop";
  stop["need_ack"] = 0;
  EXPECT_EQ(DaemonIPC().SendCommand(stop, none), 0);
  EXPECT_EQ(Stop(0), 0);
  EXPECT_FALSE(Exists("/tmp/plovo-socket"));

  WriteFile("/tmp/plovo-socket", "stale");  // replaced by the next start
  for (int signal : {SIGTERM, SIGINT}) {
    Start();
    EXPECT_EQ(Stop(signal), 0) << signal;
    EXPECT_FALSE(Exists("/tmp/plovo-socket")) << signal;
  }
}

// The module's task methods through plovo-api, this daemon behind them.
class DevDaemonApiTest : public DevDaemonTest {
 protected:
  // The answer's data, or "error N" (with the exit status when not 1).
  Json::Value Api(const std::string& method, const std::string& params) {
    const std::string command = "PLOVO_ROOT=" + Root() + " " + PLOVO_API_PATH + " " + method +
                                " '" + params + "' 2>/dev/null";
    FILE* pipe = popen(command.c_str(), "r");
    std::string out;
    char buffer[4096];
    for (size_t n; pipe && (n = fread(buffer, 1, sizeof(buffer), pipe)) > 0;) out.append(buffer, n);
    const int status = pipe ? pclose(pipe) : -1;
    Json::Value json;
    std::istringstream text(out);
    EXPECT_TRUE(Json::parseFromStream(Json::CharReaderBuilder(), text, &json, nullptr)) << out;
    if (status == 0 && json["success"].asBool()) return json["data"];
    const int exit = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    return (exit == 1 ? "" : "exit " + std::to_string(exit) + " ") + "error " +
           std::to_string(json["error"]["code"].asInt());
  }
  static std::string Task(const std::string& name, const std::string& destination) {
    return R"({"name": ")" + name + R"(", "type": "import_general",
      "source_path": "/usbshare1/DCIM", "destination_path": ")" + destination + R"(",
      "copy_strategy": "versioning", "enable_rotation": true, "max_version_count": 10,
      "rotation_policy": "oldest_version", "run_when_plug_in": true,
      "eject_when_task_done": false, "schedule_enabled": false, "schedule_content": {},
      "filter": {"white_list": {"extensions": ["jpg"], "names": []},
                 "black_list": {"extensions": [], "names": []},
                 "customized_list": {"extensions": [], "names": []}}})";
  }
};

TEST_F(DevDaemonApiTest, CreateListEditRunCancelAndDelete) {
  WriteStatus(4, "");
  Start();
  const std::string one = R"({"id": 1})";
  Json::Value created = Api("create", R"({"task": )" + Task("Camera", "/photo/camera") + "}");
  EXPECT_EQ(created["task_id"].asUInt64(), 1u) << created;
  EXPECT_EQ(Api("create", R"({"task": )" + Task("Camera", "/photo") + "}"), "error 403");

  Json::Value tasks = Api("list", "{}")["tasks"];
  ASSERT_EQ(tasks.size(), 1u) << tasks;
  EXPECT_EQ(tasks[0]["name"], "Camera");
  EXPECT_EQ(tasks[0]["source_path"], "/usbshare1/DCIM");
  EXPECT_EQ(tasks[0]["destination_path"], "/photo/camera");
  EXPECT_EQ(tasks[0]["status"], "idle");
  EXPECT_EQ(tasks[0]["max_version_count"].asUInt64(), 10u);
  EXPECT_EQ(tasks[0]["schedule_id"].asInt64(), -1);
  EXPECT_EQ(Api("get", one)["task"]["run_when_plug_in"], true);
  EXPECT_EQ(Api("get_filter", one)["task_filter"]["white_list"]["extensions"][0], "jpg");

  EXPECT_EQ(Api("set_setting", R"({"id": 1, "task_setting": )" + Task("Holiday", "/photo") + "}"),
            Json::Value());
  Json::Value task = Api("get", one)["task"];
  EXPECT_EQ(task["name"], "Holiday") << task;
  EXPECT_EQ(task["destination_path"], "/photo");

  EXPECT_EQ(Api("run", one), Json::Value());
  EXPECT_EQ(Api("run", one), "error 403");
  EXPECT_EQ(Api("list", "{}")["tasks"][0]["status"], "running");
  EXPECT_EQ(Api("cancel", one), Json::Value());
  EXPECT_EQ(Api("cancel", one), Json::Value());  // the daemon's 8: nothing to cancel
  EXPECT_EQ(Api("delete", one), Json::Value());
  EXPECT_EQ(Api("list", "{}")["tasks"], Json::Value(Json::arrayValue));
  EXPECT_EQ(Api("get", one), "error 401");
  const std::string log = ReadFile("/daemon.log");
  EXPECT_NE(log.find("run_task 1 -> error 3\n"), std::string::npos) << log;
  EXPECT_NE(log.find("cancel_task 1 -> error 8\n"), std::string::npos) << log;
}

}  // namespace
