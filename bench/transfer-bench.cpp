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


void ReportTransfer(benchmark::State& state) {
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kFileSize));
  if (!plovo_bench::SameContent(gSource, gDestination)) state.SkipWithError("destination differs from source");
}

void BM_RawSocketLoop(benchmark::State& state) {
  for (auto _ : state) {
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) plovo_bench::Die("socketpair");
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
        stored = stored && plovo_bench::WriteAll(out, buffer.get(), static_cast<size_t>(n));
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
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) plovo_bench::Die("socketpair");
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
  plovo_bench::RegisterRepeated(name, fn, 5, benchmark::kMillisecond)->Iterations(2);
}

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  const std::string dir = plovo_bench::DataDir(sandbox, "transfer");
  gSource = dir + "/source.bin";
  gDestination = dir + "/destination.bin";
  std::printf("transfer-bench: files in %s\n", dir.c_str());
  std::fflush(stdout);
  plovo_bench::PrepareRandomFile(gSource, kFileSize);

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
