#include "daemons/kavoelasticd/registry.h"

#include <json/value.h>

#include <cerrno>
#include <cstdio>
#include <utility>

#include "common/check.h"
#include "common/file.h"
#include "common/json.h"
#include "common/string.h"
#include "daemons/common/log.h"
#include "daemons/kavoelasticd/disk.h"
#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/store.h"

namespace vexlo::elasticd {
namespace {

constexpr State kStates[] = {State::kActive, State::kPaused, State::kDamaged};

bool ReadEntry(const Json::Value& value, RegistryEntry* entry) {
  if (!value.isObject() || !value["path"].isString() || !value["token"].isString() ||
      !value["state"].isString()) {
    return false;
  }
  entry->path = value["path"].asString();
  entry->token = value["token"].asString();
  if (value["move_to"].isString()) {
    entry->move_to = value["move_to"].asString();
  }
  for (const State state : kStates) {
    if (value["state"].asString() == NameOf(state)) {
      entry->state = state;
      return true;
    }
  }
  return false;
}

bool ReadEntries(const std::string& text, std::map<std::string, RegistryEntry>* entries) {
  Json::Value value;
  if (!JsonFromString(value, text) || !value.isObject() || !value["indexes"].isObject()) {
    return false;
  }
  for (const std::string& id : value["indexes"].getMemberNames()) {
    if (!ReadEntry(value["indexes"][id], &(*entries)[id])) {
      return false;
    }
  }
  return true;
}

}  // namespace

const char* NameOf(State state) {
  switch (state) {
    case State::kPaused:
      return "paused";
    case State::kDamaged:
      return "damaged";
    default:
      return "active";
  }
}

Registry::Registry(std::string file) : file_(std::move(file)) {
  if (const size_t slash = file_.rfind('/'); slash != std::string::npos && slash > 0) {
    MakeFolders(file_.substr(0, slash));
  }
  if (Exists(file_)) {
    Load();
    SettleMoves();
  }
}

void Registry::Load() {
  std::string text;
  if (!ReadFile(text, file_)) {
    throw Failure(Code::kStorage, ErrnoText("the registry cannot be read", file_));
  }
  if (ReadEntries(text, &entries_)) {
    return;
  }
  entries_.clear();
  std::string aside;
  for (int n = 1; aside.empty() || Exists(aside); ++n) {
    aside = file_ + ".damaged-" + std::to_string(n);
  }
  if (rename(file_.c_str(), aside.c_str()) != 0) {
    throw Failure(Code::kStorage, ErrnoText("the damaged registry cannot be renamed", file_));
  }
  daemon::Log(daemon::Level::kError, VEXLO_SOURCE, __LINE__,
              "the registry is damaged and set aside, path=" + aside);
}

void Registry::SettleMoves() {
  std::map<std::string, RegistryEntry> settled = entries_;
  bool any = false;
  for (auto& [id, entry] : settled) {
    if (!entry.move_to.empty()) {
      any = true;
      if (Exists(DatabaseFile(entry.move_to))) {
        entry.path = entry.move_to;
      }
      entry.move_to.clear();
    }
  }
  if (any) {
    Save(std::move(settled));
  }
}

const RegistryEntry* Registry::Find(const std::string& id) const {
  const auto found = entries_.find(id);
  return found == entries_.end() ? nullptr : &found->second;
}

std::string Registry::OwnerOf(const std::string& path) const {
  for (const auto& [id, entry] : entries_) {
    if (entry.path == path || entry.move_to == path || IsSameFile(entry.path, path) ||
        (!entry.move_to.empty() && IsSameFile(entry.move_to, path))) {
      return id;
    }
  }
  return "";
}

void Registry::Put(const std::string& id, const RegistryEntry& entry) { Replace(id, id, entry); }

void Registry::Replace(const std::string& id, const std::string& new_id,
                       const RegistryEntry& entry) {
  std::map<std::string, RegistryEntry> entries = entries_;
  entries.erase(id);
  entries[new_id] = entry;
  Save(std::move(entries));
}

void Registry::Remove(const std::string& id) {
  std::map<std::string, RegistryEntry> entries = entries_;
  entries.erase(id);
  Save(std::move(entries));
}

void Registry::Save(std::map<std::string, RegistryEntry> entries) {
  Json::Value indexes(Json::objectValue);
  for (const auto& [id, entry] : entries) {
    Json::Value& value = indexes[id];
    value["path"] = entry.path;
    value["token"] = entry.token;
    value["state"] = NameOf(entry.state);
    if (!entry.move_to.empty()) {
      value["move_to"] = entry.move_to;
    }
  }
  Json::Value file;
  file["indexes"] = indexes;
  if (!JsonToFile(file, file_)) {
    throw Failure(errno == ENOSPC ? Code::kNoSpace : Code::kStorage,
                  ErrnoText("the registry cannot be written", file_));
  }
  entries_ = std::move(entries);
}

}  // namespace vexlo::elasticd
