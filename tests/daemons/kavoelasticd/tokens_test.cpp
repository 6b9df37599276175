#include "daemons/kavoelasticd/tokens.h"

#include <gtest/gtest.h>

#include <string>

#include "daemons/kavoelasticd/fold.h"

namespace vexlo::elasticd {
namespace {

TEST(Fold, OneSpellingForOneText) {
  struct Case {
    const char* name;
    std::string text;
    std::string want;
  };
  const Case cases[] = {
      {"Decomposed", "Cafe\u0301", "cafe"},
      {"SharpS", "STRASSE Stra\u00dfe", "strasse strasse"},
      {"TurkishCapitalI", "\u0130zmir", "izmir"},
      {"FullWidth", "\uff21\uff22\uff23", "abc"},
      {"CyrillicShortI", "\u0419\u043e\u0434", "\u0438\u043e\u0434"},
      {"DecomposedVoicedKana", "\u304b\u3099", "\u304c"},
      {"HalfWidthVoicedKana", "\uff76\uff9e", "\u30ac"},
      {"DecomposedHangul", "\u1112\u1161\u11ab", "\ud55c"},
      {"VowelSignsStay", "\u0915\u0941", "\u0915\u0941"},
      {"BadBytesStay", "A\xff\xc3Z", "a\xff\xc3z"},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(Fold(c.text), c.want) << c.name;
  }
}

std::string Join(const std::string& text, Cut cut) {
  WordCutter words("english");
  std::string joined;
  words.Words(text, cut, [&](const Token& token) {
    joined += (joined.empty() ? "" : token.same_place ? "/" : " ") + std::string(token.text);
    EXPECT_LE(token.begin, token.end);
    EXPECT_LE(token.end, text.size());
    return true;
  });
  return joined;
}

TEST(WordCutter, CutsDocumentsAndQueries) {
  struct Case {
    const char* name;
    std::string text;
    std::string document;
    std::string query;
    std::string prefix;
  };
  const std::string tokyo = "\u6771\u4eac\u90fd";
  const Case cases[] = {
      {"Stems", "Running dogs", "running/run dogs/dog", "run dog", "running dogs"},
      {"Separators", "IMG_2019-01.jpg", "img 2019 01 jpg", "img 2019 01 jpg", "img 2019 01 jpg"},
      {"BadBytesSeparate",
       "ab\xff"
       "cd",
       "ab cd", "ab cd", "ab cd"},
      {"Pairs", tokyo, "\u6771\u4eac \u4eac\u90fd/\u90fd", "\u6771\u4eac \u4eac\u90fd",
       "\u6771\u4eac \u4eac\u90fd"},
      {"PairsAmongWords",
       "a\u6771\u4eac"
       "b",
       "a \u6771\u4eac/\u4eac b", "a \u6771\u4eac b", "a \u6771\u4eac b"},
      {"SoftHyphen", "co\u00adop", "coop", "coop", "coop"},
      {"LongWordsAreCutAlike", std::string(300, 'x'), std::string(128, 'x'), std::string(128, 'x'),
       std::string(128, 'x')},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(Join(c.text, Cut::kDocument), c.document) << c.name;
    EXPECT_EQ(Join(c.text, Cut::kQuery), c.query) << c.name;
    EXPECT_EQ(Join(c.text, Cut::kPrefixQuery), c.prefix) << c.name;
  }
}

}  // namespace
}  // namespace vexlo::elasticd
