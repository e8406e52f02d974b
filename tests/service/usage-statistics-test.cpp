// The usage-statistics document, read back from standard output.
#include "service/usage-statistics.h"

#include <json/reader.h>
#include <json/writer.h>

#include <sstream>

#include "db/task-db.h"
#include "sandbox.h"

namespace {

using UsageStatisticsTest = plovo_test::SandboxTest;

// Styled, and nothing else printed. Where the repository has no task database, none is
// created: the next start would take it for an install that already has its default tasks.
TEST_F(UsageStatisticsTest, PrintsEveryDeviceAndTaskWithoutNamesAndCreatesNoDatabase) {
  MakeDir("/volume1/@Plovo/db");
  WriteFile("/var/packages/Plovo/etc/setting.conf", "repo_vol_path=\"" + Path("/volume1") + "\"\nbeep=\"no\"\n");
  testing::internal::CaptureStdout();
  EXPECT_EQ(CollectUageStatistics(), -1);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
  EXPECT_FALSE(Exists("/volume1/@Plovo/db/task-db.sqlite"));
  TaskDB db;
  ASSERT_EQ(db.Initialize(Path("/volume1/@Plovo/db/task-db.sqlite")), 0);
  unsigned long usb = 0, id = 0;
  TaskDB::USBInfo device;
  device.uuid = "u-1", device.run_when_plug_in = true, device.eject_when_task_done = false;
  device.producer = "Acme", device.product = "Stick";
  ASSERT_EQ(db.AddUSBInfo(device, usb), 0);
  TaskDB::TaskInfo task;
  task.usb_id = usb, task.task_name = "Trip", task.usb_folder_path = "/DCIM", task.nas_folder_path = "/album";
  task.task_type = 2, task.is_enable = true, task.last_copied_time = 1790000000, task.max_version_count = 9;
  ASSERT_EQ(db.AddTaskInfo(task, id), 0);
  device.uuid = "u-2", device.run_when_plug_in = false, device.eject_when_task_done = true, device.product = "Card";
  ASSERT_EQ(db.AddUSBInfo(device, usb), 0);
  Json::Value expected;
  std::istringstream(R"({"collector_version": 2, "package_version": "0057", "beep": false, "collect_data": [
    {"usb_id": 1, "uuid": "u-1", "run_when_plug_in": true, "eject_when_task_done": false, "producer": "Acme",
     "product": "Stick", "task_info": [{"task_type": 2, "is_enable": true, "last_copied_time": 1790000000,
       "copy_strategy": 0, "keep_dir_structure": true, "smart_create_date_dir": false, "rename_photo_video": false,
       "remove_src_file": false, "conflict_policy": 0, "enable_rotation": false, "max_version_count": 9, "rotation_policy": 0}]},
    {"usb_id": 2, "uuid": "u-2", "run_when_plug_in": false, "eject_when_task_done": true, "producer": "Acme",
     "product": "Card", "task_info": []}]})") >> expected;
  testing::internal::CaptureStdout();
  EXPECT_EQ(CollectUageStatistics(), 0);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), Json::StyledWriter().write(expected));
}

}  // namespace
