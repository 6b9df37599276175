#include "fileindex/optree/optree.h"

#include <algorithm>
#include <bit>
#include <cerrno>
#include <cstring>
#include <utility>

#include "common/check.h"
#include "common/string.h"
#include "fileindex/optree/child_index.h"
#include "fileindex/optree/folder_cache.h"
#include "fileindex/optree/line_parser.h"
#include "fileindex/optree/line_reader.h"
#include "fileindex/optree/malformed_line.h"
#include "fileindex/optree/name_hash.h"
#include "fileindex/optree/slab.h"

namespace vexlo::fileindex {
namespace {

constexpr uint64_t kLinesBetweenProgress = 4096;
constexpr int kDebugLevel = 7;
// Of paths that overlapping renames of one tree may make. The kernel knows no such renames; a queue
// with more is damaged, and some would go on for ever.
constexpr uint64_t kMostOverlappingBytes = uint64_t{4} * 1024 * 1024;

// A kind that no rule looks at or changes.
bool IsSettled(FileIndexOP op) { return op == OP_NONE || op == OP_RENAME; }

// Cancelled operations do not matter, and a delete stays with the old path.
bool MovesWithItsFolder(const OP& op) { return op.op >= OP_UPSERT; }

const Json::Value& NullData() {
  static const Json::Value null;
  return null;
}

std::shared_ptr<OP> NewOP(OPNode& node, FileIndexOP op) {
  return std::allocate_shared<OP>(SlabAllocator<OP>(), node.weak_from_this(), op);
}

// For walks along a list: the operations lie where their lines put them.
void PrefetchAhead(const std::vector<std::shared_ptr<OP>>& ops, size_t at) {
  constexpr size_t kAhead = 8;
  if (at + kAhead < ops.size()) {
    __builtin_prefetch(ops[at + kAhead].get());
  }
}

}  // namespace

// What a step does to one pending operation, and whether that absorbs the new one.
struct OPTree::Rule {
  FileIndexOP becomes;
  bool drops_new;
  enum : uint8_t { kKeepData, kSetData, kMergeData } data = kKeepData;
};

namespace {

// Four letters each, so that the columns of the table stand below each other.
constexpr FileIndexOP kNone = OP_NONE;
constexpr FileIndexOP kDele = OP_DELETE;
constexpr FileIndexOP kUpse = OP_UPSERT;
constexpr FileIndexOP kAttr = OP_ATTR;
constexpr FileIndexOP kFold = OP_UPDATE_DIRECTORY;
constexpr FileIndexOP kRena = OP_RENAME;
constexpr FileIndexOP kRein = OP_REINDEX;
constexpr FileIndexOP kCras = OP_QUEUE_CRASHED;
constexpr bool kKeep = false;
constexpr bool kDrop = true;

}  // namespace

// A row a handler, a column a pending operation's kind: what that becomes, and whether the new one
// is kept or dropped. The asymmetries are meant: a delete stands behind a folder update or a
// reindex, since the folder may be gone before those are done; a create revives a pending delete,
// while a modify that was seen late does not.
// clang-format off
const OPTree::Rule OPTree::kRules[6][8] = {
    /* create */ {{kNone, kKeep}, {kUpse, kDrop}, {kUpse, kDrop}, {kUpse, kDrop},
                  {kFold, kDrop}, {kRena, kKeep}, {kRein, kDrop}, {kCras, kKeep}},
    /* modify */ {{kNone, kKeep}, {kDele, kDrop}, {kUpse, kDrop}, {kUpse, kDrop},
                  {kFold, kDrop}, {kRena, kKeep}, {kRein, kDrop}, {kCras, kKeep}},
    /* attr   */ {{kNone, kKeep}, {kDele, kDrop}, {kUpse, kDrop}, {kAttr, kDrop},
                  {kFold, kDrop}, {kRena, kKeep}, {kRein, kDrop}, {kCras, kKeep}},
    /* delete */ {{kNone, kKeep}, {kDele, kDrop}, {kDele, kDrop}, {kDele, kDrop},
                  {kFold, kKeep}, {kRena, kKeep}, {kRein, kKeep}, {kCras, kKeep}},
    /* reindex*/ {{kNone, kKeep}, {kDele, kDrop}, {kRein, kDrop}, {kRein, kDrop},
                  {kRein, kDrop}, {kRena, kKeep}, {kRein, kDrop}, {kCras, kKeep}},
    /* folder */ {{kNone, kKeep}, {kDele, kDrop},
                  {kFold, kDrop, Rule::kSetData}, {kFold, kDrop, Rule::kSetData},
                  {kFold, kDrop, Rule::kMergeData}, {kRena, kKeep}, {kRein, kDrop}, {kCras, kKeep}},
};
// clang-format on

namespace {

// The kind that a handler gives the new operation, by OPTree::Handler.
constexpr FileIndexOP kKindOf[] = {OP_UPSERT, OP_UPSERT,  OP_ATTR,
                                   OP_DELETE, OP_REINDEX, OP_UPDATE_DIRECTORY};

}  // namespace

OPTree::OPTree(const std::string& queue_path_in) : OPTree(queue_path_in, nullptr) {}

OPTree::OPTree(const std::string& queue_path_in, std::function<void(const Progress&)> on_progress)
    : queue_path(queue_path_in),
      root(std::make_shared<OPNode>(nullptr, "")),
      on_progress_(std::move(on_progress)) {
  BuildTree();
}

OPTree::~OPTree() {
  for (size_t i = 0; i < ops.size(); ++i) {
    PrefetchAhead(ops, i);
    ops[i].reset();
  }
}

void OPTree::BuildTree() {
  literal_ = !ops.empty() || !root->children.empty();
  folders_ = std::make_shared<FolderCache>();
  ReadQueue();
  if (must_start_over_) {
    must_start_over_ = false;
    reported_lines_ = line_count_ - 1;  // All but the one that was broken off.
    line_count_ = 0;
    skipped_count_ = 0;
    crashed = false;
    ops.clear();
    root = std::make_shared<OPNode>(nullptr, "");
    folders_ = std::make_shared<FolderCache>();
    literal_ = true;
    ReadQueue();
  }
  literal_ = true;  // Whatever comes after the file.
  ops.shrink_to_fit();
  folders_ = nullptr;
  reported_lines_ = 0;
  unparsable_lines_.clear();
}

// One of the lines that are read together.
struct OPTree::AheadLine {
  QueueLine line;
  bool ordinary = false;  // `event` holds what the line says.
  EventView event;
  std::string_view folder_path;
  uint64_t folder_hash = 0;
  OPNode* folder = nullptr;  // Of the path; null when it is not there or was not looked for.
  std::string_view name;     // In the folder; empty when the folder is not to be looked for.
  uint64_t hash = 0;         // Of the name.
  size_t guess = ChildIndex::kNone;
  OPNode* node = nullptr;  // Of the path; null when it was not found.
};

void OPTree::ReadQueue() {
  errno = 0;
  LineReader reader(queue_path);
  VEXLO_CHECK_AT((LogSite{"optree", 190, "BuildTree", "!input_stream"}), !reader.IsOpen(),
                 ERR_SYSTEM, std::string("Failed to open queue, reason=") + strerror(errno));
  LineParser parser;
  std::vector<AheadLine> lines;
  uint64_t next_progress = kLinesBetweenProgress;
  auto known_bad = unparsable_lines_.cbegin();
  const auto known_bad_end = unparsable_lines_.cend();
  for (ReadAhead(reader, lines); !lines.empty() && !must_start_over_; ReadAhead(reader, lines)) {
    Resolve(lines);
    for (const AheadLine& line : lines) {
      const bool reported = line_count_ < reported_lines_;
      if (reported && known_bad != known_bad_end && *known_bad == line_count_) {
        ++known_bad;
        ++skipped_count_;
      } else {
        InsertLine(parser, line, reported);
      }
      ++line_count_;
    }
    if (line_count_ >= next_progress && on_progress_ != nullptr) {
      next_progress = line_count_ + kLinesBetweenProgress;
      on_progress_({reader.BytesRead(), reader.FileBytes(), line_count_});
    }
  }
  VEXLO_CHECK(reader.Failed(), ERR_SYSTEM,
              std::string("Failed to read queue, reason=") + strerror(errno));
}

// Reads a few lines, up to the first that may move nodes: what was resolved for the lines behind it
// would not hold any more.
void OPTree::ReadAhead(LineReader& reader, std::vector<AheadLine>& lines) {
  constexpr size_t kLines = 16;
  lines.clear();
  QueueLine line;
  bool more = reader.Next(line);
  while (more) {
    AheadLine& ahead = lines.emplace_back();
    ahead.line = line;
    ahead.ordinary = line.length == line.text.size() && ScanLine(line.text, ahead.event);
    more = ahead.ordinary && (ahead.event.event & EV_RENAME) == 0 && lines.size() < kLines &&
           reader.NextBuffered(line);
  }
}

// Looks up the nodes that are there already. In a large tree every step of a look-up waits for
// memory: taken line by line the waits add up, taken step by step over several lines they overlap.
void OPTree::Resolve(std::vector<AheadLine>& lines) {
  if (literal_) {
    return;
  }
  for (AheadLine& line : lines) {
    const size_t slash = line.event.path.rfind('/');
    if (line.ordinary && slash != std::string_view::npos && slash + 1 < line.event.path.size()) {
      line.name = line.event.path.substr(slash + 1);
      line.folder_path = line.event.path.substr(0, slash);
      line.folder_hash = NameHash(line.folder_path);
      folders_->Prefetch(line.folder_hash);
    }
  }
  for (AheadLine& line : lines) {
    if (line.name.empty()) {
      continue;
    }
    line.folder = FindFolder(line.folder_path, line.folder_hash);
    line.hash = NameHash(line.name);
    if (line.folder != nullptr && line.folder->index_ != nullptr) {
      line.folder->index_->Prefetch(line.hash);
    }
  }
  ResolveChildren(lines);
}

// The steps behind the folders.
void OPTree::ResolveChildren(std::vector<AheadLine>& lines) {
  for (AheadLine& line : lines) {
    if (line.folder != nullptr && line.folder->index_ != nullptr) {
      line.guess = line.folder->index_->Guess(line.hash);
      if (line.guess < line.folder->children.size()) {
        __builtin_prefetch(&line.folder->children[line.guess]);
      }
    }
  }
  for (AheadLine& line : lines) {
    if (line.folder != nullptr && line.guess < line.folder->children.size()) {
      line.node = line.folder->children[line.guess].get();
      __builtin_prefetch(&line.node->name);
      __builtin_prefetch(&line.node->ops);
    }
  }
  for (AheadLine& line : lines) {
    if (line.node != nullptr && line.node->name != line.name) {
      line.node = nullptr;
    }
    if (line.node != nullptr) {
      __builtin_prefetch(line.node->ops.data());
    }
  }
  for (const AheadLine& line : lines) {
    if (line.node != nullptr && line.node->settled_ops_ < line.node->ops.size()) {
      __builtin_prefetch(&line.node->ops[line.node->settled_ops_]->op);
    }
  }
}

// The node of a folder that is there already, by a path that is checked on the way; else null.
OPNode* OPTree::FindFolder(std::string_view path, uint64_t hash) {
  if (OPNode* const known = folders_->Find(path, hash); known != nullptr) {
    return known;
  }
  OPNode* node = root.get();
  for (size_t begin = 0; begin < path.size() && node != nullptr;) {
    const size_t end = std::min(path.find('/', begin + 1), path.size());
    // Every component follows one "/": an empty one names no child.
    const std::string_view name = path.substr(begin + 1, end - begin - 1);
    node = path[begin] == '/' && !name.empty() ? node->FindChild(name, NameHash(name)) : nullptr;
    begin = end;
  }
  if (node != nullptr) {
    folders_->Put(path, hash, node);
  }
  return node;
}

void OPTree::InsertLine(LineParser& parser, const AheadLine& line, bool reported) {
  if (log_level == kDebugLevel && !reported) {
    LogLine("optree", 194, "Got event: " + std::string(line.line.text));
  }
  bool parsed = line.ordinary;
  try {
    const EventView& event = line.ordinary ? line.event : parser.ParseUnusual(line.line);
    parsed = true;
    Insert(event, line.node != nullptr     ? *line.node
                  : line.folder != nullptr ? line.folder->FindOrAddChild(line.name, line.hash)
                                           : FindNode(event.path));
  } catch (const Error& error) {
    ++skipped_count_;
    if (!parsed && !literal_) {
      unparsable_lines_.push_back(line_count_);
    }
    if (!reported) {
      LogContext({"optree", 198, "BuildTree", ""},
                 "InsertEvent failed, event_raw=" + Excerpt(line.line.text, line.line.length) +
                     ", code=" + std::to_string(error.GetErrorCode()) + ", reason=" + error.what(),
                 errno);
    }
  }
}

void OPTree::InsertEvent(std::shared_ptr<Event> event) {
  const EventView view = ViewOf(*event);
  Insert(view, FindNode(view.path));
}

void OPTree::Insert(const EventView& event, OPNode& node) {
  constexpr uint32_t kSteps = EV_CREATE | EV_ATTRIB | EV_DELETE | EV_RENAME | EV_REINDEX |
                              EV_UPDATE_DIRECTORY | EV_MODIFY | EV_CLOSE_WRITE;
  uint32_t steps = event.event & kSteps;
  if ((steps & EV_MODIFY) != 0) {  // The two are one step.
    steps = (steps & ~EV_MODIFY) | EV_CLOSE_WRITE;
  }
  if (steps != 0) {
    if ((steps & (steps - 1)) == 0) {
      InsertOneStep(steps, event, node);
    } else {
      InsertSteps(steps, event, node);
    }
  }
  if ((event.event & EV_QUEUE_CRASHED) != 0) {
    crashed = true;
  }
}

// A line with one step needs no operation object until one is added, and most are absorbed.
void OPTree::InsertOneStep(uint32_t step, const EventView& event, OPNode& node) {
  while (node.settled_ops_ < node.ops.size() && IsSettled(node.ops[node.settled_ops_]->op)) {
    ++node.settled_ops_;
  }
  switch (step) {
    case EV_CREATE:
      return HandleNew(event.is_dir ? Handler::kReindex : Handler::kCreate, node, NullData());
    case EV_ATTRIB:
      return HandleNew(Handler::kAttr, node, NullData());
    case EV_CLOSE_WRITE:
      return HandleNew(Handler::kModify, node, NullData());
    case EV_DELETE:
      return HandleNew(event.is_dir ? Handler::kReindex : Handler::kDelete, node, NullData());
    case EV_REINDEX:
      return HandleNew(Handler::kReindex, node, NullData());
    case EV_UPDATE_DIRECTORY:
      return HandleNew(Handler::kUpdateDirectory, node,
                       event.data == nullptr ? NullData() : *event.data);
    default: {
      const std::shared_ptr<OP> op = NewOP(node, OP_NONE);
      op->path_old = event.path_old;
      return Rename(node, event.path, op, /*may_trade=*/!literal_);
    }
  }
}

// The steps of one line share one operation: a later step finds what an earlier one added among the
// pending ones, and its rule applies to it like to any other.
void OPTree::InsertSteps(uint32_t steps, const EventView& event, OPNode& node) {
  const std::shared_ptr<OP> op = NewOP(node, OP_NONE);
  const auto has = [steps](EventMask step) { return (steps & step) != 0; };
  if (has(EV_CREATE)) {
    Handle(event.is_dir ? Handler::kReindex : Handler::kCreate, node, op);
  }
  if (has(EV_ATTRIB)) {
    Handle(Handler::kAttr, node, op);
  }
  if (has(EV_CLOSE_WRITE)) {
    Handle(Handler::kModify, node, op);
  }
  if (has(EV_DELETE)) {
    Handle(event.is_dir ? Handler::kReindex : Handler::kDelete, node, op);
  }
  if (has(EV_RENAME)) {
    op->path_old = event.path_old;
    Rename(node, event.path, op, /*may_trade=*/false);
    if (must_start_over_) {
      return;
    }
  }
  if (has(EV_REINDEX)) {
    Handle(Handler::kReindex, node, op);
  }
  if (has(EV_UPDATE_DIRECTORY)) {
    op->data = event.data == nullptr ? NullData() : *event.data;
    Handle(Handler::kUpdateDirectory, node, op);
  }
}

void OPTree::HandleCreate(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  Handle(Handler::kCreate, *node, op);
}

void OPTree::HandleAttr(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  Handle(Handler::kAttr, *node, op);
}

void OPTree::HandleModifyAndCloseWrite(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  Handle(Handler::kModify, *node, op);
}

void OPTree::HandleDelete(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  Handle(Handler::kDelete, *node, op);
}

void OPTree::HandleRename(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  Rename(*node, node->GetPath(), op, /*may_trade=*/false);
}

void OPTree::HandleReindex(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  Handle(Handler::kReindex, *node, op);
}

void OPTree::HandleUpdateDirectory(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  Handle(Handler::kUpdateDirectory, *node, op);
}

void OPTree::Handle(Handler handler, OPNode& node, const std::shared_ptr<OP>& op) {
  op->op = kKindOf[static_cast<size_t>(handler)];
  if (const std::shared_ptr<OPNode> holder = op->node.lock(); holder != nullptr) {
    // It may be pending already, and a rename may have moved it.
    SetMarks(*holder, MarksOf(op->op));
  }
  Unsettle(node);
  ApplyRules(handler, node, op->data, op.get());
  if (handler == Handler::kReindex) {
    // Also what is about to be added, where a rename took it there.
    folders_ == nullptr ? CancelAllBelow(node) : CancelBelow(node);
  }
  if (op->op != OP_NONE) {
    Add(op);
  }
}

// Handle() for an operation that nobody else holds.
void OPTree::HandleNew(Handler handler, OPNode& node, const Json::Value& data) {
  Unsettle(node);
  const bool survives = ApplyRules(handler, node, data, /*added=*/nullptr);
  if (handler == Handler::kReindex) {
    folders_ == nullptr ? CancelAllBelow(node) : CancelBelow(node);
  }
  if (survives) {
    const std::shared_ptr<OP> op = NewOP(node, kKindOf[static_cast<size_t>(handler)]);
    if (handler == Handler::kUpdateDirectory) {  // No other carries a payload.
      op->data = data;
    }
    AddTo(node, op);
  }
}

void OPTree::Add(const std::shared_ptr<OP>& op) {
  if (const std::shared_ptr<OPNode> node = op->node.lock(); node != nullptr) {
    AddTo(*node, op);
  } else {
    ops.push_back(op);
  }
}

void OPTree::AddTo(OPNode& node, const std::shared_ptr<OP>& op) {
  ops.push_back(op);
  node.ops.push_back(op);
  SetMarks(node, MarksOf(op->op));
}

bool OPTree::ApplyRules(Handler handler, OPNode& node, const Json::Value& data, OP* added) {
  const Rule* const rules = kRules[static_cast<size_t>(handler)];
  bool survives = true;
  for (size_t i = node.settled_ops_; i < node.ops.size(); ++i) {
    OP& pending = *node.ops[i];
    if (static_cast<uint32_t>(pending.op) > OP_QUEUE_CRASHED) {
      continue;  // No kind of ours: left alone, like a crash.
    }
    const Rule& rule = rules[pending.op];
    survives = survives && !rule.drops_new;
    if (rule.data == Rule::kMergeData) {
      pending.MergeData(data);
    } else if (rule.data == Rule::kSetData) {
      pending.data = data;
    }
    if (pending.op != rule.becomes) {
      pending.op = rule.becomes;
      SetMarks(node, MarksOf(pending.op));
    }
    if (rule.drops_new && added != nullptr) {
      added->op = OP_NONE;  // At once: it may stand further down the list itself.
    }
  }
  return survives;
}

void OPTree::CancelPending(OPNode& node) {
  for (size_t i = node.settled_ops_; i < node.ops.size(); ++i) {
    if (node.ops[i]->op != OP_RENAME) {
      node.ops[i]->op = OP_NONE;
    }
  }
}

// Marks and the settled operations do not tell of what callers change by hand, which they may do
// while no file is read.
void OPTree::Unsettle(OPNode& node) const {
  if (folders_ == nullptr) {
    node.settled_ops_ = 0;
  }
}

void OPTree::CancelAllBelow(OPNode& node) {
  TraverseNodeDescendant(
      node.shared_from_this(),
      [this](const std::shared_ptr<OPNode>& child) {
        Unsettle(*child);
        CancelPending(*child);
      },
      /*skip_self=*/true);
}

void OPTree::CancelBelow(OPNode& node) {
  if (node.children.empty()) {
    return;
  }
  std::vector<OPNode*> marked = {&node};
  while (!marked.empty()) {
    OPNode& parent = *marked.back();
    marked.pop_back();
    TakeMarkedChildren(parent, kCancellable, [&marked](OPNode& child) {
      CancelPending(child);
      marked.push_back(&child);
    });
  }
}

void OPTree::Rename(OPNode& node, std::string_view new_path, const std::shared_ptr<OP>& op,
                    bool may_trade) {
  const std::string_view old_path = op->path_old;
  OPNode& source = FindNode(old_path);
  const bool overlapping = IsSameOrBelow(new_path, old_path) || IsSameOrBelow(old_path, new_path);
  if (overlapping && !literal_) {
    must_start_over_ = true;
    return;
  }
  op->op = OP_RENAME;
  Unsettle(node);
  Unsettle(source);
  // What was pending for the old occupant of the new path is void.
  for (size_t i = node.settled_ops_; i < node.ops.size(); ++i) {
    OP& pending = *node.ops[i];
    if (pending.op == OP_DELETE || pending.op == OP_UPSERT || pending.op == OP_ATTR) {
      pending.op = OP_NONE;
    }
  }
  FileIndexOP carried = OP_NONE;
  for (size_t i = source.settled_ops_; i < source.ops.size(); ++i) {
    OP& pending = *source.ops[i];
    if (pending.op == OP_UPSERT || pending.op == OP_ATTR || pending.op == OP_REINDEX) {
      carried = pending.op;
      pending.op = OP_NONE;
    }
  }
  OPNode* moved = &node;  // What stands at the new path.
  if (may_trade && TradePlaces(source, node)) {
    moved = &source;
    op->node = moved->weak_from_this();
    // A pending delete stays with the old path.
    MoveMarkedBelow(*moved, node, kStaying,
                    [](const OP& pending) { return pending.op == OP_DELETE; });
  } else {
    if (&source != &node) {
      MoveOps(source, node, [](const OP&) { return true; });
    }
    if (literal_) {
      MoveAllBelow(source, old_path, new_path, overlapping);
    } else {
      MoveMarkedBelow(source, node, kMovable, MovesWithItsFolder);
    }
  }
  Add(op);  // To its node, which the moves may have changed.
  if (carried != OP_NONE) {
    AddTo(*moved, NewOP(*moved, carried));
  }
}

// Puts the source node with all that is below it at the target's place, and the target at the
// source's, instead of moving each operation below: a folder of a million files is renamed in no
// time. All operations of both end on the node that was the source. False, and nothing is done,
// where that does not pay or somebody else holds one of the two and would see it.
bool OPTree::TradePlaces(OPNode& source, OPNode& target) {
  if (source.children.empty() || !target.children.empty()) {
    return false;
  }
  const std::shared_ptr<OPNode> from = source.parent.lock();
  const std::shared_ptr<OPNode> to = target.parent.lock();
  if (from == nullptr || to == nullptr || source.position_ >= from->children.size() ||
      target.position_ >= to->children.size()) {
    return false;
  }
  std::shared_ptr<OPNode>& source_slot = from->children[source.position_];
  std::shared_ptr<OPNode>& target_slot = to->children[target.position_];
  if (source_slot.get() != &source || source_slot.use_count() != 1 ||
      target_slot.get() != &target || target_slot.use_count() != 1) {
    return false;
  }
  for (const std::shared_ptr<OP>& op : target.ops) {
    op->node = source.weak_from_this();
  }
  source.ops.insert(source.ops.begin(), std::make_move_iterator(target.ops.begin()),
                    std::make_move_iterator(target.ops.end()));
  source.settled_ops_ = target.settled_ops_;
  target.ops.clear();
  target.settled_ops_ = 0;

  source_slot.swap(target_slot);
  folders_->Forget();
  source.name.swap(target.name);
  source.parent.swap(target.parent);
  const uint32_t position = source.position_;
  source.position_ = target.position_;
  target.position_ = position;
  const auto marks = static_cast<uint8_t>(source.marks_ | target.marks_);
  source.marks_ = 0;
  target.marks_ = 0;
  SetMarks(source, marks);
  return true;
}

// Moves, below `from`, the operations for which `which` holds to the nodes of the same names below
// `to`, which are made only where something moves there.
template <typename Which>
void OPTree::MoveMarkedBelow(OPNode& from, OPNode& to, Mark mark, Which which) {
  if (from.children.empty()) {
    return;
  }
  std::vector<std::pair<OPNode*, OPNode*>> marked = {{&from, &to}};
  while (!marked.empty()) {
    const auto [node, node_to] = marked.back();
    marked.pop_back();
    TakeMarkedChildren(*node, mark, [&, target = node_to](OPNode& child) {
      OPNode& child_to = target->FindOrAddChild(child.name, NameHash(child.name));
      MoveOps(child, child_to, which);
      marked.emplace_back(&child, &child_to);
    });
  }
}

// Visits every node below and makes its like at the new place. Where the two places overlap, the
// walk may for ever come upon what it has just made. A queue that says so is damaged beyond what
// can be told from it, and counts as crashed.
void OPTree::MoveAllBelow(OPNode& from, std::string_view old_path, std::string_view new_path,
                          bool overlapping) {
  TraverseNodeDescendant(
      from.shared_from_this(),
      [&](const std::shared_ptr<OPNode>& node) {
        if (overlapping && overlapping_bytes_ > kMostOverlappingBytes) {
          return;  // Makes nothing more, so the walk ends.
        }
        std::string path(new_path);
        path += std::string_view(node->GetPath()).substr(old_path.size());
        overlapping_bytes_ += overlapping ? path.size() : 0;
        MoveOps(*node, FindNode(path), MovesWithItsFolder);
      },
      /*skip_self=*/true);
  if (overlapping && overlapping_bytes_ > kMostOverlappingBytes && !crashed) {
    LogLine(VEXLO_SOURCE, __LINE__, "Renames into themselves do not end, queue=" + queue_path);
    crashed = true;
  }
}

// Moves the operations for which `which` holds behind those of `to`, in order.
template <typename Which>
void OPTree::MoveOps(OPNode& from, OPNode& to, Which which) {
  const auto first_moved =
      std::stable_partition(from.ops.begin(), from.ops.end(),
                            [&which](const std::shared_ptr<OP>& op) { return !which(*op); });
  if (first_moved == from.ops.end()) {
    return;
  }
  const std::vector<std::shared_ptr<OP>> moved(std::make_move_iterator(first_moved),
                                               std::make_move_iterator(from.ops.end()));
  from.ops.erase(first_moved, from.ops.end());
  from.settled_ops_ = 0;
  uint8_t marks = 0;
  for (const std::shared_ptr<OP>& op : moved) {
    op->node = to.weak_from_this();
    marks |= MarksOf(op->op);
    to.ops.push_back(op);
  }
  SetMarks(to, marks);
}

uint8_t OPTree::MarksOf(FileIndexOP op) {
  switch (op) {
    case OP_NONE:
      return 0;
    case OP_DELETE:
      return kCancellable | kStaying;
    case OP_RENAME:
      return kMovable;
    default:
      return kCancellable | kMovable;
  }
}

void OPTree::SetMarks(OPNode& node, uint8_t marks) {
  std::shared_ptr<OPNode> parent;
  for (OPNode* at = &node;;) {
    marks &= static_cast<uint8_t>(~at->marks_);
    if (marks == 0) {
      return;
    }
    at->marks_ = static_cast<uint8_t>(at->marks_ | marks);
    std::shared_ptr<OPNode> above = at->parent.lock();
    if (above == nullptr) {
      return;
    }
    if (above->index_ != nullptr) {
      // A child that somebody put there by hand does not know its position.
      size_t position = at->position_;
      if (position >= above->children.size() || above->children[position].get() != at) {
        position = 0;
        while (position < above->children.size() && above->children[position].get() != at) {
          ++position;
        }
      }
      for (size_t bit = 0; bit < above->index_->marked.size(); ++bit) {
        if ((marks >> bit & 1) != 0) {
          above->index_->marked[bit].Add(position);
        }
      }
    }
    parent = std::move(above);
    at = parent.get();
  }
}

template <typename Visit>
void OPTree::TakeMarkedChildren(OPNode& node, Mark mark, Visit visit) {
  const auto take = [&](OPNode& child) {
    if ((child.marks_ & mark) != 0) {
      child.marks_ = static_cast<uint8_t>(child.marks_ & ~mark);
      visit(child);
    }
  };
  if (node.index_ == nullptr) {
    for (const std::shared_ptr<OPNode>& child : node.children) {
      take(*child);
    }
    return;
  }
  const auto bit = static_cast<size_t>(std::countr_zero(static_cast<unsigned>(mark)));
  node.index_->marked[bit].TakeAll([&](size_t position) {
    if (position < node.children.size()) {
      take(*node.children[position]);
    }
  });
}

std::shared_ptr<OPNode> OPTree::GetNodeByPath(const std::string& path) {
  return FindNode(path).shared_from_this();
}

OPNode& OPTree::FindNode(std::string_view path) {
  if (folders_ != nullptr && !path.empty() && path.back() != '/') {
    const std::string_view folder_path = path.substr(0, std::min(path.rfind('/'), path.size()));
    if (OPNode* const folder = folders_->Find(folder_path, NameHash(folder_path))) {
      const std::string_view name = path.substr(folder_path.size() + 1);
      return folder->FindOrAddChild(name, NameHash(name));
    }
  }
  OPNode* node = root.get();
  // Going back up from the node gives the path again just when every component followed one "/".
  bool normalised = path.empty() || path.front() == '/';
  for (size_t begin = 0; begin < path.size();) {
    const size_t end = std::min(path.find('/', begin), path.size());
    if (end > begin) {
      const std::string_view name = path.substr(begin, end - begin);
      node = &node->FindOrAddChild(name, NameHash(name));
    } else if (begin > 0) {
      normalised = false;
    }
    begin = end + 1;
  }
  normalised = normalised && (path.empty() || path.back() != '/');
  if (!normalised) {
    throw Error(ERR_INTERNAL, "GetNodeByPath failed, path=" + std::string(path));
  }
  return *node;
}

void OPTree::TraverseNodeDescendant(std::shared_ptr<OPNode> node,
                                    std::function<void(std::shared_ptr<OPNode>)> fn,
                                    bool skip_self) {
  // A stack of our own: the depth of a path is bounded by the line's length alone.
  struct Level {
    std::shared_ptr<OPNode> node;
    std::vector<std::shared_ptr<OPNode>> children;
    size_t next = 0;
  };
  std::vector<Level> levels;
  levels.push_back({node, node->children});
  while (!levels.empty()) {
    Level& level = levels.back();
    if (level.next < level.children.size()) {
      const std::shared_ptr<OPNode> child = level.children[level.next++];
      levels.push_back({child, child->children});
      continue;
    }
    const std::shared_ptr<OPNode> done = std::move(level.node);
    levels.pop_back();
    if (!levels.empty() || !skip_self) {
      fn(done);
    }
  }
}

size_t OPTree::ProcessOP(std::function<void(std::shared_ptr<OP>)> callback) {
  if (crashed) {
    LogLine("optree", 144, "Queue crashed: " + queue_path);
    callback(std::make_shared<OP>(root, OP_QUEUE_CRASHED, "", NullData()));
    return 1;
  }
  for (size_t i = 0; i < ops.size(); ++i) {
    PrefetchAhead(ops, i);
    if (ops[i]->op != OP_NONE) {
      callback(ops[i]);
    }
  }
  return ops.size();
}

}  // namespace vexlo::fileindex
