// Requests to the engine, one a line, over an index with a few documents. Each is answered as
// clients expect it, and what was committed is the same after a restart.
#include <filesystem>
#include <functional>
#include <memory>

#include "common/json.h"
#include "daemons/kavoelasticd/server.h"
#include "fuzz/engine_index.h"
#include "fuzz/target.h"

namespace {

using vexlo::elasticd::Engine;
namespace fs = std::filesystem;

std::string Registry() { return fuzz::Folder() + "/engine/registry.json"; }

// The folder of the engine as every input finds it.
void Restore() {
  const std::string work = fuzz::Folder() + "/engine";
  const std::string kept = fuzz::Folder() + "/kept";
  if (!fs::exists(kept)) {
    fs::create_directories(work);
    {
      Engine engine(Registry());
      fuzz::FillIndex(engine);
    }
    fs::copy(work, kept, fs::copy_options::recursive);
  }
  fs::remove_all(work);
  fs::copy(kept, work, fs::copy_options::recursive);
}

// Folders of indexes stand in the target's own folder, whatever the request says.
void Confine(Json::Value& path) {
  if (path.isString() && !path.asString().empty()) {
    constexpr size_t kFolders = 3;
    path = fuzz::Folder() + "/engine/" +
           std::string(
               1, static_cast<char>('i' + std::hash<std::string>()(path.asString()) % kFolders));
  }
}

Json::Value Confined(Json::Value request) {
  if (request["data"].isObject()) {
    Json::Value& data = request["data"];
    if (request["command"] == "index_create") {
      Confine(data["path"]);
    } else if (request["command"] == "index_config_set" && data["data"].isObject()) {
      Confine(data["data"]["path"]);
    }
  }
  return request;
}

void CheckItem(const Json::Value& reply) {
  fuzz::Require(reply.isObject() && reply["success"].isBool(), "a reply does not say how it went");
  if (reply["success"].asBool()) {
    return;
  }
  const int code = reply["error"]["code"].asInt();
  fuzz::Require(reply["error"]["msg"].isString() && !reply["error"]["msg"].asString().empty(),
                "a refusal has no reason");
  // Neither of what is wrong with the index, nor with the engine.
  fuzz::Require((code >= 2000 && code <= 2009 && code != 2005) || code == 120,
                vexlo::JsonToString(reply).c_str());
}

void CheckReply(const std::string& text) {
  Json::Value reply;
  fuzz::Require(vexlo::JsonFromString(reply, text), "a reply is no JSON");
  CheckItem(reply);
  if (reply.isMember("has_fail")) {
    bool any = false;
    for (const Json::Value& item : reply["data"]) {
      CheckItem(item);
      any = any || !item["success"].asBool();
    }
    fuzz::Require(reply["has_fail"].asBool() == any, "a compound miscounts what failed");
  }
}

// Every document, and what a search for all of them finds; "" for an index that is not there.
std::string Documents(Engine& engine) {
  Json::Value query;
  fuzz::Require(
      vexlo::JsonFromString(query, R"({"query":{"qsl":{"prefix":{"KAVOMDPath":""}},"size":1000}})"),
      "the query is no JSON");
  const Json::Value reply = engine.Handle(fuzz::Request("document_get_by_query", query));
  return reply["success"].asBool() ? vexlo::JsonToString(reply) : "";
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  Restore();
  auto engine = std::make_unique<Engine>(Registry());
  const vexlo::elasticd::Handler handler = [&](const Json::Value& request) {
    return engine->Handle(Confined(request));
  };
  constexpr int kMostRequests = 20;
  std::string_view rest = fuzz::TextOf(data, size);
  for (int i = 0; i < kMostRequests && !rest.empty(); ++i) {
    CheckReply(vexlo::elasticd::AnswerText(handler, std::string(fuzz::TakeLine(rest))));
  }
  const std::string before = Documents(*engine);
  if (engine->Handle(fuzz::Request("commit", Json::objectValue))["success"].asBool()) {
    engine.reset();
    engine = std::make_unique<Engine>(Registry());
    fuzz::RequireEqual(Documents(*engine), before, "a restart changes what was committed");
  }
  return 0;
}
