// plovo-api, run as its own process: parameters it cannot take end it with
// status 2 and a message, whatever the reader makes of them.
#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "emulation.h"
#include "sandbox.h"

namespace {

class PlovoApiTest : public plovo_test::SandboxTest {
 protected:
  // Runs plovo-api with method "get" and params; returns its exit status, or -1
  // when it did not exit normally (an abort), with its stderr in *err.
  int Run(const std::string& params, std::string* err) {
    const std::string errFile = Path("/stderr");
    pid_t pid = fork();
    if (pid == 0) {
      dup2(open("/dev/null", O_WRONLY), 1);
      dup2(open(errFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 2);
      execl(PLOVO_API_PATH, PLOVO_API_PATH, "get", params.c_str(), static_cast<char*>(nullptr));
      _exit(127);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    *err = ReadFile("/stderr");
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
};

TEST_F(PlovoApiTest, ParamsTheReaderRefusesEndWithStatusTwo) {
  PLOVO_SKIP_UNLESS_TARGET_PROGRAMS_RUN();
  const std::string deep = std::string(2000, '[') + std::string(2000, ']');
  const struct {
    const char* name;
    std::string params;
  } cases[] = {
      // Past the reader's nesting limit the reader throws.
      {"2000 nested arrays", R"({"a": )" + deep + "}"},
      {"not JSON", "{"},
      {"not an object", "[]"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    std::string err;
    EXPECT_EQ(2, Run(c.params, &err)) << err;
    EXPECT_EQ(0u, err.rfind("plovo-api: PARAMS_JSON ", 0)) << err;
  }
}

}  // namespace
