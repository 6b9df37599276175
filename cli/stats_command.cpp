// "fileindex stats": what the index daemon does.
#include <json/value.h>

#include <cinttypes>
#include <cstdio>

#include "cli/command.h"
#include "cli/text.h"
#include "common/json.h"
#include "fileindex/paths.h"
#include "kavo/sock_connection.h"

namespace vexlo::cli {
namespace {

// The library's way to the daemon drops the answer, which here is all that is wanted.
Json::Value AskDaemon() {
  const std::string path = fileindex::kFileIndexDaemonSocketPath.Get();
  kavodaemon::DomainSockConnection connection(path);
  if (!connection.Connect(/*timeout=*/1)) {
    throw Failure("the index daemon fileindexd does not run (nobody answers on '" + path + "')");
  }
  Json::Value request;
  request["type"] = "stats";
  request["data"] = Json::Value();
  std::string reply;
  Json::Value answer;
  if (!connection.Send(JsonToString(request) + '\0') || !connection.Recv(reply) ||
      !JsonFromString(answer, reply) || !answer.isObject() || !answer["shares"].isArray()) {
    throw Failure("the index daemon does not say what it does");
  }
  return answer["shares"];
}

void Print(const Json::Value& share, const Console& console) {
  char numbers[160];
  snprintf(numbers, sizeof(numbers),
           "  about %" PRIu64 " lines queued, %" PRIu64 " operations, %" PRIu64
           " files, %.0f files/s",
           share["queue_lines"].asUInt64(), share["operations"].asUInt64(),
           share["files"].asUInt64(), share["rate"].asDouble());
  console.out << ForTerminal(share["share"].asString() + "  " + share["state"].asString())
              << numbers << "\n";
  for (const std::string& code : share["errors"].getMemberNames()) {
    console.out << "  error " << ForTerminal(code) << ": " << share["errors"][code].asUInt64()
                << " times\n";
  }
  if (!share["last_error"].asString().empty()) {
    console.out << "  last error: " << ForTerminal(share["last_error"].asString()) << "\n";
  }
}

ExitStatus ShowStats(const Arguments& arguments, const Console& console) {
  const Json::Value shares = AskDaemon();
  for (const Json::Value& share : shares) {
    if (arguments.Has("--json")) {
      console.out << JsonToString(share) << "\n";
    } else {
      Print(share, console);
    }
  }
  return shares.empty() ? kNothingFound : kDone;
}

}  // namespace

std::vector<Command> StatsCommands() {
  return {{"stats",
           "",
           "says what the index daemon does",
           "Asks fileindexd, which must be running, and prints for each share with a worker its\n"
           "state, what waits in its queue, what it has done since the daemon started, and what\n"
           "went wrong. Exit status 1 when there are none.\n"
           "\n"
           "  fileindex stats --json | jq 'select(.state == \"failing\")'\n",
           {{"--json", nullptr, "one JSON object a line"}},
           {},
           0,
           0,
           ShowStats}};
}

}  // namespace vexlo::cli
