// The package's scheduler entries as the development scheduler saves them:
// the fields of a new entry, the timetable handed over, updates, the error
// lines, and showing, hiding and removing only the package's own entries.
#include <json/json.h>
#include <velt/dev.h>
#include <velt/sched.h>

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include "log-capture.h"
#include "sandbox.h"
#include "service/schedule.h"

namespace {

using plovo_test::LogCapture;

const std::string kTimetable =
    R"({"week_day":"1,3","hour":7,"minute":30,"repeat_date":0,"date":"2026/11/23"})";

// How many of the module's error lines end with exactly this message.
long Logged(const LogCapture& log, const std::string& message) {
  std::vector<LogCapture::Line> lines = log.Lines();
  return std::count_if(lines.begin(), lines.end(), [&](const LogCapture::Line& l) {
    std::string text = l.text.substr(0, l.text.find_last_not_of('\n') + 1);
    size_t tail = message.size() + 3;
    return text.rfind("[ERR] schedule(", 0) == 0 && text.size() > tail &&
           text.compare(text.size() - tail, tail, "): " + message) == 0;
  });
}

Json::Value Parse(const std::string& text) {
  Json::Value value;
  std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
  EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &value, nullptr)) << text;
  return value;
}

class ScheduleTest : public plovo_test::SandboxTest {
 protected:
  void TearDown() override {
    VeltDevClearFaults();
    SandboxTest::TearDown();
  }
  Json::Value Entry(int64_t id) const {
    return Parse(ReadFile("/velt-dev/scheduler/" + std::to_string(id) + ".json"));
  }
  int64_t Create() {
    int64_t id = -1;
    EXPECT_TRUE(Plovo::CreateSchedule(5, 1, "Daily", true, kTimetable, id));
    return id;
  }
  // An entry of another application, or of none when app is empty.
  int64_t Foreign(const std::string& app, bool listable) {
    PVELTSCHEDTASK task = VELTSchedTaskAlloc();
    if (!app.empty()) VELTSchedCTaskSetApp(task, app.c_str());
    VELTSchedCTaskSetListable(task, listable ? 1 : 0);
    Json::Value json = Parse(R"({"schedule": {"week_name": "2", "hour": 0, "min": 0,
                                              "repeat": 0}})");
    int64_t id = -1;
    EXPECT_EQ(0, VELTSchedTaskConvertFromJson_Schedule(json, task));
    EXPECT_EQ(0, VELTSchedTaskSave(task));
    VELTSchedCTaskGetID(task, &id);
    VELTSchedTaskFree(task);
    return id;
  }
  // The ids of every saved entry, whoever made it.
  std::vector<int64_t> Ids() const {
    PVELTSCHEDTASKLIST list = nullptr;
    EXPECT_EQ(0, VELTSchedTaskListGet(&list, nullptr));
    std::vector<int64_t> ids;
    int64_t id = -1;
    while (PVELTSCHEDTASK t = VELTSchedTaskNext(list)) {
      ids.push_back(VELTSchedCTaskGetID(t, &id) == 0 ? id : -1);
    }
    VELTSchedTaskListFree(list);
    return ids;
  }
};

TEST_F(ScheduleTest, CreateSavesEveryFieldAndTheConvertedTimetable) {
  struct Case { unsigned long taskId; int type; bool enabled; const char* icon; };
  for (const Case& c : {Case{7, 1, true, "#type:icon_import_general#"},
                        Case{42, 2, false, "#type:icon_export_general#"},
                        Case{9, 3, true, "#type:icon_import_photo#"}}) {
    int64_t id = -1;
    ASSERT_TRUE(Plovo::CreateSchedule(c.taskId, c.type, "Copy card", c.enabled, kTimetable, id));
    Json::Value want = Parse(R"({"app": "VELT.QXS.Plovo.Application", "name": "Copy card",
        "app_name": "#common:app_name#", "can_run_app_same_time": true, "owner": 0,
        "can_run_task_same_time": true, "can_run_from_ui": true, "can_edit_name": false,
        "can_edit_owner": false, "can_delete_from_ui": false, "listable": true,
        "schedule": {"week_day": "1,3", "week_name": "1,3", "hour": 7, "min": 30,
                     "repeat_date": 0, "repeat": 0, "date": "2026/11/23"}})");
    want["id"] = Json::Int64(id);
    want["action"] = c.icon;
    want["command"] = Root() + "/var/packages/Plovo/target/bin/plovo-notifier --execute-task " +
                      std::to_string(c.taskId);
    want["enabled"] = c.enabled;
    EXPECT_EQ(want, Entry(id));
  }
}

TEST_F(ScheduleTest, UnusableTimetableCreatesNothing) {
  for (const auto& [json, line] : std::vector<std::pair<std::string, std::string>>{
           {"every monday", "parse json[every monday] failed"},
           {"[1,3]", "parse json[[1,3]] failed"},
           {R"({"week_day":"1","hour":7,"repeat_date":0})",  // no minute
            "VELTSchedTaskConvertFromJson_Schedule() failed, converted_json["}}) {
    LogCapture log;
    int64_t id = -1;
    EXPECT_FALSE(Plovo::CreateSchedule(1, 1, "x", true, json, id)) << json;
    EXPECT_TRUE(log.Contains(line)) << log.Dump();
    EXPECT_EQ(1, Logged(log, "ConvertScheduleJson() failed")) << log.Dump();
  }
  EXPECT_TRUE(Ids().empty());
}

TEST_F(ScheduleTest, UpdatesChangeTheSavedEntry) {
  int64_t id = Create();
  ASSERT_TRUE(Plovo::UpdateScheduleName(id, "Nightly"));
  const char* json = R"({"week_day":"0","hour":23,"minute":5,"repeat_date":60})";
  ASSERT_TRUE(Plovo::UpdateScheduleContent(id, false, json));
  Json::Value e = Entry(id);
  EXPECT_FALSE(e["enabled"].asBool());
  EXPECT_EQ("Nightly", e["name"].asString());
  EXPECT_EQ(Parse(R"({"week_day": "0", "week_name": "0", "hour": 23, "min": 5,
                     "repeat_date": 60, "repeat": 60})"), e["schedule"]);

  LogCapture log;
  EXPECT_FALSE(Plovo::UpdateScheduleContent(id, true, "{"));
  EXPECT_EQ(1, Logged(log, "ConvertScheduleJson() failed.")) << log.Dump();
  EXPECT_EQ(e, Entry(id));
  EXPECT_FALSE(Plovo::UpdateScheduleName(id + 1, "x"));
  EXPECT_FALSE(Plovo::UpdateScheduleContent(id + 1, true, kTimetable));
  EXPECT_EQ(2, Logged(log, "VELTSchedTaskLoad() failed.")) << log.Dump();
}

TEST_F(ScheduleTest, PlatformFailuresAreLoggedAndReported) {
  int64_t id = Create(), newId = -1;
  enum Op { kCreate, kName, kContent };
  auto run = [&](Op op) {
    return op == kCreate ? Plovo::CreateSchedule(1, 2, "n", true, kTimetable, newId)
           : op == kName ? Plovo::UpdateScheduleName(id, "n")
                         : Plovo::UpdateScheduleContent(id, true, kTimetable);
  };
  struct Case { const char* call; Op op; const char* line; };
  for (const Case& c : {Case{"VELTSchedTaskAlloc", kCreate, "VELTSchedTaskAlloc() failed"},
                        Case{"VELTSchedTaskSave", kCreate, "VELTSchedTaskSave() failed"},
                        Case{"VELTSchedCTaskGetID", kCreate, "VELTSchedCTaskGetID() failed"},
                        Case{"VELTSchedTaskAlloc", kName, "VELTSchedTaskAlloc() failed."},
                        Case{"VELTSchedTaskSave", kName, "VELTSchedTaskSave() failed."},
                        Case{"VELTSchedTaskAlloc", kContent, "VELTSchedTaskAlloc() failed."},
                        Case{"VELTSchedTaskSave", kContent, "VELTSchedTaskSave() failed."},
                        Case{"VELTSchedTaskConvertFromJson_Schedule", kContent,
                             "ConvertScheduleJson() failed."}}) {
    LogCapture log;
    VeltDevFailCall(c.call, 1, 0, VLIBC_ERR_IO);
    EXPECT_FALSE(run(c.op)) << c.call;
    VeltDevClearFaults();
    EXPECT_EQ(1, Logged(log, c.line)) << c.call << "\n" << log.Dump();
  }
  EXPECT_EQ("Daily", Entry(id)["name"].asString());
}

TEST_F(ScheduleTest, ShowHideAndRemoveTouchOnlyThePackageEntries) {
  // Nothing to do is no failure.
  for (auto op : {Plovo::ShowAllSchedule, Plovo::HideAllSchedule, Plovo::RemoveAllSchedule}) {
    EXPECT_TRUE(op());
  }
  int64_t a = Create(), other = Foreign("Other.App", true), b = Create(),
          hidden = Foreign("Other.App", false), noApp = Foreign("", true);
  auto others = [&] { return std::vector<Json::Value>{Entry(other), Entry(hidden), Entry(noApp)}; };
  const std::vector<Json::Value> before = others();
  ASSERT_TRUE(Plovo::HideAllSchedule());
  EXPECT_FALSE(Entry(a)["listable"].asBool());
  EXPECT_FALSE(Entry(b)["listable"].asBool());
  {
    // Already hidden, so not saved again: a save that would fail is never made.
    LogCapture log;
    VeltDevFailCall("VELTSchedTaskSave", 1, 0, VLIBC_ERR_IO);
    EXPECT_TRUE(Plovo::HideAllSchedule());
    VeltDevClearFaults();
    EXPECT_TRUE(log.Lines().empty()) << log.Dump();
  }
  // The first save fails; the walk goes on to the next entry.
  VeltDevFailCall("VELTSchedTaskSave", 1, 1, VLIBC_ERR_IO);
  EXPECT_TRUE(Plovo::ShowAllSchedule());
  EXPECT_FALSE(Entry(a)["listable"].asBool());
  EXPECT_TRUE(Entry(b)["listable"].asBool());
  EXPECT_EQ(before, others());
  ASSERT_TRUE(Plovo::RemoveAllSchedule());
  EXPECT_EQ((std::vector<int64_t>{other, hidden, noApp}), Ids());
}

TEST_F(ScheduleTest, UnreadableListFails) {
  int64_t id = Create();
  for (auto op : {Plovo::ShowAllSchedule, Plovo::HideAllSchedule, Plovo::RemoveAllSchedule}) {
    VeltDevFailCall("VELTSchedTaskListGet", 1, 0, VLIBC_ERR_IO);
    EXPECT_FALSE(op());
  }
  VeltDevClearFaults();
  EXPECT_TRUE(Entry(id)["listable"].asBool());
  EXPECT_EQ(std::vector<int64_t>{id}, Ids());
}

}  // namespace
