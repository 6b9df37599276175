#include "cli/quarantine_list.h"

#include <json/value.h>
#include <sys/stat.h>

#include <cerrno>
#include <system_error>

#include "common/file.h"
#include "common/json.h"
#include "fileindex/paths.h"

namespace vexlo::cli {
namespace {

constexpr fileindex::FixedPath kFile("/var/lib/kavo/extract/quarantine.json");
constexpr int64_t kSecond = 1'000'000'000;

bool Is(const Json::Value& value, uint64_t number) {
  return value.isUInt64() && value.asUInt64() == number;
}
bool Is(const Json::Value& value, const timespec& time) {
  return value.isInt64() && value.asInt64() == time.tv_sec * kSecond + time.tv_nsec;
}

bool IsAsItWas(const Json::Value& entry) {
  struct stat info {};
  return lstat(entry["path"].asCString(), &info) == 0 && Is(entry["device"], info.st_dev) &&
         Is(entry["inode"], info.st_ino) &&
         Is(entry["size"], static_cast<uint64_t>(info.st_size)) &&
         Is(entry["modified"], info.st_mtim) && Is(entry["changed"], info.st_ctim);
}

}  // namespace

QuarantineList ReadQuarantine() {
  QuarantineList list;
  const std::string file = kFile.Get();
  std::string text;
  if (!ReadFile(text, file)) {
    if (errno != ENOENT) {
      list.fault = file + ": " + std::generic_category().message(errno);
    }
    return list;
  }
  Json::Value document;
  if (!JsonFromString(document, text) || !document.isObject() || !document["files"].isArray()) {
    list.fault = file + " is damaged";
    return list;
  }
  for (const Json::Value& entry : document["files"]) {
    if (entry.isObject() && entry["path"].isString() && entry["reason"].isString() &&
        entry["msg"].isString() && IsAsItWas(entry)) {
      list.files[entry["path"].asString()] =
          entry["reason"].asString() + ": " + entry["msg"].asString();
    }
  }
  return list;
}

}  // namespace vexlo::cli
