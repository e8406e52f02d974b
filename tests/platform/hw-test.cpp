// What the copy daemon asks of the NAS's hardware: ejecting a share's
// device (velt/share.h) and the buzzer (velt/hw.h). On the development
// platform the eject shows in storage.json, both in system.log.
#include <json/reader.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <velt/dev.h>
#include <velt/hw.h>
#include <velt/share.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "sandbox.h"

namespace {

const char* const kStorage = "/velt-dev/storage.json";

// Shares, one unmounted, and what an eject must carry over: devices of any
// shape, an unknown key, large and fractional numbers.
const char* const kDeclared = R"({"note": "kept", "size": 18446744073709551615, "ratio": 0.1,
  "shares": [{"name": "usbshare1", "dev_path": "dev/usb1"},
    {"name": "sdcard", "path": "/abs/sd", "mounted": true, "x": [1, {"y": null}]},
    {"name": "old", "mounted": false}],
  "devices": [{"product": "Stick \u00e9", "partitions": [{"share_name": "usbshare1"}]}, 7]})";

Json::Value Parse(const std::string& text) {
  Json::Value value;
  std::istringstream in(text);
  EXPECT_TRUE(Json::parseFromStream(Json::CharReaderBuilder(), in, &value, nullptr)) << text;
  return value;
}

class HardwareTest : public plovo_test::SandboxTest {
 protected:
  // The lines of system.log without their time stamps.
  std::vector<std::string> LogLines() const {
    std::vector<std::string> lines;
    std::istringstream in(ReadFile("/velt-dev/system.log"));
    for (std::string line; std::getline(in, line);) lines.push_back(line.substr(line.find('\t')));
    return lines;
  }
};

TEST_F(HardwareTest, EjectUnmountsOnlyThatShareKeepsTheRestAndLogsOnce) {
  WriteFile(kStorage, kDeclared);
  ASSERT_EQ(0, chmod(Path(kStorage).c_str(), 0600));
  ASSERT_EQ(0, VELTShareEject("sdcard")) << VLIBCErrGet();
  Json::Value want = Parse(kDeclared);
  want["shares"][1]["mounted"] = false;
  EXPECT_EQ(want, Parse(ReadFile(kStorage))) << ReadFile(kStorage);
  struct stat st {};
  EXPECT_TRUE(stat(Path(kStorage).c_str(), &st) == 0 && (st.st_mode & 07777) == 0600);
  EXPECT_EQ(-1, VELTShareEject("sdcard"));  // ejected already
  EXPECT_EQ(VLIBC_ERR_NOT_MOUNTED, VLIBCErrGet());
  EXPECT_EQ(std::vector<std::string>{"\t1\t1\t0x11A00101\tStorage\tsdcard\tejected\t"}, LogLines());
}

TEST_F(HardwareTest, FailedEjectLeavesStorageAsItWas) {
  // Makes every file write past a few bytes fail, even for root.
  auto smallFiles = [](const std::function<void()>& call) {
    struct rlimit old {};
    getrlimit(RLIMIT_FSIZE, &old);
    const struct rlimit limit = {16, old.rlim_max};
    auto handler = signal(SIGXFSZ, SIG_IGN);
    setrlimit(RLIMIT_FSIZE, &limit);
    call();
    setrlimit(RLIMIT_FSIZE, &old);
    signal(SIGXFSZ, handler);
  };
  auto plain = [](const std::function<void()>& call) { call(); };
  auto lockIsFolder = [&](const std::function<void()>& call) {
    MakeDir(kStorage + std::string(".lock"));
    call();
  };
  const struct {
    const char* share;
    std::string storage;  // empty: no velt-dev folder at all
    std::function<void(const std::function<void()>&)> around;
    int code;
  } cases[] = {
      {nullptr, kDeclared, plain, VLIBC_ERR_BAD_PARAMETER},
      {"", kDeclared, plain, VLIBC_ERR_BAD_PARAMETER},
      {"usbshare", kDeclared, plain, VLIBC_ERR_NOT_FOUND},
      {"usbshare1", "", plain, VLIBC_ERR_NOT_FOUND},
      {"old", kDeclared, plain, VLIBC_ERR_NOT_MOUNTED},
      {"usbshare1", "{\"shares\": [", plain, VLIBC_ERR_BAD_CONFIG},
      {"usbshare1", R"({"shares": [{"name": "usbshare1", "mounted": "yes"}]})", plain,
       VLIBC_ERR_BAD_CONFIG},
      {"usbshare1", kDeclared, smallFiles, VLIBC_ERR_IO},
      {"usbshare1", kDeclared, lockIsFolder, VLIBC_ERR_IO},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(&c - cases);
    std::filesystem::remove_all(Path("/velt-dev"));
    if (!c.storage.empty()) WriteFile(kStorage, c.storage);
    int rc = 0, err = 0;
    c.around([&] { rc = VELTShareEject(c.share); err = VLIBCErrGet(); });
    EXPECT_TRUE(rc == -1 && err == c.code) << rc << " " << err;
    EXPECT_EQ(c.storage, ReadFile(kStorage));
    EXPECT_FALSE(Exists("/velt-dev/system.log"));
  }
}

// Each eject rewrites the whole file; without the lock between them one
// would write back the share the other had just ejected. Two threads let go
// together hit that window in about half the rounds.
TEST_F(HardwareTest, TwoEjectsAtOnceBothLand) {
  constexpr int kRounds = 50;
  for (int round = 0; round < kRounds; ++round) {
    WriteFile(kStorage, R"({"shares": [{"name": "usb0"}, {"name": "usb1"}]})");
    std::atomic<int> ready{0};
    int results[2] = {-2, -2};
    auto eject = [&](int i) {
      const std::string name = "usb" + std::to_string(i);
      for (++ready; ready.load() < 2;) {
      }
      results[i] = VELTShareEject(name.c_str());
    };
    std::thread first(eject, 0), second(eject, 1);
    first.join();
    second.join();
    const Json::Value shares = Parse(ReadFile(kStorage))["shares"];
    ASSERT_TRUE(results[0] == 0 && results[1] == 0 && shares[0]["mounted"] == false &&
                shares[1]["mounted"] == false)
        << round << ": " << ReadFile(kStorage);
  }
  EXPECT_EQ(2u * kRounds, LogLines().size());
}

// Fault switches fail one call and leave no trace; a failing log fails the
// beep (the line is the beep) but not the eject, which keeps the caller's
// last error.
TEST_F(HardwareTest, BeepsFaultSwitchesAndLogFailures) {
  WriteFile(kStorage, kDeclared);
  for (const char* call : {"VELTShareEject", "VELTBuzzerBeep"}) {
    VeltDevFailCall(call, 1, 1, VLIBC_ERR_NO_MEMORY);
  }
  EXPECT_TRUE(VELTShareEject("usbshare1") == -1 && VLIBCErrGet() == VLIBC_ERR_NO_MEMORY);
  EXPECT_TRUE(VELTBuzzerBeep(VELT_BEEP_LONG) == -1 && VLIBCErrGet() == VLIBC_ERR_NO_MEMORY);
  EXPECT_EQ(kDeclared, ReadFile(kStorage));
  EXPECT_FALSE(Exists("/velt-dev/system.log"));
  for (int kind : {0, 3, -1}) {
    EXPECT_TRUE(VELTBuzzerBeep(kind) == -1 && VLIBCErrGet() == VLIBC_ERR_BAD_PARAMETER) << kind;
  }
  EXPECT_TRUE(VELTBuzzerBeep(VELT_BEEP_SHORT) == 0 && VELTBuzzerBeep(VELT_BEEP_LONG) == 0);
  const std::string beep = "\t1\t1\t0x11A00201\tBuzzer\t";
  EXPECT_EQ((std::vector<std::string>{beep + "short\t\t", beep + "long\t\t"}), LogLines());

  VeltDevFailCall("VELTLogSet1", 1, 0, VLIBC_ERR_IO);
  EXPECT_TRUE(VELTBuzzerBeep(VELT_BEEP_SHORT) == -1 && VLIBCErrGet() == VLIBC_ERR_IO);
  EXPECT_EQ(-1, VELTShareEject(""));
  EXPECT_EQ(0, VELTShareEject("usbshare1"));
  EXPECT_EQ(VLIBC_ERR_BAD_PARAMETER, VLIBCErrGet());
  EXPECT_TRUE(Parse(ReadFile(kStorage))["shares"][0]["mounted"] == false);
  EXPECT_EQ(2u, LogLines().size());
}

}  // namespace
