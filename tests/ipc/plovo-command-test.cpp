#include "ipc/plovo-command.h"

#include <gtest/gtest.h>

namespace {

// The builders the web actions call are checked through them, on the wire
// and in the daemon's hands (tests/webapi/task-actions-test.cpp); here are
// what those cannot reach: the records' defaults and the builders no action
// uses yet.

TEST(CommandBuilders, ListTaskIsExactlyActionAndAck) {
  PObject request;
  request["left_over"] = 1;  // a reused object must not carry old keys along
  ASSERT_EQ(Plovo::ListTaskCmd(request), 0);
  EXPECT_EQ(request.toString(), "{\"action\": \"list_task\", \"need_ack\": 1}");
  ASSERT_EQ(Plovo::ListEntryCmd(request), 0);
  EXPECT_EQ(request.toString(), "{\"action\": \"list_entry\", \"need_ack\": 1}");
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

}  // namespace
