// Volumes declared in the sandbox's velt-dev/volumes.json.
#include <sys/statvfs.h>
#include <velt/mount.h>

#include <memory>
#include <string>
#include <vector>

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
  Config(R"({"volumes": [{"path": "volume1/"}, {"path": "volume9"}]})");
  InfoPtr info = Info(Root() + "/volume1/");
  ASSERT_TRUE(info);
  EXPECT_EQ(Root() + "/volume1", info->szPath);
  EXPECT_TRUE(info->isMounted && info->isWritable && !info->pNext);
  EXPECT_EQ(VELT_VOL_LOCATION_INTERNAL, info->location);
  struct statvfs fs;
  ASSERT_EQ(0, statvfs(Path("/volume1").c_str(), &fs));
  EXPECT_EQ(1ULL * fs.f_blocks * fs.f_frsize, info->totalBytes);
  EXPECT_TRUE(info->freeBytes > 0 && info->freeBytes <= info->totalBytes);
  info = Info(Root() + "/volume9");  // declared, but no such folder
  ASSERT_TRUE(info);
  EXPECT_EQ(0u, info->freeBytes + info->totalBytes);
  EXPECT_FALSE(Info("/volume1"));  // only the resolved path matches
}

TEST_F(VolumeTest, UnmountedUndeclaredAndEnumeration) {
  Config(R"({"volumes": [{"path": "volume3"}, {"path": "volume1", "mounted": false},
      {"path": "/abs/usb", "writable": false, "location": "external", "free_bytes": 5,
       "total_bytes": 4294967296}]})");
  EXPECT_FALSE(Info(Path("/volume1")));
  EXPECT_EQ(VLIBC_ERR_NOT_MOUNTED, VLIBCErrGet());
  EXPECT_FALSE(Info(Path("/volume")));  // a prefix is no match
  EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
  PVELTMOUNTVOLINFO list = nullptr;
  ASSERT_EQ(3, VELTMountVolAllEnum(&list));
  InfoPtr owner(list, VELTMountVolInfoFree);
  std::vector<std::string> paths;
  for (PVELTMOUNTVOLINFO v = list; v; v = v->pNext) paths.push_back(v->szPath);
  EXPECT_EQ((std::vector<std::string>{Path("/volume3"), Path("/volume1"), "/abs/usb"}), paths);
  EXPECT_EQ(0, list->pNext->isMounted);
  InfoPtr usb = Info("/abs/usb/");
  ASSERT_TRUE(usb);
  EXPECT_EQ(0, usb->isWritable);
  EXPECT_EQ(VELT_VOL_LOCATION_EXTERNAL, usb->location);
  EXPECT_EQ(5u, usb->freeBytes);
  EXPECT_EQ(4294967296ULL, usb->totalBytes);
}

TEST_F(VolumeTest, MissingConfigurationMeansNoVolumes) {
  PVELTMOUNTVOLINFO list = reinterpret_cast<PVELTMOUNTVOLINFO>(1);
  EXPECT_EQ(0, VELTMountVolAllEnum(&list));
  EXPECT_EQ(nullptr, list);
  EXPECT_FALSE(Info(Path("/volume1")));
  EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
}

TEST_F(VolumeTest, BadConfigurationIsReported) {
  for (const char* json :
       {R"({"volumes": [{"path": "volume1"})",
        R"({"volumes": [{"path": "volume1", "location": "usb"}]})",
        R"({"volumes": [{"path": "volume1", "mounted": "yes"}]})",
        R"({"volumes": [{"path": "volume1", "free_bytes": -1}]})",
        R"({"volumes": [{"mounted": true}]})", R"({"volumes": {"path": "volume1"}})", "[]"}) {
    Config(json);
    PVELTMOUNTVOLINFO list = reinterpret_cast<PVELTMOUNTVOLINFO>(1);
    EXPECT_LT(VELTMountVolAllEnum(&list), 0) << json;
    EXPECT_EQ(nullptr, list);
    EXPECT_EQ(VLIBC_ERR_BAD_CONFIG, VLIBCErrGet()) << json;
    EXPECT_FALSE(Info(Path("/volume1"))) << json;
    EXPECT_EQ(VLIBC_ERR_BAD_CONFIG, VLIBCErrGet()) << json;
  }
}

}  // namespace
