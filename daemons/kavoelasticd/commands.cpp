#include "daemons/kavoelasticd/commands.h"

#include <utility>
#include <vector>

#include "daemons/kavoelasticd/query.h"
#include "daemons/kavoelasticd/search.h"

namespace vexlo::elasticd {
namespace {

constexpr size_t kDefaultPage = 10;
// Documents that move while others wait for the writer: some hundredths of a second.
constexpr size_t kMostMoves = 10'000;

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

// data[name], a list of texts that may be missing.
std::vector<std::string> TextsMember(const Json::Value& data, const std::string& name) {
  std::vector<std::string> texts;
  if (!data[name].isNull() && !data[name].isArray()) {
    throw Failure(Code::kBadRequest, name + " is no list");
  }
  for (const Json::Value& text : data[name]) {
    if (!text.isString()) {
      throw Failure(Code::kBadRequest, name + " holds something else than names");
    }
    texts.push_back(text.asString());
  }
  return texts;
}

// data["after"], a path that may be missing.
std::string AfterMember(const Json::Value& data) {
  if (!data["after"].isNull() && !data["after"].isString()) {
    throw Failure(Code::kBadRequest, "after is no path");
  }
  return data["after"].asString();
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

Json::Value MoveBelow(Writer& writer, const Json::Value& data) {
  const FolderMove move = {RequiredText(data, "from"), RequiredText(data, "to"),
                           TextsMember(data, "folder_field"), AfterMember(data),
                           PageNumber(data, "size", kMostMoves)};
  const auto is_folder = [](const std::string& path) { return !path.ends_with('/'); };
  if (!is_folder(move.from) || !is_folder(move.to) ||
      (move.from + "/").starts_with(move.to + "/") ||
      (move.to + "/").starts_with(move.from + "/")) {
    throw Failure(Code::kBadRequest, "from and to are no two folders beside each other");
  }
  if (move.size == 0 || move.size > kMostMoves) {
    throw Failure(Code::kBadRequest, "size is out of range");
  }
  Json::Value answer(Json::objectValue);
  answer["failed"] = Json::arrayValue;
  const std::string after =
      writer.MoveBelow(move, [&](const std::string& path, const Failure& failure) {
        Json::Value item = Refusal(failure.GetCode(), failure.what());
        item["doc_id"] = path;
        answer["failed"].append(std::move(item));
      });
  if (!after.empty()) {
    answer["after"] = after;
  }
  return answer;
}

Json::Value GetByQuery(Session& session, const Json::Value& data) {
  const Json::Value& query = QueryOf(data);
  const Conditions conditions = ParseQuery(query["qsl"]);
  const std::vector<std::string> names = TextsMember(query, "load_field");
  if (!query["flat"].isNull() && !query["flat"].isBool()) {
    throw Failure(Code::kBadRequest, "flat is neither true nor false");
  }
  const Page page = {AfterMember(query), PageNumber(query, "from", 0),
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
