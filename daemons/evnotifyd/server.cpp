#include "daemons/evnotifyd/server.h"

#include <utility>

#include "common/error.h"
#include "common/json.h"
#include "daemons/common/frame_server.h"
#include "daemons/evnotifyd/monitor.h"
#include "kavo/local/shares.h"

namespace vexlo::evnotifyd {
namespace {

constexpr size_t kMostRequestBytes = 4096;
constexpr std::chrono::milliseconds kStopTimeout(200);

std::string Answer(const Monitor& monitor, const std::string& request) {
  Json::Value value;
  if (JsonFromString(value, request) && value.isObject() && value["command"] == "stats") {
    return JsonToString(monitor.Stats());
  }
  Json::Value refusal(Json::objectValue);
  refusal["success"] = false;
  refusal["error"]["code"] = static_cast<int>(ERR_BAD_PARAMETER);
  refusal["error"]["msg"] = "the request is not {\"command\":\"stats\"}";
  return JsonToString(refusal);
}

}  // namespace

void Serve(daemon::Daemon& daemon, const FeederOptions& options) {
  const Monitor monitor(options);
  daemon::FrameServerOptions server_options;
  server_options.socket_path = kavo::local::Root() + "/var/run/evnotifyd.sock";
  server_options.handler = [&monitor](const std::string& request) {
    return Answer(monitor, request);
  };
  server_options.workers = 1;
  server_options.max_request_bytes = kMostRequestBytes;
  server_options.max_total_bytes = size_t{16} << 20;
  server_options.stop_timeout = kStopTimeout;
  daemon::FrameServer server(std::move(server_options));
  daemon.Ready();
  server.Run(daemon.StopFd());
}

}  // namespace vexlo::evnotifyd
