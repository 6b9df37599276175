#include "fileindex/util/custom_event.h"

#include <gtest/gtest.h>

#include <optional>

#include "common/error.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "fileindex/status_mgr.h"
#include "support/faults.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

using namespace vexlo::fileindex;

namespace {

const PrivateRoot root;

}  // namespace

FAULTABLE(ssize_t, write, (int fd, const void* data, size_t size), (fd, data, size))

namespace {

const std::string kReindex = "{\"event\":65536,\"path\":\"" + root / "v/s/a" + "\"}";

struct Case {
  const char* name;
  std::string share, below;  // The path.
  int event;
  std::string live, snapshot;  // Before; "" for no file.
  int code;                    // Of what is thrown, 0 for nothing.
  std::string want;            // Before the new line, if any.
  bool want_line, want_marked;
  int failing_writes = 0;  // 2 stands for all.
};

TEST(AddCustomEvent, AppendsOneLineOrNothing) {
  root.SetShares("{\"name\": \"s\", \"path\": \"" + root.MakeFolder("v/s") +
                 "\"}, {\"name\": \"off\", \"encrypted\": true, \"path\": \"" +
                 root.MakeFolder("v/off") +
                 "\"}, {\"name\": \"ro\", \"read_only\": true, \"path\": \"" +
                 root.MakeFolder("v/ro") + "\"}");
  for (const char* folder : {"tmp", "var/packages/Vexlo/etc", "var/lib/kavo/fileindex/queue"}) {
    root.MakeFolder(folder);
  }
  const std::string status = root / "var/packages/Vexlo/etc/fileindex.status";
  const std::string none = "<missing>";
  const std::string whole = "{\"event\":8,\"path\":\"/x\"}";
  const Case cases[] = {
      {"First", "s", "a", 0x20000, "", "", 0, "", true, false},
      {"BytesThatAreNotUtf8", "s", "\xE9\"\n", 0x100, "", "", 0, "", true, false},
      {"LockedShare", "off", "a", 0x10000, "", "", 0, none, false, false},
      {"ReadOnlyShare", "ro", "a", 0x10000, "", "", 0, none, false, false},
      {"Covered", "s", "a/b", 0x20000, kReindex + "\n", "", 0, kReindex + "\n", false, false},
      {"CoveredBySnapshot", "s", "a", 0x80, "", kReindex + "\n", 0, none, false, false},
      {"NotCovered", "s", "ab", 0x20000, kReindex + "\n", "", 0, kReindex + "\n", true, false},
      {"NoNewline", "s", "a", 0x40, whole, "", 0, whole + "\n", true, false},
      {"BadLine", "s", "a", 0x40, "{\"ev", "", 906, "{\"ev", false, true},
      {"NoShare", "", "a", 0x40, "", "", 502, none, false, false},
      {"NegativeMask", "s", "a", -1, "", "", 120, none, false, true},
      {"FullDisk", "s", "a", 0x40, whole, "", 502, whole, false, true, 1},
      {"FullDiskForTheMarkToo", "s", "a", 0x40, whole, "", 502, whole, false, false, 2},
  };
  for (const Case& row : cases) {
    SCOPED_TRACE(row.name);
    const std::string path = root / "v/" + row.share + "/" + row.below;
    const std::string queue =
        vexlo::sdk::SDKShare(row.share.empty() ? "s" : row.share).GetQueuePath();
    for (const auto& [file, text] : {std::pair{queue, row.live}, {queue + ".tmp", row.snapshot}}) {
      text.empty() ? void(unlink(file.c_str())) : WriteText(file, text);
    }
    WriteText(status, "{\"share\":{\"s\":4}}");
    Json::Value data;
    data["photo"] = true;
    SyslogCapture log;
    int code = 0;
    std::string reason;
    {
      const ScopedFault fault(row.failing_writes > 0 ? "write" : "", ENOSPC, 1,
                              /*lasting=*/row.failing_writes > 1);
      try {
        AddCustomEvent(row.event, path, "/v/s/old", data);
      } catch (const vexlo::Error& error) {
        code = error.GetErrorCode();
        reason = error.what();
      }
    }
    EXPECT_EQ(code, row.code) << reason;
    std::string text = ReadText(queue);
    if (row.want_line) {
      ASSERT_TRUE(text.starts_with(row.want));
      const std::string line = text.substr(row.want.size());
      EXPECT_EQ(line.find('\n'), line.size() - 1);
      Json::Value want, got;
      want["event"] = row.event;
      want["path"] = path;
      want["path_old"] = "/v/s/old";
      want["data"] = data;
      EXPECT_TRUE(vexlo::JsonFromString(got, line) && got == want) << line;
      text = row.want;
    }
    EXPECT_EQ(text, row.want);
    EXPECT_EQ(StatusMgr().GetShareStatus("s"), row.want_marked ? 5U : 4U);
    EXPECT_EQ(StatusMgr().GetShareStatus(""), 0U);
    const std::string want_logged =
        "(AddCustomEvent) AddCustomEvent failed, code=" + std::to_string(code) +
        ", reason=" + reason + ". Set [" + row.share + "] need reindex";
    size_t logged = 0;
    for (const std::string& line : log.Take()) {
      logged += line.starts_with("<3>util:868 (") && line.find(want_logged) != line.npos ? 1 : 0;
    }
    EXPECT_EQ(logged, code == 0 ? 0U : 1U);
  }
}

}  // namespace
