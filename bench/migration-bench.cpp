// UpdaterCore::Update on a version 1 repository of 1000 tasks, 100 of them
// incremental with a file database of 100000 rows each, against cp of the
// same files into an empty folder, and cp then sync (the migration syncs).
//
// The repository is made once under the sandbox root ("template"); its file
// databases are copies of one (filling all 100 takes 45 s, and the work of
// the migration does not depend on the paths differing). Each migration
// gets a fresh repository: a copy of the task database and hard links to
// the file databases, which the migration replaces by rename and never
// writes in place (checked at the end). Dirty pages are written out before
// every timed run. Last, one more repository is migrated step by step
// through the public helpers, to show where the time goes.
#include <sqlite3.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "bench-support.h"
#include "updater/updater-core.h"
#include "updater/updater-utils.h"
#include "updater/updater-v1.h"

namespace {

constexpr int kTasks = 1000;
constexpr int kEvery = 10;  // tasks 10, 20, ... 1000 are incremental
constexpr int kRows = 100000;
constexpr const char* kIndexScript =
    "DROP INDEX IF EXISTS file_info_table_src_path_idx; DROP INDEX IF EXISTS file_info_table_dst_path_idx; "
    "CREATE INDEX IF NOT EXISTS file_info_src_path_idx on file_info_table(source_path); "
    "CREATE INDEX IF NOT EXISTS file_info_dst_path_idx on file_info_table(destination_path); ";

std::string gTemplate, gRepo, gCopyDest, gSchedDir;

// Runs sql on the database at path, made when missing.
void Exec(const std::string& path, const std::string& sql) {
  sqlite3* db = nullptr;
  if (sqlite3_open(path.c_str(), &db) != SQLITE_OK || sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr)) {
    plovo_bench::Die(path + ": " + sqlite3_errmsg(db));
  }
  sqlite3_close_v2(db);
}

double Now() { return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count(); }

std::vector<int> Incremental() {
  std::vector<int> ids;
  for (int id = kEvery; id <= kTasks; id += kEvery) ids.push_back(id);
  return ids;
}

std::string TaskDb(const std::string& repo) { return repo + "/db/task-db.sqlite"; }
std::string FileDb(const std::string& repo, int id) { return repo + "/task/" + std::to_string(id) + "/file-db.sqlite"; }

// A shell command line, as a script would run cp; false unless it exits 0.
bool Run(const std::string& command) { return std::system(command.c_str()) == 0; }

// The version 1 task database: two default devices with a task each, 48
// other devices sharing the other 998 tasks, every tenth one incremental.
// Then one file database filled in the order a walk of the device copies
// (rows of one album and folder together), both indexes kept up as rows
// come in, and 99 copies of it.
void MakeTemplate() {
  for (int id : Incremental()) plovo_bench::MakeDirs(gTemplate + "/task/" + std::to_string(id));
  plovo_bench::MakeDirs(gTemplate + "/db");
  Exec(TaskDb(gTemplate),
       "PRAGMA journal_mode = WAL; BEGIN;"
       "CREATE TABLE config_table (key TEXT PRIMARY KEY, value TEXT NOT NULL);"
       "INSERT INTO config_table VALUES ('version', '1');"
       "CREATE TABLE usb_info_table (id INTEGER PRIMARY KEY AUTOINCREMENT, uuid TEXT UNIQUE NOT NULL,"
       " run_when_plug_in INTEGER NOT NULL, eject_when_task_done INTEGER NOT NULL, producer TEXT NOT NULL,"
       " product TEXT NOT NULL);"
       "CREATE TABLE task_info_table (id INTEGER PRIMARY KEY AUTOINCREMENT, usb_id INTEGER NOT NULL,"
       " is_enable INTEGER NOT NULL, task_name TEXT NOT NULL, task_type INTEGER NOT NULL,"
       " usb_folder_path TEXT NOT NULL, nas_folder_path TEXT NOT NULL, nas_share_name TEXT NOT NULL,"
       " last_copied_time INTEGER NOT NULL, copy_strategy INTEGER NOT NULL, keep_dir_structure INTEGER NOT NULL,"
       " smart_create_date_dir INTEGER NOT NULL, rename_photo_file INTEGER NOT NULL,"
       " conflict_policy INTEGER NOT NULL, error INTEGER NOT NULL);"
       "INSERT INTO usb_info_table VALUES (1, 'PLOVO_DEFAULT_USB_UUID', 1, 0, '', ''),"
       " (2, 'PLOVO_DEFAULT_SD_UUID', 1, 0, '', '');"
       "WITH RECURSIVE d(n) AS (SELECT 3 UNION ALL SELECT n + 1 FROM d WHERE n < 50) INSERT INTO usb_info_table"
       " SELECT n, 'uuid-' || (n * 7919), 0, 1, 'Generic', 'Flash Disk' FROM d;"
       "WITH RECURSIVE t(n) AS (SELECT 1 UNION ALL SELECT n + 1 FROM t WHERE n < " + std::to_string(kTasks) + ")"
       " INSERT INTO task_info_table SELECT n, CASE WHEN n <= 2 THEN n ELSE 3 + n % 48 END, 1, 'Task ' || n,"
       " 1 + n % 3, '/DCIM', '/Backup/Task ' || n, 'photo', 1790000000, CASE WHEN n % " + std::to_string(kEvery) +
       " = 0 THEN 3 ELSE 1 + n % 2 END, 1, 0, n % 2, 2, 0 FROM t; COMMIT;");
  const std::string first = FileDb(gTemplate, kEvery);
  Exec(first,
       "PRAGMA journal_mode = OFF; PRAGMA synchronous = OFF; BEGIN;"
       "CREATE TABLE config_table (key TEXT PRIMARY KEY, value TEXT NOT NULL);"
       "INSERT INTO config_table VALUES ('version', '1');"
       "CREATE TABLE file_info_table (id INTEGER PRIMARY KEY AUTOINCREMENT, source_path TEXT NOT NULL,"
       " destination_path TEXT NOT NULL, size INTEGER NOT NULL, mtime INTEGER NOT NULL, copied_time INTEGER NOT NULL);"
       "CREATE INDEX file_info_table_src_path_idx on file_info_table(source_path);"
       "CREATE INDEX file_info_table_dst_path_idx on file_info_table(destination_path);"
       "WITH RECURSIVE r(n) AS (SELECT 0 UNION ALL SELECT n + 1 FROM r WHERE n < " + std::to_string(kRows - 1) + "),"
       " a(i, name) AS (VALUES (0, 'Holiday'), (1, '2023-07-14 Summer at the lake'), (2, 'Birthday Anna'),"
       "  (3, 'Misc'), (4, 'Garden'), (5, '2024-01 Ski week in the mountains'), (6, 'Wedding of Tom and Lisa'),"
       "  (7, 'Concert 2022'), (8, 'Old phone backup'), (9, '2024-05-02 School trip to the coast')),"
       " f(n, album) AS (SELECT n, (SELECT name FROM a WHERE i = n / 2000 % 10) FROM r)"
       " INSERT INTO file_info_table (source_path, destination_path, size, mtime, copied_time) SELECT"
       " printf('/volumeUSB1/usbshare1-1/DCIM/%s/%03dCANON/IMG_%05d.JPG', album, 100 + n / 1000, n),"
       " printf('/volume1/photo/Imported/Camera card 10/%s/IMG_%05d.JPG', album, n),"
       " 1000000 + n * 7919 % 9000000, 1700000000 + n * 60, 1790000000 + n FROM f;"
       "COMMIT; PRAGMA journal_mode = WAL;");
  for (int n : Incremental()) {
    if (n != kEvery && !Run("cp '" + first + "' '" + FileDb(gTemplate, n) + "'")) plovo_bench::Die("cp a file db");
  }
}

// A version 1 repository to migrate, no scheduler entries, nothing dirty.
void FreshRepo() {
  plovo_bench::RemoveTree(gRepo);
  plovo_bench::RemoveTree(gSchedDir);
  plovo_bench::MakeDirs(gRepo + "/db");
  if (!Run("cp '" + TaskDb(gTemplate) + "' '" + TaskDb(gRepo) + "'")) plovo_bench::Die("copy the task db");
  for (int id : Incremental()) {
    plovo_bench::MakeDirs(gRepo + "/task/" + std::to_string(id));
    if (link(FileDb(gTemplate, id).c_str(), FileDb(gRepo, id).c_str()) != 0) plovo_bench::Die("link a file db");
  }
  sync();
}

// The first column of the first row as text; "" when none or on failure.
std::string Query(const std::string& path, const std::string& sql) {
  std::string text;
  auto read = [](sqlite3_stmt* s, std::string& out) { out = reinterpret_cast<const char*>(sqlite3_column_text(s, 0)); };
  GetDBRecord<std::string>(path, sql, read, text);
  return text;
}

// The id of the first file database of repo without both indexes named
// with prefix, or of one with a working copy left; 0 when there is none.
int FileDbWithout(const std::string& repo, const std::string& prefix) {
  for (int id : Incremental()) {
    if (Query(FileDb(repo, id), "SELECT COUNT(*) FROM sqlite_master WHERE name IN ('" + prefix + "src_path_idx', '" +
                                    prefix + "dst_path_idx')") != "2" ||
        access((FileDb(repo, id) + ".bkp_v1").c_str(), F_OK) == 0) {
      return id;
    }
  }
  return 0;
}

// "" when the repository is migrated: version 2, a schedule id for each task
// outside the default devices, the new indexes, no working copy.
std::string CheckMigrated() {
  const std::string task = TaskDb(gRepo);
  if (Query(task, "SELECT value FROM config_table WHERE key = 'version'") != "2") return "task db not at version 2";
  if (Query(task, "SELECT COUNT(*) FROM task_info_table WHERE schedule_id > 0") != std::to_string(kTasks - 2)) {
    return "not every ordinary task has a schedule id";
  }
  const int id = FileDbWithout(gRepo, "file_info_");
  return id == 0 ? "" : "file db of task " + std::to_string(id) + " not migrated";
}

void BM_Update(benchmark::State& state) {
  for (auto _ : state) {
    state.PauseTiming();
    FreshRepo();
    state.ResumeTiming();
    if (UpdaterCore().Update(gRepo) != 0) return state.SkipWithError("Update failed");
  }
  const std::string fault = CheckMigrated();
  if (!fault.empty()) state.SkipWithError(fault.c_str());
}

template <bool kSync>
void BM_Cp(benchmark::State& state) {
  const std::string cp = "cp -r '" + gTemplate + "/db' '" + gTemplate + "/task' '" + gCopyDest + "'";
  for (auto _ : state) {
    state.PauseTiming();
    plovo_bench::RemoveTree(gCopyDest);
    plovo_bench::MakeDirs(gCopyDest);
    sync();
    state.ResumeTiming();
    if (!Run(cp)) return state.SkipWithError("cp failed");
    if (kSync) sync();
  }
}

// The migration's steps one by one on a fresh repository, each summed over
// the 100 file databases, then the task database as a whole.
void Phases() {
  FreshRepo();
  double spent[4] = {}, last = Now();
  auto step = [&](int phase, bool ok) {
    if (!ok) plovo_bench::Die("phase " + std::to_string(phase) + " failed");
    const double now = Now();
    spent[phase] += now - last;
    last = now;
  };
  for (int id : Incremental()) {
    const std::string live = FileDb(gRepo, id), copy = live + ".bkp_v1";
    step(0, BackupDB(live, copy) == 0);
    step(1, UpdateDB(copy, kIndexScript) == 0);
    step(2, ReplaceDB(copy, live) == 0);
  }
  sync();
  last = Now();
  step(3, UpdaterV1(gRepo).UpdateTaskDB(TaskDb(gRepo)) == 0);
  if (!CheckMigrated().empty()) plovo_bench::Die("phases: " + CheckMigrated());
  std::printf("phases: file db backup %.2f s, index script %.2f s, replace (checkpoint, syncs, rename) %.2f s, "
              "task db with %d scheduler entries %.2f s; sum %.2f s\n", spent[0], spent[1], spent[2], kTasks - 2,
              spent[3], spent[0] + spent[1] + spent[2] + spent[3]);
}

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  const std::string& root = sandbox.Root();
  gTemplate = root + "/template";
  gRepo = root + "/volume1/@Plovo";
  gCopyDest = root + "/cp-copy";
  gSchedDir = root + "/velt-dev/scheduler";
  const double start = Now();
  MakeTemplate();
  sync();
  std::printf("template: %d tasks, %d file databases of %d rows made in %.1f s\n", kTasks, kTasks / kEvery, kRows,
              Now() - start);
  std::fflush(stdout);

  // Two migrations only, so that the whole run stays within three minutes.
  plovo_bench::RegisterRepeated("update", BM_Update, 2, benchmark::kSecond)->Iterations(1);
  plovo_bench::RegisterRepeated("cp", BM_Cp<false>, 3, benchmark::kSecond)->Iterations(1);
  plovo_bench::RegisterRepeated("cp_sync", BM_Cp<true>, 3, benchmark::kSecond)->Iterations(1);
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);
  Phases();

  int status = 0;
  if (const int id = FileDbWithout(gTemplate, "file_info_table_")) {
    std::printf("migration-bench: the template's file db of task %d was changed in place\n", id);
    status = 1;
  }
  auto update = reporter.MedianSeconds("update");
  auto cp = reporter.MedianSeconds("cp");
  auto cpSync = reporter.MedianSeconds("cp_sync");
  if (!update || !cp || !cpSync) {
    std::printf("summary migration: incomplete, no ratio\n");
    return 1;
  }
  std::printf("summary migration: Update median %.2f s, cp median %.2f s, ratio %.2f; cp+sync median %.2f s, "
              "ratio %.2f\n", *update, *cp, *update / *cp, *cpSync, *update / *cpSync);
  return status;
}
