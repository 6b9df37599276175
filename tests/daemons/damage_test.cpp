// Every file of lists and state with each of its bits flipped, and cut off at each place: what
// reads it refuses the whole, or loses no more than the damage touches.
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <iterator>
#include <memory>
#include <optional>
#include <set>
#include <sstream>
#include <string>

#include "common/error.h"
#include "common/json.h"
#include "daemons/fileindexd/share_state.h"
#include "daemons/kavocontentextractd/quarantine.h"
#include "daemons/kavoelasticd/registry.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/paths.h"
#include "fileindex/queue_mgr.h"
#include "fileindex/status_mgr.h"
#include "kavo/local/monitor_queues.h"
#include "kavo/local/shares.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"
#include "support/temp_folder.h"

namespace {

const PrivateRoot kRoot;
namespace index = vexlo::fileindex;

// What a file says, an element for each part that damage may touch by itself; none when it is
// refused.
using Answer = std::optional<std::set<std::string>>;

Answer ReadFolders(const std::string& /*file*/) {
  std::set<std::string> folders;
  const index::FolderMgr list;
  for (const auto& folder : list.GetFolders()) {
    folders.insert(vexlo::JsonToString(folder->GetData()));
  }
  return folders;
}

Answer ReadStatus(const std::string& /*file*/) {
  const index::StatusMgr status;
  return std::set<std::string>{"pause " + std::to_string(status.GetPauseInfo()),
                               "share " + std::to_string(status.GetShareStatus("photo"))};
}

Answer ReadShareState(const std::string& file) {
  const vexlo::fileindexd::ShareState state = vexlo::fileindexd::LoadShareState(file);
  if (state == vexlo::fileindexd::ShareState()) {
    return std::nullopt;
  }
  const auto list = [](const std::set<std::string>& paths) {
    return vexlo::JsonToString(vexlo::Vec2JsonArr<std::string>({paths.begin(), paths.end()}));
  };
  return std::set<std::string>{
      "crawl " + (state.crawl ? state.crawl->root + state.crawl->after : ""),
      "rebuilt " + std::to_string(state.rebuilt), "crawled " + list(state.crawled),
      "missed " + list(state.missed.Paths())};
}

// Set aside, never overwritten: who looks into the matter finds it as it was.
void ExpectKept(const std::string& aside, const std::string& bytes) {
  EXPECT_EQ(ReadText(aside), bytes);
  std::filesystem::remove(aside);
}

Answer ReadQuarantine(const std::string& file) {
  const std::string bytes = ReadText(file);
  vexlo::extractd::Quarantine list(file);
  if (!std::filesystem::exists(file)) {
    ExpectKept(file + ".damaged", bytes);
    return std::nullopt;
  }
  std::set<std::string> entries;
  for (const uint64_t inode : {7, 8}) {
    if (const auto fault = list.Find({1, inode, 3, 4, 5})) {
      entries.insert(std::to_string(inode) + fault->Reason() + fault->what());
    }
  }
  return entries;
}

Answer ReadRegistry(const std::string& file) {
  const std::string bytes = ReadText(file);
  const vexlo::elasticd::Registry registry(file);
  if (!std::filesystem::exists(file)) {
    ExpectKept(file + ".damaged-1", bytes);
    return std::nullopt;
  }
  std::set<std::string> entries;
  for (const auto& [id, entry] : registry.Entries()) {
    entries.insert(id + " " + entry.path + " " + vexlo::elasticd::NameOf(entry.state));
  }
  return entries;
}

Answer ReadRegistrations(const std::string& /*file*/) {
  const kavo::local::MonitorQueues read = kavo::local::ReadMonitorQueues();
  if (!read.unreadable.empty()) {
    return std::nullopt;
  }
  std::set<std::string> queues;
  for (const auto& queue : read.queues) {
    queues.insert(queue.queue + " " + std::to_string(queue.folders.size()));
  }
  return queues;
}

Answer ReadShares(const std::string& file) {
  try {
    std::set<std::string> shares;
    for (const kavo::local::Share& share : kavo::local::ReadShares(file)) {
      shares.insert(share.path + " " + std::to_string(share.read_only));
    }
    return shares;
  } catch (const kavo::local::SharesError&) {
    return std::nullopt;
  }
}

Answer ReadQueue(const std::string& file) {
  std::set<std::string> operations;
  index::QueueMgr(file).ProcessOP(
      [&](const std::shared_ptr<index::OP>& op) {
        std::ostringstream out;
        out << op;
        operations.insert(out.str());
      },
      /*use_tmp=*/false);
  return operations;
}

struct Kind {
  const char* name;
  std::string file;
  std::string content;
  Answer (*read)(const std::string& file);
  size_t parts;
  // How many parts a flipped bit may touch, and whether a beginning of the file is one of a list.
  size_t touched = 1;
  bool is_lines = false;
};

std::vector<Kind> Kinds() {
  const std::string types = R"("document":true,"audio":false,"video":true,"photo":false)";
  const std::string lines =
      "{\"event\":8,\"is_dir\":false,\"path\":\"/v/s/one\",\"path_old\":\"\",\"data\":null}\n"
      "{\"event\":64,\"is_dir\":false,\"path\":\"/v/t/two\",\"path_old\":\"\",\"data\":null}\n"
      "{\"event\":4,\"is_dir\":true,\"path\":\"/v/u/\\u00e9\",\"path_old\":\"\",\"data\":{}}\n";
  return {
      {"folders", index::kFileIndexFoldersCfgPath.Get(),
       R"([{"path":"/photo/2019","name":"a",)" + types + R"(},{"path":"/music","name":"b",)" +
           types + "}]\n",
       ReadFolders, 2},
      {"status", index::kFileIndexStatusCfgPath.Get(),
       "{\"resume_time\":1700000000,\"share\":{\"photo\":3}}\n", ReadStatus, 2},
      {"share state", kRoot / "state.json",
       R"({"crawled":["/v/photo","/v/music"],"rebuilt":true,"missed":["/v/photo/a"],)"
       R"("crawl":{"root":"/v/photo","cause":"x","after":"/v/photo/b","pass":2,"saw_gone":true}})",
       ReadShareState, 4},
      {"quarantine", kRoot / "extract/quarantine.json",
       R"({"files":[{"device":1,"inode":7,"size":3,"modified":4,"changed":5,"reason":"crash",)"
       R"("msg":"m","path":"/v/a","time":6},{"device":1,"inode":8,"size":3,"modified":4,)"
       R"("changed":5,"reason":"memory","msg":"n","path":"/v/b","time":6}]})",
       ReadQuarantine, 2},
      {"registry", kRoot / "registry.json",
       R"({"indexes":{"photo":{"path":"/v/i","token":"t","state":"active"},)"
       R"("music":{"path":"/v/j","token":"u","state":"paused"}}})",
       ReadRegistry, 2},
      {"registrations", kavo::local::MonitorQueuesFolder() + "/app.json",
       R"({"queues":[{"queue":"/v/q","type":1,"config":[{"path":"/v/s","mask":974,"ignore":[]}]},)"
       R"({"queue":"/w/r","type":1,"config":[]}]})",
       ReadRegistrations, 2},
      {"shares", kavo::local::SharesFile(),
       R"({"shares": [{"name": "photo", "path": "/volume1/photo", "read_only": true},)"
       "\n{\"name\": \"music\", \"path\": \"/volume1/music\"}]}\n",
       ReadShares, 2},
      {"queue", kRoot / "live", lines, ReadQueue, 3, 2, true},
  };
}

Answer Read(const Kind& kind, const std::string& content) {
  WriteText(kind.file, content);
  try {
    return kind.read(kind.file);
  } catch (const vexlo::Error&) {
    return std::nullopt;
  }
}

// How many elements of `a` are not in `b`.
size_t Missing(const std::set<std::string>& a, const std::set<std::string>& b) {
  std::vector<std::string> rest;
  std::set_difference(a.begin(), a.end(), b.begin(), b.end(), std::back_inserter(rest));
  return rest.size();
}

TEST(Damage, TouchesNoMoreThanItsPlace) {
  const SyslogCapture quiet;
  for (const Kind& kind : Kinds()) {
    SCOPED_TRACE(kind.name);
    std::filesystem::create_directories(std::filesystem::path(kind.file).parent_path());
    const Answer good = Read(kind, kind.content);
    ASSERT_TRUE(good && good->size() == kind.parts);
    for (size_t at = 0; at < kind.content.size(); ++at) {
      const Answer cut = Read(kind, kind.content.substr(0, at));
      if (kind.is_lines) {
        const auto whole_lines = static_cast<size_t>(
            std::count(kind.content.begin(), kind.content.begin() + static_cast<long>(at), '\n'));
        ASSERT_EQ(Missing(*cut, *good), 0U) << at;
        ASSERT_GE(cut->size(), whole_lines) << at;
      } else {
        ASSERT_TRUE(!cut || cut->empty() || *cut == *good) << at;
      }
      for (int bit = 0; bit < 8; ++bit) {
        std::string flipped = kind.content;
        flipped[at] = static_cast<char>(flipped[at] ^ (1 << bit));
        if (const Answer answer = Read(kind, flipped)) {
          ASSERT_LE(Missing(*good, *answer), kind.touched) << flipped;
          ASSERT_LE(Missing(*answer, *good), 1U) << flipped;
        }
      }
    }
    std::filesystem::remove(kind.file);
  }
}

}  // namespace
