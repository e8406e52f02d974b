#include "common/usb-device.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <thread>
#include <vector>

#include "common/file-op.h"
#include "log-capture.h"
#include "sandbox.h"
#include "velt/dev.h"

namespace {

// One USB share, "usbshare1", mounted at <root>/usbshare1, whose device is
// an empty image: a file system without an identity of its own. usbshare2
// is declared but not mounted. The storage service lists a device whose
// partitions are not a list (passed over) before the one that holds
// usbshare1.
class USBDeviceTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/usbshare1");
    MakeDir("/usbshare2");
    MakeDir("/elsewhere");
    WriteFile("/dev/usb1", "");
    Declare(R"("shares": [{"name": "usbshare1", "dev_path": "dev/usb1"},
                          {"name": "usbshare2", "mounted": false, "dev_path": "dev/usb1"}],
               "devices": [{"producer": "Acme", "product": "Stick", "partitions": "none"},
                           {"producer": "Acme", "product": "Card", "partitions": [{"share_name": "usbshare1"}]}])");
  }
  void Declare(const std::string& members) const { WriteFile("/velt-dev/storage.json", "{" + members + "}"); }
  std::string StoredUuid() const {
    std::string uuid;
    EXPECT_EQ(ReadPlovoConfig(Path("/usbshare1"), "uuid", uuid), 1);
    return uuid;
  }
};

// Each step that can fail names itself, and a share that cannot be used
// fails before any device lookup.
TEST_F(USBDeviceTest, EachStepFailsWithItsLine) {
  const struct {
    const char* name;
    std::string share;
    std::function<void()> arrange;
    std::string line;
  } cases[] = {
      {"unknown share", "usbshare9", [] {}, "Failed to open share 'usbshare9'"},
      {"share not mounted", "usbshare2", [] { VeltDevFailCall("VELTDevPathGet", 1, 0, VLIBC_ERR_IO); },
       "Share 'usbshare2' is not mounted"},
      {"no block device", "usbshare1", [] { VeltDevFailCall("VELTDevPathGet", 1, 1, VLIBC_ERR_NOT_FOUND); },
       "Failed to get dev_path for usb_share_path '" + Path("/usbshare1") + "'"},
      // "@eaDir" is in the way as a plain file.
      {"identity not stored", "usbshare1", [this] { WriteFile("/usbshare1/@eaDir", ""); },
       "Failed to write Plovo config '" + Path("/usbshare1") + "', uuid '"},
      // A link planted on the device must not carry a root write elsewhere.
      {"folder is a link", "usbshare1", [this] { symlink(Path("/elsewhere").c_str(), Path("/usbshare1/@eaDir").c_str()); },
       "Failed to write Plovo config '" + Path("/usbshare1") + "', uuid '"},
      {"storage service fails", "usbshare1", [] { VeltDevFailCall("GetUSBInfo", 1, 1, VLIBC_ERR_IO); },
       "Failed to get all usb data"},
      {"storage answer without a device list", "usbshare1",
       [this] { Declare(R"("shares": [{"name": "usbshare1", "dev_path": "dev/usb1"}], "devices": {"sdq": {}})"); },
       "USBInfo is invalid ({\n\t\"devices\" : \n\t{\n\t\t\"sdq\" : {}"},
      {"device not listed", "usbshare1",
       [this] {
         Declare(R"("shares": [{"name": "usbshare1", "dev_path": "dev/usb1"}],
                    "devices": [{"partitions": [{"share_name": "usbshare3"}]}])");
       },
       "Failed to get usb info for usb_share_name 'usbshare1'"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    VeltDevClearFaults();
    unlink(Path("/usbshare1/@eaDir").c_str());
    c.arrange();
    plovo_test::LogCapture log;
    Plovo::USBDevice device;
    EXPECT_EQ(Plovo::ResolveUSBDevice(c.share, device), -1);
    EXPECT_TRUE(log.Contains(LOG_ERR, c.line)) << log.Dump();
  }
  EXPECT_FALSE(Exists("/usbshare2/@eaDir"));
  EXPECT_TRUE(std::filesystem::is_empty(Path("/elsewhere")));
}

// Concurrent creators on a device without identity must agree on one, the
// one stored, and exactly one of them must report having stored it.
TEST_F(USBDeviceTest, ConcurrentCreatorsAgreeOnTheStoredIdentity) {
  constexpr int kThreads = 16;
  const std::string root = Path("/usbshare1"), dev = Path("/dev/usb1");
  for (int round = 0; round < 20; ++round) {
    unlink(PlovoConfigPath(root).c_str());
    std::atomic<bool> go{false};
    std::vector<std::string> uuids(kThreads);
    std::vector<int> results(kThreads);
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) {
      threads.emplace_back([&, i] {
        while (!go) std::this_thread::yield();
        results[i] = Plovo::GetOrCreateUUID(root, dev, uuids[i]);
      });
    }
    go = true;
    for (std::thread& t : threads) t.join();

    const std::string stored = StoredUuid();
    int writers = 0;
    for (int i = 0; i < kThreads; ++i) {
      ASSERT_GE(results[i], 0) << "round " << round;
      writers += results[i];
      ASSERT_EQ(uuids[i], stored) << "round " << round << ", thread " << i;
    }
    ASSERT_EQ(writers, 1) << "round " << round;
  }
}

TEST_F(USBDeviceTest, CreationGivesUpOnALockHeldElsewhereAndLeavesAStoredIdentityAlone) {
  const std::string root = Path("/usbshare1"), dev = Path("/dev/usb1");
  const std::string config = PlovoConfigPath(root);
  MakeDir("/usbshare1/@eaDir");
  const int held = open((config + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  ASSERT_GE(held, 0);
  ASSERT_EQ(flock(held, LOCK_EX), 0);
  {
    plovo_test::LogCapture log;
    std::string uuid = "left over";
    EXPECT_EQ(Plovo::GetOrCreateUUID(root, dev, uuid, std::chrono::milliseconds(50)), -1);
    EXPECT_EQ(uuid, "");
    EXPECT_TRUE(log.Contains(LOG_ERR, "still held after 50 ms")) << log.Dump();
    EXPECT_FALSE(Exists("/usbshare1/@eaDir/.VeltraPlovo.config"));
  }
  close(held);

  std::string uuid;
  ASSERT_EQ(Plovo::GetOrCreateUUID(root, dev, uuid), 1);
  EXPECT_EQ(uuid, StoredUuid());

  // A stored identity is returned as it is: the file is not even replaced.
  struct stat before, after;
  ASSERT_EQ(stat(config.c_str(), &before), 0);
  std::string again;
  EXPECT_EQ(Plovo::GetOrCreateUUID(root, dev, again), 0);
  EXPECT_EQ(again, uuid);
  ASSERT_EQ(stat(config.c_str(), &after), 0);
  EXPECT_EQ(after.st_ino, before.st_ino);
}

}  // namespace
