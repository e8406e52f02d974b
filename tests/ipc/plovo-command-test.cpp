#include "ipc/plovo-command.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <syslog.h>
#include <unistd.h>

#include <memory>
#include <set>

#include "common/file-op.h"
#include "ipc/daemon-ipc.h"
#include "ipc/stream.h"
#include "log-capture.h"
#include "sandbox.h"
#include "test-daemon.h"
#include "velt/dev.h"

namespace {

std::set<std::string> Keys(const PObject& map) {
  std::set<std::string> keys;
  for (const auto& [key, value] : map.asMap()) keys.insert(key);
  return keys;
}

// What PStream puts on the wire for value.
std::string WireBytes(const PObject& value) {
  int fds[2];
  EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  Channel channel(81920);
  EXPECT_EQ(channel.Open(fds[0], true), 0);
  EXPECT_EQ(PStream().Send(channel, value), 0);
  channel.Close();
  std::string out;
  char buf[4096];
  ssize_t n;
  while ((n = read(fds[1], buf, sizeof buf)) > 0) out.append(buf, static_cast<size_t>(n));
  close(fds[1]);
  return out;
}

std::string Str(const std::string& text) {
  return std::string{0x10, 0, static_cast<char>(text.size())} + text;
}

TEST(CommandBuilders, ListTaskIsExactlyActionAndAckOnTheWire) {
  PObject request;
  request["left_over"] = 1;  // a reused object must not carry old keys along
  ASSERT_EQ(Plovo::ListTaskCmd(request), 0);
  EXPECT_EQ(request.toString(), "{\"action\": \"list_task\", \"need_ack\": 1}");
  EXPECT_EQ(WireBytes(request),
            "\x42" + Str("action") + Str("list_task") + Str("need_ack") + std::string("\x01\x01\x01\x40", 4));
  ASSERT_EQ(Plovo::ListEntryCmd(request), 0);
  EXPECT_EQ(request.toString(), "{\"action\": \"list_entry\", \"need_ack\": 1}");
}

TEST(CommandBuilders, TaskIdCommands) {
  const struct {
    int (*build)(unsigned long, PObject&);
    const char* action;
  } cases[] = {{Plovo::EnableTaskCmd, "enable_task"},         {Plovo::DisableTaskCmd, "disable_task"},
               {Plovo::StartTaskCmd, "run_task"},             {Plovo::StopTaskCmd, "cancel_task"},
               {Plovo::DeleteTaskCmd, "remove_task"},         {Plovo::GetTaskSettingCmd, "get_task_setting"},
               {Plovo::GetFilterSettingCmd, "get_filter_setting"}};
  for (const auto& c : cases) {
    PObject request;
    ASSERT_EQ(c.build(7, request), 0) << c.action;
    EXPECT_EQ(request.toString(), std::string("{\"action\": \"") + c.action + "\", \"need_ack\": 1, \"task_id\": 7}");
  }
}

TEST(CommandBuilders, DefaultTaskSettingGoesOutAsIntegersWithoutStrategy) {
  Plovo::TaskSetting task;
  task.usb_share_name = "usbshare1";
  task.copy_strategy = Registry::COPY_STRATEGY_MIRROR;
  PObject request;
  ASSERT_EQ(Plovo::SetTaskSettingCmd(3, task, request), 0);
  EXPECT_EQ(request.toString(),
            "{\"action\": \"set_task_setting\", \"conflict_policy\": 1, \"enable_rotation\": 0, "
            "\"keep_dir_structure\": 1, \"max_version_count\": 256, \"nas_folder_path\": \"\", "
            "\"nas_share_name\": \"\", \"need_ack\": 1, \"remove_src_file\": 0, \"rename_photo_video\": 0, "
            "\"rotation_policy\": 1, \"smart_create_date_dir\": 0, \"task_id\": 3, \"task_name\": \"\", "
            "\"task_type\": 1, \"usb_folder_path\": \"\"}");
  // Enumerations are 32-bit signed and widen with their sign.
  task.task_type = static_cast<Registry::TASK_TYPE>(-1);
  Plovo::SetTaskSettingCmd(3, task, request);
  EXPECT_EQ(request["task_type"].asUInt64(), UINT64_MAX);
}

TEST(CommandBuilders, TriggerFilterAndGlobalSettings) {
  Plovo::TriggerTimeSetting trigger;
  PObject request;
  Plovo::SetTriggerTimeSettingCmd(5, trigger, request);
  EXPECT_EQ(request.toString(),
            "{\"action\": \"set_trigger_time_setting\", \"eject_when_task_done\": 1, \"need_ack\": 1, "
            "\"run_when_plug_in\": 0, \"schedule_enabled\": 0, \"schedule_json_str\": \"{}\", \"task_id\": 5}");
  trigger.schedule["week_days"].append(1);
  trigger.schedule["hour"] = 3;
  Plovo::SetTriggerTimeSettingCmd(5, trigger, request);
  EXPECT_EQ(request["schedule_json_str"].asString(), "{\"hour\":3,\"week_days\":[1]}");

  Plovo::FilterSetting filter;
  filter.white_ext.append("jpg");
  filter.white_ext.append(7);  // not a string: left out
  filter.white_ext.append("png");
  filter.black_name.append("tmp");
  Plovo::SetFilterSettingCmd(5, filter, request);
  EXPECT_EQ(request.toString(),
            "{\"action\": \"set_filter_setting\", \"black_ext\": [], \"black_name\": [\"tmp\"], "
            "\"custom_ext\": [], \"custom_name\": [], \"need_ack\": 1, \"task_id\": 5, \"white_ext\": "
            "[\"jpg\", \"png\"], \"white_name\": []}");

  Plovo::SetGlobalSettingCmd(true, request);
  EXPECT_EQ(request.toString(), "{\"action\": \"set_global_setting\", \"beep_on_task_start_end\": 1, \"need_ack\": 1}");
  Plovo::SetGlobalSettingCmd(false, request);
  EXPECT_EQ(request["beep_on_task_start_end"].asUInt64(), 0u);
}

// A sandbox with one USB share, "usbshare1", mounted at <root>/usbshare1,
// whose device is an empty image: a file system without an identity.
class CreateTaskTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/usbshare1");
    MakeDir("/usbshare2");
    WriteFile("/dev/usb1", "");
    Declare(R"("shares": [{"name": "usbshare1", "dev_path": "dev/usb1"},
                          {"name": "usbshare2", "mounted": false, "dev_path": "dev/usb1"}],
               "devices": [{"producer": "Acme", "product": "Stick", "partitions": "none"},
                           {"producer": "Acme", "product": "Card", "partitions": [{"share_name": "usbshare1"}]}])");
    task_.usb_share_name = "usbshare1";
    task_.nas_share_name = "photo";
    task_.usb_folder_path = "/DCIM";
    task_.nas_folder_path = "/trip";
    task_.task_name = "Trip";
    task_.copy_strategy = Registry::COPY_STRATEGY_INCREMENTAL;
    filter_.custom_ext.append("raw");
  }
  void Declare(const std::string& members) const { WriteFile("/velt-dev/storage.json", "{" + members + "}"); }
  std::string StoredUuid() const {
    std::string uuid;
    EXPECT_EQ(ReadPlovoConfig(Path("/usbshare1"), "uuid", uuid), 1);
    return uuid;
  }
  int Create(PObject& request) { return Plovo::CreateTaskCmd(task_, trigger_, filter_, request); }

  Plovo::TaskSetting task_;
  Plovo::TriggerTimeSetting trigger_;
  Plovo::FilterSetting filter_;
};

TEST_F(CreateTaskTest, ANewIdentityIsStoredOnTheDeviceAndReadBackNextTime) {
  plovo_test::LogCapture log;
  PObject first;
  ASSERT_EQ(Create(first), 0) << log.Dump();
  const std::string uuid = StoredUuid();
  EXPECT_EQ(uuid.size(), 36u);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to get uuid for dev_path '" + Path("/dev/usb1") + "'")) << log.Dump();
  EXPECT_TRUE(log.Contains(LOG_WARNING, "[WARN] plovo-command(")) << log.Dump();
  EXPECT_TRUE(log.Contains("write uuid '" + uuid + "' to config file")) << log.Dump();
  // The first device's partitions are not a list: it is passed over.
  EXPECT_TRUE(log.Contains(LOG_DEBUG, "USBData partitions is invalid")) << log.Dump();

  EXPECT_EQ(Keys(first),
            (std::set<std::string>{"action", "need_ack", "uuid", "usb_share_path", "nas_share_name",
                                   "usb_folder_path", "nas_folder_path", "producer", "product", "task_name",
                                   "task_type", "copy_strategy", "keep_dir_structure", "smart_create_date_dir",
                                   "rename_photo_video", "remove_src_file", "conflict_policy", "enable_rotation",
                                   "max_version_count", "rotation_policy", "run_when_plug_in",
                                   "eject_when_task_done", "schedule_enabled", "schedule_json_str", "white_name",
                                   "white_ext", "black_name", "black_ext", "custom_name", "custom_ext"}));
  EXPECT_EQ(first["action"].asString(), "add_task");
  EXPECT_EQ(first["uuid"].asString(), uuid);
  EXPECT_EQ(first["usb_share_path"].asString(), Path("/usbshare1"));
  EXPECT_EQ(first["producer"].asString(), "Acme");
  EXPECT_EQ(first["product"].asString(), "Card");
  EXPECT_EQ(first["copy_strategy"].asUInt64(), 3u);
  EXPECT_EQ(first["usb_folder_path"].asString(), "/DCIM");
  EXPECT_EQ(first["custom_ext"].toString(), "[\"raw\"]");

  plovo_test::LogCapture again;
  PObject second;
  ASSERT_EQ(Create(second), 0);
  EXPECT_EQ(second["uuid"].asString(), uuid);
  EXPECT_FALSE(again.Contains("write uuid")) << again.Dump();

  // What the daemon receives is the map as built.
  MakeDir("/tmp");
  auto daemon = std::make_unique<plovo_test::TestDaemon>();
  PObject answer;
  ASSERT_EQ(DaemonIPC().SendCommand(second, answer), 0);
  EXPECT_EQ(daemon->LastRequest().toString(), second.toString());
}

TEST_F(CreateTaskTest, AShareThatIsMissingOrNotMountedFailsBeforeAnyDeviceLookup) {
  plovo_test::LogCapture log;
  PObject request;
  task_.usb_share_name = "usbshare9";
  EXPECT_EQ(Create(request), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to open share 'usbshare9'")) << log.Dump();

  task_.usb_share_name = "usbshare2";
  VeltDevFailCall("VELTDevPathGet", 1, 0, VLIBC_ERR_IO);  // would show as a dev_path failure
  EXPECT_EQ(Create(request), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Share 'usbshare2' is not mounted")) << log.Dump();
  EXPECT_FALSE(log.Contains("dev_path")) << log.Dump();
  EXPECT_FALSE(Exists("/usbshare2/@eaDir"));
}

TEST_F(CreateTaskTest, EachDeviceStepFailsWithItsLine) {
  plovo_test::LogCapture log;
  PObject request;
  VeltDevFailCall("VELTDevPathGet", 1, 1, VLIBC_ERR_NOT_FOUND);
  EXPECT_EQ(Create(request), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to get dev_path for usb_share_path '" + Path("/usbshare1") + "'"))
      << log.Dump();

  // The identity cannot be stored: "@eaDir" is in the way as a plain file.
  WriteFile("/usbshare1/@eaDir", "");
  EXPECT_EQ(Create(request), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to write Plovo config '" + Path("/usbshare1") + "', uuid '"))
      << log.Dump();
}

TEST_F(CreateTaskTest, TheDeviceMustBeListedByTheStorageService) {
  plovo_test::LogCapture log;
  PObject request;
  const std::string failed = "Failed to get usb info for usb_share_name 'usbshare1'";

  VeltDevFailCall("GetUSBInfo", 1, 1, VLIBC_ERR_IO);
  EXPECT_EQ(Create(request), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to get USBInfo")) << log.Dump();
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to get all usb data")) << log.Dump();
  EXPECT_TRUE(log.Contains(LOG_ERR, failed)) << log.Dump();

  Declare(R"("shares": [{"name": "usbshare1", "dev_path": "dev/usb1"}], "devices": {"sdq": {}})");
  plovo_test::LogCapture invalid;
  EXPECT_EQ(Create(request), -1);
  EXPECT_TRUE(invalid.Contains(LOG_ERR, "USBInfo is invalid ({\n\t\"devices\" : \n\t{\n\t\t\"sdq\" : {}"))
      << invalid.Dump();
  EXPECT_TRUE(invalid.Contains(LOG_ERR, failed)) << invalid.Dump();

  Declare(R"("shares": [{"name": "usbshare1", "dev_path": "dev/usb1"}],
             "devices": [{"producer": "Acme", "product": "Card", "partitions": [{"share_name": "usbshare3"}]}])");
  plovo_test::LogCapture unlisted;
  EXPECT_EQ(Create(request), -1);
  EXPECT_TRUE(unlisted.Contains(LOG_DEBUG, "producer and product not found for share_name 'usbshare1'"))
      << unlisted.Dump();
  EXPECT_TRUE(unlisted.Contains(LOG_ERR, failed)) << unlisted.Dump();
}

}  // namespace
