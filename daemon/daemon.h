// plovod's command handler: every action the web-API module and the
// notifier send, answered from the task store, the platform's device
// lookups and the runs in progress.
//
// A failed command answers {"error": <text>, "error_code": <code>}
// (codes.h); a successful one {"ack": "ok"} plus its data. Commands run one
// at a time under one lock; runs go on beside them on threads of their own.
#ifndef PLOVO_DAEMON_DAEMON_H
#define PLOVO_DAEMON_DAEMON_H

#include <atomic>
#include <ctime>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "daemon/devices.h"
#include "daemon/engine/copy-log.h"
#include "daemon/engine/engine.h"
#include "daemon/runner.h"
#include "daemon/task-store.h"
#include "ipc/command-server.h"
#include "ipc/pobject.h"

namespace plovod {

class Daemon {
 public:
  // repo is the repository folder ("<volume>/@Plovo"); stop is called when
  // a "stop" command arrives (on a server thread) and must only ask the
  // main thread to end. beep is the global setting at start. clock gives
  // a run's start time (its version's name and rotation); tests set it.
  Daemon(const std::string& repo, bool beep, std::function<void()> stop, Job job = RunCopy,
         std::function<time_t()> clock = [] { return std::time(nullptr); });
  ~Daemon() { Shutdown(); }
  Daemon(const Daemon&) = delete;
  Daemon& operator=(const Daemon&) = delete;

  // Opens the task database; 0, or -1 (logged).
  int Open() { return store_.Open(); }
  // Every action with its handler, for the CommandServer.
  std::vector<CommandServer::Command> Commands();
  // The answer to an action that is not in the table.
  PObject Unknown(const PObject& request);
  // The answer to one request, whatever its action.
  PObject Handle(const PObject& request);
  // Cancels the runs, waits for them and closes the task database. Once.
  void Shutdown();

 private:
  using Handler = PObject (Daemon::*)(const PObject& request);

  PObject ListTask(const PObject& request);
  PObject GetTaskSetting(const PObject& request);
  PObject GetFilterSetting(const PObject& request);
  PObject AddTask(const PObject& request);
  PObject SetTaskSetting(const PObject& request);
  PObject SetTriggerTimeSetting(const PObject& request);
  PObject SetFilterSetting(const PObject& request);
  PObject EnableTask(const PObject& request);
  PObject DisableTask(const PObject& request);
  PObject SetEnabled(const PObject& request, bool enable);
  PObject RunTask(const PObject& request);
  PObject CancelTask(const PObject& request);
  PObject RemoveTask(const PObject& request);
  PObject SetGlobalSetting(const PObject& request);
  PObject ListEntry(const PObject& request);
  PObject DeviceAdded(const PObject& request);
  PObject DeviceRemoved(const PObject& request);
  PObject Stop(const PObject& request);

  // The task map the module reads, for the task as stored and as it runs.
  // running says whether the task ran when its row was read.
  PObject Describe(const StoredTask& task, const std::vector<PluggedDevice>& plugged, bool running);
  // Starts a run of the task; kOk or why not.
  Code StartRun(const StoredTask& task, std::string& why);
  // Called on a run's thread when it ends: records the outcome, writes its
  // row, beeps and ejects.
  void RunFinished(const RunPlan& plan, const RunStats& stats, int error);

  static const std::map<std::string, Handler>& Table();

  std::mutex mutex_;  // one command at a time
  TaskStore store_;
  CopyLog log_;
  std::function<time_t()> clock_;
  std::atomic<bool> beep_;
  std::function<void()> stop_;
  Runner runner_;  // last: its runs use the store
  bool shutDown_ = false;
};

}  // namespace plovod

#endif
