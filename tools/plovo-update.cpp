// Prepares the package's task database as a service start does: creates the
// default tasks on a new install, migrates an old database.
//
//   plovo-update [REPO]
//
// REPO is the repository folder; by default the one on the configured
// repository volume ("<repo_vol_path>/@Plovo"). Honours PLOVO_ROOT. Exit 0
// when the database is ready, 1 when the update failed (the log says why),
// 2 on a usage error.
#include <cstdio>
#include <string>

#include "common/log.h"
#include "service/global-setting.h"
#include "updater/updater-core.h"

int main(int argc, char** argv) {
  if (argc > 2 || (argc == 2 && (argv[1][0] == '\0' || argv[1][0] == '-'))) {
    std::fprintf(stderr, "usage: plovo-update [REPO]\n");
    return 2;
  }
  std::string repo;
  if (argc == 2) {
    repo = argv[1];
  } else {
    std::string volume = Plovo::GlobalSetting::GetRepoVolumePath();
    if (volume.empty()) {
      std::fprintf(stderr, "plovo-update: no repository volume is configured\n");
      return 2;
    }
    repo = volume + "/@Plovo";
  }
  // A person runs this: the log lines go to the terminal, not to syslog.
  Plovo::SetLogSink([](int, const std::string& line) { std::fputs(line.c_str(), stderr); });
  UpdaterCore updater;
  int rc = updater.Update(repo);
  std::printf("plovo-update: %s '%s'\n", rc == 0 ? "ready" : "failed", repo.c_str());
  return rc == 0 ? 0 : 1;
}
