// A 1 GiB file sent as a binary value, file to socket to file, through
// PStream and Channel, against a raw loop that moves the same 81920-byte
// blocks between the same files with read/send and recv/write.
//
// The files live in PLOVO_BENCH_DATA_DIR when it is set, else in
// <root>/transfer. The source is made once and read through before the
// benchmarks start, so that both sides read it from the page cache.
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <thread>

#include "bench-support.h"
#include "ipc/channel.h"
#include "ipc/pobject.h"
#include "ipc/stream.h"

namespace {

constexpr uint64_t kFileSize = uint64_t{1} << 30;
constexpr size_t kBlock = PStream::kBlockSize;

std::string gSource;
std::string gDestination;

[[noreturn]] void Die(const std::string& what) {
  std::fprintf(stderr, "transfer-bench: %s: %s\n", what.c_str(), std::strerror(errno));
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


// Makes the source (pseudo-random bytes, so that nothing along the way can
// profit from zero pages) unless a file of the right size is there, then
// reads it through once.
void PrepareSource() {
  struct stat st {};
  if (stat(gSource.c_str(), &st) != 0 || static_cast<uint64_t>(st.st_size) != kFileSize) {
    int fd = open(gSource.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) Die("create " + gSource);
    std::unique_ptr<uint64_t[]> chunk(new uint64_t[1 << 17]);  // 1 MiB
    uint64_t x = 0x9E3779B97F4A7C15ull;
    for (uint64_t done = 0; done < kFileSize; done += 8 << 17) {
      for (size_t i = 0; i < (1 << 17); ++i) {
        x ^= x << 13;
        x ^= x >> 7;
        x ^= x << 17;
        chunk[i] = x;
      }
      if (!WriteAll(fd, reinterpret_cast<const char*>(chunk.get()), 8 << 17)) Die("write " + gSource);
    }
    close(fd);
  }
  int fd = open(gSource.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) Die("open " + gSource);
  std::unique_ptr<char[]> buffer(new char[1 << 20]);
  while (read(fd, buffer.get(), 1 << 20) > 0) {
  }
  close(fd);
}

// Whether the destination holds exactly the source's bytes.
bool SameContent() {
  int a = open(gSource.c_str(), O_RDONLY | O_CLOEXEC);
  int b = open(gDestination.c_str(), O_RDONLY | O_CLOEXEC);
  bool same = a >= 0 && b >= 0;
  std::unique_ptr<char[]> x(new char[1 << 20]);
  std::unique_ptr<char[]> y(new char[1 << 20]);
  while (same) {
    ssize_t n = read(a, x.get(), 1 << 20);
    ssize_t m = read(b, y.get(), 1 << 20);
    if (n != m || n < 0) same = false;
    if (n <= 0) break;
    same = same && memcmp(x.get(), y.get(), static_cast<size_t>(n)) == 0;
  }
  if (a >= 0) close(a);
  if (b >= 0) close(b);
  return same;
}

void ReportTransfer(benchmark::State& state) {
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kFileSize));
  if (!SameContent()) state.SkipWithError("destination differs from source");
}

void BM_RawSocketLoop(benchmark::State& state) {
  for (auto _ : state) {
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) Die("socketpair");
    uint64_t received = 0;
    bool stored = true;
    std::thread receiver([&] {
      int out = open(gDestination.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
      std::unique_ptr<char[]> buffer(new char[kBlock]);
      stored = out >= 0;
      for (;;) {
        ssize_t n = recv(pair[1], buffer.get(), kBlock, 0);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        stored = stored && WriteAll(out, buffer.get(), static_cast<size_t>(n));
        received += static_cast<uint64_t>(n);
      }
      if (out >= 0) close(out);
    });
    int in = open(gSource.c_str(), O_RDONLY | O_CLOEXEC);
    std::unique_ptr<char[]> buffer(new char[kBlock]);
    for (;;) {
      ssize_t n = read(in, buffer.get(), kBlock);
      if (n <= 0) break;
      if (!plovo_bench::SendAll(pair[0], buffer.get(), static_cast<size_t>(n))) break;
    }
    if (in >= 0) close(in);
    shutdown(pair[0], SHUT_WR);
    receiver.join();
    close(pair[0]);
    close(pair[1]);
    if (!stored || received != kFileSize) {
      state.SkipWithError("raw loop moved fewer bytes than the file holds");
      return;
    }
  }
  ReportTransfer(state);
}

void BM_PStreamChannel(benchmark::State& state) {
  for (auto _ : state) {
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) Die("socketpair");
    int received = -1;
    uint64_t storedLength = 0;
    std::thread receiver([&] {
      Channel channel(kBlock);
      if (channel.Open(pair[1], true) != 0) {
        close(pair[1]);
        return;
      }
      PObject target;
      target.asBinary().path = gDestination;
      PStream stream;
      received = stream.Recv(channel, target);
      storedLength = target.asBinary().length;
    });
    Channel channel(kBlock);
    int sent = channel.Open(pair[0], true);
    if (sent == 0) {
      PObject value;
      PObject::binary_type& binary = value.asBinary();
      binary.offset = 0;
      binary.length = kFileSize;
      binary.path = gSource;
      PStream stream;
      sent = stream.Send(channel, value);
    } else {
      close(pair[0]);
    }
    // Closing before the join lets a receiver still waiting for bytes see
    // the end at once when the send failed half-way.
    channel.Close();
    receiver.join();
    if (sent != 0 || received != 0 || storedLength != kFileSize) {
      state.SkipWithError("PStream transfer failed");
      return;
    }
  }
  ReportTransfer(state);
}

void Register(const char* name, void (*fn)(benchmark::State&)) {
  benchmark::RegisterBenchmark(name, fn)
      ->Iterations(2)
      ->Repetitions(5)
      ->ReportAggregatesOnly(true)
      ->UseRealTime()
      ->Unit(benchmark::kMillisecond);
}

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  const char* dataDir = std::getenv("PLOVO_BENCH_DATA_DIR");
  std::string dir = dataDir != nullptr && dataDir[0] != '\0' ? dataDir : sandbox.Root() + "/transfer";
  plovo_bench::MakeDirs(dir);
  gSource = dir + "/source.bin";
  gDestination = dir + "/destination.bin";
  std::printf("transfer-bench: files in %s\n", dir.c_str());
  std::fflush(stdout);
  PrepareSource();

  Register("raw_socket_loop", BM_RawSocketLoop);
  Register("pstream_channel", BM_PStreamChannel);
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);

  auto raw = reporter.MedianSeconds("raw_socket_loop");
  auto subject = reporter.MedianSeconds("pstream_channel");
  if (!raw || !subject) {
    std::printf("summary transfer: incomplete, no ratio\n");
    return 1;
  }
  double rawRate = static_cast<double>(kFileSize) / *raw;
  double subjectRate = static_cast<double>(kFileSize) / *subject;
  double ratio = subjectRate / rawRate;
  std::printf("summary transfer: pstream_channel %.0f MiB/s (%.4g B/s), raw_socket_loop %.0f MiB/s (%.4g B/s), "
              "ratio %.3f (target >= 0.80: %s)\n",
              subjectRate / (1 << 20), subjectRate, rawRate / (1 << 20), rawRate, ratio,
              plovo_bench::Verdict(ratio >= 0.8));
  std::remove(gDestination.c_str());
  return 0;
}
