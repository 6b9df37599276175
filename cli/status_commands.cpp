// "fileindex status" and "fileindex summary": how indexing stands.
#include <json/value.h>

#include <chrono>
#include <cmath>
#include <map>
#include <thread>

#include "cli/command.h"
#include "cli/service.h"
#include "cli/stack_report.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/json.h"
#include "fileindex/index_mgr/status_report.h"
#include "fileindex/status_mgr.h"

namespace vexlo::cli {
namespace {

using Clock = std::chrono::steady_clock;
using Rows = std::vector<std::vector<std::string>>;

constexpr auto kInterval = std::chrono::seconds(1);
constexpr const char* kWipeScreen = "\033[H\033[2J";

const Option kJson = {"--json", nullptr, "the library's own JSON"};

// Operations a second of each share since the last time.
class Rates {
 public:
  std::map<std::string, double> Take(const Json::Value& shares) {
    const Clock::time_point now = Clock::now();
    const double seconds = std::chrono::duration<double>(now - last_).count();
    std::map<std::string, double> rates;
    for (const Json::Value& share : shares) {
      const std::string name = share["share"].asString();
      const uint64_t done = share["operations"].asUInt64() + share["files"].asUInt64();
      const auto before = done_.find(name);
      // Less than before: the daemon was started anew.
      rates[name] = before == done_.end() || done < before->second
                        ? 0
                        : static_cast<double>(done - before->second) / seconds;
      done_[name] = done;
    }
    last_ = now;
    return rates;
  }

 private:
  Clock::time_point last_ = Clock::now();
  std::map<std::string, uint64_t> done_;
};

std::string WatchText(const Json::Value& watch) {
  if (watch.isNull()) {
    return "not watched";
  }
  const std::string reason = watch["reason"].asString();
  return watch["state"].asString() + (reason.empty() ? "" : ": " + reason);
}

std::string TableOf(const Json::Value& all, const std::map<std::string, double>& rates) {
  Rows daemons = {{"DAEMON", "STATE"}};
  bool is_told = false;  // Which shares there are.
  for (const Json::Value& daemon : all["daemons"]) {
    const std::string socket = daemon["socket"].asString();
    const bool is_closed = daemon["running"].isNull();
    is_told = is_told || (daemon["name"] == "fileindexd" && daemon["running"] == true);
    daemons.push_back({daemon["name"].asString(), is_closed ? "closed to this user on " + socket
                                                  : daemon["running"].asBool()
                                                      ? "running"
                                                      : "does not answer on " + socket});
  }
  Rows shares = {{"SHARE", "STATE", "QUEUED", "DONE", "A SECOND", "WATCHED", "LAST ERROR"}};
  for (const Json::Value& share : all["shares"]) {
    const std::string name = share["share"].asString();
    const auto rate = rates.find(name);
    shares.push_back(
        {ForTerminal(name), share["state"].asString(),
         Counted(share["queue_lines"].asUInt64(), "line"),
         Counted(share["operations"].asUInt64(), "change") + ", " +
             Counted(share["files"].asUInt64(), "file"),
         rate == rates.end() ? "" : Grouped(static_cast<uint64_t>(std::llround(rate->second))),
         ForTerminal(WatchText(share["watch"])), ForTerminal(share["last_error"].asString())});
  }
  return "indexing is " + all["status"].asString() + "\n\n" + Table(daemons) +
         (shares.size() > 1 ? "\n" + Table(shares)
          : is_told         ? "\nno share is indexed\n"
                            : "\nof the shares nothing is told, as fileindexd was not reached\n");
}

void Show(const Arguments& arguments, const Console& console, Rates& rates, bool again) {
  const Json::Value all = AskWholeStack();
  const std::map<std::string, double> by_share = rates.Take(all["shares"]);
  if (arguments.Has("--json")) {
    console.out << JsonToString(all) << "\n" << std::flush;
    return;
  }
  console.out << (!again                    ? ""
                  : console.out_is_terminal ? kWipeScreen
                                            : "\n")
              << TableOf(all, by_share) << std::flush;
}

ExitStatus ShowStatus(const Arguments& arguments, const Console& console) {
  if (arguments.Has("--all") || arguments.Has("--watch")) {
    Rates rates;
    Show(arguments, console, rates, /*again=*/false);
    while (arguments.Has("--watch") && console.out) {
      std::this_thread::sleep_for(kInterval);
      Show(arguments, console, rates, /*again=*/true);
    }
    return kDone;
  }
  const std::string status = fileindex::GetIndexProcessingStatus();
  console.out << (arguments.Has("--json") ? JsonToString(status) : status) << "\n";
  if (!IsIndexDaemonListening()) {
    console.err << NoIndexDaemon() << "\n";
  }
  return kDone;
}

ExitStatus ShowSummary(const Arguments& arguments, const Console& console) {
  Json::Value summary;
  fileindex::FolderSummary(summary);
  if (arguments.Has("--json")) {
    console.out << JsonToString(summary) << "\n";
    return kDone;
  }
  Rows rows;
  for (const Json::Value& item : summary["items"]) {
    rows.push_back(
        {ForTerminal(item["name"].asString()) + (item["group"].asBool() ? " (group)" : ""),
         item["text"].asString() + (item.isMember("desc") ? ": " + item["desc"].asString() : "")});
  }
  rows.push_back({"in all", summary["status"].asString()});
  console.out << Table(rows);
  return kDone;
}

}  // namespace

std::vector<Command> StatusCommands() {
  return {
      {"status",
       "",
       "says whether indexing is finished, under way or paused",
       "Prints one word: finished, processing or paused. With --all, which of the daemons answer,\n"
       "and for each share what its worker does, what waits in its queue, what was done since the\n"
       "daemon's start, how fast, whether every change is seen, and the last error. --watch shows\n"
       "that again every second until Ctrl-C.\n"
       "\n"
       "  while [ \"$(fileindex status)\" = processing ]; do sleep 1; done\n"
       "  fileindex status --all --json | jq '.shares[] | select(.state == \"failing\")'\n",
       {{"--all", nullptr, "the daemons and the shares, too"},
        {"--watch", nullptr, "the same, every second"},
        {"--json", nullptr, "JSON, one line each time"}},
       {},
       0,
       0,
       ShowStatus},
      {"summary",
       "",
       "sums up how far each folder and group of folders is",
       "The words are those of 'fileindex folder list'; the last line is that of the whole\n"
       "service.\n"
       "\n"
       "  fileindex summary --json | jq -r '.items[] | select(.text == \"error\").name'\n",
       {kJson},
       {},
       0,
       0,
       ShowSummary},
  };
}

}  // namespace vexlo::cli
