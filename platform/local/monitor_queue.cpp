#include "kavo/monitor_queue.h"

#include <fcntl.h>
#include <json/reader.h>
#include <json/writer.h>
#include <sys/stat.h>
#include <syslog.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <memory>
#include <set>
#include <sstream>
#include <utility>

#include "kavo/local/monitor_queues.h"
#include "kavo/local/shares.h"
#include "platform/local/edit_file.h"
#include "platform/local/fd.h"

namespace kavo::local {
namespace {

constexpr char kFolder[] = "/var/lib/kavo/evnotify";
constexpr std::string_view kSuffix = ".json";
constexpr size_t kMaxAppBytes = 200;
constexpr int kMaxNesting = 16;

constexpr char kQueues[] = "queues";
constexpr char kQueue[] = "queue";
constexpr char kType[] = "type";
constexpr char kConfig[] = "config";
constexpr char kPath[] = "path";
constexpr char kMask[] = "mask";
constexpr char kIgnore[] = "ignore";

// A registration, or an application's name, that is malformed. The message goes behind what it is
// about.
class Malformed : public std::runtime_error {
  using std::runtime_error::runtime_error;
};

void Require(bool holds, const std::string& what) {
  if (!holds) {
    throw Malformed(what);
  }
}

void CheckApp(const std::string& app) {
  Require(!app.empty() && app.size() <= kMaxAppBytes && app[0] != '.' &&
              app.find_first_of(std::string("/\0", 2)) == std::string::npos,
          "an application's name has 1 to 200 bytes without \"/\" and NUL, and does not begin with "
          "\".\"");
}

std::string FileOf(const std::string& app) {
  return MonitorQueuesFolder() + "/" + app + std::string(kSuffix);
}

// --- One registration

const Json::Value& Member(const Json::Value& object, const char* key) {
  Require(object.isObject(), "what holds \"" + std::string(key) + "\" must be an object");
  Require(object.isMember(key), "\"" + std::string(key) + "\" is missing");
  return object[key];
}

std::string ReadPath(const Json::Value& object, const char* key) {
  const Json::Value& value = Member(object, key);
  Require(value.isString(), "\"" + std::string(key) + "\" must be a text");
  std::string path = value.asString();
  Require(IsNormalised(path) && path.find('\0') == std::string::npos,
          "\"" + std::string(key) +
              "\" must be absolute, without \".\", \"..\", NUL and doubled or trailing slashes");
  return path;
}

bool IsWhole(const Json::Value& value) {
  return value.type() == Json::intValue || value.type() == Json::uintValue;
}

MonitoredFolder ReadFolder(const Json::Value& value) {
  MonitoredFolder folder;
  folder.path = ReadPath(value, kPath);
  const Json::Value& mask = Member(value, kMask);
  Require(IsWhole(mask) && mask.isUInt(), "\"mask\" must be a whole number of 32 bits");
  folder.mask = mask.asUInt();
  const Json::Value& ignore = value[kIgnore];
  Require(ignore.isNull() || ignore.isArray(), "\"ignore\" must be a list");
  folder.ignore.reserve(ignore.size());
  for (const Json::Value& name : ignore) {
    Require(name.isString() && !name.asString().empty() &&
                name.asString().find_first_of(std::string("/\0", 2)) == std::string::npos,
            "\"ignore\" must list names, without \"/\" and NUL");
    folder.ignore.push_back(name.asString());
  }
  return folder;
}

// The application is left to the caller.
RegisteredQueue ReadQueue(const Json::Value& value, int type) {
  RegisteredQueue queue;
  queue.queue = ReadPath(value, kQueue);
  queue.type = type;
  const Json::Value& config = Member(value, kConfig);
  Require(config.isArray(), "\"config\" must be a list");
  queue.folders.reserve(config.size());
  std::set<std::string> paths;
  for (const Json::Value& folder : config) {
    MonitoredFolder monitored = ReadFolder(folder);
    Require(monitored.path != queue.queue, "\"path\" must be another one than the queue");
    if (paths.insert(monitored.path).second) {
      queue.folders.push_back(std::move(monitored));
    }
  }
  return queue;
}

Json::Value ToJson(const RegisteredQueue& queue) {
  Json::Value value(Json::objectValue);
  value[kQueue] = queue.queue;
  value[kType] = queue.type;
  value[kConfig] = Json::arrayValue;
  for (const MonitoredFolder& folder : queue.folders) {
    Json::Value entry(Json::objectValue);
    entry[kPath] = folder.path;
    entry[kMask] = folder.mask;
    entry[kIgnore] = Json::arrayValue;
    for (const std::string& name : folder.ignore) {
      entry[kIgnore].append(name);
    }
    value[kConfig].append(std::move(entry));
  }
  return value;
}

// --- An application's file

Json::Value Parse(const std::string& text) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  builder["stackLimit"] = kMaxNesting;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value root;
  std::string errors;
  bool is_json = false;
  try {
    is_json = reader->parse(text.data(), text.data() + text.size(), &root, &errors);
  } catch (const Json::Exception& error) {
    RethrowNoMemory(error);  // Else it is nested too deep.
  }
  Require(is_json, "not JSON");
  return root;
}

// Empty when there is no file. Throws FileError for one that cannot be used.
std::vector<RegisteredQueue> ReadFile(const std::string& app, const std::string& file) {
  // A FIFO in the file's place must not hold up whoever asks.
  const ScopedFd fd(open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (fd.Get() < 0 && errno == ENOENT) {
    return {};
  }
  struct stat info {};
  std::string text;
  if (fd.Get() < 0 || fstat(fd.Get(), &info) != 0 ||
      !ReadAll(fd.Get(), static_cast<size_t>(info.st_size), text)) {
    throw FileError(file + ": cannot be read: " + strerror(errno));
  }
  std::vector<RegisteredQueue> queues;
  try {
    Require(text.size() <= kMaxFileBytes, "too large");
    const Json::Value root = Parse(text);
    const Json::Value& list = Member(root, kQueues);
    Require(list.isArray(), "\"queues\" must be a list");
    queues.reserve(list.size());
    std::set<std::pair<std::string, int>> keys;
    for (const Json::Value& value : list) {
      const Json::Value& type = Member(value, kType);
      Require(IsWhole(type) && type.isInt(), "\"type\" must be a whole number of 32 bits");
      queues.push_back(ReadQueue(value, type.asInt()));
      queues.back().app = app;
      Require(keys.emplace(queues.back().queue, type.asInt()).second,
              "two queues have the same path and type");
    }
  } catch (const Malformed& error) {
    throw FileError(file + ": " + error.what());
  }
  return queues;
}

// A queue on a line of its own.
std::string Serialise(const std::vector<RegisteredQueue>& queues) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;  // Every other form replaces bytes that are not UTF-8.
  const std::unique_ptr<Json::StreamWriter> writer(builder.newStreamWriter());
  std::ostringstream out;
  out.exceptions(std::ios::badbit);  // Or want of memory would end the text early.
  out << "{\"queues\": [";
  const char* separator = "\n  ";
  for (const RegisteredQueue& queue : queues) {
    out << std::exchange(separator, ",\n  ");
    writer->write(ToJson(queue), &out);
  }
  out << "\n]}\n";
  return out.str();
}

// Replaces the application's queues by what change(queues) makes of them, unless it returns false
// because nothing is to be changed. False, with a line in syslog, when that fails.
template <typename Change>
bool Edit(const std::string& app, const Change& change) noexcept {
  try {
    CheckApp(app);
    const std::string file = FileOf(app);
    MakeFolders(FolderOf(file));
    const EditLock lock(file);
    std::vector<RegisteredQueue> queues = ReadFile(app, file);
    if (change(queues)) {
      const std::string text = Serialise(queues);
      if (text.size() > kMaxFileBytes) {
        throw FileError(file + ": the queues of an application may take 64 MiB");
      }
      ReplaceWhole(file, text);
    }
    return true;
  } catch (const std::exception& error) {
    syslog(LOG_ERR, "kavoplatform: the queues of application '%s' are not changed: %s", app.c_str(),
           error.what());
    return false;
  }
}

template <typename Queues>
auto Find(Queues& queues, const std::string& path, int type) {
  return std::find_if(queues.begin(), queues.end(), [&](const RegisteredQueue& queue) {
    return queue.queue == path && queue.type == type;
  });
}

}  // namespace

std::string MonitorQueuesFolder() { return Root() + kFolder; }

MonitorQueues ReadMonitorQueues() {
  const std::string folder = MonitorQueuesFolder();
  std::set<std::string> apps;
  std::error_code error;
  for (std::filesystem::directory_iterator entry(folder, error), end; !error && entry != end;
       entry.increment(error)) {
    const std::string name = entry->path().filename();
    if (name.ends_with(kSuffix) && !name.starts_with('.')) {
      apps.insert(name.substr(0, name.size() - kSuffix.size()));
    }
  }
  if (error && error != std::errc::no_such_file_or_directory) {
    throw MonitorQueuesError(folder + ": cannot be read: " + error.message());
  }
  MonitorQueues all;
  for (const std::string& app : apps) {
    try {
      std::vector<RegisteredQueue> queues = ReadFile(app, FileOf(app));
      std::move(queues.begin(), queues.end(), std::back_inserter(all.queues));
    } catch (const FileError& unusable) {
      all.unreadable[app] = unusable.what();
    }
  }
  return all;
}

}  // namespace kavo::local

namespace EVNOTIFYD {

using kavo::local::RegisteredQueue;

MonitorQueue::MonitorQueue(const Json::Value& description) : description_(description) {}

bool MonitorQueue::Upsert(const MonitorQueue& queue, const std::string& app_name,
                          MonitorQueueType type) noexcept {
  return kavo::local::Edit(app_name, [&](std::vector<RegisteredQueue>& queues) {
    RegisteredQueue registered = kavo::local::ReadQueue(queue.description_, type);
    const auto found = kavo::local::Find(queues, registered.queue, type);
    if (found == queues.end()) {
      queues.push_back(std::move(registered));
    } else {
      *found = std::move(registered);
    }
    return true;
  });
}

bool MonitorQueue::Delete(const std::string& queue_path, const std::string& app_name,
                          MonitorQueueType type) noexcept {
  return kavo::local::Edit(app_name, [&](std::vector<RegisteredQueue>& queues) {
    const auto found = kavo::local::Find(queues, queue_path, type);
    if (found == queues.end()) {
      return false;
    }
    queues.erase(found);
    return true;
  });
}

}  // namespace EVNOTIFYD
