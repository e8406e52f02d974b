#include "common/velt-sdk-wrapper.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>

#include "common/file-op.h"
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
