// The tree that folds the events of one queue file into the least operations.
#ifndef FILEINDEX_OPTREE_OPTREE_H_
#define FILEINDEX_OPTREE_OPTREE_H_

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "common/export.h"
#include "fileindex/optree/event.h"
#include "fileindex/optree/op.h"

namespace vexlo::fileindex {

class FolderCache;
struct EventView;
struct QueueLine;
class LineParser;
class LineReader;

// Built once from a file that nobody writes to any more, processed once, then dropped. Not for use
// by two threads at a time.
class VEXLO_EXPORT OPTree {
 public:
  // Reads the whole file; see BuildTree() for what it throws.
  explicit OPTree(const std::string& queue_path);
  ~OPTree();
  OPTree(const OPTree&) = default;
  OPTree& operator=(const OPTree&) = default;

  // How far BuildTree() has come, in bytes of the file and in lines.
  struct Progress {
    uint64_t bytes_read;   // From the beginning of the file. Anew from there when a folder is
                           // renamed into itself, as the tree is then built once more.
    uint64_t bytes_total;  // The size of the file.
    uint64_t lines;        // Of these bytes, skipped ones too.
  };

  // The same, with a call every few thousand lines.
  OPTree(const std::string& queue_path, std::function<void(const Progress&)> on_progress);

  // Reads `queue_path` line by line and inserts each event. A line that cannot be inserted (906 not
  // JSON or longer than kMaxQueueLineBytes, 120 a member missing or mistyped, 9999 a path that is
  // not absolute or has an empty part) is logged and skipped. Throws Error 502 when the file cannot
  // be opened or read.
  void BuildTree();

  // Folds one event into the pending operations. Throws Error 9999 as GetNodeByPath() does, or 120
  // from OP::MergeData(); what the event did before that stands.
  void InsertEvent(std::shared_ptr<Event> event);

  // The steps of InsertEvent(), by kind of event: `op` belongs to `node`, gets the step's kind, and
  // is added unless an operation that is pending on the node absorbs it.
  void HandleCreate(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  void HandleAttr(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  void HandleModifyAndCloseWrite(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  void HandleDelete(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  // Moves what is pending on and below `op->path_old` to `node`. Always adds `op`.
  void HandleRename(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  // Cancels everything but renames below the node, absorbed or not.
  void HandleReindex(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  void HandleUpdateDirectory(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);

  // The node of an absolute path without empty parts ("" is the root), made with its parents when
  // missing. Throws Error 9999 for any other path; the nodes that were made on the way stay.
  std::shared_ptr<OPNode> GetNodeByPath(const std::string& path);

  // Calls `fn` on every node below `node` and then, unless `skip_self`, on `node`: each node after
  // all that is below it, children in order of creation. Children that `fn` adds to a node that was
  // entered already are not visited.
  void TraverseNodeDescendant(std::shared_ptr<OPNode> node,
                              std::function<void(std::shared_ptr<OPNode>)> fn, bool skip_self);

  // Calls `callback` on each operation that is not cancelled, in order of first addition. Returns
  // the number of entries in `ops`, cancelled ones included. A crashed queue delivers one
  // OP_QUEUE_CRASHED on the root instead, and returns 1. What the callback throws passes through,
  // and the operations behind are not delivered.
  size_t ProcessOP(std::function<void(std::shared_ptr<OP>)> callback);

  // Lines that BuildTree() read, and those of them that it skipped.
  uint64_t GetLineCount() const { return line_count_; }
  uint64_t GetSkippedCount() const { return skipped_count_; }

  // What was read and what came of it, for those who look into the tree or build one by hand.
  bool crashed = false;          // Events were lost: nothing but the root's operation is delivered.
  std::string queue_path;        // As it was given.
  std::shared_ptr<OPNode> root;  // Never null.
  std::vector<std::shared_ptr<OP>> ops;  // All that were ever added, in order, cancelled ones too.

 private:
  // What may still happen to the operations on and below a node. A node that carries a mark is
  // known to its parent, which carries it too, up to the root: so a walk meets marked nodes alone,
  // and a reindex of a folder with nothing pending below costs nothing. A mark may be out of date
  // (the operation was cancelled meanwhile), never missing, but for what callers add by hand.
  enum Mark : uint8_t {
    kCancellable = 1,  // A reindex above would cancel something here.
    kMovable = 2,      // A rename above would move something from here.
    kStaying = 4,      // A rename above would leave something here.
  };
  enum class Handler : uint8_t { kCreate, kModify, kAttr, kDelete, kReindex, kUpdateDirectory };
  struct Rule;
  struct AheadLine;
  static const Rule kRules[6][8];

  void ReadQueue();
  void ReadAhead(LineReader& reader, std::vector<AheadLine>& lines);
  void Resolve(std::vector<AheadLine>& lines);
  static void ResolveChildren(std::vector<AheadLine>& lines);
  OPNode* FindFolder(std::string_view path, uint64_t hash);
  void InsertLine(LineParser& parser, const AheadLine& line, bool reported);
  void Insert(const EventView& event, OPNode& node);
  void InsertOneStep(uint32_t step, const EventView& event, OPNode& node);
  void InsertSteps(uint32_t steps, const EventView& event, OPNode& node);
  void Handle(Handler handler, OPNode& node, const std::shared_ptr<OP>& op);
  void HandleNew(Handler handler, OPNode& node, const Json::Value& data);
  void Add(const std::shared_ptr<OP>& op);  // To its own node.
  void AddTo(OPNode& node, const std::shared_ptr<OP>& op);

  // Applies the handler's rules to all that is pending; true when none of it absorbs the new one,
  // which `added` points to if it exists already. `data` may be its own.
  static bool ApplyRules(Handler handler, OPNode& node, const Json::Value& data, OP* added);
  static void CancelBelow(OPNode& node);
  static void CancelPending(OPNode& node);
  void CancelAllBelow(OPNode& node);
  void Unsettle(OPNode& node) const;

  void Rename(OPNode& node, std::string_view new_path, const std::shared_ptr<OP>& op,
              bool may_trade);
  bool TradePlaces(OPNode& source, OPNode& target);
  template <typename Which>
  static void MoveMarkedBelow(OPNode& from, OPNode& to, Mark mark, Which which);
  void MoveAllBelow(OPNode& from, std::string_view old_path, std::string_view new_path,
                    bool overlapping);
  template <typename Which>
  static void MoveOps(OPNode& from, OPNode& to, Which which);

  static uint8_t MarksOf(FileIndexOP op);
  static void SetMarks(OPNode& node, uint8_t marks);
  // Takes the mark from each marked child and calls `visit(child)`.
  template <typename Visit>
  static void TakeMarkedChildren(OPNode& node, Mark mark, Visit visit);

  OPNode& FindNode(std::string_view path);

  // Renames move what is pending and leave out the nodes that hold nothing, which is all that
  // shows, unless a folder is renamed into itself or over one that it is in: then nodes that hold
  // nothing decide what moves twice. So at the first such line BuildTree() starts over and walks
  // every node.
  bool literal_ = true;
  bool must_start_over_ = false;
  uint64_t overlapping_bytes_ = 0;  // Of paths made for such renames.

  std::function<void(const Progress&)> on_progress_;
  // There while BuildTree() runs, when nobody changes operations by hand; empty while it walks
  // every node.
  std::shared_ptr<FolderCache> folders_;

  // What was read before BuildTree() started over, so that nothing is logged twice.
  uint64_t reported_lines_ = 0;
  std::vector<uint64_t> unparsable_lines_;
  uint64_t line_count_ = 0;
  uint64_t skipped_count_ = 0;
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_OPTREE_H_
