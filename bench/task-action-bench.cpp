// Two task actions of the web API through Process, the way the web server
// calls it, with a daemon thread on the sandbox's daemon socket.
//
// "run": the readiness gate, the run_task command, its exchange with a
// listener thread that answers {"ack": "ok"}, and the response; against the
// raw connect, send, receive, close round trip of the same bytes on the
// same socket path.
//
// "list": the daemon answers 100 task maps. Besides the whole request, its
// parts are measured alone: the gate, the exchange (the list command sent
// with DaemonIPC and the answer decoded), the JSON records built from an
// answer already received, and the records handed to the response (which
// copies them). The summary gives each as a share of the whole; what is
// left is the dispatch, the command and what the parts cost each other
// when they run one after the other.
#include <fcntl.h>
#include <unistd.h>

#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <velt/webapi.h>

#include "bench-daemon.h"
#include "bench-support.h"
#include "common/paths.h"
#include "ipc/daemon-ipc.h"
#include "ipc/plovo-command.h"
#include "ipc/pobject.h"
#include "webapi/plovo.h"

namespace {

constexpr uint64_t kTaskId = 7;
constexpr size_t kTasks = 100;
// A small web server's idle workers, for the gate run as the server runs it.
constexpr int kWaitingThreads = 4;
constexpr unsigned kNobody = 65534;  // user and group

// The wire bytes of {"action": "run_task", "need_ack": 1, "task_id": 7} and
// {"ack": "ok"}. main checks that they are what the library sends and
// answers before anything is measured.
const std::string kRunBytes = plovo_bench::WireBytes(
    "\x42"
    "\x10\x00\x06" "action" "\x10\x00\x08" "run_task"
    "\x10\x00\x08" "need_ack" "\x01\x01\x01"
    "\x10\x00\x07" "task_id" "\x01\x01\x07"
    "\x40");
const std::string kAckBytes = plovo_bench::WireBytes(
    "\x42"
    "\x10\x00\x03" "ack" "\x10\x00\x02" "ok"
    "\x40");

PObject RunCommand() {
  PObject command;
  command["action"] = "run_task";
  command["need_ack"] = 1;
  command["task_id"] = kTaskId;
  return command;
}

PObject ListCommand() {
  PObject command;
  command["action"] = "list_task";
  command["need_ack"] = 1;
  return command;
}

std::string TaskName(size_t n) { return "Camera card " + std::to_string(n) + " to photo library"; }

// One task as the daemon lists it: every key the web record reads, with
// the three task types, mounted and unmounted devices, the two default
// tasks first, and no schedule.
PObject TaskMap(size_t n) {
  const uint64_t type = 1 + n % 3;  // import_general, export_general, import_photo
  PObject task;
  task["id"] = static_cast<uint64_t>(n + 1);
  task["type"] = type;
  task["uuid"] = n == 0   ? std::string("PLOVO_DEFAULT_USB_UUID")
                 : n == 1 ? std::string("PLOVO_DEFAULT_SD_UUID")
                          : "6f1c2a9e-40b7-4d1a-9c55-" + std::to_string(100000000000 + n);
  task["is_default_task"] = n < 2;
  task["task_name"] = TaskName(n);
  task["task_status"] = n % 10 == 0 ? "running" : "idle";
  task["copy_file_path"] = n % 10 == 0 ? "/DCIM/100MEDIA/IMG_" + std::to_string(4000 + n) + ".JPG" : "";
  task["is_usb_mounted"] = n % 4 != 3;
  task["is_nas_mounted"] = true;
  task["is_task_runnable"] = n % 4 != 3;
  task["latest_finish_time"] = static_cast<uint64_t>(1790000000 + n * 3600);
  task["error_code"] = uint64_t{0};
  task["usb_share_name"] = "usbshare" + std::to_string(1 + n % 2);
  const std::string device = n < 2 ? "/" : "/DCIM/" + std::to_string(100 + n % 7) + "MEDIA";
  const std::string nas = "/photo/imports/" + std::to_string(2026) + "/card-" + std::to_string(n);
  task["source_path"] = type == 2 ? nas : device;
  task["destination_path"] = type == 2 ? device : nas;
  task["run_when_plug_in"] = n % 2 == 0;
  task["eject_when_task_done"] = true;
  task["copy_strategy"] = static_cast<uint64_t>(1 + n % 3);
  task["keep_dir_structure"] = n % 3 != 0;
  task["smart_create_date_dir"] = type == 3;
  task["rename_photo_video"] = type == 3 && n % 2 == 1;
  task["remove_src_file"] = false;
  task["conflict_policy"] = static_cast<uint64_t>(1 + n % 2);
  task["enable_rotation"] = n % 3 == 0;
  task["max_version_count"] = uint64_t{256};
  task["rotation_policy"] = static_cast<uint64_t>(1 + n % 2);
  task["schedule_id"] = static_cast<uint64_t>(-1);
  return task;
}

const PObject& ListReply() {
  static const PObject reply = [] {
    PObject r = plovo_bench::AckReply();
    PObject::array_type& tasks = r["task_list"].asArray();
    for (size_t n = 0; n < kTasks; ++n) tasks.push_back(TaskMap(n));
    return r;
  }();
  return reply;
}

VELT::APIRequest Request(const char* method) {
  Json::Value params(Json::objectValue);
  if (std::string(method) == "run") params["id"] = Json::UInt64(kTaskId);
  return VELT::APIRequest("VELT.Plovo", 1, method, params);
}

// Whether a "list" answer holds the 100 records, the last one by name.
bool ListAnswered(const VELT::APIResponse& response) {
  if (!response.IsSuccess()) return false;
  const Json::Value& tasks = response.GetData()["tasks"];
  return tasks.size() == kTasks && tasks[static_cast<Json::ArrayIndex>(kTasks - 1)]["name"].asString() ==
                                       TaskName(kTasks - 1);
}

void BM_RawRoundTrip(benchmark::State& state) {
  plovo_bench::RawServer server(kRunBytes, kAckBytes);
  if (!server.Start()) {
    state.SkipWithError("cannot listen on the daemon socket");
    return;
  }
  const std::string path = Plovo::Path::DaemonSocket();
  for (auto _ : state) {
    if (!plovo_bench::RawRoundTrip(path, kRunBytes, kAckBytes)) {
      state.SkipWithError("raw round trip failed");
      break;
    }
  }
}

void BM_ProcessRun(benchmark::State& state) {
  plovo_bench::ListenerServer server(RunCommand(), plovo_bench::AckReply());
  if (!server.Start()) {
    state.SkipWithError("cannot listen on the daemon socket");
    return;
  }
  VELT::APIRequest request = Request("run");
  for (auto _ : state) {
    VELT::APIResponse response;
    ::Process(&request, &response);
    if (!response.IsSuccess()) {
      state.SkipWithError("run was not answered with success");
      break;
    }
  }
}

void BM_ProcessList(benchmark::State& state) {
  plovo_bench::ListenerServer server(ListCommand(), ListReply());
  if (!server.Start()) {
    state.SkipWithError("cannot listen on the daemon socket");
    return;
  }
  VELT::APIRequest request = Request("list");
  for (auto _ : state) {
    VELT::APIResponse response;
    ::Process(&request, &response);
    if (!ListAnswered(response)) {
      state.SkipWithError("list was not answered with the 100 records");
      break;
    }
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_ListGate(benchmark::State& state) {
  VELT::APIRequest request = Request("list");
  VELT::APIResponse response;
  PlovoHandle handle(&request, &response);
  for (auto _ : state) {
    if (!handle.IsPlovoReady()) {
      state.SkipWithError("the readiness gate refused the request");
      break;
    }
  }
}

// Threads that wait for work, as a web server's idle workers do, until the
// object goes.
class WaitingThreads {
 public:
  explicit WaitingThreads(int n) {
    for (int i = 0; i < n; ++i) {
      threads_.emplace_back([this] {
        std::unique_lock<std::mutex> lock(mutex_);
        wake_.wait(lock, [this] { return stop_; });
      });
    }
  }
  ~WaitingThreads() {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      stop_ = true;
    }
    wake_.notify_all();
    for (std::thread& t : threads_) t.join();
  }

 private:
  std::mutex mutex_;
  std::condition_variable wake_;
  bool stop_ = false;
  std::vector<std::thread> threads_;
};

// The gate as the web server runs it: the process's effective ids are not
// root, so the gate's guard raises them and puts them back on every
// request, while the server's other threads wait for work. The C library
// changes the ids of every thread of the process, so each change
// interrupts each waiting thread. The ids are dropped to nobody's for the
// loop and raised again afterwards, which only a process whose real id is
// root can do.
void BM_ListGateUnprivileged(benchmark::State& state) {
  if (getuid() != 0) {
    state.SkipWithError("needs a real user id of root to drop and raise the effective ids");
    return;
  }
  WaitingThreads workers(kWaitingThreads);
  VELT::APIRequest request = Request("list");
  VELT::APIResponse response;
  PlovoHandle handle(&request, &response);
  if (setresgid(-1, kNobody, -1) != 0 || setresuid(-1, kNobody, -1) != 0) {
    plovo_bench::Die("drop the effective ids");
  }
  for (auto _ : state) {
    if (!handle.IsPlovoReady()) {
      state.SkipWithError("the readiness gate refused the request");
      break;
    }
  }
  if (setresuid(-1, 0, -1) != 0 || setresgid(-1, 0, -1) != 0) plovo_bench::Die("raise the effective ids again");
}

void BM_ListExchange(benchmark::State& state) {
  plovo_bench::ListenerServer server(ListCommand(), ListReply());
  if (!server.Start()) {
    state.SkipWithError("cannot listen on the daemon socket");
    return;
  }
  PObject command;
  Plovo::ListTaskCmd(command);
  for (auto _ : state) {
    DaemonIPC daemon;
    PObject reply;
    if (daemon.SendCommand(command, reply) != 0 || reply["task_list"].asArray().size() != kTasks) {
      state.SkipWithError("list_task exchange failed");
      break;
    }
  }
}

// The daemon's list answer as DaemonIPC received it; null when the
// exchange failed.
PObject ReceivedListReply() {
  plovo_bench::ListenerServer server(ListCommand(), ListReply());
  PObject command;
  Plovo::ListTaskCmd(command);
  DaemonIPC daemon;
  PObject reply;
  if (!server.Start() || daemon.SendCommand(command, reply) != 0) reply.clear();
  return reply;
}

// List's answer data: {"tasks": [one record per task]}.
Json::Value ListData(PlovoHandle& handle, const PObject& reply) {
  Json::Value data(Json::objectValue);
  Json::Value& records = data["tasks"] = Json::Value(Json::arrayValue);
  for (const PObject& task : reply["task_list"].asArray()) {
    Json::Value record(Json::objectValue);
    handle.setJsonTask(task, record);
    records.append(std::move(record));
  }
  return data;
}

// The records as List builds them from a received answer: one object per
// task, appended to the answer's array.
void BM_ListJson(benchmark::State& state) {
  const PObject reply = ReceivedListReply();
  VELT::APIRequest request = Request("list");
  VELT::APIResponse response;
  PlovoHandle handle(&request, &response);
  for (auto _ : state) {
    Json::Value data = ListData(handle, reply);
    if (data["tasks"].size() != kTasks) {
      state.SkipWithError("records missing");
      break;
    }
  }
}

// The records handed to the response, which copies them, and released
// with it, as the web server does after the request.
void BM_ListAnswer(benchmark::State& state) {
  const PObject reply = ReceivedListReply();
  VELT::APIRequest request = Request("list");
  VELT::APIResponse unused;
  PlovoHandle handle(&request, &unused);
  const Json::Value data = ListData(handle, reply);
  for (auto _ : state) {
    VELT::APIResponse response;
    response.SetSuccess(data);
    if (!ListAnswered(response)) {
      state.SkipWithError("records missing");
      break;
    }
  }
}

void Register(const char* name, void (*fn)(benchmark::State&)) {
  plovo_bench::RegisterRepeated(name, fn, 9, benchmark::kMicrosecond);
}

// The service state that lets every method through the gate.
void WriteRunningStatus() {
  const std::string file = Plovo::Path::StatusFile();
  plovo_bench::MakeDirs(file.substr(0, file.rfind('/')));
  const std::string content = "state=\"4\"\nerror=\"\"\n";
  int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0 || !plovo_bench::WriteAll(fd, content.data(), content.size()) || close(fd) != 0) {
    plovo_bench::Die("write " + file);
  }
}

bool GateLetsThrough() {
  VELT::APIRequest request = Request("list");
  VELT::APIResponse response;
  PlovoHandle handle(&request, &response);
  return handle.IsPlovoReady();
}

// The raw loop must move the bytes Process moves: "run" through Process
// must be accepted by the raw server, which compares the request byte for
// byte, and the library's listener must take the raw request and give back
// the raw answer.
bool RawBytesMatchTheLibrary() {
  {
    plovo_bench::RawServer server(kRunBytes, kAckBytes);
    if (!server.Start()) return false;
    VELT::APIRequest request = Request("run");
    VELT::APIResponse response;
    ::Process(&request, &response);
    if (!response.IsSuccess()) return false;
  }
  plovo_bench::ListenerServer server(RunCommand(), plovo_bench::AckReply());
  return server.Start() && plovo_bench::RawRoundTrip(Plovo::Path::DaemonSocket(), kRunBytes, kAckBytes);
}

double Share(double part, double whole) { return 100.0 * part / whole; }

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  WriteRunningStatus();
  if (!GateLetsThrough()) {
    std::fprintf(stderr, "task-action-bench: the readiness gate refuses requests; it raises to root to read the "
                         "service status, so run the program as root\n");
    return 2;
  }
  if (!RawBytesMatchTheLibrary()) {
    std::fprintf(stderr, "task-action-bench: the raw bytes are not what the library sends and answers\n");
    return 2;
  }
  Register("raw_round_trip", BM_RawRoundTrip);
  Register("process_run", BM_ProcessRun);
  Register("process_list", BM_ProcessList);
  Register("list_gate", BM_ListGate);
  Register("list_gate_unprivileged", BM_ListGateUnprivileged);
  Register("list_exchange", BM_ListExchange);
  Register("list_json", BM_ListJson);
  Register("list_answer", BM_ListAnswer);
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);

  int status = 0;
  auto raw = reporter.MedianSeconds("raw_round_trip");
  auto run = reporter.MedianSeconds("process_run");
  if (raw && run) {
    double ratio = *run / *raw;
    std::printf("summary task-action run: Process median %.1f us, raw round trip median %.1f us, ratio %.2f "
                "(target <= 2: %s)\n",
                *run * 1e6, *raw * 1e6, ratio, plovo_bench::Verdict(ratio <= 2.0));
  } else {
    std::printf("summary task-action run: incomplete, no ratio\n");
    status = 1;
  }

  auto list = reporter.MedianSeconds("process_list");
  auto gate = reporter.MedianSeconds("list_gate");
  auto exchange = reporter.MedianSeconds("list_exchange");
  auto json = reporter.MedianSeconds("list_json");
  auto answer = reporter.MedianSeconds("list_answer");
  if (list && gate && exchange && json && answer) {
    const double whole = *list;
    const double rest = whole - *gate - *exchange - *json - *answer;
    std::printf("summary task-action list: %.0f requests/s through Process (median %.1f us); gate %.1f us (%.1f %%), "
                "exchange %.1f us (%.1f %%), JSON records %.1f us (%.1f %%), answer copy %.1f us (%.1f %%), "
                "rest %.1f us (%.1f %%)\n",
                1.0 / whole, whole * 1e6, *gate * 1e6, Share(*gate, whole), *exchange * 1e6, Share(*exchange, whole),
                *json * 1e6, Share(*json, whole), *answer * 1e6, Share(*answer, whole), rest * 1e6,
                Share(rest, whole));
  } else {
    std::printf("summary task-action list: incomplete, no breakdown\n");
    status = 1;
  }
  auto unprivileged = reporter.MedianSeconds("list_gate_unprivileged");
  if (gate && unprivileged) {
    std::printf("summary task-action gate: %.1f us as root, %.1f us with unprivileged effective ids and %d waiting "
                "threads (%.1f times)\n",
                *gate * 1e6, *unprivileged * 1e6, kWaitingThreads, *unprivileged / *gate);
  } else {
    std::printf("summary task-action gate: unprivileged figure not measured\n");
  }
  return status;
}
