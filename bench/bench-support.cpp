#include "bench-support.h"

#include <errno.h>
#include <ftw.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <fcntl.h>

#include <algorithm>
#include <cstdio>
#include <memory>
#include <cstdlib>
#include <cstring>

namespace plovo_bench {
namespace {

int RemoveEntry(const char* path, const struct stat*, int, struct FTW*) {
  if (remove(path) != 0 && errno != ENOENT) std::fprintf(stderr, "bench: remove %s: %s\n", path, std::strerror(errno));
  return 0;
}

}  // namespace

void Die(const std::string& what) {
  std::fprintf(stderr, "%s: %s: %s\n", program_invocation_short_name, what.c_str(), std::strerror(errno));
  std::exit(2);
}

bool WriteAll(int fd, const char* data, size_t n) {
  while (n > 0) {
    ssize_t w = write(fd, data, n);
    if (w < 0 && errno == EINTR) continue;
    if (w <= 0) return false;
    data += w;
    n -= static_cast<size_t>(w);
  }
  return true;
}

std::string DataDir(const Sandbox& sandbox, const std::string& name) {
  const char* given = std::getenv("PLOVO_BENCH_DATA_DIR");
  std::string dir = given != nullptr && given[0] != '\0' ? given : sandbox.Root() + "/" + name;
  MakeDirs(dir);
  return dir;
}

void PrepareRandomFile(const std::string& path, uint64_t size) {
  constexpr size_t kChunkWords = size_t{1} << 17;  // 1 MiB
  struct stat st {};
  if (stat(path.c_str(), &st) != 0 || static_cast<uint64_t>(st.st_size) != size) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) Die("create " + path);
    std::unique_ptr<uint64_t[]> chunk(new uint64_t[kChunkWords]);
    uint64_t x = 0x9E3779B97F4A7C15ull;
    for (uint64_t done = 0; done < size; done += sizeof(uint64_t) * kChunkWords) {
      for (size_t i = 0; i < kChunkWords; ++i) {
        x ^= x << 13;
        x ^= x >> 7;
        x ^= x << 17;
        chunk[i] = x;
      }
      size_t n = static_cast<size_t>(std::min<uint64_t>(size - done, sizeof(uint64_t) * kChunkWords));
      if (!WriteAll(fd, reinterpret_cast<const char*>(chunk.get()), n)) Die("write " + path);
    }
    if (fsync(fd) != 0 || close(fd) != 0) Die("flush " + path);
  }
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) Die("open " + path);
  std::unique_ptr<char[]> buffer(new char[1 << 20]);
  while (read(fd, buffer.get(), 1 << 20) > 0) {
  }
  close(fd);
}

bool SameContent(const std::string& a, const std::string& b) {
  int fa = open(a.c_str(), O_RDONLY | O_CLOEXEC);
  int fb = open(b.c_str(), O_RDONLY | O_CLOEXEC);
  bool same = fa >= 0 && fb >= 0;
  std::unique_ptr<char[]> x(new char[1 << 20]);
  std::unique_ptr<char[]> y(new char[1 << 20]);
  while (same) {
    ssize_t n = read(fa, x.get(), 1 << 20);
    ssize_t m = read(fb, y.get(), 1 << 20);
    if (n != m || n < 0) same = false;
    if (n <= 0) break;
    same = memcmp(x.get(), y.get(), static_cast<size_t>(n)) == 0;
  }
  if (fa >= 0) close(fa);
  if (fb >= 0) close(fb);
  return same;
}

Sandbox::Sandbox() {
  const char* given = std::getenv("PLOVO_ROOT");
  if (given != nullptr && given[0] != '\0') {
    root_ = given;
  } else {
    // Short on purpose: the daemon socket path must fit in 107 bytes.
    char name[] = "/tmp/plovo-bench-XXXXXX";
    if (mkdtemp(name) == nullptr) Die("mkdtemp");
    root_ = name;
    owned_ = true;
    if (setenv("PLOVO_ROOT", root_.c_str(), 1) != 0) Die("setenv PLOVO_ROOT");
  }
  MakeDirs(root_ + "/tmp");
}

Sandbox::~Sandbox() {
  if (owned_) RemoveTree(root_);
}

bool SendAll(int fd, const char* data, size_t n) {
  while (n > 0) {
    ssize_t w = send(fd, data, n, MSG_NOSIGNAL);
    if (w < 0 && errno == EINTR) continue;
    if (w <= 0) return false;
    data += w;
    n -= static_cast<size_t>(w);
  }
  return true;
}

void UseServerLogMask() { setlogmask(LOG_UPTO(LOG_INFO)); }

void RemoveTree(const std::string& path) {
  nftw(path.c_str(), RemoveEntry, 16, FTW_DEPTH | FTW_PHYS);
}

void MakeDirs(const std::string& path) {
  for (size_t at = 1; at <= path.size(); ++at) {
    if (at != path.size() && path[at] != '/') continue;
    std::string prefix = path.substr(0, at);
    if (mkdir(prefix.c_str(), 0755) != 0 && errno != EEXIST) Die("mkdir " + prefix);
  }
}

SummaryReporter::SummaryReporter()
    : ConsoleReporter(isatty(STDOUT_FILENO) ? OO_ColorTabular : OO_Tabular) {}

void SummaryReporter::ReportRuns(const std::vector<Run>& runs) {
  for (const Run& run : runs) {
    if (run.error_occurred) continue;
    // With repetitions the median aggregate stands for the benchmark; a
    // benchmark run once has only its one result.
    bool median = run.run_type == Run::RT_Aggregate && run.aggregate_name == "median";
    bool single = run.run_type == Run::RT_Iteration && run.repetitions <= 1;
    if (!median && !single) continue;
    seconds_[run.run_name.function_name] = run.GetAdjustedRealTime() / benchmark::GetTimeUnitMultiplier(run.time_unit);
  }
  ConsoleReporter::ReportRuns(runs);
}

std::optional<double> SummaryReporter::MedianSeconds(const std::string& name) const {
  auto found = seconds_.find(name);
  if (found == seconds_.end()) return std::nullopt;
  return found->second;
}

void RunBenchmarks(int argc, char** argv, SummaryReporter& reporter) {
  // The default goes first so that a flag on the command line overrides it.
  std::vector<char*> args;
  static char interleave[] = "--benchmark_enable_random_interleaving=true";
  args.push_back(argv[0]);
  args.push_back(interleave);
  for (int i = 1; i < argc; ++i) args.push_back(argv[i]);
  int count = static_cast<int>(args.size());
  args.push_back(nullptr);
  benchmark::Initialize(&count, args.data());
  if (benchmark::ReportUnrecognizedArguments(count, args.data())) std::exit(1);
  benchmark::RunSpecifiedBenchmarks(&reporter);
  benchmark::Shutdown();
}

const char* Verdict(bool met) { return met ? "met" : "MISSED"; }

benchmark::internal::Benchmark* RegisterRepeated(const char* name, void (*fn)(benchmark::State&),
                                                 int repetitions, benchmark::TimeUnit unit) {
  return benchmark::RegisterBenchmark(name, fn)
      ->Repetitions(repetitions)
      ->ReportAggregatesOnly(true)
      ->UseRealTime()
      ->Unit(unit);
}

std::vector<size_t> MixedSizes(size_t count, uint64_t total) {
  const size_t mean = total / count;
  std::vector<size_t> sizes(count);
  uint64_t x = 0x2545F4914F6CDD1Dull;
  for (size_t i = 0; i + 1 < count; i += 2) {
    x ^= x << 13;
    x ^= x >> 7;
    x ^= x << 17;
    const size_t delta = x % (mean / 2);
    sizes[i] = mean + delta;
    sizes[i + 1] = mean - delta;
  }
  sizes.back() += total - mean * count;
  return sizes;
}

namespace {

uint64_t gCountedFiles = 0, gCountedBytes = 0;  // nftw's callbacks take no context

int CountEntry(const char*, const struct stat* st, int type, struct FTW*) {
  if (type == FTW_F) {
    ++gCountedFiles;
    gCountedBytes += static_cast<uint64_t>(st->st_size);
  }
  return 0;
}

int DropEntry(const char* path, const struct stat*, int type, struct FTW*) {
  if (type != FTW_F) return 0;
  const int fd = open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return 0;
  posix_fadvise(fd, 0, 0, POSIX_FADV_DONTNEED);
  close(fd);
  return 0;
}

}  // namespace

void CountTree(const std::string& dir, uint64_t& files, uint64_t& bytes) {
  gCountedFiles = gCountedBytes = 0;
  nftw(dir.c_str(), CountEntry, 16, FTW_PHYS);
  files = gCountedFiles;
  bytes = gCountedBytes;
}

void DropFromCache(const std::string& dir) { nftw(dir.c_str(), DropEntry, 16, FTW_PHYS); }

std::vector<char> RandomPool(size_t bytes) {
  std::vector<char> pool(bytes);
  uint64_t x = 0x9E3779B97F4A7C15ull;
  for (size_t i = 0; i + sizeof x <= bytes; i += sizeof x) {
    x ^= x << 13;
    x ^= x >> 7;
    x ^= x << 17;
    std::memcpy(pool.data() + i, &x, sizeof x);
  }
  return pool;
}

}  // namespace plovo_bench
