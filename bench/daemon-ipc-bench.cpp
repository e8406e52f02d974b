// One small command and its small answer over a fresh connection to the
// daemon socket: DaemonIPC::SendCommand against a listener thread built from
// IPCListener and IPCSender, and the same bytes sent by a raw connect, send,
// receive, close loop to a raw accept, receive, send, close thread.
#include <cstdio>
#include <string>

#include "bench-daemon.h"
#include "bench-support.h"
#include "common/paths.h"
#include "ipc/daemon-ipc.h"
#include "ipc/pobject.h"

namespace {

// The wire bytes of {"action": "run_task", "task_id": 7} and {"ack": "ok"},
// so that the raw loop moves what DaemonIPC moves.
const std::string kRequestBytes = plovo_bench::WireBytes(
    "\x42"
    "\x10\x00\x06" "action" "\x10\x00\x08" "run_task"
    "\x10\x00\x07" "task_id" "\x01\x01\x07"
    "\x40");
const std::string kReplyBytes = plovo_bench::WireBytes(
    "\x42"
    "\x10\x00\x03" "ack" "\x10\x00\x02" "ok"
    "\x40");

PObject Request() {
  PObject request;
  request["action"] = "run_task";
  request["task_id"] = 7;
  return request;
}

void BM_DaemonIPC(benchmark::State& state) {
  plovo_bench::ListenerServer server(Request(), plovo_bench::AckReply());
  if (!server.Start()) {
    state.SkipWithError("cannot listen on the daemon socket");
    return;
  }
  const PObject request = Request();
  for (auto _ : state) {
    DaemonIPC ipc;
    PObject response;
    if (ipc.SendCommand(request, response) != 0) {
      state.SkipWithError("SendCommand failed");
      break;
    }
  }
}

void BM_RawRoundTrip(benchmark::State& state) {
  plovo_bench::RawServer server(kRequestBytes, kReplyBytes);
  if (!server.Start()) {
    state.SkipWithError("cannot listen on the daemon socket");
    return;
  }
  const std::string path = Plovo::Path::DaemonSocket();
  for (auto _ : state) {
    if (!plovo_bench::RawRoundTrip(path, kRequestBytes, kReplyBytes)) {
      state.SkipWithError("raw round trip failed");
      break;
    }
  }
}

void Register(const char* name, void (*fn)(benchmark::State&)) {
  plovo_bench::RegisterRepeated(name, fn, 9, benchmark::kMicrosecond);
}

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  Register("raw_round_trip", BM_RawRoundTrip);
  Register("daemon_ipc_send_command", BM_DaemonIPC);
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);

  auto raw = reporter.MedianSeconds("raw_round_trip");
  auto subject = reporter.MedianSeconds("daemon_ipc_send_command");
  if (!raw || !subject) {
    std::printf("summary daemon-ipc: incomplete, no ratio\n");
    return 1;
  }
  double ratio = *subject / *raw;
  std::printf("summary daemon-ipc: SendCommand median %.1f us, raw round trip median %.1f us, ratio %.2f "
              "(target <= 1.5: %s)\n",
              *subject * 1e6, *raw * 1e6, ratio, plovo_bench::Verdict(ratio <= 1.5));
  return 0;
}
