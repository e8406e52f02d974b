// The copy engine (RunCopy) on a tree of 10000 files, 1 GiB in all, against
// the tools a user would otherwise reach for, in the same run and on the
// same disk.
//
// Import (`import_engine`): an incremental run with an empty memory into an
// empty folder, the first copy a task makes. Baselines: `cp -r SRC DST`
// (`import_cp`) and `cp -r SRC DST && sync -f DST` (`import_cp_sync`). The
// engine syncs every file before it puts it in place, so its copy is on the
// disk when it returns; cp leaves its copy dirty in the page cache. Only the
// second baseline does the same work, and the verdict is against it; both
// ratios are printed.
//
// Nothing changed (`incremental_engine`): the same incremental task again
// on a destination it filled once, untimed; it must copy nothing. Baseline
// (`incremental_rsync`): `rsync -a SRC/ DST/` on a destination that equals
// the source.
//
// One percent changed (`mirror_engine`): a mirror run after 100 files of
// the source were rewritten with new bytes and a new modification time.
// Baseline (`mirror_rsync`): `rsync -a --delete SRC/ DST/` after the same
// change. Each side has a source of its own, so that neither sees the
// other's changes; both apply the same sequence of changes, one per
// iteration, and their destinations were filled once, untimed.
//
// Before every timed step the machine's dirty pages are written out and the
// source's pages are dropped from the page cache (posix_fadvise on its own
// files; nothing machine-wide), so every step reads its source from the
// disk and none pays for the previous one's write-back. The trees live in a
// fresh folder under the sandbox root and are removed at the end.
#include <fcntl.h>
#include <ftw.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>
#include <utility>
#include <vector>

#include "bench-support.h"
#include "daemon/engine/engine.h"
#include "daemon/engine/run-control.h"

namespace {

constexpr int kDirs = 100;
constexpr int kFilesPerDir = 100;
constexpr unsigned long kFiles = kDirs * kFilesPerDir;
constexpr uint64_t kTreeBytes = uint64_t{1} << 30;
constexpr size_t kPoolBytes = size_t{256} << 10;  // larger than the largest file
constexpr int kRepetitions = 3;
constexpr int kIncrementalStrategy = 3;
constexpr int kMirrorStrategy = 2;

std::string gWork;  // everything this program writes
std::vector<char> gPool;
time_t gBaseTime = 0;  // after the trees were written: changed files get later times

double Now() { return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count(); }

// ---- The tree ----------------------------------------------------------------


std::string TreeFile(const std::string& tree, size_t index) {
  return tree + "/" + std::to_string(index / kFilesPerDir + 1) + "/" + std::to_string(index % kFilesPerDir) + ".bin";
}

// Writes file index of the tree from the pool; version 0 is the original
// content, a change round r writes version r + 1.
void WriteFile(const std::string& tree, size_t index, size_t size, int version) {
  const size_t offset = (index * 7919 + static_cast<size_t>(version) * 4099) % (kPoolBytes - size);
  const std::string path = TreeFile(tree, index);
  const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0 || !plovo_bench::WriteAll(fd, gPool.data() + offset, size)) plovo_bench::Die("write " + path);
  if (version > 0) {
    // A second of its own per round, later than any earlier one: a tool
    // that compares times in whole seconds must still see the change.
    const struct timespec times[2] = {{0, UTIME_OMIT}, {gBaseTime + version, 0}};
    if (futimens(fd, times) != 0) plovo_bench::Die("futimens " + path);
  }
  if (close(fd) != 0) plovo_bench::Die("close " + path);
}

void WriteTree(const std::string& tree) {
  const std::vector<size_t> sizes = plovo_bench::MixedSizes(kFiles, kTreeBytes);
  for (int d = 0; d < kDirs; ++d) plovo_bench::MakeDirs(tree + "/" + std::to_string(d + 1));
  for (size_t i = 0; i < kFiles; ++i) WriteFile(tree, i, sizes[i], 0);
}

// Change round r: file number r % 100 of every folder gets new bytes (same
// size) and a new time. Returns the bytes changed.
uint64_t ChangeTree(const std::string& tree, int round) {
  const std::vector<size_t> sizes = plovo_bench::MixedSizes(kFiles, kTreeBytes);
  uint64_t bytes = 0;
  for (int d = 0; d < kDirs; ++d) {
    const size_t i = static_cast<size_t>(d * kFilesPerDir + round % kFilesPerDir);
    WriteFile(tree, i, sizes[i], round + 1);
    bytes += sizes[i];
  }
  return bytes;
}

// "" when the folder holds exactly a tree's count of files and bytes.
std::string CheckCount(const std::string& dir) {
  uint64_t files = 0, bytes = 0;
  plovo_bench::CountTree(dir, files, bytes);
  if (files == kFiles && bytes == kTreeBytes) return "";
  return dir + " holds " + std::to_string(files) + " files of " + std::to_string(bytes) + " bytes";
}

// "" when every file of the tree has its copy, byte for byte, at the same
// place below copy.
std::string CheckContent(const std::string& tree, const std::string& copy) {
  for (size_t i = 0; i < kFiles; ++i) {
    if (!plovo_bench::SameContent(TreeFile(tree, i), TreeFile(copy, i))) return TreeFile(copy, i) + " differs";
  }
  return CheckCount(copy);
}

// Untimed, before every timed step: the previous step's writes go to the
// disk, and the source's pages leave the page cache (clean pages only,
// hence the sync first).
void Settle(const std::string& tree) {
  sync();
  plovo_bench::DropFromCache(tree);
}

// ---- The runs ------------------------------------------------------------------

// A task's run from <work>/<from>/tree into <work>/dst/<to>, remembering in
// <work>/task-<to>.
plovod::RunPlan Plan(const std::string& from, const std::string& to, int strategy) {
  plovod::RunPlan plan;
  plan.id = 1;
  plan.source_root = gWork + "/" + from;
  plan.source = plan.source_root + "/tree";
  plan.destination_root = gWork + "/dst";
  plan.destination = plan.destination_root + "/" + to;
  plan.task.id = 1;
  plan.task.task_type = 1;
  plan.task.copy_strategy = strategy;
  plan.task.keep_dir_structure = true;
  plan.task.conflict_policy = 1;
  plan.task_folder = gWork + "/task-" + to;
  plovo_bench::MakeDirs(plan.task_folder);
  plovo_bench::MakeDirs(plan.destination);
  return plan;
}

// One run, timed when state is given; "" when it succeeded and copied what
// it was expected to.
std::string Run(const plovod::RunPlan& plan, unsigned long files, uint64_t bytes, benchmark::State* state) {
  plovod::RunPlan now = plan;
  now.started = time(nullptr);
  plovod::RunControl control;
  const double start = Now();
  const int result = plovod::RunCopy(now, control);
  if (state != nullptr) state->SetIterationTime(Now() - start);
  const plovod::RunStats& stats = control.stats;
  if (result == 0 && stats.copied == files && stats.bytes == bytes && stats.skipped == 0 && stats.removed == 0) {
    return "";
  }
  return "RunCopy returned " + std::to_string(result) + " after copying " + std::to_string(stats.copied) +
         " files of " + std::to_string(stats.bytes) + " bytes (expected " + std::to_string(files) + " of " +
         std::to_string(bytes) + "), " + std::to_string(stats.skipped) + " skipped, " +
         std::to_string(stats.removed) + " removed";
}

// A baseline through the shell, timed.
bool Shell(const std::string& command, benchmark::State& state) {
  const double start = Now();
  const bool ok = std::system(command.c_str()) == 0;
  state.SetIterationTime(Now() - start);
  return ok;
}

std::string Source(const std::string& from) { return gWork + "/" + from + "/tree"; }
std::string Destination(const std::string& to) { return gWork + "/dst/" + to; }

void BM_ImportEngine(benchmark::State& state) {
  for (auto _ : state) {
    const plovod::RunPlan plan = Plan("src", "import", kIncrementalStrategy);
    Settle(plan.source);
    const std::string fault = Run(plan, kFiles, kTreeBytes, &state);
    const std::string count = CheckCount(plan.destination);
    plovo_bench::RemoveTree(plan.destination);
    plovo_bench::RemoveTree(plan.task_folder);  // the next import starts with an empty memory
    if (!fault.empty()) return state.SkipWithError(fault.c_str());
    if (!count.empty()) return state.SkipWithError(count.c_str());
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kTreeBytes));
}

void Cp(benchmark::State& state, bool withSync) {
  const std::string dst = Destination("cp");
  const std::string command = "/bin/cp -r '" + Source("src") + "' '" + dst + "'" +
                              (withSync ? " && /bin/sync -f '" + dst + "'" : "");
  for (auto _ : state) {
    Settle(Source("src"));
    const bool ok = Shell(command, state);
    const std::string count = CheckCount(dst);
    plovo_bench::RemoveTree(dst);
    if (!ok) return state.SkipWithError("cp failed");
    if (!count.empty()) return state.SkipWithError(count.c_str());
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kTreeBytes));
}

void BM_ImportCp(benchmark::State& state) { Cp(state, false); }
void BM_ImportCpSync(benchmark::State& state) { Cp(state, true); }

void BM_IncrementalEngine(benchmark::State& state) {
  const plovod::RunPlan plan = Plan("src", "incremental", kIncrementalStrategy);
  for (auto _ : state) {
    Settle(plan.source);
    const std::string fault = Run(plan, 0, 0, &state);
    if (!fault.empty()) return state.SkipWithError(fault.c_str());
  }
  const std::string count = CheckCount(plan.destination);
  if (!count.empty()) state.SkipWithError(count.c_str());
}

void BM_IncrementalRsync(benchmark::State& state) {
  const std::string command = "/usr/bin/rsync -a '" + Source("src") + "/' '" + Destination("rsync") + "/'";
  for (auto _ : state) {
    Settle(Source("src"));
    if (!Shell(command, state)) return state.SkipWithError("rsync failed");
  }
  const std::string count = CheckCount(Destination("rsync"));
  if (!count.empty()) state.SkipWithError(count.c_str());
}

int gEngineRound = 0, gRsyncRound = 0;  // the change rounds each side has applied

void BM_MirrorEngine(benchmark::State& state) {
  const plovod::RunPlan plan = Plan("mirror-engine", "mirror-engine", kMirrorStrategy);
  for (auto _ : state) {
    const uint64_t bytes = ChangeTree(plan.source, gEngineRound++);
    Settle(plan.source);
    const std::string fault = Run(plan, kDirs, bytes, &state);
    if (!fault.empty()) return state.SkipWithError(fault.c_str());
  }
  const std::string count = CheckCount(plan.destination);
  if (!count.empty()) state.SkipWithError(count.c_str());
}

void BM_MirrorRsync(benchmark::State& state) {
  const std::string src = Source("mirror-rsync"), dst = Destination("mirror-rsync");
  const std::string command = "/usr/bin/rsync -a --delete '" + src + "/' '" + dst + "/'";
  for (auto _ : state) {
    ChangeTree(src, gRsyncRound++);
    Settle(src);
    if (!Shell(command, state)) return state.SkipWithError("rsync failed");
  }
  const std::string count = CheckCount(dst);
  if (!count.empty()) state.SkipWithError(count.c_str());
}

void Register(const char* name, void (*fn)(benchmark::State&), int iterations) {
  benchmark::RegisterBenchmark(name, fn)
      ->Repetitions(kRepetitions)
      ->ReportAggregatesOnly(true)
      ->UseManualTime()
      ->Unit(benchmark::kSecond)
      ->Iterations(iterations);
}

// Untimed: the destinations the later runs start from, each filled once by
// its own side.
void Prepare() {
  std::string fault = Run(Plan("src", "incremental", kIncrementalStrategy), kFiles, kTreeBytes, nullptr);
  if (fault.empty()) fault = Run(Plan("mirror-engine", "mirror-engine", kMirrorStrategy), kFiles, kTreeBytes, nullptr);
  if (!fault.empty()) {
    std::fprintf(stderr, "copy-engine-bench: the untimed first run failed: %s\n", fault.c_str());
    plovo_bench::RemoveTree(gWork);
    std::exit(1);
  }
  const std::string rsync = "/usr/bin/rsync -a '" + Source("src") + "/' '" + Destination("rsync") + "/' && " +
                            "/usr/bin/rsync -a '" + Source("mirror-rsync") + "/' '" + Destination("mirror-rsync") + "/'";
  if (std::system(rsync.c_str()) != 0) {
    std::fprintf(stderr, "copy-engine-bench: the untimed first rsync failed\n");
    plovo_bench::RemoveTree(gWork);
    std::exit(1);
  }
}

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  std::string work = sandbox.Root() + "/copy-engine-XXXXXX";
  if (mkdtemp(&work[0]) == nullptr) plovo_bench::Die("mkdtemp " + work);
  gWork = work;

  // Three sources, four destinations kept through the run, and one import.
  struct statvfs fs {};
  if (statvfs(gWork.c_str(), &fs) != 0) plovo_bench::Die("statvfs " + gWork);
  const uint64_t freeBytes = static_cast<uint64_t>(fs.f_bavail) * fs.f_frsize;
  if (freeBytes < 9 * kTreeBytes) {
    std::fprintf(stderr, "copy-engine-bench: %.1f GiB free under %s, 9 GiB needed\n",
                 static_cast<double>(freeBytes) / kTreeBytes, gWork.c_str());
    plovo_bench::RemoveTree(gWork);
    return 2;
  }

  gPool = plovo_bench::RandomPool(kPoolBytes);
  double start = Now();
  for (const char* from : {"src", "mirror-engine", "mirror-rsync"}) WriteTree(Source(from));
  sync();
  gBaseTime = time(nullptr) + 1;
  std::printf("trees: 3 of %d folders of %d files, %llu bytes each, written in %.1f s; %.0f GiB free under %s\n",
              kDirs, kFilesPerDir, static_cast<unsigned long long>(kTreeBytes), Now() - start,
              static_cast<double>(freeBytes) / kTreeBytes, gWork.c_str());
  start = Now();
  Prepare();
  std::printf("destinations filled once (two engine runs, two rsync) in %.1f s\n", Now() - start);
  std::fflush(stdout);

  Register("import_engine", BM_ImportEngine, 1);
  Register("import_cp", BM_ImportCp, 1);
  Register("import_cp_sync", BM_ImportCpSync, 1);
  Register("incremental_engine", BM_IncrementalEngine, 3);
  Register("incremental_rsync", BM_IncrementalRsync, 3);
  Register("mirror_engine", BM_MirrorEngine, 3);
  Register("mirror_rsync", BM_MirrorRsync, 3);
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);

  // What the engine left must be the source, byte for byte: a fast run
  // that copied the wrong bytes would be no result.
  int status = 0;
  for (const auto& [from, to] : {std::pair<const char*, const char*>{"src", "incremental"},
                                 {"mirror-engine", "mirror-engine"}}) {
    const std::string fault = CheckContent(Source(from), Destination(to));
    if (!fault.empty()) {
      std::printf("copy-engine-bench: after the runs %s\n", fault.c_str());
      status = 1;
    }
  }
  plovo_bench::RemoveTree(gWork);

  auto engine = reporter.MedianSeconds("import_engine");
  auto cp = reporter.MedianSeconds("import_cp");
  auto cpSync = reporter.MedianSeconds("import_cp_sync");
  if (engine && cp && cpSync) {
    std::printf("summary copy-engine import: RunCopy median %.2f s; cp -r %.2f s, speed ratio %.3f; "
                "cp -r && sync %.2f s, speed ratio %.3f (target >= 0.90 against cp -r && sync: %s)\n",
                *engine, *cp, *cp / *engine, *cpSync, *cpSync / *engine,
                plovo_bench::Verdict(*cpSync / *engine >= 0.9));
  } else {
    std::printf("summary copy-engine import: incomplete, no ratio\n");
    status = 1;
  }
  // The engine's time against rsync's: at most rsync's.
  auto againstRsync = [&](const char* what, const char* run, const char* rsyncRun, const char* strategy,
                          const char* command) {
    const auto mine = reporter.MedianSeconds(run), theirs = reporter.MedianSeconds(rsyncRun);
    if (!mine || !theirs) {
      std::printf("summary copy-engine %s: incomplete, no ratio\n", what);
      status = 1;
      return;
    }
    std::printf("summary copy-engine %s: RunCopy %s median %.3f s; %s %.3f s; time ratio %.3f (target <= 1.00: %s)\n",
                what, strategy, *mine, command, *theirs, *mine / *theirs, plovo_bench::Verdict(*mine <= *theirs));
  };
  againstRsync("unchanged", "incremental_engine", "incremental_rsync", "incremental", "rsync -a");
  againstRsync("1% changed", "mirror_engine", "mirror_rsync", "mirror", "rsync -a --delete");
  return status;
}
