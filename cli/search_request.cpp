#include "cli/search_request.h"

#include <charconv>
#include <cmath>
#include <cstdint>
#include <ctime>
#include <limits>

#include "cli/folder_paths.h"
#include "cli/text.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/util/file_type.h"

namespace vexlo::cli {
namespace {

constexpr int kDefaultLimit = 20;

// "10", "1.5M", "2g": powers of 1024.
int64_t ReadSize(const std::string& text) {
  double number = 0;
  const char* const end_of_text = text.data() + text.size();
  const auto [end, error] = std::from_chars(text.data(), end_of_text, number);
  const std::string unit(end, end_of_text);
  int power = 0;
  if (unit.size() == 1) {
    constexpr std::string_view kUnits = "bkmgtBKMGT";
    const size_t at = kUnits.find(unit);
    power = at == std::string_view::npos ? -1 : static_cast<int>(at % 5);
  }
  const double bytes = number * std::pow(1024.0, power);
  if (error != std::errc() || unit.size() > 1 || power < 0 || !(bytes >= 0) ||
      bytes >= static_cast<double>(std::numeric_limits<int64_t>::max())) {
    throw UsageError("'" + text + "' is no size: a number is wanted, with k, M, G or T behind it");
  }
  return static_cast<int64_t>(bytes);
}

// "7d" before now, "2026-11-01" or "2026-11-01 14:30" in local time. Seconds since the epoch.
int64_t ReadTime(const std::string& text) {
  constexpr std::pair<char, int64_t> kUnits[] = {
      {'h', 3600}, {'d', 86400}, {'w', 7 * 86400}, {'m', 30 * 86400}, {'y', 365 * 86400}};
  int64_t number = 0;
  const char* const end_of_text = text.data() + text.size();
  const auto [end, error] = std::from_chars(text.data(), end_of_text, number);
  if (error == std::errc() && end + 1 == end_of_text && number >= 0 && number < 1'000'000) {
    for (const auto& [unit, seconds] : kUnits) {
      if (*end == unit) {
        return static_cast<int64_t>(time(nullptr)) - number * seconds;
      }
    }
  }
  for (const char* const format : {"%Y-%m-%d", "%Y-%m-%d %H:%M", "%Y-%m-%dT%H:%M"}) {
    struct tm parts {};
    parts.tm_isdst = -1;
    const char* const rest = strptime(text.c_str(), format, &parts);
    if (rest == nullptr || *rest != '\0') {
      continue;
    }
    // 31 February would be a day in March.
    const int day = parts.tm_mday;
    const auto instant = static_cast<int64_t>(mktime(&parts));
    if (parts.tm_mday == day) {
      return instant;
    }
  }
  throw UsageError("'" + text +
                   "' is no date: 2026-11-01, \"2026-11-01 14:30\" or 7d (h, d, w, m, "
                   "y before now) is wanted");
}

int ReadLimit(const std::string& text) {
  int number = 0;
  const char* const end_of_text = text.data() + text.size();
  const auto [end, error] = std::from_chars(text.data(), end_of_text, number);
  if (error != std::errc() || end != end_of_text || number < 1 || number > 1'000'000) {
    throw UsageError("'" + text + "' is no limit: a number from 1 to 1000000 is wanted");
  }
  return number;
}

Json::Value ReadType(const std::string& text) {
  Json::Value extensions(Json::arrayValue);
  for (const fileindex::FileType type : {fileindex::FILE_TYPE_DOCUMENT, fileindex::FILE_TYPE_AUDIO,
                                         fileindex::FILE_TYPE_VIDEO, fileindex::FILE_TYPE_PHOTO}) {
    if (text == fileindex::GetFileTypeName(type)) {
      for (const std::string_view extension : fileindex::GetFileTypeExtensions(type)) {
        extensions.append(std::string(extension));
      }
    }
  }
  if (extensions.empty()) {
    throw UsageError("'" + text + "' is no type: document, audio, video or photo is wanted");
  }
  return extensions;
}

// "name", "size" or "modified", with "-" before it for the other direction.
void ReadSort(const std::string& text, Json::Value& data) {
  const bool descending = text.starts_with('-');
  const std::string order = text.substr(descending ? 1 : 0);
  for (const char* const known : {"relevance", "name", "path", "size", "modified"}) {
    if (order == known) {
      data["sort"] = order;
      data["descending"] = descending;
      return;
    }
  }
  throw UsageError(
      "'" + text +
      "' is no order: relevance, name, path, size or modified is wanted, with - before "
      "it for descending");
}

}  // namespace

Json::Value MakeSearchRequest(const Arguments& arguments) {
  Json::Value request;
  request["command"] = "search";
  Json::Value& data = request["data"];
  std::string words;
  for (const std::string& word : arguments.positional) {
    words += (words.empty() ? "" : " ") + word;
  }
  data["words"] = words;
  if (arguments.Has("--share")) {
    data["ids"].append(fileindex::elastic::GetFileIndexID(arguments.Get("--share")));
  }
  if (arguments.Has("--below")) {
    data["below"] = IndexedPath(arguments.Get("--below"));
  }
  if (arguments.Has("--name")) {
    data["name"] = arguments.Get("--name");
  }
  if (arguments.Has("--type")) {
    data["types"] = ReadType(arguments.Get("--type"));
  }
  for (const auto& [option, member] :
       {std::pair{"--larger", "size_min"}, std::pair{"--smaller", "size_max"}}) {
    if (arguments.Has(option)) {
      data[member] = Json::Int64{ReadSize(arguments.Get(option))};
    }
  }
  for (const auto& [option, member] :
       {std::pair{"--newer", "modified_min"}, std::pair{"--older", "modified_max"}}) {
    if (arguments.Has(option)) {
      data[member] = Json::Int64{ReadTime(arguments.Get(option))};
    }
  }
  if (arguments.Has("--sort")) {
    ReadSort(arguments.Get("--sort"), data);
  }
  data["size"] = arguments.Has("--limit") ? ReadLimit(arguments.Get("--limit")) : kDefaultLimit;
  if (words.empty() && data.size() == 2) {
    throw UsageError("wants words to look for, or an option that narrows the search");
  }
  return request;
}

}  // namespace vexlo::cli
