// plovod's command handler in this process, on a sandbox's repository: its
// refusals, what each kept change leaves on disk, that a failed change
// leaves nothing behind, and runs, with the default job and with one that
// blocks until it is cancelled.
#include <gmock/gmock.h>
#include <json/json.h>
#include <velt/dev.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <memory>
#include <thread>

#include "daemon-sandbox.h"
#include "daemon/daemon.h"
#include "db/task-db.h"
#include "filter/file-filter.h"
#include "ipc/error-code.h"

namespace {

namespace fs = std::filesystem;
using Strings = std::vector<std::string>;
using testing::ElementsAre;

constexpr const char* kTimetable = R"({"week_day":"1,3","hour":7,"minute":30,"repeat_date":0})";
const char* const kLists[] = {"white_name", "white_ext", "black_name", "black_ext", "custom_name", "custom_ext"};

PObject With(PObject request, const char* key, const PObject& value) {
  request[key] = value;
  return request;
}
PObject Num(uint64_t n) { return PObject(n); }
PObject List(const Strings& items) {
  PObject list;
  list.asArray();
  for (const std::string& item : items) list.asArray().push_back(item);
  return list;
}
PObject Action(const char* action) { return With(PObject(), "action", action); }
void Pause(int ms = 10) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }

class DaemonTest : public plovo_test::DaemonSandboxTest {
 protected:
  void TearDown() override {
    daemon_.reset();
    DaemonSandboxTest::TearDown();
  }
  void Start(plovod::Job job = plovod::CopyNewFiles) {
    daemon_ = std::make_unique<plovod::Daemon>(RepoPath(), false, [] {}, job);
    ASSERT_EQ(daemon_->Open(), 0);
  }
  PObject Do(const PObject& request) { return daemon_->Handle(request); }
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
  // Polls list_task (at most 5 s) until the task is idle; its map.
  PObject WaitIdle(unsigned long id) {
    for (int i = 0; i < 5000; ++i, Pause(1)) {
      PObject task = Listed(id);
      if (task["task_status"].asStringRef() == "idle") return task;
    }
    ADD_FAILURE() << "task " << id << " still runs";
    return PObject();
  }
  static PObject SetRequest(unsigned long id, const std::string& name, const std::string& usb = "/DCIM",
                            const std::string& nas = "/card") {
    return With(With(AddTaskRequest(name, usb, nas), "action", "set_task_setting"), "task_id", Num(id));
  }
  static PObject Trigger(unsigned long id, const std::string& timetable, bool plugIn = false) {
    PObject r = With(OnTask("set_trigger_time_setting", id), "schedule_json_str", timetable);
    r["run_when_plug_in"] = plugIn;
    r["eject_when_task_done"] = !plugIn;
    r["schedule_enabled"] = 1;
    return r;
  }

  std::string Db() const { return RepoPath() + "/db/task-db.sqlite"; }
  bool DeviceRow(TaskDB::USBInfo& row) const {
    TaskDB db;
    return db.Initialize(Db()) == 0 && db.GetUSBInfoByUUID(kUuid, row) == 1;
  }
  static std::string TaskDir(unsigned long id) { return std::string(kRepo) + "/task/" + std::to_string(id); }
  static std::string EntryPath(int64_t id) { return "/velt-dev/scheduler/" + std::to_string(id) + ".json"; }
  Json::Value Entry(int64_t id) const {
    std::ifstream in(Path(EntryPath(id)));
    Json::Value entry;
    Json::CharReaderBuilder builder;
    std::string errors;
    EXPECT_TRUE(Json::parseFromStream(builder, in, &entry, &errors)) << EntryPath(id);
    return entry;
  }
  // What lies below the folder, or only the names with that ending.
  size_t Entries(const std::string& systemDir, const std::string& ending = "") const {
    std::error_code ec;
    size_t n = 0;
    for (auto it = fs::recursive_directory_iterator(Path(systemDir), ec); !ec && it != fs::end(it); ++it) {
      const std::string name = it->path().filename();
      n += name.size() >= ending.size() && name.compare(name.size() - ending.size(), ending.size(), ending) == 0;
    }
    return n;
  }

  // A job that shows a file being copied and blocks until it is cancelled
  // (at most 5 s), so that a run in progress owes nothing to timing.
  plovod::Job Blocking() {
    return [this](const plovod::RunPlan&, plovod::RunControl& control) {
      control.SetCopying("/DCIM/a.jpg");
      started_ = true;
      for (int i = 0; i < 500 && !control.Cancelled(); ++i) Pause();
      cancelled_ = control.Cancelled();
      ended_ = true;
      return cancelled_ ? P_ERR_STOPPED : P_SUCCESS;
    };
  }
  void WaitStarted() {
    for (int i = 0; i < 500 && !started_; ++i) Pause();
    ASSERT_TRUE(started_);
  }

  std::atomic<bool> started_{false}, cancelled_{false}, ended_{false};
  std::atomic<int> runs_{0};
  std::unique_ptr<plovod::Daemon> daemon_;  // last: its runs use the flags above
};

TEST_F(DaemonTest, RefusalsCarryTheirCodeAndChangeNothing) {
  Start();
  const unsigned long card = Add(AddTaskRequest("Card"));
  const unsigned long away = Add(With(AddTaskRequest("Away"), "nas_share_name", "nowhere"));
  const unsigned long off = Add(AddTaskRequest("Off"));
  ASSERT_TRUE(Ok(OnTask("disable_task", off)));
  PObject mixed = List({"jpg"});
  mixed.asArray().push_back(Num(3));
  const PObject add = AddTaskRequest("New");
  // key: the argument a wrong-kind refusal names; "" when none is named.
  const struct {
    const char* what;
    PObject request;
    int code;
    const char* key;
  } cases[] = {
      {"unknown action", OnTask("frobnicate", card), 1, ""},
      {"task_id a string", With(OnTask("get_task_setting", card), "task_id", "1"), 2, "task_id"},
      {"task_id 0", OnTask("run_task", 0), 2, "task_id"},
      {"task_type 4", With(add, "task_type", Num(4)), 2, "task_type"},
      {"dot-dot folder", With(add, "usb_folder_path", "/a/../b"), 2, "usb_folder_path"},
      {"relative folder", With(add, "usb_folder_path", "DCIM"), 2, "usb_folder_path"},
      {"share with a slash", With(add, "nas_share_name", "a/b"), 2, "nas_share_name"},
      {"list with an integer", With(add, "white_ext", mixed), 2, "white_ext"},
      {"empty task name", With(add, "task_name", ""), 2, "task_name"},
      {"copy_strategy 0", With(add, "copy_strategy", Num(0)), 2, "copy_strategy"},
      {"timetable not json", With(add, "schedule_json_str", "not json"), 2, ""},
      {"name taken on add", With(add, "task_name", "Card"), 3, ""},
      {"name taken on set", SetRequest(away, "Card"), 3, ""},
      {"get of no task", OnTask("get_task_setting", 999), 4, ""},
      {"set of no task", SetRequest(999, "X"), 4, ""},
      {"run of no task", OnTask("run_task", 999), 4, ""},
      {"cancel of no task", OnTask("cancel_task", 999), 4, ""},
      {"remove of no task", OnTask("remove_task", 999), 4, ""},
      {"enable of no task", OnTask("enable_task", 999), 4, ""},
      {"cancel of an idle task", OnTask("cancel_task", card), 8, ""},
      {"run with the share missing", OnTask("run_task", away), 10, ""},
      {"run of a disabled task", OnTask("run_task", off), 11, ""},
  };
  for (const auto& c : cases) {
    const PObject answer = Do(c.request);
    EXPECT_EQ(answer["error_code"].asInt32(), c.code) << c.what << ": " << answer.toString();
    EXPECT_THAT(answer["error"].asStringRef(), testing::HasSubstr(c.key)) << c.what;
    EXPECT_FALSE(answer.hasMember("ack")) << c.what;
  }
  PlugIn(false);
  EXPECT_EQ(Code(OnTask("run_task", card)), 9);
  EXPECT_EQ(Do(Action("list_task"))["task_list"].asArray().size(), 3u);
  EXPECT_EQ(Get(away)["task_name"].asStringRef(), "Away");
}

TEST_F(DaemonTest, TaskSettingsRoundTripAndTakeOnlyTheirStrategysOptions) {
  Start();
  const unsigned long versioned = Add(AddTaskRequest("Ver"));
  const unsigned long incremental = Add(With(AddTaskRequest("Inc", "/DCIM", "/inc"), "copy_strategy", Num(3)));
  for (unsigned long id : {versioned, incremental}) {
    const std::string name = id == versioned ? "Ver2" : "Inc2";
    const PObject set = With(SetRequest(id, name, "/DCIM2", "/new"), "conflict_policy", Num(2));
    ASSERT_TRUE(Ok(With(set, "max_version_count", Num(9))));
    const PObject task = Get(id);
    EXPECT_EQ(task["task_name"].asStringRef(), name);
    EXPECT_EQ(task["source_path"].asStringRef(), "/DCIM2");
    EXPECT_EQ(task["destination_path"].asStringRef(), "/photo/new");
    EXPECT_EQ(task["conflict_policy"].asUInt64(), id == versioned ? 1u : 2u);
    EXPECT_EQ(task["max_version_count"].asUInt64(), id == versioned ? 9u : 256u);
    TaskDB db;
    TaskDB::TaskInfo row;
    ASSERT_EQ(db.Initialize(Db()), 0);
    ASSERT_EQ(db.GetTaskInfo(id, row), 1);
    EXPECT_EQ(row.task_name + row.usb_folder_path + row.nas_folder_path, name + "/DCIM2/new");
  }
}

TEST_F(DaemonTest, FilterListsRoundTripAndAFailedSetKeepsTheOldFiles) {
  Start();
  const unsigned long id = Add(AddTaskRequest("Card"));
  const Strings lists[] = {{"a", "b"}, {"jpg"}, {"tmp"}, {"bak", "old"}, {"x"}, {"raw"}};
  PObject set = OnTask("set_filter_setting", id);
  for (int i = 0; i < 6; ++i) set[kLists[i]] = List(lists[i]);
  ASSERT_TRUE(Ok(set));
  const PObject got = Do(OnTask("get_filter_setting", id));
  for (int i = 0; i < 6; ++i) EXPECT_EQ(got[kLists[i]].toString(), List(lists[i]).toString()) << kLists[i];

  const std::string dir = TaskDir(id);
  Strings names, exts;
  ASSERT_EQ(ReadWhiteList(Path(dir + "/whitelist.filter"), names, exts), 0);
  ASSERT_EQ(ReadBlackList(Path(dir + "/blacklist.filter"), names, exts), 0);
  EXPECT_THAT(names, ElementsAre("a", "b", "tmp"));
  EXPECT_THAT(exts, ElementsAre("jpg", "bak", "old"));
  EXPECT_THAT(ReadFile(dir + "/user.config"), testing::HasSubstr(R"("user_defined_extensions":["raw"])"));

  auto files = [&] { return ReadFile(dir + "/whitelist.filter") + ReadFile(dir + "/blacklist.filter") +
                            ReadFile(dir + "/user.config"); };
  const std::string before = files();
  set["white_name"] = List({"c"});
  set["black_ext"] = List({"bak", ""});  // after the white list is written
  EXPECT_EQ(Code(set), 2);
  EXPECT_EQ(files(), before);
  EXPECT_EQ(Entries(dir), 3u);
}

TEST_F(DaemonTest, TriggerLandsInTheSchedulerAndOnTheDeviceRow) {
  Start();
  const unsigned long id = Add(AddTaskRequest("Card"));
  const PObject set = Do(Trigger(id, kTimetable, true));
  const int64_t schedule = set["schedule_id"].asInt64();
  ASSERT_GT(schedule, 0) << set.toString();
  EXPECT_EQ(Get(id)["schedule_id"].asInt64(), schedule);
  EXPECT_EQ(Entry(schedule)["name"].asString(), "Card");
  EXPECT_THAT(Entry(schedule)["command"].asString(), testing::EndsWith(" --execute-task " + std::to_string(id)));
  TaskDB::USBInfo device;
  ASSERT_TRUE(DeviceRow(device));
  EXPECT_TRUE(device.run_when_plug_in);
  EXPECT_FALSE(device.eject_when_task_done);

  ASSERT_TRUE(Ok(SetRequest(id, "Renamed")));
  EXPECT_EQ(Entry(schedule)["name"].asString(), "Renamed");
  EXPECT_EQ(Do(Trigger(id, "{}"))["schedule_id"].asInt64(), -1);
  EXPECT_FALSE(Exists(EntryPath(schedule)));
  EXPECT_EQ(Get(id)["schedule_id"].asInt64(), -1);
}

TEST_F(DaemonTest, RemoveTakesRowFolderEntryAndTheLastTasksDeviceRow) {
  Start();
  const unsigned long first = Add(AddTaskRequest("Card"));
  const unsigned long second = Add(AddTaskRequest("Second", "/DCIM", "/b"));
  const int64_t schedule = Do(Trigger(first, kTimetable))["schedule_id"].asInt64();
  ASSERT_TRUE(Exists(EntryPath(schedule)));
  ASSERT_TRUE(Ok(OnTask("remove_task", first)));
  EXPECT_EQ(Code(OnTask("get_task_setting", first)), 4);
  EXPECT_FALSE(Exists(TaskDir(first)));
  EXPECT_FALSE(Exists(EntryPath(schedule)));
  TaskDB::USBInfo device;
  EXPECT_TRUE(DeviceRow(device));
  ASSERT_TRUE(Ok(OnTask("remove_task", second)));
  EXPECT_FALSE(DeviceRow(device));
}

TEST_F(DaemonTest, FailedAddLeavesNoRowFolderOrEntry) {
  Start();
  VeltDevFailCall("VELTSchedTaskSave", 1, 1, VLIBC_ERR_IO);
  EXPECT_NE(Code(With(AddTaskRequest("Card"), "schedule_json_str", kTimetable)), 0);
  EXPECT_EQ(Code(With(AddTaskRequest("Card"), "white_name", List({"a", ""}))), 2);
  EXPECT_TRUE(Do(Action("list_task"))["task_list"].asArray().empty());
  TaskDB::USBInfo device;
  EXPECT_FALSE(DeviceRow(device));
  EXPECT_EQ(Entries(std::string(kRepo) + "/task"), 0u);
  EXPECT_EQ(Entries("/velt-dev/scheduler", ".json"), 0u);
}

TEST_F(DaemonTest, TasksSurviveARestart) {
  Start();
  Add(AddTaskRequest("Card"));
  ASSERT_TRUE(Ok(Trigger(Add(AddTaskRequest("Second", "/DCIM", "/b")), kTimetable, true)));
  const PObject listed = Do(Action("list_task"));
  ASSERT_EQ(listed["task_list"].asArray().size(), 2u);
  daemon_.reset();
  Start();
  EXPECT_EQ(Do(Action("list_task")).toString(), listed.toString());
}

TEST_F(DaemonTest, RunCopiesWhatTheDestinationLacks) {
  WriteFile("/usbshare1/DCIM/a.jpg", "alpha");
  WriteFile("/usbshare1/DCIM/sub/b.jpg", "beta");
  WriteFile("/usbshare1/DCIM/@eaDir/thumb", "t");
  Start();
  const unsigned long id = Add(AddTaskRequest("Card"));
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  const PObject done = WaitIdle(id);
  EXPECT_EQ(done["error_code"].asInt64(), 0);
  EXPECT_NE(done["latest_finish_time"].asUInt64(), 0u);
  EXPECT_EQ(ReadFile("/volume1/photo/card/a.jpg"), "alpha");
  EXPECT_EQ(ReadFile("/volume1/photo/card/sub/b.jpg"), "beta");
  EXPECT_FALSE(Exists("/volume1/photo/card/@eaDir"));

  // A copy already there (same size and time) is kept; only the new file goes.
  WriteFile("/volume1/photo/card/a.jpg", "ALPHA");
  fs::last_write_time(Path("/volume1/photo/card/a.jpg"), fs::last_write_time(Path("/usbshare1/DCIM/a.jpg")));
  WriteFile("/usbshare1/DCIM/c.jpg", "gamma");
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), 0);
  EXPECT_EQ(ReadFile("/volume1/photo/card/a.jpg"), "ALPHA");
  EXPECT_EQ(ReadFile("/volume1/photo/card/c.jpg"), "gamma");
  EXPECT_EQ(Entries("/volume1/photo/card"), 4u);  // a, c, sub, sub/b: no temporary left

  const unsigned long gone = Add(AddTaskRequest("Gone", "/Gone", "/gone"));
  ASSERT_TRUE(Ok(OnTask("run_task", gone)));
  EXPECT_EQ(WaitIdle(gone)["error_code"].asInt64(), P_ERR_SOURCE_ROOT_MISSING);
}

TEST_F(DaemonTest, AnIdleTaskShowsItsLastRunsOutcome) {
  // Each run ends at once with a code of its own: the map that first shows
  // the task idle again must show that run's code, not the one before. Many
  // runs, since only a map read just as a run ends could show the old one.
  Start([this](const plovod::RunPlan&, plovod::RunControl&) { return -1 - runs_++ % 20; });
  const unsigned long id = Add(AddTaskRequest("Card"));
  for (int i = 0; i < 500; ++i) {
    ASSERT_TRUE(Ok(OnTask("run_task", id)));
    ASSERT_EQ(WaitIdle(id)["error_code"].asInt64(), -1 - i % 20) << "run " << i;
  }
}

TEST_F(DaemonTest, RunInProgressShowsAndCancels) {
  Start(Blocking());
  const unsigned long id = Add(AddTaskRequest("Card"));
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  WaitStarted();
  const PObject task = Listed(id);
  EXPECT_EQ(task["task_status"].asStringRef(), "running");
  EXPECT_EQ(task["copy_file_path"].asStringRef(), "/DCIM/a.jpg");
  EXPECT_FALSE(task["is_task_runnable"].asBool());
  EXPECT_EQ(Code(OnTask("run_task", id)), 3);
  EXPECT_EQ(Code(OnTask("remove_task", id)), 3);
  EXPECT_TRUE(Ok(OnTask("cancel_task", id)));
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), P_ERR_STOPPED);
  EXPECT_TRUE(cancelled_);
  EXPECT_EQ(Code(OnTask("cancel_task", id)), 8);
}

TEST_F(DaemonTest, PlugInStartsARunAndRemovalCancelsIt) {
  Start(Blocking());
  const unsigned long id = Add(AddTaskRequest("Card"));
  ASSERT_TRUE(Ok(Trigger(id, "{}", true)));
  ASSERT_TRUE(Ok(With(Action("device_added"), "share_name", "usbshare1")));
  WaitStarted();
  ASSERT_TRUE(Ok(With(Action("device_removed"), "share_name", "usbshare1")));
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), P_ERR_STOPPED);
  EXPECT_TRUE(cancelled_);
}

TEST_F(DaemonTest, ShutdownCancelsAndWaitsForTheRun) {
  Start(Blocking());
  ASSERT_TRUE(Ok(OnTask("run_task", Add(AddTaskRequest("Card")))));
  WaitStarted();
  daemon_->Shutdown();
  EXPECT_TRUE(ended_);
  EXPECT_TRUE(cancelled_);
}

}  // namespace
