// plovod as a NAS runs it: the real program started by the package's
// service control or in the foreground, driven through its socket, its
// files, the module (plovo-api) and plovo-notifier.
#include <gmock/gmock.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

#include "daemon-sandbox.h"
#include "emulation.h"
#include "ipc/command-server.h"
#include "ipc/error-code.h"

namespace {

using plovo_test::Eventually;
using plovo_test::Running;
using testing::AllOf;
using testing::HasSubstr;
using testing::Not;

const char* const kPidFile = "/var/run/plovod.pid";
const char* const kSocket = "/tmp/plovo-socket";
// A whole "list_task" request on the wire: a map of one string pair.
const std::string kListTask("\x42\x10\x00\x06" "action" "\x10\x00\x09" "list_task" "\x40", 23);

// The number after "key": in a JSON text; -1 when it is not there.
long Number(const std::string& json, const std::string& key) {
  const size_t at = json.find("\"" + key + "\":");
  return at == std::string::npos ? -1 : std::stol(json.substr(at + key.size() + 3));
}

class PlovodTest : public plovo_test::DaemonSandboxTest {
 protected:
  void SetUp() override {
    DaemonSandboxTest::SetUp();
    PLOVO_SKIP_UNLESS_TARGET_PROGRAMS_RUN();
  }
  bool Serving() const { return ReadFile("/var/packages/Plovo/etc/status") == "state=\"4\"\nerror=\"\"\n"; }
  bool Answers() { return Ok(Action("list_task")); }
  bool Gone() const { return !Exists(kSocket) && !Exists(kPidFile); }
  static int Connect(bool nonBlocking = false) {
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | (nonBlocking ? SOCK_NONBLOCK : 0), 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, Plovo::Path::DaemonSocket().c_str(), sizeof(address.sun_path) - 1);
    if (connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0) return fd;
    close(fd);
    return -1;
  }
  // A 2 GiB source file that costs no disk: no run copies it within one
  // command's round trip.
  void BigSource() const {
    WriteFile("/usbshare1/DCIM/big.bin", "");
    std::filesystem::resize_file(Path("/usbshare1/DCIM/big.bin"), 2L << 30);
  }
  // The two photos in a version folder of the card's versioning task.
  bool PhotosArrived() const {
    std::error_code error;
    for (const auto& version : std::filesystem::directory_iterator(Path("/volume1/photo/card"), error)) {
      const std::string folder = "/volume1/photo/card/" + version.path().filename().string();
      if (ReadFile(folder + "/a.jpg") == "A" && ReadFile(folder + "/b.jpg") == "BB") return true;
    }
    return false;
  }
};

TEST_F(PlovodTest, OneDaemonThatKeepsItsTasksAndEndsCleanly) {
  ASSERT_EQ(Service("start"), 0);
  EXPECT_TRUE(Serving());
  const pid_t pid = DaemonPid();
  ASSERT_TRUE(Running(pid));
  const unsigned long card = Add(AddTaskRequest("Card")), second = Add(AddTaskRequest("Card2", "/DCIM", "/card2"));
  // A second daemon leaves the first one's pid file, socket and state alone.
  EXPECT_EQ(WaitExit(StartForeground()), 1) << ReadFile("/plovod.err");
  EXPECT_EQ(DaemonPid(), pid);
  EXPECT_TRUE(Answers());
  EXPECT_TRUE(Serving());

  EXPECT_EQ(Service("stop"), 0);
  EXPECT_TRUE(Eventually([pid] { return !Running(pid); }));
  EXPECT_TRUE(Gone());
  ASSERT_EQ(Service("start"), 0);
  EXPECT_EQ(Listed(card)["task_name"].asString() + Listed(second)["task_name"].asString(), "CardCard2");
  ASSERT_EQ(Service("stop"), 0);

  // In the foreground: how it is told to end, and its exit status.
  const struct { const char* how; int signal; int status; } cases[] = {
      {"SIGTERM", SIGTERM, 0},
      {"SIGINT", SIGINT, 0},
      {"stop command", 0, 0},
      {"no repository recorded", -1, 1},  // last: it empties setting.conf
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.how);
    if (c.signal < 0) WriteFile("/var/packages/Plovo/etc/setting.conf", "");
    unlink(Path("/var/packages/Plovo/etc/status").c_str());
    const pid_t foreground = StartForeground();
    ASSERT_TRUE(c.signal < 0 || Eventually([this] { return Serving(); })) << ReadFile("/plovod.err");
    if (c.signal > 0) kill(foreground, c.signal);
    if (c.signal == 0) Send(With(Action("stop"), "need_ack", Num(0)));
    EXPECT_EQ(WaitExit(foreground), c.status) << ReadFile("/plovod.err");
    EXPECT_TRUE(Gone());
  }
}

TEST_F(PlovodTest, ReadmeWalkThroughTheModule) {
  ASSERT_EQ(Service("start"), 0);
  const std::string created = Api("create", R"({"task": {"name": "Camera", "type": "import_general",
      "source_path": "/usbshare1/DCIM", "destination_path": "/photo/card", "copy_strategy": "versioning",
      "enable_rotation": true, "max_version_count": 10, "rotation_policy": "oldest_version",
      "run_when_plug_in": false, "eject_when_task_done": false, "schedule_enabled": false,
      "schedule_content": {}, "filter": {}}})");
  ASSERT_THAT(created, HasSubstr(R"("success":true)"));
  const std::string id = "\"id\": " + std::to_string(Number(created, "task_id"));
  const std::string task = "{" + id + "}";
  const auto ok = HasSubstr(R"({"success":true,"data":null})");
  const struct { const char* method; std::string params; testing::Matcher<std::string> answer; } steps[] = {
      {"list", "", HasSubstr(R"("name":"Camera")")},
      {"get", task, AllOf(HasSubstr(R"("is_usb_mounted":true)"), HasSubstr(R"("source_path":"/usbshare1/DCIM")"))},
      {"set_setting", "{" + id + R"(, "task_setting": {"name": "Card", "type": "import_general",
          "source_path": "/usbshare1/DCIM", "destination_path": "/photo/card", "copy_strategy": "versioning",
          "enable_rotation": true, "max_version_count": 5, "rotation_policy": "oldest_version"}})", ok},
      {"get", task, HasSubstr(R"("name":"Card")")},
      {"set_trigger_time", "{" + id + R"(, "trigger_time": {"run_when_plug_in": false,
          "eject_when_task_done": false, "schedule_enabled": true,
          "schedule_content": {"week_day": "1,3", "hour": 7, "minute": 30, "repeat_date": 0}}})",
       HasSubstr(R"("success":true)")},
      {"get", task, AllOf(HasSubstr(R"("success":true)"), Not(HasSubstr(R"("next_run_time":"N/A")")))},
      {"set_filter", "{" + id + R"(, "task_filter": {"white_list": {"extensions": ["jpg"], "names": []},
          "black_list": {"extensions": [], "names": ["Thumbs.db"]},
          "customized_list": {"extensions": ["raw"], "names": ["DSC"]}}})", ok},
      {"get_filter", task, AllOf(HasSubstr(R"("white_list":{"extensions":["jpg"],"names":[]})"),
                                 HasSubstr(R"("black_list":{"extensions":[],"names":["Thumbs.db"]})"),
                                 HasSubstr(R"("customized_list":{"extensions":["raw"],"names":["DSC"]})"))},
      {"disable", task, ok},
      {"get", task, HasSubstr(R"("is_task_runnable":false)")},
      {"run", task, HasSubstr(R"("success":false)")},
      {"enable", task, ok},
      {"get", task, HasSubstr(R"("is_task_runnable":true)")},
  };
  for (const auto& step : steps) EXPECT_THAT(Api(step.method, step.params), step.answer) << step.method;
  EXPECT_TRUE(Exists(EntryPath(Number(Api("get", task), "schedule_id"))));

  PlugIn(false);
  EXPECT_THAT(Api("get", task),
              AllOf(HasSubstr(R"("is_usb_mounted":false)"), HasSubstr(R"("source_path":"[USB]/DCIM")")));
  PlugIn(true);
  WriteFile("/usbshare1/DCIM/a.jpg", "A");
  WriteFile("/usbshare1/DCIM/b.jpg", "BB");
  EXPECT_THAT(Api("run", task), ok);
  EXPECT_TRUE(Eventually([this] { return PhotosArrived(); }));
  EXPECT_TRUE(Eventually([&] { return Api("get", task).find(R"("status":"idle")") != std::string::npos; }));
  // The log screen's page: the run's end, then its start.
  EXPECT_THAT(Api("get_log_list", R"({"limit": 2, "offset": 0, "log_filter": {"log_desc_id_list": [1, 2]}})"),
              HasSubstr(R"("description_id":2,"description_parameter":"[\"Card\",\"2\",\"3\",\"0\"]")"));
  EXPECT_THAT(Api("cancel", task), ok);  // nothing runs: as the user wants it
  EXPECT_THAT(Api("delete", task), ok);
  EXPECT_THAT(Api("get", task), HasSubstr(R"("success":false)"));
}

// Clients that send nothing, half a request or garbage hold at most their
// own worker: a normal client is answered while they are still connected.
// A thousand at once, half of them hanging up before the answer, leave it
// serving; some of their connects may be refused with the queue full.
TEST_F(PlovodTest, HostileAndManyClientsHoldNoOneElseUp) {
  ASSERT_EQ(Service("start"), 0);
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
    char byte;
    // Not dropped for their time limit yet: the answer came while they were held.
    for (int fd : held) EXPECT_TRUE(!c.kept || (recv(fd, &byte, 1, MSG_DONTWAIT) < 0 && errno == EAGAIN));
    for (int fd : held) close(fd);
  }

  std::vector<int> connected;
  for (int i = 0; i < 1000; ++i) {
    const int fd = Connect(true);
    if (fd >= 0 && i % 2 == 0) send(fd, kListTask.data(), kListTask.size(), MSG_NOSIGNAL);
    if (fd >= 0) connected.push_back(fd);
  }
  EXPECT_FALSE(connected.empty());
  for (int fd : connected) close(fd);
  EXPECT_TRUE(Eventually([this] { return Answers(); }));  // new clients wait until the queue drains
  EXPECT_TRUE(Running(DaemonPid()));
}

TEST_F(PlovodTest, LongRunsAndTheNotifier) {
  ASSERT_EQ(Service("start"), 0);
  const unsigned long id = Add(AddTaskRequest("Card"));
  // A long run delays no command, and one cancelled while it copies leaves
  // no partial file.
  BigSource();
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  ASSERT_TRUE(Eventually([&] { return !Listed(id)["copy_file_path"].asStringRef().empty(); }));
  EXPECT_EQ(Get(id)["task_name"].asStringRef(), "Card");
  const PObject cancelled = Do(OnTask("cancel_task", id));
  // A run that ended between the two commands is not running any more (8).
  const bool stopped = cancelled["ack"].asStringRef() == "ok";
  EXPECT_TRUE(stopped || cancelled["error_code"].asInt64() == 8) << cancelled.toString();
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), stopped ? P_ERR_STOPPED : 0);
  std::error_code absent;
  EXPECT_TRUE(std::filesystem::file_size(Path("/volume1/photo/card/big.bin"), absent) == 2ul << 30 || absent);
  for (const auto& entry : std::filesystem::directory_iterator(Path("/volume1/photo/card")))
    EXPECT_NE(entry.path().filename().string().rfind(".plovo-", 0), 0u) << entry.path();

  // A scheduled run, and a run that ends when its device is pulled out.
  unlink(Path("/usbshare1/DCIM/big.bin").c_str());
  WriteFile("/usbshare1/DCIM/a.jpg", "A");
  WriteFile("/usbshare1/DCIM/b.jpg", "BB");
  EXPECT_EQ(Notify("--execute-task " + std::to_string(id)), 0) << ReadFile("/tools.err");
  EXPECT_TRUE(Eventually([this] { return PhotosArrived(); }));
  WaitIdle(id);
  BigSource();
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  EXPECT_EQ(Notify("--device-removed usbshare1"), 0) << ReadFile("/tools.err");
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), P_ERR_SHARE_NOT_MOUNTED);

  // Plugged in: nothing runs until the device's tasks run on plug-in.
  unlink(Path("/usbshare1/DCIM/big.bin").c_str());
  std::filesystem::remove_all(Path("/volume1/photo/card"));
  EXPECT_EQ(Notify("--device-added usbshare1"), 0) << ReadFile("/tools.err");
  EXPECT_EQ(Listed(id)["task_status"].asStringRef(), "idle");
  EXPECT_FALSE(Exists("/volume1/photo/card"));
  ASSERT_TRUE(Ok(Trigger(id, "{}", true)));
  EXPECT_EQ(Notify("--device-added usbshare1"), 0) << ReadFile("/tools.err");
  EXPECT_TRUE(Eventually([this] { return PhotosArrived(); }));
}

}  // namespace
