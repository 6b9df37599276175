// "fileindex share ...": the folders that are shared, and so can be indexed.
#include <json/value.h>

#include <algorithm>
#include <charconv>
#include <iomanip>

#include "cli/command.h"
#include "cli/shares.h"
#include "cli/text.h"
#include "common/file.h"
#include "common/json.h"
#include "common/string.h"
#include "kavo/local/shares.h"

namespace vexlo::cli {
namespace {

using kavo::local::Share;

// One switch of a share: how it is asked for, written and stored.
struct Flag {
  const char* option;
  const char* key;
  bool Share::*value;
  const char* help;
};

const Flag kFlags[] = {
    {"--encrypted", "encrypted", &Share::encrypted, "encrypted, and locked at present"},
    {"--encryption", "encryption", &Share::encryption, "of the encrypted kind, locked or not"},
    {"--read-only", "read_only", &Share::read_only, "nothing can be written"},
    {"--recycle", "recycle", &Share::recycle, "deleted files go to #recycle"},
    {"--hide-unreadable", "hide_unreadable", &Share::hide_unreadable,
     "hide files from users who may not read them"},
};

uint32_t ReadFTPPrivilege(const std::string& text) {
  uint32_t number = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (error != std::errc() || end != text.data() + text.size()) {
    throw UsageError("'" + text + "' is no FTP privilege: a number from 0 to 4294967295 is wanted");
  }
  return number;
}

// The library's functions fail with SharesError, which names file, line and key.
template <typename Work>
auto OnSharesFile(Work work) {
  try {
    return work(kavo::local::SharesFile());
  } catch (const kavo::local::SharesError& error) {
    throw Failure(error.what());
  }
}

ExitStatus ListShares(const Arguments& arguments, const Console& console) {
  const std::vector<Share> shares = OnSharesFile(kavo::local::ReadShares);
  size_t width = 0;
  for (const Share& share : shares) {
    width = std::max(width, share.name.size());
  }
  for (const Share& share : shares) {
    if (arguments.Has("--json")) {
      Json::Value line;
      line["name"] = share.name;
      line["path"] = share.path;
      line["ftp_privilege"] = share.ftp_privilege;
      for (const Flag& flag : kFlags) {
        line[flag.key] = share.*flag.value;
      }
      console.out << JsonToString(line) << "\n";
      continue;
    }
    std::string text = share.name + std::string(width + 2 - share.name.size(), ' ') + share.path;
    for (const Flag& flag : kFlags) {
      if (share.*flag.value) {
        text += std::string("  ") + flag.key;
      }
    }
    console.out << (console.out_is_terminal ? ForTerminal(text) : text) << "\n";
  }
  if (shares.empty()) {
    console.err << "there are no shares in '" << kavo::local::SharesFile() << "'\n";
    return kNothingFound;
  }
  return kDone;
}

ExitStatus AddShare(const Arguments& arguments, const Console& console) {
  const std::string& folder = arguments.positional[0];
  Share share;
  share.path = RealPath(folder);
  if (share.path.empty() || !IsDirExist(share.path, /*follow_link=*/false)) {
    throw Failure("'" + ForTerminal(folder) + "' is no folder");
  }
  if (share.path == "/") {
    throw Failure("the root folder has no name, so it cannot be a share");
  }
  share.name = Basename(share.path);
  for (const Flag& flag : kFlags) {
    share.*flag.value = arguments.Has(flag.option);
  }
  if (arguments.Has("--ftp-privilege")) {
    share.ftp_privilege = ReadFTPPrivilege(arguments.Get("--ftp-privilege"));
  }
  OnSharesFile([&share](const std::string& file) { kavo::local::AddShare(file, share); });
  console.out << "added: " << ForTerminal(share.name) << " (" << ForTerminal(share.path) << ")\n";
  return kDone;
}

ExitStatus RemoveShare(const Arguments& arguments, const Console& console) {
  const std::string& name = arguments.positional[0];
  OnSharesFile([&name](const std::string& file) { kavo::local::RemoveShare(file, name); });
  console.out << "removed: " << ForTerminal(name) << "; its folder stays as it is\n";
  return kDone;
}

std::vector<Option> AddOptions() {
  std::vector<Option> options;
  for (const Flag& flag : kFlags) {
    options.push_back({flag.option, nullptr, flag.help});
  }
  options.push_back({"--ftp-privilege", "N", "the FTP server's bits"});
  return options;
}

}  // namespace

void CheckSharesFile() {
  OnSharesFile([](const std::string& file) { kavo::local::ReadShares(file); });
}

std::set<std::string> ShareNames() {
  std::set<std::string> names;
  for (const Share& share : OnSharesFile(kavo::local::ReadShares)) {
    names.insert(share.name);
  }
  return names;
}

std::vector<Command> ShareCommands() {
  return {
      {"share list",
       "",
       "lists the shares of this machine",
       "Prints name, folder and settings of each share, one a line, in the order of the shares\n"
       "file. Exit status 1 when there are none.\n"
       "\n"
       "  fileindex share list --json | jq -r 'select(.read_only).path'\n",
       {{"--json", nullptr, "one JSON object a line, with the keys of the shares file"}},
       {},
       0,
       0,
       ListShares},
      {"share add",
       "FOLDER",
       "makes a folder a share",
       "Adds FOLDER to the shares file under its own name; the path is written without symbolic\n"
       "links. The file is checked before and after, and replaced whole: when anything is wrong\n"
       "it stays as it was.\n"
       "\n"
       "  fileindex share add /volume1/photo --recycle\n",
       AddOptions(),
       {},
       1,
       1,
       AddShare},
      {"share remove",
       "NAME",
       "makes a share an ordinary folder again",
       "Takes the share NAME out of the shares file. Its folder and all that is in it stay.\n"
       "\n"
       "  fileindex share remove photo\n",
       {},
       {},
       1,
       1,
       RemoveShare},
  };
}

}  // namespace vexlo::cli
