// plovod-dev, the development daemon, run as its own process in a sandbox
// and driven through plovo-api as the README shows.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <thread>

#include "common/paths.h"
#include "sandbox.h"

namespace {

using namespace std::chrono_literals;

class DevDaemonTest : public plovo_test::SandboxTest {
 protected:
  void TearDown() override {
    if (pid_ > 0) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
    SandboxTest::TearDown();
  }
  // Starts the daemon, its stderr in the sandbox, and waits for its socket
  // (a plain file at that path does not count).
  void Start() {
    MakeDir("/tmp");
    MakeDir("/var/run");
    pid_ = fork();
    if (pid_ == 0) {
      dup2(open(Path("/daemon.log").c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644), 2);
      execl(PLOVOD_DEV_PATH, PLOVOD_DEV_PATH, "--foreground", static_cast<char*>(nullptr));
      _exit(127);
    }
    struct stat st {};
    for (int i = 0; i < 250; ++i, std::this_thread::sleep_for(20ms)) {
      if (stat(Plovo::Path::DaemonSocket().c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) return;
    }
    FAIL() << "no socket; " << ReadFile("/daemon.log");
  }
  // What plovo-api prints: the answer as compact JSON.
  std::string Api(const std::string& method, const std::string& params) {
    const std::string command = "PLOVO_ROOT=" + Root() + " " + PLOVO_API_PATH + " " + method + " '" +
                                params + "' 2>/dev/null";
    FILE* pipe = popen(command.c_str(), "r");
    std::string out;
    char buffer[4096];
    for (size_t n; pipe && (n = fread(buffer, 1, sizeof(buffer), pipe)) > 0;) out.append(buffer, n);
    if (pipe) pclose(pipe);
    return out;
  }

  pid_t pid_ = -1;
};

// The round trip the README shows, step by step (what each answer holds),
// and the daemon's lines for the refusals.
TEST_F(DevDaemonTest, CreateListEditRunCancelAndDelete) {
  MakeDir("/usbshare1");
  WriteFile("/dev/usb1", "");
  WriteFile("/velt-dev/storage.json",
            R"({"shares": [{"name": "usbshare1", "path": "usbshare1", "dev_path": "dev/usb1"}],
                "devices": [{"partitions": [{"share_name": "usbshare1"}]}]})");
  WriteStatus(4, "");
  Start();
  auto task = [](const std::string& head, const char* name, const char* destination) {
    return head + R"({"name": ")" + name + R"(", "type": "import_general", "source_path": "/usbshare1/DCIM",
      "destination_path": ")" + destination + R"("}})";
  };
  const std::string one = R"({"id": 1})", ok = R"("success":true)";
  const struct {
    const char* method;
    std::string params;
    std::string holds;
  } steps[] = {
      {"create", task(R"({"task": )", "Camera", "/photo/camera"), R"("data":{"task_id":1})"},
      {"create", task(R"({"task": )", "Camera", "/photo"), R"("code":403)"},
      {"list", "{}", R"("destination_path":"/photo/camera")"},
      {"set_setting", task(R"({"id": 1, "task_setting": )", "Holiday", "/photo"), ok},
      {"get", one, R"("name":"Holiday")"},
      {"run", one, ok},
      {"run", one, R"("code":403)"},
      {"list", "{}", R"("status":"running")"},
      {"cancel", one, ok},
      {"cancel", one, ok},  // the daemon's 8: nothing to cancel
      {"delete", one, ok},
      {"list", "{}", R"("tasks":[])"},
      {"get", one, R"("code":401)"},
  };
  for (const auto& step : steps) {
    EXPECT_THAT(Api(step.method, step.params), testing::HasSubstr(step.holds)) << step.method;
  }
  const std::string log = ReadFile("/daemon.log");
  for (const char* line : {"add_task -> error 3\n", "run_task 1 -> error 3\n", "cancel_task 1 -> error 8\n",
                           "get_task_setting 1 -> error 4\n"}) {
    EXPECT_THAT(log, testing::HasSubstr(line));
  }
}

}  // namespace
