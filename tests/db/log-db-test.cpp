// The log database: schema, rotation, what the filter finds, refusing a
// symbolic link, and sharing the files with another process.
#include "db/log-db.h"

#include <signal.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <functional>
#include <tuple>

#include "db/task-db.h"
#include "log-capture.h"
#include "raw-sqlite.h"
#include "sandbox.h"

namespace {

using plovo_test::LogCapture;
using plovo_test::RawSqlite;

const std::vector<unsigned int> kAllIds{1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12};

class LogDBTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/db");
    path_ = Path("/db/log-db.sqlite");
    ASSERT_EQ(db_.Initialize(path_), 0);
  }
  void TearDown() override {
    db_.Destroy();
    SandboxTest::TearDown();
  }
  void Add(const std::string& param, int type = 1, unsigned int descId = 1, unsigned long taskId = 1) {
    LogDB::LogInfo info;
    info.task_id = taskId;
    info.log_type = type;
    info.description_id = descId;
    info.description_param = param;
    ASSERT_EQ(db_.AddLogInfo(info), 0) << param;
  }
  // The description_param of each listed row, joined by ','; and the count.
  std::string List(const LogDB::LogInfoFilter& filter) {
    std::list<LogDB::LogInfo> list;
    EXPECT_EQ(db_.ListLogInfo(filter, list), 0);
    std::string params;
    for (const LogDB::LogInfo& info : list) params += (params.empty() ? "" : ",") + info.description_param;
    return params;
  }
  unsigned long Count(const LogDB::LogInfoFilter& filter) {
    unsigned long count = 999;
    EXPECT_EQ(db_.GetLogListCount(filter, count), 0);
    return count;
  }
  LogDB::LogInfoFilter All() {
    LogDB::LogInfoFilter filter;
    filter.log_desc_id_list = kAllIds;
    return filter;
  }

  std::string path_;
  LogDB db_;
};

TEST_F(LogDBTest, SchemaOnDiskAndInitializingAgain) {
  RawSqlite raw(path_);
  EXPECT_EQ(raw.Rows("PRAGMA journal_mode"), "wal");
  EXPECT_EQ(raw.Columns("log_info_table"),
            "id INTEGER 0 NULL 1,task_id INTEGER 1 NULL 0,log_type INTEGER 1 NULL 0,timestamp INTEGER 1 NULL 0,"
            "description_id INTEGER 1 NULL 0,description_param TEXT 1 NULL 0,error INTEGER 1 NULL 0");
  EXPECT_EQ(raw.Columns("config_table"), "key TEXT 0 NULL 1,value TEXT 1 NULL 0");
  EXPECT_EQ(raw.Rows("SELECT name FROM sqlite_master WHERE sql LIKE '%id INTEGER PRIMARY KEY AUTOINCREMENT%'"),
            "log_info_table");
  EXPECT_EQ(raw.Rows("SELECT m.type, m.name, m.tbl_name, i.name FROM sqlite_master m LEFT JOIN "
                     "pragma_index_info(m.name) i WHERE m.type IN ('index', 'trigger') ORDER BY m.name"),
            "trigger add_log_info_rotate_trigger log_info_table NULL,"
            "index log_info_table_description_id_idx log_info_table description_id,"
            "index log_info_table_description_param_idx log_info_table description_param,"
            "index log_info_table_log_type_idx log_info_table log_type,"
            "index log_info_table_task_id_idx log_info_table task_id,"
            "index log_info_table_timestamp_idx log_info_table timestamp,"
            "trigger log_rotate_trigger config_table NULL,"
            "index sqlite_autoindex_config_table_1 config_table key");
  EXPECT_EQ(raw.Rows("SELECT key, value, typeof(value) FROM config_table ORDER BY key"),
            "log_rotate_count 100000 text,version 1 text");
  unsigned long count = 0;
  EXPECT_EQ(db_.GetRotationCount(count), 0);
  EXPECT_EQ(count, 100000u);

  ASSERT_EQ(db_.UpdateRotationCount(50), 0);
  Add("kept");
  const std::string schema = raw.Rows("SELECT * FROM sqlite_master");
  LogCapture log;
  EXPECT_EQ(db_.Initialize(Path("/elsewhere.sqlite")), 0);
  EXPECT_TRUE(log.Contains(LOG_INFO, "[INFO] log-db(") && log.Contains("): Task DB has been inited")) << log.Dump();
  db_.Destroy();
  ASSERT_EQ(db_.Initialize(path_), 0);
  EXPECT_EQ(raw.Rows("SELECT * FROM sqlite_master"), schema);
  EXPECT_EQ(raw.Rows("SELECT value FROM config_table WHERE key = 'log_rotate_count'"), "50");
  EXPECT_EQ(raw.Rows("SELECT COUNT(*) FROM log_info_table"), "1");
}

TEST_F(LogDBTest, RotationCountBoundsAndTrimming) {
  for (const auto& [count, result] : {std::pair<unsigned long, int>{4, -1}, {100001, -1}, {5, 0}, {100000, 0}}) {
    LogCapture log;
    EXPECT_EQ(db_.UpdateRotationCount(count), result) << count;
    EXPECT_EQ(log.Contains("): Invalid rotation count '" + std::to_string(count) + "'"), result != 0) << count;
  }
  for (int i = 1; i <= 10; ++i) Add(std::to_string(i));
  ASSERT_EQ(db_.UpdateRotationCount(5), 0);
  EXPECT_EQ(List(All()), "10,9,8,7,6");
  Add("11");
  EXPECT_EQ(List(All()), "11,10,9,8,7");
  // Raising deletes nothing; the table then grows up to the new limit.
  ASSERT_EQ(db_.UpdateRotationCount(6), 0);
  Add("12");
  Add("13");
  EXPECT_EQ(List(All()), "13,12,11,10,9,8");
}

TEST(LogInfoFilterTest, QueryText) {
  LogDB::LogInfoFilter filter;
  EXPECT_EQ(filter.ToSQLQueryString(), " WHERE 1 AND 0  ORDER BY id DESC");
  filter.log_desc_id_list = kAllIds;
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

TEST_F(LogDBTest, FilterSelectsRowsNewestFirst) {
  Add("100% done", 1, 1, 1);
  Add("1000 files", 2, 2, 1);
  Add("a_b", 4, 3, 2);
  Add("axb", 1, 4, 2);
  Add("O'Brien's stick", 2, 5, 3);
  Add("\xC3\x89T\xC3\x89 100%", 4, 6, 3);  // "ÉTÉ 100%"
  const struct {
    const char* keyWord;
    unsigned int type;
    std::vector<unsigned int> ids;
    unsigned long taskId;
    const char* found;
  } cases[] = {
      {"", 7, {}, 0, ""},  // no description id, no row
      {"", 7, kAllIds, 0, "\xC3\x89T\xC3\x89 100%,O'Brien's stick,axb,a_b,1000 files,100% done"},
      {"", 6, kAllIds, 0, "\xC3\x89T\xC3\x89 100%,O'Brien's stick,axb,a_b,1000 files,100% done"},  // not one type: all
      {"", 2, kAllIds, 0, "O'Brien's stick,1000 files"},
      {"", 7, {1, 3}, 0, "a_b,100% done"},
      {"", 7, kAllIds, 2, "axb,a_b"},
      {"100%", 7, kAllIds, 0, "\xC3\x89T\xC3\x89 100%,100% done"},
      {"0% d", 7, kAllIds, 0, "100% done"},
      {"a_b", 7, kAllIds, 0, "a_b"},
      {"o'brien", 7, kAllIds, 0, "O'Brien's stick"},
      {"' OR 1=1 --", 7, kAllIds, 0, ""},
      // Case is ignored for ASCII letters only: "été" does not find "ÉTÉ".
      {"\xC3\xA9t\xC3\xA9", 7, kAllIds, 0, ""},
      {"\xC3\x89t\xC3\x89", 7, kAllIds, 0, "\xC3\x89T\xC3\x89 100%"},
      // A trailing backslash escapes the closing '%': the text must end
      // with what precedes it and a '%'.
      {"100\\", 7, kAllIds, 0, "\xC3\x89T\xC3\x89 100%"},
  };
  for (const auto& c : cases) {
    LogDB::LogInfoFilter filter;
    filter.key_word = c.keyWord;
    filter.log_type = c.type;
    filter.log_desc_id_list = c.ids;
    filter.task_id = c.taskId;
    const std::string found = c.found;
    EXPECT_EQ(List(filter), found) << filter.ToSQLQueryString();
    EXPECT_EQ(Count(filter), found.empty() ? 0 : std::count(found.begin(), found.end(), ',') + 1u) << found;
  }
  // The list is appended to; an offset alone skips rows.
  LogDB::LogInfoFilter page = All();
  page.offset = 3;
  std::list<LogDB::LogInfo> list(1);
  ASSERT_EQ(db_.ListLogInfo(page, list), 0);
  ASSERT_EQ(list.size(), 4u);
  EXPECT_TRUE(list.back().description_param == "100% done" && list.back().log_type == 1);
}

// Root opens these files: a symbolic link in a database's place is refused,
// and nothing is created or changed where it points.
TEST_F(LogDBTest, ASymbolicLinkIsNoDatabase) {
  WriteFile("/outside-empty", "");
  const std::function<int(const std::string&)> opens[] = {
      [](const std::string& path) { return LogDB().Initialize(path); },
      [](const std::string& path) { return TaskDB().Initialize(path); },
  };
  const std::string link = Path("/db/linked.sqlite");
  for (const auto& open : opens) {
    for (const char* target : {"/outside-missing", "/outside-empty"}) {
      unlink(link.c_str());
      ASSERT_EQ(symlink(Path(target).c_str(), link.c_str()), 0);
      LogCapture log;
      EXPECT_EQ(open(link), -1) << target;
      EXPECT_TRUE(log.Contains(" db at '" + link + "'. [")) << log.Dump();
    }
  }
  for (const char* made : {"/outside-missing", "/outside-missing-wal", "/outside-empty-wal", "/db/linked.sqlite-wal"}) {
    EXPECT_FALSE(Exists(made)) << made;
  }
  EXPECT_EQ(ReadFile("/outside-empty"), "");
}

// Two reads deliberately do not fail: a count whose step fails leaves the
// caller's count as it was, and a missing rotation row reads as 0. A key
// word whose pattern passes SQLite's 50000 bytes fails at the step.
TEST_F(LogDBTest, CountsThatDoNotFail) {
  Add("x");
  for (const auto& [length, listed, count] : {std::tuple<size_t, int, unsigned long>{49998, 0, 0}, {49999, -1, 123}}) {
    LogDB::LogInfoFilter filter = All();
    filter.key_word = std::string(length, 'k');
    std::list<LogDB::LogInfo> list;
    unsigned long got = 123;
    LogCapture log;
    EXPECT_EQ(db_.ListLogInfo(filter, list), listed) << length;
    EXPECT_EQ(db_.GetLogListCount(filter, got), 0) << length;
    EXPECT_EQ(got, count) << length;
    EXPECT_EQ(log.Contains("): sqlite3_step: [1] LIKE or GLOB pattern too complex"), listed != 0) << log.Dump();
  }
  RawSqlite(path_).Exec("DELETE FROM config_table WHERE key = 'log_rotate_count'");
  unsigned long rotation = 123;
  EXPECT_EQ(db_.GetRotationCount(rotation), 0);
  EXPECT_EQ(rotation, 0u);
}

// Tests with a second process. It is forked before this process opens any
// connection: SQLite's state must not cross a fork.
class LogDBProcessTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/db");
  }
  // Forks a child that runs body and exits with its result.
  void Start(const std::function<int()>& body) {
    child_ = fork();
    ASSERT_NE(child_, -1);
    if (child_ == 0) _exit(body());
  }
  // The child's exit status, or -1 when it has not exited within a few
  // seconds (it is then killed).
  int Finish() {
    int status = 0;
    for (int i = 0; i < 500 && waitpid(child_, &status, WNOHANG) == 0; ++i) usleep(10000);
    if (waitpid(child_, &status, WNOHANG) == 0) kill(child_, SIGKILL), waitpid(child_, &status, 0);
    child_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  void TearDown() override {
    if (child_ > 0) kill(child_, SIGKILL), waitpid(child_, nullptr, 0);
    SandboxTest::TearDown();
  }

  pid_t child_ = -1;
};

// One byte at a time from one process to the other.
struct Pipe {
  Pipe() { EXPECT_EQ(pipe(fds), 0); }
  ~Pipe() { close(fds[0]), close(fds[1]); }
  bool Send(char c) const { return write(fds[1], &c, 1) == 1; }
  bool Receive(char& c) const { return read(fds[0], &c, 1) == 1; }
  int fds[2];
};

// The daemon's role: another process appends rows one by one while this
// one lists and counts. Every call succeeds, the count never goes back,
// some round sees the writer half way, and each row read is whole: its
// parameter text matches its task id.
TEST_F(LogDBProcessTest, ReadsWhileAnotherProcessWrites) {
  constexpr unsigned long kRows = 1500;
  auto paramOf = [](unsigned long n) { return std::to_string(n) + std::string(n % 200, 'x'); };
  const std::string path = Path("/db/log-db.sqlite");
  Pipe go;
  Start([&] {
    char c = 0;
    LogDB writer;
    if (!go.Receive(c) || writer.Initialize(path) != 0) return 1;
    for (unsigned long n = 1; n <= kRows; ++n) {
      LogDB::LogInfo info;
      info.task_id = n;
      info.description_id = 1 + n % 12;
      info.description_param = paramOf(n);
      if (writer.AddLogInfo(info) != 0) return 2;
    }
    return 0;
  });
  LogDB reader;
  ASSERT_EQ(reader.Initialize(path), 0);
  ASSERT_TRUE(go.Send('g'));
  LogDB::LogInfoFilter filter;
  filter.log_desc_id_list = kAllIds;
  filter.limit = 50;
  LogDB::LogInfoFilter all;
  all.log_desc_id_list = kAllIds;
  unsigned long last = 0;
  int failures = 0, torn = 0, halfWay = 0;
  // A deadline that fails the test, not a time asserted.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while (last < kRows && std::chrono::steady_clock::now() < deadline) {
    std::list<LogDB::LogInfo> list;
    unsigned long count = 0;
    failures += reader.ListLogInfo(filter, list) != 0 || reader.GetLogListCount(all, count) != 0 || count < last;
    for (const LogDB::LogInfo& info : list) torn += info.description_param != paramOf(info.task_id);
    halfWay += count > 0 && count < kRows;
    last = count;
  }
  EXPECT_EQ(Finish(), 0);
  EXPECT_EQ(last, kRows);
  EXPECT_EQ(failures, 0);
  EXPECT_EQ(torn, 0);
  EXPECT_GT(halfWay, 0) << "the reads did not overlap the writes";
}

// Another process, the daemon, holds the write lock of its files for about
// a second, then commits: each call that needs the lock waits for it and
// succeeds instead of failing busy at once.
TEST_F(LogDBProcessTest, CallsWaitForAnotherProcessesWriteLock) {
  const std::string logPath = Path("/db/log-db.sqlite"), taskPath = Path("/db/task-db.sqlite");
  Pipe go, held;
  Start([&] {
    // The daemon's files, made as it makes them.
    if (LogDB().Initialize(logPath) != 0 || TaskDB().Initialize(taskPath) != 0) return 3;
    RawSqlite log(logPath), task(taskPath);
    for (char file = 0; go.Receive(file) && file != 'q';) {
      const RawSqlite& db = file == 'l' ? log : task;
      if (db.Run("BEGIN IMMEDIATE") != SQLITE_OK || !held.Send('h')) return 1;
      usleep(1000000);
      if (db.Run("COMMIT") != SQLITE_OK) return 2;
    }
    return 0;
  });
  LogDB log;
  TaskDB task;
  const struct {
    char file;
    std::function<int()> call;
    const char* what;
  } steps[] = {
      {'l', [&] { return log.Initialize(logPath); }, "LogDB::Initialize"},
      {'l', [&] { return log.AddLogInfo(LogDB::LogInfo()); }, "AddLogInfo"},
      {'t', [&] { return task.Initialize(taskPath); }, "TaskDB::Initialize"},
      {'t', [&] { unsigned long id = 0; return task.AddUSBInfo(TaskDB::USBInfo(), id); }, "AddUSBInfo"},
  };
  for (const auto& step : steps) {
    char c = 0;
    ASSERT_TRUE(go.Send(step.file) && held.Receive(c));
    LogCapture capture;
    EXPECT_EQ(step.call(), 0) << step.what << capture.Dump();
  }
  ASSERT_TRUE(go.Send('q'));
  EXPECT_EQ(Finish(), 0);
}

}  // namespace
