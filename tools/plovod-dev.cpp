// plovod-dev: a development stand-in for the copy daemon.
//
//   plovod-dev [--foreground]
//
// Listens on the daemon socket ($PLOVO_ROOT/tmp/plovo-socket in a sandbox)
// and answers the task commands the web-API module sends, so that plovo-api
// can list, create, edit, run and delete tasks on a machine without the
// real daemon. Started without arguments, as the service start runs the
// package's daemon program, it puts itself in the background and its
// command returns once it serves; --foreground keeps it in the terminal.
// Either way it holds the pid file "/var/run/plovod.pid" under a lock (a
// second one refuses to start), writes the running state (4) when it
// serves, and removes its socket and pid file when it ends. It is not the real daemon: no file is ever copied, "running"
// is only a status, and tasks live in memory, so every start begins with
// none. Every task reports schedule_id -1: schedules are not kept yet.
//
// One connection carries one command; connections are served on several
// threads, the commands one at a time. Each request gives one line on
// stderr ("list_task -> ok", "run_task 3 -> error 3"); in the background
// stderr is /dev/null. SIGINT, SIGTERM or a
// "stop" request (which gets no answer) end it; the socket file is removed
// on the way out.
//
// The "error_code" of a failed command:
//   1  unknown action
//   3  conflict: the task name is taken, or the task is already running
//   4  no such task
//   8  cancel of a task that is not running (the module counts it a success)
#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "common/log.h"
#include "common/paths.h"
#include "ipc/command-server.h"
#include "service/service-ctrl.h"

namespace {

constexpr int kErrUnknownAction = 1;
constexpr int kErrConflict = 3;
constexpr int kErrNoSuchTask = 4;
constexpr int kErrNotRunning = 8;

// Schedules are not kept yet (they come with the task scheduler), so every
// task has none. PObject has no signed kind: -1 travels as its 64-bit two's
// complement and the module reads it back with asInt64().
constexpr uint64_t kNoSchedule = static_cast<uint64_t>(-1);

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
  // Every action this daemon answers, once, with its handler.
  std::vector<CommandServer::Command> Commands();
  // The answer to any other action.
  CommandServer::Handler Unknown();

 private:
  using Command = std::function<Outcome(const PObject& request)>;
  using TaskCommand = std::function<Outcome(uint64_t id, Task& task, const PObject& request)>;

  // A handler that runs command with the lock held and logs its line.
  CommandServer::Handler Logged(Command command);
  // The same for a command on one task, which must exist.
  CommandServer::Handler OnTask(TaskCommand command);

  Outcome List() const;
  Outcome Add(const PObject& request);
  Outcome GetFilter(const Task& task) const;
  // Copies every argument of request into the task, except those that
  // address the command and, for set_task_setting, the fixed strategy.
  static void Merge(const PObject& request, Task& task, bool keepStrategy);
  bool NameTaken(const std::string& name, uint64_t except) const;
  PObject Describe(uint64_t id, const Task& task) const;

  // Connections are served on several threads; commands run one at a time.
  std::mutex mutex_;
  std::map<uint64_t, Task> tasks_;
  uint64_t nextId_ = 1;
};

std::vector<CommandServer::Command> DevDaemon::Commands() {
  return {
      {"list_task", Logged([this](const PObject&) { return List(); })},
      {"add_task", Logged([this](const PObject& request) { return Add(request); })},
      {"list_entry", Logged([](const PObject&) {
         Outcome o = Ok();
         o.answer["entry_list"].asArray();
         return o;
       })},
      {"set_global_setting", Logged([](const PObject&) { return Ok(); })},
      {"get_task_setting", OnTask([this](uint64_t id, Task& task, const PObject&) {
         Outcome o = Ok();
         const PObject described = Describe(id, task);
         for (const auto& [key, value] : described.asMap()) o.answer[key] = value;
         return o;
       })},
      {"get_filter_setting", OnTask([this](uint64_t, Task& task, const PObject&) { return GetFilter(task); })},
      {"set_task_setting", OnTask([this](uint64_t id, Task& task, const PObject& request) {
         if (request.hasMember("task_name") && NameTaken(request["task_name"].asStringRef(), id)) {
           return Error(kErrConflict, "task name already exists");
         }
         Merge(request, task, true);
         return Ok();
       })},
      {"set_trigger_time_setting", OnTask([](uint64_t, Task& task, const PObject& request) {
         Merge(request, task, false);
         Outcome o = Ok();
         o.answer["schedule_id"] = kNoSchedule;
         return o;
       })},
      {"set_filter_setting", OnTask([](uint64_t, Task& task, const PObject& request) {
         Merge(request, task, false);
         return Ok();
       })},
      {"run_task", OnTask([](uint64_t, Task& task, const PObject&) {
         if (task.running) return Error(kErrConflict, "task is already running");
         task.running = true;
         return Ok();
       })},
      {"cancel_task", OnTask([](uint64_t, Task& task, const PObject&) {
         if (!task.running) return Error(kErrNotRunning, "task is not running");
         task.running = false;
         return Ok();
       })},
      {"enable_task", OnTask([](uint64_t, Task& task, const PObject&) {
         task.runnable = true;
         return Ok();
       })},
      {"disable_task", OnTask([](uint64_t, Task& task, const PObject&) {
         task.runnable = false;
         return Ok();
       })},
      {"remove_task", OnTask([this](uint64_t id, Task&, const PObject&) {
         tasks_.erase(id);
         return Ok();
       })},
      // No answer: the sender does not wait for one. The main thread waits
      // for the end signals, so a stop request is one more of them.
      {"stop",
       [](const PObject&) {
         std::fprintf(stderr, "stop\n");
         kill(getpid(), SIGTERM);
         return PObject();
       }},
  };
}

CommandServer::Handler DevDaemon::Unknown() {
  return Logged([](const PObject&) { return Error(kErrUnknownAction, "unknown action"); });
}

CommandServer::Handler DevDaemon::Logged(Command command) {
  return [this, command](const PObject& request) {
    std::lock_guard<std::mutex> lock(mutex_);
    Outcome outcome = command(request);
    const std::string& action = request["action"].asStringRef();
    std::string line = action.empty() ? "(no action)" : action;
    if (request.hasMember("task_id")) line += " " + std::to_string(request["task_id"].asUInt64());
    std::fprintf(stderr, "%s -> %s\n", line.c_str(), outcome.log.c_str());
    return outcome.answer;
  };
}

CommandServer::Handler DevDaemon::OnTask(TaskCommand command) {
  return Logged([this, command](const PObject& request) {
    const uint64_t id = request["task_id"].asUInt64();
    auto it = tasks_.find(id);
    if (it == tasks_.end()) return Error(kErrNoSuchTask, "no such task");
    return command(id, it->second, request);
  });
}

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

Outcome DevDaemon::List() const {
  Outcome o = Ok();
  PObject::array_type& list = o.answer["task_list"].asArray();
  for (const auto& [id, task] : tasks_) list.push_back(Describe(id, task));
  return o;
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

Outcome DevDaemon::GetFilter(const Task& task) const {
  Outcome o = Ok();
  for (const char* key :
       {"white_name", "white_ext", "black_name", "black_ext", "custom_name", "custom_ext"}) {
    o.answer[key] = Strings(task.fields, key);
  }
  return o;
}

}  // namespace

// Takes the pid file under an exclusive lock held for the process's life
// and writes this process's id into it. False when another instance holds
// it or it cannot be written.
bool TakePidFile(const std::string& path) {
  const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  if (fd < 0) {
    std::fprintf(stderr, "plovod-dev: cannot open %s: %s\n", path.c_str(), std::strerror(errno));
    return false;
  }
  if (flock(fd, LOCK_EX | LOCK_NB) != 0) {
    std::fprintf(stderr, "plovod-dev: another one runs (%s is locked)\n", path.c_str());
    close(fd);
    return false;
  }
  const std::string pid = std::to_string(getpid()) + "\n";
  if (ftruncate(fd, 0) != 0 || write(fd, pid.data(), pid.size()) != static_cast<ssize_t>(pid.size())) {
    std::fprintf(stderr, "plovod-dev: cannot write %s\n", path.c_str());
    close(fd);
    return false;
  }
  return true;  // fd stays open: the lock lasts until the process ends
}

// Puts the process in the background: the parent returns from here only
// to exit, with 0 once the child reported that it serves (a byte on
// *ready) and 1 when the child gave up first.
void Daemonize(int* ready) {
  // Whatever its starter left open (a web server's sockets and pipes)
  // would stay held for as long as the daemon runs.
  close_range(STDERR_FILENO + 1, ~0U, 0);
  int report[2];
  if (pipe2(report, O_CLOEXEC) != 0) {
    std::perror("plovod-dev: pipe");
    std::exit(1);
  }
  const pid_t child = fork();
  if (child < 0) {
    std::perror("plovod-dev: fork");
    std::exit(1);
  }
  if (child > 0) {
    close(report[1]);
    char byte = 0;
    ssize_t n;
    do n = read(report[0], &byte, 1);
    while (n < 0 && errno == EINTR);
    std::_Exit(n == 1 ? 0 : 1);
  }
  close(report[0]);
  setsid();
  // Nobody reads the terminal of a background process, and an inherited
  // pipe would keep whoever started it waiting for the end of its output.
  const int null = open("/dev/null", O_RDWR);
  if (null >= 0) {
    dup2(null, STDIN_FILENO);
    dup2(null, STDOUT_FILENO);
    dup2(null, STDERR_FILENO);
    if (null > STDERR_FILENO) close(null);
  }
  *ready = report[1];
}

int main(int argc, char** argv) {
  const bool foreground = argc == 2 && std::strcmp(argv[1], "--foreground") == 0;
  if (argc != 1 && !foreground) {
    std::fprintf(stderr, "usage: plovod-dev [--foreground]\n");
    return 2;
  }
  int ready = -1;
  if (!foreground) Daemonize(&ready);
  // The library's own complaints (a socket that cannot be bound, a broken
  // stream) belong with this program's lines, not in the system log.
  Plovo::SetLogSink([](int priority, const std::string& line) {
    if (LOG_PRI(priority) <= LOG_WARNING) std::fprintf(stderr, "plovod-dev: %s\n", line.c_str());
  });

  // The end signals are taken by sigwait below; blocked before any thread
  // starts, so that no other thread is interrupted by them.
  sigset_t ends;
  sigemptyset(&ends);
  sigaddset(&ends, SIGINT);
  sigaddset(&ends, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &ends, nullptr);
  signal(SIGPIPE, SIG_IGN);  // a client that hangs up early must not end us

  DevDaemon daemon;
  CommandServer server(daemon.Commands(), daemon.Unknown(), [](const std::string& problem) {
    std::fprintf(stderr, "plovod-dev: %s\n", problem.c_str());
  });
  const std::string pidFile = Plovo::Path::DaemonPidFile();
  if (!TakePidFile(pidFile)) return 1;
  const std::string path = Plovo::Path::DaemonSocket();
  if (server.Start(path) != 0) {  // replaces a stale socket file
    std::fprintf(stderr, "plovod-dev: cannot listen on %s (does its folder exist?)\n",
                 path.c_str());
    unlink(pidFile.c_str());
    return 1;
  }
  ServiceStatus running;
  running.state = PLOVO_SERVICE_STATUS_RUNNING;
  if (SetServiceStatus(running) != 0) {
    std::fprintf(stderr, "plovod-dev: cannot write the running state\n");
    server.Stop();
    unlink(pidFile.c_str());
    return 1;
  }
  std::fprintf(stderr, "plovod-dev: listening on %s\n", path.c_str());
  if (ready >= 0) {
    const char byte = 1;
    if (write(ready, &byte, 1) != 1) std::fprintf(stderr, "plovod-dev: cannot report readiness\n");
    close(ready);
  }

  int received = 0;
  sigwait(&ends, &received);
  server.Stop();
  unlink(pidFile.c_str());
  std::fprintf(stderr, "plovod-dev: stopped\n");
  return 0;
}
