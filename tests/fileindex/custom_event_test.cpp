#include "fileindex/util/custom_event.h"

#include <gtest/gtest.h>

#include "common/error.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "fileindex/status_mgr.h"
#include "support/faults.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

using vexlo::fileindex::AddCustomEvent;
using vexlo::fileindex::StatusMgr;

FAULTABLE(ssize_t, write, (int fd, const void* data, size_t size), (fd, data, size))

namespace {

const PrivateRoot kRoot;

std::string Share(const std::string& name, const std::string& flags) {
  return R"({"name": ")" + name + R"(", "path": ")" + kRoot.MakeFolder("v/" + name) + "\"" + flags +
         "}";
}

TEST(AddCustomEvent, AppendsOneLineOrNothing) {
  for (const char* needed : {"tmp", "var/packages/Vexlo/etc", "var/lib/kavo/fileindex/queue"}) {
    kRoot.MakeFolder(needed);
  }
  kRoot.SetShares(Share("s", "") + "," + Share("off", R"(, "encrypted": true)") + "," +
                  Share("ro", R"(, "read_only": true)"));
  const std::string reindex = R"({"event":65536,"path":")" + kRoot / "v/s/a" + "\"}\n";
  const std::string whole = R"({"event":8,"path":"/x"})";
  struct Row {
    const char *name, *share, *below;
    int event;
    std::string live, snapshot;  // Queue files before; "" for none.
    int code;
    bool adds, marks;
    int failing_writes = 0;  // 2 stands for all.
  };
  for (const Row& row : {
           Row{"First", "s", "a", 0x20000, "", "", 0, true, false},
           Row{"BytesThatAreNotUtf8", "s", "\xE9\"\n", 0x100, "", "", 0, true, false},
           Row{"LockedShare", "off", "a", 0x10000, "", "", 0, false, false},
           Row{"ReadOnlyShare", "ro", "a", 0x10000, "", "", 0, false, false},
           Row{"Covered", "s", "a/b", 0x20000, reindex, "", 0, false, false},
           Row{"CoveredBySnapshot", "s", "a", 0x80, "", reindex, 0, false, false},
           Row{"NotCovered", "s", "ab", 0x20000, reindex, "", 0, true, false},
           Row{"LineWithoutNewline", "s", "a", 0x40, whole, "", 0, true, false},
           Row{"BadLine", "s", "a", 0x40, "{\"ev", "", 906, false, true},
           Row{"NoShare", "", "a", 0x40, "", "", 502, false, false},
           Row{"NegativeMask", "s", "a", -1, "", "", 120, false, true},
           Row{"FullDisk", "s", "a", 0x40, whole, "", 502, false, true, 1},
           Row{"NoRoomForTheMark", "s", "a", 0x40, whole, "", 502, false, false, 2},
       }) {
    SCOPED_TRACE(row.name);
    const std::string path = kRoot / "v/" + row.share + "/" + row.below;
    const std::string queue =
        vexlo::sdk::SDKShare(*row.share == '\0' ? "s" : row.share).GetQueuePath();
    for (const auto& [file, text] : {std::pair{queue, row.live}, {queue + ".tmp", row.snapshot}}) {
      text.empty() ? void(unlink(file.c_str())) : WriteText(file, text);
    }
    WriteText(kRoot / "var/packages/Vexlo/etc/fileindex.status", "{\"share\":{\"s\":4}}");
    SyslogCapture log;
    std::string want_logged;
    try {
      const ScopedFault fault(row.failing_writes > 0 ? "write" : "", ENOSPC, 1,
                              /*lasting=*/row.failing_writes > 1);
      AddCustomEvent(row.event, path, "/old", vexlo::Vec2JsonArr<std::string>({"x"}));
      EXPECT_EQ(row.code, 0);
    } catch (const vexlo::Error& error) {
      EXPECT_EQ(error.GetErrorCode(), row.code);
      want_logged = "(AddCustomEvent) AddCustomEvent failed, code=" + std::to_string(row.code) +
                    ", reason=" + error.what() + ". Set [" + row.share + "] need reindex";
    }
    const std::string line = R"({"data":["x"],"event":)" + std::to_string(row.event) +
                             R"(,"path":)" + vexlo::JsonToString(path) + R"(,"path_old":"/old"})";
    const std::string newline = row.live == whole ? "\n" : "";
    EXPECT_EQ(ReadText(queue), row.adds           ? row.live + newline + line + "\n"
                               : row.live.empty() ? "<missing>"
                                                  : row.live);
    EXPECT_EQ(StatusMgr().GetShareStatus("s"), row.marks ? 5U : 4U);
    EXPECT_EQ(StatusMgr().GetShareStatus(""), 0U);
    std::string logged;
    for (const std::string& text : log.Take()) {
      logged += text.starts_with("<3>util:868 (") ? text.substr(text.find(") (") + 2) : "";
    }
    EXPECT_EQ(logged.substr(0, logged.rfind(" [err: ")), want_logged);
  }
}

}  // namespace
