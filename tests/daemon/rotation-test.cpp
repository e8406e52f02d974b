// Version folder names and which versions rotation removes.
#include "daemon/engine/rotation.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <optional>
#include <tuple>
#include <vector>

namespace {

constexpr time_t kNow = 1000000000;  // 2001-09-09 01:46:40 UTC
constexpr time_t H = 3600, D = 24 * H, W = 7 * D, M = 30 * D;

// Names are in local time; a zone in its summer time shows an hour or a summer flag lost on the way.
TEST(VersionNames, RoundTripInLocalTimeAndOtherFoldersAreNotVersions) {
  const char* host = std::getenv("TZ");
  const std::optional<std::string> hostTz = host ? std::optional<std::string>(host) : std::nullopt;
  setenv("TZ", "CET-1CEST,M3.5.0,M10.5.0/3", 1);
  tzset();
  const std::pair<const char*, int> names[] = {  // the sequence that makes the name, 0 for none
      {"2001-09-09_034640", 1}, {"2001-09-09_034640_2", 2}, {"2001-09-09_034640_12", 12}, {"holiday", 0},
      {"2001-09-09_034640_1", 0}, {"2001-09-09_034640_02", 0}, {"2001-09-09_034640_", 0}, {"2001-09-09_034640x", 0},
      {"2001-09-09_034640_2x", 0}, {"2001-13-09_034640", 0}, {"2001-09-09 034640", 0}};
  for (const auto& [name, sequence] : names) {
    time_t started = 0;
    EXPECT_EQ(plovod::ParseVersionName(name, started) && started == kNow, sequence > 0) << name;
    EXPECT_TRUE(sequence == 0 || plovod::VersionName(kNow, sequence) == name) << name;
  }
  hostTz ? setenv("TZ", hostTz->c_str(), 1) : unsetenv("TZ");
  tzset();
}

TEST(Rotation, RemovesTheOldestAndThinsByDayAndWeek) {
  const std::tuple<std::vector<time_t>, unsigned long, int, std::vector<size_t>> cases[] = {
      // ages of the versions (made at kNow - age), max, policy, the versions removed
      {{2 * D, 0, 4 * D, 1 * D, 3 * D}, 3, 1, {2, 4}},  // the oldest beyond max, listed in order
      {{5, 1, 3}, 0, 1, {0, 2}},                        // max 0 keeps one
      {{H, H}, 1, 1, {0}},                              // of the same second, the later is newer
      // All of the last day, the newest of each day to 30 days back, then of each week from there.
      {{0, D - 1, D, D + 1, 2 * D - 1, 2 * D, M - 1, M, M + 6 * D, M + W - 1, M + W, 99 * D}, 20, 2, {3, 4, 8, 9}},
      {{0, D, D + 1, 2 * D, 40 * D}, 2, 2, {2, 3, 4}},  // thinned, then max
  };
  for (const auto& [ages, max, policy, removed] : cases) {
    std::vector<time_t> versions;
    for (time_t age : ages) versions.push_back(kNow - age);
    EXPECT_EQ(plovod::VersionsToRemove(versions, kNow, max, policy), removed) << testing::PrintToString(ages);
  }
}

}  // namespace
