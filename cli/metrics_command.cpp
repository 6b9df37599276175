// "fileindex metrics" and "fileindex health": the service for monitoring.
#include <algorithm>
#include <charconv>
#include <iterator>
#include <map>
#include <optional>
#include <set>

#include "cli/command.h"
#include "cli/daemon_stats.h"
#include "cli/metrics.h"
#include "cli/stack_report.h"
#include "cli/text.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/paths.h"

namespace vexlo::cli {
namespace {

Json::Value StateWithBacklogs() {
  Json::Value state = AskWholeStack();
  for (Json::Value& share : state["shares"]) {
    const Backlog backlog = BacklogOf(share["queue"].asString());
    share["backlog"]["lines"] = static_cast<Json::UInt64>(backlog.lines);
    share["backlog"]["bytes"] = static_cast<Json::UInt64>(backlog.bytes);
    share["backlog"]["age"] = backlog.age;
  }
  return state;
}

ExitStatus ShowMetrics(const Arguments& /*arguments*/, const Console& console) {
  console.out << MetricsText(StateWithBacklogs());
  return kDone;
}

double ReadSeconds(const std::string& text) {
  unsigned seconds = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), seconds);
  if (error != std::errc() || end != text.data() + text.size()) {
    throw UsageError("'" + text + "' is no number of seconds");
  }
  return seconds;
}

std::string WorkerFault(const Json::Value& share) {
  const std::string name = ForTerminal(share["share"].asString());
  const std::string worker = share["state"].asString();
  if (worker != "failing" && worker != "unavailable") {
    return "";
  }
  std::string fault = "the share " + name;
  fault.append(" is ").append(worker);
  const std::string error = share["last_error"].asString();
  return error.empty() ? fault : fault.append(": ").append(ForTerminal(error));
}

std::string WatchFault(const Json::Value& share) {
  const std::string name = ForTerminal(share["share"].asString());
  const Json::Value& watch = share["watch"];
  return watch.isNull() ? "nobody watches the share " + name
         : watch["state"] == "degraded"
             ? "not all changes in the share " + name +
                   " are seen at once: " + ForTerminal(watch["reason"].asString())
             : "";
}

// Of the shares that are to be indexed. What a daemon would tell that does not answer is no fault
// of its own: one line says that already.
std::vector<std::string> ShareFaults(const Json::Value& state) {
  std::set<std::string> answering;
  for (const Json::Value& daemon : state["daemons"]) {
    answering.insert(daemon["running"] == true ? daemon["name"].asString() : "");
  }
  std::vector<std::string> faults;
  std::set<std::string> with_worker;
  for (const Json::Value& share : state["shares"]) {
    with_worker.insert(share["share"].asString());
    faults.push_back(WorkerFault(share));
    faults.push_back(answering.contains("evnotifyd") ? WatchFault(share) : "");
  }
  std::map<std::string, std::string> indexes;  // States by id.
  const std::optional<Json::Value> list =
      answering.contains("kavoelasticd")
          ? AskDaemon(fileindex::kElasticdSocketPath.Get(), R"({"command":"index_list"})")
          : std::nullopt;
  for (const Json::Value& index : list ? (*list)["data"] : Json::Value()) {
    indexes[index["id"].asString()] = index["state"].asString();
  }
  for (const std::string& share : fileindex::FolderMgr().GetIndexedShares()) {
    const std::string name = ForTerminal(share);
    const std::string index = indexes[fileindex::elastic::GetFileIndexID(share)];
    if (list && index != "active") {
      std::string& fault = faults.emplace_back("the ");
      fault.append(index.empty() ? "share " : "index of the share ").append(name);
      fault.append(index.empty() ? " has no index" : " is ").append(index);
    }
    if (answering.contains("fileindexd") && !with_worker.contains(share)) {
      faults.emplace_back("fileindexd has no worker for the share ").append(name);
    }
  }
  std::erase(faults, "");
  return faults;
}

ExitStatus CheckHealth(const Arguments& arguments, const Console& console) {
  const double oldest = arguments.Has("--fresh") ? ReadSeconds(arguments.Get("--fresh")) : -1;
  const Json::Value state = StateWithBacklogs();
  std::vector<std::string> faults;
  std::string closed;
  for (const Json::Value& daemon : state["daemons"]) {
    if (daemon["running"].isNull()) {
      closed.append(closed.empty() ? "" : ", ").append(daemon["name"].asString());
    } else if (!daemon["running"].asBool()) {
      faults.push_back(daemon["name"].asString() + " does not answer");
    }
  }
  if (arguments.Has("--ready")) {
    std::ranges::move(ShareFaults(state), std::back_inserter(faults));
  }
  for (const Json::Value& share : state["shares"]) {
    if (oldest >= 0 && share["backlog"]["age"].asDouble() > oldest) {
      faults.push_back(
          "changes in the share " + ForTerminal(share["share"].asString()) + " wait for " +
          Grouped(static_cast<uint64_t>(share["backlog"]["age"].asDouble())) + " seconds");
    }
  }
  for (const std::string& fault : faults) {
    console.out << fault << "\n";
  }
  // To start what runs again would not help.
  if (!closed.empty()) {
    console.err << "not told: the sockets of " << closed << " are closed to this user\n";
    return faults.empty() ? kFailed : kNothingFound;
  }
  if (faults.empty()) {
    console.out << "healthy\n";
  }
  return faults.empty() ? kDone : kNothingFound;
}

}  // namespace

std::vector<Command> MetricsCommands() {
  return {
      {"metrics",
       "",
       "prints what a monitoring system wants to know",
       "In the text format of Prometheus: which daemons answer, what waits in the queues and "
       "since\n"
       "when, operations by kind, errors by code, how long the engine takes, how the extractor\n"
       "fares. Counters begin at a daemon's start. A daemon that does not answer is shown as "
       "down,\n"
       "and what it would tell is left out. docs/operations.md explains each.\n"
       "\n"
       "  fileindex metrics > /var/lib/prometheus/node-exporter/fileindex.prom\n",
       {},
       {},
       0,
       0,
       ShowMetrics},
      {"health",
       "",
       "says whether the service works, for probes",
       "Exit status 0 when all is well, 1 with a line for each fault otherwise. Without options "
       "the\n"
       "daemons must answer, no more: what a probe asks that would start them again. 3 when "
       "nothing\n"
       "is wrong as far as this user may ask: the daemons' sockets are closed to all but their "
       "owner.\n"
       "\n"
       "  fileindex health --ready --fresh 300 || mail -s 'the index is behind' root </dev/null\n",
       {{"--ready", nullptr, "also each share must be indexed without fault and watched in full"},
        {"--fresh", "SECONDS", "also no change may wait for longer"}},
       {},
       0,
       0,
       CheckHealth},
  };
}

}  // namespace vexlo::cli
