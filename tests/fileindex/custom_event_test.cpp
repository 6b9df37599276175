#include "fileindex/util/custom_event.h"

#include <gtest/gtest.h>
#include <json/reader.h>

#include <sstream>

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
  kRoot.SetShares(Share("s", "") + "," + Share("off", R"(, "encrypted": true)"));
  const std::string reindex = R"({"event":65536,"path":")" + kRoot / "v/s/a" + "\"}\n";
  const std::string whole = R"({"event":8,"path":"/x"})";
  Json::Value data;  // As read by a program that keeps comments.
  std::istringstream("/* two\n lines */ [\"x\" // one\n]") >> data;
  struct Row {
    const char *name, *share, *below;
    int event;
    std::string live, snapshot;  // Queue files before; "" for none.
    int code;
    bool adds, marks;
    bool fails = false;
  };
  for (const Row& row : {
           Row{"First", "s", "a", 0x20000, "", "", 0, true, false},
           Row{"BytesThatAreNotUtf8", "s", "\xE9\"\n", 0x100, "", "", 0, true, false},
           Row{"LockedShare", "off", "a", 0x10000, "", "", 0, false, false},
           Row{"CoveredBySnapshot", "s", "a", 0x80, "", reindex, 0, false, false},
           Row{"NotCovered", "s", "ab", 0x20000, reindex, "", 0, true, false},
           Row{"LineWithoutNewline", "s", "a", 0x40, whole, "", 0, true, false},
           Row{"BadLine", "s", "a", 0x40, "{\"ev", "", 906, false, true},
           Row{"NoShare", "", "a", 0x40, "", "", 502, false, false},
           Row{"NegativeMask", "s", "a", -1, "", "", 120, false, true},
           Row{"FullDisk", "s", "a", 0x40, whole, "", 502, false, true, true},
       }) {
    SCOPED_TRACE(row.name);
    const std::string path = kRoot / "v/" + row.share + "/" + row.below;
    const std::string queue =
        vexlo::sdk::SDKShare(*row.share == '\0' ? "s" : row.share).GetQueuePath();
    for (const auto& [file, text] : {std::pair{queue, row.live}, {queue + ".tmp", row.snapshot}}) {
      text.empty() ? void(unlink(file.c_str())) : WriteText(file, text);
    }
    WriteText(kRoot / "var/packages/Vexlo/etc/fileindex.status", "{\"share\":{\"s\":4}}");
    const SyslogCapture quiet;
    try {
      const ScopedFault fault(row.fails ? "write" : "", ENOSPC);
      AddCustomEvent(row.event, path, "/old", data);
      EXPECT_EQ(row.code, 0);
    } catch (const vexlo::Error& error) {
      EXPECT_EQ(error.GetErrorCode(), row.code);
    }
    const std::string line = R"({"data":["x"],"event":)" + std::to_string(row.event) +
                             R"(,"path":)" + vexlo::JsonToString(path) + R"(,"path_old":"/old"})";
    const std::string newline = row.live == whole ? "\n" : "";
    EXPECT_EQ(ReadText(queue), row.adds           ? row.live + newline + line + "\n"
                               : row.live.empty() ? "<missing>"
                                                  : row.live);
    EXPECT_EQ(StatusMgr().GetShareStatus("s"), row.marks ? 5U : 4U);
    EXPECT_EQ(StatusMgr().GetShareStatus(""), 0U);
  }
}

}  // namespace
