// What the benchmark programs share: the sandbox root they run under, the
// server's log mask, and a reporter that keeps the median of each benchmark
// so that main can print the ratio against its baseline.
#ifndef PLOVO_BENCH_BENCH_SUPPORT_H
#define PLOVO_BENCH_BENCH_SUPPORT_H

#include <benchmark/benchmark.h>

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace plovo_bench {

// The sandbox root of one benchmark run. When PLOVO_ROOT names a folder it
// is used as it is (the caller removes it); otherwise a fresh folder under
// /tmp is made, PLOVO_ROOT is set to it, and it is removed with everything
// in it when this object goes. Either way <root>/tmp exists afterwards, so
// that the daemon socket can be bound. Aborts the program when no root can
// be had: a benchmark must never fall back to the system's own paths.
class Sandbox {
 public:
  Sandbox();
  ~Sandbox();
  Sandbox(const Sandbox&) = delete;
  Sandbox& operator=(const Sandbox&) = delete;

  const std::string& Root() const { return root_; }

 private:
  std::string root_;
  bool owned_ = false;
};

// Masks out debug lines as the web server does, so that the per-value trace
// costs what it costs in production: nothing but the mask test.
void UseServerLogMask();

// Sends all n bytes on a blocking socket; false when the peer is gone.
bool SendAll(int fd, const char* data, size_t n);

// Prints "<program>: <what>: <errno text>" and exits with status 2.
[[noreturn]] void Die(const std::string& what);

// Writes all n bytes to a file; false on a write error.
bool WriteAll(int fd, const char* data, size_t n);

// The folder for a benchmark's large files: PLOVO_BENCH_DATA_DIR when set
// (scripts/bench puts it in memory when there is room), else
// <sandbox root>/<name>. Made when missing.
std::string DataDir(const Sandbox& sandbox, const std::string& name);

// Makes path a file of size pseudo-random bytes (so that no layer can
// profit from zero pages) unless a file of that size is there, flushes it,
// then reads it through once so that it sits in the page cache.
void PrepareRandomFile(const std::string& path, uint64_t size);

// count file sizes for a tree of exactly total bytes: between half and one
// and a half times the mean, pseudo-random but the same in every run, in
// pairs that sum to twice the mean; the last takes the rest. count even.
std::vector<size_t> MixedSizes(size_t count, uint64_t total);

// bytes (a multiple of 8) of pseudo-random bytes, the same in every run:
// the contents the tree benchmarks' files are cut from.
std::vector<char> RandomPool(size_t bytes);

// The count and bytes of the regular files below dir (links not followed).
void CountTree(const std::string& dir, uint64_t& files, uint64_t& bytes);

// Drops the regular files below dir from the page cache (their clean pages
// only: sync first), so that the next reader reads them from the disk.
void DropFromCache(const std::string& dir);

// Whether the two files hold the same bytes.
bool SameContent(const std::string& a, const std::string& b);

// Removes a folder and everything under it; a missing folder is no error.
void RemoveTree(const std::string& path);
// Makes path and its missing parents (mode 0755). Aborts on failure.
void MakeDirs(const std::string& path);

// Runs the registered benchmarks with the console output, then returns the
// reporter that saw them. argv may carry the usual --benchmark_* flags;
// repetitions are interleaved at random unless the caller says otherwise,
// so that slow drift of the machine falls on baseline and subject alike.
class SummaryReporter : public benchmark::ConsoleReporter {
 public:
  // Colours only on a terminal, so that a log of the run stays plain text.
  SummaryReporter();
  void ReportRuns(const std::vector<Run>& runs) override;

  // Median real time per iteration, in seconds, of the benchmark registered
  // under name; empty when it did not run or failed.
  std::optional<double> MedianSeconds(const std::string& name) const;

 private:
  std::map<std::string, double> seconds_;
};

void RunBenchmarks(int argc, char** argv, SummaryReporter& reporter);

// Registers fn under name, timed by the wall clock, run repetitions times and
// reported by its aggregates, the median among them, which the summaries
// compare. Returns the registration for further settings.
benchmark::internal::Benchmark* RegisterRepeated(const char* name, void (*fn)(benchmark::State&),
                                                 int repetitions, benchmark::TimeUnit unit);

// "met" or "MISSED", for the summary lines.
const char* Verdict(bool met);

}  // namespace plovo_bench

#endif
