// Volumes declared in the sandbox's velt-dev/volumes.json.
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
  // The enumerated paths in order, or {"<rc>"} when the call fails.
  std::vector<std::string> All() {
    PVELTMOUNTVOLINFO list = reinterpret_cast<PVELTMOUNTVOLINFO>(1);
    int rc = VELTMountVolAllEnum(&list);
    if (rc < 0) return {list ? "<stale list>" : "<" + std::to_string(rc) + ">"};
    InfoPtr owner(list, VELTMountVolInfoFree);
    std::vector<std::string> paths;
    for (PVELTMOUNTVOLINFO v = list; v; v = v->pNext) paths.push_back(v->szPath);
    EXPECT_EQ(rc, static_cast<int>(paths.size()));
    return paths;
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

TEST_F(VolumeTest, UnmountedUndeclaredAndEnumeration) {
  Config(R"({"volumes": [{"path": "volume3"}, {"path": "volume1", "mounted": false},
      {"path": "/abs/usb", "writable": false, "location": "external", "free_bytes": 5,
       "total_bytes": 4294967296}]})");
  EXPECT_FALSE(Info(Path("/volume1")));
  EXPECT_EQ(VLIBC_ERR_NOT_MOUNTED, VLIBCErrGet());
  EXPECT_FALSE(Info(Path("/volume")));  // a prefix is no match
  EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
  EXPECT_EQ((std::vector<std::string>{Path("/volume3"), Path("/volume1"), "/abs/usb"}), All());
  InfoPtr usb = Info("/abs/usb/");
  ASSERT_TRUE(usb);
  EXPECT_TRUE(!usb->isWritable && usb->location == VELT_VOL_LOCATION_EXTERNAL);
  EXPECT_TRUE(usb->freeBytes == 5 && usb->totalBytes == 4294967296ULL);
}

TEST_F(VolumeTest, MissingConfigurationIsEmptyButBadOneIsReported) {
  EXPECT_EQ(std::vector<std::string>{}, All());
  for (const char* json : {R"({"volumes": [{"path": "volume1"})",
                           R"({"volumes": [{"path": "volume1", "location": "usb"}]})"}) {
    Config(json);
    EXPECT_EQ(std::vector<std::string>{"<-1>"}, All()) << json;
    EXPECT_FALSE(Info(Path("/volume1"))) << json;
    EXPECT_EQ(VLIBC_ERR_BAD_CONFIG, VLIBCErrGet()) << json;
  }
}

}  // namespace
