// Scheduler entries saved under the sandbox, and their next trigger times.
#include <json/reader.h>
#include <velt/dev.h>
#include <velt/sched.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <memory>
#include <numeric>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "sandbox.h"

namespace {

using TaskPtr = std::unique_ptr<VELTSCHEDTASK, void (*)(PVELTSCHEDTASK)>;
using ListPtr = std::unique_ptr<VELTSCHEDTASKLIST, void (*)(PVELTSCHEDTASKLIST)>;

TaskPtr NewTask() { return TaskPtr(VELTSchedTaskAlloc(), VELTSchedTaskFree); }

Json::Value Parse(const std::string& text) {
  Json::Value value;
  std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
  EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &value, nullptr)) << text;
  return value;
}

// The argument of VELTSchedTaskConvertFromJson_Schedule; numbers are JSON text.
std::string Sched(const std::string& week, const std::string& hour, const std::string& min,
                  const std::string& repeat) {
  return "{\"schedule\": {\"week_name\": \"" + week + "\", \"hour\": " + hour +
         ", \"min\": " + min + ", \"repeat\": " + repeat + "}}";
}

int SetTimetable(PVELTSCHEDTASK task, const std::string& json) {
  return VELTSchedTaskConvertFromJson_Schedule(Parse(json), task);
}

std::string AppOf(const VELTSCHEDTASK* task) {
  std::string app;
  return VELTSchedCTaskGetApp(task, app) == 0 ? app : "<none>";
}

// The ids of a list, or {-1} when ListGet fails.
std::vector<int64_t> ListIds(VELTSchedTaskFilter filter) {
  PVELTSCHEDTASKLIST raw = nullptr;
  if (VELTSchedTaskListGet(&raw, filter) != 0) return {raw ? -2 : -1};
  ListPtr list(raw, VELTSchedTaskListFree);
  std::vector<int64_t> ids;
  while (PVELTSCHEDTASK task = VELTSchedTaskNext(list.get())) {
    EXPECT_EQ(0, VELTSchedCTaskGetID(task, &ids.emplace_back()));
  }
  return ids;
}

class SchedTest : public plovo_test::SandboxTest {
 protected:
  // Local time is UTC unless a test says otherwise, whatever the host's zone.
  void SetUp() override {
    SandboxTest::SetUp();
    if (const char* tz = std::getenv("TZ")) oldTz_ = tz;
    setenv("TZ", "UTC0", 1);
    tzset();
  }
  void TearDown() override {
    oldTz_ ? setenv("TZ", oldTz_->c_str(), 1) : unsetenv("TZ");
    tzset();
    SandboxTest::TearDown();
  }
  // The next trigger time of a new task with this timetable when it is `now`.
  std::string Next(const std::string& now, const std::string& json) {
    WriteFile("/velt-dev/sched-now", now + "\n");
    TaskPtr task = NewTask();
    if (SetTimetable(task.get(), json) != 0) return "<refused>";
    return VELTSchedTaskGetNextTriggerTime(task.get());
  }
  int64_t SaveNew(const std::string& app, bool listable = true) {
    TaskPtr task = NewTask();
    int64_t id = -1;
    bool ok = !VELTSchedCTaskSetApp(task.get(), app.c_str()) &&
              !VELTSchedCTaskSetListable(task.get(), listable) && !VELTSchedTaskSave(task.get());
    return ok && VELTSchedCTaskGetID(task.get(), &id) == 0 ? id : -1;
  }
  std::string Entry(int64_t id) {
    return ReadFile("/velt-dev/scheduler/" + std::to_string(id) + ".json");
  }

 private:
  std::optional<std::string> oldTz_;
};

TEST_F(SchedTest, NextTriggerWrapsWeekMonthYearAndDaylightSaving) {
  // 2024/01/03 is a Wednesday.
  EXPECT_EQ("2024/01/08 09:00", Next("2024/01/05 10:00", Sched("1", "9", "0", "0")));
  EXPECT_EQ("2024/01/03 09:00", Next("2024/01/03 08:00", Sched("3", "9", "0", "0")));
  EXPECT_EQ("2024/01/10 09:00", Next("2024/01/03 12:00", Sched("3", "9", "0", "0")));
  EXPECT_EQ("2025/01/01 00:00", Next("2024/12/31 23:59", Sched("3", "0", "0", "0")));
  EXPECT_EQ("2024/01/06 07:05",
            Next("2024/01/01 00:00", Sched(" 6 , 6,0", "\"07\"", "\"5\"", "0")));
  // Each day gets its own DST offset, not the one in force now.
  setenv("TZ", "CET-1CEST,M3.5.0,M10.5.0/3", 1);
  tzset();
  EXPECT_EQ("2024/04/01 10:00", Next("2024/03/30 12:00", Sched("1", "10", "0", "0")));
  EXPECT_EQ("2024/10/28 10:00", Next("2024/10/26 12:00", Sched("1", "10", "0", "0")));
}

TEST_F(SchedTest, RepeatStaysWithinTheDayAndNowItselfIsPast) {
  const std::string twice = Sched("3,4", "22", "15", "100");  // 22:15 and 23:55
  EXPECT_EQ("2024/01/03 22:15", Next("2024/01/03 22:14:59", twice));
  EXPECT_EQ("2024/01/03 23:55", Next("2024/01/03 22:15", twice));
  EXPECT_EQ("2024/01/03 23:55", Next("2024/01/03 22:15:01", twice));
  EXPECT_EQ("2024/01/04 22:15", Next("2024/01/03 23:55", twice));  // no 01:35 spill-over
  EXPECT_EQ("2024/01/03 23:59", Next("2024/01/03 12:00", Sched("3", "0", "0", "1439")));
  EXPECT_EQ("2024/01/03 12:01", Next("2024/01/03 12:00:30", Sched("3", "0", "0", "1")));
}

TEST_F(SchedTest, NoDayNoTimetableAndBadNowGiveEmptyTime) {
  EXPECT_EQ("", Next("2024/01/03 12:00", Sched("", "9", "0", "0")));
  TaskPtr task = NewTask();
  EXPECT_EQ("", VELTSchedTaskGetNextTriggerTime(task.get()));
  for (const char* now : {"2024/13/01 10:00", "2023/02/29 10:00", "2024-01-01 10:00", ""}) {
    EXPECT_EQ("", Next(now, Sched("0,1,2,3,4,5,6", "0", "0", "1"))) << now;
    EXPECT_EQ(VLIBC_ERR_BAD_CONFIG, VLIBCErrGet()) << now;
  }
  // Without the file the clock counts: the next whole minute.
  std::remove(Path("/velt-dev/sched-now").c_str());
  ASSERT_EQ(0, SetTimetable(task.get(), Sched("0,1,2,3,4,5,6", "0", "0", "1")));
  char before[32], after[32];
  struct tm tm;
  time_t t = time(nullptr);
  strftime(before, sizeof before, "%Y/%m/%d %H:%M", localtime_r(&t, &tm));
  std::string next = VELTSchedTaskGetNextTriggerTime(task.get());
  t = time(nullptr) + 60;
  strftime(after, sizeof after, "%Y/%m/%d %H:%M", localtime_r(&t, &tm));
  EXPECT_TRUE(next > before && next <= after) << next;
}

TEST_F(SchedTest, InvalidTimetableIsRefusedAndTaskUnchanged) {
  WriteFile("/velt-dev/sched-now", "2024/01/03 08:00");
  TaskPtr task = NewTask();
  ASSERT_EQ(0, SetTimetable(task.get(), Sched("3", "9", "0", "0")));
  const std::vector<std::string> bad = {
      "{}", "[]", R"({"schedule": "x"})", R"({"schedule": {"week_name": "1", "hour": 1, "min": 1}})",
      Sched("1", "24", "0", "0"), Sched("1", "0", "60", "0"), Sched("1", "0", "0", "1440"),
      Sched("1", "-1", "0", "0"), Sched("1", "\"-1\"", "0", "0"), Sched("1", "\"7a\"", "0", "0"),
      Sched("1", "\"\"", "0", "0"), Sched("1", "7.5", "0", "0"), Sched("1", "true", "0", "0"),
      Sched("7", "0", "0", "0"), Sched("1,,2", "0", "0", "0"), Sched("1,", "0", "0", "0"),
      Sched("mon", "0", "0", "0"),
      R"({"schedule": {"week_name": 1, "hour": 1, "min": 1, "repeat": 0}})"};
  for (const std::string& json : bad) {
    EXPECT_EQ(-1, SetTimetable(task.get(), json)) << json;
    EXPECT_EQ(VLIBC_ERR_BAD_PARAMETER, VLIBCErrGet()) << json;
    EXPECT_EQ("2024/01/03 09:00", VELTSchedTaskGetNextTriggerTime(task.get())) << json;
  }
}

TEST_F(SchedTest, SaveAndLoadKeepEveryField) {
  TaskPtr task = NewTask();
  int64_t id = 0;
  EXPECT_TRUE(VELTSchedCTaskGetID(task.get(), &id) < 0 && VLIBCErrGet() == VLIBC_ERR_NOT_FOUND);
  EXPECT_TRUE(VELTSchedTaskIsEnabled(task.get()) && VELTSchedTaskIsListable(task.get()));
  EXPECT_EQ("<none>", AppOf(task.get()));
  PVELTSCHEDTASK t = task.get();
  ASSERT_TRUE(!VELTSchedCTaskSetApp(t, "VeltraPlovo") && !VELTSchedCTaskSetAppName(t, "Plovo") &&
              !VELTSchedCTaskSetName(t, "Copy \"USB\"") && !VELTSchedCTaskSetAction(t, "run") &&
              !VELTSchedCTaskSetCommand(t, "/bin/echo hi") && !VELTSchedCTaskSetState(t, 0) &&
              !VELTSchedCTaskSetCanRunAppSameTime(t, 1) &&
              !VELTSchedCTaskSetCanRunTaskSameTime(t, 2) && !VELTSchedCTaskSetCanRunFromUI(t, 1) &&
              !VELTSchedCTaskSetOwner(t, 1026) &&
              !VELTSchedCTaskSetCanEditName(t, 1) && !VELTSchedCTaskSetCanEditOwner(t, 1) &&
              !VELTSchedCTaskSetCanDeleteFromUI(t, 1) && !VELTSchedCTaskSetListable(t, 0));
  const std::string schedule =
      R"({"week_name": "1,3", "hour": "7", "min": 30, "repeat": 0, "note": "kept"})";
  ASSERT_EQ(0, SetTimetable(t, "{\"schedule\": " + schedule + "}"));
  ASSERT_EQ(0, VELTSchedTaskSave(t));
  ASSERT_TRUE(VELTSchedCTaskGetID(t, &id) == 0 && id == 1);
  EXPECT_EQ(Parse(R"({"id": 1, "app": "VeltraPlovo", "app_name": "Plovo", "name": "Copy \"USB\"",
      "action": "run", "command": "/bin/echo hi", "enabled": false, "can_run_app_same_time": true,
      "can_run_task_same_time": true, "can_run_from_ui": true, "owner": 1026, "can_edit_name": true,
      "can_edit_owner": true, "can_delete_from_ui": true, "listable": false, "schedule": )" +
                  schedule + "}"),
            Parse(Entry(1)));
  const std::string saved = Entry(1);
  WriteFile("/velt-dev/sched-now", "2024/01/03 08:00");
  TaskPtr loaded = NewTask();
  ASSERT_EQ(0, VELTSchedTaskLoad(1, loaded.get()));
  EXPECT_FALSE(VELTSchedTaskIsEnabled(loaded.get()) || VELTSchedTaskIsListable(loaded.get()));
  EXPECT_EQ("VeltraPlovo", AppOf(loaded.get()));
  EXPECT_EQ("2024/01/08 07:30", VELTSchedTaskGetNextTriggerTime(loaded.get()));
  ASSERT_EQ(0, VELTSchedTaskSave(loaded.get()));  // replaces entry 1 with what was loaded
  EXPECT_EQ(saved, Entry(1));
}

TEST_F(SchedTest, ConcurrentNewEntriesGetDistinctIds) {
  constexpr int kThreads = 8, kEach = 10;
  std::vector<int64_t> ids(kThreads * kEach, -1);  // -1: that save or its check failed
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&, i] {
      for (int j = 0; j < kEach; ++j) {
        const std::string app = "t" + std::to_string(i) + "-" + std::to_string(j);
        TaskPtr task = NewTask(), back = NewTask();
        int64_t id = -1;
        PVELTSCHEDTASKLIST list = nullptr;
        bool ok = VELTSchedCTaskSetApp(task.get(), app.c_str()) == 0 &&
                  VELTSchedTaskSave(task.get()) == 0 && VELTSchedCTaskGetID(task.get(), &id) == 0 &&
                  VELTSchedTaskLoad(id, back.get()) == 0 && AppOf(back.get()) == app &&
                  VELTSchedTaskListGet(&list, nullptr) == 0;  // never sees a half-written entry
        VELTSchedTaskListFree(list);
        if (ok) ids[i * kEach + j] = id;
      }
    });
  }
  for (std::thread& t : threads) t.join();
  std::vector<int64_t> expected(kThreads * kEach);
  std::iota(expected.begin(), expected.end(), 1);
  std::sort(ids.begin(), ids.end());
  EXPECT_EQ(expected, ids);
  EXPECT_EQ(expected, ListIds(nullptr));
}

TEST_F(SchedTest, ListInIdOrderWithFilterAndRemove) {
  for (int i = 1; i <= 11; ++i) ASSERT_EQ(i, SaveNew("a" + std::to_string(i), i == 2 || i == 10));
  for (const char* stray : {"notes.txt", "5.json.bak", ".3.json.tmp", "012.json"}) {
    WriteFile(std::string("/velt-dev/scheduler/") + stray, "{");  // no entries: not read
  }
  EXPECT_EQ((std::vector<int64_t>{2, 10}), ListIds(VELTSchedTaskIsListable));
  EXPECT_EQ((std::vector<int64_t>{1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11}), ListIds(nullptr));

  TaskPtr stale = NewTask();
  ASSERT_EQ(0, VELTSchedTaskLoad(11, stale.get()));
  ASSERT_EQ(0, VELTSchedTaskRemove(11));
  for (int rc : {VELTSchedTaskLoad(11, stale.get()), VELTSchedTaskRemove(11),
                 VELTSchedTaskSave(stale.get())}) {
    EXPECT_EQ(-1, rc);
    EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
  }
  EXPECT_FALSE(Exists("/velt-dev/scheduler/11.json"));  // the stale save did not bring it back
  EXPECT_EQ(12, SaveNew("after"));                       // ids are never given twice
}

TEST_F(SchedTest, UnknownMalformedAndFaultedLoadsFail) {
  TaskPtr task = NewTask();
  ASSERT_EQ(0, VELTSchedCTaskSetApp(task.get(), "keep"));
  EXPECT_TRUE(VELTSchedTaskLoad(99, task.get()) < 0 && VLIBCErrGet() == VLIBC_ERR_NOT_FOUND);
  EXPECT_TRUE(VELTSchedTaskLoad(0, task.get()) < 0 && VLIBCErrGet() == VLIBC_ERR_BAD_PARAMETER);
  ASSERT_EQ(1, SaveNew("one"));
  for (const char* content : {"{", R"({"id": 3})", "[]"}) {
    WriteFile("/velt-dev/scheduler/3.json", content);
    EXPECT_EQ(-1, VELTSchedTaskLoad(3, task.get())) << content;
    EXPECT_EQ(VLIBC_ERR_IO, VLIBCErrGet()) << content;
    EXPECT_EQ((std::vector<int64_t>{-1}), ListIds(nullptr)) << content;
    EXPECT_EQ(VLIBC_ERR_IO, VLIBCErrGet()) << content;
  }
  EXPECT_EQ("keep", AppOf(task.get()));
  VeltDevFailCall("VELTSchedTaskLoad", 1, 1, VLIBC_ERR_IO);
  EXPECT_EQ(-1, VELTSchedTaskLoad(1, task.get()));
  EXPECT_TRUE(VLIBCErrGet() == VLIBC_ERR_IO && AppOf(task.get()) == "keep");
  EXPECT_TRUE(VELTSchedTaskLoad(1, task.get()) == 0 && AppOf(task.get()) == "one");  // once only
}

}  // namespace
