// Searches and queries over documents that do not change. The first byte of an input says what the
// rest is: words ("w") and parts of names ("n"), which are looked for in the texts themselves, too;
// the data of a search ("s") or a query ("q"), whose pages together are the whole.
#include <algorithm>
#include <filesystem>
#include <set>

#include "daemons/kavoelasticd/fold.h"
#include "daemons/kavoelasticd/search.h"
#include "daemons/kavoelasticd/tokens.h"
#include "fuzz/engine_index.h"
#include "fuzz/target.h"

namespace {

using vexlo::elasticd::Engine;
using Paths = std::set<std::string>;

Engine& Index() {
  static const bool is_made = std::filesystem::create_directories(fuzz::Folder() + "/engine");
  static Engine engine(fuzz::Folder() + "/engine/registry.json");
  static const bool is_filled = (fuzz::FillIndex(engine), is_made);
  fuzz::Require(is_filled, "the index is there already");
  return engine;
}

std::string Name(const std::string& path) { return path.substr(path.rfind('/') + 1); }

// The documents that a search finds, each once.
Paths Find(const Json::Value& data) {
  Json::Value reply = Index().Handle(fuzz::Request("search", data));
  fuzz::Require(reply["success"].asBool(), vexlo::JsonToString(reply).c_str());
  Paths found;
  for (const Json::Value& hit : reply["data"]) {
    fuzz::Require(found.insert(hit["path"].asString()).second, "a document is found twice");
  }
  return found;
}

// Where the words stand: each of them in the text or in the name.
bool HasWords(const std::vector<vexlo::elasticd::SearchRequest::Term>& terms,
              const std::string& path, const std::string& text) {
  static vexlo::elasticd::WordCutter words("english");
  return std::all_of(terms.begin(), terms.end(), [&](const auto& term) {
    const auto cut =
        term.prefix ? vexlo::elasticd::Cut::kPrefixQuery : vexlo::elasticd::Cut::kQuery;
    const std::vector<std::string> tokens = words.QueryTokens(term.text, cut);
    return tokens.empty() || words.Contains(text, tokens, term.prefix) ||
           words.Contains(Name(path), tokens, term.prefix);
  });
}

void SearchWords(const std::string& text) {
  Json::Value data;
  data["words"] = text;
  data["snippet"] = true;
  data["size"] = 100;
  const auto request = vexlo::elasticd::ParseSearch(data);
  Paths want;
  for (const auto& [path, content] : fuzz::Texts()) {
    if (HasWords(request.terms, path, content)) {
      want.insert(path);
    }
  }
  fuzz::Require(Find(data) == want || request.terms.empty(),
                "a search finds other documents than have the words");
}

void SearchName(const std::string& part) {
  Json::Value data;
  data["name"] = part;
  data["size"] = 100;
  Paths want;
  const std::string folded = vexlo::elasticd::Fold(part);
  for (const auto& [path, content] : fuzz::Texts()) {
    if (vexlo::elasticd::Fold(Name(path)).find(folded) != std::string::npos) {
      want.insert(path);
    }
  }
  // A part of a character is none of a name.
  fuzz::Require(Find(data) == want || folded.empty() || !fuzz::IsUtf8(part),
                "a search finds other documents than have the name");
}

// The list that `data` asks for, in one piece and in pages of two; `page` is where in it the page
// stands.
void CheckPages(const std::string& command, const Json::Value& data, Json::Value& page) {
  page["from"] = 0;
  page["size"] = 100;
  const Json::Value whole = Index().Handle(fuzz::Request(command, data));
  if (!whole["success"].asBool()) {
    const int code = whole["error"]["code"].asInt();
    fuzz::Require(code == 2000 || code == 2001 || code == 2002, vexlo::JsonToString(whole).c_str());
    return;
  }
  Json::Value joined(Json::arrayValue);
  page["size"] = 2;
  for (unsigned from = 0; from < fuzz::Texts().size() + 2; from += 2) {
    page["from"] = from;
    const Json::Value reply = Index().Handle(fuzz::Request(command, data));
    fuzz::Require(reply["success"].asBool(), "a page is refused, and the whole is not");
    for (const Json::Value& hit : reply["data"]) {
      joined.append(hit);
    }
  }
  fuzz::RequireEqual(vexlo::JsonToString(joined), vexlo::JsonToString(whole["data"]),
                     "the pages are not the whole");
  fuzz::Require(command != "search" || whole["total"].asUInt() == whole["data"].size(),
                "the total is not what was found");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) {
    return 0;
  }
  const std::string text(fuzz::TextOf(data + 1, size - 1));
  Json::Value value;
  switch (*data) {
    case 'w':
      SearchWords(text);
      break;
    case 'n':
      SearchName(text);
      break;
    case 's':
      if (vexlo::JsonFromString(value, text) && value.isObject()) {
        value.removeMember("ids");
        CheckPages("search", value, value);
      }
      break;
    case 'q':
      if (vexlo::JsonFromString(value, text)) {
        Json::Value query;
        query["query"]["qsl"] = value;
        CheckPages("document_get_by_query", query, query["query"]);
      }
      break;
    default:
      break;
  }
  return 0;
}
