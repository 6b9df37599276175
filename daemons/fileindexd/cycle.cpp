#include "daemons/fileindexd/cycle.h"

#include <algorithm>
#include <set>
#include <system_error>
#include <utility>
#include <vector>

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "common/string.h"
#include "daemons/common/log.h"
#include "daemons/common/no_memory.h"
#include "daemons/fileindexd/consequence.h"
#include "daemons/fileindexd/documents.h"
#include "daemons/fileindexd/rename_plan.h"
#include "fileindex/elastic_control/documents.h"
#include "fileindex/elastic_control/schema.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/util/file_type.h"

namespace vexlo::fileindexd {
namespace {

namespace elastic = fileindex::elastic;
using fileindex::GetFileTypeByFullPath;
using fileindex::GetFileTypeName;

constexpr Json::ArrayIndex kMostDeletes = 500;
constexpr size_t kMostTaken = 10000;
constexpr size_t kMostTouched = 100000;
constexpr size_t kMostMoves = 100000;
constexpr unsigned kMostLogged = 10;      // Of one code, in a cycle.
constexpr char kByItself[] = "settings";  // The cause of a crawl that no operation asked for.

Json::Value DeleteItem(const std::string& id, const std::string& path) {
  Json::Value item;
  item["command"] = "document_del_by_id";
  item["data"]["id"] = id;
  item["data"]["doc_id"] = path;
  return item;
}

Json::Value DeleteBelowItem(const std::string& id, const std::string& path) {
  Json::Value item;
  item["command"] = "document_del_by_query";
  item["data"]["id"] = id;
  item["data"]["query"]["qsl"]["prefix"][elastic::field::KAVOMDPath] = path + "/";
  return item;
}

bool IsTrue(const Json::Value& types, const char* name) {
  return types.isObject() && types[name].isBool() && types[name].asBool();
}

std::optional<uint64_t> InodeOf(const std::optional<Stamp>& stamp) {
  return stamp ? std::optional(stamp->inode) : std::nullopt;
}

}  // namespace

Cycle::Cycle(const std::string& share, const std::string& share_path, std::string cause,
             ShareState& state, Stats& stats, std::function<bool()> is_interrupted)
    : share_(share),
      id_(elastic::GetFileIndexID(share)),
      cause_(std::move(cause)),
      scope_(share, share_path),
      state_(state),
      missed_(state.missed),
      stats_(stats),
      is_interrupted_(std::move(is_interrupted)),
      indexer_(id_, stats, is_interrupted_),
      engine_run_(EngineRun()) {}

void Cycle::LookAheadIn(const std::string& queue_path, std::chrono::milliseconds step) {
  tail_.emplace(queue_path);
  look_step_ = step;
  looked_ = std::chrono::steady_clock::now();
}

// What goes wrong with a line alone will be told by the cycle that takes it.
void Cycle::LookAhead() {
  const auto now = std::chrono::steady_clock::now();
  if (!tail_ || now - looked_ < look_step_) {
    return;
  }
  looked_ = now;
  std::vector<GoneList::Gone> gone;
  for (const std::string& line : tail_->Next()) {
    try {
      LookAt(fileindex::Event(line), &gone);
    } catch (const Error& error) {
      if (OfOperation(error.GetErrorCode()) != Consequence::kGoOn) {
        throw;
      }
    }
  }
  if (!gone.empty()) {
    Settle();
    Remove(gone);
  }
}

// Folders are left to the crawl that will be asked for.
void Cycle::LookAt(const fileindex::Event& event, std::vector<GoneList::Gone>* gone) {
  constexpr uint32_t kWritten = fileindex::EV_CLOSE_WRITE | fileindex::EV_RENAME;
  if (event.is_dir) {
    return;
  }
  for (const std::string* const path : {&event.path, &event.path_old}) {
    if (path->empty() || path->find('\0') != std::string::npos || !scope_.IsInShare(*path)) {
      continue;
    }
    NoteTouched(*path);  // Whatever is handed over after this is from before.
    const bool is_new = path == &event.path;
    if (is_new && (event.event & kWritten) != 0 && IsWanted(*path)) {
      FlushDeletes();
      Submit(*path);
    } else if ((!is_new || (event.event & fileindex::EV_DELETE) != 0) && scope_.Covers(*path) &&
               IsGone(*path)) {
      ForgetTaken(*path);
      gone->push_back({*path, /*with_all_below=*/false});
    }
  }
}

void Cycle::Handle(const fileindex::OP& op) {
  Check();
  LookAhead();
  const std::shared_ptr<fileindex::OPNode> node = op.node.lock();
  if (node == nullptr) {
    return;
  }
  const std::string path = node->GetPath();
  stats_.CountOperation(op.op);
  try {
    CarryTwice(op, path);
  } catch (const Error& error) {
    if (OfOperation(error.GetErrorCode()) != Consequence::kGoOn) {
      throw;
    }
    Count(error.GetErrorCode(), error.what(), path);
  } catch (const std::exception& error) {
    if (daemon::IsLackOfMemory(error)) {
      throw;
    }
    Count(ERR_INTERNAL, error.what(), path);
  }
}

// What the system refused once it may grant at the next try; where the fault is the share's, the
// operation waits for it.
void Cycle::CarryTwice(const fileindex::OP& op, const std::string& path) {
  try {
    Carry(op, path);
  } catch (const Error& error) {
    if (error.GetErrorCode() != ERR_SYSTEM) {
      throw;
    }
    scope_.CheckShare();
    Carry(op, path);
  }
}

void Cycle::Carry(const fileindex::OP& op, const std::string& path) {
  if (op.op == fileindex::OP_QUEUE_CRASHED) {
    ReconcileShare();
    return;
  }
  for (const std::string* const each : {&path, &op.path_old}) {
    const bool may_miss = each == &op.path_old && op.op != fileindex::OP_RENAME;
    if (!may_miss && (each->empty() || each->find('\0') != std::string::npos)) {
      throw Error(ERR_BAD_PARAMETER, "not a path");
    }
  }
  if (!scope_.IsInShare(path)) {
    VEXLO_CHECK(!IsSameOrBelow(path, scope_.SharePath()), ERR_BAD_PARAMETER,
                "the path lies outside of the share");
    LeaveToInnerShare(op, path);
    return;
  }
  CarryKnown(op, path);
  NoteTouched(path);
  if (op.op == fileindex::OP_RENAME) {
    NoteTouched(op.path_old);
  }
}

// The path lies in a share within this one, which has it in an index of its own. Documents from
// before that share was there go, and so does what has moved there.
void Cycle::LeaveToInnerShare(const fileindex::OP& op, const std::string& path) {
  Delete(path);
  if (op.op != fileindex::OP_RENAME || !scope_.IsInShare(op.path_old)) {
    return;
  }
  if (IsGone(op.path_old)) {
    Delete(op.path_old);
  } else {
    ReconcileMixed(op.path_old);
  }
}

void Cycle::CarryKnown(const fileindex::OP& op, const std::string& path) {
  switch (op.op) {
    case fileindex::OP_DELETE:
      // A folder that is made at once where something was deleted leaves the delete alone.
      if (IsGone(path) || !IsWanted(path)) {
        ForgetMissed(path);
        Delete(path);
      } else {
        ReconcileMixed(path);
      }
      break;
    case fileindex::OP_UPSERT:
      Upsert(path);
      break;
    case fileindex::OP_ATTR:
      UpdateAttributes(path);
      break;
    case fileindex::OP_UPDATE_DIRECTORY:
      Reconcile(path, op.data);
      ReconcileMovedFrom(path, /*only_from_above=*/false);
      break;
    case fileindex::OP_RENAME:
      Rename(path, op.path_old);
      ReconcileMovedFrom(path, /*only_from_above=*/true);
      break;
    case fileindex::OP_REINDEX:
      Reconcile(path, Json::Value());
      ReconcileMovedFrom(path, /*only_from_above=*/false);
      break;
    case fileindex::OP_NONE:
    case fileindex::OP_QUEUE_CRASHED:
      break;
  }
}

void Cycle::Delete(const std::string& path) {
  indexer_.Drain();  // What was taken before must not come behind.
  ForgetTaken(path);
  deletes_.append(DeleteItem(id_, path));
  deletes_.append(DeleteBelowItem(id_, path));
  if (deletes_.size() >= kMostDeletes) {
    FlushDeletes();
  }
}

void Cycle::DeleteUnwanted(const std::string& path) {
  if (scope_.Covers(path) && IsGone(path)) {
    NoteMissed(path);
  }
  Delete(path);
}

void Cycle::Upsert(const std::string& path) {
  if (!IsWanted(path)) {
    DeleteUnwanted(path);
    return;
  }
  FlushDeletes();
  Submit(path);
}

void Cycle::UpdateAttributes(const std::string& path) {
  if (!IsWanted(path)) {
    DeleteUnwanted(path);
    return;
  }
  Settle();
  const bool content = scope_.WantsContent(path);
  const std::optional<Stamp> now = StampOfPath(path, content);
  const std::optional<IndexedPath> document = FindDocument(id_, path);
  // A change of the content whose own event was lost would go unseen for good once the document
  // has the new dates.
  if (!now || !document || !document->stamp || document->stamp->content != content ||
      !HasSameContent(*document->stamp, *now)) {
    Submit(path);
    return;
  }
  Json::Value requests(Json::arrayValue);
  requests.append(MakeAttributes(id_, path, *now));
  SendCounted(std::move(requests));
}

void Cycle::Rename(const std::string& path, const std::string& path_old) {
  // Neither happens on a disk. The library would move documents into a folder that it moves for
  // ever.
  if (!scope_.IsInShare(path_old) || IsSameOrBelow(path, path_old)) {
    Reconcile(path, Json::Value());
    return;
  }
  Settle();
  const std::optional<IndexedPath> document = FindDocument(id_, path_old);
  const std::optional<Stamp> now = StampOfPath(path, scope_.WantsContent(path));
  RenameFacts facts;
  facts.new_is_wanted = now ? IsWanted(path) : scope_.Covers(path);
  facts.has_document = document.has_value();
  facts.document_inode = document ? InodeOf(document->stamp) : std::nullopt;
  facts.old_inode = InodeOf(StampOfPath(path_old, /*content=*/false));
  facts.new_inode = InodeOf(now);
  RenameStep step = PlanRename(facts);
  // What was handed over before this may be of what came after it: see touched_.
  const bool has_missed = missed_.HaveBelow(path_old);
  const bool is_mixed = has_missed || WasTouched(path) || WasTouched(path_old);
  ForgetMissed(path_old);
  ForgetTaken(path);
  ForgetTaken(path_old);
  if (step == RenameStep::kMove && !Move(path, path_old)) {
    step = RenameStep::kReconcile;
  }
  if (step == RenameStep::kMove) {
    NoteMove(path, path_old);
    if (now) {
      FinishMove(path, path_old, document->stamp, *now);
      // What lies below keeps what it was indexed with, unless other settings hold now.
      if (is_mixed || !scope_.HaveSameSettings(path, path_old)) {
        ReconcileMixed(path);
      }
    } else {
      moved_to_nothing_.insert(path);
      if (has_missed) {
        NoteMissed(path);  // It was renamed on.
      }
    }
  } else if (step == RenameStep::kReconcile) {
    ReconcileMixed(path);
  } else {
    Delete(path);
  }
  if (facts.old_inode) {
    ReconcileMixed(path_old);
  } else {
    Delete(path_old);
  }
}

// False when the engine refuses these documents.
bool Cycle::Move(const std::string& path, const std::string& path_old) {
  has_sent_ = true;
  try {
    if (IsSameOrBelow(path_old, path)) {
      elastic::IndexRename(share_, path, path_old);  // Some move to where others are.
      return true;
    }
    MoveBelow(
        id_, path, path_old, [this] { Check(); },
        [this](const std::string& document, const FailedItem& item) {
          if (OfOperation(item.code) != Consequence::kGoOn) {
            throw Error(static_cast<ErrorCode>(item.code), item.reason);
          }
          Count(item.code, item.reason, document);
        });
    // Last: as long as it is at the old path, doing this again moves what is left there.
    Json::Value requests(Json::arrayValue);
    requests.append(MakeMove(id_, path, path_old));
    for (const FailedItem& item : SendList(std::move(requests))) {
      throw Error(static_cast<ErrorCode>(item.code), item.reason);
    }
    return true;
  } catch (const Error& error) {
    if (OfOperation(error.GetErrorCode()) != Consequence::kGoOn) {
      throw;
    }
    Count(error.GetErrorCode(), error.what(), path);
    return false;
  }
}

// The renamed object's own document: its dates are new, and its type may be.
void Cycle::FinishMove(const std::string& path, const std::string& path_old,
                       const std::optional<Stamp>& before, const Stamp& now) {
  if (!before || before->content != now.content || !HasSameContent(*before, now) ||
      GetFileExtension(path, /*lower=*/true) != GetFileExtension(path_old, /*lower=*/true)) {
    Submit(path);
    return;
  }
  Json::Value requests(Json::arrayValue);
  requests.append(MakeAttributes(id_, path, now));
  SendCounted(std::move(requests));
}

// Where documents may stand at each other's paths. Files that were made in the same tick have the
// same dates.
void Cycle::ReconcileMixed(const std::string& path) {
  inodes_count_ = true;
  Reconcile(path, Json::Value());
}

void Cycle::ReconcileShare() { Reconcile(scope_.SharePath(), Json::Value(), kByItself); }

void Cycle::ReconcileNewFolders() {
  const std::vector<std::string>& folders = scope_.Folders();
  const auto is_folder = [&](const std::string& path) {
    return std::binary_search(folders.begin(), folders.end(), path);
  };
  if (state_.crawl && state_.crawl->cause == kByItself && !is_folder(state_.crawl->root)) {
    state_.crawled.insert(state_.crawl->root);  // As far as it came.
    state_.crawl.reset();
  }
  const std::set<std::string> crawled = state_.crawled;
  for (const std::string& folder : crawled) {
    if (!is_folder(folder)) {
      Reconcile(folder, Json::Value(), kByItself);
      state_.crawled.erase(folder);
      state_.settings.erase(folder);
      state_changed_ = true;
    }
  }
  for (const std::string& folder : folders) {
    if (!state_.crawled.contains(folder)) {
      Reconcile(folder, Json::Value(), kByItself);
    }
  }
}

void Cycle::ReconcileOtherSettings() {
  for (const std::string& folder : scope_.Folders()) {
    const auto known = state_.settings.find(folder);
    if (known == state_.settings.end()) {
      state_.settings[folder] = scope_.SettingsOf(folder);  // Was crawled before they were noted.
      state_changed_ = true;
    } else if (known->second != scope_.SettingsOf(folder)) {
      Reconcile(folder, Json::Value(), kByItself);
    }
  }
}

bool Cycle::IndexUnread() {
  constexpr unsigned kPage = 500;
  Settle();
  std::vector<std::string> page;
  std::string after;
  bool all_are_there = true;
  do {
    page = ListUnread(id_, after, kPage);
    if (!page.empty() && after.empty() && !CanReadContents()) {
      return false;
    }
    for (const std::string& path : page) {
      Check();
      LookAhead();
      if (IsWanted(path)) {
        Submit(path);
      } else {
        all_are_there = false;  // Renamed, say, and its document will be in a later cycle.
      }
      after = path;
    }
  } while (page.size() == kPage);
  return all_are_there;
}

void Cycle::Reconcile(const std::string& root, const Json::Value& types, const char* cause) {
  Settle();
  scope_.CheckShare();
  const std::vector<std::string>& folders = scope_.Folders();
  if (std::all_of(folders.begin(), folders.end(),
                  [&](const std::string& folder) { return IsSameOrBelow(folder, root); })) {
    missed_.Clear();
    state_changed_ = true;
  }
  ForgetMissed(root);
  stats_.SetState(WorkerState::kCrawling);
  CrawlPoint point;
  point.root = root;
  point.cause = (cause == nullptr ? cause_ : cause) + (types.isNull() ? "" : JsonToString(types));
  if (state_.crawl && state_.crawl->root == root && state_.crawl->cause == point.cause) {
    point = *state_.crawl;
  }
  const WalkRules rules = {[this](const std::string& path) { return scope_.Covers(path); },
                           [this](const std::string& path) { return scope_.LeadsToFolder(path); },
                           // What only leads to indexed folders need not be let in itself, such as
                           // a share's directory on which a volume is mounted.
                           [this](const std::string& path) {
                             return scope_.IsInShare(path) &&
                                    (!scope_.Covers(path) || scope_.Allows(path));
                           }};
  CrawlDeeds deeds;
  bool is_first_time = true;  // What cannot be read is tried once more, and then passed over.
  deeds.check = [this] { Check(); };
  deeds.compare = [&](const DiskEntry& entry, const IndexedPath* indexed, bool first_pass) {
    LookAhead();
    Compare(entry, indexed, first_pass && is_first_time ? types : Json::Value::nullSingleton());
  };
  deeds.is_gone = IsGone;
  deeds.remove = [this](std::vector<GoneList::Gone> gone) { Remove(gone); };
  deeds.commit = [this] {
    has_sent_ = true;  // What was found to be there may be what a killed run had not committed.
    Commit();
  };
  deeds.save = [this](const CrawlPoint& reached) {
    state_.crawl = reached;
    NoteGone();  // What goes on from there does not meet them again.
    SaveShareState(ShareStateFile(share_), state_);
  };
  deeds.progress = [this](uint64_t found, bool is_end) {
    stats_.SetProgress(is_end ? found : found - std::min<uint64_t>(found, indexer_.InWork()),
                       found);
  };
  std::optional<ContentRules> content;
  if (types.isNull() && !inodes_count_) {
    content = {[this](const std::string& path) { return scope_.WantsContent(path); },
               [this](const std::string& folder) { return scope_.ContentsIn(folder); }};
  }
  const bool goes_on = !point.after.empty() || point.pass > 1;
  CrawlResult result = Crawl(id_, point, rules, content, deeds);
  // A crawl that was asked for meanwhile was taken for this one, which had passed a part already,
  // and by other settings perhaps.
  if (result.unknown > 0 || goes_on) {
    is_first_time = false;
    result = Crawl(id_, {point.root, point.cause, /*after=*/""}, rules, content, deeds);
  }
  if (result.unknown > 0) {
    Count(ERR_SYSTEM,
          std::to_string(result.unknown) + " folders or files cannot be read, the last: " +
              std::generic_category().message(result.last_error),
          root);
  }
  inodes_count_ = false;
  state_.crawl.reset();
  MarkCrawled(root);
  stats_.SetState(WorkerState::kProcessing);
}

// Makes the document where it is missing, or is another one's, or its type is asked for.
void Cycle::Compare(const DiskEntry& entry, const IndexedPath* indexed, const Json::Value& types) {
  const bool content = scope_.WantsContent(entry.path);
  const bool is_asked_for =
      IsTrue(types, "basic") ||
      (!S_ISDIR(entry.info.st_mode) &&
       IsTrue(types, std::string(GetFileTypeName(GetFileTypeByFullPath(entry.path))).c_str()));
  const Stamp now = StampOf(entry.info, content, timespec{});
  if (is_asked_for || indexed == nullptr || !IsCurrent(indexed->stamp, now) ||
      (inodes_count_ && indexed->stamp->inode != now.inode)) {
    Submit(entry.path);
  }
}

void Cycle::Remove(const std::vector<GoneList::Gone>& gone) {
  // A share that has just been taken away looks as if all were gone.
  scope_.CheckShare();
  for (const auto& [path, with_all_below] : gone) {
    const bool is_gone = IsGone(path);
    if (is_gone) {
      NoteMissed(path);
    }
    if (is_gone && with_all_below) {
      Delete(path);
    } else if (is_gone || !IsWanted(path)) {
      deletes_.append(DeleteItem(id_, path));
    } else if (with_all_below) {
      // Something stands there again, perhaps a file. What was below it was met as gone; what is
      // there by now is told of later.
      ForgetTaken(path);
      deletes_.append(DeleteBelowItem(id_, path));
    }
    if (deletes_.size() >= kMostDeletes) {
      FlushDeletes();
    }
  }
}

// A folder counts as crawled when everything in it was compared, whatever was asked for besides.
void Cycle::MarkCrawled(const std::string& root) {
  for (const std::string& folder : scope_.Folders()) {
    if (!IsSameOrBelow(folder, root)) {
      continue;
    }
    const bool is_new = state_.crawled.insert(folder).second;
    std::string settings = scope_.SettingsOf(folder);
    if (std::string& known = state_.settings[folder]; is_new || known != settings) {
      known = std::move(settings);
      state_changed_ = true;
    }
  }
}

void Cycle::Check() {
  if (is_interrupted_()) {
    throw Interrupted{};
  }
}

bool Cycle::IsWanted(const std::string& path) const {
  return scope_.Covers(path) && scope_.Allows(path) && scope_.IsReached(path);
}

void Cycle::Submit(const std::string& path) {
  const bool content = scope_.WantsContent(path);
  std::optional<Stamp> now = StampOfPath(path, content);
  if (now) {
    now->is_young = false;  // That says when it was looked at.
    const auto taken = taken_.find(path);
    if (taken != taken_.end() && taken->second == *now) {
      return;
    }
    if (taken_.size() >= kMostTaken) {
      taken_.clear();
    }
    taken_[path] = *now;
  }
  indexer_.Upsert(path, content);
}

void Cycle::NoteMissed(const std::string& path) {
  state_.missed.Note(path);
  missed_.Note(path);
  state_changed_ = true;
}

void Cycle::ForgetMissed(const std::string& path) {
  if (missed_.HaveBelow(path)) {
    missed_.Forget(path);
    state_changed_ = true;
  }
}

void Cycle::NoteGone() {
  for (const std::string& path : indexer_.TakeGone()) {
    NoteMissed(path);
  }
}

void Cycle::ForgetTaken(const std::string& path) {
  taken_.erase(path);
  // What lies below stands together, from "/" on and up to the byte behind it.
  taken_.erase(taken_.lower_bound(path + "/"), taken_.lower_bound(path + "0"));
}

void Cycle::NoteMove(const std::string& path, const std::string& path_old) {
  if (moves_.size() < kMostMoves) {
    moves_.emplace(path_old, path);
  } else {
    ReconcileMixed(path);  // At once, as it would not be known later.
  }
}

// Compares where documents of the path have moved to in this cycle. A reindex, or a rename of
// something else to the path, cancels what was pending there, a delete from before the move among
// it; the move has then taken along a document that should have gone.
void Cycle::ReconcileMovedFrom(const std::string& path, bool only_from_above) {
  std::set<std::string> seen = {path};
  std::vector<std::string> todo = {path};
  const auto follow = [&](std::string moved_to) {
    if (seen.insert(moved_to).second) {
      todo.push_back(std::move(moved_to));
    }
  };
  while (!todo.empty()) {
    const std::string from = std::move(todo.back());
    todo.pop_back();
    const bool is_first = from == path;
    std::string at = from;
    if (is_first && only_from_above) {
      at.resize(at.rfind('/'));
    }
    for (; !at.empty(); at.resize(at.rfind('/'))) {
      const auto [first, last] = moves_.equal_range(at);
      for (auto move = first; move != last; ++move) {
        follow(move->second + from.substr(at.size()));
      }
    }
    if (!is_first || !only_from_above) {
      const auto last = moves_.lower_bound(from + "0");
      for (auto move = moves_.lower_bound(from + "/"); move != last; ++move) {
        follow(move->second);
      }
    }
    if (!is_first && (only_from_above || !IsSameOrBelow(from, path))) {
      ReconcileMixed(from);
    }
  }
}

void Cycle::NoteTouched(const std::string& path) {
  if (touched_.size() < kMostTouched) {
    touched_.insert(path);
  } else {
    touched_too_much_ = true;
  }
}

// Whether an operation so far was about the path, what lies below it, or a folder above it.
bool Cycle::WasTouched(const std::string& path) const {
  if (touched_too_much_ || touched_.lower_bound(path + "/") != touched_.lower_bound(path + "0")) {
    return true;
  }
  for (std::string at = path; !at.empty(); at.resize(at.rfind('/'))) {
    if (touched_.contains(at)) {
      return true;
    }
  }
  return false;
}

void Cycle::FlushDeletes() {
  if (!deletes_.empty()) {
    SendCounted(std::exchange(deletes_, Json::Value(Json::arrayValue)));
  }
}

void Cycle::SendCounted(Json::Value requests) {
  has_sent_ = true;
  for (const FailedItem& failed : SendList(requests)) {
    if (OfOperation(failed.code) != Consequence::kGoOn) {
      throw Error(static_cast<ErrorCode>(failed.code), failed.reason);
    }
    const Json::Value& path = requests[static_cast<Json::ArrayIndex>(failed.at)]["data"]["doc_id"];
    Count(failed.code, failed.reason, path.isString() ? path.asString() : "");
  }
}

void Cycle::Settle() {
  FlushDeletes();
  indexer_.Drain();
}

void Cycle::Commit() {
  Settle();
  if (indexer_.TakeWasUsed() || has_sent_) {
    has_sent_ = true;  // Until it is done.
    elastic::IndexCommit(share_);
    // A run that was killed has lost what it had taken, and the next one does not know.
    VEXLO_CHECK(EngineRun() != engine_run_, ERR_ELASTIC_REQUEST,
                "the engine was started anew before the commit");
    has_sent_ = false;
  }
}

// Where a renamed path was gone already, a later operation has taken its documents on or away,
// unless that one was folded into an operation before the rename (a folder that is made, filled by
// the rename, and deleted is one reindex, at the place of its making). Whoever is told of them
// later compares.
void Cycle::RemoveGhosts() {
  for (const std::string& path : std::exchange(moved_to_nothing_, {})) {
    if (IsGone(path)) {
      NoteMissed(path);
      Delete(path);
    }
  }
}

void Cycle::Finish() {
  RemoveGhosts();
  Commit();
  NoteGone();
  state_.missed = missed_;
  if (state_changed_) {
    SaveShareState(ShareStateFile(share_), state_);
    state_changed_ = false;
  }
  for (const auto& [code, count] : failures_) {
    if (count > kMostLogged) {
      daemon::Log(daemon::Level::kError, VEXLO_SOURCE, __LINE__,
                  share_ + ": " + std::to_string(count) +
                      " operations failed, code=" + std::to_string(code));
    }
  }
}

void Cycle::Count(int code, const std::string& reason, const std::string& path) {
  stats_.CountError(code, reason);
  if (++failures_[code] <= kMostLogged) {
    daemon::Log(daemon::Level::kError, VEXLO_SOURCE, __LINE__,
                share_ + ": passed over, path=" + path + ", code=" + std::to_string(code) +
                    ", reason=" + reason);
  }
}

}  // namespace vexlo::fileindexd
