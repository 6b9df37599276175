// "fileindex extract FILE...": what would be indexed of files.
#include <json/value.h>

#include <exception>

#include "cli/command.h"
#include "cli/text.h"
#include "common/json.h"
#include "kavo/content_extract.h"
#include "kavo/local/content.h"

namespace vexlo::cli {
namespace {

// Texts may be long; their beginning tells what was read.
constexpr size_t kShownBytes = 200;

void PrintText(const Console& console, const std::string& path, const Json::Value& fields) {
  const auto shown = [&console](const std::string& text) {
    return console.out_is_terminal ? ForTerminal(text) : text;
  };
  console.out << shown(path) << "\n";
  for (auto member = fields.begin(); member != fields.end(); ++member) {
    std::string text = member->isString() ? member->asString() : JsonToString(*member);
    const size_t size = text.size();
    if (member.name() == "KAVOMDTextContent") {
      text = text.substr(0, text.find('\n'));
    }
    if (text.size() > kShownBytes) {
      size_t end = kShownBytes;
      while (end > 0 && (static_cast<unsigned char>(text[end]) & 0xC0U) == 0x80U) {
        --end;  // Between two characters.
      }
      text.resize(end);
    }
    console.out << "  " << member.name() << ": " << shown(text);
    if (text.size() < size) {
      console.out << "... (" << Grouped(size) << " bytes)";
    }
    console.out << "\n";
  }
}

ExitStatus RunExtract(const Arguments& arguments, const Console& console) {
  Json::Value options;
  options["need_meta"] = true;
  ExitStatus status = kDone;
  for (const std::string& argument : arguments.positional) {
    const std::string path = AbsolutePath(argument);
    Json::Value fields;
    try {
      KAVO::CONTENT_EXTRACT::ParseFile(path, options, fields);
    } catch (const std::exception& error) {
      console.err << "fileindex: " << ForTerminal(error.what()) << "\n";
      status = kFailed;
      continue;
    }
    if (arguments.Has("--json")) {
      console.out << JsonToString(fields) << "\n";
    } else {
      PrintText(console, path, fields);
    }
    if (status == kDone && fields.isMember(kavo::local::kContentErrorField)) {
      status = kNothingFound;
    }
  }
  return status;
}

}  // namespace

std::vector<Command> ExtractCommands() {
  return {
      {"extract",
       "FILE...",
       "shows what would be indexed of files",
       "Prints the fields of each FILE's document: what the file system tells, and what stands in\n"
       "the file, as the daemon kavocontentextractd reads it. Nothing is indexed. Without --json\n"
       "the text ends at its first line.\n"
       "\n"
       "Exit status 0 when all of it was read, 1 when the content of some file is missing or in\n"
       "part (the field KAVOMDContentError says why), 3 when a FILE is not there.\n"
       "\n"
       "  fileindex extract --json report.pdf\n",
       {{"--json", nullptr, "print one JSON object a line, with the whole text"}},
       {},
       1,
       SIZE_MAX,
       RunExtract},
  };
}

}  // namespace vexlo::cli
