#include "common/tmp-name.h"

#include <gtest/gtest.h>

#include <cstring>
#include <set>
#include <thread>
#include <vector>

namespace {

const std::string kAlphabet = "0123456789abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ-_";

bool IsName(const std::string& name) {
  return name.size() == 8 && name.find_first_not_of(kAlphabet) == std::string::npos;
}

// Expected values worked out by hand-running the algorithm (Python) on the
// key "1700000000-123456" followed by zeros.
TEST(TmpNameGen, KeystreamRestartsCountersButCarriesThePermutation) {
  unsigned char key[256] = {};
  memcpy(key, "1700000000-123456", 17);
  unsigned char state[256];
  TmpNameGen::rc4_init(state, key);

  unsigned char first[6], second[6];
  TmpNameGen::rc4_randomize(state, first, 6);
  TmpNameGen::rc4_randomize(state, second, 6);
  const unsigned char wantFirst[6] = {0x10, 0xef, 0x85, 0xc0, 0xe7, 0x59};
  const unsigned char wantSecond[6] = {0xb4, 0x88, 0x43, 0xa6, 0x4e, 0xc9};
  EXPECT_EQ(0, memcmp(first, wantFirst, 6));
  EXPECT_EQ(0, memcmp(second, wantSecond, 6));
  EXPECT_EQ(TmpNameGen::encode_name(first), "4e-5Metp");
  EXPECT_EQ(TmpNameGen::encode_name(second), "J8x3FAX9");
}

TEST(TmpNameGen, EncodingUsesTheWholeAlphabet) {
  const unsigned char low[6] = {0, 0, 0, 0, 0, 0};
  const unsigned char high[6] = {0xff, 0xff, 0xff, 0xff, 0xff, 0xff};
  const unsigned char ramp[6] = {0x04, 0x20, 0xc4, 0x14, 0x61, 0xc8};  // 6-bit groups 1 2 3 4 5 6 7 8
  EXPECT_EQ(TmpNameGen::encode_name(low), "00000000");
  EXPECT_EQ(TmpNameGen::encode_name(high), "________");
  EXPECT_EQ(TmpNameGen::encode_name(ramp), "12345678");
}

TEST(TmpNameGen, ConcurrentCallersGetDistinctWellFormedNames) {
  std::vector<std::vector<std::string>> perThread(4);
  std::vector<std::thread> threads;
  for (auto& names : perThread) {
    threads.emplace_back([&names] {
      for (int i = 0; i < 1000; ++i) names.push_back(TmpNameGen::getInstance().getTmpName());
    });
  }
  for (auto& t : threads) t.join();
  std::set<std::string> all;
  for (const auto& names : perThread) {
    for (const auto& n : names) {
      ASSERT_TRUE(IsName(n)) << n;
      all.insert(n);
    }
  }
  EXPECT_EQ(all.size(), 4000u);
}

}  // namespace
