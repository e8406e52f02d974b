// The task database: the schema it leaves on disk, its triggers, quoting,
// the result conventions, and one instance used from eight threads.
#include "db/task-db.h"

#include <syslog.h>

#include <sstream>
#include <thread>
#include <vector>

#include "log-capture.h"
#include "raw-sqlite.h"
#include "sandbox.h"

namespace {

using plovo_test::LogCapture;
using plovo_test::RawSqlite;

std::string Text(const TaskDB::TaskInfo& t) {
  std::ostringstream s;
  s << t.id << '|' << t.usb_id << '|' << t.schedule_id << '|' << t.is_enable << '|' << t.task_name << '|'
    << t.task_type << '|' << t.usb_folder_path << '|' << t.nas_folder_path << '|' << t.nas_share_name << '|'
    << t.last_copied_time << '|' << t.copy_strategy << '|' << t.keep_dir_structure << t.smart_create_date_dir
    << t.rename_photo_video << t.remove_src_file << '|' << t.conflict_policy << '|' << t.enable_rotation << '|'
    << t.max_version_count << '|' << t.rotation_policy << '|' << t.error;
  return s.str();
}

class TaskDBTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/db");
    path_ = Path("/db/task-db.sqlite");
    ASSERT_EQ(db_.Initialize(path_), 0);
  }
  void TearDown() override {
    db_.Destroy();
    SandboxTest::TearDown();
  }
  unsigned long AddDevice(const std::string& uuid) {
    TaskDB::USBInfo device;
    device.uuid = uuid;
    unsigned long id = 0;
    EXPECT_EQ(db_.AddUSBInfo(device, id), 0) << uuid;
    return id;
  }
  unsigned long AddTask(unsigned long usbId) {
    TaskDB::TaskInfo task;
    task.usb_id = usbId;
    unsigned long id = 0;
    EXPECT_EQ(db_.AddTaskInfo(task, id), 0);
    return id;
  }

  std::string path_;
  TaskDB db_;
};

TEST_F(TaskDBTest, SchemaOnDiskAndInitializingAgain) {
  RawSqlite raw(path_);
  EXPECT_EQ(raw.Rows("PRAGMA journal_mode"), "wal");
  EXPECT_EQ(raw.Columns("config_table"), "key TEXT 0 NULL 1,value TEXT 1 NULL 0");
  EXPECT_EQ(raw.Columns("usb_info_table"),
            "id INTEGER 0 NULL 1,uuid TEXT 1 NULL 0,run_when_plug_in INTEGER 1 NULL 0,eject_when_task_done INTEGER 1 "
            "NULL 0,producer TEXT 1 NULL 0,product TEXT 1 NULL 0");
  std::string columns = "id INTEGER 0 NULL 1";
  for (const char* c : {"usb_id I", "is_enable I", "task_name T", "task_type I", "usb_folder_path T",
                        "nas_folder_path T", "nas_share_name T", "last_copied_time I", "copy_strategy I",
                        "keep_dir_structure I", "smart_create_date_dir I", "rename_photo_video I", "remove_src_file I",
                        "conflict_policy I", "enable_rotation I", "max_version_count I", "rotation_policy I"}) {
    const std::string name(c);
    columns += "," + name.substr(0, name.size() - 2) + (name.back() == 'I' ? " INTEGER" : " TEXT") + " 1 NULL 0";
  }
  EXPECT_EQ(raw.Columns("task_info_table"), columns + ",schedule_id INTEGER 0 -1 0,error INTEGER 1 NULL 0");
  // Ids count up for ever and a uuid is unique.
  EXPECT_EQ(raw.Rows("SELECT name FROM sqlite_master WHERE sql LIKE '%id INTEGER PRIMARY KEY AUTOINCREMENT%'"),
            "usb_info_table,task_info_table");
  EXPECT_EQ(raw.Rows("SELECT \"unique\" FROM pragma_index_list('usb_info_table') WHERE origin = 'u'"), "1");
  EXPECT_EQ(raw.Rows("SELECT m.type, m.name, m.tbl_name, i.name FROM sqlite_master m LEFT JOIN "
                     "pragma_index_info(m.name) i WHERE m.type IN ('index', 'trigger') ORDER BY m.name"),
            "index sqlite_autoindex_config_table_1 config_table key,"
            "index sqlite_autoindex_usb_info_table_1 usb_info_table uuid,"
            "trigger task_info_delete_trigger task_info_table NULL,"
            "index task_info_table_nas_share_name_idx task_info_table nas_share_name,"
            "index task_info_table_usb_id_idx task_info_table usb_id,"
            "trigger usb_info_delete_trigger usb_info_table NULL,"
            "index usb_info_table_uuid_idx usb_info_table uuid");
  EXPECT_EQ(raw.Rows("SELECT key, value, typeof(value) FROM config_table"), "version 2 text");

  // A second Initialize keeps the first connection, even for another path.
  AddTask(AddDevice("dev-a"));
  raw.Exec("UPDATE config_table SET value = '7'");
  const std::string schema = raw.Rows("SELECT * FROM sqlite_master");
  {
    LogCapture log;
    EXPECT_EQ(db_.Initialize(Path("/other.sqlite")), 0);
    EXPECT_TRUE(log.Contains(LOG_INFO, "[INFO] task-db(") && log.Contains("): Task DB has been inited")) << log.Dump();
  }
  EXPECT_FALSE(Exists("/other.sqlite"));
  // Opening the existing file again changes nothing.
  db_.Destroy();
  ASSERT_EQ(db_.Initialize(path_), 0);
  EXPECT_EQ(raw.Rows("SELECT * FROM sqlite_master"), schema);
  EXPECT_EQ(raw.Rows("SELECT value FROM config_table"), "7");
  EXPECT_EQ(raw.Rows("SELECT COUNT(*) FROM task_info_table"), "1");
}

TEST_F(TaskDBTest, RemovingADeviceOrItsLastTaskRemovesTheOther) {
  const unsigned long a = AddDevice("dev-a"), b = AddDevice("dev-b");
  const unsigned long a1 = AddTask(a);
  AddTask(a);
  const unsigned long b1 = AddTask(b), b2 = AddTask(b);
  ASSERT_EQ(db_.RemoveUSBInfo(a), 0);
  std::list<TaskDB::TaskInfo> tasks;
  ASSERT_EQ(db_.ListTaskInfo(tasks), 0);
  EXPECT_EQ(tasks.size(), 2u);
  TaskDB::TaskInfo task;
  EXPECT_EQ(db_.GetTaskInfo(a1, task), 0);
  TaskDB::USBInfo device;
  ASSERT_EQ(db_.RemoveTaskInfo(b1), 0);
  EXPECT_EQ(db_.GetUSBInfo(b, device), 1) << "a task is left";
  ASSERT_EQ(db_.RemoveTaskInfo(b2), 0);
  EXPECT_EQ(db_.GetUSBInfo(b, device), 0) << "the last task went";
}

TEST_F(TaskDBTest, RecordsRoundTripWithQuotesIntact) {
  TaskDB::USBInfo device;
  device.uuid = "it's-'quoted'";
  device.run_when_plug_in = true;
  device.eject_when_task_done = false;
  device.producer = "O'Neil";
  unsigned long usbId = 0;
  ASSERT_EQ(db_.AddUSBInfo(device, usbId), 0);
  device.product = "New'product";
  device.id = usbId;
  ASSERT_EQ(db_.UpdateUSBInfo(device), 0);
  TaskDB::USBInfo read;
  ASSERT_EQ(db_.GetUSBInfoByUUID("it's-'quoted'", read), 1);
  EXPECT_TRUE(read.id == usbId && read.producer == "O'Neil" && read.product == "New'product" &&
              read.run_when_plug_in && !read.eject_when_task_done);

  TaskDB::TaskInfo task;
  task.usb_id = usbId;
  task.task_name = "Bob's trip";
  task.usb_folder_path = "/DCIM/'100'";
  task.nas_folder_path = "/it's/here";
  task.nas_share_name = "Bob's share";
  task.is_enable = task.smart_create_date_dir = task.rename_photo_video = task.remove_src_file = true;
  task.keep_dir_structure = false;
  task.enable_rotation = true;
  task.task_type = 3;
  task.copy_strategy = task.conflict_policy = task.rotation_policy = 2;
  task.last_copied_time = 4000000000u;
  task.max_version_count = 5000000000ul;
  task.schedule_id = 1234567890123l;
  task.error = -25;
  ASSERT_EQ(db_.AddTaskInfo(task, task.id), 0);
  std::list<TaskDB::TaskInfo> tasks;
  ASSERT_EQ(db_.ListTaskInfo("Bob's share", tasks), 0);
  ASSERT_EQ(tasks.size(), 1u);
  EXPECT_EQ(Text(tasks.front()), Text(task));

  ASSERT_EQ(db_.UpdateNASShareName("Bob's share", "Ann's"), 0);
  task.nas_share_name = "Ann's";
  for (const auto& [share, found] : {std::pair<const char*, size_t>{"Ann's", 1}, {"Bob's share", 0},
                                     {"x' OR '1'='1", 0}}) {
    ASSERT_EQ(db_.ListTaskInfo(share, tasks), 0);
    EXPECT_EQ(tasks.size(), found) << share;
  }
  task.task_name = "Renamed";
  task.schedule_id = -1;
  ASSERT_EQ(db_.UpdateTaskInfo(task), 0);
  ASSERT_EQ(db_.EnableTaskInfo(task.id, false), 0);
  task.is_enable = false;
  ASSERT_EQ(db_.ListTaskInfo(usbId, tasks), 0);
  EXPECT_EQ(Text(tasks.front()), Text(task));

  // The error alone, or the error and a new copy time.
  ASSERT_EQ(db_.UpdateTaskInfo(task.id, 5, 0), 0);
  TaskDB::TaskInfo got;
  ASSERT_EQ(db_.GetTaskInfo(task.id, got), 1);
  EXPECT_TRUE(got.error == 5 && got.last_copied_time == 4000000000u) << Text(got);
  ASSERT_EQ(db_.UpdateTaskInfo(task.id, 0, 1800000000u), 0);
  ASSERT_EQ(db_.GetTaskInfo(task.id, got), 1);
  EXPECT_TRUE(got.error == 0 && got.last_copied_time == 1800000000u) << Text(got);
}

TEST_F(TaskDBTest, MissingRowsAndFailures) {
  TaskDB::TaskInfo task;
  task.task_name = "untouched";
  EXPECT_EQ(db_.GetTaskInfo(999, task), 0);
  EXPECT_EQ(task.task_name, "untouched");
  LogCapture log;
  TaskDB::USBInfo duplicate;
  duplicate.uuid = "dev";
  unsigned long id = AddDevice("dev");
  EXPECT_EQ(db_.AddUSBInfo(duplicate, id), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "[ERR] task-db(") &&
              log.Contains("): sqlite3_exec: [19] UNIQUE constraint failed: usb_info_table.uuid")) << log.Dump();

  // A table gone under the library's feet: the list keeps what it held.
  RawSqlite(path_).Exec("DROP TABLE task_info_table");
  EXPECT_EQ(db_.GetTaskInfo(1, task), -1);
  std::list<TaskDB::TaskInfo> tasks(1);
  EXPECT_EQ(db_.ListTaskInfo(tasks), -1);
  EXPECT_EQ(tasks.size(), 1u);
  EXPECT_TRUE(log.Contains("): sqlite3_prepare_v2: [1] no such table: task_info_table")) << log.Dump();

  // A failed Initialize leaves the instance closed.
  TaskDB other;
  EXPECT_EQ(other.Initialize(Path("/nowhere/task-db.sqlite")), -1);
  WriteFile("/not-a-db", std::string(4096, 'x'));
  EXPECT_EQ(other.Initialize(Path("/not-a-db")), -1);
  EXPECT_TRUE(log.Contains("): Failed to create task db at '" + Path("/nowhere/task-db.sqlite") + "'. [14] ") &&
              log.Contains("): Failed to create task db table at '" + Path("/not-a-db") + "'. [26] "));
  EXPECT_EQ(other.Initialize(Path("/good.sqlite")), 0);
  EXPECT_FALSE(log.Contains("has been inited"));
}

TEST(EscapingTest, LiteralsAndPatterns) {
  const char* const cases[][4] = {
      // text, SQL literal, LIKE pattern, GLOB pattern
      {"50%_a\\b", "'50%_a\\b'", "50\\%\\_a\\b", "50%_a\\b"},
      {"a*b[c]?", "'a*b[c]?'", "a*b[c]?", "a[*]b[[]c][?]"},
      {"O'Brien", "'O''Brien'", "O'Brien", "O'Brien"},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(GetEscapedString(c[0]), c[1]);
    EXPECT_EQ(GetEscapedLIKEString(c[0]), c[2]);
    EXPECT_EQ(GetEscapedGLOBString(c[0]), c[3]);
  }
}

// Eight threads on one instance, each with its own device and tasks; run
// under ThreadSanitizer by scripts/test. Each thread checks every result
// and what it reads back; removing its device with tasks still on it must
// take the tasks too, so nothing is left at the end.
TEST_F(TaskDBTest, EightThreadsShareOneInstance) {
  std::vector<int> failures(8, 0);
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([this, t, &failures] {
      int& failed = failures[t];
      TaskDB::USBInfo device, readDevice;
      device.uuid = "dev-" + std::to_string(t);
      unsigned long usbId = 0;
      failed += db_.AddUSBInfo(device, usbId) != 0;
      std::vector<TaskDB::TaskInfo> tasks(20);
      for (int i = 0; i < 20; ++i) {
        TaskDB::TaskInfo& task = tasks[i];
        TaskDB::TaskInfo read;
        task.usb_id = usbId;
        task.task_name = device.uuid + "-" + std::to_string(i);
        failed += db_.AddTaskInfo(task, task.id) != 0;
        failed += db_.UpdateTaskInfo(task.id, i + 1, 0) != 0;
        failed += db_.GetTaskInfo(task.id, read) != 1 || read.task_name != task.task_name || read.error != i + 1;
      }
      // Half the tasks go; the device stays while it has any.
      std::string kept;
      for (int i = 0; i < 20; ++i) {
        TaskDB::TaskInfo read;
        if (i % 2 == 0) {
          failed += db_.RemoveTaskInfo(tasks[i].id) != 0 || db_.GetTaskInfo(tasks[i].id, read) != 0;
          failed += db_.GetUSBInfo(usbId, readDevice) != 1;
        } else {
          kept += tasks[i].task_name + ",";
        }
      }
      std::list<TaskDB::TaskInfo> mine;
      failed += db_.ListTaskInfo(usbId, mine) != 0;
      std::string listed;
      for (const TaskDB::TaskInfo& task : mine) listed += task.task_name + ",";
      failed += listed != kept;
      failed += db_.RemoveUSBInfo(usbId) != 0 || db_.GetUSBInfo(usbId, readDevice) != 0;
      failed += db_.ListTaskInfo(usbId, mine) != 0 || !mine.empty();
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures, std::vector<int>(8, 0));
  std::list<TaskDB::USBInfo> devices;
  std::list<TaskDB::TaskInfo> tasks;
  ASSERT_EQ(db_.ListUSBInfo(devices), 0);
  ASSERT_EQ(db_.ListTaskInfo(tasks), 0);
  EXPECT_EQ(devices.size() + tasks.size(), 0u);
  EXPECT_EQ(RawSqlite(path_).Rows("SELECT (SELECT COUNT(*) FROM usb_info_table), COUNT(*) FROM task_info_table"),
            "0 0");
}

}  // namespace
