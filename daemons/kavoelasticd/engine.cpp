#include "daemons/kavoelasticd/engine.h"

#include <algorithm>
#include <exception>
#include <random>
#include <utility>
#include <vector>

#include "common/check.h"
#include "daemons/common/log.h"
#include "daemons/common/no_memory.h"
#include "daemons/kavoelasticd/commands.h"
#include "daemons/kavoelasticd/disk.h"
#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/folder_sums.h"
#include "daemons/kavoelasticd/search.h"

namespace vexlo::elasticd {
namespace {

// Hits of a page, for those who only search.
constexpr size_t kMostShown = 10000;
// And how long they may make a search take: it keeps a worker, and who would pause the index.
constexpr std::chrono::seconds kSearchTime(10);

// What a request gives as "data": an empty object where there is none.
const Json::Value& DataOf(const Json::Value& request) {
  static const Json::Value kNone(Json::objectValue);
  const Json::Value& data = request["data"];
  if (!data.isNull() && !data.isObject()) {
    throw Failure(Code::kBadRequest, "data is no object");
  }
  return data.isNull() ? kNone : data;
}

std::string AbsoluteFolder(const std::string& path) {
  if (path[0] != '/' || path.find('\0') != std::string::npos) {
    throw Failure(Code::kBadRequest, "path is not absolute: " + path);
  }
  std::string folder = path;
  while (folder.size() > 1 && folder.ends_with('/')) {
    folder.pop_back();
  }
  return folder;
}

std::string NewToken() {
  std::random_device random;
  std::string token;
  for (int i = 0; i < 16; ++i) {
    token += "0123456789abcdef"[random() % 16];
  }
  return token;
}

// The index that an item of a compound writes to, "" when it is no such item.
std::string WriteTarget(const Json::Value& item) {
  if (!item.isObject() || !item["command"].isString() || !IsWrite(item["command"].asString()) ||
      !item["data"].isObject()) {
    return "";
  }
  const Json::Value& id = item["data"]["id"];
  return id.isString() ? id.asString() : "";
}

Json::Value WithData(Json::Value data) {
  Json::Value reply = Success();
  reply["data"] = std::move(data);
  return reply;
}

}  // namespace

Engine::Engine(std::string registry_path) : registry_(std::move(registry_path)) {
  for (const auto& [id, entry] : registry_.Entries()) {
    auto slot = std::make_shared<Slot>();
    slot->id = id;
    slot->entry = entry;
    slots_.emplace(id, std::move(slot));
  }
}

Engine::~Engine() {
  for (const auto& [id, slot] : slots_) {
    try {
      if (slot->store != nullptr) {
        slot->store->Close();
      }
    } catch (const std::exception& error) {
      daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                  "closing failed, id=" + id + ", reason=" + error.what());
    }
  }
}

Json::Value Engine::Handle(const Json::Value& request) {
  return Answer([&] { return Dispatch(request); });
}

Json::Value Engine::HandleSearch(const Json::Value& request, const JudgePaths& judge) {
  return Answer([&] {
    if (!request.isObject() || request.isMember("compound") ||
        RequiredText(request, "command") != "search") {
      throw Failure(Code::kBadRequest, "only searches are answered here");
    }
    const Json::Value& data = DataOf(request);
    if (PageNumber(data, "from", 0) + PageNumber(data, "size", 0) > kMostShown) {
      throw Failure(Code::kBadRequest, "the page ends behind the hit number 10000");
    }
    return Search(data, judge, std::chrono::steady_clock::now() + kSearchTime);
  });
}

Json::Value Engine::Answer(const std::function<Json::Value()>& work) {
  try {
    return work();
  } catch (const Failure& failure) {
    return Refusal(failure.GetCode(), failure.what());
  } catch (const std::exception& error) {
    if (daemon::IsLackOfMemory(error)) {
      return Refusal(Code::kStorage, kNoMemory);
    }
    daemon::Log(daemon::Level::kError, VEXLO_SOURCE, __LINE__,
                std::string("a request failed, reason=") + error.what());
    return Refusal(Code::kInternal, error.what());
  }
}

Json::Value Engine::Dispatch(const Json::Value& request) {
  if (!request.isObject()) {
    throw Failure(Code::kBadRequest, "the request is no object");
  }
  if (request.isMember("compound")) {
    return Compound(request["compound"]);
  }
  const std::string command = RequiredText(request, "command");
  const Json::Value& data = DataOf(request);
  if (IsWrite(command)) {
    WithStore(RequiredText(data, "id"), [&](Store& store) {
      store.Write([&](Writer& writer, Session& /*session*/) { RunWrite(writer, command, data); });
    });
    NoteChange();
    return Success();
  }
  if (command == "document_move_below") {
    Json::Value answer;
    WithStore(RequiredText(data, "id"), [&](Store& store) {
      store.Write([&](Writer& writer, Session& /*session*/) { answer = MoveBelow(writer, data); });
    });
    NoteChange();
    return WithData(std::move(answer));
  }
  if (command == "document_get_by_query") {
    Json::Value hits;
    WithStore(RequiredText(data, "id"), [&](Store& store) {
      store.Read([&](Session& session) { hits = GetByQuery(session, data); });
    });
    return WithData(std::move(hits));
  }
  if (command == "folder_digests") {
    Json::Value digests;
    WithStore(RequiredText(data, "id"), [&](Store& store) {
      store.Read([&](Session& session) { digests = GetFolderDigests(session, data); });
    });
    return WithData(std::move(digests));
  }
  if (command == "commit") {
    WithStore(RequiredText(data, "id"), [](Store& store) { store.Commit(); });
    return Success();
  }
  if (command == "search") {
    return Search(data, nullptr, std::nullopt);
  }
  if (command == "index_list") {
    return WithData(IndexList());
  }
  constexpr std::pair<const char*, void (Engine::*)(const Json::Value&)> kAdmin[] = {
      {"index_create", &Engine::IndexCreate},
      {"index_delete", &Engine::IndexDelete},
      {"index_pause", &Engine::IndexPause},
      {"index_resume", &Engine::IndexResume},
      {"index_config_set", &Engine::IndexConfigSet}};
  for (const auto& [name, run] : kAdmin) {
    if (command == name) {
      const kavo::local::MutexLock lock(admin_mutex_);
      (this->*run)(data);
      return Success();
    }
  }
  throw Failure(Code::kBadRequest, "the command is not known: " + command);
}

Json::Value Engine::Compound(const Json::Value& list) {
  if (!list.isArray()) {
    throw Failure(Code::kBadRequest, "compound is no list");
  }
  // By pointer, as the library looks up the place of every element anew.
  std::vector<const Json::Value*> items;
  for (const Json::Value& item : list) {
    items.push_back(&item);
  }
  std::vector<Json::Value> results(items.size());
  // What stands together for one index is done together.
  for (size_t from = 0; from < items.size();) {
    const std::string id = WriteTarget(*items[from]);
    size_t to = from + 1;
    while (to < items.size() && WriteTarget(*items[to]) == id) {
      ++to;
    }
    CompoundRun(id, std::span(items).subspan(from, to - from),
                std::span(results).subspan(from, to - from));
    from = to;
  }
  Json::Value data(Json::arrayValue);
  bool has_fail = false;
  for (Json::Value& result : results) {
    has_fail = has_fail || !result["success"].asBool();
    data.append(std::move(result));
  }
  Json::Value reply = WithData(std::move(data));
  reply["has_fail"] = has_fail;
  return reply;
}

void Engine::CompoundRun(const std::string& id, std::span<const Json::Value* const> items,
                         std::span<Json::Value> results) {
  const auto refused = [&](size_t i, const Failure& failure) {
    results[i] = Refusal(failure.GetCode(), failure.what());
  };
  const auto run_item = [&](Writer& writer, size_t i) {
    const Json::Value& request = *items[i];
    try {
      RunWrite(writer, request["command"].asString(), request["data"]);
      results[i] = Success();
    } catch (const Failure& failure) {
      if (!failure.IsAnswer()) {
        throw;
      }
      refused(i, failure);
    }
  };
  try {
    if (id.empty()) {
      throw Failure(Code::kBadRequest, "a compound holds commands on documents, each with an id");
    }
    WithStore(id, [&](Store& store) {
      store.Write([&](Writer& writer, Session& /*session*/) {
        writer.List(
            items.size(), [&](size_t i) { run_item(writer, i); }, refused);
      });
    });
    NoteChange();
  } catch (const Failure& failure) {
    for (size_t i = 0; i < items.size(); ++i) {
      refused(i, failure);
    }
  }
}

Engine::SlotPtr Engine::Find(const std::string& id) {
  const kavo::local::MutexLock lock(registry_mutex_);
  const auto found = slots_.find(id);
  if (found == slots_.end()) {
    throw Failure(Code::kIndexMissing, "there is no index " + id);
  }
  return found->second;
}

void Engine::WithStore(const std::string& id, const StoreUse& use) {
  const SlotPtr slot = Find(id);
  // As a rule twice at most: once to find it closed, once when it is open. Whoever closes it in
  // between also changes its state.
  for (;;) {
    uint64_t damaged_opening = 0;
    {
      const Gate::Visit visit(slot->gate);
      if (slot->gone || slot->id != id) {
        throw Failure(Code::kIndexMissing, "there is no index " + id);
      }
      if (slot->entry.state == State::kPaused) {
        throw Failure(Code::kIndexPaused, "the index is paused: " + id);
      }
      if (slot->entry.state == State::kDamaged) {
        throw Failure(Code::kIndexDamaged, "the index must be rebuilt: " + id);
      }
      if (slot->store != nullptr) {
        try {
          use(*slot->store);
          return;
        } catch (const Failure& failure) {
          if (failure.GetCode() != Code::kIndexDamaged) {
            throw;
          }
          daemon::Log(daemon::Level::kError, VEXLO_SOURCE, __LINE__,
                      "damage is met, id=" + id + ", reason=" + failure.what());
          damaged_opening = slot->openings;
        }
      }
    }
    const Gate::Alone alone(slot->gate);
    // Between the two gates others may have opened the index, or closed and opened it.
    if (slot->store != nullptr) {
      if (slot->openings == damaged_opening) {
        MarkDamaged(*slot, "damage was met while it was used");
      }
    } else if (!slot->gone && slot->entry.state == State::kActive) {
      Open(*slot);
    }
  }
}

void Engine::Open(Slot& slot) {
  try {
    slot.store = std::make_unique<Store>(slot.entry.path, slot.entry.token);
    ++slot.openings;
  } catch (const Failure& failure) {
    if (failure.GetCode() != Code::kIndexDamaged) {
      throw;
    }
    MarkDamaged(slot, failure.what());
  }
}

void Engine::MarkDamaged(Slot& slot, const std::string& reason) {
  slot.store.reset();
  const std::string aside = SetAside(slot.entry.path);
  daemon::Log(
      daemon::Level::kError, VEXLO_SOURCE, __LINE__,
      "the index must be rebuilt, id=" + slot.id + ", set aside=" + aside + ", reason=" + reason);
  SetState(slot, State::kDamaged);
}

void Engine::SetState(Slot& slot, State state) {
  RegistryEntry entry = slot.entry;
  entry.state = state;
  const kavo::local::MutexLock lock(registry_mutex_);
  registry_.Put(slot.id, entry);
  slot.entry = entry;
}

// Everything in the one file afterwards, or the index marked as damaged.
void Engine::CloseCleanly(Slot& slot) {
  if (slot.store == nullptr && Exists(DatabaseFile(slot.entry.path) + "-wal") &&
      slot.entry.state != State::kDamaged) {
    Open(slot);
  }
  if (slot.store != nullptr) {
    slot.store->Close();
    slot.store.reset();
  }
}

void Engine::IndexCreate(const Json::Value& data) {
  const std::string id = RequiredText(data, "id");
  const std::string path = AbsoluteFolder(RequiredText(data, "path"));
  const IndexInfo info = {NewToken(), data["mappings"], data["settings"], data["event_handler"]};
  const Schema schema(info.mappings);
  const WordCutter cutter(LanguageOf(info.settings));
  SlotPtr slot;
  {
    const kavo::local::MutexLock lock(registry_mutex_);
    const std::string owner = registry_.OwnerOf(path);
    if (!owner.empty() && owner != id) {
      throw Failure(Code::kIndexExists, path + " is the folder of " + owner);
    }
    if (const auto found = slots_.find(id); found != slots_.end()) {
      slot = found->second;
    }
  }
  if (slot == nullptr) {
    slot = std::make_shared<Slot>();
  }
  const Gate::Alone alone(slot->gate);
  if (!slot->entry.path.empty() && slot->entry.state != State::kDamaged) {
    throw Failure(Code::kIndexExists, "there is an index " + id);
  }
  Store::Create(path, info);
  const RegistryEntry entry = {path, info.token, State::kActive, /*move_to=*/""};
  const kavo::local::MutexLock lock(registry_mutex_);
  registry_.Put(id, entry);
  slot->id = id;
  slot->entry = entry;
  slots_[id] = slot;
}

void Engine::IndexDelete(const Json::Value& data) {
  const std::string id = RequiredText(data, "id");
  const SlotPtr slot = Find(id);
  const Gate::Alone alone(slot->gate);
  {
    const kavo::local::MutexLock lock(registry_mutex_);
    registry_.Remove(id);
    slots_.erase(id);
  }
  slot->gone = true;
  slot->store.reset();
  RemoveIndexFolder(slot->entry.path);
}

void Engine::IndexPause(const Json::Value& data) {
  const SlotPtr slot = Find(RequiredText(data, "id"));
  const Gate::Alone alone(slot->gate);
  if (slot->entry.state == State::kDamaged) {
    throw Failure(Code::kIndexDamaged, "the index must be rebuilt: " + slot->id);
  }
  CloseCleanly(*slot);
  if (slot->entry.state == State::kActive) {
    SetState(*slot, State::kPaused);
  }
}

void Engine::IndexResume(const Json::Value& data) {
  const SlotPtr slot = Find(RequiredText(data, "id"));
  const Gate::Alone alone(slot->gate);
  if (slot->entry.state == State::kPaused) {
    SetState(*slot, State::kActive);
    Open(*slot);
  }
  if (slot->entry.state == State::kDamaged) {
    throw Failure(Code::kIndexDamaged, "the index must be rebuilt: " + slot->id);
  }
}

void Engine::IndexConfigSet(const Json::Value& data) {
  const SlotPtr slot = Find(RequiredText(data, "id"));
  const Json::Value& change = DataOf(data);
  const Gate::Alone alone(slot->gate);
  const std::string id = slot->id;
  const std::string new_id = change.isMember("id") ? RequiredText(change, "id") : id;
  RegistryEntry entry = slot->entry;
  const std::string from = entry.path;
  entry.path = change.isMember("path") ? AbsoluteFolder(RequiredText(change, "path")) : from;
  {
    const kavo::local::MutexLock lock(registry_mutex_);
    const std::string owner = registry_.OwnerOf(entry.path);
    if ((new_id != id && slots_.contains(new_id)) || (!owner.empty() && owner != id)) {
      throw Failure(Code::kIndexExists, "the id or the folder belongs to another index");
    }
  }
  CloseCleanly(*slot);
  entry.state = slot->entry.state;
  // With nothing at the old place, whoever moved the share has moved the database with it.
  if (entry.path != from && Exists(DatabaseFile(from))) {
    MakeFolders(entry.path);
    // For good before the registry tells of the move: a database that stands there counts as moved.
    // It may be somebody's backup.
    if (slot->entry.move_to != entry.path) {
      SetAside(entry.path, "found");
    }
    RemoveDatabase(entry.path);
    SyncFolder(entry.path);
    RegistryEntry moving = slot->entry;
    moving.move_to = entry.path;
    {
      const kavo::local::MutexLock lock(registry_mutex_);
      registry_.Put(id, moving);
    }
    MoveDatabase(from, entry.path);
  }
  const kavo::local::MutexLock lock(registry_mutex_);
  registry_.Replace(id, new_id, entry);
  slot->id = new_id;
  slot->entry = entry;
  slots_.erase(id);
  slots_[new_id] = slot;
}

Json::Value Engine::IndexList() {
  Json::Value list(Json::arrayValue);
  const kavo::local::MutexLock lock(registry_mutex_);
  for (const auto& [id, entry] : registry_.Entries()) {
    Json::Value& item = list.append(Json::objectValue);
    item["id"] = id;
    item["path"] = entry.path;
    item["state"] = NameOf(entry.state);
  }
  return list;
}

Json::Value Engine::Search(const Json::Value& data, const JudgePaths& judge,
                           Connection::Deadline deadline) {
  const SearchRequest request = ParseSearch(data);
  std::vector<std::string> ids;
  for (const std::string& id : request.ids) {
    if (std::find(ids.begin(), ids.end(), id) == ids.end()) {
      ids.push_back(id);
    }
  }
  const bool named = !ids.empty();
  if (!named) {
    const kavo::local::MutexLock lock(registry_mutex_);
    for (const auto& [id, slot] : slots_) {
      ids.push_back(id);
    }
  }
  Json::Value reply = Success();
  reply["data"] = Json::arrayValue;
  std::vector<std::pair<SearchHit, const std::string*>> hits;
  size_t total = 0;
  bool is_least = false;
  const Merge merge = ids.size() == 1 ? Merge::kOne : Merge::kSeveral;
  const size_t shown_from = merge == Merge::kOne ? request.from : 0;
  for (const std::string& id : ids) {
    SearchPage page;
    try {
      WithStore(id, [&](Store& store) {
        store.ReadCommitted([&](Session& session) {
          const TimeLimit limit(session.db, deadline);
          page = elasticd::Search(session, request, merge, shown_from, judge);
        });
      });
    } catch (const Failure& failure) {
      if (named || failure.GetCode() == Code::kTimeIsUp) {
        throw;
      }
      Json::Value& skipped = reply["skipped"].append(Json::objectValue);
      skipped["id"] = id;
      skipped["code"] = static_cast<int>(failure.GetCode());
    }
    total += page.total;
    is_least = is_least || page.is_least;
    for (SearchHit& hit : page.hits) {
      hits.emplace_back(std::move(hit), &id);
    }
  }
  std::stable_sort(hits.begin(), hits.end(), [&](const auto& a, const auto& b) {
    return ComesBefore(request, a.first, b.first);
  });
  for (size_t i = request.from; i < hits.size() && i < request.from + request.count; ++i) {
    hits[i].first.shown["id"] = *hits[i].second;
    reply["data"].append(std::move(hits[i].first.shown));
  }
  reply["total"] = static_cast<Json::UInt64>(total);
  if (is_least) {
    reply["total_is_least"] = true;
  }
  return reply;
}

void Engine::NoteChange() {
  const kavo::local::MutexLock lock(change_mutex_);
  if (!changed_) {
    changed_ = true;
    change_noted_.NotifyAll();
  }
}

void Engine::AwaitChange(const std::stop_token& stop) {
  const std::stop_callback wake(stop, [this] {
    const kavo::local::MutexLock lock(change_mutex_);
    change_noted_.NotifyAll();
  });
  kavo::local::MutexLock lock(change_mutex_);
  change_noted_.Wait(
      lock, [&]() KAVO_REQUIRES(change_mutex_) { return changed_ || stop.stop_requested(); });
  changed_ = false;
}

bool Engine::CommitIdle(std::chrono::steady_clock::duration idle) {
  std::vector<SlotPtr> slots;
  {
    const kavo::local::MutexLock lock(registry_mutex_);
    for (const auto& [id, slot] : slots_) {
      slots.push_back(slot);
    }
  }
  bool left = false;
  for (const SlotPtr& slot : slots) {
    const Gate::Visit visit(slot->gate);
    try {
      left = (slot->store != nullptr && slot->store->CommitIdle(idle)) || left;
    } catch (const std::exception& error) {
      daemon::Log(daemon::Level::kError, VEXLO_SOURCE, __LINE__,
                  "committing failed, id=" + slot->id + ", reason=" + error.what());
    }
  }
  return left;
}

}  // namespace vexlo::elasticd
