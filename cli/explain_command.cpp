// "fileindex explain PATH": why a path is indexed or not.
#include <json/value.h>

#include <algorithm>
#include <iomanip>

#include "cli/command.h"
#include "cli/shares.h"
#include "cli/text.h"
#include "common/error.h"
#include "common/json.h"
#include "fileindex/util/file_type.h"
#include "fileindex/util/path_policy.h"
#include "fileindex/util/share_path.h"

namespace vexlo::cli {
namespace {

using fileindex::RuleVerdict;

struct Explanation {
  std::string path;
  std::vector<RuleVerdict> verdicts;
  RuleVerdict::Answer answer;  // The first that is not kPasses.
  std::string share;           // "" when no share holds the path.
  std::string share_dir;
  std::string type;
};

Explanation Explain(const std::string& path) {
  Explanation explanation;
  explanation.path = path;
  explanation.verdicts = fileindex::ExplainFullPath(path);
  const auto decides =
      std::find_if(explanation.verdicts.begin(), explanation.verdicts.end(),
                   [](const RuleVerdict& verdict) { return verdict.answer != verdict.kPasses; });
  explanation.answer =
      decides == explanation.verdicts.end() ? RuleVerdict::kPasses : decides->answer;
  try {
    fileindex::GetShareNamePathByFullPath(explanation.share, explanation.share_dir, path);
  } catch (const Error&) {  // The rule "share" has said so.
  }
  explanation.type = fileindex::GetFileTypeName(fileindex::GetFileTypeByFullPath(path));
  return explanation;
}

const char* AnswerText(RuleVerdict::Answer answer) {
  switch (answer) {
    case RuleVerdict::kPasses:
      return "passes";
    case RuleVerdict::kRefuses:
      return "refuses";
    default:
      return "cannot tell";
  }
}

void PrintJson(std::ostream& out, const Explanation& explanation) {
  Json::Value document;
  document["path"] = explanation.path;
  document["can_be_indexed"] = explanation.answer == RuleVerdict::kPasses;
  document["rules"] = Json::Value(Json::arrayValue);
  for (const RuleVerdict& verdict : explanation.verdicts) {
    Json::Value& rule = document["rules"].append(Json::Value());
    rule["rule"] = verdict.rule;
    rule["answer"] = AnswerText(verdict.answer);
    rule["reason"] = verdict.reason;
  }
  document["share"] = explanation.share.empty() ? Json::Value() : Json::Value(explanation.share);
  document["share_path"] =
      explanation.share.empty() ? Json::Value() : Json::Value(explanation.share_dir);
  document["type"] = explanation.type;
  out << JsonToString(document) << "\n";
}

void PrintText(const Console& console, const Explanation& explanation) {
  const auto shown = [&console](const std::string& text) {
    return console.out_is_terminal ? ForTerminal(text) : text;
  };
  console.out << shown(explanation.path) << "\n";
  for (const RuleVerdict& verdict : explanation.verdicts) {
    console.out << "  " << std::left << std::setw(13) << verdict.rule << std::setw(13)
                << AnswerText(verdict.answer) << shown(verdict.reason) << "\n";
  }
  console.out << (explanation.answer == RuleVerdict::kPasses    ? "can be indexed\n"
                  : explanation.answer == RuleVerdict::kRefuses ? "cannot be indexed\n"
                                                                : "cannot be told\n");
  console.out << "type: " << explanation.type << "\n";
  if (explanation.share.empty()) {
    console.out << "share: none holds the path\n";
  } else {
    console.out << "share: " << shown(explanation.share) << " (" << shown(explanation.share_dir)
                << ")\n";
  }
}

ExitStatus RunExplain(const Arguments& arguments, const Console& console) {
  const std::string& path = arguments.positional[0];
  // An absolute path is judged byte for byte as it was given.
  const Explanation explanation = Explain(path.starts_with('/') ? path : AbsolutePath(path));
  if (explanation.share.empty()) {
    CheckSharesFile();
  }
  if (arguments.Has("--json")) {
    PrintJson(console.out, explanation);
  } else {
    PrintText(console, explanation);
  }
  switch (explanation.answer) {
    case RuleVerdict::kPasses:
      return kDone;
    case RuleVerdict::kRefuses:
      return kNothingFound;
    default:
      return explanation.share.empty() ? kNothingFound : kFailed;
  }
}

}  // namespace

std::vector<Command> ExplainCommands() {
  return {
      {"explain",
       "PATH",
       "says why a path can be indexed or not",
       "Asks every rule of the path policy, in their order, and prints what each one says of "
       "PATH;\n"
       "the first that does not pass decides. At the end stand the group of the file's type and\n"
       "the share that holds the path. A relative PATH is made absolute; an absolute one is "
       "judged\n"
       "as it is written, so a trailing \"/\" is refused.\n"
       "\n"
       "Exit status 0 when the path can be indexed, 1 when it cannot, 3 when a question about its\n"
       "share failed.\n"
       "\n"
       "  fileindex explain /volume1/photo/2019/beach.jpg\n"
       "  fileindex explain --json ./notes | jq -r '.rules[] | select(.answer != \"passes\")'\n",
       {{"--json", nullptr, "one JSON object: path, can_be_indexed, rules, type, share"}},
       {},
       1,
       1,
       RunExplain},
  };
}

}  // namespace vexlo::cli
