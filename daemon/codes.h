// The "error_code" of a failed daemon command. The module turns 3, 9 and
// 10 into web-API errors of their own and takes 8 from "cancel_task" as a
// success; every other code reaches the user as a general failure.
#ifndef PLOVO_DAEMON_CODES_H
#define PLOVO_DAEMON_CODES_H

namespace plovod {

enum Code {
  kOk = 0,
  kUnknownAction = 1,
  // A missing or malformed argument, an unsafe path, or a timetable the
  // scheduler did not take (the scheduler does not tell a bad timetable
  // from its own failure).
  kBadRequest = 2,
  kConflict = 3,      // the task name is taken, or the task is running
  kNoSuchTask = 4,
  kFailed = 5,        // the task database or folder failed, or an entry could not be renamed or removed
  kNotRunning = 8,    // cancel of a task that is not running
  kDeviceAbsent = 9,  // the task's device is not plugged in
  kShareAbsent = 10,  // the task's NAS share is missing or not mounted
  kDisabled = 11,     // the task is disabled
};

}  // namespace plovod

#endif
