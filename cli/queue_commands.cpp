// "fileindex queue ...": what stands in a queue file.
#include <algorithm>
#include <cstdint>
#include <functional>
#include <iterator>

#include "cli/command.h"
#include "cli/operation_writer.h"
#include "cli/progress.h"
#include "cli/service.h"
#include "cli/shares.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/optree/event.h"
#include "fileindex/optree/optree.h"
#include "fileindex/queue_mgr.h"
#include "fileindex/util/custom_event.h"
#include "fileindex/util/share_path.h"

namespace vexlo::cli {
namespace {

using fileindex::OP;
using fileindex::OPTree;
using fileindex::QueueMgr;

[[noreturn]] void FailToRead(const std::string& path, const Error& error) {
  throw Failure("the queue '" + path + "' cannot be read: " + CauseOf(error.what()));
}

ExitStatus ShowQueue(const Arguments& arguments, const Console& console) {
  const std::string& path = arguments.positional[0];
  OperationWriter writer(console, arguments.Has("--json"));
  std::unique_ptr<OPTree> tree;
  try {
    ProgressBar bar(console);
    tree = std::make_unique<OPTree>(path, [&bar](const OPTree::Progress& progress) {
      bar.Show(progress.bytes_read, progress.bytes_total, progress.lines);
    });
  } catch (const Error& error) {
    FailToRead(path, error);
  }
  const size_t entries =
      tree->ProcessOP([&writer](const std::shared_ptr<OP>& op) { writer.Write(op); });
  console.out.flush();
  console.err << Counted(tree->GetLineCount(), "line") << " read, "
              << Grouped(tree->GetSkippedCount()) << " skipped, "
              << (entries == 1 ? "1 entry" : Grouped(entries) + " entries")
              << " in the tree's list, " << Counted(writer.GetCount(), "operation")
              << " to deliver\n";
  if (tree->crashed) {
    console.err << "events were lost: the whole share must be rebuilt\n";
  }
  return writer.GetCount() == 0 ? kNothingFound : kDone;
}

ExitStatus Ask(const Arguments& arguments, const Console& console,
               bool (QueueMgr::*question)(const std::string&), const char* yes, const char* no) {
  const std::string path = AbsolutePath(arguments.positional[0]);
  const std::string queue = arguments.Get("--queue");
  // The library takes a missing queue for an idle one; a person has more likely mistyped its name.
  if (!IsFileExist(queue) && !IsFileExist(queue + ".tmp")) {
    throw Failure("there is no queue '" + queue + "', nor a snapshot of it");
  }
  bool answer = false;
  try {
    answer = (QueueMgr(queue).*question)(path);
  } catch (const Error& error) {
    FailToRead(queue, error);
  }
  console.out << (answer ? yes : no) << ForTerminal(path) << "\n";
  return answer ? kDone : kNothingFound;
}

ExitStatus IsPending(const Arguments& arguments, const Console& console) {
  try {
    const fileindex::FolderMgr folders;  // The question loads it too; its own error tells less.
  } catch (const Error& error) {
    throw Failure("the list of folders cannot be loaded: " + CauseOf(error.what()) +
                  "; 'fileindex config check' says more");
  }
  return Ask(arguments, console, &QueueMgr::IsFullPathProcessing, "pending: ", "not pending: ");
}

ExitStatus HasReindex(const Arguments& arguments, const Console& console) {
  return Ask(arguments, console, &QueueMgr::IsFullPathHasReindex,
             "reindex pending: ", "no reindex pending: ");
}

struct EventName {
  const char* name;
  int event;
};
const EventName kEventNames[] = {
    {"attrib", fileindex::EV_ATTRIB},   {"write", fileindex::EV_CLOSE_WRITE},
    {"create", fileindex::EV_CREATE},   {"delete", fileindex::EV_DELETE},
    {"rename", fileindex::EV_RENAME},   {"crashed", fileindex::EV_QUEUE_CRASHED},
    {"reindex", fileindex::EV_REINDEX}, {"update-directory", fileindex::EV_UPDATE_DIRECTORY},
};

const EventName& ReadEvent(const std::string& name) {
  const auto* const known =
      std::find_if(std::begin(kEventNames), std::end(kEventNames),
                   [&](const EventName& event) { return name == event.name; });
  if (known == std::end(kEventNames)) {
    std::string names;
    for (const EventName& event : kEventNames) {
      names.append(names.empty() ? "" : ", ").append(event.name);
    }
    throw UsageError("there is no event '" + name + "'; there are " + names);
  }
  return *known;
}

// The library adds nothing in these cases, and does not say so; a person wants to know.
std::string WhyNothingIsAdded(const sdk::SDKShare& share, const std::string& path) {
  if (!share.CanBeIndexed()) {
    return "the share '" + share.GetName() + "' cannot be indexed at present";
  }
  if (QueueMgr(share.GetQueuePath()).IsFullPathHasReindex(path)) {
    return "a reindex that covers the path is queued already";
  }
  return "";
}

ExitStatus AddEvent(const Arguments& arguments, const Console& console) {
  const EventName& event = ReadEvent(arguments.positional[0]);
  const std::string path = AbsolutePath(arguments.positional[1]);
  if (arguments.Has("--old") != (event.event == fileindex::EV_RENAME)) {
    throw UsageError("'rename' wants the option --old PATH, and nothing else takes it");
  }
  const std::string path_old = arguments.Has("--old") ? AbsolutePath(arguments.Get("--old")) : "";
  Json::Value data;
  if (arguments.Has("--data")) {
    const std::string fault = JsonFault(arguments.Get("--data"));
    if (!fault.empty()) {
      throw UsageError("the value of --data is no JSON: " + fault);
    }
    JsonFromString(data, arguments.Get("--data"));
  }
  CheckSharesFile();
  std::string share_name;
  std::string share_dir;
  try {
    fileindex::GetShareNamePathByFullPath(share_name, share_dir, path);
  } catch (const Error&) {
    throw Failure("no share holds '" + ForTerminal(path) + "'");
  }
  const sdk::SDKShare share(share_name);
  const std::string why_nothing = WhyNothingIsAdded(share, path);
  if (!why_nothing.empty()) {
    console.err << "nothing added: " << ForTerminal(why_nothing) << "\n";
    return kNothingFound;
  }
  fileindex::AddCustomEvent(event.event, path, path_old, data);
  console.out << "added to " << ForTerminal(share.GetQueuePath()) << ": " << event.name << " "
              << (path_old.empty() ? "" : ForTerminal(path_old) + " -> ") << ForTerminal(path)
              << "\n";
  if (!IsIndexDaemonListening()) {
    console.err << NoIndexDaemon() << "; the event waits in the queue until it does\n";
  }
  return kDone;
}

const Option kQueueOption = {"--queue", "FILE", "the queue; its snapshot FILE.tmp is read too"};

}  // namespace

std::vector<Command> QueueCommands() {
  return {
      {"queue show",
       "FILE",
       "shows what a queue file comes down to",
       "Reads the events in FILE, folds them and prints the operations that an indexer would be\n"
       "handed, in order. FILE is not changed. Lines that are no events are skipped and counted; "
       "the\n"
       "system log has them.\n"
       "\n"
       "  [01] PATH         remove it from the index\n"
       "  [02] PATH         index it\n"
       "  [03] PATH         update its attributes\n"
       "  [04] PATH, data=  update the folder's settings\n"
       "  [05] OLD -> PATH  rename it\n"
       "  [06] PATH         index it and everything below it again\n"
       "  [07]              events were lost: rebuild the share\n"
       "\n"
       "Exit status 1 when nothing is left to do.\n"
       "\n"
       "  fileindex queue show /var/lib/kavo/fileindex/queue/photo\n"
       "  fileindex queue show --json queue.tmp | jq -r 'select(.op == 1).path'\n",
       {{"--json", nullptr, "one JSON object a line: op, path, path_old, data"}},
       {},
       1,
       1,
       ShowQueue},
      {"queue add",
       "EVENT PATH",
       "queues an event for a path, as if it had just happened",
       "Appends one line to the queue of the share that holds PATH. EVENT is one of attrib, "
       "write,\n"
       "create, delete, rename (with --old), crashed, reindex and update-directory (with --data:\n"
       "which groups of files to index again). Nothing is added, and the exit status is 1, while\n"
       "the share cannot be indexed or a reindex that covers PATH is queued.\n"
       "\n"
       "  fileindex queue add reindex /volume1/photo/2019\n"
       "  fileindex queue add rename /volume1/photo/new --old /volume1/photo/old\n"
       "  fileindex queue add update-directory /volume1/photo --data '{\"photo\": true}'\n",
       {{"--old", "PATH", "the path before a rename"},
        {"--data", "JSON", "the event's payload; null without it"}},
       {},
       2,
       2,
       AddEvent},
      {"queue pending",
       "PATH",
       "asks whether events wait for a path or below it",
       "Exit status 0 when an event in the queue or its snapshot is about PATH or something below\n"
       "it (a rename counts at both ends), 1 when none is.\n"
       "\n"
       "  fileindex queue pending /volume1/photo/2019 --queue queue && echo 'not yet searchable'\n",
       {kQueueOption},
       {"--queue"},
       1,
       1,
       IsPending},
      {"queue has-reindex",
       "PATH",
       "asks whether a reindex that covers a path is queued",
       "Exit status 0 when a reindex of PATH or of a folder above it waits in the queue or its\n"
       "snapshot, 1 when none does.\n"
       "\n"
       "  fileindex queue has-reindex /volume1/photo/2019 --queue queue\n",
       {kQueueOption},
       {"--queue"},
       1,
       1,
       HasReindex},
  };
}

}  // namespace vexlo::cli
