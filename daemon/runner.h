// The daemon's running work: at most one run per task, each on a thread of
// its own, so that a long copy never delays a command. A run can be
// cancelled and ends within a second; every run is cancelled and waited
// for when the daemon stops.
#ifndef PLOVO_DAEMON_RUNNER_H
#define PLOVO_DAEMON_RUNNER_H

#include <atomic>
#include <ctime>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>

#include "daemon/engine/run-control.h"

namespace plovod {

// Copies plan.source into plan.destination, looking at control between
// blocks: 0, or a negative code of ipc/error-code.h (P_ERR_STOPPED when
// cancelled).
using Job = std::function<int(const RunPlan& plan, RunControl& control)>;

class Runner {
 public:
  // finished is called on the run's thread with the job's result, before
  // the task counts as idle again.
  using Finished = std::function<void(const RunPlan& plan, const RunStats& stats, int error)>;
  Runner(Job job, Finished finished) : job_(std::move(job)), finished_(std::move(finished)) {}
  ~Runner() { StopAll(); }
  Runner(const Runner&) = delete;
  Runner& operator=(const Runner&) = delete;

  // False when the task runs already.
  bool Start(const RunPlan& plan);
  // False when the task does not run. Returns at once; the run ends soon.
  bool Cancel(unsigned long id);
  // Cancels the runs that copy from or to the device shared as share.
  void CancelOnShare(const std::string& share);
  bool IsRunning(unsigned long id) const;
  // Whether a run other than task except's copies from or to the device
  // shared as share.
  bool BusyOnShare(const std::string& share, unsigned long except) const;
  // The tasks that run now.
  std::set<unsigned long> Running() const;
  // The file a run copies now; "" when none or the task does not run.
  std::string Copying(unsigned long id) const;
  // Cancels every run, waits for them, and refuses new ones from then on.
  void StopAll();

 private:
  struct Run {
    RunPlan plan;
    RunControl control;
    std::thread thread;
    bool done = false;  // guarded by mutex_
  };
  // Joins the runs that have ended. Called with mutex_ held.
  void Reap();

  Job job_;
  Finished finished_;
  mutable std::mutex mutex_;
  std::map<unsigned long, std::unique_ptr<Run>> runs_;
  bool stopping_ = false;
};

}  // namespace plovod

#endif
