// "fileindex queue ...": what stands in a queue file.
#include <cstdint>
#include <functional>

#include "cli/command.h"
#include "cli/operation_writer.h"
#include "cli/progress.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/file.h"
#include "fileindex/optree/optree.h"
#include "fileindex/queue_mgr.h"

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
  return Ask(arguments, console, &QueueMgr::IsFullPathProcessing, "pending: ", "not pending: ");
}

ExitStatus HasReindex(const Arguments& arguments, const Console& console) {
  return Ask(arguments, console, &QueueMgr::IsFullPathHasReindex,
             "reindex pending: ", "no reindex pending: ");
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
