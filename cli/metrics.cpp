#include "cli/metrics.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <utility>
#include <vector>

#include "watch/directory.h"

namespace vexlo::cli {
namespace {

using Labels = std::vector<std::pair<std::string, std::string>>;

// The metrics in their order; each is announced once.
class Page {
 public:
  void Announce(const char* name, const char* type, const char* help) {
    text_ += std::string("# HELP ") + name + " " + help + "\n# TYPE " + name + " " + type + "\n";
  }
  void Put(const std::string& name, const Labels& labels, double value) {
    text_ += name;
    for (size_t at = 0; at < labels.size(); ++at) {
      text_ += at == 0 ? "{" : ",";
      text_ += labels[at].first;
      text_ += "=\"";
      AppendEscaped(labels[at].second);
      text_ += '"';
    }
    char number[32];
    (void)snprintf(number, sizeof(number), " %.15g\n", value);
    text_ += labels.empty() ? "" : "}";
    text_ += number;
  }
  std::string Take() { return std::move(text_); }

 private:
  void AppendEscaped(const std::string& value) {
    for (const char character : value) {
      if (character == '\n') {
        text_ += "\\n";
        continue;
      }
      if (character == '"' || character == '\\') {
        text_ += '\\';
      }
      text_ += character;
    }
  }

  std::string text_;
};

const char* KindName(const std::string& number) {
  constexpr const char* kNames[] = {"none",   "delete", "upsert",  "attributes",
                                    "folder", "rename", "reindex", "queue_crashed"};
  const bool is_known = number.size() == 1 && number[0] >= '0' && number[0] <= '7';
  return is_known ? kNames[number[0] - '0'] : "other";
}

double Number(const Json::Value& value) { return value.isNumeric() ? value.asDouble() : 0; }

// One metric of each share that has the value.
void PutShares(Page& page, const Json::Value& state, const char* name, const char* type,
               const char* help, const Json::Path& value_of) {
  page.Announce(name, type, help);
  for (const Json::Value& share : state["shares"]) {
    if (const Json::Value& value = value_of.resolve(share); value.isNumeric()) {
      page.Put(name, {{"share", share["share"].asString()}}, value.asDouble());
    }
  }
}

void PutShareCounts(Page& page, const Json::Value& state, const char* name, const char* help,
                    const char* member, const char* label) {
  page.Announce(name, "counter", help);
  for (const Json::Value& share : state["shares"]) {
    const Json::Value& counts = share[member];
    for (auto count = counts.begin(); count != counts.end(); ++count) {
      const std::string key = count.name();
      page.Put(name,
               {{"share", share["share"].asString()},
                {label, std::string(label) == "kind" ? KindName(key) : key}},
               Number(*count));
    }
  }
}

void PutEngine(Page& page, const Json::Value& stats) {
  const char* const name = "fileindex_engine_request_seconds";
  page.Announce(name, "histogram", "How long the engine takes to answer.");
  const Json::Value& commands = stats["commands"];
  for (auto command = commands.begin(); command != commands.end(); ++command) {
    double below = 0;
    for (Json::ArrayIndex at = 0; at < stats["bounds"].size(); ++at) {
      below += Number((*command)["steps"][at]);
      char bound[32];
      (void)snprintf(bound, sizeof(bound), "%g", stats["bounds"][at].asDouble());
      page.Put(std::string(name) + "_bucket", {{"command", command.name()}, {"le", bound}}, below);
    }
    const double count = Number((*command)["count"]);
    page.Put(std::string(name) + "_bucket", {{"command", command.name()}, {"le", "+Inf"}}, count);
    page.Put(std::string(name) + "_sum", {{"command", command.name()}},
             Number((*command)["seconds"]));
    page.Put(std::string(name) + "_count", {{"command", command.name()}}, count);
  }
  page.Announce("fileindex_engine_errors_total", "counter", "Requests that failed, by error code.");
  const Json::Value& errors = stats["errors"];
  for (auto error = errors.begin(); error != errors.end(); ++error) {
    page.Put("fileindex_engine_errors_total", {{"code", error.name()}}, Number(*error));
  }
}

void PutOne(Page& page, const char* name, const char* type, const char* help,
            const Json::Value& value) {
  if (value.isNumeric()) {
    page.Announce(name, type, help);
    page.Put(name, {}, value.asDouble());
  }
}

}  // namespace

Backlog BacklogOf(const std::string& queue_path) {
  Backlog backlog;
  for (const char* const suffix : {".tmp", ""}) {
    const watch::Fd file(open((queue_path + suffix).c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    struct statx info {};
    if (!file || statx(file.Get(), "", AT_EMPTY_PATH, STATX_BTIME | STATX_MTIME, &info) != 0) {
      continue;
    }
    char block[65536];
    ssize_t count = 0;
    uint64_t bytes = 0;
    while ((count = read(file.Get(), block, sizeof(block))) > 0) {
      backlog.lines += static_cast<uint64_t>(std::count(block, block + count, '\n'));
      bytes += static_cast<uint64_t>(count);
    }
    backlog.bytes += bytes;
    // A queue file is made with its first line, and renamed to be the snapshot.
    const statx_timestamp& since =
        (info.stx_mask & STATX_BTIME) != 0 ? info.stx_btime : info.stx_mtime;
    if (bytes > 0) {
      timespec now{};
      clock_gettime(CLOCK_REALTIME, &now);
      const double age = static_cast<double>(now.tv_sec - since.tv_sec) +
                         static_cast<double>(now.tv_nsec - since.tv_nsec) / 1e9;
      backlog.age = std::max({backlog.age, age, 0.0});
    }
  }
  return backlog;
}

std::string MetricsText(const Json::Value& state) {
  Page page;
  page.Announce("fileindex_up", "gauge", "Whether the daemon answers.");
  for (const Json::Value& daemon : state["daemons"]) {
    if (daemon["running"].isBool()) {
      page.Put("fileindex_up", {{"daemon", daemon["name"].asString()}},
               daemon["running"].asBool() ? 1 : 0);
    }
  }
  if (state["resume_time"].isNumeric()) {
    const int64_t resume_time = state["resume_time"].asInt64();
    page.Announce("fileindex_paused", "gauge", "Whether indexing is paused.");
    page.Put("fileindex_paused", {}, resume_time == 0 || resume_time > time(nullptr) ? 1 : 0);
  }
  PutShares(page, state, "fileindex_queue_lines", "gauge", "Events that wait, snapshot and all.",
            Json::Path(".backlog.lines"));
  PutShares(page, state, "fileindex_queue_bytes", "gauge", "Size of queue and snapshot.",
            Json::Path(".backlog.bytes"));
  PutShares(page, state, "fileindex_freshness_seconds", "gauge",
            "Age of the oldest change that is not searchable yet; 0 when none waits.",
            Json::Path(".backlog.age"));
  PutShareCounts(page, state, "fileindex_operations_total",
                 "Operations since the index daemon's start.", "kinds", "kind");
  PutShares(page, state, "fileindex_documents_sent_total", "counter",
            "Documents that the engine has taken.", Json::Path(".files"));
  PutShareCounts(page, state, "fileindex_errors_total", "Failures of the index daemon, by code.",
                 "errors", "code");
  page.Announce("fileindex_worker_state", "gauge", "1 for the state that the share is in.");
  for (const Json::Value& share : state["shares"]) {
    page.Put("fileindex_worker_state",
             {{"share", share["share"].asString()}, {"state", share["state"].asString()}}, 1);
  }
  PutShares(page, state, "fileindex_crawl_found", "gauge", "Paths that the current crawl has met.",
            Json::Path(".progress.found"));
  PutShares(page, state, "fileindex_crawl_done", "gauge", "Paths that it is done with.",
            Json::Path(".progress.done"));
  PutShares(page, state, "fileindex_watched_folders", "gauge",
            "Folders that the kernel tells about.", Json::Path(".watch.watches"));
  PutShares(page, state, "fileindex_events_total", "counter",
            "Lines that were appended to the queue.", Json::Path(".watch.lines"));
  PutShares(page, state, "fileindex_overflows_total", "counter", "Times that events were lost.",
            Json::Path(".watch.overflows"));
  for (const Json::Value& daemon : state["daemons"]) {
    const Json::Value& stats = daemon["stats"];
    if (stats.isObject() && daemon["name"] == "kavoelasticd") {
      PutEngine(page, stats);
    } else if (stats.isObject() && daemon["name"] == "kavocontentextractd") {
      PutOne(page, "fileindex_extract_files_total", "counter", "Files that came to be read.",
             stats["files"]);
      PutOne(page, "fileindex_extract_deaths_total", "counter",
             "Worker processes that were lost while they read a file.", stats["deaths"]);
      PutOne(page, "fileindex_extract_quarantined", "gauge", "Contents that are left alone.",
             stats["quarantined"]);
      PutOne(page, "fileindex_extract_workers", "gauge", "Worker processes.", stats["workers"]);
    }
  }
  return page.Take();
}

}  // namespace vexlo::cli
