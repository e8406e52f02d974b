// The copy engine: one run of a task, from its source folder to its
// destination folder, by the task's strategy and options.
//
//  - versioning: a new version folder per run, named by the run's start
//    time (rotation.h); a file unchanged since the previous version (same
//    size and modification time) is a hard link to it there;
//  - mirror: the destination becomes a copy of the source; what the
//    source no longer has is removed, unless the filters exclude it;
//  - incremental: only files not copied before, remembered by their
//    source path, size and modification time in the task's
//    "file-db.sqlite" (file-memory.h); nothing is removed at the
//    destination. Options: a flat layout, date folders, names by capture
//    time (capture-time.h), rename or overwrite on a name conflict, and
//    removal of the sources once their copies are in place.
//
// Every file is written under a temporary name in its destination folder,
// synced, and renamed into place (file-copy.h), so no file under its final
// name is ever partial. The filters (black list, white list with the
// custom names and extensions) decide what is copied; the device's own
// configuration file, the platform's "@eaDir" folders and the temporary
// files of a run that was killed never are. Both trees are walked through
// open folders, never through a link.
#ifndef PLOVO_DAEMON_ENGINE_ENGINE_H
#define PLOVO_DAEMON_ENGINE_ENGINE_H

#include <ctime>
#include <string>

#include "daemon/runner.h"

namespace plovod {

// One run, as the runner hands it to its job: 0, or a negative code of
// ipc/error-code.h: P_ERR_STOPPED (cancelled), P_ERR_SHARE_NOT_MOUNTED
// (the device went away), P_ERR_DEST_QUOTA_FULL, P_ERR_SOURCE_ROOT_MISSING,
// P_ERR_DEST_ROOT_MISSING, P_ERR_FILE_OPERATION. Files that cannot be
// copied are logged and skipped; the run goes on.
int RunCopy(const RunPlan& plan, RunControl& control);

}  // namespace plovod

#endif
