// The task and log databases: the schema each leaves on disk, the triggers,
// quoting, the filter, the results that deliberately do not fail, and
// sharing a file between threads and with another process.
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <chrono>
#include <functional>
#include <sstream>
#include <thread>
#include <tuple>

#include "db/log-db.h"
#include "db/task-db.h"
#include "log-capture.h"
#include "raw-db.h"
#include "sandbox.h"

namespace {

using plovo_test::LogCapture;

const std::vector<unsigned int> kAllIds{1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12};

// A filter that names every description id, so no id limits it.
LogDB::LogInfoFilter All() {
  LogDB::LogInfoFilter filter;
  filter.log_desc_id_list = kAllIds;
  return filter;
}

using Raw = plovo_test::RawDB;

// Every table, index and trigger of a file by name, with the table it is on
// and its columns; a table's as "name type", "null" when nullable,
// "=default", "pk" for the key.
const char* const kObjects =
    "SELECT name || iif(type = 'table', '', ' ON ' || tbl_name) || ifnull('(' || ifnull((SELECT group_concat(name || "
    "' ' || type || iif(\"notnull\", '', ' null') || ifnull(' =' || dflt_value, '') || iif(pk, ' pk', ''), ', ') FROM "
    "pragma_table_info(m.name)), (SELECT group_concat(name) FROM pragma_index_info(m.name))) || ')', '') "
    "FROM sqlite_master m WHERE name != 'sqlite_sequence' ORDER BY name";
// The configuration rows and the AUTOINCREMENT counters.
const char* const kValues =
    "SELECT key, value, typeof(value) FROM config_table UNION ALL "
    "SELECT name, seq, 'seq' FROM sqlite_sequence ORDER BY 1";

template <typename DB>
class DBTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    ASSERT_EQ(db_.Initialize(path_ = Path("/db.sqlite")), 0);
  }
  void TearDown() override {
    db_.Destroy();
    SandboxTest::TearDown();
  }
  // What Initialize left on disk, once a row is in each table. Then a second
  // Initialize only logs and keeps its connection, and opening the file
  // again changes nothing that is there.
  void CheckSchema(const char* source, const char* objects, const char* values) {
    Raw raw(path_);
    EXPECT_EQ(raw.Rows("PRAGMA journal_mode"), "wal");
    EXPECT_EQ(raw.Rows(kObjects), objects);
    EXPECT_EQ(raw.Rows(kValues), values);
    ASSERT_EQ(raw.Run("UPDATE config_table SET value = value + 1"), SQLITE_OK);
    const std::string changed = raw.Rows(kValues);
    LogCapture log;
    EXPECT_EQ(db_.Initialize(Path("/other.sqlite")), 0);
    EXPECT_TRUE(log.Contains(LOG_INFO, "[INFO] " + std::string(source) + "(") &&
                log.Contains("): Task DB has been inited") && !Exists("/other.sqlite")) << log.Dump();
    db_.Destroy();
    ASSERT_EQ(db_.Initialize(path_), 0);
    EXPECT_EQ(raw.Rows(kValues), changed);
  }

  std::string path_;
  DB db_;
};

using TaskDBTest = DBTest<TaskDB>;

class LogDBTest : public DBTest<LogDB> {
 protected:
  void Add(const std::string& param) {
    LogDB::LogInfo info;
    info.description_param = param;
    ASSERT_EQ(db_.AddLogInfo(info), 0) << param;
  }
  // The parameter of each listed row after a ','. The list is appended to:
  // the empty record it held stays first.
  std::string List(const LogDB::LogInfoFilter& filter) {
    std::list<LogDB::LogInfo> list(1);
    EXPECT_EQ(db_.ListLogInfo(filter, list), 0);
    std::string params;
    for (const LogDB::LogInfo& info : list) params += (&info == &list.front() ? "" : ",") + info.description_param;
    return params;
  }
};

TEST_F(TaskDBTest, SchemaOnDiskAndInitializingAgain) {
  TaskDB::TaskInfo task;
  ASSERT_EQ(db_.AddUSBInfo(TaskDB::USBInfo(), task.usb_id), 0);
  ASSERT_EQ(db_.AddTaskInfo(task, task.id), 0);
  CheckSchema("task-db",
              "config_table(key TEXT null pk, value TEXT)\nsqlite_autoindex_config_table_1 ON config_table(key)\n"
              "sqlite_autoindex_usb_info_table_1 ON usb_info_table(uuid)\n"
              "task_info_delete_trigger ON task_info_table\n"
              "task_info_table(id INTEGER null pk, usb_id INTEGER, is_enable INTEGER, task_name TEXT, task_type "
              "INTEGER, usb_folder_path TEXT, nas_folder_path TEXT, nas_share_name TEXT, last_copied_time INTEGER, "
              "copy_strategy INTEGER, keep_dir_structure INTEGER, smart_create_date_dir INTEGER, rename_photo_video "
              "INTEGER, remove_src_file INTEGER, conflict_policy INTEGER, enable_rotation INTEGER, max_version_count "
              "INTEGER, rotation_policy INTEGER, schedule_id INTEGER null =-1, error INTEGER)\n"
              "task_info_table_nas_share_name_idx ON task_info_table(nas_share_name)\n"
              "task_info_table_usb_id_idx ON task_info_table(usb_id)\nusb_info_delete_trigger ON usb_info_table\n"
              "usb_info_table(id INTEGER null pk, uuid TEXT, run_when_plug_in INTEGER, eject_when_task_done INTEGER, "
              "producer TEXT, product TEXT)\nusb_info_table_uuid_idx ON usb_info_table(uuid)",
              "task_info_table 1 seq\nusb_info_table 1 seq\nversion 2 text");
}

std::string Text(const TaskDB::TaskInfo& t) {
  std::ostringstream s;
  s << t.id << '|' << t.usb_id << '|' << t.schedule_id << '|' << t.is_enable << '|' << t.task_name << '|'
    << t.task_type << '|' << t.usb_folder_path << '|' << t.nas_folder_path << '|' << t.nas_share_name << '|'
    << t.last_copied_time << '|' << t.copy_strategy << '|' << t.keep_dir_structure << t.smart_create_date_dir
    << t.rename_photo_video << t.remove_src_file << '|' << t.conflict_policy << '|' << t.enable_rotation << '|'
    << t.max_version_count << '|' << t.rotation_policy << '|' << t.error;
  return s.str();
}

// Every column written and read back, quotes intact; not found is 0 and
// leaves the record as it was.
TEST_F(TaskDBTest, RecordsRoundTripWithQuotesIntact) {
  TaskDB::USBInfo device, readDevice;
  device.uuid = "it's";
  device.producer = "O'Neil";
  device.eject_when_task_done = false;
  ASSERT_EQ(db_.AddUSBInfo(device, device.id), 0);
  device.product = "New'product";
  device.run_when_plug_in = true;
  ASSERT_EQ(db_.UpdateUSBInfo(device), 0);
  ASSERT_EQ(db_.GetUSBInfoByUUID("it's", readDevice), 1);
  EXPECT_TRUE(readDevice.id == device.id && readDevice.producer == "O'Neil" && readDevice.product == "New'product" &&
              readDevice.run_when_plug_in && !readDevice.eject_when_task_done);

  // Read as stored, written as a new row and read back.
  Raw raw(path_);
  ASSERT_EQ(raw.Run("INSERT INTO task_info_table VALUES (1, 1, 1, 'Bob''s trip', 3, '/DCIM/''100''', '/it''s/here', "
                    "'Bob''s share', 4000000000, 1, 0, 1, 0, 1, 2, 1, 5000000000, 2, 1234567890123, -25)"), SQLITE_OK);
  TaskDB::TaskInfo task, read;
  ASSERT_EQ(db_.GetTaskInfo(1, task), 1);
  EXPECT_EQ(Text(task), "1|1|1234567890123|1|Bob's trip|3|/DCIM/'100'|/it's/here|Bob's share|4000000000|1|0101|2|1|"
                        "5000000000|2|-25");
  ASSERT_EQ(db_.AddTaskInfo(task, task.id), 0);
  ASSERT_EQ(db_.GetTaskInfo(task.id, read), 1);
  EXPECT_EQ(Text(read), Text(task));
  EXPECT_EQ(db_.GetTaskInfo(task.id + 1, read), 0);
  EXPECT_EQ(Text(read), Text(task));
  // Every column rewritten, the task disabled, its share renamed.
  task.task_name = "Renamed";
  task.schedule_id = -1;
  ASSERT_EQ(db_.UpdateTaskInfo(task), 0);
  ASSERT_EQ(db_.EnableTaskInfo(task.id, false), 0);
  ASSERT_EQ(db_.UpdateNASShareName("Bob's share", "Ann's"), 0);
  task.is_enable = false;
  task.nas_share_name = "Ann's";
  std::list<TaskDB::TaskInfo> tasks(1);  // emptied first
  ASSERT_EQ(db_.ListTaskInfo("Ann's", tasks), 0);
  ASSERT_EQ(tasks.size(), 2u);
  EXPECT_EQ(Text(tasks.back()), Text(task));
  // The error alone, or the error and a new copy time.
  for (const auto& [error, time, kept] : {std::tuple<int, unsigned, unsigned>{5, 0, 4000000000u}, {0, 9, 9}}) {
    ASSERT_EQ(db_.UpdateTaskInfo(task.id, error, time), 0);
    ASSERT_EQ(db_.GetTaskInfo(task.id, read), 1);
    EXPECT_TRUE(read.error == error && read.last_copied_time == kept) << Text(read);
  }
}

// Failures are -1 and logged; a failed Initialize leaves the object closed.
TEST_F(TaskDBTest, Failures) {
  LogCapture log;
  TaskDB::USBInfo device;
  ASSERT_EQ(db_.AddUSBInfo(device, device.id), 0);
  EXPECT_EQ(db_.AddUSBInfo(device, device.id), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "[ERR] task-db(") &&
              log.Contains("): sqlite3_exec: [19] UNIQUE constraint failed: usb_info_table.uuid")) << log.Dump();
  // A table gone under the library's feet: the list keeps what it held.
  ASSERT_EQ(Raw(path_).Run("DROP TABLE task_info_table"), SQLITE_OK);
  TaskDB::TaskInfo task;
  std::list<TaskDB::TaskInfo> tasks(1);
  EXPECT_TRUE(db_.GetTaskInfo(1, task) == -1 && db_.ListTaskInfo(tasks) == -1 && tasks.size() == 1);
  EXPECT_TRUE(log.Contains("): sqlite3_prepare_v2: [1] no such table: task_info_table")) << log.Dump();
  TaskDB other;
  WriteFile("/not-a-db", std::string(4096, 'x'));
  EXPECT_EQ(other.Initialize(Path("/nowhere/task-db.sqlite")), -1);
  EXPECT_EQ(other.Initialize(Path("/not-a-db")), -1);
  EXPECT_TRUE(log.Contains("): Failed to create task db at '" + Path("/nowhere/task-db.sqlite") + "'. [14] ") &&
              log.Contains("): Failed to create task db table at '" + Path("/not-a-db") + "'. [26] "));
  EXPECT_EQ(other.Initialize(Path("/good.sqlite")), 0);
  EXPECT_FALSE(log.Contains("has been inited"));
}

TEST(EscapingTest, LiteralsAndPatterns) {
  const char* const cases[][2] = {
      // text; its SQL literal, LIKE pattern and GLOB pattern
      {"50%_a\\b", "'50%_a\\b' 50\\%\\_a\\b 50%_a\\b"},
      {"a*b[c]?", "'a*b[c]?' a*b[c]? a[*]b[[]c][?]"},
      {"O'Brien", "'O''Brien' O'Brien O'Brien"},
  };
  for (const auto& [text, escaped] : cases) {
    EXPECT_EQ(GetEscapedString(text) + " " + GetEscapedLIKEString(text) + " " + GetEscapedGLOBString(text), escaped);
  }
}

// Eight threads on one instance (run under ThreadSanitizer by scripts/test),
// each with its own device and tasks, checking every result and what it
// reads back. A device stays while it has a task; its last task's removal
// takes it, and its removal takes its tasks: nothing is left at the end.
TEST_F(TaskDBTest, EightThreadsShareOneInstance) {
  std::vector<int> failures(8, 0);
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([this, t, &failed = failures[t]] {
      TaskDB::USBInfo device;
      device.uuid = "dev-" + std::to_string(t);
      TaskDB::TaskInfo task, read;
      failed += db_.AddUSBInfo(device, task.usb_id) != 0;
      std::vector<unsigned long> ids(10);
      for (int i = 0; i < 10; ++i) {
        task.task_name = device.uuid + "-" + std::to_string(i);
        failed += db_.AddTaskInfo(task, ids[i]) != 0 || db_.UpdateTaskInfo(ids[i], i + 1, 0) != 0;
        failed += db_.GetTaskInfo(ids[i], read) != 1 || read.task_name != task.task_name || read.error != i + 1;
      }
      std::list<TaskDB::TaskInfo> mine;
      failed += db_.ListTaskInfo(task.usb_id, mine) != 0 || mine.size() != 10;
      for (const TaskDB::TaskInfo& listed : mine) failed += listed.usb_id != task.usb_id;
      for (int i = 0; i < 9; ++i) {
        failed += db_.RemoveTaskInfo(ids[i]) != 0 || db_.GetTaskInfo(ids[i], read) != 0;
        failed += db_.GetUSBInfo(task.usb_id, device) != 1;
      }
      failed += (t % 2 ? db_.RemoveUSBInfo(task.usb_id) : db_.RemoveTaskInfo(ids[9])) != 0;
      failed += db_.GetUSBInfo(task.usb_id, device) != 0 || db_.GetTaskInfo(ids[9], read) != 0;
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures, std::vector<int>(8, 0));
  EXPECT_EQ(Raw(path_).Rows("SELECT (SELECT COUNT(*) FROM usb_info_table), COUNT(*) FROM task_info_table"), "0 0");
}

TEST_F(LogDBTest, SchemaOnDiskAndInitializingAgain) {
  unsigned long count = 0;
  EXPECT_TRUE(db_.GetRotationCount(count) == 0 && count == 100000u) << count;
  Add("x");
  CheckSchema("log-db",
              "add_log_info_rotate_trigger ON log_info_table\nconfig_table(key TEXT null pk, value TEXT)\n"
              "log_info_table(id INTEGER null pk, task_id INTEGER, log_type INTEGER, timestamp INTEGER, "
              "description_id INTEGER, description_param TEXT, error INTEGER)\n"
              "log_info_table_description_id_idx ON log_info_table(description_id)\n"
              "log_info_table_description_param_idx ON log_info_table(description_param)\n"
              "log_info_table_log_type_idx ON log_info_table(log_type)\n"
              "log_info_table_task_id_idx ON log_info_table(task_id)\n"
              "log_info_table_timestamp_idx ON log_info_table(timestamp)\nlog_rotate_trigger ON config_table\n"
              "sqlite_autoindex_config_table_1 ON config_table(key)",
              "log_info_table 1 seq\nlog_rotate_count 100000 text\nversion 1 text");
}

TEST_F(LogDBTest, RotationCountBoundsAndTrimming) {
  {
    LogCapture log;
    EXPECT_TRUE(db_.UpdateRotationCount(4) == -1 && db_.UpdateRotationCount(100001) == -1);
    EXPECT_TRUE(log.Contains("): Invalid rotation count '4'") && log.Contains("): Invalid rotation count '100001'"));
    EXPECT_TRUE(db_.UpdateRotationCount(5) == 0 && db_.UpdateRotationCount(100000) == 0 && !log.Contains("'5'"));
  }
  for (int i = 1; i <= 10; ++i) Add(std::to_string(i));
  ASSERT_EQ(db_.UpdateRotationCount(5), 0);
  EXPECT_EQ(List(All()), ",10,9,8,7,6");
  Add("11");
  EXPECT_EQ(List(All()), ",11,10,9,8,7");
  // Raising deletes nothing; the table then grows up to the new limit.
  ASSERT_EQ(db_.UpdateRotationCount(6), 0);
  Add("12");
  Add("13");
  EXPECT_EQ(List(All()), ",13,12,11,10,9,8");
  // A missing row deliberately reads as 0.
  ASSERT_EQ(Raw(path_).Run("DELETE FROM config_table WHERE key = 'log_rotate_count'"), SQLITE_OK);
  unsigned long count = 123;
  EXPECT_TRUE(db_.GetRotationCount(count) == 0 && count == 0) << count;
}

TEST(LogInfoFilterTest, QueryText) {
  LogDB::LogInfoFilter filter;
  EXPECT_EQ(filter.ToSQLQueryString(), " WHERE 1 AND 0  ORDER BY id DESC");
  filter.log_desc_id_list = kAllIds;
  filter.log_type = 6;  // not one type: all
  filter.offset = 20;
  EXPECT_EQ(filter.ToSQLQueryString(), " WHERE 1 ORDER BY id DESC LIMIT -1 OFFSET 20");
  filter.task_id = 9;
  filter.from_timestamp = 100;
  filter.to_timestamp = 200;
  filter.key_word = "50%_O'B";
  filter.log_type = 2;
  filter.log_desc_id_list = {1, 3, 5};
  filter.limit = 50;
  EXPECT_EQ(filter.ToSQLQueryString(),
            " WHERE 1 AND task_id = 9 AND timestamp >= 100 AND timestamp <= 200 AND description_param LIKE "
            "'%50\\%\\_O''B%' ESCAPE '\\'  AND log_type = 2 AND ( description_id = 1 OR description_id = 3 OR "
            "description_id = 5 ) ORDER BY id DESC LIMIT 50 OFFSET 20");
}

// What a key word finds in SQLite, newest first: a literal substring, ASCII
// letters in any case, and a trailing backslash escapes the closing '%'.
// A key word past SQLite's 50000 bytes of pattern fails the list at the
// step; the count deliberately does not fail and leaves the caller's count.
TEST_F(LogDBTest, KeyWordFindsRowsNewestFirst) {
  for (const char* param : {"100%", "1000 files", "a_b", "axb", "O'Brien's stick"}) Add(param);
  const std::pair<const char*, const char*> cases[] = {
      {"", ",O'Brien's stick,axb,a_b,1000 files,100%"}, {"0%", ",100%"}, {"a_b", ",a_b"},
      {"o'brien", ",O'Brien's stick"}, {"100\\", ",100%"},
  };
  for (const auto& [keyWord, found] : cases) {
    LogDB::LogInfoFilter filter = All();
    filter.key_word = keyWord;
    EXPECT_EQ(List(filter), found) << keyWord;
    unsigned long count = 999;
    EXPECT_EQ(db_.GetLogListCount(filter, count), 0);
    EXPECT_EQ(count, static_cast<unsigned long>(std::count(found, found + strlen(found), ','))) << keyWord;
  }
  LogDB::LogInfoFilter filter = All();
  filter.offset = 2;
  EXPECT_EQ(List(filter), ",a_b,1000 files,100%");
  filter.key_word = std::string(49999, 'k');
  std::list<LogDB::LogInfo> list;
  unsigned long count = 123;
  LogCapture log;
  EXPECT_EQ(db_.ListLogInfo(filter, list), -1);
  EXPECT_EQ(db_.GetLogListCount(filter, count), 0);
  EXPECT_TRUE(count == 123 && log.Contains("): sqlite3_step: [1] LIKE or GLOB pattern too complex")) << log.Dump();
}

// Root opens these files: a symbolic link in a database's place is refused,
// and nothing is created or changed where it points.
TEST_F(TaskDBTest, ASymbolicLinkIsNoDatabase) {
  WriteFile("/outside-empty", "");
  const std::string link = Path("/linked.sqlite");
  for (bool task : {false, true}) {
    for (const char* target : {"/outside-missing", "/outside-empty"}) {
      unlink(link.c_str());
      ASSERT_EQ(symlink(Path(target).c_str(), link.c_str()), 0);
      LogCapture log;
      EXPECT_EQ(task ? TaskDB().Initialize(link) : LogDB().Initialize(link), -1) << target;
      EXPECT_TRUE(log.Contains(" db at '" + link + "'. [")) << log.Dump();
    }
  }
  for (const char* made : {"/outside-missing", "/outside-missing-wal", "/outside-empty-wal", "/linked.sqlite-wal"}) {
    EXPECT_FALSE(Exists(made)) << made;
  }
  EXPECT_EQ(ReadFile("/outside-empty"), "");
}

// One byte at a time between two processes.
struct Pipe {
  Pipe() { EXPECT_EQ(pipe(fds), 0); }
  ~Pipe() { close(fds[0]), close(fds[1]); }
  bool Send(char c) const { return write(fds[1], &c, 1) == 1; }
  char Receive() const { char c = 0; return read(fds[0], &c, 1) == 1 ? c : 0; }
  int fds[2] = {-1, -1};
};

// A second process in the daemon's role, forked before this process opens
// any connection (SQLite's state must not cross a fork). It exits with the
// result of body or is killed after ten seconds; Finish gives its exit
// status, -1 when it was killed.
class TwoProcessTest : public plovo_test::SandboxTest {
 protected:
  void Start(const std::function<int()>& body) {
    if ((child_ = fork()) == 0) alarm(10), _exit(body());
  }
  int Finish() {
    int status = 0;
    return waitpid(child_, &status, 0) == child_ && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  pid_t child_ = -1;
};

// The other process appends rows one by one while this one lists and
// counts. Every call succeeds, the count never goes back, some round sees
// the writer half way, and each row read is whole: its parameter text
// matches its task id.
TEST_F(TwoProcessTest, ReadsWhileAnotherProcessWrites) {
  constexpr unsigned long kRows = 1500;
  auto paramOf = [](unsigned long n) { return std::to_string(n) + std::string(n % 200, 'x'); };
  const std::string path = Path("/log-db.sqlite");
  Pipe go;
  Start([&] {
    LogDB writer;
    LogDB::LogInfo info;
    if (go.Receive() != 'g' || writer.Initialize(path) != 0) return 1;
    for (info.task_id = 1; info.task_id <= kRows; ++info.task_id) {
      info.description_param = paramOf(info.task_id);
      if (writer.AddLogInfo(info) != 0) return 2;
    }
    return 0;
  });
  LogDB reader;
  ASSERT_EQ(reader.Initialize(path), 0);
  ASSERT_TRUE(go.Send('g'));
  LogDB::LogInfoFilter page = All();
  page.limit = 50;
  unsigned long last = 0;
  int failures = 0, torn = 0, halfWay = 0;
  // A deadline that fails the test, not a time asserted.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while (last < kRows && std::chrono::steady_clock::now() < deadline) {
    std::list<LogDB::LogInfo> list;
    unsigned long count = 0;
    failures += reader.ListLogInfo(page, list) != 0 || reader.GetLogListCount(All(), count) != 0 || count < last;
    for (const LogDB::LogInfo& info : list) torn += info.description_param != paramOf(info.task_id);
    halfWay += count > 0 && count < kRows;
    last = count;
  }
  EXPECT_EQ(Finish(), 0);
  EXPECT_EQ(last, kRows);
  EXPECT_EQ(failures + torn, 0) << failures << " failed, " << torn << " torn";
  EXPECT_GT(halfWay, 0) << "the reads did not overlap the writes";
}

// The other process holds the write lock of a file for about a second, then
// commits: each call that needs the lock waits for it and succeeds instead
// of failing busy at once.
TEST_F(TwoProcessTest, CallsWaitForAnotherProcessesWriteLock) {
  const std::string logPath = Path("/log-db.sqlite"), taskPath = Path("/task-db.sqlite");
  Pipe go, back;
  Start([&] {
    // The daemon's files, made as it makes them.
    if (LogDB().Initialize(logPath) != 0 || TaskDB().Initialize(taskPath) != 0) return 3;
    const Raw log(logPath), task(taskPath);
    for (char file; (file = go.Receive()) == 'l' || file == 't';) {
      const Raw& db = file == 'l' ? log : task;
      if (db.Run("BEGIN IMMEDIATE") != SQLITE_OK || !back.Send('h')) return 1;
      usleep(1000000);
      if (db.Run("COMMIT") != SQLITE_OK) return 2;
    }
    return 0;
  });
  LogDB log;
  TaskDB task;
  unsigned long id = 0;
  LogCapture capture;
  auto held = [&](char file) { return go.Send(file) && back.Receive() == 'h'; };
  EXPECT_TRUE(held('l') && log.Initialize(logPath) == 0) << capture.Dump();
  EXPECT_TRUE(held('l') && log.AddLogInfo(LogDB::LogInfo()) == 0) << capture.Dump();
  EXPECT_TRUE(held('t') && task.Initialize(taskPath) == 0) << capture.Dump();
  EXPECT_TRUE(held('t') && task.AddUSBInfo(TaskDB::USBInfo(), id) == 0) << capture.Dump();
  ASSERT_TRUE(go.Send('q'));
  EXPECT_EQ(Finish(), 0);
}

}  // namespace
