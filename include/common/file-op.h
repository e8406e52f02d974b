// File operations over local paths: a path's kind and attributes, folders,
// copy, move, remove, tree walks, and one key of a removable device's own
// configuration file.
//
// Every function returns 0 on success and a negative code on failure (or a
// bool for a predicate) and logs its failures as "[ERR] file-op(<line>): ...".
// Codes: -1 bad argument, missing path or generic failure; -2 a walk stopped
// (TraverseDir), a folder could not be created (FSMKDir) or the disk is full
// (FSCopy); -3 a removal (FSRemove) or a move (FSRename) failed; -100 a name
// too long for rename (FSRename). Nothing throws. The functions keep no
// state and may be called from several threads.
#ifndef PLOVO_COMMON_FILE_OP_H
#define PLOVO_COMMON_FILE_OP_H

#include <cstdint>
#include <string>

// What GetFileInfo learnt of one path. Entry kinds (type):
// 1 regular file, 2 directory, 3 symbolic link, 5 character or block device,
// 6 FIFO, 7 socket.
struct LocalFileInfo {
  LocalFileInfo();
  ~LocalFileInfo();
  // Back to the state of a new record.
  void Clear();

  std::string path;    // the path as given
  std::string name;    // its last component
  std::string extra;   // left empty by GetFileInfo
  int type;
  int32_t mtime;       // modification time, seconds
  int64_t size;        // bytes
  bool exists;
  uint32_t uid;
  uint32_t gid;
};

// lstat of path (a symbolic link is described, not followed). A missing path
// (ENOENT, ENOTDIR) is not a failure: the record says exists false, type 1,
// size 0 and mtime now, and the result is 0. Other lstat failures, and kinds
// outside the list above, give -1.
int GetFileInfo(const std::string& path, LocalFileInfo& info);

// Same as GetFileInfo; the name FSRename uses.
int FSStat(const std::string& path, LocalFileInfo& info);

// false for an empty path, else whether access(path, F_OK) succeeds.
bool IsFileExist(const std::string& path);

// Makes a folder (with its missing parents when recursive) and gives it to
// uid:gid (-1 leaves an id as it falls). An existing folder is success and
// is left alone; an existing non-folder gives -1; a failed mkdir -2.
int FSMKDir(const std::string& path, bool recursive, unsigned uid, unsigned gid);

// Makes path and its missing parents, each owned by uid:gid (-1: unchanged).
int FSMKDirP(const std::string& path, unsigned uid, unsigned gid);

// chown; an id of -1 is left unchanged.
int FSChown(const std::string& path, unsigned uid, unsigned gid);

// Copies a regular file's bytes to destination (created or truncated, mode
// 0666 before the umask), then removes the source when removeSource is set.
// The kernel copies where it can (copy_file_range, else sendfile); a 32 MiB
// buffer, allocated per call, takes over where it cannot (pipes, devices).
// -2 when the destination's disk is full (the partial file is left; a write
// that takes no byte counts as full), -1 for every other failure, including
// a destination that is the source itself (refused before it is truncated).
// The destination is fsynced before it is closed, a failing fsync or close
// fails the copy, and the source is removed only after both succeeded.
int FSCopy(const std::string& source, const std::string& destination, bool removeSource);

// Removes a file or a whole folder tree, with the platform's extended
// attribute data of each entry. A missing path is success. When an entry
// cannot be removed the others still are, the folders above it stay, and
// the first failure's code is returned (-3, or -1 for a folder that cannot
// be read). The flag is accepted and ignored.
int FSRemove(const std::string& path, bool flag);

// Moves a file or folder tree; when the two paths lie on different file
// systems, copies file by file, removing each source after its copy and the
// source folders bottom-up. Entries other than files and folders are left
// where they are (and count as moved), so a folder holding one cannot be
// removed afterwards and that move gives -3 with everything else copied.
// -1 empty argument, -2 source missing, -3 move failed, -100 a name too
// long for rename.
int FSRename(const std::string& source, const std::string& destination);

// Calls callback on path itself, then on each entry beneath it, a folder
// before its contents; symbolic links are reported, not followed. An entry
// whose kind the file system does not report is looked up, so that a
// folder is always walked into rather than reported as a file. A
// non-zero answer of the callback stops the walk with -2; path missing or
// not a folder gives -1.
int TraverseDir(const std::string& path, int (*callback)(const std::string& path, void* context),
                void* context);

// The device's configuration file: deviceRoot + "/@eaDir/.VeltraPlovo.config".
std::string PlovoConfigPath(const std::string& deviceRoot);

// Sets key="value" in the device's configuration file, creating its
// "@eaDir" folder when missing. Every argument must be non-empty. 0 or -1.
int WritePlovoConfig(const std::string& deviceRoot, const std::string& key,
                     const std::string& value);

// Reads key from the device's configuration file into value, never cut
// short (values up to 1 MiB). 1 when found, 0 when the file or the key is
// absent (value cleared), -1 on a bad argument or a file that cannot be
// read.
int ReadPlovoConfig(const std::string& deviceRoot, const std::string& key, std::string& value);

#endif
