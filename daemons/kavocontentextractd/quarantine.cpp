#include "daemons/kavocontentextractd/quarantine.h"

#include <json/value.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <system_error>

#include "common/check.h"
#include "common/file.h"
#include "common/json.h"
#include "daemons/common/folders.h"
#include "daemons/common/log.h"

namespace vexlo::extractd {
namespace {

constexpr int64_t kSecond = 1000000000;

struct Number {
  const char* name;
  uint64_t ContentKey::*bits;
};
constexpr Number kNumbers[] = {
    {"device", &ContentKey::device}, {"inode", &ContentKey::inode}, {"size", &ContentKey::size}};
struct Time {
  const char* name;
  int64_t ContentKey::*time;
};
constexpr Time kTimes[] = {{"modified", &ContentKey::modified}, {"changed", &ContentKey::changed}};

int64_t NanosecondsOf(const struct timespec& time) { return time.tv_sec * kSecond + time.tv_nsec; }

bool ReadKey(const Json::Value& value, ContentKey& key) {
  for (const Number& number : kNumbers) {
    if (!value[number.name].isUInt64()) {
      return false;
    }
    key.*number.bits = value[number.name].asUInt64();
  }
  for (const Time& time : kTimes) {
    if (!value[time.name].isInt64()) {
      return false;
    }
    key.*time.time = value[time.name].asInt64();
  }
  return true;
}

}  // namespace

ContentKey KeyOf(const struct stat& info) {
  return {info.st_dev, info.st_ino, static_cast<uint64_t>(info.st_size),
          NanosecondsOf(info.st_mtim), NanosecondsOf(info.st_ctim)};
}

Quarantine::Quarantine(std::string file, size_t most) : file_(std::move(file)), most_(most) {
  const std::filesystem::path folder = std::filesystem::path(file_).parent_path();
  if (!daemon::MakeFolders(folder)) {
    throw std::system_error(errno, std::generic_category(), "cannot be made: " + folder.string());
  }
  std::filesystem::permissions(folder, std::filesystem::perms::owner_all);
  if (!Load()) {
    entries_.clear();
    by_file_.clear();
    const std::string aside = file_ + ".damaged";
    const bool moved = rename(file_.c_str(), aside.c_str()) == 0;
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                "the list of quarantined files is damaged and begun anew, path=" + file_ +
                    (moved ? ", the old one is " + aside : ""));
  }
}

// False for a file that is there and cannot be understood.
bool Quarantine::Load() {
  Json::Value document;
  if (!JsonFromFile(document, file_)) {
    return !std::filesystem::exists(file_);
  }
  if (!document.isObject() || !document["files"].isArray()) {
    return false;
  }
  for (const Json::Value& value : document["files"]) {
    Entry entry;
    if (!value.isObject() || !ReadKey(value, entry.key) || !value["time"].isInt64() ||
        !value["reason"].isString() || !value["msg"].isString() || !value["path"].isString()) {
      return false;
    }
    entry.reason = value["reason"].asString();
    entry.message = value["msg"].asString();
    entry.path = value["path"].asString();
    entry.time = value["time"].asInt64();
    Put(std::move(entry));
  }
  return true;
}

void Quarantine::Save() {
  Json::Value document(Json::objectValue);
  Json::Value& files = document["files"] = Json::Value(Json::arrayValue);
  for (const Entry& entry : entries_) {
    Json::Value& value = files.append(Json::Value(Json::objectValue));
    for (const Number& number : kNumbers) {
      value[number.name] = static_cast<Json::UInt64>(entry.key.*number.bits);
    }
    for (const Time& time : kTimes) {
      value[time.name] = static_cast<Json::Int64>(entry.key.*time.time);
    }
    value["reason"] = entry.reason;
    value["msg"] = entry.message;
    value["path"] = entry.path;
    value["time"] = static_cast<Json::Int64>(entry.time);
  }
  if (!JsonToFile(document, file_)) {
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                "the list of quarantined files cannot be written, path=" + file_ +
                    ", reason=" + std::generic_category().message(errno));
  }
}

void Quarantine::Put(Entry entry) {
  const FileId id(entry.key.device, entry.key.inode);
  if (const auto found = by_file_.find(id); found != by_file_.end()) {
    entries_.erase(found->second);
    by_file_.erase(found);
  }
  by_file_[id] = entries_.insert(entries_.end(), std::move(entry));
  if (entries_.size() > most_) {
    by_file_.erase({entries_.front().key.device, entries_.front().key.inode});
    entries_.pop_front();
  }
}

std::optional<Fault> Quarantine::Find(const ContentKey& key) {
  const kavo::local::MutexLock lock(mutex_);
  const auto found = by_file_.find({key.device, key.inode});
  if (found == by_file_.end()) {
    return std::nullopt;
  }
  if (found->second->key == key) {
    return Fault(found->second->reason, found->second->message);
  }
  entries_.erase(found->second);
  by_file_.erase(found);
  return std::nullopt;
}

void Quarantine::Add(const ContentKey& key, const Fault& fault, const std::string& path) {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  const kavo::local::MutexLock lock(mutex_);
  Put({key, fault.Reason(), fault.what(), path,
       std::chrono::duration_cast<std::chrono::seconds>(now).count()});
  Save();
}

unsigned Quarantine::CountKill(const ContentKey& key) {
  const FileId id(key.device, key.inode);
  const kavo::local::MutexLock lock(mutex_);
  if (kills_.size() >= most_ && !kills_.contains(id)) {
    kills_.clear();
  }
  auto& [content, kills] = kills_[id];
  kills = content == key ? kills + 1 : 1;
  content = key;
  return kills;
}

void Quarantine::ForgetKills(const ContentKey& key) {
  const kavo::local::MutexLock lock(mutex_);
  kills_.erase({key.device, key.inode});
}

size_t Quarantine::Size() {
  const kavo::local::MutexLock lock(mutex_);
  return entries_.size();
}

}  // namespace vexlo::extractd
