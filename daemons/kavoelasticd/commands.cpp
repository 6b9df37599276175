#include "daemons/kavoelasticd/commands.h"

#include <utility>
#include <vector>

#include "daemons/kavoelasticd/query.h"
#include "daemons/kavoelasticd/search.h"

namespace vexlo::elasticd {
namespace {

constexpr size_t kDefaultPage = 10;

void Upsert(Writer& writer, const Json::Value& data) {
  writer.Upsert(RequiredText(data, "doc_id"), data["data"]);
}

void Set(Writer& writer, const Json::Value& data) {
  writer.Set(RequiredText(data, "doc_id"), data["data"]);
}

void Delete(Writer& writer, const Json::Value& data) {
  writer.Delete(RequiredText(data, "doc_id"));
}

const Json::Value& QueryOf(const Json::Value& data) {
  if (!data["query"].isObject()) {
    throw Failure(Code::kBadRequest, "query is missing");
  }
  return data["query"];
}

void DeleteByQuery(Writer& writer, const Json::Value& data) {
  writer.DeleteWhere(ParseQuery(QueryOf(data)["qsl"]));
}

constexpr std::pair<const char*, void (*)(Writer&, const Json::Value&)> kWrites[] = {
    {"document_upsert_by_id", Upsert},
    {"document_set_by_id", Set},
    {"document_del_by_id", Delete},
    {"document_del_by_query", DeleteByQuery},
};

}  // namespace

bool IsWrite(const std::string& command) {
  for (const auto& [name, run] : kWrites) {
    if (command == name) {
      return true;
    }
  }
  return false;
}

void RunWrite(Writer& writer, const std::string& command, const Json::Value& data) {
  for (const auto& [name, run] : kWrites) {
    if (command == name) {
      run(writer, data);
    }
  }
}

Json::Value GetByQuery(Session& session, const Json::Value& data) {
  const Json::Value& query = QueryOf(data);
  const Conditions conditions = ParseQuery(query["qsl"]);
  std::vector<std::string> names;
  if (!query["load_field"].isNull() && !query["load_field"].isArray()) {
    throw Failure(Code::kBadRequest, "load_field is no list");
  }
  for (const Json::Value& name : query["load_field"]) {
    if (!name.isString()) {
      throw Failure(Code::kBadRequest, "load_field holds something else than names");
    }
    names.push_back(name.asString());
  }
  if (!query["after"].isNull() && !query["after"].isString()) {
    throw Failure(Code::kBadRequest, "after is no path");
  }
  if (!query["flat"].isNull() && !query["flat"].isBool()) {
    throw Failure(Code::kBadRequest, "flat is neither true nor false");
  }
  const Page page = {query["after"].asString(), PageNumber(query, "from", 0),
                     PageNumber(query, "size", kDefaultPage), query["flat"].asBool()};
  const Selection selection = session.Select(names);
  Json::Value hits(Json::arrayValue);
  for (const int64_t id : Find(session, conditions, page)) {
    if (auto document = session.Load(id)) {
      hits.append(session.Fields(&*document, selection));
    }
  }
  return hits;
}

std::string RequiredText(const Json::Value& data, const char* name) {
  const Json::Value& value = data[name];
  if (!value.isString() || value.asString().empty()) {
    throw Failure(Code::kBadRequest, std::string(name) + " is missing");
  }
  return value.asString();
}

Json::Value Success() {
  Json::Value reply(Json::objectValue);
  reply["success"] = true;
  return reply;
}

Json::Value Refusal(Code code, const std::string& message) {
  Json::Value reply(Json::objectValue);
  reply["success"] = false;
  reply["error"]["code"] = static_cast<int>(code);
  reply["error"]["msg"] = message;
  return reply;
}

}  // namespace vexlo::elasticd
