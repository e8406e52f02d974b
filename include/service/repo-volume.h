// The package's repository: the folder "@Plovo" at the top of one internal
// volume, with "db" (the task and log databases) and "task" (one folder per
// task). These functions create it, record which volume holds it and move
// it to another volume.
//
// The volume is recorded twice: "repo_vol_path" in setting.conf, read by
// the module and the daemon, and "veltpkg_conf/reg_volume", a one-element
// JSON array that tells the platform's package manager which volume the
// package occupies.
//
// A move copies the repository into the target volume's "@tmp" first, so a
// half-finished copy never looks like a repository, renames it into place,
// records the new volume, and only then retires the old one (renamed into
// its own volume's "@tmp" and deleted in the background). Until the record
// names the new volume the old repository is untouched.
//
// The functions run in the calling process and block while they copy; they
// need root. Only ChangeRepoVolume may be called from several threads or
// processes at once; it serialises itself.
#ifndef PLOVO_SERVICE_REPO_VOLUME_H
#define PLOVO_SERVICE_REPO_VOLUME_H

#include <string>

#include "common/export.h"

// Creates volumePath + "/@Plovo", "/@Plovo/db" and "/@Plovo/task" (existing
// folders are kept). 0, or -1 for an empty path or a folder that cannot be
// made.
int MakeRepo(const std::string& volumePath);

// Records volumePath (may be empty: no repository) as the repository's
// volume in setting.conf and in reg_volume (`["<path>"]` and a newline).
// False when either cannot be written.
bool SetRepoVolumePath(const std::string& volumePath);

// Copies from + "/@Plovo" to to + "/@Plovo" through to + "/@tmp/@Plovo"
// (the volume's "@tmp" is created when it has none, and whatever an earlier
// attempt left in the staging place is removed first). False when the copy
// or the rename into place fails; the old repository is untouched either
// way: RetireRepo removes it once the new volume is recorded. Refuses
// (false, nothing copied) when to + "/@Plovo" already exists, since
// renaming onto it would bury the copy inside it.
bool move_repo_volume(const std::string& from, const std::string& to);

// Renames from + "/@Plovo" to from + "/@tmp/@Plovo" and deletes it there in
// the background. Failures are logged and leave it where it is.
void RetireRepo(const std::string& from);

// Moves the repository from the volume `from` (empty: there is none yet,
// and one is created on `to`) to the volume `to`, stopping the service
// first when the daemon runs and starting it again afterwards, all under
// the ServiceLock. True on success, and at once when from equals to or the
// repository is already recorded on `to`; false when it is recorded on
// neither (another move came first). A failed copy starts the service
// again on the old volume and leaves the state error (7) only when that
// start fails too; any other failure after the stop leaves state 7.
PLOVO_EXPORT bool ChangeRepoVolume(const std::string& from, const std::string& to);

#endif
