#include "daemons/kavocontentextractd/service.h"

#include <fcntl.h>
#include <linux/capability.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <system_error>
#include <thread>
#include <utility>

#include "common/check.h"
#include "common/json.h"
#include "common/string.h"
#include "daemons/common/frame_server.h"
#include "daemons/common/log.h"
#include "daemons/kavocontentextractd/fault.h"
#include "kavo/local/content.h"
#include "kavo/local/shares.h"

namespace vexlo::extractd {
namespace {

namespace reason = kavo::local::content_reason;

constexpr unsigned kTries = 2;
// Until who kills the workers of a file counts as provoked by it: a kernel without memory.
constexpr unsigned kMostKills = 3;
constexpr size_t kMaxRequestBytes = size_t{256} << 10;
// A thread each for a file in work, and some more, so that those that wait for a worker are told in
// time that there is none.
constexpr size_t kThreads = 32;
// Whom a superuser's workers become.
constexpr char kWorkerUser[] = "kavo-extract";

std::string TextOf(const Json::Value& object, const char* member) {
  const Json::Value& value = object[member];
  return value.isString() ? value.asString() : "";
}

std::string Refusal(const std::string& word, const std::string& message) {
  return JsonToString(ReplyOf(Fault(word, message)));
}

bool IsText(const Json::Value& value) { return value.isString(); }

// A worker may be in the hands of whoever wrote the file, so only what has the form of metadata
// goes on to the index: names of the platform's fields, and plain values.
bool IsMetadata(const Json::Value& reply) {
  for (auto member = reply.begin(); member != reply.end(); ++member) {
    const Json::Value& value = *member;
    const bool is_list = value.isArray() && std::all_of(value.begin(), value.end(), IsText);
    if (!member.name().starts_with("KAVO") ||
        (!is_list && !IsText(value) && !value.isBool() && !value.isNumeric())) {
      return false;
    }
  }
  return true;
}

// What the file has done to its worker; nothing when the reply is one to pass on.
std::optional<Fault> DeathOf(const Pool::Outcome& outcome, const PoolOptions& options) {
  if (outcome.kind == Pool::Outcome::kDeadline) {
    return Fault(reason::kDeadline, "reading takes over " +
                                        std::to_string(options.deadline / std::chrono::seconds(1)) +
                                        " seconds");
  }
  if (outcome.kind == Pool::Outcome::kMemory) {
    return Fault(reason::kMemory,
                 "reading takes over " + std::to_string(options.memory) + " MiB of memory");
  }
  if (outcome.kind == Pool::Outcome::kDied) {
    return Fault(reason::kCrash, outcome.text);
  }
  Json::Value reply;
  if (!JsonFromString(reply, outcome.text) || !reply.isObject()) {
    return Fault(reason::kCrash, "the worker's reply is no JSON object");
  }
  if (!reply.isMember("error")) {
    return IsMetadata(reply)
               ? std::nullopt
               : std::optional(Fault(reason::kCrash, "the worker's reply is no metadata"));
  }
  const Json::Value& error = reply["error"];
  if (!error.isObject() || TextOf(error, "reason").empty()) {
    return Fault(reason::kCrash, "the worker's reply is no error");
  }
  return std::nullopt;
}

// One that no other service runs as: nobody's processes may be in other hands already.
daemon::Account WorkerAccount() {
  const std::optional<daemon::Account> own = daemon::FindAccount(kWorkerUser);
  if (!own && geteuid() == 0) {
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                std::string("there is no user ") + kWorkerUser +
                    ": files are read as nobody, which other services may run as too");
  }
  return own.value_or(kNobody);
}

}  // namespace

Service::Service(const PoolOptions& options, const std::string& quarantine_file)
    : options_(options), pool_(options), quarantine_(quarantine_file) {}

std::string Service::Answer(const std::string& request, daemon::UniqueFd file) {
  Json::Value value;
  if (!JsonFromString(value, request) || !value.isObject()) {
    return Refusal(reason::kUnavailable, "the request is no JSON object");
  }
  const std::string command = TextOf(value, "command");
  if (command == "stats") {
    return JsonToString(Stats());
  }
  if (command != "extract") {
    return Refusal(reason::kUnavailable, "the request is none of the known commands");
  }
  return Extract(TextOf(value, "path"), file.Get());
}

std::string Service::Extract(const std::string& path, int file) {
  const int flags = file < 0 ? -1 : fcntl(file, F_GETFL);
  struct stat info {};
  if (flags < 0 || (flags & O_PATH) != 0 || (flags & O_ACCMODE) == O_WRONLY ||
      fstat(file, &info) != 0) {
    return Refusal(reason::kUnreadable, "no file that can be read came with the request");
  }
  if (!S_ISREG(info.st_mode)) {
    return Refusal(reason::kUnreadable, "this is no regular file");
  }
  ++files_;
  const ContentKey key = KeyOf(info);
  if (const std::optional<Fault> known = quarantine_.Find(key)) {
    return JsonToString(ReplyOf(*known));
  }
  Json::Value request(Json::objectValue);
  request["name"] = Basename(path);
  const std::string text = JsonToString(request);
  std::optional<Fault> fault;
  for (unsigned i = 0; i < kTries; ++i) {
    Pool::Outcome outcome = pool_.Run(text, file, /*new_worker=*/i > 0);
    if (outcome.kind == Pool::Outcome::kNoWorker) {
      return Refusal(reason::kUnavailable, outcome.text);
    }
    if (outcome.kind == Pool::Outcome::kKilled) {
      daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                  "killed from outside, path=" + path + ", reason=" + outcome.text);
      if (quarantine_.CountKill(key) < kMostKills) {
        return Refusal(reason::kUnavailable, outcome.text);
      }
      fault = Fault(reason::kCrash, outcome.text);
      break;
    }
    fault = DeathOf(outcome, options_);
    if (!fault) {
      quarantine_.ForgetKills(key);
      return std::move(outcome.text);
    }
  }
  // One that changes under the reader is no content that could be left alone.
  if (fstat(file, &info) == 0 && KeyOf(info) == key) {
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                "quarantined, path=" + path + ", reason=" + fault->Reason() + ": " + fault->what());
    quarantine_.Add(key, *fault, path);
  }
  return JsonToString(ReplyOf(*fault));
}

Json::Value Service::Stats() {
  Json::Value stats(Json::objectValue);
  stats["files"] = static_cast<Json::UInt64>(files_);
  stats["deaths"] = static_cast<Json::UInt64>(pool_.Deaths());
  stats["quarantined"] = static_cast<Json::UInt64>(quarantine_.Size());
  stats["workers"] = static_cast<Json::UInt64>(pool_.Workers());
  stats["deadline"] = static_cast<Json::UInt64>(options_.deadline / std::chrono::seconds(1));
  return stats;
}

daemon::DaemonOptions ExtractdOptions(Settings* settings) {
  daemon::DaemonOptions options;
  options.name = "kavocontentextractd";
  options.capabilities = {CAP_KILL, CAP_SETGID, CAP_SETUID};  // For workers of another user.
  options.pid_file = kavo::local::Root() + "/var/run/kavocontentextractd.pid";
  options.usage =
      "[--deadline SECONDS] [--memory MIB] [--workers N]\n\n"
      "Reads texts and metadata out of files, in processes of their own, for the search index.\n"
      "Runs in the foreground until SIGTERM or SIGINT and answers on\n" +
      kavo::local::ContentSocket() +
      ".\n\n"
      "  --deadline SECONDS  for one file, 1 to 3600; 10 without it\n"
      "  --memory MIB        address space of a process that reads, at least 128; 512 without it,\n"
      "                      0 for no limit\n"
      "  --workers N         how many of them there are at most, 1 to 16";
  options.arguments = [settings](const std::vector<std::string>& words) {
    for (size_t i = 0; i + 1 < words.size(); i += 2) {
      const std::string& word = words[i + 1];
      unsigned number = 0;
      const auto [end, error] = std::from_chars(word.data(), word.data() + word.size(), number);
      if (error != std::errc() || end != word.data() + word.size()) {
        return false;
      }
      if (words[i] == "--deadline" && number >= 1 && number <= 3600) {
        settings->deadline = number;
      } else if (words[i] == "--memory" && (number == 0 || number >= 128)) {
        settings->memory = number;
      } else if (words[i] == "--workers" && number >= 1 && number <= 16) {
        settings->workers = number;
      } else {
        return false;
      }
    }
    return words.size() % 2 == 0;
  };
  return options;
}

void Serve(daemon::Daemon& daemon, const Settings& settings, const std::string& program) {
  PoolOptions options;
  options.program = program;
  options.deadline = std::chrono::seconds(settings.deadline);
  options.memory = settings.memory;
  options.account = WorkerAccount();
  options.workers = settings.workers > 0
                        ? settings.workers
                        : std::clamp<size_t>(std::thread::hardware_concurrency(), 2, 8);
  Service service(options, kavo::local::Root() + "/var/lib/kavo/extract/quarantine.json");
  daemon::FrameServerOptions server_options;
  server_options.socket_path = kavo::local::ContentSocket();
  server_options.workers = kThreads;
  server_options.max_request_bytes = kMaxRequestBytes;
  server_options.max_total_bytes = size_t{256} << 20;
  server_options.file_handler = [&service](const std::string& request, daemon::UniqueFd file) {
    return service.Answer(request, std::move(file));
  };
  server_options.stopping = [&service] { service.Stop(); };
  server_options.refusal = [](daemon::Refusal refusal) {
    return Refusal(reason::kUnavailable, RefusalSentence(refusal, "the daemon"));
  };
  daemon::FrameServer server(std::move(server_options));
  daemon.Ready();
  if (!server.Run(daemon.StopFd())) {
    daemon.EndAtOnce("a file takes too long");
  }
}

}  // namespace vexlo::extractd
