// The base of the schema updaters: the repository they work in.
#ifndef PLOVO_UPDATER_UPDATER_BASE_H
#define PLOVO_UPDATER_UPDATER_BASE_H

#include <string>

class UpdaterBase {
 public:
  explicit UpdaterBase(const std::string& repoPath) : repoPath_(repoPath) {}
  virtual ~UpdaterBase() {}
  const std::string& GetRepoPath() const { return repoPath_; }

 private:
  std::string repoPath_;
};

#endif
