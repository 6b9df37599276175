#include "daemons/kavoelasticd/tokens.h"

#include <gtest/gtest.h>
#include <unicode/normalizer2.h>
#include <unicode/unistr.h>

#include <chrono>
#include <string>
#include <string_view>

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
      {"Strokes", "\u0141\u00f3d\u017a \u0110\u00d8 \u01ff", "lodz do o"},
      {"BadBytesStay", "A\xff\xc3Z", "a\xff\xc3z"},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(Fold(c.text), c.want) << c.name;
  }
}

// The same with ICU alone, for a text without strokes.
std::string FoldByInsertion(const std::string& text) {
  UErrorCode status = U_ZERO_ERROR;
  icu::UnicodeString folded;
  icu::Normalizer2::getNFKCCasefoldInstance(status)->normalize(icu::UnicodeString::fromUTF8(text),
                                                               folded, status);
  std::string ordered;
  folded.toUTF8String(ordered);
  return Fold(ordered);
}

std::string Repeat(const std::string& text, size_t bytes) {
  std::string repeated;
  while (repeated.size() < bytes) {
    repeated += text;
  }
  return repeated;
}

// What is not in order as it stands: marks of two classes, those that only come apart to marks, and
// those that only meet when what stands between them is gone.
TEST(Fold, AnyNumberOfMarksIsFoldedAtOnceAndAlike) {
  for (const char* const marks : {"\u0301\u0316", "\u0f73\u0f71", "\u0301\u034f\u0316\u034f",
                                  "\u3099\U0001d165", "\uff9e\u0334\uff9f"}) {
    for (const size_t count : {1, 10, 40}) {
      const std::string run = Repeat(marks, std::string_view(marks).size() * count);
      EXPECT_EQ(Fold("\u00e9" + run), FoldByInsertion("\u00e9" + run)) << marks << count;
    }
    const auto start = std::chrono::steady_clock::now();
    Fold("z" + Repeat(marks, size_t{1} << 20));
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2)) << marks;
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
      {"ThaiInPairsOfClusters", "\u0e19\u0e49\u0e33\u0e17\u0e35\u0e48\u0e44",
       "\u0e19\u0e49\u0e4d\u0e32\u0e17\u0e35\u0e48 \u0e17\u0e35\u0e48\u0e44/\u0e44",
       "\u0e19\u0e49\u0e4d\u0e32\u0e17\u0e35\u0e48 \u0e17\u0e35\u0e48\u0e44",
       "\u0e19\u0e49\u0e4d\u0e32\u0e17\u0e35\u0e48 \u0e17\u0e35\u0e48\u0e44"},
      {"ZeroWidthSpace", "hello\u200bworld \u1780\u200b\u1781", "hello world \u1780 \u1781",
       "hello world \u1780 \u1781", "hello world \u1780 \u1781"},
      {"MarksWithoutEnd", "\u6771" + Repeat("\u3099", 3000), "\u6771" + Repeat("\u3099", 123),
       "\u6771" + Repeat("\u3099", 123), "\u6771" + Repeat("\u3099", 123)},
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
