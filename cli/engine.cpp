#include "cli/engine.h"

#include <unistd.h>

#include <cerrno>
#include <string>

#include "cli/service.h"
#include "cli/shares.h"
#include "cli/text.h"
#include "common/json.h"
#include "fileindex/comm.h"
#include "fileindex/paths.h"
#include "kavo/sock_connection.h"

namespace vexlo::cli {
namespace {

// Where anybody may search.
constexpr fileindex::FixedPath kSearchSocket("/var/run/kavoelasticd.search.sock");
constexpr int kConnectSeconds = 10;
// Where a page ends there.
constexpr int kMostShown = 10000;

[[noreturn]] void FailWithoutEngine() {
  throw Failure(
      WhyUnreached("the search engine kavoelasticd", fileindex::kElasticdSocketPath.Get()));
}

}  // namespace

void RequireEngine() {
  if (access(fileindex::kElasticdSocketPath.Get().c_str(), F_OK) != 0) {
    FailWithoutEngine();
  }
}

void ExplainEngineError(const Error& error) {
  const std::string reason = error.what();
  if (error.GetErrorCode() == ERR_ELASTIC_REQUEST && reason == "Connect failed") {
    FailWithoutEngine();
  }
  if (error.GetErrorCode() == ERR_SHARE_NOT_FOUND) {
    CheckSharesFile();
    throw Failure("there is no share '" + reason + "'; 'fileindex share list' lists them");
  }
  if (error.GetErrorCode() == ERR_DOC_NOT_FOUND) {
    throw Failure("the path is not in the index");
  }
  constexpr std::string_view kPrefix = "Request failed, msg=";
  if (reason.starts_with(kPrefix)) {
    throw Failure("the search engine says: " + ForTerminal(reason.substr(kPrefix.size())) +
                  " (error " + std::to_string(error.GetErrorCode()) + ")");
  }
}

void WithEngine(const std::function<void()>& work) {
  RequireEngine();
  try {
    work();
  } catch (const Error& error) {
    ExplainEngineError(error);
    throw;
  }
}

Json::Value AskSearch(const Json::Value& request, Json::Value* reply) {
  if (access(fileindex::kElasticdSocketPath.Get().c_str(), W_OK) == 0 || errno != EACCES) {
    return AskEngine(request, reply);
  }
  const std::string path = kSearchSocket.Get();
  if (access(path.c_str(), W_OK) != 0 && errno == EACCES) {
    throw Failure("only the user who runs the search engine can search: it is not root's");
  }
  Json::Value asked = request;
  if (asked["data"]["size"].asInt() > kMostShown) {
    asked["data"]["size"] = kMostShown;
  }
  kavodaemon::DomainSockConnection connection(path);
  std::string text;
  if (!connection.Connect(kConnectSeconds) || !connection.Send(JsonToString(asked)) ||
      !connection.Recv(text) || !JsonFromString(*reply, text) || !reply->isObject()) {
    throw Failure("the search engine kavoelasticd gives no answer on '" + path + "'");
  }
  if ((*reply)["success"] != true) {
    throw Failure("the search engine says: " + ForTerminal((*reply)["error"]["msg"].asString()) +
                  " (error " + std::to_string((*reply)["error"]["code"].asInt()) + ")");
  }
  return (*reply)["data"];
}

Json::Value AskEngine(const Json::Value& request, Json::Value* reply) {
  Json::Value answer;
  WithEngine([&] { SendRequestImpl(answer, request); });
  Json::Value data = answer["data"];
  if (reply != nullptr) {
    *reply = std::move(answer);
  }
  return data;
}

}  // namespace vexlo::cli
