// "fileindex search": finds files by what is in them, their names and their settings.
#include <json/value.h>

#include <charconv>
#include <cmath>
#include <cstdint>
#include <ctime>
#include <limits>

#include "cli/command.h"
#include "cli/engine.h"
#include "cli/text.h"
#include "common/json.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/util/file_type.h"

namespace vexlo::cli {
namespace {

constexpr int kDefaultLimit = 20;
// Around a word that was found, in what the engine sends.
constexpr char kMarkBegin = '\x02';
constexpr char kMarkEnd = '\x03';
constexpr char kHighlight[] = "\033[1;33m";
constexpr char kPlain[] = "\033[0m";
constexpr char kBold[] = "\033[1m";

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
    if (rest != nullptr && *rest == '\0') {
      return static_cast<int64_t>(mktime(&parts));
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

Json::Value MakeRequest(const Arguments& arguments, const Console& console) {
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
    data["below"] = AbsolutePath(arguments.Get("--below"));
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
  data["snippet"] = console.out_is_terminal || arguments.Has("--json");
  if (words.empty() && data.size() == 3) {
    throw UsageError("wants words to look for, or an option that narrows the search");
  }
  return request;
}

// A snippet with its marks as colours, and nothing else in it that a terminal obeys.
std::string Coloured(const std::string& snippet) {
  std::string shown;
  for (const char c : snippet) {
    shown += c == kMarkBegin ? std::string(kHighlight)
             : c == kMarkEnd ? std::string(kPlain)
                             : ForTerminal(std::string_view(&c, 1));
  }
  return shown;
}

void PrintHit(const Arguments& arguments, const Console& console, const Json::Value& hit) {
  const std::string path = hit["path"].asString();
  if (arguments.Has("--json")) {
    console.out << JsonToString(hit) << "\n";
  } else if (arguments.Has("-0")) {
    console.out << path << '\0';
  } else if (!console.out_is_terminal) {
    console.out << path << "\n";
  } else {
    const size_t name_at = path.rfind('/') + 1;
    console.out << ForTerminal(path.substr(0, name_at)) << kBold
                << ForTerminal(path.substr(name_at)) << kPlain << "\n";
    if (const std::string snippet = hit["snippet"].asString(); !snippet.empty()) {
      console.out << "    " << Coloured(snippet) << "\n";
    }
  }
}

ExitStatus RunSearch(const Arguments& arguments, const Console& console) {
  Json::Value reply;
  const Json::Value hits = AskSearch(MakeRequest(arguments, console), &reply);
  for (const Json::Value& hit : hits) {
    PrintHit(arguments, console, hit);
  }
  console.out.flush();
  for (const Json::Value& index : reply["skipped"]) {
    console.err << "not searched: " << ForTerminal(index["id"].asString()) << " (error "
                << index["code"].asInt() << ")\n";
  }
  if (console.err_is_terminal || hits.empty()) {
    const uint64_t total = reply["total"].asUInt64();
    console.err << (reply["total_is_least"] == true ? "at least " : "") << Counted(total, "file")
                << " found";
    if (total > hits.size()) {
      console.err << ", the first " << Grouped(hits.size()) << " shown";
    }
    console.err << "\n";
  }
  return hits.empty() ? kNothingFound : kDone;
}

}  // namespace

std::vector<Command> SearchCommands() {
  return {
      {"search",
       "[WORD...]",
       "finds files by their content, names and settings",
       "Prints the files that hold all of the words, best first: in their text, their names or\n"
       "their metadata. \"A phrase\" is found as it stands, sun* whatever begins so. Case and\n"
       "accents do not matter. On a terminal each file comes with the place that was found.\n"
       "Exit status 1 when nothing was found.\n"
       "\n"
       "  fileindex search beach holiday\n"
       "  fileindex search '\"annual report\"' --below /volume1/docs --newer 1y\n"
       "  fileindex search --name invoice --type document --sort -modified --limit 5\n"
       "  fileindex search --type video --larger 4G -0 | xargs -0 ls -l\n",
       {{"--share", "SHARE", "in this share only"},
        {"--below", "FOLDER", "below this folder only"},
        {"--name", "PART", "whose name holds this"},
        {"--type", "TYPE", "document, audio, video or photo"},
        {"--larger", "SIZE", "of at least so many bytes: 500k, 1.5M, 4G"},
        {"--smaller", "SIZE", "of at most so many bytes"},
        {"--newer", "DATE", "changed since: 2026-11-01, or 7d ago (h, d, w, m, y)"},
        {"--older", "DATE", "not changed since"},
        {"--sort", "ORDER", "relevance, name, path, size, modified; -size for descending"},
        {"--limit", "N", "show at most so many (20)"},
        {"--json", nullptr, "one JSON object a line"},
        {"-0", nullptr, "end each path with a NUL instead of a newline"}},
       {},
       0,
       64,
       RunSearch},
  };
}

}  // namespace vexlo::cli
