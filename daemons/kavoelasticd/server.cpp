#include "daemons/kavoelasticd/server.h"

#include <utility>

#include "common/error.h"
#include "common/json.h"
#include "daemons/common/frame_server.h"
#include "kavo/local/shares.h"

namespace vexlo::elasticd {
namespace {

std::string SocketPath() { return kavo::local::Root() + "/var/run/kavoelasticd.sock"; }

// Never one of the codes that make callers wait and try again: none of these passes by waiting.
std::string ErrorText(ErrorCode code, const std::string& message) {
  Json::Value reply(Json::objectValue);
  reply["success"] = false;
  reply["error"]["code"] = static_cast<int>(code);
  reply["error"]["msg"] = message;
  return JsonToString(reply);
}

std::string RefusalText(daemon::Refusal refusal) {
  return ErrorText(refusal == daemon::Refusal::kHandlerFailed ? ERR_INTERNAL : ERR_BAD_PARAMETER,
                   RefusalSentence(refusal, "the engine"));
}

}  // namespace

std::string AnswerText(const Handler& handler, const std::string& request) {
  Json::Value value;
  if (!JsonFromString(value, request) || !value.isObject()) {
    return ErrorText(ERR_BAD_PARAMETER, "the request is no JSON object");
  }
  return JsonToString(handler(value));
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
