#include "cli/daemon_stats.h"

#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <system_error>

#include "cli/service.h"
#include "common/json.h"
#include "fileindex/paths.h"
#include "kavo/local/frames.h"
#include "watch/directory.h"

namespace vexlo::cli {
namespace {

constexpr std::chrono::seconds kPatience(5);
constexpr size_t kMostReplyBytes = size_t{64} << 20;

}  // namespace

std::optional<Json::Value> AskDaemon(const std::string& path, const std::string& request,
                                     std::string* reason) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  std::string text;
  Json::Value reply;
  const watch::Fd connection(kavo::local::ConnectWithin(path, deadline));
  std::string fault;
  if (!connection) {
    fault = errno == ENOENT || errno == ECONNREFUSED
                ? "nobody answers on '" + path + "'"
                : "'" + path + "': " + std::generic_category().message(errno);
  } else if (!kavo::local::SendFrame(connection.Get(), request, -1, deadline) ||
             !kavo::local::ReceiveFrame(connection.Get(), kMostReplyBytes, text, nullptr,
                                        deadline)) {
    fault = "no answer comes on '" + path + "': " + std::generic_category().message(errno);
  } else if (!JsonFromString(reply, text) || !reply.isObject()) {
    fault = "what comes on '" + path + "' is no answer";
  }
  if (fault.empty()) {
    return reply;
  }
  if (reason != nullptr) {
    *reason = fault;
  }
  return std::nullopt;
}

std::optional<Json::Value> IndexDaemonStats(std::string* reason) {
  std::optional<Json::Value> stats = AskDaemon(fileindex::kFileIndexDaemonSocketPath.Get(),
                                               R"({"type":"stats","data":null})", reason);
  if (stats && !(*stats)["shares"].isArray()) {
    if (reason != nullptr) {
      *reason = "its answer has no list of shares";
    }
    return std::nullopt;
  }
  return stats;
}

}  // namespace vexlo::cli
