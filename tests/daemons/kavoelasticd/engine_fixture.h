// An engine over one small index, spoken to as clients do.
#ifndef DAEMONS_KAVOELASTICD_ENGINE_FIXTURE_H_
#define DAEMONS_KAVOELASTICD_ENGINE_FIXTURE_H_

#include <gtest/gtest.h>
#include <json/writer.h>

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "common/json.h"
#include "daemons/kavoelasticd/engine.h"
#include "daemons/kavoelasticd/sqlite.h"
#include "support/temp_folder.h"

inline Json::Value Parsed(const std::string& text) {
  Json::Value value;
  EXPECT_TRUE(vexlo::JsonFromString(value, text)) << text;
  return value;
}

// The mappings that the library sends, less most of the fields that are like others.
constexpr char kMappings[] = R"({"property_id":"KAVOMDPath",
 "default":{"type":"string","analyzer":"kavostandard","required":false,"stored":true,"_all":true},
 "properties":{
  "KAVOMDPath":{"analyzer":"keyword","required":true,"_all":false},
  "KAVOMDFSName":{"analyzer":"keyword","_all":false},
  "KAVOMDParent":{"analyzer":"keyword","_all":false},
  "KAVOMDExtension":{"analyzer":"keyword","_all":false},
  "KAVOMDIsDir":{"type":"bool","_all":false},
  "KAVOMDFSSize":{"type":"int"},"KAVOMDFSContentChangeDate":{"type":"int"},
  "KAVOMDAuthors":{"type":"text","analyzer":"white space"},
  "KAVOMDTitle":{"type":"text"},"KAVOMDTextContent":{"type":"text"},
  "KAVOMDIdentifier":{"type":"text","analyzer":"keyword","_all":false},
  "KAVOMDDurationSecond":{"type":"double"},
  "KAVOMDSearchFileName":{"type":"text","analyzer":"white space","preprocess":["tolower","ngram"]},
  "KAVOMDSearchAncestor":{"type":"text","analyzer":"white space escaped",
                          "preprocess":["list_ancestor"],"_all":false},
  "Hidden":{"stored":false},
  "Quiet":{"_all":false},
  "Quiet text":{"type":"text","_all":false},
  "Lower":{"analyzer":"keyword","preprocess":["tolower"]},
  "Escaped":{"type":"text","analyzer":"white space escaped"}}})";

// "ok", or the code.
inline std::string Answer(const Json::Value& reply) {
  return reply["success"].asBool() ? "ok" : std::to_string(reply["error"]["code"].asInt());
}

// A document with the fields that follow from its path, and those of `more`.
inline Json::Value MakeDocument(const std::string& path, const std::string& more = "{}") {
  Json::Value data = Parsed(more);
  const size_t slash = path.rfind('/');
  data["KAVOMDPath"] = path;
  for (const char* field : {"KAVOMDParent", "KAVOMDSearchAncestor"}) {
    data[field] = path.substr(0, slash);
  }
  for (const char* field : {"KAVOMDFSName", "KAVOMDSearchFileName", "KAVOMDDisplayName"}) {
    data[field] = path.substr(slash + 1);
  }
  const size_t dot = path.rfind('.');
  data["KAVOMDExtension"] = dot == std::string::npos ? "" : path.substr(dot + 1);
  return data;
}

inline Json::Value WriteRequest(const std::string& command, const std::string& doc_id,
                                const Json::Value& data, const std::string& id = "i") {
  Json::Value request;
  request["command"] = command;
  request["data"]["id"] = id;
  request["data"]["doc_id"] = doc_id;
  request["data"]["data"] = data;
  return request;
}

// What the library sends for a document that moves from `from`.
inline Json::Value RenameRequest(const std::string& from, const std::string& to) {
  return WriteRequest("document_set_by_id", from, MakeDocument(to));
}

inline std::string Paths(const Json::Value& list, const char* field) {
  std::string paths;
  for (const Json::Value& item : list) {
    paths += (paths.empty() ? "" : " ") + item[field].asString();
  }
  return paths;
}

class EngineFixture {
 public:
  EngineFixture() {
    Restart();
    EXPECT_EQ(Create("i", folder_ / "i"), "ok");
  }

  void Restart() {
    engine_.reset();
    engine_ = std::make_unique<vexlo::elasticd::Engine>(folder_ / "registry.json");
  }

  Json::Value Send(const Json::Value& request) { return engine_->Handle(request); }
  Json::Value SearchFor(const Json::Value& request, const vexlo::elasticd::JudgePaths& judge) {
    return engine_->HandleSearch(request, judge);
  }
  Json::Value Send(const std::string& command, Json::Value data, const std::string& id = "i") {
    Json::Value request;
    request["command"] = command;
    request["data"] = std::move(data);
    if (!request["data"].isMember("id")) {
      request["data"]["id"] = id;
    }
    return Send(request);
  }

  std::string Do(const std::string& command, const std::string& data = "{}",
                 const std::string& id = "i") {
    return Answer(Send(command, Parsed(data), id));
  }

  // Tells where the folder of the index is to be.
  std::string Move(const std::string& path, const std::string& id = "i") {
    return Do("index_config_set", R"({"data":{"path":")" + path + "\"}}", id);
  }

  std::string Create(const std::string& id, const std::string& path,
                     const std::string& mappings = kMappings) {
    Json::Value data;
    data["id"] = id;
    data["path"] = path;
    data["settings"] = Json::objectValue;
    data["mappings"] = Parsed(mappings);
    return Answer(Send("index_create", data));
  }

  std::string Add(const std::string& path, const std::string& more = "{}") {
    return Answer(Send(WriteRequest("document_upsert_by_id", path, MakeDocument(path, more))));
  }

  // The documents that a query finds, as it gives them.
  Json::Value Documents(const std::string& qsl, const std::string& rest = "{}") {
    Json::Value data;
    data["query"] = Parsed(rest);
    data["query"]["qsl"] = Parsed(qsl);
    const Json::Value reply = Send("document_get_by_query", data);
    EXPECT_TRUE(reply["data"].isArray()) << reply;
    return reply["data"];
  }

  // Their paths.
  std::string Query(const std::string& qsl, const std::string& rest = "{}") {
    return Paths(Documents(qsl, rest), "KAVOMDPath");
  }
  // The paths of a committed search.
  std::string Search(const std::string& data) {
    EXPECT_EQ(Do("commit"), "ok");
    const Json::Value reply = Send("search", Parsed(data));
    EXPECT_TRUE(reply["success"].asBool()) << reply;
    return Paths(reply["data"], "path");
  }

  // Runs this on the database of the index while the engine does not have it.
  void ChangeDatabase(const std::string& sql) {
    using vexlo::elasticd::Connection;
    EXPECT_EQ(Do("index_pause"), "ok");
    Connection(folder_ / "i/index.db", Connection::Use::kWrite).Run(sql);
    EXPECT_EQ(Do("index_resume"), "ok");
  }

  TempFolder& Folder() { return folder_; }
  vexlo::elasticd::Engine& Engine() { return *engine_; }

 private:
  TempFolder folder_;
  std::unique_ptr<vexlo::elasticd::Engine> engine_;
};

#endif  // DAEMONS_KAVOELASTICD_ENGINE_FIXTURE_H_
