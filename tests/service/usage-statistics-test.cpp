// The usage-statistics document, read back from standard output.
#include "service/usage-statistics.h"

#include <fcntl.h>
#include <json/reader.h>
#include <json/writer.h>
#include <unistd.h>

#include <cstdio>
#include <sstream>
#include <utility>

#include "db/task-db.h"
#include "log-capture.h"
#include "sandbox.h"

namespace {

// What a correct run prints: the document styled, and nothing else.
std::string Printed(const std::string& json) {
  Json::Value value;
  std::istringstream(json) >> value;
  return Json::StyledWriter().write(value);
}

class UsageStatisticsTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/volume1/@Plovo/db");
    WriteFile("/var/packages/Plovo/etc/setting.conf", "repo_vol_path=\"" + Path("/volume1") + "\"\nbeep=\"yes\"\n");
  }
  // The result and everything written to standard output meanwhile.
  std::pair<int, std::string> Collect() const {
    std::fflush(stdout);
    const int saved = dup(STDOUT_FILENO), file = open(Path("/stdout").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    dup2(file, STDOUT_FILENO);
    const int result = CollectUageStatistics();
    std::fflush(stdout);
    dup2(saved, STDOUT_FILENO);
    close(saved);
    close(file);
    return {result, ReadFile("/stdout")};
  }
};

TEST_F(UsageStatisticsTest, DescribesEveryDeviceAndTaskWithoutNames) {
  const std::string head = R"({"collector_version": 2, "package_version": "0057", "collect_data": )";
  TaskDB db;
  ASSERT_EQ(db.Initialize(Path("/volume1/@Plovo/db/task-db.sqlite")), 0);
  EXPECT_EQ(Collect(), std::make_pair(0, Printed(head + R"([], "beep": true})")));
  unsigned long usb = 0, id = 0;
  TaskDB::USBInfo device;
  device.uuid = "u-1"; device.run_when_plug_in = true; device.eject_when_task_done = false;
  device.producer = "Acme"; device.product = "Stick";
  ASSERT_EQ(db.AddUSBInfo(device, usb), 0);
  TaskDB::TaskInfo task;
  task.usb_id = usb; task.task_name = "Trip"; task.usb_folder_path = "/DCIM"; task.nas_folder_path = "/album";
  task.task_type = 2; task.is_enable = true; task.last_copied_time = 1790000000; task.copy_strategy = 3;
  task.keep_dir_structure = false; task.smart_create_date_dir = true; task.remove_src_file = true;
  task.conflict_policy = 1; task.enable_rotation = true; task.max_version_count = 9; task.rotation_policy = 2;
  ASSERT_EQ(db.AddTaskInfo(task, id), 0);
  task = TaskDB::TaskInfo();
  task.usb_id = usb;
  ASSERT_EQ(db.AddTaskInfo(task, id), 0);
  device.uuid = "u-2"; device.run_when_plug_in = false; device.eject_when_task_done = true; device.product = "Card";
  ASSERT_EQ(db.AddUSBInfo(device, usb), 0);
  WriteFile("/var/packages/Plovo/etc/setting.conf", "repo_vol_path=\"" + Path("/volume1") + "\"\nbeep=\"no\"\n");
  EXPECT_EQ(Collect(), std::make_pair(0, Printed(head + R"([
    {"usb_id": 1, "uuid": "u-1", "run_when_plug_in": true, "eject_when_task_done": false, "producer": "Acme",
     "product": "Stick", "task_info": [
       {"task_type": 2, "is_enable": true, "last_copied_time": 1790000000, "copy_strategy": 3, "keep_dir_structure": false,
        "smart_create_date_dir": true, "rename_photo_video": false, "remove_src_file": true, "conflict_policy": 1,
        "enable_rotation": true, "max_version_count": 9, "rotation_policy": 2},
       {"task_type": 0, "is_enable": false, "last_copied_time": 0, "copy_strategy": 0, "keep_dir_structure": true,
        "smart_create_date_dir": false, "rename_photo_video": false, "remove_src_file": false, "conflict_policy": 0,
        "enable_rotation": false, "max_version_count": 0, "rotation_policy": 0}]},
    {"usb_id": 2, "uuid": "u-2", "run_when_plug_in": false, "eject_when_task_done": true, "producer": "Acme",
     "product": "Card", "task_info": []}], "beep": false})")));
}

TEST_F(UsageStatisticsTest, WithoutAReadableTaskDatabaseNothingIsPrinted) {
  for (const bool recorded : {false, true}) {
    WriteFile("/var/packages/Plovo/etc/setting.conf", recorded ? "repo_vol_path=\"" + Path("/volume1") + "\"\n" : "");
    MakeDir("/volume1/@Plovo/db/task-db.sqlite");  // a folder in the database's place
    plovo_test::LogCapture log;
    EXPECT_EQ(Collect(), std::make_pair(-1, std::string()));
    EXPECT_TRUE(log.Contains("Failed to init task db at")) << log.Dump();
  }
}

}  // namespace
