#include "daemons/kavoelasticd/server.h"

#include <malloc.h>

#include <atomic>
#include <cstddef>
#include <optional>
#include <thread>
#include <utility>

#include "common/error.h"
#include "common/json.h"
#include "daemons/common/frame_server.h"
#include "daemons/common/no_memory.h"
#include "daemons/kavoelasticd/failure.h"
#include "kavo/local/shares.h"

namespace vexlo::elasticd {
namespace {

constexpr size_t kLongBytes = size_t{1} << 20;

std::string SocketPath() { return kavo::local::Root() + "/var/run/kavoelasticd.sock"; }

// Never one of the codes that make callers wait and try again: none of these passes by waiting.
std::string ErrorText(int code, const std::string& message) {
  Json::Value reply(Json::objectValue);
  reply["success"] = false;
  reply["error"]["code"] = code;
  reply["error"]["msg"] = message;
  return JsonToString(reply);
}

std::string SearchSocketPath() { return kavo::local::Root() + "/var/run/kavoelasticd.search.sock"; }

std::string RefusalText(daemon::Refusal refusal) {
  if (refusal == daemon::Refusal::kStopping) {
    return "";  // Callers ask the next run where they find the connection closed.
  }
  return ErrorText(refusal == daemon::Refusal::kHandlerFailed ? ERR_INTERNAL : ERR_BAD_PARAMETER,
                   RefusalSentence(refusal, "the engine"));
}

// A server of its own, so that nobody who only searches takes places and threads of those who
// index.
daemon::FrameServerOptions SearchOptions(const SearchHandler& handler, bool is_open) {
  daemon::FrameServerOptions options;
  options.socket_path = SearchSocketPath();
  options.mode = is_open ? 0666 : 0600;
  options.admits = [is_open](const daemon::Peer& /*peer*/) { return is_open; };
  options.peer_handler = [&handler](const std::string& request, const daemon::Peer& peer) {
    return AnswerText([&](const Json::Value& value) { return handler(value, peer); }, request);
  };
  options.refusal = RefusalText;
  options.workers = 2;
  options.max_connections = 256;
  options.max_request_bytes = size_t{64} << 10;
  options.max_total_bytes = size_t{64} << 20;
  return options;
}

}  // namespace

std::string AnswerText(const Handler& handler, const std::string& request) {
  std::string reply;
  try {
    Json::Value value;
    if (!JsonFromString(value, request) || !value.isObject()) {
      return ErrorText(ERR_BAD_PARAMETER, "the request is no JSON object");
    }
    reply = JsonToString(handler(value));
  } catch (const std::exception& error) {
    if (!daemon::IsLackOfMemory(error)) {
      throw;
    }
    reply = ErrorText(static_cast<int>(Code::kStorage), kNoMemory);
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
  options.keeps_to_state = false;  // Whoever makes or moves an index says where it lies.
  options.usage =
      "\n\nKeeps the full-text indexes of the shares. Runs in the foreground until SIGTERM or "
      "SIGINT and "
      "answers\non " +
      SocketPath() + ".";
  options.pid_file = kavo::local::Root() + "/var/run/kavoelasticd.pid";
  return options;
}

void Serve(daemon::Daemon& daemon, const Handler& handler, const SearchHandler& search_handler,
           bool is_open) {
  daemon::FrameServerOptions options;
  options.socket_path = SocketPath();
  options.handler = [&handler](const std::string& request) { return AnswerText(handler, request); };
  options.refusal = RefusalText;
  daemon::FrameServer server(std::move(options));
  std::optional<daemon::FrameServer> search_server;
  std::thread search_thread;
  std::atomic<bool> searches_ended = true;
  if (search_handler) {
    search_server.emplace(SearchOptions(search_handler, is_open));
    search_thread = std::thread([&] { searches_ended = search_server->Run(daemon.StopFd()); });
  }
  daemon.Ready();
  const bool requests_ended = server.Run(daemon.StopFd());
  if (search_thread.joinable()) {
    search_thread.join();
  }
  if (!requests_ended || !searches_ended) {
    daemon.EndAtOnce("a request takes too long");
  }
}

}  // namespace vexlo::elasticd
