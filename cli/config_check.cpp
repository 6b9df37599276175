#include "cli/config_check.h"

#include <json/value.h>

#include <algorithm>
#include <cctype>
#include <filesystem>
#include <map>
#include <optional>
#include <set>
#include <string_view>

#include "cli/command.h"
#include "cli/shares.h"
#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "fileindex/folder.h"
#include "fileindex/paths.h"
#include "fileindex/util/path_policy.h"
#include "kavo/local/shares.h"

namespace vexlo::cli {
namespace {

using fileindex::Folder;

// The first line; what follows shows the whole record.
std::string FirstLine(const std::string& reason) {
  std::string line = reason.substr(0, reason.find('\n'));
  constexpr std::string_view kData = ", data={";
  return line.ends_with(kData) ? line.substr(0, line.size() - kData.size()) : line;
}

class Findings {
 public:
  explicit Findings(std::vector<ConfigFinding>& list) : list_(list) {}

  void Add(const std::string& file, const std::string& place, const std::string& what) {
    list_.push_back({file, place, what});
  }

 private:
  std::vector<ConfigFinding>& list_;
};

// A key as jq takes it behind a dot: as it is, or in quotes.
std::string Member(const std::string& key) {
  const bool is_plain = !key.empty() && (std::isdigit(static_cast<unsigned char>(key[0])) == 0) &&
                        std::all_of(key.begin(), key.end(), [](unsigned char c) {
                          return c == '_' || (c < 0x80 && std::isalnum(c) != 0);
                        });
  return is_plain ? key : JsonToString(key);
}

// Null for a file that is missing or cannot be used.
Json::Value ReadDocument(Findings& findings, const std::string& file) {
  Json::Value document;
  std::string text;
  if (!IsFileExist(file)) {
    if (std::filesystem::exists(std::filesystem::symlink_status(file))) {
      findings.Add(file, "", "is no regular file, and counts as missing");
    }
  } else if (!ReadFile(text, file)) {
    findings.Add(file, "", "cannot be read");
  } else if (const std::string fault = JsonFault(text); !fault.empty()) {
    findings.Add(file, "", fault);
  } else {
    JsonFromString(document, text);
  }
  return document;
}

// What a whole record comes to on this machine.
void CheckFolder(Findings& findings, const std::string& file, const std::string& place,
                 const Folder& folder) {
  try {
    if (!fileindex::CanPathBeIndexed(folder.GetPath())) {
      findings.Add(file, place,
                   "'" + folder.GetPath() + "' cannot be indexed: 'fileindex explain " +
                       folder.GetFullPath() + "' says why");
    } else if (!IsDirExist(folder.GetFullPath(), /*follow_link=*/false)) {
      findings.Add(file, place, "'" + folder.GetFullPath() + "' is no folder");
    }
  } catch (const Error& error) {
    const std::string reason = error.what();
    findings.Add(file, place,
                 error.GetErrorCode() == ERR_SHARE_NOT_FOUND
                     ? "there is no share '" + reason + "' for '" + folder.GetPath() + "'"
                 : error.GetErrorCode() == ERR_BAD_PARAMETER
                     ? "'" + reason + "' is no share path: it does not begin with \"/\""
                     : FirstLine(reason));
  }
}

// Members that are read as their default when they are of another type.
void CheckOptional(Findings& findings, const std::string& file, const std::string& place,
                   const Json::Value& record) {
  for (const char* key : {"owner", "group", "volume_to_be_clean", "privileged", "paused"}) {
    const Json::Value& member = record[key];
    const bool is_text = std::string_view("privileged paused").find(key) == std::string_view::npos;
    if (is_text ? !isJsonType<std::string>(member) : !isJsonType<bool>(member)) {
      findings.Add(
          file, place + "." + key,
          is_text ? "is no text, and counts as \"\"" : "is no boolean, and counts as false");
    }
  }
}

void CheckFolders(Findings& findings, size_t& count) {
  const std::string file = fileindex::kFileIndexFoldersCfgPath.Get();
  const Json::Value folders = ReadDocument(findings, file);
  if (!folders.isNull() && !folders.isArray()) {
    findings.Add(file, "", "must hold a list of folders");
    return;
  }
  std::map<std::string, std::string> places;
  for (Json::ArrayIndex i = 0; i < folders.size(); ++i) {
    const std::string place = ".[" + std::to_string(i) + "]";
    try {
      const Folder folder(folders[i]);
      ++count;
      const auto [same, is_new] = places.emplace(folder.GetPath(), place);
      if (!is_new) {
        findings.Add(file, place,
                     "is of the same path as " + same->second + ", which goes before it");
      }
      CheckOptional(findings, file, place, folders[i]);
      CheckFolder(findings, file, place, folder);
    } catch (const Error& error) {
      findings.Add(file, place, FirstLine(error.what()) + "; the list cannot be loaded");
    }
  }
}

// Without the shares, no share's name can be judged.
std::optional<std::set<std::string>> CheckShares(Findings& findings) {
  try {
    CheckSharesFile();
    return ShareNames();
  } catch (const Failure& failure) {
    findings.Add(kavo::local::SharesFile(), "", failure.what());
    return std::nullopt;
  }
}

void CheckStatus(Findings& findings, const std::optional<std::set<std::string>>& known_shares) {
  const std::string file = fileindex::kFileIndexStatusCfgPath.Get();
  const Json::Value status = ReadDocument(findings, file);
  if (status.isNull()) {
    return;
  }
  if (!status.isObject()) {
    findings.Add(file, "", "must hold an object");
    return;
  }
  if (status.isMember("resume_time") && !isJsonType<long>(status["resume_time"])) {
    findings.Add(file, ".resume_time", "is no whole number, and counts as no pause");
  }
  const Json::Value& shares = status["share"];
  if (!shares.isNull() && !shares.isObject()) {
    findings.Add(file, ".share", "must hold an object");
    return;
  }
  for (auto share = shares.begin(); share != shares.end(); ++share) {
    const std::string place = ".share." + Member(share.name());
    if (!isJsonType<unsigned int>(*share)) {
      findings.Add(file, place, "is no word of status bits, and counts as 0");
    }
    if (known_shares && !known_shares->contains(share.name())) {
      findings.Add(file, place, "there is no such share");
    }
  }
}

}  // namespace

std::vector<ConfigFinding> CheckConfig(size_t& folders) {
  std::vector<ConfigFinding> list;
  Findings findings(list);
  folders = 0;
  const std::optional<std::set<std::string>> shares = CheckShares(findings);
  CheckFolders(findings, folders);
  CheckStatus(findings, shares);
  return list;
}

}  // namespace vexlo::cli
