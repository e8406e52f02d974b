// Feeds arbitrary bytes to plovod's command handler as one request,
// received as the daemon's server receives it (a socket pair read through a
// CommandServer connection), on a daemon opened once on a scratch sandbox:
// a repository, a NAS share "photo" and a plugged-in device "usbshare1".
// Any input must give an answer map ("ack" or "error_code") or, for "stop",
// null: never a crash, a hang or a leak. Runs end at once, so that a
// "run_task" or "device_added" costs no copying; the scratch folder is
// removed at exit.
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <string>

#include "fuzz-socket.h"
#include "common/log.h"
#include "daemon/daemon.h"
#include "ipc/command-server.h"
#include "ipc/error-code.h"
#include "ipc/pobject.h"

namespace {

namespace fs = std::filesystem;

// A plain array, so that it is still there when the exit handler runs.
char gScratch[] = "/tmp/plovo-fuzz-XXXXXX";
plovod::Daemon* gDaemon = nullptr;

void Write(const std::string& systemPath, const std::string& text) {
  const fs::path path = std::string(gScratch) + systemPath;
  fs::create_directories(path.parent_path());
  std::ofstream(path) << text;
}

// The layout of the daemon tests' sandbox.
void MakeSandbox() {
  for (const char* dir : {"/volume1/@Plovo/db", "/volume1/@Plovo/task", "/volume1/photo", "/usbshare1/DCIM"})
    fs::create_directories(std::string(gScratch) + dir);
  Write("/var/packages/Plovo/enabled", "");
  Write("/etc.defaults/veltinfo.conf", "");
  Write("/var/packages/Plovo/etc/setting.conf",
        "repo_vol_path=\"" + std::string(gScratch) + "/volume1\"\nbeep=\"no\"\n");
  Write("/dev/usb1", "");
  Write("/usbshare1/@eaDir/.VeltraPlovo.config", "uuid=\"0d7c3c55-5b1e-4a53-9d4c-0a1b2c3d4e5f\"\n");
  Write("/velt-dev/volumes.json",
        R"({"volumes": [{"path": "volume1", "mounted": true, "writable": true, "location": "internal"}]})");
  Write("/velt-dev/storage.json",
        R"({"shares": [{"name": "usbshare1", "path": "usbshare1", "dev_path": "dev/usb1", "mounted": true},
                       {"name": "photo", "path": "volume1/photo"}],
            "devices": [{"producer": "Acme", "product": "Card", "partitions": [{"share_name": "usbshare1"}]}]})");
}

void RemoveScratch() {
  delete gDaemon;  // its runs end and the database closes before the files go
  gDaemon = nullptr;
  std::error_code ec;
  fs::remove_all(gScratch, ec);
}

size_t TaskCount() {
  PObject list;
  list["action"] = "list_task";
  return gDaemon->Handle(list)["task_list"].asArray().size();
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  Plovo::SetLogSink([](int, const std::string&) {});
  if (mkdtemp(gScratch) == nullptr) abort();
  setenv("PLOVO_ROOT", gScratch, 1);
  atexit(RemoveScratch);
  MakeSandbox();
  gDaemon = new plovod::Daemon(std::string(gScratch) + "/volume1/@Plovo", false, [] {},
                               [](const plovod::RunPlan&, plovod::RunControl&) { return int{P_SUCCESS}; });
  if (gDaemon->Open() != 0) abort();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const int input = InputSocket(data, size);

  PObject request;
  {
    CommandServer::Connection connection(input);  // owns input from here
    if (connection.Recv(request) != 0) return 0;   // the server drops such a connection
  }
  const PObject answer = gDaemon->Handle(request);
  if (answer.isNull()) {
    if (request["action"].asStringRef() != "stop") abort();
  } else if (!answer.isMap() || !(answer["ack"].asStringRef() == "ok" || answer["error_code"].isInteger())) {
    abort();
  }
  // Tasks the input added are kept to a handful, so that the store does not
  // grow without bound over a long run.
  if (answer.hasMember("task_id") && TaskCount() > 8) {
    PObject remove;
    remove["action"] = "remove_task";
    remove["task_id"] = answer["task_id"].asUInt64();
    gDaemon->Handle(remove);
  }
  return 0;
}
