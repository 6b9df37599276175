#include "daemons/kavoelasticd/server.h"

#include <malloc.h>

#include <cstddef>
#include <utility>

#include "common/error.h"
#include "common/json.h"
#include "daemons/common/frame_server.h"
#include "kavo/local/shares.h"

namespace vexlo::elasticd {
namespace {

constexpr size_t kLongBytes = size_t{1} << 20;

std::string SocketPath() { return kavo::local::Root() + "/var/run/kavoelasticd.sock"; }

// Never one of the codes that make callers wait and try again: none of these passes by waiting.
std::string ErrorText(ErrorCode code, const char* message) {
  Json::Value reply(Json::objectValue);
  reply["success"] = false;
  reply["error"]["code"] = static_cast<int>(code);
  reply["error"]["msg"] = message;
  return JsonToString(reply);
}

std::string RefusalText(daemon::Refusal refusal) {
  return refusal == daemon::Refusal::kTooLong
             ? ErrorText(ERR_BAD_PARAMETER, "the request is too long")
             : ErrorText(ERR_INTERNAL, "the request made the engine fail");
}

}  // namespace

std::string AnswerText(const Handler& handler, const std::string& request) {
  std::string reply;
  {
    Json::Value value;
    if (!JsonFromString(value, request) || !value.isObject()) {
      return ErrorText(ERR_BAD_PARAMETER, "the request is no JSON object");
    }
    reply = JsonToString(handler(value));
  }
  // Each worker would keep as much as its longest request took.
  if (request.size() + reply.size() >= kLongBytes) {
    malloc_trim(0);
  }
  return reply;
}

daemon::DaemonOptions ElasticdOptions() {
  daemon::DaemonOptions options;
  options.name = "kavoelasticd";
  options.usage =
      "\n\nKeeps the full-text indexes of the shares. Runs in the foreground until SIGTERM or "
      "SIGINT and "
      "answers\non " +
      SocketPath() + ".";
  options.pid_file = kavo::local::Root() + "/var/run/kavoelasticd.pid";
  return options;
}

void Serve(daemon::Daemon& daemon, const Handler& handler) {
  daemon::FrameServerOptions options;
  options.socket_path = SocketPath();
  options.handler = [&handler](const std::string& request) { return AnswerText(handler, request); };
  options.refusal = RefusalText;
  daemon::FrameServer server(std::move(options));
  daemon.Ready();
  if (!server.Run(daemon.StopFd())) {
    daemon.EndAtOnce("a request takes too long");
  }
}

}  // namespace vexlo::elasticd
