// Cuts texts into what the text indexes hold. Pure; a WordCutter is for one thread at a time.
#ifndef DAEMONS_KAVOELASTICD_TOKENS_H_
#define DAEMONS_KAVOELASTICD_TOKENS_H_

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

struct sb_stemmer;

namespace vexlo::elasticd {

// How a text is cut: a document's gives what it may be found by, a query's what must be there.
enum class Cut { kDocument, kQuery, kPrefixQuery };

struct Token {
  std::string_view text;  // Folded; lives as long as the call that it is passed to.
  size_t begin;           // Where it stands in the text, in bytes.
  size_t end;
  bool same_place;  // Stands where the token before it does: another form of the same word.
};

// False ends the cutting.
using TokenSink = std::function<bool(const Token&)>;

// Words are runs of letters, digits and marks. A document's word is found by itself and by its
// stem, a query's by its stem, a query for beginnings by the word as typed. Characters of Chinese,
// Japanese and Korean, and of scripts that are written without spaces, such as Thai, Lao, Khmer and
// Burmese, come in overlapping pairs, each with the marks on it, and the last of a run also alone,
// at the place of its pair, so that one character is found as the beginning of a pair.
class WordCutter {
 public:
  // A Snowball algorithm's name, or "none". Throws Failure kBadMappings for another one.
  explicit WordCutter(const std::string& language);
  ~WordCutter();
  WordCutter(const WordCutter&) = delete;
  WordCutter& operator=(const WordCutter&) = delete;

  void Words(std::string_view text, Cut cut, const TokenSink& sink);

  // The tokens of a query.
  std::vector<std::string> QueryTokens(std::string_view text, Cut cut);

  // Whether the tokens stand one behind the other in `text`; with `prefix`, the last need only
  // begin so.
  bool Contains(std::string_view text, const std::vector<std::string>& tokens, bool prefix);

 private:
  bool Word(std::string_view text, size_t begin, size_t end, Cut cut, const TokenSink& sink);
  std::string_view Stem(std::string_view word);

  struct StemmerDelete {
    void operator()(sb_stemmer* stemmer) const;
  };
  std::unique_ptr<sb_stemmer, StemmerDelete> stemmer_;
  // Words met lately, each at the place of its hash: most of a text is words that are frequent.
  struct Known {
    std::string word;
    std::string stem;
  };
  std::vector<Known> known_;
};

// Whether the last run of the text is one character of those that come in pairs: a query that ends
// so is found by beginnings, as documents have a character with the one behind it.
bool EndsInSingleIdeograph(std::string_view text);

// The parts of two and three characters of a text and its last character: what a name is found by.
void Grams(std::string_view text, const std::function<bool(std::string_view)>& sink);

// The grams that a name with `part` in it must have; `begins` when the one gram is the beginning of
// another. Empty for an empty part.
std::vector<std::string> QueryGrams(std::string_view part, bool* begins);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_TOKENS_H_
