#include "daemons/evnotifyd/options.h"

#include <linux/capability.h>

#include <charconv>
#include <cstdint>
#include <optional>

#include "kavo/local/shares.h"

namespace vexlo::evnotifyd {
namespace {

constexpr uint64_t kMostSeconds = 86400;
constexpr uint64_t kMostWatches = uint64_t{1} << 31;

std::optional<uint64_t> NumberUpTo(uint64_t most, const std::string& text) {
  uint64_t number = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  const bool valid =
      error == std::errc() && end == text.data() + text.size() && number > 0 && number <= most;
  return valid ? std::optional(number) : std::nullopt;
}

bool ReadArguments(const std::vector<std::string>& arguments, FeederOptions& options) {
  for (size_t i = 0; i < arguments.size(); i += 2) {
    const bool rescan = arguments[i] == "--rescan";
    if ((!rescan && arguments[i] != "--max-watches") || i + 1 == arguments.size()) {
      return false;
    }
    const std::optional<uint64_t> number =
        NumberUpTo(rescan ? kMostSeconds : kMostWatches, arguments[i + 1]);
    if (!number.has_value()) {
      return false;
    }
    if (rescan) {
      options.rescan = std::chrono::seconds(*number);
    } else {
      options.max_watches = *number;
    }
  }
  return true;
}

}  // namespace

daemon::DaemonOptions EvnotifydOptions(FeederOptions& options) {
  daemon::DaemonOptions daemon;
  daemon.name = "evnotifyd";
  daemon.keeps_to_state = false;  // Whoever registers a queue says where it lies.
  // The latter for fanotify, where a share has more folders than inotify takes.
  daemon.capabilities = {CAP_DAC_READ_SEARCH, CAP_SYS_ADMIN};
  daemon.usage =
      "[--rescan SECONDS] [--max-watches N]\n\n"
      "Watches the folders that are registered and appends what happens there to their queues.\n"
      "Runs in the foreground until SIGTERM or SIGINT.\n\n"
      "  --rescan SECONDS   how often what cannot be watched is looked at, 1 to 86400; default "
      "300\n"
      "  --max-watches N    the most folders to watch for a queue; default is the system's limit";
  daemon.pid_file = kavo::local::Root() + "/var/run/evnotifyd.pid";
  daemon.arguments = [&options](const std::vector<std::string>& arguments) {
    return ReadArguments(arguments, options);
  };
  return daemon;
}

}  // namespace vexlo::evnotifyd
