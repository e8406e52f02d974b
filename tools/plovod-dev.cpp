// plovod-dev: a development stand-in for the copy daemon.
//
//   plovod-dev
//
// Listens on the daemon socket ($PLOVO_ROOT/tmp/plovo-socket in a sandbox)
// and answers the task commands the web-API module sends, so that plovo-api
// can list, create, edit, run and delete tasks on a machine without the
// real daemon. It is not the real daemon: no file is ever copied, "running"
// is only a status, and tasks live in memory, so every start begins with
// none. Every task reports schedule_id -1: schedules are not kept yet.
//
// One connection carries one command; they are served one at a time in one
// thread. Each request gives one line on stderr ("list_task -> ok",
// "run_task 3 -> error 3"). SIGINT, SIGTERM or a "stop" request (which gets
// no answer) end it; the socket file is removed on the way out.
//
// The "error_code" of a failed command:
//   1  unknown action
//   3  conflict: the task name is taken, or the task is already running
//   4  no such task
//   8  cancel of a task that is not running (the module counts it a success)
#include <signal.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <map>
#include <string>

#include "common/log.h"
#include "common/paths.h"
#include "ipc/simple-ipc.h"

namespace {

constexpr int kErrUnknownAction = 1;
constexpr int kErrConflict = 3;
constexpr int kErrNoSuchTask = 4;
constexpr int kErrNotRunning = 8;

// Schedules are not kept yet (they come with the task scheduler), so every
// task has none. PObject has no signed kind: -1 travels as its 64-bit two's
// complement and the module reads it back with asInt64().
constexpr uint64_t kNoSchedule = static_cast<uint64_t>(-1);

volatile sig_atomic_t g_stop = 0;

void OnSignal(int) { g_stop = 1; }

struct Task {
  // The request keys as last sent: add_task's, then whatever the set_*
  // commands changed. The answers are derived from them, so that an edit of
  // a folder or share shows in the paths at once.
  PObject fields;
  bool running = false;
  bool runnable = true;
};

// What one command did: the answer map and the text of the log line.
struct Outcome {
  PObject answer;
  std::string log;
};

Outcome Ok() {
  Outcome o;
  o.answer["ack"] = "ok";
  o.log = "ok";
  return o;
}

Outcome Error(int code, const char* text) {
  Outcome o;
  o.answer["error"] = text;
  o.answer["error_code"] = code;
  o.log = "error " + std::to_string(code);
  return o;
}

// The last component of a path, ignoring trailing slashes.
std::string BaseName(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

// A field as the integer kind, whatever the sender put there.
PObject Int(const PObject& fields, const char* key) { return PObject(fields[key].asUInt64()); }

PObject Strings(const PObject& fields, const char* key) {
  PObject list;
  list.asArray();
  for (const PObject& item : fields[key].asArray()) {
    if (item.isString()) list.asArray().push_back(item);
  }
  return list;
}

class DevDaemon {
 public:
  Outcome Handle(const PObject& request);

 private:
  Outcome Add(const PObject& request);
  Outcome List() const;
  Outcome GetFilter(const Task& task) const;
  // Copies every argument of request into the task, except those that
  // address the command and, for set_task_setting, the fixed strategy.
  static void Merge(const PObject& request, Task& task, bool keepStrategy);
  bool NameTaken(const std::string& name, uint64_t except) const;
  PObject Describe(uint64_t id, const Task& task) const;

  std::map<uint64_t, Task> tasks_;
  uint64_t nextId_ = 1;
};

bool DevDaemon::NameTaken(const std::string& name, uint64_t except) const {
  for (const auto& [id, task] : tasks_) {
    if (id != except && task.fields["task_name"].asStringRef() == name) return true;
  }
  return false;
}

void DevDaemon::Merge(const PObject& request, Task& task, bool keepStrategy) {
  for (const auto& [key, value] : request.asMap()) {
    if (key == "action" || key == "need_ack" || key == "task_id") continue;
    if (keepStrategy && key == "copy_strategy") continue;
    task.fields[key] = value;
  }
}

PObject DevDaemon::Describe(uint64_t id, const Task& task) const {
  const PObject& f = task.fields;
  // The NAS side is shown as /share/folder, the share alone for its root.
  const std::string folder = f["nas_folder_path"].asStringRef();
  std::string nas = "/" + f["nas_share_name"].asStringRef();
  if (folder != "/") nas += folder;
  const std::string usb = f["usb_folder_path"].asStringRef();
  const bool isExport = f["task_type"].asUInt64() == 2;

  PObject t;
  t["id"] = static_cast<unsigned long>(id);
  t["is_default_task"] = 0;
  t["uuid"] = f["uuid"].asStringRef();
  t["type"] = Int(f, "task_type");
  t["task_name"] = f["task_name"].asStringRef();
  t["task_status"] = task.running ? "running" : "idle";
  t["copy_file_path"] = "";
  t["is_usb_mounted"] = 1;
  t["is_nas_mounted"] = 1;
  t["is_task_runnable"] = task.runnable;
  t["latest_finish_time"] = 0;
  t["error_code"] = 0;
  t["source_path"] = isExport ? nas : usb;
  t["destination_path"] = isExport ? usb : nas;
  t["usb_share_name"] = BaseName(f["usb_share_path"].asStringRef());
  for (const char* key : {"run_when_plug_in", "eject_when_task_done", "copy_strategy",
                          "keep_dir_structure", "smart_create_date_dir", "rename_photo_video",
                          "remove_src_file", "conflict_policy", "enable_rotation",
                          "max_version_count", "rotation_policy"}) {
    t[key] = Int(f, key);
  }
  t["schedule_id"] = kNoSchedule;
  return t;
}

Outcome DevDaemon::Add(const PObject& request) {
  if (NameTaken(request["task_name"].asStringRef(), 0)) {
    return Error(kErrConflict, "task name already exists");
  }
  const uint64_t id = nextId_++;
  Merge(request, tasks_[id], false);
  Outcome o = Ok();
  o.answer["task_id"] = static_cast<unsigned long>(id);
  return o;
}

Outcome DevDaemon::List() const {
  Outcome o = Ok();
  PObject::array_type& list = o.answer["task_list"].asArray();
  for (const auto& [id, task] : tasks_) list.push_back(Describe(id, task));
  return o;
}

Outcome DevDaemon::GetFilter(const Task& task) const {
  Outcome o = Ok();
  for (const char* key :
       {"white_name", "white_ext", "black_name", "black_ext", "custom_name", "custom_ext"}) {
    o.answer[key] = Strings(task.fields, key);
  }
  return o;
}

Outcome DevDaemon::Handle(const PObject& request) {
  const std::string action = request["action"].asStringRef();
  if (action == "list_task") return List();
  if (action == "add_task") return Add(request);
  if (action == "list_entry") {
    Outcome o = Ok();
    o.answer["entry_list"].asArray();
    return o;
  }
  if (action == "set_global_setting") return Ok();

  static const char* const kTaskActions[] = {
      "get_task_setting", "get_filter_setting", "set_task_setting", "set_trigger_time_setting",
      "set_filter_setting", "run_task", "cancel_task", "enable_task", "disable_task",
      "remove_task"};
  bool known = false;
  for (const char* name : kTaskActions) known = known || action == name;
  if (!known) return Error(kErrUnknownAction, "unknown action");

  const uint64_t id = request["task_id"].asUInt64();
  auto it = tasks_.find(id);
  if (it == tasks_.end()) return Error(kErrNoSuchTask, "no such task");
  Task& task = it->second;

  if (action == "get_task_setting") {
    Outcome o = Ok();
    const PObject described = Describe(id, task);
    for (const auto& [key, value] : described.asMap()) o.answer[key] = value;
    return o;
  }
  if (action == "get_filter_setting") return GetFilter(task);
  if (action == "set_task_setting") {
    if (request.hasMember("task_name") && NameTaken(request["task_name"].asStringRef(), id)) {
      return Error(kErrConflict, "task name already exists");
    }
    Merge(request, task, true);
    return Ok();
  }
  if (action == "set_trigger_time_setting" || action == "set_filter_setting") {
    Merge(request, task, false);
    Outcome o = Ok();
    if (action == "set_trigger_time_setting") o.answer["schedule_id"] = kNoSchedule;
    return o;
  }
  if (action == "run_task") {
    if (task.running) return Error(kErrConflict, "task is already running");
    task.running = true;
    return Ok();
  }
  if (action == "cancel_task") {
    if (!task.running) return Error(kErrNotRunning, "task is not running");
    task.running = false;
    return Ok();
  }
  if (action == "enable_task" || action == "disable_task") {
    task.runnable = action == "enable_task";
    return Ok();
  }
  tasks_.erase(it);  // remove_task
  return Ok();
}

// Serves one accepted connection. Returns false when the request was "stop".
bool Serve(DevDaemon& daemon, int fd) {
  IPCSender peer;
  if (peer.assign(fd) != 0) {
    close(fd);
    return true;
  }
  peer.channel().SetTimeout(5);
  PObject request;
  if (peer.recv(request) != 0) {
    std::fprintf(stderr, "plovod-dev: unreadable request\n");
    return true;
  }
  const std::string action = request["action"].asStringRef();
  if (action == "stop") {
    std::fprintf(stderr, "stop\n");
    return false;
  }
  Outcome outcome = daemon.Handle(request);
  std::string line = action.empty() ? "(no action)" : action;
  if (request.hasMember("task_id")) line += " " + std::to_string(request["task_id"].asUInt64());
  std::fprintf(stderr, "%s -> %s\n", line.c_str(), outcome.log.c_str());
  const bool wantsAnswer = !request.hasMember("need_ack") || request["need_ack"].asBool();
  if (wantsAnswer && peer.send(outcome.answer) != 0) {
    std::fprintf(stderr, "plovod-dev: the answer to %s could not be sent\n", action.c_str());
  }
  return true;
}

}  // namespace

int main(int argc, char**) {
  if (argc != 1) {
    std::fprintf(stderr, "usage: plovod-dev\n");
    return 2;
  }
  // The library's own complaints (a socket that cannot be bound, a broken
  // stream) belong with this program's lines, not in the system log.
  Plovo::SetLogSink([](int priority, const std::string& line) {
    if (LOG_PRI(priority) <= LOG_WARNING) std::fprintf(stderr, "plovod-dev: %s\n", line.c_str());
  });

  struct sigaction action {};
  action.sa_handler = OnSignal;
  sigemptyset(&action.sa_mask);
  sigaction(SIGINT, &action, nullptr);
  sigaction(SIGTERM, &action, nullptr);
  signal(SIGPIPE, SIG_IGN);  // a client that hangs up early must not end us

  const std::string path = Plovo::Path::DaemonSocket();
  IPCListener listener;
  if (listener.prepare(path) != 0) {  // replaces a stale socket file
    std::fprintf(stderr, "plovod-dev: cannot listen on %s (does its folder exist?)\n",
                 path.c_str());
    return 1;
  }
  // A short wait, so that a signal is noticed promptly.
  listener.setTimeout({0, 200000});
  std::fprintf(stderr, "plovod-dev: listening on %s\n", path.c_str());

  DevDaemon daemon;
  bool running = true;
  while (running && !g_stop) {
    if (!listener.isReady()) continue;
    const int fd = listener.accept();
    if (fd >= 0) running = Serve(daemon, fd);
  }
  listener.close();
  std::fprintf(stderr, "plovod-dev: stopped\n");
  return 0;
}
