// plovod's command handler in this process, on a sandbox's repository.
#include <gmock/gmock.h>

#include "daemon-sandbox.h"
#include "daemon/daemon.h"

namespace {

class DaemonTest : public plovo_test::DaemonSandboxTest {};

TEST_F(DaemonTest, AddedTaskIsListedWithItsDevicePlugged) {
  plovod::Daemon daemon(RepoPath(), false, [] {});
  ASSERT_EQ(daemon.Open(), 0);
  const PObject added = daemon.Handle(AddTaskRequest("Card"));
  ASSERT_EQ(added["ack"].asStringRef(), "ok") << added.asString();
  PObject list;
  list["action"] = "list_task";
  const PObject listed = daemon.Handle(list);
  ASSERT_EQ(listed["task_list"].asArray().size(), 1u);
  EXPECT_EQ(listed["task_list"].asArray()[0]["usb_share_name"].asStringRef(), "usbshare1");
  EXPECT_TRUE(listed["task_list"].asArray()[0]["is_task_runnable"].asBool());
}

}  // namespace
