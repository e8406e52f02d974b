// The development platform's eject (velt/share.h) and buzzer (velt/hw.h).
#include <json/reader.h>
#include <signal.h>
#include <sys/resource.h>
#include <velt/dev.h>
#include <velt/hw.h>
#include <velt/share.h>

#include <filesystem>
#include <sstream>
#include <sstream>
#include <string>
#include <thread>

#include "sandbox.h"

namespace {

namespace fs = std::filesystem;
using HardwareTest = plovo_test::SandboxTest;
const char* const kStorage = "/velt-dev/storage.json";
const char* const kDeclared = R"({"note": 1, "shares": [{"name": "usbshare1"},
  {"name": "sdcard", "path": "/abs/sd"}, {"name": "old", "mounted": false}], "devices": [7, {}]})";

// An eject rewrites the whole file, all but one flag as it was read: without
// the lock, one of two at once would undo the other.
TEST_F(HardwareTest, TwoEjectsAtOnceBothLandAndKeepTheRest) {
  auto parse = [](const std::string& s) { Json::Value v; std::istringstream(s) >> v; return v; };
  Json::Value want = parse(kDeclared);
  want["shares"][0]["mounted"] = want["shares"][1]["mounted"] = false;
  for (int round = 0; round < 100; ++round) {
    WriteFile(kStorage, kDeclared);
    fs::permissions(Path(kStorage), fs::perms(0640));  // neither a new file's mode nor a temp's
    std::thread other([] { VELTShareEject("usbshare1"); });
    VELTShareEject("sdcard");
    other.join();
    ASSERT_EQ(want, parse(ReadFile(kStorage))) << round << ": " << ReadFile(kStorage);
    ASSERT_EQ(fs::perms(0640), fs::status(Path(kStorage)).permissions());
  }
}

// A failed eject leaves storage.json as it was and logs nothing. Code IO: no
// write past 16 bytes succeeds, even root's; NO_MEMORY: the fault switch.
TEST_F(HardwareTest, FailedEjectsLeaveNoTrace) {
  WriteFile(kStorage, kDeclared);
  const struct { const char* share; int code; } cases[] = {
      {nullptr, VLIBC_ERR_BAD_PARAMETER}, {"", VLIBC_ERR_BAD_PARAMETER},
      {"usbshare", VLIBC_ERR_NOT_FOUND}, {"sdcard2", VLIBC_ERR_NOT_FOUND},
      {"old", VLIBC_ERR_NOT_MOUNTED}, {"sdcard", VLIBC_ERR_IO}, {"sdcard", VLIBC_ERR_NO_MEMORY}};
  for (const auto& c : cases) {
    SCOPED_TRACE(&c - cases);
    if (c.code == VLIBC_ERR_NO_MEMORY) VeltDevFailCall("VELTShareEject", 1, 1, c.code);
    struct rlimit old {};
    getrlimit(RLIMIT_FSIZE, &old);
    const struct rlimit limit = {c.code == VLIBC_ERR_IO ? 16 : old.rlim_cur, old.rlim_max};
    auto handler = signal(SIGXFSZ, SIG_IGN);
    setrlimit(RLIMIT_FSIZE, &limit);
    const int rc = VELTShareEject(c.share), err = VLIBCErrGet();
    setrlimit(RLIMIT_FSIZE, &old);
    signal(SIGXFSZ, handler);
    EXPECT_TRUE(rc == -1 && err == c.code) << rc << " " << err;
  }
  EXPECT_EQ(kDeclared, ReadFile(kStorage));
  EXPECT_FALSE(Exists("/velt-dev/system.log"));
  WriteFile(kStorage, "{");
  EXPECT_TRUE(VELTShareEject("sdcard") == -1 && VLIBCErrGet() == VLIBC_ERR_BAD_CONFIG);
}

// A failing log fails the beep (the line is the beep) but not the eject,
// which keeps the caller's last error.
TEST_F(HardwareTest, EjectAndBeepLogTheirEvents) {
  WriteFile(kStorage, kDeclared);
  VeltDevFailCall("VELTBuzzerBeep", 1, 1, VLIBC_ERR_NO_MEMORY);
  EXPECT_TRUE(VELTBuzzerBeep(VELT_BEEP_LONG) == -1 && VLIBCErrGet() == VLIBC_ERR_NO_MEMORY);
  for (int kind : {0, 3, -1}) EXPECT_EQ(-1, VELTBuzzerBeep(kind)) << kind;
  EXPECT_EQ(VLIBC_ERR_BAD_PARAMETER, VLIBCErrGet());
  EXPECT_TRUE(VELTShareEject("sdcard") == 0 && VELTBuzzerBeep(VELT_BEEP_SHORT) == 0 &&
              VELTBuzzerBeep(VELT_BEEP_LONG) == 0);
  std::istringstream log(ReadFile("/velt-dev/system.log"));
  std::string unstamped;  // each line without its time stamp
  for (std::string line; std::getline(log, line);) unstamped += line.substr(line.find('\t')) + "\n";
  EXPECT_EQ("\t1\t1\t0x11A00101\tStorage\tsdcard\tejected\t\n"
            "\t1\t1\t0x11A00201\tBuzzer\tshort\t\t\n\t1\t1\t0x11A00201\tBuzzer\tlong\t\t\n",
            unstamped);
  VeltDevFailCall("VELTLogSet1", 1, 0, VLIBC_ERR_IO);
  EXPECT_TRUE(VELTBuzzerBeep(VELT_BEEP_SHORT) == -1 && VLIBCErrGet() == VLIBC_ERR_IO);
  EXPECT_EQ(-1, VELTShareEject(""));
  EXPECT_EQ(0, VELTShareEject("usbshare1"));
  EXPECT_EQ(VLIBC_ERR_BAD_PARAMETER, VLIBCErrGet());
}

}  // namespace
