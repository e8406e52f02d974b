// "delete", "run", "enable", "disable" and "cancel": one daemon command on
// one task. Whether the task exists is the daemon's answer.
#include "ipc/plovo-command.h"
#include "webapi/plovo.h"

namespace {

// The daemon's "error_code" for a task that has nothing to stop.
constexpr int32_t kNothingToCancel = 8;

}  // namespace

void PlovoHandle::Delete() { SendTaskIdCmd(Plovo::DeleteTaskCmd); }
void PlovoHandle::Run() { SendTaskIdCmd(Plovo::StartTaskCmd); }
void PlovoHandle::Enable() { SendTaskIdCmd(Plovo::EnableTaskCmd); }
void PlovoHandle::Disable() { SendTaskIdCmd(Plovo::DisableTaskCmd); }
// Cancelling a task that is not running leaves it as the user wants it.
void PlovoHandle::Cancel() { SendTaskIdCmd(Plovo::StopTaskCmd, {kNothingToCancel}); }
