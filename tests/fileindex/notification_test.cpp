#include "fileindex/util/notification.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "support/private_root.h"

using vexlo::fileindex::NotifyLackOfMemory;
using vexlo::fileindex::SendQPXNotify;

namespace {

const PrivateRoot kRoot;

TEST(Notification, RunsTheToolAndReturnsItsResult) {
  EXPECT_EQ(NotifyLackOfMemory(), -1);  // No tool there.
  const std::string tool = kRoot.MakeFolder("usr/kavo/bin") + "/kavoqpxnotify";
  WriteText(tool, "#!/bin/sh\nprintf '%s\\n' \"$@\" > '" + kRoot / "arguments" + "'\nexit 5\n");
  ASSERT_EQ(chmod(tool.c_str(), 0755), 0);
  EXPECT_EQ(SendQPXNotify(), 5);
  EXPECT_EQ(ReadText(kRoot / "arguments"),
            "-c\nKAVO.Vexlo.Application\n-b\ntrue\n-e\nfalse\n@administrators\napp:displayname\n"
            "error:index_no_space\n"
            "<a data-kavo-app=\"KAVO.Vexlo.Application\" data-kavo-fn=\"preference\">\n</a>\n");
  EXPECT_EQ(NotifyLackOfMemory(), 5);
  EXPECT_EQ(ReadText(kRoot / "arguments"),
            "-c\nKAVO.Vexlo.Application\n@administrators\napp:displayname\nerror:lack_of_memory\n");
}

}  // namespace
