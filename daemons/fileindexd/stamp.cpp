#include "daemons/fileindexd/stamp.h"

namespace vexlo::fileindexd {
namespace {

constexpr int64_t kSecond = 1'000'000'000;
// The kernel gives files the time of its last tick, which is 10 ms old at most; a file system that
// keeps whole seconds, of which FAT has only the even ones, is told by their looks.
constexpr int64_t kTick = kSecond / 20;
constexpr int64_t kCoarseTick = 2 * kSecond;

int64_t Nanoseconds(const timespec& time) { return time.tv_sec * kSecond + time.tv_nsec; }

bool ReadInt(const Json::Value& value, int64_t* out) {
  if (!value.isInt64()) {
    return false;
  }
  *out = value.asInt64();
  return true;
}

}  // namespace

Stamp StampOf(const struct stat& info, bool content, const timespec& now) {
  Stamp stamp;
  stamp.size = info.st_size;
  stamp.mtime_ns = Nanoseconds(info.st_mtim);
  stamp.ctime_ns = Nanoseconds(info.st_ctim);
  stamp.inode = info.st_ino;
  stamp.content = content;
  const int64_t tick = stamp.ctime_ns % kSecond == 0 ? kCoarseTick : kTick;
  stamp.is_young = Nanoseconds(now) - stamp.ctime_ns < tick;
  return stamp;
}

std::optional<Stamp> StampFrom(const Json::Value& value) {
  Stamp stamp;
  if (!value.isObject() || !ReadInt(value["size"], &stamp.size) ||
      !ReadInt(value["mtime"], &stamp.mtime_ns) || !ReadInt(value["ctime"], &stamp.ctime_ns) ||
      !value["inode"].isUInt64()) {
    return std::nullopt;
  }
  stamp.inode = value["inode"].asUInt64();
  stamp.content = value["content"].isBool() && value["content"].asBool();
  stamp.is_young = value["young"].isBool() && value["young"].asBool();
  return stamp;
}

Json::Value ToJson(const Stamp& stamp) {
  Json::Value value(Json::objectValue);
  value["size"] = static_cast<Json::Int64>(stamp.size);
  value["mtime"] = static_cast<Json::Int64>(stamp.mtime_ns);
  value["ctime"] = static_cast<Json::Int64>(stamp.ctime_ns);
  value["inode"] = static_cast<Json::UInt64>(stamp.inode);
  if (stamp.content) {
    value["content"] = true;
  }
  if (stamp.is_young) {
    value["young"] = true;
  }
  return value;
}

bool IsCurrent(const std::optional<Stamp>& indexed, const Stamp& file) {
  // Not by inode: there are file systems that give a new one at each mount.
  return indexed && !indexed->is_young && HasSameContent(*indexed, file) &&
         indexed->ctime_ns == file.ctime_ns && indexed->content == file.content;
}

bool HasSameContent(const Stamp& indexed, const Stamp& file) {
  return indexed.size == file.size && indexed.mtime_ns == file.mtime_ns;
}

}  // namespace vexlo::fileindexd
