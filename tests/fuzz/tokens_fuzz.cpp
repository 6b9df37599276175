// Folding, words, parts of names and snippets: a text is found by each of its own words, a name by
// each of its own parts, and what is shown of a text is text.
#include <algorithm>
#include <set>
#include <vector>

#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/fold.h"
#include "daemons/kavoelasticd/record.h"
#include "daemons/kavoelasticd/snippet.h"
#include "daemons/kavoelasticd/tokens.h"
#include "fuzz/target.h"

namespace {

using vexlo::elasticd::Cut;
using vexlo::elasticd::Record;
using vexlo::elasticd::WordCutter;

void CheckWords(WordCutter& words, std::string_view text) {
  std::set<std::string> forms;
  size_t last = 0;
  words.Words(text, Cut::kDocument, [&](const vexlo::elasticd::Token& token) {
    fuzz::Require(token.begin <= token.end && token.end <= text.size() && token.begin >= last,
                  "a word stands nowhere in the text");
    last = token.begin;
    forms.emplace(token.text);
    return true;
  });
  for (const Cut cut : {Cut::kQuery, Cut::kPrefixQuery}) {
    for (const std::string& token : words.QueryTokens(text, cut)) {
      fuzz::Require(forms.contains(token), "a text is not found by its own word");
    }
  }
  const std::vector<std::string> whole = words.QueryTokens(text, Cut::kQuery);
  fuzz::Require(whole.empty() || words.Contains(text, whole, /*prefix=*/false),
                "a text is not found by the whole of it");
}

// At the boundaries of characters, as far as the name is of any use.
void CheckGrams(std::string_view name) {
  const std::string folded = vexlo::elasticd::Fold(name.substr(0, 64));
  std::set<std::string> grams;
  vexlo::elasticd::Grams(name.substr(0, 64), [&](std::string_view gram) {
    grams.emplace(gram);
    return true;
  });
  std::vector<size_t> starts;
  starts.reserve(folded.size() + 1);
  for (size_t at = 0; at < folded.size(); vexlo::elasticd::NextCodePoint(folded, &at)) {
    starts.push_back(at);
  }
  starts.push_back(folded.size());
  for (size_t i = 0; i + 1 < starts.size(); ++i) {
    for (size_t j = i + 1; j < starts.size() && j <= i + 5; ++j) {
      const std::string part = folded.substr(starts[i], starts[j] - starts[i]);
      if (vexlo::elasticd::Fold(part) != part) {
        continue;  // Other marks beside it make other characters.
      }
      bool begins = false;
      for (const std::string& gram : vexlo::elasticd::QueryGrams(part, &begins)) {
        const auto found = grams.lower_bound(gram);
        fuzz::Require(found != grams.end() && (begins ? found->starts_with(gram) : *found == gram),
                      "a name is not found by its own part");
      }
    }
  }
}

void CheckSnippet(WordCutter& words, std::string_view text, std::string_view query) {
  std::vector<vexlo::elasticd::Wanted> wanted(1);
  wanted[0].tokens = words.QueryTokens(query, Cut::kPrefixQuery);
  wanted[0].prefix = true;
  const std::string snippet = vexlo::elasticd::MakeSnippet(words, text, wanted);
  bool is_marked = false;
  bool any = snippet.empty();
  for (const char c : snippet) {
    if (c == vexlo::elasticd::kMarkBegin || c == vexlo::elasticd::kMarkEnd) {
      fuzz::Require(is_marked == (c == vexlo::elasticd::kMarkEnd), "marks are not in pairs");
      is_marked = !is_marked;
      any = true;
    } else {
      fuzz::Require(static_cast<unsigned char>(c) >= ' ', "a snippet has a control character");
    }
  }
  fuzz::Require(any && !is_marked, "a snippet shows nothing that was looked for");
  if (fuzz::IsUtf8(text)) {
    fuzz::Require(fuzz::IsUtf8(snippet), "a snippet cuts a character");
  }
}

void CheckRecord(const std::string& bytes) {
  try {
    const Record record = Record::Decode(bytes);
    const std::string written = record.Encode();
    fuzz::Require(Record::Decode(written).SameStored(record),
                  "a record is another one when written");
    fuzz::RequireEqual(record.Copy().Encode(), written, "the copy of a record is another one");
    for (const vexlo::elasticd::Item& item : record.Items()) {
      if (item.kind == vexlo::elasticd::Kind::kInt) {
        vexlo::elasticd::IntOf(item);
      } else if (item.kind == vexlo::elasticd::Kind::kDouble) {
        vexlo::elasticd::DoubleOf(item);
      }
    }
  } catch (const vexlo::elasticd::Failure& failure) {
    fuzz::Require(failure.GetCode() == vexlo::elasticd::Code::kIndexDamaged,
                  "a damaged record fails otherwise");
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static WordCutter english("english");
  static WordCutter plain("none");
  const std::string_view text = fuzz::TextOf(data, size);
  // Of other bytes, two may come together as a character where an accent was between them.
  if (fuzz::IsUtf8(text)) {
    const std::string folded = vexlo::elasticd::Fold(text);
    fuzz::RequireEqual(vexlo::elasticd::Fold(folded), folded, "folding twice is another thing");
    fuzz::Require(fuzz::IsUtf8(folded), "folding breaks characters");
  }
  CheckWords(english, text);
  CheckWords(plain, text);
  CheckGrams(text);
  std::string_view rest = text;
  const std::string_view query = fuzz::TakeLine(rest);
  CheckSnippet(english, rest, query);
  CheckRecord(std::string(text));
  return 0;
}
