#include "fileindex/elastic_control/documents.h"

#include <json/value.h>

#include <cerrno>
#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "common/string.h"
#include "fileindex/elastic_control/request.h"
#include "fileindex/elastic_control/schema.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/status_mgr.h"
#include "kavo/content_extract.h"

namespace vexlo::fileindex::elastic {
namespace {

constexpr Json::ArrayIndex kRenameBatch = 10000;

// A key that documents share instead of having a copy each.
Json::StaticString Key(const char* name) { return Json::StaticString(name); }

Json::Value BelowPath(const std::string& path) {
  Json::Value query;
  query[Key("qsl")][Key("prefix")][Key(field::KAVOMDPath)] = path + "/";
  return query;
}

// The list that a query found.
Json::Value Find(const std::string& id, const Json::Value& query) {
  Json::Value request = MakeRequest("document_get_by_query", id);
  request["data"]["query"] = query;
  Json::Value res;
  SendRequestWithRetry(res, request);
  VEXLO_CHECK(!res.isMember("data") || !res["data"].isArray(), ERR_BAD_RESPONSE,
              JsonToStyledString(res));
  return std::move(res["data"]);
}

bool IsDocumentExists(const std::string& share, const std::string& path) {
  Json::Value query;
  query["qsl"]["term"][field::KAVOMDPath] = path;
  return !Find(GetFileIndexID(share), query).empty();
}

Json::Value Extract(const std::string& path, bool need_meta) {
  Json::Value options;
  options[extraction::kOptionNeedMeta] = need_meta;
  Json::Value metadata(Json::objectValue);
  errno = 0;
  try {
    KAVO::CONTENT_EXTRACT::ParseFile(path, options, metadata);
    const Json::Value& extracted =
        metadata;  // What is missing is null, and is not added by reading.
    metadata[field::KAVOMDSearchFileName] = extracted[field::KAVOMDFSName];
    metadata[field::KAVOMDSearchAncestor] = extracted[field::KAVOMDParent];
  } catch (...) {
    FailCheck({VEXLO_SOURCE, __LINE__, __func__, "ParseFile(path, options, metadata)"},
              ERR_PARSE_FILE, "Parse failed, path=" + path, errno);
  }
  return metadata;
}

void SendDocument(const char* command, const std::string& share, const std::string& path,
                  Json::Value fields) {
  Json::Value request = MakeRequest(command, GetFileIndexID(share));
  request["data"]["doc_id"] = path;
  request["data"]["data"] = std::move(fields);
  SendRequest(request);
}

// The request that moves one document below a renamed folder. Takes the hit's path out of it, and
// holds on to the id.
Json::Value MoveOf(Json::Value& hit, const std::string& id, const Json::Value& query,
                   const std::string& new_path, const std::string& old_path) {
  std::string name;
  std::string parent;
  GetJsonValue(name, hit, field::KAVOMDFSName, /*required=*/true);
  GetJsonValue(parent, hit, field::KAVOMDParent, /*required=*/true);
  parent.replace(0, old_path.size(), new_path);
  Json::Value move;
  move[Key("command")] = Key("document_set_by_id");
  Json::Value& data = move[Key("data")];
  data[Key("id")] = Key(id.c_str());
  data[Key("doc_id")] = std::move(hit[field::KAVOMDPath]);
  // The engine does not look at it, but is used to seeing it.
  data[Key("query")] = query;
  Json::Value& fields = data[Key("data")];
  fields[Key(field::KAVOMDParent)] = parent;
  fields[Key(field::KAVOMDPath)] = parent + "/" + name;
  fields[Key(field::KAVOMDSearchFileName)] = name;
  fields[Key(field::KAVOMDSearchAncestor)] = parent;
  return move;
}

// Moves the first documents below the old path, and says how many there were. There is one list of
// hits and one of moves at a time: each takes the other's place in memory.
Json::ArrayIndex MoveBatch(const std::string& id, const Json::Value& query,
                           const std::string& new_path, const std::string& old_path) {
  Json::Value hits = Find(id, query);
  const Json::ArrayIndex count = hits.size();
  if (count == 0) {
    return 0;
  }
  Json::Value request;
  Json::Value& moves = request["compound"];
  for (Json::Value& hit : hits) {
    moves.append(MoveOf(hit, id, query, new_path, old_path));
    hit = Json::Value();
  }
  hits = Json::Value();
  SendRequest(request);
  return count;
}

}  // namespace

void IndexUpsert(const std::string& share, const std::string& path, bool need_meta) {
  SendDocument("document_upsert_by_id", share, path, Extract(path, need_meta));
}

void IndexAttr(const std::string& share, const std::string& path) {
  if (!IsDocumentExists(share, path)) {
    throw Error(ERR_DOC_NOT_FOUND);
  }
  SendDocument("document_set_by_id", share, path, Extract(path, /*need_meta=*/false));
}

void IndexDel(const std::string& share, const std::string& path) {
  Json::Value request = MakeRequest("document_del_by_id", GetFileIndexID(share));
  request["data"]["doc_id"] = path;
  SendRequest(request);
}

void IndexDelDir(const std::string& share, const std::string& path) {
  Json::Value request = MakeRequest("document_del_by_query", GetFileIndexID(share));
  request["data"]["query"] = BelowPath(path);
  SendRequest(request);
}

void IndexGetByPrefixPath(const std::string& id, const std::string& path,
                          std::vector<std::string>& out) {
  Json::Value query = BelowPath(path);
  query["load_field"].append(field::KAVOMDPath);
  const Json::Value hits = Find(id, query);
  for (const Json::Value& hit : hits) {
    if (hit.isObject() && hit.isMember(field::KAVOMDPath) &&
        isJsonType<std::string>(hit[field::KAVOMDPath])) {
      out.push_back(hit[field::KAVOMDPath].asString());
    }
  }
}

void IndexCommit(const std::string& share) {
  try {
    SendRequest(MakeRequest("commit", GetFileIndexID(share)));
  } catch (const Error&) {
    if (sdk::SDKShare(share).IsSpaceEnough()) {
      throw;
    }
    StatusMgr().SetShareStatus(share, SS_NEED_REINDEX);
    FailCheck({VEXLO_SOURCE, __LINE__, __func__, "!SDKShare(share).IsSpaceEnough()"},
              ERR_SPACE_NOT_ENOUGH, "Share (" + share + ") space not enough", /*error=*/0);
  }
}

void IndexRename(const std::string& share, const std::string& new_path,
                 const std::string& old_path) {
  const std::string name = Basename(new_path);
  const std::string extension = GetFileExtension(new_path, /*lower=*/true);
  const std::string parent = Dirname(new_path);
  if (!IsDocumentExists(share, old_path)) {
    throw Error(ERR_DOC_NOT_FOUND);
  }
  Json::Value fields;
  fields[field::KAVOMDPath] = new_path;
  fields[field::KAVOMDParent] = parent;
  fields[field::KAVOMDFSName] = name;
  fields[field::KAVOMDSearchFileName] = name;
  fields[field::KAVOMDSearchAncestor] = parent;
  fields[field::KAVOMDDisplayName] = name;
  fields[field::KAVOMDKind] = extension;
  fields[field::KAVOMDExtension] = extension;
  SendDocument("document_set_by_id", share, old_path, std::move(fields));

  const std::string id = GetFileIndexID(share);
  Json::Value query = BelowPath(old_path);
  query[Key("from")] = 0;  // Always: a commit has taken the moved ones out of the old path's range.
  query[Key("size")] = kRenameBatch;
  for (unsigned pass = 1;; ++pass) {
    // The names are listed once more in each pass, which the engine takes for what it is.
    for (const char* const load : {field::KAVOMDPath, field::KAVOMDFSName, field::KAVOMDParent}) {
      query[Key("load_field")].append(Key(load));
    }
    if (MoveBatch(id, query, new_path, old_path) < kRenameBatch) {
      return;
    }
    LogLine(VEXLO_SOURCE, __LINE__,
            "Rename of " + old_path + ": request " + std::to_string(pass) + " was full, going on");
    IndexCommit(share);
  }
}

}  // namespace vexlo::fileindex::elastic
