// DaemonIPC against a daemon that does not keep to the protocol: what such
// a peer may cost the web server that runs the module is an error code,
// bounded in time and memory, and nothing on disk.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <functional>
#include <future>
#include <set>
#include <string>
#include <thread>

#include "common/paths.h"
#include "ipc/command-server.h"
#include "ipc/daemon-ipc.h"
#include "log-capture.h"
#include "sandbox.h"

namespace {

std::string B(std::initializer_list<int> bytes) {
  std::string s;
  for (int b : bytes) s += static_cast<char>(b);
  return s;
}

std::string Str(const std::string& text) {
  return B({0x10, static_cast<int>(text.size() >> 8), static_cast<int>(text.size() & 0xFF)}) + text;
}

// Sends all of data; false once the client is gone.
bool SendAll(int fd, const std::string& data) {
  size_t done = 0;
  while (done < data.size()) {
    ssize_t n = send(fd, data.data() + done, data.size() - done, MSG_NOSIGNAL);
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

// Reads the one-map request the client sends first (it ends with the map's
// end tag; the commands here hold no nested containers).
void ReadRequest(int fd) {
  char c;
  while (recv(fd, &c, 1, 0) == 1 && c != 0x40) {
  }
}

// A peer that answers bytes after the request, then closes.
std::function<void(int)> Answering(const std::string& bytes) {
  return [bytes](int fd) {
    ReadRequest(fd);
    SendAll(fd, bytes);
  };
}

// A daemon on the sandbox socket that serves each connection with a
// behaviour on its raw socket. Every behaviour is bounded in time, so a
// client that waits for ever fails the test instead of hanging it.
class HostilePeer {
 public:
  explicit HostilePeer(std::function<void(int)> behaviour)
      : server_([behaviour](CommandServer::Connection& connection) { behaviour(connection.fd()); }) {
    EXPECT_EQ(server_.Start(Plovo::Path::DaemonSocket()), 0);
  }

 private:
  CommandServer server_;
};

class HostileDaemonTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/tmp");
  }
  static PObject Command(const char* action) {
    PObject c;
    c["action"] = action;
    return c;
  }
  // One exchange with a short time limit; the client must give up by itself.
  static int Exchange(PObject& response, unsigned int limit = 1, const PObject& command = Command("list_task")) {
    DaemonIPC ipc;
    ipc.SetTimeLimit(limit);
    return ipc.SendCommand(command, response);
  }
};

std::set<std::string> Entries(const std::string& dir) {
  std::set<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) names.insert(entry.path().filename());
  return names;
}

// Whatever a broken answer held before it broke is not the daemon's word;
// a file in an answer is refused and written nowhere.
TEST_F(HostileDaemonTest, ABrokenAnswerLeavesTheAnswerEmptyAndAFileIsWrittenNowhere) {
  const auto rootBefore = Entries("/");
  const auto cwdBefore = Entries(".");
  const auto sandboxBefore = Entries(Path("/tmp"));
  const std::string cutAfterCode = B({0x42}) + Str("error_code") + B({0x01, 0x01, 0x08});
  const std::string withFile =
      B({0x42}) + Str("ack") + Str("ok") + Str("file") + B({0x30, 0, 0, 0, 0, 0, 0, 0, 5}) + "xxxxx" + B({0x40});
  for (const std::string& bytes : {cutAfterCode, cutAfterCode + Str("x") + B({0x77}), withFile}) {
    HostilePeer peer(Answering(bytes));
    PObject response;
    response["stale"] = 1;
    EXPECT_EQ(Exchange(response), -1);
    EXPECT_TRUE(response.isNull()) << response.toString();
  }
  EXPECT_EQ(Entries("/"), rootBefore);
  EXPECT_EQ(Entries("."), cwdBefore);
  EXPECT_EQ(Entries(Path("/tmp")), sandboxBefore);
}

// A peer that keeps the connection busy or held must not keep the caller:
// the whole exchange has a deadline that progress does not extend.
TEST_F(HostileDaemonTest, TheWholeExchangeHasADeadline) {
  struct Case {
    const char* name;
    std::function<void(int, std::atomic<bool>&)> behaviour;
  };
  const Case cases[] = {
      {"one byte at a time",
       [](int fd, std::atomic<bool>& cutOff) {
         ReadRequest(fd);
         SendAll(fd, B({0x42}) + Str("task_list") + B({0x41}));
         // Each byte is progress, so the per-wait limit alone never ends it.
         for (int i = 0; i < 60; ++i) {
           std::this_thread::sleep_for(std::chrono::milliseconds(100));
           if (!SendAll(fd, B({0x00, 0x00}))) {
             cutOff = true;
             return;
           }
         }
       }},
      {"answer cut short, connection held",
       [](int fd, std::atomic<bool>& cutOff) {
         ReadRequest(fd);
         SendAll(fd, B({0x42}) + Str("ack"));
         // The client sends nothing more: readable means it has closed.
         pollfd p{fd, POLLIN, 0};
         cutOff = poll(&p, 1, 6000) == 1;
       }},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::atomic<bool> cutOff{false};
    {
      HostilePeer peer([&](int fd) { c.behaviour(fd, cutOff); });
      PObject response;
      EXPECT_EQ(Exchange(response), -1);
      EXPECT_TRUE(response.isNull());
    }
    EXPECT_TRUE(cutOff) << "the client waited as long as the peer liked";
  }
}

TEST_F(HostileDaemonTest, AnEndlessAnswerIsRefusedAtTheSizeBound) {
  std::atomic<bool> cutOff{false};
  plovo_test::LogCapture log;
  {
    HostilePeer peer([&](int fd) {
      ReadRequest(fd);
      SendAll(fd, B({0x42}) + Str("task_list") + B({0x41}));
      // Tiny values cost the receiver far more memory than wire bytes; past
      // the bound the client must stop reading. 4 Mi values of three bytes
      // each hold 256 MiB of charges, four times the bound.
      std::string block;
      for (int i = 0; i < 4096; ++i) block += B({0x01, 0x01, 0x07});
      for (int i = 0; i < 1024; ++i) {
        if (!SendAll(fd, block)) {
          cutOff = true;
          return;
        }
      }
    });
    PObject response;
    EXPECT_EQ(Exchange(response, 30), -1);
    EXPECT_TRUE(response.isNull());
  }
  EXPECT_TRUE(cutOff) << "the whole endless answer was taken";
  EXPECT_TRUE(log.Contains("PStream: message exceeds 67108864 bytes")) << log.Dump();
}

TEST_F(HostileDaemonTest, ALongAnswerIsLoggedCut) {
  plovo_test::LogCapture log;
  {
    HostilePeer peer(Answering(B({0x42}) + Str("error") + Str(std::string(60000, 'e')) + B({0x40})));
    PObject response;
    EXPECT_EQ(Exchange(response), -1);
    EXPECT_EQ(response["error"].asStringRef().size(), 60000u) << "the caller still gets the whole answer";
  }
  ASSERT_TRUE(log.Contains(LOG_ERR, "SendCommand error: \"eeee")) << log.Dump();
  // The debug trace shows each string whole (at most 64 KiB); the lines
  // a server keeps are cut.
  for (const auto& line : log.Lines()) {
    EXPECT_TRUE(line.priority >= LOG_DEBUG || line.text.size() < DaemonIPC::kLogTextLimit + 100) << line.text.size();
  }
  EXPECT_TRUE(log.Contains("(60002 bytes in all)")) << log.Dump();
}

// A command that cannot be sent whole is not sent at all: the daemon would
// otherwise take the part that left for a command of its own.
TEST_F(HostileDaemonTest, ARefusedCommandPutsNoByteOnTheWire) {
  PObject longString = Command("add_task");
  longString["task_name"] = std::string(65536, 'n');
  PObject buffer = Command("add_task");
  buffer["raw"] = PObject::buffer_type();
  PObject deep = Command("add_task");
  PObject* at = &deep["nested"];
  for (int i = 0; i < 70; ++i) at = &(*at)["n"];
  PObject missingFile = Command("add_task");
  PObject::binary_type file;
  file.path = "/nonexistent/plovo-source";
  file.length = 1;
  missingFile["z"] = file;
  for (const PObject* command : {&longString, &buffer, &deep, &missingFile}) {
    // The first receive tells a client that closed without a byte (0).
    std::promise<ssize_t> received;
    std::future<ssize_t> bytes = received.get_future();
    HostilePeer peer([&](int fd) {
      char c;
      received.set_value(recv(fd, &c, 1, 0));
    });
    PObject response;
    EXPECT_EQ(Exchange(response, 2, *command), -1);
    ASSERT_EQ(bytes.wait_for(std::chrono::seconds(10)), std::future_status::ready);
    EXPECT_EQ(bytes.get(), 0);
  }
}

TEST_F(HostileDaemonTest, AFullListenQueueFailsTheConnectInsteadOfBlocking) {
  int listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  Plovo::Path::DaemonSocket().copy(addr.sun_path, sizeof(addr.sun_path) - 1);
  ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)), 0);
  ASSERT_EQ(listen(listener, 0), 0);
  // Fill the queue of a daemon that never accepts.
  std::vector<int> queued;
  for (int i = 0; i < 16; ++i) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
      close(fd);
      break;
    }
    queued.push_back(fd);
  }
  ASSERT_FALSE(queued.empty());
  auto result = std::async(std::launch::async, [] {
    PObject response;
    return Exchange(response);
  });
  const bool finished = result.wait_for(std::chrono::seconds(10)) == std::future_status::ready;
  close(listener);  // releases a connect that blocked, so the test ends either way
  EXPECT_TRUE(finished) << "the connect blocked";
  EXPECT_EQ(result.get(), -1);
  for (int fd : queued) close(fd);
}

}  // namespace
