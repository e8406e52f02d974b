#include "common/velt-sdk-wrapper.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>

#include "common/file-op.h"
#include "sandbox.h"
#include "velt/dev.h"

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

}  // namespace
