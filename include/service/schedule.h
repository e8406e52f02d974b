// The package's entries in the platform's task scheduler. A task that runs
// on a timetable has one entry; its command runs the notifier with the task
// id, and the task record keeps the entry's id ("schedule_id", -1 none).
//
// Timetables come as the web interface's JSON text: an object with
// "week_day", "hour", "minute" and "repeat_date" (and keys the scheduler
// keeps as they are). They are handed to the scheduler with "minute" as
// "min", "week_day" as "week_name" and "repeat_date" as "repeat".
//
// Every function returns true on success; a failure is logged as
// "[ERR] schedule(<line>): ...". The scheduler object a call works on is
// always freed. Safe to call from several threads.
#ifndef PLOVO_SERVICE_SCHEDULE_H
#define PLOVO_SERVICE_SCHEDULE_H

#include <cstdint>
#include <string>

namespace Plovo {

// The application every entry of the package carries; the entries of
// ShowAllSchedule, HideAllSchedule and RemoveAllSchedule are those with it.
extern const char* const kScheduleApp;

// A new entry for the task: named after it, the icon of its type, enabled
// or not, on the timetable scheduleJson. scheduleId receives its id. Names
// longer than 1024 bytes or holding a NUL, and timetables over 16 KiB, are
// refused.
bool CreateSchedule(unsigned long taskId, int taskType, const std::string& name, bool enabled,
                    const std::string& scheduleJson, int64_t& scheduleId);
bool UpdateScheduleName(int64_t scheduleId, const std::string& name);
// Sets the entry's state, then its timetable, in one save.
bool UpdateScheduleContent(int64_t scheduleId, bool enabled, const std::string& scheduleJson);
// Make every entry of the package listed (shown) or not (hidden) in the
// scheduler's list. An entry already so is not saved again; one whose save
// fails is skipped and the others are still changed. False only when the
// list cannot be read.
bool ShowAllSchedule();
bool HideAllSchedule();
// Deletes the entry; one that is gone already counts as deleted.
bool RemoveSchedule(int64_t scheduleId);
// Deletes every entry of the package; one that cannot be deleted is skipped.
// False only when the list cannot be read.
bool RemoveAllSchedule();

}  // namespace Plovo

#endif
