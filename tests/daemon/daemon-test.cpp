// plovod's command handler in this process, served on the sandbox's socket: its
// refusals, what a change leaves on disk and a failed one does not, and
// runs, with the default job and with one that blocks until cancelled.
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <velt/dev.h>

#include <atomic>
#include <memory>

#include "daemon-sandbox.h"
#include "common/paths.h"
#include "daemon/daemon.h"
#include "ipc/command-server.h"
#include "ipc/error-code.h"

namespace {

constexpr const char* kTimetable = R"({"week_day":"1,3","hour":7,"minute":30,"repeat_date":0})";
const char* const kLists[] = {"white_name", "white_ext", "black_name", "black_ext", "custom_name", "custom_ext"};

class DaemonTest : public plovo_test::DaemonSandboxTest {
 protected:
  void TearDown() override {
    server_.reset();
    daemon_.reset();
    DaemonSandboxTest::TearDown();
  }
  // The daemon of this process on the sandbox's socket, asked as the
  // module asks it (Do); its runs use job.
  void Start(plovod::Job job = plovod::RunCopy, bool beep = false) {
    server_.reset();
    daemon_ = std::make_unique<plovod::Daemon>(RepoPath(), beep, [] {}, job);
    ASSERT_EQ(daemon_->Open(), 0);
    server_ = std::make_unique<CommandServer>(daemon_->Commands(),
                                              [this](const PObject& request) { return daemon_->Handle(request); });
    ASSERT_EQ(server_->Start(Plovo::Path::DaemonSocket()), 0);
  }
  // Asked in process when direct_: a socket's round trip mostly misses the
  // moment a run ends.
  PObject Do(const PObject& request) override { return direct_ ? daemon_->Handle(request) : Send(request); }
  static PObject SetRequest(unsigned long id, const std::string& name) {
    return With(With(AddTaskRequest(name, "/DCIM2", "/new"), "action", "set_task_setting"), "task_id", Num(id));
  }

  // A job that shows a file being copied and blocks until it is cancelled
  // (at most 5 s), so that a run in progress owes nothing to timing.
  plovod::Job Blocking() {
    return [this](const plovod::RunPlan&, plovod::RunControl& control) {
      control.SetCopying("/DCIM/a.jpg");
      control_ = &control;
      ++started_;
      for (int i = 0; i < 500 && !control.Cancelled(); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
      const bool cancelled = control.Cancelled();
      cancelled_ += cancelled;
      return cancelled ? P_ERR_STOPPED : P_SUCCESS;
    };
  }

  std::atomic<int> started_{0}, cancelled_{0};
  bool direct_ = false;
  std::atomic<plovod::RunControl*> control_{nullptr};  // the latest run's; it lives until the next starts
  std::unique_ptr<plovod::Daemon> daemon_;             // its runs use the members above
  std::unique_ptr<CommandServer> server_;              // last: it serves daemon_
};

TEST_F(DaemonTest, RefusalsCarryTheirCodeAndChangeNothing) {
  Start();
  // A failed add leaves no row, device row, folder or scheduler entry.
  VeltDevFailCall("VELTSchedTaskSave", 1, 1, VLIBC_ERR_IO);
  EXPECT_NE(Code(With(AddTaskRequest("Card"), "schedule_json_str", kTimetable)), 0);
  EXPECT_TRUE(Do(Action("list_task"))["task_list"].asArray().empty());
  EXPECT_FALSE(DeviceRow());
  EXPECT_EQ(Count(std::string(kRepo) + "/task"), 0u);
  EXPECT_EQ(Count("/velt-dev/scheduler", ".json"), 0u);

  const unsigned long card = Add(AddTaskRequest("Card"));
  const unsigned long away = Add(With(AddTaskRequest("Away"), "nas_share_name", "nowhere"));
  const unsigned long off = Add(AddTaskRequest("Off"));
  ASSERT_TRUE(Ok(OnTask("disable_task", off)));
  PObject mixed;
  mixed.asArray() = {PObject("jpg"), Num(3)};
  const PObject add = AddTaskRequest("New");
  // key: the argument a wrong-kind refusal names; "" when none is named.
  const struct { const char* what; PObject request; int code; const char* key; } cases[] = {
      {"unknown action", OnTask("frobnicate", card), 1, ""},
      {"task_id a string", With(OnTask("get_task_setting", card), "task_id", "1"), 2, "task_id"},
      {"task_id 0", OnTask("run_task", 0), 2, "task_id"},
      {"task_type 4", With(add, "task_type", Num(4)), 2, "task_type"},
      {"dot-dot folder", With(add, "usb_folder_path", "/a/../b"), 2, "usb_folder_path"},
      {"relative folder", With(add, "usb_folder_path", "DCIM"), 2, "usb_folder_path"},
      {"share with a slash", With(add, "nas_share_name", "a/b"), 2, "nas_share_name"},
      {"list with an integer", With(add, "white_ext", mixed), 2, "white_ext"},
      {"empty list member", With(add, "black_name", Strings({"a", ""})), 2, "black_name"},
      {"empty task name", With(add, "task_name", ""), 2, "task_name"},
      {"copy_strategy 0", With(add, "copy_strategy", Num(0)), 2, "copy_strategy"},
      {"timetable not json", With(add, "schedule_json_str", "not json"), 2, ""},
      {"name taken on add", With(add, "task_name", "Card"), 3, ""},
      {"name taken on set", SetRequest(away, "Card"), 3, ""},
      {"set of no task", SetRequest(999, "X"), 4, ""},
      {"cancel of an idle task", OnTask("cancel_task", card), 8, ""},
      {"run with the share missing", OnTask("run_task", away), 10, ""},
      {"run of a disabled task", OnTask("run_task", off), 11, ""},
  };
  for (const auto& c : cases) {
    const PObject answer = Do(c.request);
    EXPECT_TRUE(answer["error_code"].asInt32() == c.code && !answer.hasMember("ack") &&
                answer["error"].asStringRef().find(c.key) != std::string::npos) << c.what << ": " << answer.toString();
  }
  for (const char* action : {"get_task_setting", "run_task", "cancel_task", "remove_task", "enable_task"})
    EXPECT_EQ(Code(OnTask(action, 999)), 4) << action;
  PlugIn(false);
  EXPECT_EQ(Code(OnTask("run_task", card)), 9);
  EXPECT_EQ(Do(Action("list_task"))["task_list"].asArray().size(), 3u);
  EXPECT_EQ(Get(away)["task_name"].asStringRef(), "Away");
}

TEST_F(DaemonTest, ChangesLandInRowListsSchedulerAndDeviceRowAndOutliveARestart) {
  Start();
  const unsigned long ver = Add(AddTaskRequest("Ver"));
  const unsigned long inc = Add(With(AddTaskRequest("Inc", "/DCIM", "/inc"), "copy_strategy", Num(3)));
  for (unsigned long id : {ver, inc}) {  // each strategy takes only its own options
    const PObject set = With(SetRequest(id, id == ver ? "Ver2" : "Inc2"), "conflict_policy", Num(2));
    ASSERT_TRUE(Ok(With(set, "max_version_count", Num(9))));
    const PObject task = Get(id);
    EXPECT_EQ(task["source_path"].asString() + task["destination_path"].asString(), "/DCIM2/photo/new");
    EXPECT_EQ(task["conflict_policy"].asUInt64(), id == ver ? 1u : 2u);
    EXPECT_EQ(task["max_version_count"].asUInt64(), id == ver ? 9u : 256u);
  }

  const std::vector<std::string> lists[] = {{"a", "b"}, {"jpg"}, {"tmp"}, {"bak", "old"}, {"x"}, {"raw"}};
  PObject filters = OnTask("set_filter_setting", ver);
  for (int i = 0; i < 6; ++i) filters[kLists[i]] = Strings(lists[i]);
  ASSERT_TRUE(Ok(filters));
  const PObject got = Do(OnTask("get_filter_setting", ver));
  for (const char* list : kLists) EXPECT_EQ(got[list].toString(), filters[list].toString()) << list;
  const std::string dir = TaskDir(ver);
  auto files = [&] { return ReadFile(dir + "/whitelist.filter") + ReadFile(dir + "/blacklist.filter") +
                            ReadFile(dir + "/user.config"); };
  const std::string before = files();
  MakeDir(dir + "/blacklist.filter.new");  // the black list fails after the white one is written
  filters["white_name"] = Strings({"c"});
  EXPECT_EQ(Code(filters), 5);
  EXPECT_EQ(files(), before);
  EXPECT_EQ(Count(dir), 4u);  // the three and the obstacle

  // Plug-in and eject belong to the device row, shared by its tasks.
  const int64_t schedule = Do(Trigger(ver, kTimetable, true))["schedule_id"].asInt64();
  EXPECT_EQ(EntryField(schedule, "name"), "Ver2");
  EXPECT_THAT(EntryField(schedule, "command"), testing::EndsWith(" --execute-task " + std::to_string(ver)));
  EXPECT_TRUE(Get(inc)["run_when_plug_in"].asBool());
  EXPECT_FALSE(Get(inc)["eject_when_task_done"].asBool());
  ASSERT_TRUE(Ok(SetRequest(ver, "Renamed")));
  EXPECT_EQ(EntryField(schedule, "name"), "Renamed");
  const std::string listed = Do(Action("list_task")).toString();
  server_.reset();
  daemon_.reset();
  Start();
  EXPECT_EQ(Do(Action("list_task")).toString(), listed);

  EXPECT_EQ(Do(Trigger(ver, "{}"))["schedule_id"].asInt64(), -1);
  EXPECT_FALSE(Exists(EntryPath(schedule)));
  const int64_t again = Do(Trigger(ver, kTimetable))["schedule_id"].asInt64();
  ASSERT_TRUE(Exists(EntryPath(again)));
  ASSERT_TRUE(Ok(OnTask("remove_task", ver)));
  EXPECT_EQ(Code(OnTask("get_task_setting", ver)), 4);
  EXPECT_FALSE(Exists(TaskDir(ver)));
  EXPECT_FALSE(Exists(EntryPath(again)));
  EXPECT_TRUE(DeviceRow());
  ASSERT_TRUE(Ok(OnTask("remove_task", inc)));
  EXPECT_FALSE(DeviceRow());  // it went with the device's last task
}

TEST_F(DaemonTest, RunCopiesWhatTheDestinationLacks) {
  WriteFile("/usbshare1/DCIM/a.jpg", "alpha");
  WriteFile("/usbshare1/DCIM/sub/b.jpg", "beta");
  WriteFile("/usbshare1/DCIM/@eaDir/thumb", "t");
  Start();
  const unsigned long id = Add(With(AddTaskRequest("Card"), "copy_strategy", Num(3)));
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  const PObject done = WaitIdle(id);
  EXPECT_TRUE(done["error_code"].asInt64() == 0 && done["latest_finish_time"].asUInt64() != 0) << done.toString();
  EXPECT_EQ(ReadFile("/volume1/photo/card/a.jpg") + ReadFile("/volume1/photo/card/sub/b.jpg"), "alphabeta");
  EXPECT_FALSE(Exists("/volume1/photo/card/@eaDir"));

  // A file copied before is not copied again, even changed at the NAS.
  WriteFile("/volume1/photo/card/a.jpg", "ALPHA");
  std::filesystem::last_write_time(Path("/volume1/photo/card/a.jpg"),
                                   std::filesystem::last_write_time(Path("/usbshare1/DCIM/a.jpg")));
  WriteFile("/usbshare1/DCIM/c.jpg", "gamma");
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), 0);
  EXPECT_EQ(ReadFile("/volume1/photo/card/a.jpg") + ReadFile("/volume1/photo/card/c.jpg"), "ALPHAgamma");
  EXPECT_EQ(Count("/volume1/photo/card"), 4u);  // a, c, sub, sub/b: no temporary left

  const unsigned long gone = Add(AddTaskRequest("Gone", "/Gone", "/gone"));
  ASSERT_TRUE(Ok(OnTask("run_task", gone)));
  EXPECT_EQ(WaitIdle(gone)["error_code"].asInt64(), P_ERR_SOURCE_ROOT_MISSING);
}

// Each run ends, at once or within 2 ms, with a code of its own: the map
// that first shows the task idle again must show that run's code. Only a
// map read just as a run ends could show the one before, so the list is
// read in process without a pause, over many runs.
TEST_F(DaemonTest, AnIdleTaskShowsItsLastRunsOutcome) {
  Start([this](const plovod::RunPlan&, plovod::RunControl&) {  // one run at a time
    std::this_thread::sleep_for(std::chrono::microseconds(100 * (started_ % 20)));
    return -1 - started_++ % 20;
  });
  const unsigned long id = Add(AddTaskRequest("Card"));
  direct_ = true;
  for (int i = 0; i < 1000; ++i) {
    ASSERT_TRUE(Ok(OnTask("run_task", id)));
    ASSERT_EQ(WaitIdle(id, std::chrono::microseconds(0))["error_code"].asInt64(), -1 - i % 20) << "run " << i;
  }
}

TEST_F(DaemonTest, RunsShowAndEndByCancelPullOutAndShutdown) {
  Start(Blocking());
  const unsigned long id = Add(AddTaskRequest("Card"));
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  ASSERT_TRUE(plovo_test::Eventually([&] { return started_ == 1; }));
  const PObject task = Listed(id);
  EXPECT_EQ(task["task_status"].asStringRef() + task["copy_file_path"].asStringRef(), "running/DCIM/a.jpg");
  EXPECT_FALSE(task["is_task_runnable"].asBool());
  EXPECT_EQ(Code(OnTask("run_task", id)), 3);
  EXPECT_EQ(Code(OnTask("remove_task", id)), 3);
  EXPECT_TRUE(Ok(OnTask("cancel_task", id)));
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), P_ERR_STOPPED);
  EXPECT_EQ(Code(OnTask("cancel_task", id)), 8);

  ASSERT_TRUE(Ok(Trigger(id, "{}", true)));
  ASSERT_TRUE(Ok(With(Action("device_added"), "share_name", "usbshare1")));
  ASSERT_TRUE(plovo_test::Eventually([&] { return started_ == 2; }));
  ASSERT_TRUE(Ok(With(Action("device_removed"), "share_name", "photo")));
  EXPECT_FALSE(control_.load()->Cancelled());  // not the run's device
  ASSERT_TRUE(Ok(With(Action("device_removed"), "share_name", "usbshare1")));
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), P_ERR_STOPPED);

  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  ASSERT_TRUE(plovo_test::Eventually([&] { return started_ == 3; }));
  daemon_->Shutdown();
  EXPECT_EQ(cancelled_, 3);  // the last run too, cancelled and waited for
}

// What a run may never do: follow a link out of its folders, replace a
// file at the destination, wait on a FIFO, copy a leftover temporary, or
// copy into its own source.
TEST_F(DaemonTest, RunStaysInItsFoldersAndReplacesNothing) {
  WriteFile("/outside/secret", "private");
  WriteFile("/usbshare1/DCIM/a.jpg", "card");
  WriteFile("/usbshare1/DCIM/b.jpg", "card b");
  WriteFile("/usbshare1/DCIM/.plovo-abcdefgh", "left by a killed run");
  ASSERT_EQ(symlink(Path("/outside").c_str(), Path("/usbshare1/DCIM/linked").c_str()), 0);
  ASSERT_EQ(mkfifo(Path("/usbshare1/DCIM/f.jpg").c_str(), 0644), 0);
  WriteFile("/volume1/photo/card/a.jpg", "the user's own");
  Start();
  const unsigned long id = Add(With(AddTaskRequest("Card"), "copy_strategy", Num(3)));
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), 0);
  EXPECT_EQ(ReadFile("/volume1/photo/card/a.jpg"), "the user's own");
  EXPECT_EQ(ReadFile("/volume1/photo/card/a (1).jpg"), "card");
  EXPECT_EQ(ReadFile("/volume1/photo/card/b.jpg"), "card b");
  for (const char* absent : {"/linked", "/f.jpg", "/.plovo-abcdefgh"}) {
    EXPECT_FALSE(Exists(std::string("/volume1/photo/card") + absent)) << absent;
  }

  // A destination folder that is a link: its files are skipped (with a
  // row) and nothing lands where it points.
  std::filesystem::remove_all(Path("/volume1/photo/card"));
  MakeDir("/volume1/photo/card");
  ASSERT_EQ(symlink(Path("/outside").c_str(), Path("/volume1/photo/card/linked").c_str()), 0);
  ASSERT_EQ(unlink(Path("/usbshare1/DCIM/linked").c_str()), 0);
  WriteFile("/usbshare1/DCIM/linked/c.jpg", "c");  // a real folder on the card now
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), 0);
  EXPECT_FALSE(Exists("/outside/c.jpg"));

  // A destination inside the source is refused before anything is made.
  const unsigned long nested = Add(With(AddTaskRequest("Nested", "/DCIM", "/DCIM/backup"), "nas_share_name", "usbshare1"));
  EXPECT_EQ(Code(OnTask("run_task", nested)), plovod::kBadRequest);
  EXPECT_FALSE(Exists("/usbshare1/DCIM/backup"));
}

// A run that succeeds ejects its device when the device says so, and the
// buzzer sounds at its start and end when the beep is on.
TEST_F(DaemonTest, SuccessfulRunEjectsAndBeeps) {
  WriteFile("/usbshare1/DCIM/a.jpg", "a");
  Start(plovod::RunCopy, true);
  const unsigned long id = Add(With(AddTaskRequest("Card"), "eject_when_task_done", Num(1)));
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  const PObject done = WaitIdle(id);
  EXPECT_EQ(done["error_code"].asInt64(), 0);
  EXPECT_FALSE(done["is_usb_mounted"].asBool());
  const std::string log = ReadFile("/velt-dev/system.log");
  EXPECT_THAT(log, testing::HasSubstr("usbshare1\tejected"));
  EXPECT_THAT(log, testing::HasSubstr("Buzzer\tshort"));
  EXPECT_THAT(log, testing::HasSubstr("Buzzer\tlong"));
}

}  // namespace
