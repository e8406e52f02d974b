#include "service/global-setting.h"

#include <velt/dev.h>

#include "sandbox.h"

namespace {

using Plovo::GlobalSetting;

class GlobalSettingTest : public plovo_test::SandboxTest {
 protected:
  static constexpr const char* kSetting = "/var/packages/Plovo/etc/setting.conf";
};

TEST_F(GlobalSettingTest, InitBeepWritesYesOnlyWhenAbsent) {
  WriteFile(kSetting, "repo_vol_path=\"/volume1\"\n");
  EXPECT_TRUE(init_global_setting());
  EXPECT_EQ(ReadFile(kSetting), "repo_vol_path=\"/volume1\"\nbeep=\"yes\"\n");
  EXPECT_TRUE(GlobalSetting::GetBeep());

  ASSERT_TRUE(GlobalSetting::SetBeep(false));
  EXPECT_TRUE(GlobalSetting::InitBeep());
  EXPECT_FALSE(GlobalSetting::GetBeep());
  EXPECT_EQ(ReadFile(kSetting), "repo_vol_path=\"/volume1\"\nbeep=\"no\"\n");
}

TEST_F(GlobalSettingTest, BeepIsOnOnlyForYesInAnyCase) {
  for (const char* on : {"yes", "YES", "yEs"}) {
    WriteFile(kSetting, std::string("beep=\"") + on + "\"\n");
    EXPECT_TRUE(GlobalSetting::GetBeep()) << on;
  }
  // A value that merely starts with "yes" stays off, also where the 5-byte
  // buffer cuts it.
  for (const char* off : {"no", "", "1", "true", "yes2", "yesss", "y"}) {
    WriteFile(kSetting, std::string("beep=\"") + off + "\"\n");
    EXPECT_FALSE(GlobalSetting::GetBeep()) << off;
  }
}

TEST_F(GlobalSettingTest, RepoVolumePathIsCutAt63Bytes) {
  const std::string longPath = "/" + std::string(80, 'v');
  WriteFile(kSetting, "repo_vol_path=\"" + longPath + "\"\n");
  EXPECT_EQ(GlobalSetting::GetRepoVolumePath(), longPath.substr(0, 63));
  WriteFile(kSetting, "beep=\"yes\"\n");
  EXPECT_EQ(GlobalSetting::GetRepoVolumePath(), "");
}

TEST_F(GlobalSettingTest, PlatformFailuresFailTheCallAndChangeNothing) {
  WriteFile(kSetting, "beep=\"yes\"\n");
  VeltDevFailCall("VLIBCFileGetKeyValue", 1, 0, VLIBC_ERR_IO);
  EXPECT_FALSE(GlobalSetting::InitBeep());
  EXPECT_FALSE(GlobalSetting::GetBeep());
  EXPECT_EQ(GlobalSetting::GetRepoVolumePath(), "");
  VeltDevClearFaults();
  VeltDevFailCall("VLIBCFileSetKeyValue", 1, 1, VLIBC_ERR_IO);
  EXPECT_FALSE(GlobalSetting::SetBeep(false));
  EXPECT_EQ(ReadFile(kSetting), "beep=\"yes\"\n");
}

}  // namespace
