#include "daemons/fileindexd/documents.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>
#include <deque>
#include <future>
#include <new>
#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "common/string.h"
#include "daemons/common/no_memory.h"
#include "daemons/common/unique_fd.h"
#include "daemons/fileindexd/file_version.h"
#include "fileindex/comm.h"
#include "fileindex/elastic_control/schema.h"
#include "fileindex/paths.h"
#include "kavo/content_extract.h"
#include "kavo/local/content.h"
#include "kavo/local/open.h"
#include "kavo/sock_connection.h"

namespace vexlo::fileindexd {
namespace {

namespace field = fileindex::elastic::field;

constexpr char kDelete[] = "document_del_by_id";
constexpr int kNotKnown = 2000;  // The engine's answer to a command that it does not know.
// Some hundredths of a second, in which other clients wait.
constexpr unsigned kMovesInRequest = 5000;
constexpr unsigned kMovePage = 2000;
// While the engine carries out one request it reads the next, and this side lists a third page.
constexpr size_t kMostMovesUnderWay = 2;

Json::Value MakeItem(const char* command, const std::string& id, const std::string& path) {
  Json::Value item;
  item["command"] = command;
  item["data"]["id"] = id;
  item["data"]["doc_id"] = path;
  return item;
}

// At once where the engine does not run: the library would wait for it for half a minute, and this
// daemon is to stop before.
void Send(Json::Value* response, const Json::Value& request) {
  const std::string socket = fileindex::kElasticdSocketPath.Get();
  VEXLO_CHECK(access(socket.c_str(), F_OK) != 0, ERR_ELASTIC_REQUEST,
              "the engine does not run, path=" + socket);
  SendRequestImpl(*response, request);
}

enum class Load { kPath, kPathAndStamp };

std::vector<IndexedPath> Query(const std::string& id, Json::Value query,
                               Load load = Load::kPathAndStamp) {
  Json::Value request;
  request["command"] = "document_get_by_query";
  request["data"]["id"] = id;
  query["load_field"].append(field::KAVOMDPath);
  if (load == Load::kPathAndStamp) {
    query["load_field"].append(kStampField);
  }
  request["data"]["query"] = std::move(query);
  Json::Value response;
  Send(&response, request);
  const Json::Value& hits = response["data"];
  VEXLO_CHECK(!hits.isArray(), ERR_BAD_RESPONSE, "the engine's reply has no list");
  std::vector<IndexedPath> found;
  found.reserve(hits.size());
  for (const Json::Value& hit : hits) {
    if (hit.isObject() && hit[field::KAVOMDPath].isString()) {
      found.push_back({hit[field::KAVOMDPath].asString(), StampFrom(hit[kStampField])});
    }
  }
  return found;
}

// False with errno; ENOTDIR, too, where a folder on the way is a link by now, which ParseFile()
// does not follow: what stood there is gone.
bool Stat(const std::string& path, struct stat* info) {
  const daemon::UniqueFd file(kavo::local::OpenInShare(path, O_PATH));
  return file.Get() >= 0 && fstat(file.Get(), info) == 0;
}

bool ParseOnce(const std::string& path, bool content, Json::Value* fields) {
  Json::Value options;
  options[fileindex::elastic::extraction::kOptionNeedMeta] = content;
  *fields = Json::Value(Json::objectValue);
  try {
    KAVO::CONTENT_EXTRACT::ParseFile(path, options, *fields);
    return fields->isObject();
  } catch (const std::exception& error) {
    if (daemon::IsLackOfMemory(error)) {
      throw std::bad_alloc();  // The file is as good as before, and is read when there is memory.
    }
    return false;
  } catch (...) {  // The platform's may throw anything.
    return false;
  }
}

// `reason` is one of kavo::local::content_reason.
bool LacksContent(const Json::Value& fields, const char* reason) {
  const Json::Value& error = fields[kavo::local::kContentErrorField];
  return error.isString() && error.asString().starts_with(reason);
}

// What the system refused once it may grant at the next try.
bool Parse(const std::string& path, bool content, Json::Value* fields) {
  return (ParseOnce(path, content, fields) &&
          !LacksContent(*fields, kavo::local::content_reason::kUnreadable)) ||
         ParseOnce(path, content, fields);
}

void AddCopies(Json::Value* fields) {
  const Json::Value& extracted = *fields;
  (*fields)[field::KAVOMDSearchFileName] = extracted[field::KAVOMDFSName];
  (*fields)[field::KAVOMDSearchAncestor] = extracted[field::KAVOMDParent];
}

std::vector<IndexedPath> QueryBelow(const std::string& id, const std::string& folder,
                                    const std::string& after, unsigned count, Load load,
                                    bool flat = false) {
  Json::Value query;
  if (flat) {
    query["flat"] = true;
  }
  query["qsl"]["prefix"][field::KAVOMDPath] = folder + "/";
  query["size"] = count;
  if (!after.empty()) {
    query["after"] = after;
  }
  return Query(id, std::move(query), load);
}

FailedItem FailureOf(size_t at, const Json::Value& result) {
  const Json::Value& code = result["error"]["code"];
  const Json::Value& reason = result["error"]["msg"];
  return {at, code.isInt() ? code.asInt() : 0, reason.isString() ? reason.asString() : ""};
}

// Requests on their way, each on a thread of its own.
class MovesUnderWay {
 public:
  using Failed = std::function<void(const std::string& path, const FailedItem& item)>;

  explicit MovesUnderWay(const Failed& failed) : failed_(failed) {}

  void Send(Json::Value requests, std::vector<std::string> paths) {
    if (sent_.size() == kMostMovesUnderWay) {
      AwaitFirst();
    }
    sent_.push_back(
        {std::move(paths), std::async(std::launch::async, SendList, std::move(requests))});
  }
  void AwaitAll() {
    while (!sent_.empty()) {
      AwaitFirst();
    }
  }

 private:
  struct Sent {
    std::vector<std::string> paths;
    std::future<std::vector<FailedItem>> failed;
  };

  void AwaitFirst() {
    Sent first = std::move(sent_.front());
    sent_.pop_front();
    for (const FailedItem& item : first.failed.get()) {
      failed_(first.paths.at(item.at), item);
    }
  }

  const Failed& failed_;
  std::deque<Sent> sent_;  // Waited for where they are dropped.
};

// For an engine that does not know how to move all below a folder.
void MovePages(const std::string& id, const std::string& path, const std::string& path_old,
               const std::function<void()>& check,
               const std::function<void(const std::string& path, const FailedItem& item)>& failed) {
  MovesUnderWay moves(failed);
  std::vector<IndexedPath> page;
  std::string after;
  do {
    check();
    // What has moved lies before this page, so nothing need be committed for it to be right.
    page = QueryBelow(id, path_old, after, kMovePage, Load::kPath);
    if (!page.empty()) {
      after = page.back().path;
    }
    Json::Value requests(Json::arrayValue);
    std::vector<std::string> paths;
    paths.reserve(page.size());
    for (IndexedPath& document : page) {
      const std::string moved = path + document.path.substr(path_old.size());
      Json::Value item = MakeItem("document_set_by_id", id, document.path);
      Json::Value& fields = item["data"]["data"];
      fields[field::KAVOMDPath] = moved;
      fields[field::KAVOMDParent] = fields[field::KAVOMDSearchAncestor] = Dirname(moved);
      requests.append(std::move(item));
      paths.push_back(std::move(document.path));
    }
    if (!paths.empty()) {
      moves.Send(std::move(requests), std::move(paths));
    }
  } while (page.size() == kMovePage);
  moves.AwaitAll();
}

}  // namespace

std::optional<IndexedPath> FindDocument(const std::string& id, const std::string& path) {
  Json::Value query;
  query["qsl"]["term"][field::KAVOMDPath] = path;
  std::vector<IndexedPath> found = Query(id, std::move(query));
  return found.empty() ? std::nullopt : std::optional(std::move(found.front()));
}

std::vector<IndexedPath> ListBelow(const std::string& id, const std::string& folder,
                                   const std::string& after, unsigned count) {
  return QueryBelow(id, folder, after, count, Load::kPathAndStamp);
}

std::vector<IndexedPath> ListIn(const std::string& id, const std::string& folder,
                                const std::string& after, unsigned count) {
  return QueryBelow(id, folder, after, count, Load::kPathAndStamp, /*flat=*/true);
}

FolderPage ListFolders(const std::string& id, const std::string& folder, const std::string& after,
                       unsigned count) {
  Json::Value request;
  request["command"] = "folder_digests";
  request["data"]["id"] = id;
  request["data"]["below"] = folder;
  request["data"]["size"] = count;
  if (!after.empty()) {
    request["data"]["after"] = after;
  }
  Json::Value response;
  Send(&response, request);
  const Json::Value& data = response["data"];
  VEXLO_CHECK(!data.isObject() || !data["seed"].isUInt64() || !data["folders"].isArray(),
              ERR_BAD_RESPONSE, "the engine's reply has no folders");
  FolderPage page;
  page.seed = data["seed"].asUInt64();
  page.folders.reserve(data["folders"].size());
  for (const Json::Value& each : data["folders"]) {
    VEXLO_CHECK(!each.isArray() || each.size() != 3 || !each[0].isString() || !each[1].isUInt64() ||
                    !each[2].isUInt64(),
                ERR_BAD_RESPONSE, "the engine's reply has something else than folders");
    page.folders.push_back({each[0].asString(), {each[1].asUInt64(), each[2].asUInt64()}});
  }
  return page;
}

Json::Value MakePut(const std::string& id, const std::string& path, bool content) {
  // The stamp first: a change while the file is read makes the document look old, never new.
  std::optional<Stamp> stamp = StampOfPath(path, content);
  Json::Value fields;
  bool is_parsed = stamp && Parse(path, content, &fields);
  if (stamp && !is_parsed && content) {
    // Better its name and dates than nothing.
    is_parsed = Parse(path, /*content=*/false, &fields);
    stamp->content = false;
  }
  // Of a file that went while it was read there is a part at best.
  if (!stamp || IsGone(path)) {
    return MakeItem(kDelete, id, path);
  }
  VEXLO_CHECK(!is_parsed, ERR_PARSE_FILE, "Parse failed, path=" + path);
  if (LacksContent(fields, kavo::local::content_reason::kUnreadable)) {
    stamp->content = false;  // A change of its rights, and the next comparison, have it read again.
  }
  AddCopies(&fields);
  fields[kStampField] = ToJson(*stamp);
  Json::Value item = MakeItem("document_upsert_by_id", id, path);
  item["data"]["data"] = std::move(fields);
  return item;
}

bool IsDelete(const Json::Value& item) { return item["command"] == kDelete; }

bool IsUnread(const Json::Value& item) {
  return LacksContent(item["data"]["data"], kavo::local::content_reason::kUnavailable);
}

std::vector<std::string> ListUnread(const std::string& id, const std::string& after,
                                    unsigned count) {
  Json::Value query;
  query["qsl"]["term"][kavo::local::kContentErrorField] = kavo::local::content_reason::kUnavailable;
  query["size"] = count;
  if (!after.empty()) {
    query["after"] = after;
  }
  std::vector<std::string> paths;
  for (IndexedPath& found : Query(id, std::move(query))) {
    paths.push_back(std::move(found.path));
  }
  return paths;
}

bool CanReadContents() {
  return kavodaemon::DomainSockConnection(kavo::local::ContentSocket()).Connect(1);
}

Json::Value MakeAttributes(const std::string& id, const std::string& path, const Stamp& stamp) {
  Json::Value fields;
  VEXLO_CHECK(!Parse(path, /*content=*/false, &fields), ERR_PARSE_FILE,
              "Parse failed, path=" + path);
  AddCopies(&fields);
  fields[kStampField] = ToJson(stamp);
  Json::Value item = MakeItem("document_set_by_id", id, path);
  item["data"]["data"] = std::move(fields);
  return item;
}

std::optional<Stamp> StampOfPath(const std::string& path, bool content) {
  struct stat info {};
  if (!Stat(path, &info)) {
    VEXLO_CHECK(errno != ENOENT && errno != ENOTDIR, ERR_SYSTEM, "lstat failed, path=" + path);
    return std::nullopt;
  }
  timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  return StampOf(info, content, now);
}

bool IsGone(const std::string& path) {
  struct stat info {};
  return !Stat(path, &info) && (errno == ENOENT || errno == ENOTDIR);
}

std::string EngineRun() {
  // Each run makes its socket anew.
  return FileVersion(fileindex::kElasticdSocketPath.Get());
}

std::vector<FailedItem> SendList(Json::Value requests) {
  Json::Value request;
  request["compound"] = std::move(requests);
  Json::Value response;
  Send(&response, request);
  const Json::Value& results = response["data"];
  VEXLO_CHECK(!results.isArray(), ERR_BAD_RESPONSE, "the engine's reply has no list");
  std::vector<FailedItem> failed;
  for (Json::ArrayIndex i = 0; i < results.size(); ++i) {
    const Json::Value& result = results[i];
    if (!result["success"].isBool() || !result["success"].asBool()) {
      failed.push_back(FailureOf(i, result));
    }
  }
  return failed;
}

Json::Value MakeMove(const std::string& id, const std::string& path, const std::string& path_old) {
  const std::string name = Basename(path);
  const std::string parent = Dirname(path);
  const std::string extension = GetFileExtension(path, /*lower=*/true);
  Json::Value item = MakeItem("document_set_by_id", id, path_old);
  Json::Value& fields = item["data"]["data"];
  fields[field::KAVOMDPath] = path;
  fields[field::KAVOMDParent] = parent;
  fields[field::KAVOMDFSName] = name;
  fields[field::KAVOMDSearchFileName] = name;
  fields[field::KAVOMDSearchAncestor] = parent;
  fields[field::KAVOMDDisplayName] = name;
  fields[field::KAVOMDKind] = extension;
  fields[field::KAVOMDExtension] = extension;
  return item;
}

void MoveBelow(const std::string& id, const std::string& path, const std::string& path_old,
               const std::function<void()>& check,
               const std::function<void(const std::string& path, const FailedItem& item)>& failed) {
  Json::Value request;
  request["command"] = "document_move_below";
  Json::Value& data = request["data"];
  data["id"] = id;
  data["from"] = path_old;
  data["to"] = path;
  data["folder_field"].append(field::KAVOMDParent);
  data["folder_field"].append(field::KAVOMDSearchAncestor);
  data["size"] = kMovesInRequest;
  do {
    check();
    Json::Value response;
    try {
      Send(&response, request);
    } catch (const Error& error) {
      if (error.GetErrorCode() != kNotKnown) {
        throw;
      }
      MovePages(id, path, path_old, check, failed);
      return;
    }
    const Json::Value& answer = response["data"];
    VEXLO_CHECK(!answer.isObject() || !answer["failed"].isArray(), ERR_BAD_RESPONSE,
                "the engine's reply has no list");
    for (const Json::Value& item : answer["failed"]) {
      const Json::Value& document = item["doc_id"];
      failed(document.isString() ? document.asString() : "", FailureOf(0, item));
    }
    data["after"] = answer["after"];
  } while (data["after"].isString());
}

}  // namespace vexlo::fileindexd
