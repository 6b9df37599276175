// "fileindex metrics" and "fileindex health": the service for monitoring.
#include <charconv>

#include "cli/command.h"
#include "cli/metrics.h"
#include "cli/stack_report.h"
#include "cli/text.h"

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
  for (const Json::Value& share : state["shares"]) {
    const std::string name = ForTerminal(share["share"].asString());
    const std::string worker = share["state"].asString();
    if (arguments.Has("--ready") && (worker == "failing" || worker == "unavailable")) {
      const std::string error = share["last_error"].asString();
      std::string fault = "the share " + name;
      fault.append(" is ").append(worker);
      if (!error.empty()) {
        fault.append(": ").append(ForTerminal(error));
      }
      faults.push_back(std::move(fault));
    }
    if (arguments.Has("--ready") && share["watch"]["state"] == "degraded") {
      faults.push_back("not all changes in the share " + name +
                       " are seen at once: " + ForTerminal(share["watch"]["reason"].asString()));
    }
    if (oldest >= 0 && share["backlog"]["age"].asDouble() > oldest) {
      faults.push_back("changes in the share " + name + " wait for " +
                       Grouped(static_cast<uint64_t>(share["backlog"]["age"].asDouble())) +
                       " seconds");
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
