// FSCopy of a 1 GiB file against cp copying the same file into the same
// folder, in the same run, with the repetitions interleaved.
//
// The files live in PLOVO_BENCH_DATA_DIR when it is set (scripts/bench
// points it at /dev/shm when there is room), else in <root>/file-copy. The
// source is made once and read through before the benchmarks start, so
// that every copy reads it from the page cache. Each copy goes to a
// destination that does not exist yet; removing the previous one is not
// timed.
//
// fsync: FSCopy flushes its destination before it returns, cp does not. On
// a memory file system (tmpfs, as /dev/shm) the flush costs nothing and the
// two do the same work. On a disk-backed folder FSCopy's time includes
// writing the gigabyte to the disk while cp leaves it dirty in the page
// cache, which would compare the disk with the page cache, not the two
// copies. So a third figure, cp followed by an fsync of its copy, is taken
// as well, and on a disk-backed folder the verdict is against that one; on
// a memory file system it is against cp alone. Both ratios are printed.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "bench-support.h"
#include "common/file-op.h"

namespace {

constexpr uint64_t kFileSize = uint64_t{1} << 30;
constexpr long kTmpfsMagic = 0x01021994;
constexpr long kRamfsMagic = 0x858458f6;

std::string gSource;
std::string gDestination;
const char* gCp = "/bin/cp";

// The file system the figures are for.
std::string FileSystemName(const std::string& dir, bool* inMemory) {
  struct statfs fs {};
  if (statfs(dir.c_str(), &fs) != 0) plovo_bench::Die("statfs " + dir);
  long type = static_cast<long>(fs.f_type);
  *inMemory = type == kTmpfsMagic || type == kRamfsMagic;
  switch (type) {
    case kTmpfsMagic: return "tmpfs";
    case kRamfsMagic: return "ramfs";
    case 0xEF53: return "ext2/3/4";
    case 0x58465342: return "xfs";
    case 0x9123683E: return "btrfs";
    default: {
      char hex[32];
      std::snprintf(hex, sizeof hex, "type 0x%lx", type);
      return hex;
    }
  }
}

// cp as a shell or a script would run it: a child process, waited for.
bool RunCp() {
  pid_t child = fork();
  if (child < 0) return false;
  if (child == 0) {
    execl(gCp, "cp", gSource.c_str(), gDestination.c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  int status = 0;
  while (waitpid(child, &status, 0) < 0) {
    if (errno != EINTR) return false;
  }
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

bool FlushDestination() {
  int fd = open(gDestination.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  bool ok = fsync(fd) == 0;
  return close(fd) == 0 && ok;
}

// Times copy() over fresh destinations, then checks the last copy.
template <typename Copy>
void TimeCopies(benchmark::State& state, Copy copy) {
  for (auto _ : state) {
    state.PauseTiming();
    if (unlink(gDestination.c_str()) != 0 && errno != ENOENT) plovo_bench::Die("unlink " + gDestination);
    state.ResumeTiming();
    if (!copy()) {
      state.SkipWithError("copy failed");
      return;
    }
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kFileSize));
  if (!plovo_bench::SameContent(gSource, gDestination)) state.SkipWithError("destination differs from source");
  unlink(gDestination.c_str());
}

void BM_FSCopy(benchmark::State& state) {
  TimeCopies(state, [] { return FSCopy(gSource, gDestination, false) == 0; });
}

void BM_Cp(benchmark::State& state) { TimeCopies(state, RunCp); }

void BM_CpFsync(benchmark::State& state) {
  TimeCopies(state, [] { return RunCp() && FlushDestination(); });
}

void Register(const char* name, void (*fn)(benchmark::State&)) {
  plovo_bench::RegisterRepeated(name, fn, 9, benchmark::kMillisecond)->Iterations(2);
}

double MiBps(double seconds) { return static_cast<double>(kFileSize) / seconds / (1 << 20); }

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  const std::string dir = plovo_bench::DataDir(sandbox, "file-copy");
  gSource = dir + "/copy-source.bin";
  gDestination = dir + "/copy-destination.bin";
  if (access(gCp, X_OK) != 0) gCp = "/usr/bin/cp";
  if (access(gCp, X_OK) != 0) plovo_bench::Die("no cp in /bin or /usr/bin");
  bool inMemory = false;
  std::string fsName = FileSystemName(dir, &inMemory);
  std::printf("file-copy-bench: files in %s (%s, %s), cp is %s\n", dir.c_str(), fsName.c_str(),
              inMemory ? "in memory" : "disk-backed", gCp);
  std::fflush(stdout);
  plovo_bench::PrepareRandomFile(gSource, kFileSize);

  Register("fscopy", BM_FSCopy);
  Register("cp", BM_Cp);
  Register("cp_fsync", BM_CpFsync);
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);

  auto subject = reporter.MedianSeconds("fscopy");
  auto cp = reporter.MedianSeconds("cp");
  auto cpFsync = reporter.MedianSeconds("cp_fsync");
  if (!subject || !cp || !cpFsync) {
    std::printf("summary file-copy: incomplete, no ratio\n");
    return 1;
  }
  double ratio = *cp / *subject;  // throughput ratio: time of cp over time of FSCopy
  double ratioFsync = *cpFsync / *subject;
  double verdictRatio = inMemory ? ratio : ratioFsync;
  std::printf("summary file-copy (%s): fscopy %.0f MiB/s, cp %.0f MiB/s, ratio %.3f; cp+fsync %.0f MiB/s, "
              "ratio %.3f (target >= 0.90 against %s: %s)\n",
              fsName.c_str(), MiBps(*subject), MiBps(*cp), ratio, MiBps(*cpFsync), ratioFsync,
              inMemory ? "cp" : "cp+fsync", plovo_bench::Verdict(verdictRatio >= 0.9));
  return 0;
}
