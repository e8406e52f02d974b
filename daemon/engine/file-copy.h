// The copy engine's file primitives: folders opened below a root without
// ever following a link, and the placement of copies, each written under
// a temporary name in its destination folder and renamed into place only
// once its bytes are on the disk.
#ifndef PLOVO_DAEMON_ENGINE_FILE_COPY_H
#define PLOVO_DAEMON_ENGINE_FILE_COPY_H

#include <sys/stat.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "common/unique-fd.h"
#include "daemon/engine/run-control.h"

namespace plovod {

// A shared open folder: a copy waiting in a batch keeps its folder open.
using Folder = std::shared_ptr<Plovo::UniqueFd>;

// Whether name is a copy's temporary name: one a run that was killed left
// behind is no file of the user's, and is never copied on.
bool IsTemporary(const std::string& name);

// The folder relative ("a/b", "" for base itself) below the open folder
// base, never through a link: a link on the card or in the NAS folder,
// even one put there during the run, would lead the copy out of its
// folders. Missing folders are made when create is set. An open folder,
// or null with errno set.
Folder OpenBelow(int base, const std::string& relative, bool create);

// Removes the entry name of the open folder and, for a folder, everything
// below it, without following links; a tree more than 256 levels deep is
// left. 0, or -1 with errno set.
int RemoveEntry(int folder, const std::string& name, int depth = 0);

// Copies in batches: each file goes to a temporary name in its folder;
// when the batch is full (or at Commit) the destination's file system is
// synced once and every file of the batch is renamed into place, in
// order, and its placed callback runs. One sync per batch rather than per
// file keeps many small files as fast as a plain copy, and no file is
// under its final name before its bytes are on the disk.
class Placer {
 public:
  // Called once the file is in place.
  using Placed = std::function<void()>;
  // How Copy ended for one file.
  enum Outcome { kCopied, kSkipped, kFailed };

  // dropped is called with a file's shown path and why when it could not
  // be put in place: a file of its name appeared at the destination
  // meanwhile (and was kept), or the destination refuses its name.
  using Dropped = std::function<void(const std::string& shown, const std::string& why)>;
  Placer(int destinationRoot, RunControl& control, Dropped dropped);
  ~Placer() { Discard(); }
  Placer(const Placer&) = delete;
  Placer& operator=(const Placer&) = delete;

  // Copies the regular file name of the open folder from (st: its lstat)
  // into the folder to as name. replace: the file put in place replaces
  // what stands there; otherwise a file that appeared under that name
  // meanwhile is kept and the copy dropped. kCopied (waiting in the
  // batch, or placed), kSkipped with why (the file alone cannot be
  // copied: it went away, is not readable, the destination refuses its
  // name or size), or kFailed with the run's error in error (cancelled,
  // destination full, device gone, ...). shown is what the task list
  // shows while it copies.
  Outcome Copy(int from, const std::string& name, const struct stat& st, const Folder& to, const std::string& finalName,
               bool replace, const std::string& shown, const Placed& placed, std::string& why, int& error);
  // Puts the waiting files in place: 0, or the run's error (they are then
  // removed).
  int Commit();
  // Removes the waiting files' temporaries.
  void Discard();
  // Whether no file waits: the last Copy put its batch in place.
  bool Empty() const { return waiting_.empty(); }

 private:
  struct Waiting {
    Folder folder;
    std::string temporary;
    std::string name;
    bool replace;
    Placed placed;
    std::string shown;
  };
  // Writes the bytes of in to out, looking at the cancel between blocks.
  // 0, or the errno of the failing side: set fromSource when it was the
  // reading.
  int Transfer(int in, int out, bool& fromSource);

  int root_;
  RunControl& control_;
  Dropped dropped_;
  std::vector<Waiting> waiting_;
  unsigned long long waitingBytes_ = 0;
  std::vector<char> buffer_;
  bool kernelCopy_ = true;
};

}  // namespace plovod

#endif
