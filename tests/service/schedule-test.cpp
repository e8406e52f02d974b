// The package's scheduler entries as the development scheduler saves them.
#include <json/json.h>
#include <velt/dev.h>
#include <velt/sched.h>

#include <memory>
#include <string>
#include <vector>

#include "log-capture.h"
#include "sandbox.h"
#include "service/schedule.h"

namespace {

const char* const kTimetable =
    R"({"week_day":"1,3","hour":7,"minute":30,"repeat_date":0,"date":"2026/11/23"})";

// True when the last line logged is the module's error line with exactly this message.
bool LastLogIs(const plovo_test::LogCapture& log, const std::string& message) {
  std::vector<plovo_test::LogCapture::Line> lines = log.Lines();
  std::string text = lines.empty() ? "" : lines.back().text, tail = "): " + message + "\n";
  return text.rfind("[ERR] schedule(", 0) == 0 && text.size() > tail.size() &&
         text.compare(text.size() - tail.size(), tail.size(), tail) == 0;
}

Json::Value Parse(const std::string& text) {
  Json::Value value;
  std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
  EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &value, nullptr)) << text;
  return value;
}

class ScheduleTest : public plovo_test::SandboxTest {
 protected:
  // Every saved entry, whoever made it.
  std::vector<Json::Value> Entries() const {
    PVELTSCHEDTASKLIST list = nullptr;
    EXPECT_EQ(0, VELTSchedTaskListGet(&list, nullptr));
    std::vector<Json::Value> entries;
    int64_t id = -1;
    while (PVELTSCHEDTASK t = VELTSchedTaskNext(list)) {
      EXPECT_EQ(0, VELTSchedCTaskGetID(t, &id));
      entries.push_back(Parse(ReadFile("/velt-dev/scheduler/" + std::to_string(id) + ".json")));
    }
    VELTSchedTaskListFree(list);
    return entries;
  }
  // An entry of another application, or of none when app is empty.
  void Foreign(const char* app) {
    PVELTSCHEDTASK task = VELTSchedTaskAlloc();
    if (*app) VELTSchedCTaskSetApp(task, app);
    EXPECT_EQ(0, VELTSchedTaskSave(task));
    VELTSchedTaskFree(task);
  }
};

TEST_F(ScheduleTest, CreateAndUpdateSaveEveryField) {
  Json::Value want = Parse(R"({"app": "VELT.QXS.Plovo.Application", "name": "Copy card",
      "app_name": "#common:app_name#", "action": "#type:icon_export_general#", "owner": 0,
      "can_run_app_same_time": true, "can_run_task_same_time": true, "can_run_from_ui": true,
      "can_edit_name": false, "can_edit_owner": false, "can_delete_from_ui": false,
      "listable": true, "schedule": {"week_day": "1,3", "week_name": "1,3", "hour": 7,
      "min": 30, "repeat_date": 0, "repeat": 0, "date": "2026/11/23"}})");
  int64_t id = -1;
  for (bool enabled : {false, true}) {
    ASSERT_TRUE(Plovo::CreateSchedule(42, 2, "Copy card", enabled, kTimetable, id));
    want["id"] = Json::Int64(id);
    want["command"] = Root() + "/var/packages/Plovo/target/bin/plovo-notifier --execute-task 42";
    want["enabled"] = enabled;
    EXPECT_EQ(want, Entries().back());
  }
  ASSERT_TRUE(Plovo::UpdateScheduleName(id, "Nightly"));
  const char* json = R"({"week_day":"0","hour":23,"minute":5,"repeat_date":60})";
  ASSERT_TRUE(Plovo::UpdateScheduleContent(id, false, json));
  want["name"] = "Nightly";
  want["enabled"] = false;
  want["schedule"] = Parse(R"({"week_day": "0", "week_name": "0", "hour": 23, "min": 5,
                              "repeat_date": 60, "repeat": 60})");
  EXPECT_EQ(want, Entries().back());
}

TEST_F(ScheduleTest, FailuresAreLoggedAndReported) {
  int64_t id = -1, newId = -1;
  ASSERT_TRUE(Plovo::CreateSchedule(5, 1, "Daily", true, kTimetable, id));
  enum Op { kCreate, kName, kContent };
  // fail: the platform call made to fail, if any; arg: the name or the
  // timetable ("[1,3]" is JSON but no timetable; trailing text is refused).
  struct Case { Op op; const char* fail; std::string arg; const char* line; };
  for (const Case& c : {Case{kCreate, "VELTSchedTaskSave", kTimetable, "VELTSchedTaskSave() failed"},
                        Case{kCreate, nullptr, std::string(1025, 'n'), "Invalid schedule name of 1025 bytes"},
                        Case{kName, "VELTSchedTaskLoad", "n", "VELTSchedTaskLoad() failed."},
                        Case{kName, "VELTSchedTaskSave", "n", "VELTSchedTaskSave() failed."},
                        Case{kName, nullptr, std::string("a\0b", 3), "Invalid schedule name of 3 bytes"},
                        Case{kContent, nullptr, "[1,3]", "ConvertScheduleJson() failed."},
                        Case{kContent, nullptr, std::string(kTimetable) + " x", "ConvertScheduleJson() failed."}}) {
    plovo_test::LogCapture log;
    if (c.fail) VeltDevFailCall(c.fail, 1, 1, VLIBC_ERR_IO);
    EXPECT_FALSE(c.op == kCreate ? Plovo::CreateSchedule(1, 2, c.arg, true, kTimetable, newId)
                 : c.op == kName ? Plovo::UpdateScheduleName(id, c.arg)
                                 : Plovo::UpdateScheduleContent(id, true, c.arg)) << c.line;
    EXPECT_TRUE(LastLogIs(log, c.line)) << c.line << "\n" << log.Dump();
  }
  plovo_test::LogCapture log;
  EXPECT_FALSE(Plovo::CreateSchedule(1, 2, "n", true, "not json", newId));
  EXPECT_TRUE(log.Contains("[ERR] schedule(") && log.Contains("parse json[not json] failed")) << log.Dump();
  EXPECT_EQ(Entries().size(), 1u);  // no failed create left an entry
}

TEST_F(ScheduleTest, ShowHideAndRemoveTouchOnlyThePackageEntries) {
  for (const char* app : {"Other.App", ""}) {
    int64_t id = -1;
    ASSERT_TRUE(Plovo::CreateSchedule(5, 1, "Daily", true, kTimetable, id));
    Foreign(app);
  }
  std::vector<Json::Value> want = Entries();
  ASSERT_EQ(4u, want.size());
  ASSERT_TRUE(Plovo::HideAllSchedule());
  want[0]["listable"] = want[2]["listable"] = false;
  EXPECT_EQ(want, Entries());
  // Entries already hidden are not saved again, so the failing save is left
  // for the next show: the first entry stays hidden, the walk goes on.
  plovo_test::LogCapture log;
  VeltDevFailCall("VELTSchedTaskSave", 1, 1, VLIBC_ERR_IO);
  EXPECT_TRUE(Plovo::HideAllSchedule());
  EXPECT_TRUE(log.Lines().empty()) << log.Dump();
  EXPECT_TRUE(Plovo::ShowAllSchedule());
  want[2]["listable"] = true;
  EXPECT_EQ(want, Entries());
  for (auto op : {Plovo::ShowAllSchedule, Plovo::HideAllSchedule, Plovo::RemoveAllSchedule}) {
    VeltDevFailCall("VELTSchedTaskListGet", 1, 1, VLIBC_ERR_IO);
    EXPECT_FALSE(op());
  }
  ASSERT_TRUE(Plovo::RemoveAllSchedule());
  EXPECT_EQ((std::vector<Json::Value>{want[1], want[3]}), Entries());
}

}  // namespace
