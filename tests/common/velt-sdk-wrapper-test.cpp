#include "common/velt-sdk-wrapper.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <thread>
#include <vector>

#include "common/file-op.h"
#include "log-capture.h"
#include "sandbox.h"
#include "velt/dev.h"
#include "velt/storage.h"

namespace {

// Two shares: usbshare1 mounted at <root>/usbshare1 on the device image
// dev/usb1, and usbshare2, declared but not mounted.
class PlatformShareTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/usbshare1");
    WriteFile("/dev/usb1", "");
    WriteFile("/velt-dev/storage.json",
              R"({"shares": [{"name": "usbshare1", "dev_path": "dev/usb1"},
                             {"name": "usbshare2", "path": "/mnt/x", "mounted": false, "dev_path": "dev/usb2"}],
                  "devices": [{"producer": "Acme", "partitions": [{"share_name": "usbshare1"}], "port": 2}]})");
  }
};

TEST_F(PlatformShareTest, SharesAreFoundByNameWithTheirMountState) {
  SDK::Share share;
  ASSERT_EQ(share.open("usbshare1"), 0);
  EXPECT_TRUE(share.isMounted());
  EXPECT_EQ(share.getMountPoint(), Path("/usbshare1"));
  ASSERT_EQ(share.open("usbshare2"), 0);
  EXPECT_FALSE(share.isMounted());
  EXPECT_EQ(share.getMountPoint(), "/mnt/x");
  EXPECT_EQ(share.open("nosuch"), -1);
  EXPECT_EQ(VLIBCErrGet(), VLIBC_ERR_NOT_FOUND);
  EXPECT_FALSE(share.isMounted());
  EXPECT_EQ(share.getMountPoint(), "");

  WriteFile("/velt-dev/storage.json", R"({"shares": [{"name": "usbshare1", "mounted": "yes"}]})");
  EXPECT_EQ(share.open("usbshare1"), -1);
  EXPECT_EQ(VLIBCErrGet(), VLIBC_ERR_BAD_CONFIG);
}

TEST_F(PlatformShareTest, TheDeviceBehindAPathIsThatOfTheMountedShareHoldingIt) {
  std::string dev;
  ASSERT_EQ(SDK::GetDevPath(Path("/usbshare1"), dev), 0);
  EXPECT_EQ(dev, Path("/dev/usb1"));
  ASSERT_EQ(SDK::GetDevPath(Path("/usbshare1/DCIM/"), dev), 0);
  EXPECT_EQ(dev, Path("/dev/usb1"));
  // Neither a name that only starts alike nor an unmounted share counts.
  EXPECT_EQ(SDK::GetDevPath(Path("/usbshare10"), dev), -1);
  EXPECT_EQ(dev, "");
  EXPECT_EQ(SDK::GetDevPath("/mnt/x", dev), -1);
}

TEST_F(PlatformShareTest, IdentityComesFromTheFileSystemThenTheDeviceConfig) {
  std::string uuid;
  EXPECT_EQ(SDK::GetUUID(Path("/usbshare1"), Path("/dev/usb1"), uuid), -1);
  ASSERT_EQ(WritePlovoConfig(Path("/usbshare1"), "uuid", "stored-id"), 0);
  ASSERT_EQ(SDK::GetUUID(Path("/usbshare1"), Path("/dev/usb1"), uuid), 0);
  EXPECT_EQ(uuid, "stored-id");

  // A real file system's identity wins over the stored one.
  const char* mke2fs = access("/usr/sbin/mke2fs", X_OK) == 0 ? "/usr/sbin/mke2fs" : "/sbin/mke2fs";
  if (access(mke2fs, X_OK) != 0) GTEST_SKIP() << "mke2fs is needed to make a file system image";
  const std::string image = Path("/dev/usb1");
  ASSERT_EQ(truncate(image.c_str(), 1 << 20), 0);
  const std::string id = "0b5f4c2e-1d3a-4e6f-9a8b-7c6d5e4f3a2b";
  ASSERT_EQ(std::system((std::string(mke2fs) + " -q -F -t ext2 -U " + id + " " + image + " >/dev/null 2>&1").c_str()), 0);
  ASSERT_EQ(SDK::GetUUID(Path("/usbshare1"), image, uuid), 0);
  EXPECT_EQ(uuid, id);

  VeltDevFailCall("VELTDevFsUuidGet", 1, 1, VLIBC_ERR_IO);
  ASSERT_EQ(SDK::GetUUID(Path("/usbshare1"), image, uuid), 0);
  EXPECT_EQ(uuid, "stored-id");
}

TEST(NewIdentity, IsARandomLowerCaseUuidText) {
  const std::string a = SDK::GenerateUUID(), b = SDK::GenerateUUID();
  EXPECT_NE(a, b);
  ASSERT_EQ(a.size(), 36u);
  EXPECT_EQ(a.find_first_not_of("0123456789abcdef-"), std::string::npos) << a;
  EXPECT_EQ(a[14], '4') << a;  // version 4: random
}

// Concurrent creators on a device without identity must agree on one, the
// one stored, and exactly one of them must report having stored it.
TEST_F(PlatformShareTest, ConcurrentCreatorsAgreeOnTheStoredIdentity) {
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
        results[i] = SDK::GetOrCreateUUID(root, dev, uuids[i]);
      });
    }
    go = true;
    for (std::thread& t : threads) t.join();

    std::string stored;
    ASSERT_EQ(ReadPlovoConfig(root, "uuid", stored), 1) << "round " << round;
    ASSERT_EQ(stored.size(), 36u);
    int writers = 0;
    for (int i = 0; i < kThreads; ++i) {
      ASSERT_GE(results[i], 0) << "round " << round;
      writers += results[i];
      ASSERT_EQ(uuids[i], stored) << "round " << round << ", thread " << i;
    }
    ASSERT_EQ(writers, 1) << "round " << round;
  }
}

TEST_F(PlatformShareTest, CreationGivesUpOnALockHeldElsewhereAndLeavesAStoredIdentityAlone) {
  const std::string root = Path("/usbshare1"), dev = Path("/dev/usb1");
  const std::string config = PlovoConfigPath(root);
  MakeDir("/usbshare1/@eaDir");
  const int held = open((config + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  ASSERT_GE(held, 0);
  ASSERT_EQ(flock(held, LOCK_EX), 0);
  {
    plovo_test::LogCapture log;
    std::string uuid = "left over";
    EXPECT_EQ(SDK::GetOrCreateUUID(root, dev, uuid, std::chrono::milliseconds(50)), -1);
    EXPECT_EQ(uuid, "");
    EXPECT_TRUE(log.Contains(LOG_ERR, "still held after 50 ms")) << log.Dump();
    EXPECT_FALSE(Exists("/usbshare1/@eaDir/.VeltraPlovo.config"));
  }
  close(held);

  std::string uuid;
  ASSERT_EQ(SDK::GetOrCreateUUID(root, dev, uuid), 1);
  std::string stored;
  ASSERT_EQ(ReadPlovoConfig(root, "uuid", stored), 1);
  EXPECT_EQ(uuid, stored);

  // A stored identity is returned as it is: the file is not even replaced.
  struct stat before, after;
  ASSERT_EQ(stat(config.c_str(), &before), 0);
  std::string again;
  EXPECT_EQ(SDK::GetOrCreateUUID(root, dev, again), 0);
  EXPECT_EQ(again, stored);
  ASSERT_EQ(stat(config.c_str(), &after), 0);
  EXPECT_EQ(after.st_ino, before.st_ino);
}

TEST_F(PlatformShareTest, TheStorageServiceAnswersTheDeclaredDevices) {
  Json::Value info;
  ASSERT_EQ(VELT::QXS::STORAGE_WEBUTILS::Storage::GetUSBInfo(info), 0);
  EXPECT_EQ(info["devices"][0]["producer"].asString(), "Acme");
  EXPECT_EQ(info["devices"][0]["port"].asInt(), 2);
  EXPECT_EQ(info["devices"][0]["partitions"][0]["share_name"].asString(), "usbshare1");

  unlink(Path("/velt-dev/storage.json").c_str());
  ASSERT_EQ(VELT::QXS::STORAGE_WEBUTILS::Storage::GetUSBInfo(info), 0);
  EXPECT_TRUE(info["devices"].isArray());
  EXPECT_EQ(info["devices"].size(), 0u);

  WriteFile("/velt-dev/storage.json", "{\"devices\": [");
  EXPECT_EQ(VELT::QXS::STORAGE_WEBUTILS::Storage::GetUSBInfo(info), -1);
  EXPECT_EQ(VLIBCErrGet(), VLIBC_ERR_BAD_CONFIG);
  EXPECT_TRUE(info.isNull());
}

}  // namespace
