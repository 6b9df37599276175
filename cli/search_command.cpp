// "fileindex search": finds files by what is in them, their names and their settings.
#include <json/value.h>

#include <cstdint>

#include "cli/command.h"
#include "cli/engine.h"
#include "cli/search_request.h"
#include "cli/text.h"
#include "common/json.h"

namespace vexlo::cli {
namespace {

// Around a word that was found, in what the engine sends.
constexpr char kMarkBegin = '\x02';
constexpr char kMarkEnd = '\x03';
constexpr char kHighlight[] = "\033[1;33m";
constexpr char kPlain[] = "\033[0m";
constexpr char kBold[] = "\033[1m";

// A snippet with its marks as colours, and nothing else in it that a terminal obeys.
std::string Coloured(const std::string& snippet) {
  constexpr char kMarks[] = {kMarkBegin, kMarkEnd};
  const std::string_view text = snippet;
  std::string shown;
  for (size_t from = 0; from < text.size();) {
    const size_t mark = text.find_first_of(std::string_view(kMarks, sizeof(kMarks)), from);
    shown += ForTerminal(text.substr(from, mark - from));
    if (mark == std::string_view::npos) {
      break;
    }
    shown += text[mark] == kMarkBegin ? kHighlight : kPlain;
    from = mark + 1;
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
  Json::Value request = MakeSearchRequest(arguments);
  request["data"]["snippet"] = console.out_is_terminal || arguments.Has("--json");
  Json::Value reply;
  const Json::Value hits = AskSearch(request, &reply);
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
