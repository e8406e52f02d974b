// Version folder names and which versions rotation removes.
#include "daemon/engine/rotation.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <optional>

namespace {

constexpr time_t kNow = 1000000000;
constexpr time_t H = 3600, D = 24 * H;

class RotationTest : public ::testing::Test {
 protected:
  // Names are in local time; UTC here, whatever the host's zone.
  void SetUp() override {
    if (const char* tz = std::getenv("TZ")) oldTz_ = tz;
    setenv("TZ", "UTC", 1);
    tzset();
  }
  void TearDown() override {
    oldTz_ ? setenv("TZ", oldTz_->c_str(), 1) : unsetenv("TZ");
    tzset();
  }
  std::optional<std::string> oldTz_;
};

TEST_F(RotationTest, NamesRoundTripAndOtherFoldersAreNotVersions) {
  const struct {
    int sequence;
    const char* name;
  } made[] = {{1, "2001-09-09_014640"}, {2, "2001-09-09_014640_2"}, {12, "2001-09-09_014640_12"}};
  for (const auto& m : made) {
    EXPECT_EQ(plovod::VersionName(kNow, m.sequence), m.name);
    time_t started = 0;
    EXPECT_TRUE(plovod::ParseVersionName(m.name, started) && started == kNow) << m.name;
  }
  time_t parsed = 0;
  EXPECT_TRUE(plovod::ParseVersionName("2024-02-29_235959", parsed) && parsed == 1709251199);
  setenv("TZ", "CET-1CEST,M3.5.0,M10.5.0/3", 1);  // summer time in September
  tzset();
  EXPECT_EQ(plovod::VersionName(kNow), "2001-09-09_034640");
  EXPECT_TRUE(plovod::ParseVersionName("2001-09-09_034640", parsed) && parsed == kNow);
  for (const char* name : {"holiday", "", "2001-09-09_014640_1", "2001-09-09_014640_02", "2001-09-09_014640_",
                           "2001-09-09_014640x", "2001-09-09_014640_2x", "2001-13-09_014640", "2001-02-29_014640",
                           "2001-09-09_240000", "2001-09-09_016000", "2001-09-09 014640", "2001-09-09_01464x", "2001-9-09_0146400"}) {
    time_t started = 0;
    EXPECT_FALSE(plovod::ParseVersionName(name, started)) << name;
  }
}

TEST_F(RotationTest, RemovesTheOldestAndThinsByDayAndWeek) {
  const struct {
    const char* what;
    std::vector<time_t> ages;  // versions made at kNow - age
    unsigned long max;
    int policy;
    std::vector<size_t> removed;
  } cases[] = {
      {"oldest beyond max", {2 * D, 0, 4 * D, 1 * D, 3 * D}, 3, 1, {2, 4}},
      {"max 0 keeps one", {5, 1, 3}, 0, 1, {0, 2}},
      {"under max", {0, D, 90 * D}, 3, 1, {}},
      {"same second", {H, H}, 1, 1, {0}},
      {"last day kept whole", {0, H, 23 * H, D - 1}, 10, 2, {}},
      {"newest of each day", {D - 1, D, D + 1, 2 * D - 1, 2 * D, 29 * D + 5}, 10, 2, {2, 3}},
      {"same second in a day", {3 * D, 3 * D}, 10, 2, {0}},
      {"newest of each week", {30 * D - 1, 30 * D, 36 * D, 37 * D - 1, 37 * D, 100 * D}, 10, 2, {2, 3}},
      {"all older than a month", {33 * D, 31 * D, 32 * D}, 10, 2, {0, 2}},
      {"thinned, then max", {0, D, D + 1, 2 * D, 40 * D}, 2, 2, {2, 3, 4}},
      {"future versions", {-5 * D, -D, 0, 2 * D}, 2, 2, {2, 3}},
  };
  for (const auto& c : cases) {
    std::vector<time_t> versions;
    for (time_t age : c.ages) versions.push_back(kNow - age);
    EXPECT_EQ(plovod::VersionsToRemove(versions, kNow, c.max, c.policy), c.removed) << c.what;
  }
}

}  // namespace
