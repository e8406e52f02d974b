// Volumes declared in the sandbox's velt-dev/volumes.json.
#include <velt/mount.h>

#include <memory>
#include <string>

#include "sandbox.h"

namespace {

using InfoPtr = std::unique_ptr<VELTMOUNTVOLINFO, void (*)(PVELTMOUNTVOLINFO)>;

class VolumeTest : public plovo_test::SandboxTest {
 protected:
  void Config(const std::string& json) { WriteFile("/velt-dev/volumes.json", json); }
  // The description of path; null when the call fails.
  InfoPtr Info(const std::string& path) {
    PVELTMOUNTVOLINFO info = reinterpret_cast<PVELTMOUNTVOLINFO>(1);
    int rc = VELTMountVolInfoGet(path.c_str(), &info);
    EXPECT_EQ(rc == 0, info != nullptr) << path;
    return InfoPtr(info, VELTMountVolInfoFree);
  }
};

TEST_F(VolumeTest, RelativePathLiesUnderRootWithDefaults) {
  MakeDir("/volume1");
  Config(R"({"volumes": [{"path": "volume1/"}]})");
  InfoPtr info = Info(Root() + "/volume1/");
  ASSERT_TRUE(info);
  EXPECT_EQ(Root() + "/volume1", info->szPath);
  EXPECT_TRUE(info->isMounted && info->isWritable && info->location == VELT_VOL_LOCATION_INTERNAL);
  EXPECT_TRUE(info->freeBytes > 0 && info->freeBytes <= info->totalBytes);
  EXPECT_FALSE(Info("/volume1"));  // only the resolved path matches
}

TEST_F(VolumeTest, UnmountedAndUndeclaredVolumesAndDeclaredFields) {
  Config(R"({"volumes": [{"path": "volume3"}, {"path": "volume1", "mounted": false},
      {"path": "/abs/usb", "writable": false, "location": "external", "free_bytes": 5,
       "total_bytes": 4294967296}]})");
  EXPECT_FALSE(Info(Path("/volume1")));
  EXPECT_EQ(VLIBC_ERR_NOT_MOUNTED, VLIBCErrGet());
  EXPECT_FALSE(Info(Path("/volume")));  // a prefix is no match
  EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
  InfoPtr usb = Info("/abs/usb/");
  ASSERT_TRUE(usb);
  EXPECT_TRUE(!usb->isWritable && usb->location == VELT_VOL_LOCATION_EXTERNAL);
  EXPECT_TRUE(usb->freeBytes == 5 && usb->totalBytes == 4294967296ULL);
}

}  // namespace
