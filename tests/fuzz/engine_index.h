// An engine with one small index, as the engine's targets use it.
#ifndef FUZZ_ENGINE_INDEX_H_
#define FUZZ_ENGINE_INDEX_H_

#include <json/value.h>

#include <filesystem>
#include <map>
#include <string>

#include "common/json.h"
#include "daemons/kavoelasticd/engine.h"
#include "fuzz/target.h"

namespace fuzz {

constexpr char kIndexFolder[] = "/engine/i";
constexpr char kMappings[] = R"({"property_id":"KAVOMDPath",
 "default":{"type":"string","analyzer":"kavostandard","required":false,"stored":true,"_all":true},
 "properties":{
  "KAVOMDPath":{"analyzer":"keyword","required":true,"_all":false},
  "KAVOMDFSName":{"analyzer":"keyword","_all":false},
  "KAVOMDParent":{"analyzer":"keyword","_all":false},
  "KAVOMDExtension":{"analyzer":"keyword","_all":false},
  "KAVOMDIsDir":{"type":"bool","_all":false},
  "KAVOMDFSSize":{"type":"int","_all":false},"KAVOMDFSContentChangeDate":{"type":"int"},
  "KAVOMDAuthors":{"type":"text","analyzer":"white space"},
  "KAVOMDTextContent":{"type":"text"},
  "KAVOMDDurationSecond":{"type":"double"},
  "KAVOMDSearchFileName":{"type":"text","analyzer":"white space","preprocess":["tolower","ngram"]},
  "KAVOMDSearchAncestor":{"type":"text","analyzer":"white space escaped",
                          "preprocess":["list_ancestor"],"_all":false},
  "Hidden":{"stored":false},
  "Lower":{"analyzer":"keyword","preprocess":["tolower"]}}})";

// The texts of the documents, by their paths.
inline const std::map<std::string, std::string>& Texts() {
  static const std::map<std::string, std::string> texts = {
      {"/v/a/Fox.txt", "The quick brown fox jumps over the lazy dog"},
      {"/v/a/fox jumping.md", "foxes \"jumped\"\nquickly\ttoday"},
      {"/v/b/Zu\u0308rich.TXT", "Caf\u00e9 stra\u00dfe 2019-01 IMG_01.jpg"},
      {"/v/b/\u6771\u4eac\u90fd 2020.pdf",
       "\u6771\u4eac\u90fdmap \u65e5\u672c\u8a9e\u306e\u6587\u7ae0"},
      {"/v/raw\xff\xfe"
       "name",
       "a\xffquick b"},
      {"/v/empty", ""},
  };
  return texts;
}

inline Json::Value Request(const std::string& command, const Json::Value& data) {
  Json::Value request;
  request["command"] = command;
  request["data"] = data;
  request["data"]["id"] = "i";
  return request;
}

inline Json::Value MustAnswer(vexlo::elasticd::Engine& engine, const std::string& command,
                              const Json::Value& data) {
  Json::Value reply = engine.Handle(Request(command, data));
  Require(reply["success"].asBool(), vexlo::JsonToString(reply).c_str());
  return reply["data"];
}

// Makes the index "i" with the documents, committed.
inline void FillIndex(vexlo::elasticd::Engine& engine) {
  Json::Value index;
  index["path"] = Folder() + kIndexFolder;
  index["settings"] = Json::objectValue;
  Require(vexlo::JsonFromString(index["mappings"], kMappings), "the mappings are no JSON");
  MustAnswer(engine, "index_create", index);
  for (const auto& [path, text] : Texts()) {
    const size_t slash = path.rfind('/');
    Json::Value data;
    data["doc_id"] = path;
    Json::Value& document = data["data"];
    document["KAVOMDPath"] = path;
    document["KAVOMDParent"] = document["KAVOMDSearchAncestor"] = path.substr(0, slash);
    document["KAVOMDFSName"] = document["KAVOMDSearchFileName"] = path.substr(slash + 1);
    document["KAVOMDTextContent"] = text;
    document["KAVOMDFSSize"] = static_cast<Json::UInt64>(text.size());
    document["KAVOMDIsDir"] = false;
    MustAnswer(engine, "document_upsert_by_id", data);
  }
  MustAnswer(engine, "commit", Json::objectValue);
}

inline std::string Registry() { return Folder() + "/engine/registry.json"; }

// Makes the folder of the engine as every input finds it: with that index, closed.
inline void RestoreIndex() {
  namespace fs = std::filesystem;
  const std::string work = Folder() + "/engine";
  const std::string kept = Folder() + "/kept";
  if (!fs::exists(kept)) {
    fs::create_directories(work);
    {
      vexlo::elasticd::Engine engine(Registry());
      FillIndex(engine);
    }
    fs::copy(work, kept, fs::copy_options::recursive);
  }
  fs::remove_all(work);
  fs::copy(kept, work, fs::copy_options::recursive);
}

// The reply with every document of the index "i".
inline Json::Value AllDocuments(vexlo::elasticd::Engine& engine) {
  Json::Value query;
  Require(
      vexlo::JsonFromString(query, R"({"query":{"qsl":{"prefix":{"KAVOMDPath":""}},"size":1000}})"),
      "the query is no JSON");
  return engine.Handle(Request("document_get_by_query", query));
}

// Requires the form that clients expect of a reply; gives the code of a refusal, or 0.
inline int CodeOf(const Json::Value& reply) {
  Require(reply.isObject() && reply["success"].isBool(), "a reply does not say how it went");
  if (reply["success"].asBool()) {
    return 0;
  }
  Require(reply["error"]["msg"].isString() && !reply["error"]["msg"].asString().empty(),
          "a refusal has no reason");
  return reply["error"]["code"].asInt();
}

}  // namespace fuzz

#endif  // FUZZ_ENGINE_INDEX_H_
