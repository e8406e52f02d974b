// "get_log_list" through Process on a full log of 100000 rows, against the
// same two statements (the page and the count) prepared and stepped
// directly on the same file; and the insert rate at the rotation limit,
// where every insert trims the oldest row, against inserts into the same
// table without the rotation trigger.
//
// The log is made once per run under the sandbox root: 100000 rows of
// twelve message numbers, three types and parameters as the daemon writes
// them (task name, file path, size). The page asked for is 50 records at
// offset 1000 of one type and five message numbers, with and without a key
// word. Every answer is checked to hold the full page.
#include <fcntl.h>
#include <sqlite3.h>
#include <unistd.h>

#include <cstdio>
#include <string>

#include <velt/webapi.h>

#include "bench-support.h"
#include "common/paths.h"
#include "db/log-db.h"
#include "webapi/plovo.h"

namespace {

constexpr int kRows = 100000;
constexpr unsigned kPage = 50;
constexpr unsigned kOffset = 1000;
constexpr const char* kKeyWord = "card 3";

std::string gListDb;      // the log Process reads
std::string gTrimDb;      // a copy at the limit, for the inserts
std::string gNoTriggerDb;  // the same copy without the insert trigger

void WriteText(const std::string& file, const std::string& content) {
  plovo_bench::MakeDirs(file.substr(0, file.rfind('/')));
  int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0 || !plovo_bench::WriteAll(fd, content.data(), content.size()) || close(fd) != 0) {
    plovo_bench::Die("write " + file);
  }
}

std::string Param(int n) {
  return "{\"task_name\":\"Camera card " + std::to_string(n % 10) + "\",\"file\":\"/DCIM/" +
         std::to_string(100 + n % 7) + "MEDIA/IMG_" + std::to_string(n % 10000) + ".JPG\",\"size\":\"" +
         std::to_string(1 + n % 9) + "." + std::to_string(n % 10) + " MB\"}";
}

void Exec(sqlite3* db, const std::string& sql) {
  char* error = nullptr;
  if (sqlite3_exec(db, sql.c_str(), nullptr, nullptr, &error) != SQLITE_OK) {
    std::fprintf(stderr, "log-list-bench: %s: %s\n", sql.c_str(), error ? error : "");
    std::exit(2);
  }
}

// The log made with the module's own schema, then filled in one
// transaction through the real table and its triggers.
void MakeLog() {
  {
    LogDB db;
    if (db.Initialize(gListDb) != 0) plovo_bench::Die("create " + gListDb);
  }
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(gListDb.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
    plovo_bench::Die("open " + gListDb);
  }
  Exec(db, "BEGIN");
  sqlite3_stmt* insert = nullptr;
  sqlite3_prepare_v2(db,
                     "INSERT INTO log_info_table (task_id, log_type, timestamp, description_id, "
                     "description_param, error) VALUES (?, ?, ?, ?, ?, ?)",
                     -1, &insert, nullptr);
  for (int n = 0; n < kRows; ++n) {
    const std::string param = Param(n);
    sqlite3_bind_int(insert, 1, 1 + n % 10);
    sqlite3_bind_int(insert, 2, 1 << (n % 3));
    sqlite3_bind_int64(insert, 3, 1790000000 + n * 30);
    sqlite3_bind_int(insert, 4, 1 + (n / 3) % 12);
    sqlite3_bind_text(insert, 5, param.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_bind_int(insert, 6, n % 50 == 0 ? -3 : 0);
    if (sqlite3_step(insert) != SQLITE_DONE) plovo_bench::Die("fill the log");
    sqlite3_reset(insert);
  }
  sqlite3_finalize(insert);
  Exec(db, "COMMIT");
  Exec(db, "VACUUM INTO '" + gTrimDb + "'");
  Exec(db, "VACUUM INTO '" + gNoTriggerDb + "'");
  sqlite3_close_v2(db);
  if (sqlite3_open_v2(gNoTriggerDb.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
    plovo_bench::Die("open " + gNoTriggerDb);
  }
  Exec(db, "PRAGMA journal_mode = WAL; DROP TRIGGER add_log_info_rotate_trigger");
  sqlite3_close_v2(db);
}

LogDB::LogInfoFilter Filter(bool keyWord) {
  LogDB::LogInfoFilter filter;
  filter.limit = kPage;
  filter.offset = kOffset;
  filter.log_type = 1;
  filter.log_desc_id_list = {1, 2, 3, 4, 5};
  if (keyWord) filter.key_word = kKeyWord;
  return filter;
}

VELT::APIRequest Request(bool keyWord) {
  Json::Value params(Json::objectValue);
  params["limit"] = kPage;
  params["offset"] = kOffset;
  Json::Value& filter = params["log_filter"];
  filter["log_type"] = 1;
  for (unsigned id = 1; id <= 5; ++id) filter["log_desc_id_list"].append(id);
  if (keyWord) filter["key_word"] = kKeyWord;
  return VELT::APIRequest("VELT.Plovo", 1, "get_log_list", params);
}

template <bool kKeyWordOn>
void BM_Process(benchmark::State& state) {
  VELT::APIRequest request = Request(kKeyWordOn);
  for (auto _ : state) {
    VELT::APIResponse response;
    ::Process(&request, &response);
    if (!response.IsSuccess() || response.GetData()["log_list"].size() != kPage) {
      state.SkipWithError("get_log_list did not answer a full page");
      break;
    }
  }
}

// The page and the count as LogDB builds them, prepared, stepped and
// finalised on one open connection, each column read once.
template <bool kKeyWordOn>
void BM_Raw(benchmark::State& state) {
  LogDB::LogInfoFilter filter = Filter(kKeyWordOn);
  const std::string list =
      "SELECT task_id, log_type, timestamp, description_id, description_param, error FROM log_info_table " +
      filter.ToSQLQueryString() + " ;";
  filter.limit = filter.offset = 0;
  const std::string count = "SELECT COUNT(*) FROM log_info_table" + filter.ToSQLQueryString() + " ;";
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(gListDb.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
    state.SkipWithError("cannot open the log");
    return;
  }
  for (auto _ : state) {
    sqlite3_stmt* statement = nullptr;
    sqlite3_prepare_v2(db, list.c_str(), -1, &statement, nullptr);
    unsigned rows = 0;
    uint64_t sum = 0;
    while (sqlite3_step(statement) == SQLITE_ROW) {
      sum += static_cast<uint64_t>(sqlite3_column_int64(statement, 0)) + sqlite3_column_int(statement, 1) +
             static_cast<uint64_t>(sqlite3_column_int64(statement, 2)) + sqlite3_column_int64(statement, 3) +
             static_cast<uint64_t>(sqlite3_column_bytes(statement, 4)) + sqlite3_column_int(statement, 5);
      ++rows;
    }
    sqlite3_finalize(statement);
    sqlite3_prepare_v2(db, count.c_str(), -1, &statement, nullptr);
    const bool counted = sqlite3_step(statement) == SQLITE_ROW && sqlite3_column_int64(statement, 0) > kOffset;
    sqlite3_finalize(statement);
    benchmark::DoNotOptimize(sum);
    if (rows != kPage || !counted) {
      state.SkipWithError("the raw statements did not give a full page");
      break;
    }
  }
  sqlite3_close_v2(db);
}

// One INSERT statement per event, as the daemon writes, through exec, each
// its own transaction.
void InsertLoop(benchmark::State& state, const std::string& file) {
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(file.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
    state.SkipWithError("cannot open the log copy");
    return;
  }
  // The daemon's connection settings (docs/database.md).
  sqlite3_busy_timeout(db, 300000);
  Exec(db, "PRAGMA synchronous = NORMAL; PRAGMA recursive_triggers = true;");
  int n = 0;
  for (auto _ : state) {
    ++n;
    char* sql = sqlite3_mprintf(
        " INSERT INTO log_info_table ( task_id, log_type, timestamp, description_id, description_param, "
        "error ) VALUES  ( %lu, %d, %u, %u, %Q,  %d  );",
        static_cast<unsigned long>(1 + n % 10), 1 << (n % 3), 1800000000u + n, 1u + n % 12,
        Param(n).c_str(), 0);
    const int rc = sqlite3_exec(db, sql, nullptr, nullptr, nullptr);
    sqlite3_free(sql);
    if (rc != SQLITE_OK) {
      state.SkipWithError("insert failed");
      break;
    }
  }
  state.SetItemsProcessed(state.iterations());
  sqlite3_close_v2(db);
}

void BM_InsertAtLimit(benchmark::State& state) { InsertLoop(state, gTrimDb); }
void BM_InsertNoTrigger(benchmark::State& state) { InsertLoop(state, gNoTriggerDb); }

void PrintPlan(const std::string& what, const std::string& sql) {
  sqlite3* db = nullptr;
  sqlite3_open_v2(gListDb.c_str(), &db, SQLITE_OPEN_READONLY, nullptr);
  sqlite3_stmt* statement = nullptr;
  sqlite3_prepare_v2(db, ("EXPLAIN QUERY PLAN " + sql).c_str(), -1, &statement, nullptr);
  std::printf("plan %s:", what.c_str());
  while (sqlite3_step(statement) == SQLITE_ROW) {
    std::printf(" [%s]", reinterpret_cast<const char*>(sqlite3_column_text(statement, 3)));
  }
  std::printf("\n");
  sqlite3_finalize(statement);
  sqlite3_close_v2(db);
}

long Rows(const std::string& file) {
  sqlite3* db = nullptr;
  sqlite3_open_v2(file.c_str(), &db, SQLITE_OPEN_READONLY, nullptr);
  sqlite3_stmt* statement = nullptr;
  sqlite3_prepare_v2(db, "SELECT COUNT(*) FROM log_info_table", -1, &statement, nullptr);
  const long rows = sqlite3_step(statement) == SQLITE_ROW ? sqlite3_column_int64(statement, 0) : -1;
  sqlite3_finalize(statement);
  sqlite3_close_v2(db);
  return rows;
}

void Summary(plovo_bench::SummaryReporter& reporter, const char* what, const char* process, const char* raw,
             bool target, int& status) {
  auto p = reporter.MedianSeconds(process);
  auto r = reporter.MedianSeconds(raw);
  if (!p || !r) {
    std::printf("summary log-list %s: incomplete, no ratio\n", what);
    status = 1;
    return;
  }
  const double ratio = *p / *r;
  std::printf("summary log-list %s: Process median %.3f ms, raw statements median %.3f ms, ratio %.2f", what,
              *p * 1e3, *r * 1e3, ratio);
  if (target) std::printf(" (target <= 1.3: %s)", plovo_bench::Verdict(ratio <= 1.3));
  std::printf("\n");
}

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  const std::string volume = sandbox.Root() + "/volume1";
  WriteText(Plovo::Path::StatusFile(), "state=\"4\"\nerror=\"\"\n");
  WriteText(Plovo::Path::SettingFile(), "repo_vol_path=\"" + volume + "\"\nbeep=\"yes\"\n");
  plovo_bench::MakeDirs(volume + "/@Plovo/db");
  gListDb = volume + "/@Plovo/db/log-db.sqlite";
  gTrimDb = sandbox.Root() + "/trim.sqlite";
  gNoTriggerDb = sandbox.Root() + "/no-trigger.sqlite";
  MakeLog();
  if (Rows(gListDb) != kRows || Rows(gTrimDb) != kRows) {
    std::fprintf(stderr, "log-list-bench: the log does not hold %d rows\n", kRows);
    return 2;
  }
  {
    VELT::APIRequest request = Request(true);
    VELT::APIResponse response;
    ::Process(&request, &response);
    if (!response.IsSuccess()) {
      std::fprintf(stderr, "log-list-bench: get_log_list fails (the gate and the database open raise to root, so "
                           "run the program as root)\n");
      return 2;
    }
    std::printf("key word page: %u records of %llu matching\n", response.GetData()["log_list"].size(),
                static_cast<unsigned long long>(response.GetData()["count"].asUInt64()));
  }
  for (bool keyWord : {true, false}) {
    LogDB::LogInfoFilter filter = Filter(keyWord);
    const char* what = keyWord ? "key word" : "no key word";
    PrintPlan(std::string(what) + " list", "SELECT task_id FROM log_info_table " + filter.ToSQLQueryString());
    filter.limit = filter.offset = 0;
    PrintPlan(std::string(what) + " count", "SELECT COUNT(*) FROM log_info_table" + filter.ToSQLQueryString());
  }

  plovo_bench::RegisterRepeated("process_keyword", BM_Process<true>, 9, benchmark::kMillisecond);
  plovo_bench::RegisterRepeated("raw_keyword", BM_Raw<true>, 9, benchmark::kMillisecond);
  plovo_bench::RegisterRepeated("process_no_keyword", BM_Process<false>, 9, benchmark::kMillisecond);
  plovo_bench::RegisterRepeated("raw_no_keyword", BM_Raw<false>, 9, benchmark::kMillisecond);
  plovo_bench::RegisterRepeated("insert_at_limit", BM_InsertAtLimit, 5, benchmark::kMicrosecond);
  plovo_bench::RegisterRepeated("insert_no_trigger", BM_InsertNoTrigger, 5, benchmark::kMicrosecond);
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);

  int status = 0;
  Summary(reporter, "key word", "process_keyword", "raw_keyword", true, status);
  Summary(reporter, "no key word", "process_no_keyword", "raw_no_keyword", false, status);
  auto trim = reporter.MedianSeconds("insert_at_limit");
  auto plain = reporter.MedianSeconds("insert_no_trigger");
  if (trim && plain) {
    std::printf("summary log-list insert: %.0f inserts/s at the 100000-row limit (each trims one row), %.0f "
                "inserts/s without the trigger, %.1f times the time\n",
                1.0 / *trim, 1.0 / *plain, *trim / *plain);
  } else {
    std::printf("summary log-list insert: incomplete\n");
    status = 1;
  }
  std::printf("rows after the inserts: %ld at the limit, %ld without the trigger\n", Rows(gTrimDb),
              Rows(gNoTriggerDb));
  return status;
}
