// plovod as a NAS runs it: the real program started by the package's
// service control or in the foreground, driven through its socket, its
// files, the module (plovo-api) and plovo-notifier.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <velt/vlibc.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <thread>

#include "common/paths.h"
#include "daemon-sandbox.h"
#include "ipc/command-server.h"
#include "ipc/error-code.h"

namespace {

using testing::AllOf;
using testing::HasSubstr;
using testing::Not;

// A whole "list_task" request on the wire: a map of one string pair.
const std::string kListTask("\x42\x10\x00\x06" "action" "\x10\x00\x09" "list_task" "\x40", 23);

// Polls done until it holds or a minute has passed; the caller checks the
// result, never how long it took.
template <class Done>
bool Eventually(Done done) {
  for (int i = 0; i < 6000; ++i, std::this_thread::sleep_for(std::chrono::milliseconds(10)))
    if (done()) return true;
  return false;
}

// Whether pid is a plovod that has not ended (a zombie has).
bool Running(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string stat;
  std::getline(in, stat);
  const size_t name = stat.find(" (plovod) ");
  return name != std::string::npos && stat.size() > name + 10 && stat[name + 10] != 'Z';
}

// The number after "key": in a JSON text; -1 when it is not there.
long Number(const std::string& json, const std::string& key) {
  const size_t at = json.find("\"" + key + "\":");
  return at == std::string::npos ? -1 : std::stol(json.substr(at + key.size() + 3));
}

class PlovodTest : public plovo_test::DaemonSandboxTest {
 protected:
  // No daemon a test started outlives it, whatever became of its pid file.
  void TearDown() override {
    DaemonPid();
    // A child's pid cannot be reused before it is collected; another's can.
    for (pid_t pid : children_) kill(pid, SIGKILL), waitpid(pid, nullptr, 0);
    for (pid_t pid : seen_)
      if (Running(pid)) kill(pid, SIGKILL);
    for (pid_t pid : seen_) EXPECT_TRUE(Eventually([pid] { return !Running(pid); })) << pid;
    DaemonSandboxTest::TearDown();
  }

  int Tool(const std::string& path, const std::string& args) const {
    const int status = std::system((path + " " + args + " >/dev/null 2>>" + Path("/tools.err")).c_str());
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  int Service(const char* verb) const { return Tool(PLOVO_SERVICE_PATH, verb); }
  // The module's answer to one web-API request.
  std::string Api(const std::string& method, const std::string& params = "") const {
    const std::string args = params.empty() ? "" : " '" + params + "'";
    FILE* pipe = popen((PLOVO_API_PATH " " + method + args + " 2>>" + Path("/tools.err")).c_str(), "r");
    std::string out;
    char buffer[4096];
    for (size_t n; pipe != nullptr && (n = fread(buffer, 1, sizeof(buffer), pipe)) > 0;) out.append(buffer, n);
    if (pipe != nullptr) pclose(pipe);
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
  bool Serving() const { return ReadFile("/var/packages/Plovo/etc/status") == "state=\"4\"\nerror=\"\"\n"; }

  static int Connect(bool nonBlocking = false) {
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | (nonBlocking ? SOCK_NONBLOCK : 0), 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, Plovo::Path::DaemonSocket().c_str(), sizeof(address.sun_path) - 1);
    if (connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0) return fd;
    close(fd);
    return -1;
  }
  static PObject List() {
    PObject r;
    r["action"] = "list_task";
    return Send(r);
  }
  static bool Answers() { return List()["ack"].asStringRef() == "ok"; }
  static unsigned long AddTask(const std::string& name, const std::string& nasFolder = "/card") {
    return Send(AddTaskRequest(name, "/DCIM", nasFolder))["task_id"].asUInt64();
  }
  static PObject Task(unsigned long id) { return Send(OnTask("get_task_setting", id)); }
  static bool Idle(unsigned long id) { return Task(id)["task_status"].asStringRef() == "idle"; }
  // A 2 GiB source file that costs no disk: no run copies it within one
  // command's round trip.
  void BigSource() const {
    WriteFile("/usbshare1/DCIM/big.bin", "");
    std::filesystem::resize_file(Path("/usbshare1/DCIM/big.bin"), 2L << 30);
  }
  void TwoPhotos() const {
    WriteFile("/usbshare1/DCIM/a.jpg", "A");
    WriteFile("/usbshare1/DCIM/b.jpg", "BB");
  }
  bool PhotosArrived() const {
    return ReadFile("/volume1/photo/card/a.jpg") == "A" && ReadFile("/volume1/photo/card/b.jpg") == "BB";
  }

  std::vector<pid_t> seen_, children_;
};

class PlovodLifecycleTest : public PlovodTest {};
class PlovodModuleTest : public PlovodTest {};
class PlovodServingTest : public PlovodTest {};
class PlovodNotifierTest : public PlovodTest {};

const char* const kPidFile = "/var/run/plovod.pid";
const char* const kSocket = "/tmp/plovo-socket";

TEST_F(PlovodLifecycleTest, StartsOnceStopsAndKeepsItsTasks) {
  ASSERT_EQ(Service("start"), 0);
  EXPECT_TRUE(Serving());
  const pid_t pid = DaemonPid();
  ASSERT_TRUE(Running(pid));
  const int held = open(Path(kPidFile).c_str(), O_RDONLY | O_CLOEXEC);
  EXPECT_EQ(flock(held, LOCK_EX | LOCK_NB), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  close(held);
  EXPECT_TRUE(Answers());
  const unsigned long first = AddTask("Card"), second = AddTask("Card2", "/card2");

  // A second daemon leaves the first one's pid file, socket and state alone.
  EXPECT_EQ(WaitExit(StartForeground()), 1) << ReadFile("/plovod.err");
  EXPECT_EQ(DaemonPid(), pid);
  EXPECT_TRUE(Exists(kSocket));
  EXPECT_TRUE(Answers());
  EXPECT_TRUE(Serving());

  EXPECT_EQ(Service("stop"), 0);
  EXPECT_TRUE(Eventually([pid] { return !Running(pid); }));
  EXPECT_FALSE(Exists(kSocket));
  EXPECT_FALSE(Exists(kPidFile));

  ASSERT_EQ(Service("start"), 0);
  const PObject listed = List();
  ASSERT_EQ(listed["task_list"].asArray().size(), 2u) << listed.asString();
  EXPECT_EQ(listed["task_list"].asArray()[0]["id"].asUInt64(), first);
  EXPECT_EQ(listed["task_list"].asArray()[1]["id"].asUInt64(), second);

  // The stop command alone ends it (the service stop also sends SIGTERM).
  const pid_t again = DaemonPid();
  PObject stop;
  stop["action"] = "stop";
  stop["need_ack"] = 0;
  Send(stop);
  EXPECT_TRUE(Eventually([again] { return !Running(again); }));
  EXPECT_FALSE(Exists(kSocket));
  EXPECT_FALSE(Exists(kPidFile));
}

TEST_F(PlovodLifecycleTest, ForegroundEndsWithItsStatusAndLeavesNoFiles) {
  const struct { const char* name; int signal; int status; } cases[] = {
      {"SIGTERM", SIGTERM, 0},
      {"SIGINT", SIGINT, 0},
      {"no repository recorded", 0, 1},  // last: it empties setting.conf
  };
  ASSERT_EQ(Service("start"), 0);  // the task database, then the daemon is not needed
  ASSERT_EQ(Service("stop"), 0);
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    if (c.signal == 0) WriteFile("/var/packages/Plovo/etc/setting.conf", "");
    unlink(Path("/var/packages/Plovo/etc/status").c_str());
    const pid_t pid = StartForeground();
    if (c.signal != 0) {
      ASSERT_TRUE(Eventually([this] { return Serving(); })) << ReadFile("/plovod.err");
      kill(pid, c.signal);
    }
    EXPECT_EQ(WaitExit(pid), c.status) << ReadFile("/plovod.err");
    EXPECT_FALSE(Exists(kSocket));
    EXPECT_FALSE(Exists(kPidFile));
  }
}

TEST_F(PlovodModuleTest, TaskFromCreationToDeletion) {
  ASSERT_EQ(Service("start"), 0);
  const std::string created = Api("create", R"({"task": {"name": "Camera", "type": "import_general",
      "source_path": "/usbshare1/DCIM", "destination_path": "/photo/card", "copy_strategy": "versioning",
      "enable_rotation": true, "max_version_count": 10, "rotation_policy": "oldest_version",
      "run_when_plug_in": false, "eject_when_task_done": false, "schedule_enabled": false,
      "schedule_content": {}, "filter": {}}})");
  ASSERT_THAT(created, HasSubstr(R"("success":true)"));
  const std::string id = "\"id\": " + std::to_string(Number(created, "task_id"));
  const std::string task = "{" + id + "}";
  const std::string ok = R"({"success":true,"data":null})";
  const struct { const char* method; std::string params; testing::Matcher<std::string> answer; } steps[] = {
      {"list", "", HasSubstr(R"("name":"Camera")")},
      {"get", task, AllOf(HasSubstr(R"("is_usb_mounted":true)"), HasSubstr(R"("source_path":"/usbshare1/DCIM")"))},
      {"set_setting", "{" + id + R"(, "task_setting": {"name": "Card", "type": "import_general",
          "source_path": "/usbshare1/DCIM", "destination_path": "/photo/card", "copy_strategy": "versioning",
          "enable_rotation": true, "max_version_count": 5, "rotation_policy": "oldest_version"}})", HasSubstr(ok)},
      {"get", task, HasSubstr(R"("name":"Card")")},
      {"set_trigger_time", "{" + id + R"(, "trigger_time": {"run_when_plug_in": false,
          "eject_when_task_done": false, "schedule_enabled": true,
          "schedule_content": {"week_day": "1,3", "hour": 7, "minute": 30, "repeat_date": 0}}})",
       HasSubstr(R"("success":true)")},
      {"get", task, AllOf(HasSubstr(R"("success":true)"), Not(HasSubstr(R"("next_run_time":"N/A")")))},
      {"set_filter", "{" + id + R"(, "task_filter": {"white_list": {"extensions": ["jpg"], "names": []},
          "black_list": {"extensions": [], "names": ["Thumbs.db"]},
          "customized_list": {"extensions": ["raw"], "names": ["DSC"]}}})", HasSubstr(ok)},
      {"get_filter", task, AllOf(HasSubstr(R"("white_list":{"extensions":["jpg"],"names":[]})"),
                                 HasSubstr(R"("black_list":{"extensions":[],"names":["Thumbs.db"]})"),
                                 HasSubstr(R"("customized_list":{"extensions":["raw"],"names":["DSC"]})"))},
      {"disable", task, HasSubstr(ok)},
      {"get", task, HasSubstr(R"("is_task_runnable":false)")},
      {"run", task, HasSubstr(R"("success":false)")},
      {"enable", task, HasSubstr(ok)},
      {"get", task, HasSubstr(R"("is_task_runnable":true)")},
  };
  for (const auto& step : steps) EXPECT_THAT(Api(step.method, step.params), step.answer) << step.method;
  const long schedule = Number(Api("get", task), "schedule_id");
  EXPECT_TRUE(Exists("/velt-dev/scheduler/" + std::to_string(schedule) + ".json")) << schedule;

  PlugIn(false);
  EXPECT_THAT(Api("get", task),
              AllOf(HasSubstr(R"("is_usb_mounted":false)"), HasSubstr(R"("source_path":"[USB]/DCIM")")));
  PlugIn(true);
  TwoPhotos();
  EXPECT_THAT(Api("run", task), HasSubstr(ok));
  EXPECT_TRUE(Eventually([this] { return PhotosArrived(); }));
  EXPECT_TRUE(Eventually([&] { return Api("get", task).find(R"("status":"idle")") != std::string::npos; }));
  EXPECT_THAT(Api("cancel", task), HasSubstr(ok));  // nothing runs: as the user wants it
  EXPECT_THAT(Api("delete", task), HasSubstr(ok));
  EXPECT_THAT(Api("get", task), HasSubstr(R"("success":false)"));
}

// Clients that send nothing, half a request or garbage hold at most their
// own worker: a normal client is answered while they are still connected.
TEST_F(PlovodServingTest, HostileClientsHoldNoOneElseUp) {
  ASSERT_EQ(Service("start"), 0);
  const unsigned long id = AddTask("Card");
  const struct { const char* name; std::string bytes; int count; bool kept; } cases[] = {
      {"garbage", std::string("\xff\x00garbage\x42\x10\xff\xff", 13), 1, false},
      {"half a request", kListTask.substr(0, 12), 1, true},
      {"silent", "", CommandServer::kWorkers - 1, true},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    std::vector<int> held;
    for (int i = 0; i < c.count; ++i) {
      held.push_back(Connect());
      ASSERT_GE(held.back(), 0);
      ASSERT_EQ(send(held.back(), c.bytes.data(), c.bytes.size(), MSG_NOSIGNAL), static_cast<ssize_t>(c.bytes.size()));
    }
    EXPECT_TRUE(Answers());
    EXPECT_EQ(Task(id)["task_name"].asStringRef(), "Card");
    char byte;
    // Not dropped for their time limit yet: the answers came while they were held.
    for (int fd : held) EXPECT_TRUE(!c.kept || (recv(fd, &byte, 1, MSG_DONTWAIT) < 0 && errno == EAGAIN));
    for (int fd : held) close(fd);
  }
}

// A thousand clients at once, half of them sending a request and hanging
// up before the answer; some connects may be refused with the queue full.
TEST_F(PlovodServingTest, AThousandClientsAtOnceLeaveItServing) {
  ASSERT_EQ(Service("start"), 0);
  const pid_t pid = DaemonPid();
  std::vector<int> connected;
  for (int i = 0; i < 1000; ++i) {
    const int fd = Connect(true);
    if (fd >= 0 && i % 2 == 0) send(fd, kListTask.data(), kListTask.size(), MSG_NOSIGNAL);
    if (fd >= 0) connected.push_back(fd);
  }
  EXPECT_FALSE(connected.empty());
  for (int fd : connected) close(fd);
  // Until the workers have drained the queue a new client is refused too.
  EXPECT_TRUE(Eventually(Answers));
  EXPECT_TRUE(Running(pid));
}

TEST_F(PlovodServingTest, ALongRunDelaysNoCommandAndLeavesNoPartialFile) {
  ASSERT_EQ(Service("start"), 0);
  const unsigned long id = AddTask("Card");
  BigSource();
  ASSERT_EQ(Send(OnTask("run_task", id))["ack"].asStringRef(), "ok");
  const PObject listed = List();
  ASSERT_EQ(listed["task_list"].asArray().size(), 1u) << listed.asString();
  EXPECT_EQ(listed["task_list"].asArray()[0]["task_status"].asStringRef(), "running") << listed.asString();
  EXPECT_EQ(Task(id)["task_name"].asStringRef(), "Card");
  const PObject cancelled = Send(OnTask("cancel_task", id));
  // A run that ended between the two commands is not running any more (8).
  const bool stopped = cancelled["ack"].asStringRef() == "ok";
  EXPECT_TRUE(stopped || cancelled["error_code"].asInt64() == 8) << cancelled.asString();
  EXPECT_TRUE(Eventually([id] { return Idle(id); }));
  EXPECT_EQ(Task(id)["error_code"].asInt64(), stopped ? P_ERR_STOPPED : 0);
  struct stat copied {};
  if (stat(Path("/volume1/photo/card/big.bin").c_str(), &copied) == 0) {
    EXPECT_EQ(copied.st_size, 2L << 30);
  }
  for (const auto& entry : std::filesystem::directory_iterator(Path("/volume1/photo/card")))
    EXPECT_NE(entry.path().filename().string().rfind(".plovo-", 0), 0u) << entry.path();
}

TEST_F(PlovodNotifierTest, ScheduledRunPlugInAndRemoval) {
  ASSERT_EQ(Service("start"), 0);
  const unsigned long id = AddTask("Card");
  TwoPhotos();
  EXPECT_EQ(Tool(PLOVO_NOTIFIER_PATH, "--execute-task " + std::to_string(id)), 0) << ReadFile("/tools.err");
  EXPECT_TRUE(Eventually([this] { return PhotosArrived(); }));
  ASSERT_TRUE(Eventually([id] { return Idle(id); }));

  // Pulled out while it copies: the run ends cancelled.
  BigSource();
  ASSERT_EQ(Send(OnTask("run_task", id))["ack"].asStringRef(), "ok");
  EXPECT_EQ(Tool(PLOVO_NOTIFIER_PATH, "--device-removed usbshare1"), 0) << ReadFile("/tools.err");
  EXPECT_TRUE(Eventually([id] { return Idle(id); }));
  EXPECT_EQ(Task(id)["error_code"].asInt64(), P_ERR_STOPPED);
  unlink(Path("/usbshare1/DCIM/big.bin").c_str());

  // Plugged in: nothing runs until the device's tasks run on plug-in.
  std::filesystem::remove_all(Path("/volume1/photo/card"));
  EXPECT_EQ(Tool(PLOVO_NOTIFIER_PATH, "--device-added usbshare1"), 0) << ReadFile("/tools.err");
  EXPECT_TRUE(Idle(id));
  EXPECT_FALSE(Exists("/volume1/photo/card"));
  PObject trigger = OnTask("set_trigger_time_setting", id);
  for (const char* key : {"eject_when_task_done", "schedule_enabled"}) trigger[key] = 0;
  trigger["run_when_plug_in"] = 1;
  trigger["schedule_json_str"] = "{}";
  ASSERT_EQ(Send(trigger)["ack"].asStringRef(), "ok");
  EXPECT_EQ(Tool(PLOVO_NOTIFIER_PATH, "--device-added usbshare1"), 0) << ReadFile("/tools.err");
  EXPECT_TRUE(Eventually([this] { return PhotosArrived(); }));
}

}  // namespace
