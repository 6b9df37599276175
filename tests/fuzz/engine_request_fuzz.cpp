// Requests to the engine, one a line, over an index with a few documents. Each is answered as
// clients expect it, and what was committed is the same after a restart.
#include <functional>
#include <memory>

#include "common/json.h"
#include "daemons/kavoelasticd/server.h"
#include "fuzz/engine_index.h"
#include "fuzz/target.h"

namespace {

using vexlo::elasticd::Engine;

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
  const int code = fuzz::CodeOf(reply);
  // Neither of what is wrong with the index, nor with the engine.
  fuzz::Require(code == 0 || (code >= 2000 && code <= 2009 && code != 2005) || code == 120,
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

// Every document; "" for an index that is not there.
std::string Documents(Engine& engine) {
  const Json::Value reply = fuzz::AllDocuments(engine);
  return fuzz::CodeOf(reply) == 0 ? vexlo::JsonToString(reply) : "";
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  fuzz::RestoreIndex();
  auto engine = std::make_unique<Engine>(fuzz::Registry());
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
    engine = std::make_unique<Engine>(fuzz::Registry());
    fuzz::RequireEqual(Documents(*engine), before, "a restart changes what was committed");
  }
  return 0;
}
