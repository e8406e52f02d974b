// Version folders of a versioning task and which of them rotation keeps.
//
// Each run makes one folder in the destination named by the run's start
// time in local time, "2026-11-23_143005"; a second run in the same second
// gets "_2", "_3", ... after it.
//
// Rotation, when the task enables it, runs after a successful run and
// keeps at most max versions:
//  - "oldest_version" (policy 1) removes the oldest versions until max
//    remain;
//  - "smart_recycle" (policy 2) first thins the history: every version of
//    the last 24 hours is kept; older than that and up to 30 days, the
//    newest version of each day (24-hour steps back from now); older than
//    30 days, the newest of each week (7-day steps back from now). If more
//    than max remain, the oldest go until max remain.
// The newest version (the run's own) is always kept.
#ifndef PLOVO_DAEMON_ENGINE_ROTATION_H
#define PLOVO_DAEMON_ENGINE_ROTATION_H

#include <ctime>
#include <string>
#include <vector>

namespace plovod {

// The folder name of a version made at started (local time); sequence 1
// gives the plain name, 2 and more add "_<sequence>".
std::string VersionName(time_t started, int sequence = 1);

// The start time of the version folder name; false for a name that is not
// a version folder's (the user's own folders beside the versions are left
// alone by rotation).
bool ParseVersionName(const std::string& name, time_t& started);

// The indexes into versions (start times, in any order) of the versions
// rotation removes at now, in ascending order. Policy 2 as above, any other
// only keeps max; max of 0 is taken as 1. Of two versions with the same
// start time, the one at the later index counts as the newer.
std::vector<size_t> VersionsToRemove(const std::vector<time_t>& versions, time_t now, unsigned long max,
                                     int policy);

}  // namespace plovod

#endif
