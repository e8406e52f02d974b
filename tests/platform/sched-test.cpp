// Scheduler entries saved under the sandbox, and their next trigger times.
#include <json/reader.h>
#include <velt/sched.h>

#include <cstdlib>
#include <ctime>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "sandbox.h"

namespace {

using TaskPtr = std::unique_ptr<VELTSCHEDTASK, void (*)(PVELTSCHEDTASK)>;

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
  EXPECT_EQ("2024/01/04 22:15", Next("2024/01/03 23:55", twice));  // no 01:35 spill-over
  EXPECT_EQ("2024/01/03 23:59", Next("2024/01/03 12:00", Sched("3", "0", "0", "1439")));
}

TEST_F(SchedTest, NoDayOrNoTimetableGivesNoTime) {
  EXPECT_EQ("", Next("2024/01/03 12:00", Sched("", "9", "0", "0")));
  TaskPtr task = NewTask();
  EXPECT_EQ("", VELTSchedTaskGetNextTriggerTime(task.get()));
}

TEST_F(SchedTest, InvalidTimetableIsRefusedAndTaskUnchanged) {
  WriteFile("/velt-dev/sched-now", "2024/01/03 08:00");
  TaskPtr task = NewTask();
  ASSERT_EQ(0, SetTimetable(task.get(), Sched("3", "9", "0", "0")));
  const std::vector<std::string> bad = {
      "{}", R"({"schedule": {"week_name": "1", "hour": 1, "min": 1}})", Sched("1", "24", "0", "0"),
      Sched("1", "0", "60", "0"), Sched("1", "0", "0", "1440"), Sched("1", "\"7a\"", "0", "0"),
      Sched("1", "7.5", "0", "0"), Sched("7", "0", "0", "0"), Sched("1,,2", "0", "0", "0")};
  for (const std::string& json : bad) {
    EXPECT_EQ(-1, SetTimetable(task.get(), json)) << json;
    EXPECT_EQ(VLIBC_ERR_BAD_PARAMETER, VLIBCErrGet()) << json;
    EXPECT_EQ("2024/01/03 09:00", VELTSchedTaskGetNextTriggerTime(task.get())) << json;
  }
}

// The module loads entries another program saved: a bad id or a broken
// entry fails the load.
TEST_F(SchedTest, BadIdsAndMalformedEntriesDoNotLoad) {
  TaskPtr task = NewTask();
  EXPECT_TRUE(VELTSchedTaskLoad(0, task.get()) < 0 && VLIBCErrGet() == VLIBC_ERR_BAD_PARAMETER);
  for (const char* content : {"{", R"({"id": 3})", "[]"}) {
    WriteFile("/velt-dev/scheduler/3.json", content);
    EXPECT_EQ(-1, VELTSchedTaskLoad(3, task.get())) << content;
    EXPECT_EQ(VLIBC_ERR_IO, VLIBCErrGet()) << content;
  }
}

}  // namespace
