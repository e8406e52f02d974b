#include "daemon/runner.h"

#include "common/no-throw.h"
#include "ipc/error-code.h"

namespace plovod {

// ---- Runner ------------------------------------------------------------------

bool Runner::Start(const RunPlan& plan) {
  std::lock_guard<std::mutex> lock(mutex_);
  Reap();
  if (stopping_ || runs_.count(plan.id) != 0) return false;
  auto run = std::make_unique<Run>();
  run->plan = plan;
  Run* started = run.get();
  run->thread = std::thread([this, started] {
    const int error = Plovo::NoThrow([&] { return job_(started->plan, started->control); },
                                     static_cast<int>(P_ERR_SYSTEM));
    finished_(started->plan, started->control.stats, error);
    std::lock_guard<std::mutex> lock(mutex_);
    started->done = true;
  });
  runs_[plan.id] = std::move(run);
  return true;
}

void Runner::Reap() {
  for (auto it = runs_.begin(); it != runs_.end();) {
    if (!it->second->done) {
      ++it;
      continue;
    }
    it->second->thread.join();
    it = runs_.erase(it);
  }
}

bool Runner::Cancel(unsigned long id) {
  std::lock_guard<std::mutex> lock(mutex_);
  auto it = runs_.find(id);
  if (it == runs_.end() || it->second->done) return false;
  it->second->control.Cancel(P_ERR_STOPPED);
  return true;
}

void Runner::CancelOnShare(const std::string& share) {
  std::lock_guard<std::mutex> lock(mutex_);
  for (auto& [id, run] : runs_) {
    if (run->plan.device_share == share) run->control.Cancel(P_ERR_SHARE_NOT_MOUNTED);
  }
}

bool Runner::IsRunning(unsigned long id) const {
  std::lock_guard<std::mutex> lock(mutex_);
  auto it = runs_.find(id);
  return it != runs_.end() && !it->second->done;
}

bool Runner::BusyOnShare(const std::string& share, unsigned long except) const {
  std::lock_guard<std::mutex> lock(mutex_);
  for (const auto& [id, run] : runs_) {
    if (id != except && !run->done && run->plan.device_share == share) return true;
  }
  return false;
}

std::set<unsigned long> Runner::Running() const {
  std::lock_guard<std::mutex> lock(mutex_);
  std::set<unsigned long> ids;
  for (const auto& [id, run] : runs_) {
    if (!run->done) ids.insert(id);
  }
  return ids;
}

std::string Runner::Copying(unsigned long id) const {
  std::lock_guard<std::mutex> lock(mutex_);
  auto it = runs_.find(id);
  return it == runs_.end() || it->second->done ? "" : it->second->control.Copying();
}

void Runner::StopAll() {
  std::map<unsigned long, std::unique_ptr<Run>> runs;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    stopping_ = true;
    for (auto& [id, run] : runs_) run->control.Cancel(P_ERR_STOPPED);
    runs.swap(runs_);
  }
  // Without the lock: a run's last step takes it.
  for (auto& [id, run] : runs) run->thread.join();
}

}  // namespace plovod
