// The service control's two slow operations, each against a baseline in the
// same run.
//
// Stop (`stop_service`): StopService with a daemon (plovod) that exits
// on the stop command. Each iteration starts the service untimed
// (StartService, which starts the daemon) and times the stop. Baseline
// (`stop_raw`): the same stop command through DaemonIPC, then a probe of
// the process every millisecond until it is gone: what the daemon itself
// takes to go.
//
// Move (`move`): move_repo_volume then RetireRepo, as a change of volume
// runs them, on a 1 GiB repository of 10000 files between two internal
// volumes on the same disk, timed until the old tree (the source's
// @tmp/@Plovo, deleted in the background after RetireRepo returns) has
// disappeared; the time of the two calls is kept apart. Baseline
// (`cp_rm`): `cp -r SRC DST && rm -r SRC` of the same tree, run by the
// shell. Both move the one tree to the other volume and back (two
// iterations per repetition), so each starts where the other left it.
// Before every timed move the machine's dirty pages are written out and
// the source's pages are dropped from the page cache (posix_fadvise on its
// own files; nothing machine-wide), so every move reads its source from the
// disk and none pays for the previous one's write-back.
#include <fcntl.h>
#include <ftw.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "bench-support.h"
#include "common/paths.h"
#include "ipc/daemon-ipc.h"
#include "ipc/pobject.h"
#include "service/repo-volume.h"
#include "service/service-ctrl.h"

namespace {

constexpr int kDirs = 100;
constexpr int kFilesPerDir = 100;
constexpr uint64_t kTreeBytes = uint64_t{1} << 30;
constexpr size_t kPoolBytes = size_t{256} << 10;  // larger than the largest file

std::string gRoot;
std::string gVolume[2];  // the two volumes the tree moves between
int gAt = 0;             // the one that holds it now
std::vector<char> gPool;
std::vector<double> gCallSeconds;  // the move's two calls, one mean per repetition

double Now() { return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count(); }

bool Exists(const std::string& path) {
  struct stat st {};
  return lstat(path.c_str(), &st) == 0;
}

void WriteText(const std::string& path, const std::string& text) {
  std::ofstream out(path);
  if (!(out << text) || !out.flush()) plovo_bench::Die("write " + path);
}

// The platform's view: three internal volumes, the package enabled, its
// daemon program the development daemon, and the service's repository
// recorded on a volume of its own, whatever an earlier program left in a
// shared root, so that it never settles on the tree the moves carry about.
void MakeSandbox() {
  for (const char* dir : {"/velt-dev", "/svc", "/vol-a", "/vol-b", "/var/packages/Plovo/etc",
                          "/var/packages/Plovo/target/sbin", "/var/run", "/etc.defaults"}) {
    plovo_bench::MakeDirs(gRoot + dir);
  }
  WriteText(gRoot + "/velt-dev/volumes.json",
            "{\"volumes\": [{\"path\": \"svc\", \"location\": \"internal\"},"
            " {\"path\": \"vol-a\", \"location\": \"internal\"},"
            " {\"path\": \"vol-b\", \"location\": \"internal\"}]}\n");
  WriteText(gRoot + "/var/packages/Plovo/enabled", "");
  WriteText(gRoot + "/etc.defaults/veltinfo.conf", "plovo=\"yes\"\n");
  if (!SetRepoVolumePath(gRoot + "/svc")) plovo_bench::Die("record the service's volume");
  const std::string daemon = Plovo::Path::DaemonProgram();
  unlink(daemon.c_str());
  if (symlink(PLOVOD_PATH, daemon.c_str()) != 0) plovo_bench::Die("symlink " + daemon);
}

// ---- Stop ----------------------------------------------------------------

// Whether the process has ended; one that has exited but is not yet
// collected by its parent counts as ended.
bool Gone(int pid) {
  if (kill(pid, 0) != 0) return errno == ESRCH;
  std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
  std::string line;
  if (!std::getline(stat, line)) return true;
  const size_t close = line.rfind(") ");
  return close != std::string::npos && close + 2 < line.size() &&
         (line[close + 2] == 'Z' || line[close + 2] == 'X');
}

int DaemonPid() {
  std::ifstream in(Plovo::Path::DaemonPidFile());
  int pid = 0;
  return in >> pid && pid > 0 ? pid : -1;
}

// Starts the service; the daemon's pid once it serves (state 4), else -1
// after stopping whatever started.
int Start() {
  ServiceStatus status;
  const int pid = StartService() == 0 ? DaemonPid() : -1;
  if (pid > 0 && GetServiceStatus(status) == 0 && status.state == PLOVO_SERVICE_STATUS_RUNNING && !Gone(pid)) {
    return pid;
  }
  if (StatusService() == 0) StopService();
  return -1;
}

void BM_StopService(benchmark::State& state) {
  for (auto _ : state) {
    state.PauseTiming();
    const int pid = Start();
    if (pid < 0) return state.SkipWithError("the service did not start");
    state.ResumeTiming();
    const int stopped = StopService();
    state.PauseTiming();
    // The daemon removes its pid file on its way out: a daemon that had to
    // be killed leaves it behind.
    ServiceStatus status;
    const bool clean = stopped == 0 && Gone(pid) && !Exists(Plovo::Path::DaemonPidFile()) &&
                       GetServiceStatus(status) == 0 && status.state == PLOVO_SERVICE_STATUS_STOP;
    if (!clean) {
      if (!Gone(pid)) kill(pid, SIGKILL);
      return state.SkipWithError("StopService failed, the daemon had to be killed, or the state is not 6");
    }
    state.ResumeTiming();
  }
}

void BM_StopRaw(benchmark::State& state) {
  PObject command;
  command["action"] = "stop";
  command["need_ack"] = 0;
  for (auto _ : state) {
    state.PauseTiming();
    const int pid = Start();
    if (pid < 0) return state.SkipWithError("the service did not start");
    state.ResumeTiming();
    PObject reply;
    const bool sent = DaemonIPC().SendCommand(command, reply) == 0;
    const double deadline = Now() + 10;
    while (sent && !Gone(pid) && Now() < deadline) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    if (!Gone(pid)) {
      kill(pid, SIGKILL);
      return state.SkipWithError("the daemon did not obey the stop command");
    }
  }
}

// ---- Move ----------------------------------------------------------------

std::string TreeFile(const std::string& repo, int dir, int file) {
  return repo + "/task/" + std::to_string(dir + 1) + "/" + std::to_string(file) + ".bin";
}


// Where in the pool a file's bytes start.
size_t PoolOffset(size_t index, size_t size) { return index * 7919 % (kPoolBytes - size); }

void WriteTree(const std::string& repo) {
  plovo_bench::MakeDirs(repo + "/db");
  const std::vector<size_t> sizes = plovo_bench::MixedSizes(kDirs * kFilesPerDir, kTreeBytes);
  for (int d = 0; d < kDirs; ++d) {
    plovo_bench::MakeDirs(repo + "/task/" + std::to_string(d + 1));
    for (int f = 0; f < kFilesPerDir; ++f) {
      const size_t i = static_cast<size_t>(d * kFilesPerDir + f);
      const std::string path = TreeFile(repo, d, f);
      const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
      if (fd < 0 || !plovo_bench::WriteAll(fd, gPool.data() + PoolOffset(i, sizes[i]), sizes[i]) || close(fd) != 0) {
        plovo_bench::Die("write " + path);
      }
    }
  }
}

// "" when the tree at repo holds every file with its bytes.
std::string CheckContent(const std::string& repo) {
  const std::vector<size_t> sizes = plovo_bench::MixedSizes(kDirs * kFilesPerDir, kTreeBytes);
  std::vector<char> buffer(kPoolBytes);
  for (int d = 0; d < kDirs; ++d) {
    for (int f = 0; f < kFilesPerDir; ++f) {
      const size_t i = static_cast<size_t>(d * kFilesPerDir + f);
      const std::string path = TreeFile(repo, d, f);
      std::ifstream in(path, std::ios::binary);
      in.read(buffer.data(), static_cast<std::streamsize>(buffer.size()));
      if (static_cast<size_t>(in.gcount()) != sizes[i] ||
          std::memcmp(buffer.data(), gPool.data() + PoolOffset(i, sizes[i]), sizes[i]) != 0) {
        return path + " differs";
      }
    }
  }
  return "";
}

// Untimed, before every move: the previous move's copy goes to the disk,
// and the source's pages leave the page cache (clean pages only, hence the
// sync first).
void Settle() {
  sync();
  plovo_bench::DropFromCache(gVolume[gAt] + "/@Plovo");
}

// "" when the whole tree is on the volume gAt names and nothing of it is
// left on the other one (neither the repository nor its staging copy).
std::string CheckPlace() {
  uint64_t files = 0, bytes = 0;
  plovo_bench::CountTree(gVolume[gAt] + "/@Plovo", files, bytes);
  if (files != kDirs * kFilesPerDir || bytes != kTreeBytes) return "the tree is not whole after the move";
  const std::string& other = gVolume[1 - gAt];
  if (Exists(other + "/@Plovo") || Exists(other + "/@tmp/@Plovo")) return "the old tree is still there";
  return "";
}

void BM_Move(benchmark::State& state) {
  double call = 0;
  for (auto _ : state) {
    state.PauseTiming();
    Settle();
    const std::string from = gVolume[gAt], to = gVolume[1 - gAt], old = from + "/@tmp/@Plovo";
    state.ResumeTiming();
    // What a change of volume does between the stop and the start, less
    // recording the new volume: the copy put in place, then the old tree
    // moved aside and deleted in the background.
    const double start = Now();
    if (!move_repo_volume(from, to)) return state.SkipWithError("move_repo_volume failed");
    RetireRepo(from);
    call += Now() - start;
    // The old tree is removed by a process of its own; its end shows only
    // as the folder's disappearance. A minute is many times what it takes.
    const double deadline = Now() + 60;
    while (Exists(old) && Now() < deadline) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    if (Exists(old)) return state.SkipWithError("the old tree is still there a minute after the move");
    gAt = 1 - gAt;
  }
  gCallSeconds.push_back(call / static_cast<double>(state.iterations()));
  const std::string fault = CheckPlace();
  if (!fault.empty()) state.SkipWithError(fault.c_str());
}

void BM_CpRm(benchmark::State& state) {
  for (auto _ : state) {
    state.PauseTiming();
    Settle();
    const std::string src = gVolume[gAt] + "/@Plovo", dst = gVolume[1 - gAt] + "/@Plovo";
    const std::string command = "/bin/cp -r '" + src + "' '" + dst + "' && /bin/rm -r '" + src + "'";
    state.ResumeTiming();
    if (std::system(command.c_str()) != 0) return state.SkipWithError("cp or rm failed");
    gAt = 1 - gAt;
  }
  const std::string fault = CheckPlace();
  if (!fault.empty()) state.SkipWithError(fault.c_str());
}

double Median(std::vector<double> values) {
  std::sort(values.begin(), values.end());
  const size_t n = values.size();
  return n % 2 ? values[n / 2] : (values[n / 2 - 1] + values[n / 2]) / 2;
}

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  gRoot = sandbox.Root();
  while (gRoot.size() > 1 && gRoot.back() == '/') gRoot.pop_back();  // volume paths are compared whole
  gVolume[0] = gRoot + "/vol-a";
  gVolume[1] = gRoot + "/vol-b";

  // The tree, a copy of it while a move runs, and room to spare.
  struct statvfs fs {};
  if (statvfs(gRoot.c_str(), &fs) != 0) plovo_bench::Die("statvfs " + gRoot);
  const uint64_t freeBytes = static_cast<uint64_t>(fs.f_bavail) * fs.f_frsize;
  if (freeBytes < 3 * kTreeBytes) {
    std::fprintf(stderr, "service-bench: %.1f GiB free under %s, 3 GiB needed\n",
                 static_cast<double>(freeBytes) / kTreeBytes, gRoot.c_str());
    return 2;
  }
  MakeSandbox();

  gPool = plovo_bench::RandomPool(kPoolBytes);
  const double start = Now();
  WriteTree(gVolume[0] + "/@Plovo");
  sync();
  std::printf("tree: %d folders of %d files, %llu bytes, written in %.1f s; %.0f GiB free under %s\n", kDirs,
              kFilesPerDir, static_cast<unsigned long long>(kTreeBytes), Now() - start,
              static_cast<double>(freeBytes) / kTreeBytes, gRoot.c_str());
  std::fflush(stdout);

  plovo_bench::RegisterRepeated("stop_service", BM_StopService, 5, benchmark::kMillisecond)->Iterations(4);
  plovo_bench::RegisterRepeated("stop_raw", BM_StopRaw, 5, benchmark::kMillisecond)->Iterations(4);
  // Two iterations a repetition: there and back.
  plovo_bench::RegisterRepeated("move", BM_Move, 5, benchmark::kSecond)->Iterations(2);
  plovo_bench::RegisterRepeated("cp_rm", BM_CpRm, 5, benchmark::kSecond)->Iterations(2);
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);

  int status = 0;
  if (StatusService() == 0) StopService();  // never leave a daemon behind
  const std::string fault = CheckContent(gVolume[gAt] + "/@Plovo");
  if (!fault.empty()) {
    std::printf("service-bench: after the moves %s\n", fault.c_str());
    status = 1;
  }
  plovo_bench::RemoveTree(gVolume[0]);
  plovo_bench::RemoveTree(gVolume[1]);

  auto stop = reporter.MedianSeconds("stop_service");
  auto stopRaw = reporter.MedianSeconds("stop_raw");
  if (stop && stopRaw) {
    std::printf("summary service stop: StopService median %.1f ms, stop command and 1 ms probe median %.1f ms, "
                "ratio %.1f\n", *stop * 1e3, *stopRaw * 1e3, *stop / *stopRaw);
  } else {
    std::printf("summary service stop: incomplete, no ratio\n");
    status = 1;
  }
  auto move = reporter.MedianSeconds("move");
  auto cpRm = reporter.MedianSeconds("cp_rm");
  if (move && cpRm && !gCallSeconds.empty()) {
    const double call = Median(gCallSeconds);
    std::printf("summary repo move: until the old tree is gone median %.2f s (the calls return at %.2f s); cp -r && "
                "rm -r median %.2f s; ratio %.3f (calls %.3f) (target <= 1.10 until gone: %s)\n",
                *move, call, *cpRm, *move / *cpRm, call / *cpRm, plovo_bench::Verdict(*move / *cpRm <= 1.1));
  } else {
    std::printf("summary repo move: incomplete, no ratio\n");
    status = 1;
  }
  return status;
}
