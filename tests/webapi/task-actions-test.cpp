// The task methods through Process against the test daemon: the request the
// daemon receives and the answer the web interface gets.
#include <dlfcn.h>
#include <sys/syscall.h>
#include <json/reader.h>
#include <syslog.h>
#include <sys/wait.h>
#include <unistd.h>
#include <velt/dev.h>
#include <velt/sched.h>

#include <atomic>
#include <cstdarg>
#include <map>
#include <cerrno>
#include <memory>
#include <sstream>
#include <thread>

#include "common/utility.h"
#include "log-capture.h"
#include "test-daemon.h"
#include "webapi-test-util.h"

namespace {

using plovo_test::DaemonAnswer;
using plovo_test::LogCapture;

Json::Value J(const std::string& text) {
  Json::Value value;
  std::istringstream in(text);
  in >> value;
  return value;
}

// JSON as the web server writes it: an unsigned and a signed 12 are alike.
std::string Text(const Json::Value& value) { return Plovo::JsonToString(value); }

PObject ErrorReply(int code) {
  PObject reply;
  reply["error"] = "failed";
  reply["error_code"] = code;
  return reply;
}

// A complete import task as the creation screen sends it.
const char* const kNewTask = R"({"task": {"name": "Trip", "type": "import_general",
  "source_path": "/usbshare1/DCIM", "destination_path": "/photo/album/trip",
  "copy_strategy": "incremental", "not_keep_dir_structure": true, "conflict_policy": "overwrite",
  "smart_create_date_dir": true, "rename_photo_video": true, "remove_src_file": false,
  "run_when_plug_in": true, "eject_when_task_done": false, "schedule_enabled": true,
  "schedule_content": {"hour": 3},
  "filter": {"white_list": {"extensions": ["jpg"], "names": []},
             "black_list": {"extensions": [], "names": ["tmp"]},
             "customized_list": {"extensions": [], "names": []}}}})";

// Every task method with a request that passes the checks.
const char* const kSetting = R"({"id": 5, "task_setting": {"type": "import_general", "source_path": "/u", "destination_path": "/p"}})";
const struct {
  const char* method;
  const char* params;
  const char* action;  // the command the daemon receives
  const char* check;   // a member of the answer's data, or "" for null data
} kCalls[] = {{"list", "{}", "list_task", "tasks"},
              {"get", R"({"id": 5})", "get_task_setting", "task"},
              {"create", kNewTask, "add_task", "task_id"},
              {"get_filter", R"({"id": 5})", "get_filter_setting", "task_filter"},
              {"set_setting", kSetting, "set_task_setting", ""},
              {"set_trigger_time", R"({"id": 5, "trigger_time": {}})", "set_trigger_time_setting", "next_run_time"},
              {"set_filter", R"({"id": 5, "task_filter": {}})", "set_filter_setting", ""},
              {"delete", R"({"id": 5})", "remove_task", ""},
              {"run", R"({"id": 5})", "run_task", ""},
              {"cancel", R"({"id": 5})", "cancel_task", ""},
              {"enable", R"({"id": 5})", "enable_task", ""},
              {"disable", R"({"id": 5})", "disable_task", ""}};

// Service running, a USB share usbshare1 on a device without identity, and
// a daemon on the sandbox socket.
class TaskActionTest : public plovo_test::WebApiTest {
 protected:
  void SetUp() override {
    WebApiTest::SetUp();
    WriteStatus(4, "");
    MakeDir("/tmp");
    MakeDir("/usbshare1");
    WriteFile("/dev/usb1", "");
    WriteFile("/velt-dev/storage.json",
              R"({"shares": [{"name": "usbshare1", "dev_path": "dev/usb1"}],
                  "devices": [{"producer": "Acme", "product": "Stick",
                               "partitions": [{"share_name": "usbshare1"}]}]})");
    daemon_ = std::make_unique<plovo_test::TestDaemon>();
  }
  void TearDown() override {
    daemon_.reset();
    VeltDevClearFaults();
    WebApiTest::TearDown();
  }
  // Saves a scheduler entry firing at 09:30 on Mondays; returns its id.
  int64_t SaveSchedule(bool enabled) {
    PVELTSCHEDTASK task = VELTSchedTaskAlloc();
    Json::Value timetable = J(R"({"schedule": {"week_name": "1", "hour": 9, "min": 30, "repeat": 0}})");
    int64_t id = -1;
    EXPECT_EQ(VELTSchedTaskConvertFromJson_Schedule(timetable, task), 0);
    EXPECT_EQ(VELTSchedCTaskSetState(task, enabled), 0);
    EXPECT_EQ(VELTSchedTaskSave(task), 0);
    EXPECT_EQ(VELTSchedCTaskGetID(task, &id), 0);
    VELTSchedTaskFree(task);
    return id;
  }
  std::unique_ptr<plovo_test::TestDaemon> daemon_;
};

// Every method that forwards maps the daemon's reason the same way; only
// create attaches the device's share to a 403.
TEST_F(TaskActionTest, DaemonFailuresMapToWebErrors) {
  const int codes[][2] = {{3, 403}, {9, 410}, {10, 413}, {4, 401}, {-1, 401}};
  for (const auto& m : kCalls) {
    for (const auto& code : codes) {
      PObject reply = code[0] < 0 ? PObject() : ErrorReply(code[0]);
      if (code[0] < 0) reply["error"] = "failed";  // no "error_code" at all
      daemon_->Answer(DaemonAnswer::Reply(reply));
      LogCapture log;
      VELT::APIResponse r = Call(m.method, J(m.params));
      EXPECT_EQ(r.GetErrorCode(), code[1]) << m.method << " " << code[0] << "\n" << log.Dump();
      EXPECT_EQ(log.Contains(LOG_ERR, "no error_code!!!"), code[0] < 0);
      const bool shareNamed = std::string(m.method) == "create" && code[1] == 403;
      EXPECT_EQ(Text(r.GetData()), Text(shareNamed ? J(R"({"usb_share_name": "usbshare1"})") : Json::Value()))
          << m.method;
    }
  }
}

TEST_F(TaskActionTest, CancelOfATaskWithNothingToStopSucceeds) {
  daemon_->Answer(DaemonAnswer::Reply(ErrorReply(8)));
  EXPECT_TRUE(Call("cancel", J(R"({"id": 3})")).IsSuccess());
  EXPECT_EQ(Call("run", J(R"({"id": 3})")).GetErrorCode(), 401);

  // A code is the daemon's word only in an answer that arrived whole.
  const std::string code8 = std::string("\x42\x10\x00\x0a" "error_code" "\x01\x01\x08", 17);
  const std::string code3 = std::string("\x42\x10\x00\x0a" "error_code" "\x01\x01\x03", 17);
  daemon_->Answer(DaemonAnswer::Bytes(code8));
  EXPECT_EQ(Call("cancel", J(R"({"id": 3})")).GetErrorCode(), 401);
  daemon_->Answer(DaemonAnswer::Bytes(code3 + "\x77"));
  EXPECT_EQ(Call("run", J(R"({"id": 3})")).GetErrorCode(), 401);
}

TEST_F(TaskActionTest, BadRequestsAreRefusedBeforeTheDaemonHearsOfThem) {
  const struct {
    const char* method;
    const char* params;
    int code;
  } cases[] = {
      {"delete", R"({"id": "seven"})", 402},
      {"run", R"({"id": -1})", 402},
      {"get", "{}", 402},
      {"get_filter", R"({"id": 1.5})", 402},
      {"set_filter", R"({"id": 1, "task_filter": []})", 402},
      {"set_filter", R"({"id": 1, "task_filter": {"black_list": {"names": "tmp"}}})", 402},
      {"set_trigger_time", R"({"id": 1, "trigger_time": {"run_when_plug_in": "yes"}})", 402},
      {"set_setting", R"({"task_setting": {"type": "import_general", "source_path": "/u", "destination_path": "/p"}})", 402},
      {"set_trigger_time", R"({"trigger_time": {}})", 402},
      {"set_filter", R"({"task_filter": {}})", 402},
      {"create", R"({"task": "x"})", 402},
      {"create", R"({"task": {"type": "export", "name": "T", "source_path": "/a", "destination_path": "/b"}})", 402},
      {"create", R"({"task": {"type": "Import_General", "name": "T", "source_path": "/a", "destination_path": "/b"}})", 402},
      {"create", R"({"task": {"type": "import_general", "source_path": "", "destination_path": "/b"}})", 402},
      {"create", R"({"task": {"type": "import_general", "source_path": "/a", "destination_path": "/b",
                    "copy_strategy": "versioning", "max_version_count": "many"}})", 402},
      {"create", R"({"task": {"type": "import_general", "source_path": "/usbshare1", "destination_path": "/photo/../etc"}})", 414},
      {"create", R"({"task": {"type": "export_general", "source_path": "/photo", "destination_path": "/usbshare1/c:"}})", 414},
      {"set_setting", R"({"id": 1, "task_setting": {"type": "import_general", "source_path": "/u/./a", "destination_path": "/p"}})", 414},
      // A share name is one name: never a step out of the shares' folder.
      {"create", R"({"task": {"type": "import_general", "source_path": "/usbshare1", "destination_path": "/../etc"}})", 414},
      {"create", R"({"task": {"type": "export_general", "source_path": "/photo", "destination_path": "/./x"}})", 414},
      {"set_setting", R"({"id": 1, "task_setting": {"type": "import_general", "source_path": "/u", "destination_path": "//etc"}})", 414},
      {"set_setting", R"({"id": 1, "task_setting": {"type": "import_general", "source_path": "/u", "destination_path": "/.."}})", 414},
      // A zero byte would end the string early on its way: what was checked
      // would not be what is used.
      {"set_setting", R"({"id": 1, "task_setting": {"type": "import_general", "source_path": "/u/a", "destination_path": "/photo/..\u0000"}})", 402},
      {"create", R"({"task": {"type": "import_general", "name": "T\u0000", "source_path": "/usbshare1", "destination_path": "/photo"}})", 402},
      {"delete", R"({"id": 1, "x\u0000y": true})", 402},
      {"set_filter", R"({"id": 1, "task_filter": {"black_list": {"names": ["a", ["\u0000"]]}}})", 402},
  };
  for (const auto& c : cases) {
    VELT::APIResponse r = Call(c.method, J(c.params));
    EXPECT_EQ(r.GetErrorCode(), c.code) << c.method << " " << c.params;
  }
  EXPECT_EQ(daemon_->Connections(), 0);
}

TEST_F(TaskActionTest, CreateSendsTheResolvedDeviceAndAnswersTheNewId) {
  PObject ok;
  ok["ack"] = "ok";
  ok["task_id"] = 12;
  daemon_->Answer(DaemonAnswer::Reply(ok));
  VELT::APIResponse r = Call("create", J(kNewTask));
  ASSERT_TRUE(r.IsSuccess()) << r.GetErrorCode();
  EXPECT_EQ(Text(r.GetData()), Text(J(R"({"task_id": 12})")));
  PObject sent = daemon_->LastRequest();
  EXPECT_EQ(sent["uuid"].asString().size(), 36u);  // a new identity for this device
  EXPECT_EQ(sent["usb_share_path"].asString(), Path("/usbshare1"));
  sent.asMap().erase("uuid");
  sent.asMap().erase("usb_share_path");
  EXPECT_EQ(sent.toString(),
            R"({"action": "add_task", "black_ext": [], "black_name": ["tmp"], "conflict_policy": 2, )"
            R"("copy_strategy": 3, "custom_ext": [], "custom_name": [], "eject_when_task_done": 0, )"
            R"("enable_rotation": 0, "keep_dir_structure": 0, "max_version_count": 256, )"
            R"("nas_folder_path": "/album/trip", "nas_share_name": "photo", "need_ack": 1, )"
            R"("producer": "Acme", "product": "Stick", "remove_src_file": 0, "rename_photo_video": 1, )"
            R"("rotation_policy": 1, "run_when_plug_in": 1, "schedule_enabled": 1, )"
            R"("schedule_json_str": "{"hour":3}", "smart_create_date_dir": 1, "task_name": "Trip", )"
            R"("task_type": 1, "usb_folder_path": "/DCIM", "white_ext": ["jpg"], "white_name": []})");

  // A share that cannot be resolved fails in building: 411, nothing sent.
  const int before = daemon_->Connections();
  Json::Value other = J(kNewTask);
  other["task"]["source_path"] = "/usbshare9";
  EXPECT_EQ(Call("create", other).GetErrorCode(), 411);
  EXPECT_EQ(daemon_->Connections(), before);
}

// An edit names the requested strategy, but the strategy is fixed at
// creation: only that strategy's keys are read and none is sent.
TEST_F(TaskActionTest, SetSettingReadsOnlyTheRequestedStrategysKeys) {
  const std::string common =
      R"("name": "N", "type": "export_general", "source_path": "/photo", "destination_path": "/usbshare2/out",
         "enable_rotation": true, "max_version_count": 9, "rotation_policy": "smart_recycle",
         "conflict_policy": "overwrite", "not_keep_dir_structure": true, "smart_create_date_dir": true,
         "rename_photo_video": true)";
  const struct {
    const char* strategy;
    const char* expected;  // the keys that depend on it
  } cases[] = {
      {"mirror", "conflict=1 keep=1 rotation=0/256/1"},
      {"versioning", "conflict=1 keep=1 rotation=1/9/2"},
      {"incremental", "conflict=2 keep=0 rotation=0/256/1"},
  };
  for (const auto& c : cases) {
    VELT::APIResponse r = Call("set_setting", J(R"({"id": 4, "task_setting": {)" + common +
                                                R"(, "copy_strategy": ")" + c.strategy + "\"}}"));
    ASSERT_TRUE(r.IsSuccess()) << c.strategy;
    const PObject sent = daemon_->LastRequest();
    EXPECT_FALSE(sent.hasMember("copy_strategy"));
    // The task's identity goes along with every edit.
    EXPECT_EQ(sent["action"].asString() + " " + sent["nas_share_name"].asString() + " " + sent["nas_folder_path"].asString() +
                  " " + sent["usb_folder_path"].asString() + " " + sent["task_name"].asString() + " " +
                  std::to_string(sent["task_id"].asUInt64()) + " " + std::to_string(sent["task_type"].asUInt64()),
              "set_task_setting photo / /out N 4 2");
    std::ostringstream keys;
    keys << "conflict=" << sent["conflict_policy"].asUInt64() << " keep=" << sent["keep_dir_structure"].asUInt64()
         << " rotation=" << sent["enable_rotation"].asUInt64() << "/" << sent["max_version_count"].asUInt64()
         << "/" << sent["rotation_policy"].asUInt64();
    EXPECT_EQ(keys.str(), c.expected) << c.strategy;
  }
}

TEST_F(TaskActionTest, FiltersGoOutAsListsAndComeBackAsTheScreensObject) {
  ASSERT_TRUE(Call("set_filter", J(R"({"id": 2, "task_filter": {"white_list": {"names": ["a", "b"]},
                                       "customized_list": {"extensions": ["raw"]}}})")).IsSuccess());
  EXPECT_EQ(daemon_->LastRequest().toString(),
            R"({"action": "set_filter_setting", "black_ext": [], "black_name": [], "custom_ext": ["raw"], )"
            R"("custom_name": [], "need_ack": 1, "task_id": 2, "white_ext": [], "white_name": ["a", "b"]})");

  PObject reply;
  reply["ack"] = "ok";
  reply["white_ext"].asArray().push_back(PObject("jpg"));
  reply["black_name"].asArray().push_back(PObject("tmp"));
  reply["black_name"].asArray().push_back(PObject(uint64_t{7}));
  daemon_->Answer(DaemonAnswer::Reply(reply));
  VELT::APIResponse r = Call("get_filter", J(R"({"id": 2})"));
  ASSERT_TRUE(r.IsSuccess());
  EXPECT_EQ(daemon_->LastRequest().toString(), R"({"action": "get_filter_setting", "need_ack": 1, "task_id": 2})");
  EXPECT_EQ(Text(r.GetData()), Text(J(R"({"task_filter": {
      "white_list": {"extensions": ["jpg"], "names": []},
      "black_list": {"extensions": [], "names": ["tmp", "7"]},
      "customized_list": {"extensions": [], "names": []}}})")));
}

PObject TaskMap(uint64_t type, bool mounted, bool isDefault, const char* source, const char* destination) {
  PObject task;
  task["id"] = uint64_t{5};
  task["type"] = type;
  task["uuid"] = isDefault ? "PLOVO_DEFAULT_SD_UUID" : "2b1e";
  task["is_default_task"] = isDefault;
  task["is_usb_mounted"] = mounted;
  task["usb_share_name"] = "usbshare1";
  task["source_path"] = source;
  task["destination_path"] = destination;
  task["schedule_id"] = static_cast<uint64_t>(-1);
  return task;
}

TEST_F(TaskActionTest, ListShowsDevicePathsTheWayTheScreenDoes) {
  PObject reply;
  reply["ack"] = "ok";
  auto& list = reply["task_list"].asArray();
  list.push_back(TaskMap(1, true, false, "/DCIM", "/photo/trip"));
  list.push_back(TaskMap(3, false, true, "/", "/"));
  list.push_back(TaskMap(2, false, false, "/photo", "/backup"));
  list.push_back(TaskMap(1, true, false, "/", "/"));
  list.push_back(TaskMap(9, true, false, "/a", "/b"));
  daemon_->Answer(DaemonAnswer::Reply(reply));
  VELT::APIResponse r = Call("list");
  ASSERT_TRUE(r.IsSuccess());
  EXPECT_EQ(daemon_->LastRequest().toString(), R"({"action": "list_task", "need_ack": 1})");
  const Json::Value& tasks = r.GetData()["tasks"];
  ASSERT_EQ(tasks.size(), 5u);
  const char* const shown[] = {"import_general /usbshare1/DCIM /photo/trip NA", "import_photo [USB]  SD_CARD",
                               "export_general /photo [USB]/backup NA", "import_general /usbshare1 / NA"};
  for (int i = 0; i < 4; ++i) {
    EXPECT_EQ(tasks[i]["type"].asString() + " " + tasks[i]["source_path"].asString() + " " +
                  tasks[i]["destination_path"].asString() + " " + tasks[i]["default_device_port"].asString(),
              shown[i]);
  }
  EXPECT_EQ(tasks[4]["type"].asString(), "");
  EXPECT_FALSE(tasks[4].isMember("source_path") || tasks[4].isMember("destination_path"));

  daemon_->Answer(DaemonAnswer::Ok());
  EXPECT_EQ(Text(Call("list").GetData()), R"({"tasks":[]})");
}

TEST_F(TaskActionTest, GetAnswersTheWholeRecord) {
  PObject task = TaskMap(3, true, true, "/DCIM", "/photo");
  task["ack"] = "ok";
  task["uuid"] = "PLOVO_DEFAULT_USB_UUID";
  task["task_name"] = "Camera";
  task["task_status"] = "running";
  task["copy_file_path"] = "/DCIM/1.jpg";
  task["id"] = (uint64_t{1} << 63) + 5;
  task["latest_finish_time"] = (uint64_t{1} << 32) + 3000000000u;  // carried in 32 bits, unsigned
  for (const char* flag : {"is_task_runnable", "run_when_plug_in", "smart_create_date_dir", "remove_src_file",
                           "enable_rotation", "eject_when_task_done", "keep_dir_structure", "rename_photo_video"}) {
    task[flag] = true;
  }
  task["error_code"] = static_cast<uint64_t>(-2);
  task["copy_strategy"] = 3;
  task["conflict_policy"] = 2;
  task["max_version_count"] = uint64_t{1} << 40;
  task["rotation_policy"] = 3;
  daemon_->Answer(DaemonAnswer::Reply(task));
  VELT::APIResponse r = Call("get", J(R"({"id": 5})"));
  ASSERT_TRUE(r.IsSuccess());
  EXPECT_EQ(daemon_->LastRequest().toString(), R"({"action": "get_task_setting", "need_ack": 1, "task_id": 5})");
  EXPECT_EQ(Text(r.GetData()), Text(J(R"({"task": {"id": 9223372036854775813, "is_default_task": true,
      "default_device_port": "USB", "type": "import_photo", "name": "Camera", "status": "running",
      "copy_file_path": "/DCIM/1.jpg", "is_usb_mounted": true, "is_nas_mounted": false, "is_task_runnable": true,
      "latest_finish_time": 3000000000, "error_code": -2, "source_path": "/usbshare1/DCIM",
      "destination_path": "/photo", "run_when_plug_in": true, "eject_when_task_done": true,
      "copy_strategy": "incremental", "not_keep_dir_structure": false, "smart_create_date_dir": true,
      "rename_photo_video": true, "remove_src_file": true, "conflict_policy": "overwrite",
      "enable_rotation": true, "max_version_count": 1099511627776, "rotation_policy": "",
      "schedule_id": -1, "next_run_time": "N/A"}})")));
}

TEST_F(TaskActionTest, NextRunTimeComesFromAnEnabledSchedule) {
  WriteFile("/velt-dev/sched-now", "2026/11/21 10:00");  // a Saturday
  const int64_t enabled = SaveSchedule(true);
  const int64_t disabled = SaveSchedule(false);
  PObject list;
  list["ack"] = "ok";
  for (int64_t id : {enabled, disabled, disabled + 50}) {
    PObject task = TaskMap(1, true, false, "/", "/p");
    task["schedule_id"] = static_cast<uint64_t>(id);
    list["task_list"].asArray().push_back(task);
  }
  daemon_->Answer(DaemonAnswer::Reply(list));
  const Json::Value tasks = Call("list").GetData()["tasks"];
  EXPECT_EQ(tasks[0]["next_run_time"].asString(), "2026/11/23 09:30");
  EXPECT_EQ(tasks[1]["next_run_time"].asString() + tasks[2]["next_run_time"].asString(), "N/AN/A");

  // set_trigger_time sends the four trigger keys and answers the schedule
  // the daemon made.
  PObject reply;
  reply["ack"] = "ok";
  reply["schedule_id"] = static_cast<uint64_t>(enabled);
  daemon_->Answer(DaemonAnswer::Reply(reply));
  VELT::APIResponse r = Call("set_trigger_time", J(R"({"id": 1, "trigger_time": {"run_when_plug_in": true,
      "eject_when_task_done": false, "schedule_enabled": true, "schedule_content": {"week_day": "1"}}})"));
  EXPECT_EQ(Text(r.GetData()), R"({"next_run_time":"2026/11/23 09:30","schedule_id":)" + std::to_string(enabled) + "}");
  EXPECT_EQ(daemon_->LastRequest().toString(),
            R"({"action": "set_trigger_time_setting", "eject_when_task_done": 0, "need_ack": 1, )"
            R"("run_when_plug_in": 1, "schedule_enabled": 1, "schedule_json_str": "{"week_day":"1"}", "task_id": 1})");

  // No schedule: the scheduler is not asked at all.
  VeltDevFailCall("VELTSchedTaskAlloc", 1, 0, VLIBC_ERR_NO_MEMORY);
  PObject task = TaskMap(1, true, false, "/", "/p");
  task["ack"] = "ok";
  daemon_->Answer(DaemonAnswer::Reply(task));
  LogCapture log;
  EXPECT_EQ(Call("get", J(R"({"id": 5})")).GetData()["task"]["next_run_time"].asString(), "N/A");
  EXPECT_FALSE(log.Contains("VELTSchedTask")) << log.Dump();
}

// The server may have given up root for good: create then leaves the
// request unanswered so that the server's own answer stands. The id change
// is taken over in this program to refuse the raise of the action (the third
// call in the request: the gate raises and restores first).
std::atomic<int> gSetresuidLeft{-1};

TEST_F(TaskActionTest, CreateWithoutRootLeavesTheRequestUnanswered) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to set up the ids";
  daemon_.reset();
  pid_t child = fork();
  if (child == 0) {
    if (setresuid(0, 65534, 0) != 0) _exit(10);
    gSetresuidLeft = 2;
    LogCapture log;
    VELT::APIResponse r = Call("create", J(kNewTask));
    if (r.AnswerCount() != 0) _exit(11);
    if (log.Contains("Failed to get daemon command")) _exit(13);
    _exit(0);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
}

// Eight server threads at once, every task method: each answered once and
// right, and each command reaching the daemon once per call.
TEST_F(TaskActionTest, ConcurrentRequestsAreEachAnsweredRight) {
  PObject reply = TaskMap(1, true, false, "/DCIM", "/p");
  reply["ack"] = "ok";
  reply["task_id"] = 12;
  reply["task_list"].asArray().push_back(TaskMap(2, true, false, "/p", "/o"));
  reply["white_name"].asArray().push_back(PObject("x"));
  daemon_->Answer(DaemonAnswer::Reply(reply));
  std::atomic<int> wrong{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 12; ++i) {
        const auto& c = kCalls[(t + i) % 12];
        VELT::APIResponse r = Call(c.method, J(c.params));
        const bool right = r.AnswerCount() == 1 && r.IsSuccess() &&
                           (*c.check ? r.GetData().isMember(c.check) : r.GetData().isNull());
        if (!right) ++wrong;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(wrong.load(), 0);
  // Counted by action, and the commands on one task by their whole text:
  // they carry just its id.
  std::map<std::string, int> received;
  for (const PObject& request : daemon_->Requests()) {
    ++received[request["action"].asString()];
    ++received[request.toString()];
  }
  for (const auto& c : kCalls) EXPECT_EQ(received[c.action], 8) << c.action;
  for (const char* action : {"remove_task", "run_task", "cancel_task", "enable_task", "disable_task"}) {
    EXPECT_EQ(received[std::string(R"({"action": ")") + action + R"(", "need_ack": 1, "task_id": 5})"], 8) << action;
  }
}

}  // namespace

// The guard changes the thread's ids with the raw system call. This passes
// every call through to the C library until gSetresuidLeft changes of the
// user id have been made, then refuses them. No other code of the program
// calls syscall() with more than the three arguments of these two calls.
extern "C" long syscall(long number, ...) {
  using Fn = long (*)(long, ...);
  static const Fn real = reinterpret_cast<Fn>(dlsym(RTLD_NEXT, "syscall"));
  va_list args;
  va_start(args, number);
  long a = va_arg(args, long), b = va_arg(args, long), c = va_arg(args, long);
  va_end(args);
  if (number == SYS_setresuid && gSetresuidLeft.load() == 0) {
    errno = EPERM;
    return -1;
  }
  if (number == SYS_setresuid && gSetresuidLeft.load() > 0) --gSetresuidLeft;
  return real(number, a, b, c);
}
