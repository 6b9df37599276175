#include "daemons/kavoelasticd/tokens.h"

#include <libstemmer.h>
#include <unicode/uchar.h>
#include <unicode/uscript.h>

#include <algorithm>
#include <array>
#include <cstdint>

#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/fold.h"

namespace vexlo::elasticd {
namespace {

// What is longer is no word; its beginning stands for it.
constexpr size_t kMaxWordBytes = 128;
constexpr size_t kKnownWords = 8192;

// Where scripts that are written without spaces end a word, if the writer wants it told.
constexpr int32_t kZeroWidthSpace = 0x200B;

// Ideographs are, in all of this, also the letters of scripts that are written without spaces.
enum class Class { kSeparator, kLetter, kExtend, kIdeograph };

constexpr std::array<bool, 256> MakePlainLetters() {
  std::array<bool, 256> letters{};
  for (int c = 0; c < 0x80; ++c) {
    letters[static_cast<size_t>(c)] =
        (c >= '0' && c <= '9') || ((c | 0x20) >= 'a' && (c | 0x20) <= 'z');
  }
  return letters;
}
// Of ASCII: most texts are nothing else.
constexpr std::array<bool, 256> kPlainLetters = MakePlainLetters();

bool IsPlainLetter(char c) { return kPlainLetters[static_cast<unsigned char>(c)]; }

// Copies ASCII letters and digits in lower case; false when there is something else.
bool LowerAscii(std::string_view word, char* out) {
  for (const char c : word) {
    if (!IsPlainLetter(c)) {
      return false;
    }
    // Digits have the bit already.
    *out++ = static_cast<char>(c | 0x20);
  }
  return true;
}

Class ClassOf(int32_t c) {
  if (c < 0) {
    return Class::kSeparator;
  }
  if (c < 0x80) {
    return kPlainLetters[static_cast<size_t>(c)] ? Class::kLetter : Class::kSeparator;
  }
  if (c >= 0x4E00 && c <= 0x9FFF) {
    return Class::kIdeograph;
  }
  if (c == kZeroWidthSpace) {
    return Class::kSeparator;
  }
  const uint32_t category = U_GET_GC_MASK(c);
  // Vowels and finals of decomposed Hangul, and the half-width voice marks, belong to the one
  // before.
  if ((category & U_GC_M_MASK) != 0 || (c >= 0x1160 && c <= 0x11FF) ||
      (c >= 0xD7B0 && c <= 0xD7FF) || c == 0xFF9E || c == 0xFF9F ||
      u_hasBinaryProperty(c, UCHAR_DEFAULT_IGNORABLE_CODE_POINT) != 0) {
    return Class::kExtend;
  }
  if ((category & (U_GC_L_MASK | U_GC_N_MASK)) == 0) {
    return Class::kSeparator;
  }
  switch (u_getIntPropertyValue(c, UCHAR_SCRIPT)) {
    case USCRIPT_HAN:
    case USCRIPT_HIRAGANA:
    case USCRIPT_KATAKANA:
    case USCRIPT_HANGUL:
    case USCRIPT_BOPOMOFO:
      return Class::kIdeograph;
    default:
      break;
  }
  if (c == 0x30FC || c == 0xFF70) {
    return Class::kIdeograph;
  }
  // Thai is the first of them.
  if (c < 0x0E00 || u_getIntPropertyValue(c, UCHAR_LINE_BREAK) != U_LB_COMPLEX_CONTEXT) {
    return Class::kLetter;
  }
  // Some vowels of Thai and Lao are letters by category and stand behind what they belong to.
  return u_getIntPropertyValue(c, UCHAR_GRAPHEME_CLUSTER_BREAK) == U_GCB_SPACING_MARK
             ? Class::kExtend
             : Class::kIdeograph;
}

// Those that fold to themselves, which is most of them.
bool FoldsToItself(std::string_view character) {
  size_t at = 0;
  const int32_t c = NextCodePoint(character, &at);
  return at == character.size() && ((c >= 0x4E00 && c <= 0x9FFF) || (c >= 0x3041 && c <= 0x3096) ||
                                    (c >= 0x30A1 && c <= 0x30FA) || (c >= 0xAC00 && c <= 0xD7A3));
}

// The end of what begins at `at`: a character with what extends it.
size_t ClusterEnd(std::string_view text, size_t at) {
  NextCodePoint(text, &at);
  while (at < text.size()) {
    size_t next = at;
    if (ClassOf(NextCodePoint(text, &next)) != Class::kExtend) {
      break;
    }
    at = next;
  }
  return at;
}

// Up to kMaxWordBytes of it.
std::string FoldedWord(std::string_view text) {
  std::string folded = Fold(text);
  if (folded.size() > kMaxWordBytes) {
    size_t length = kMaxWordBytes;
    while (length > 0 && (static_cast<unsigned char>(folded[length]) & 0xC0) == 0x80) {
      --length;
    }
    folded.resize(length);
  }
  return folded;
}

struct Cluster {
  std::string text;
  size_t begin;
  size_t end;
};

bool Ideographs(const std::vector<Cluster>& run, Cut cut, const TokenSink& sink) {
  for (size_t i = 0; i + 1 < run.size(); ++i) {
    const std::string pair = run[i].text + run[i + 1].text;
    if (!sink({pair, run[i].begin, run[i + 1].end, /*same_place=*/false})) {
      return false;
    }
  }
  if (run.empty() || (cut != Cut::kDocument && run.size() > 1)) {
    return true;
  }
  // At the place of the pair that it ends: what follows a run follows its last pair, also in a
  // query.
  const Cluster& last = run.back();
  return sink({last.text, last.begin, last.end, /*same_place=*/run.size() > 1});
}

std::vector<std::string_view> Characters(std::string_view text) {
  std::vector<std::string_view> characters;
  for (size_t i = 0; i < text.size();) {
    const size_t from = i;
    NextCodePoint(text, &i);
    characters.push_back(text.substr(from, i - from));
  }
  return characters;
}

std::string_view Span(const std::vector<std::string_view>& characters, size_t from, size_t count) {
  const char* begin = characters[from].data();
  const std::string_view last = characters[from + count - 1];
  return {begin, static_cast<size_t>(last.data() + last.size() - begin)};
}

// Of which grams are made. FTS5 ends what it gathers of a word at a NUL, and the index contradicts
// itself then.
std::string FoldWithoutNul(std::string_view text) {
  std::string folded = Fold(text);
  std::replace(folded.begin(), folded.end(), '\0', ' ');
  return folded;
}

}  // namespace

void WordCutter::StemmerDelete::operator()(sb_stemmer* stemmer) const {
  sb_stemmer_delete(stemmer);
}

WordCutter::WordCutter(const std::string& language) {
  if (language != "none") {
    stemmer_.reset(sb_stemmer_new(language.c_str(), "UTF_8"));
    if (stemmer_ == nullptr) {
      throw Failure(Code::kBadMappings, "settings: language is not known: " + language);
    }
  }
}

WordCutter::~WordCutter() = default;

std::string_view WordCutter::Stem(std::string_view word) {
  if (stemmer_ == nullptr ||
      std::any_of(word.begin(), word.end(), [](char c) { return c >= '0' && c <= '9'; })) {
    return word;
  }
  if (known_.empty()) {
    known_.resize(kKnownWords);
  }
  Known& known = known_[std::hash<std::string_view>()(word) % kKnownWords];
  if (known.word != word) {
    const auto* stem =
        sb_stemmer_stem(stemmer_.get(), reinterpret_cast<const sb_symbol*>(word.data()),
                        static_cast<int>(word.size()));
    const int length = stem == nullptr ? 0 : sb_stemmer_length(stemmer_.get());
    known.stem = length > 0
                     ? std::string(reinterpret_cast<const char*>(stem), static_cast<size_t>(length))
                     : std::string(word);
    known.word = word;
  }
  return known.stem;
}

bool WordCutter::Word(std::string_view text, size_t begin, size_t end, Cut cut,
                      const TokenSink& sink) {
  char plain[kMaxWordBytes];
  std::string folded;
  std::string_view word = text.substr(begin, std::min(end - begin, kMaxWordBytes));
  if (LowerAscii(word, plain)) {
    word = std::string_view(plain, word.size());
  } else {
    folded = FoldedWord(text.substr(begin, end - begin));
    word = folded;
  }
  if (word.empty()) {
    return true;
  }
  if (cut == Cut::kPrefixQuery) {
    return sink({word, begin, end, /*same_place=*/false});
  }
  const std::string_view stem = Stem(word);
  if (cut == Cut::kQuery) {
    return sink({stem, begin, end, /*same_place=*/false});
  }
  return sink({word, begin, end, /*same_place=*/false}) &&
         (stem == word || sink({stem, begin, end, /*same_place=*/true}));
}

void WordCutter::Words(std::string_view text, Cut cut, const TokenSink& sink) {
  std::vector<Cluster> run;
  for (size_t i = 0; i < text.size();) {
    const size_t begin = i;
    switch (ClassOf(NextCodePoint(text, &i))) {
      case Class::kIdeograph: {
        i = ClusterEnd(text, begin);
        const std::string_view cluster = text.substr(begin, i - begin);
        run.push_back(
            {FoldsToItself(cluster) ? std::string(cluster) : FoldedWord(cluster), begin, i});
        continue;
      }
      case Class::kLetter:
        if (!Ideographs(run, cut, sink)) {
          return;
        }
        run.clear();
        while (i < text.size() && IsPlainLetter(text[i])) {
          ++i;
        }
        for (size_t next = i; next < text.size(); i = next) {
          const Class kind = ClassOf(NextCodePoint(text, &next));
          if (kind != Class::kLetter && kind != Class::kExtend) {
            break;
          }
        }
        // The loop stops in front of what is no part of the word, or behind the last byte.
        if (!Word(text, begin, i, cut, sink)) {
          return;
        }
        continue;
      case Class::kExtend:
      case Class::kSeparator:
        if (!Ideographs(run, cut, sink)) {
          return;
        }
        run.clear();
        continue;
    }
  }
  Ideographs(run, cut, sink);
}

std::vector<std::string> WordCutter::QueryTokens(std::string_view text, Cut cut) {
  std::vector<std::string> tokens;
  Words(text, cut, [&](const Token& token) {
    tokens.emplace_back(token.text);
    return true;
  });
  return tokens;
}

bool WordCutter::Contains(std::string_view text, const std::vector<std::string>& tokens,
                          bool prefix) {
  // matched[i]: the first i + 1 tokens end at the place before this one.
  std::vector<bool> matched(tokens.size(), false);
  std::vector<bool> here;
  bool found = false;
  Words(text, Cut::kDocument, [&](const Token& token) {
    if (!token.same_place && !here.empty()) {
      matched = here;
    }
    if (!token.same_place) {
      here.assign(tokens.size(), false);
    }
    for (size_t i = 0; i < tokens.size(); ++i) {
      const bool fits = prefix && i + 1 == tokens.size() ? token.text.starts_with(tokens[i])
                                                         : token.text == tokens[i];
      if (fits && (i == 0 || matched[i - 1])) {
        here[i] = true;
      }
    }
    found = !tokens.empty() && here.back();
    return !found;
  });
  return found;
}

bool EndsInSingleIdeograph(std::string_view text) {
  bool is_single = false;
  WordCutter("none").Words(text, Cut::kPrefixQuery, [&](const Token& token) {
    size_t at = token.begin;
    is_single = ClassOf(NextCodePoint(text, &at)) == Class::kIdeograph &&
                ClusterEnd(text, token.begin) == token.end;
    return true;
  });
  return is_single;
}

void Grams(std::string_view text, const std::function<bool(std::string_view)>& sink) {
  const std::string folded = FoldWithoutNul(text);
  const std::vector<std::string_view> characters = Characters(folded);
  for (size_t i = 0; i < characters.size(); ++i) {
    for (const size_t count : {2, 3}) {
      if (i + count <= characters.size() && !sink(Span(characters, i, count))) {
        return;
      }
    }
  }
  if (!characters.empty()) {
    sink(characters.back());
  }
}

std::vector<std::string> QueryGrams(std::string_view part, bool* begins) {
  const std::string folded = FoldWithoutNul(part);
  const std::vector<std::string_view> characters = Characters(folded);
  *begins = characters.size() == 1;
  if (characters.size() <= 3) {
    return folded.empty() ? std::vector<std::string>() : std::vector<std::string>{folded};
  }
  std::vector<std::string> grams;
  for (size_t i = 0; i + 3 <= characters.size(); ++i) {
    grams.emplace_back(Span(characters, i, 3));
  }
  std::sort(grams.begin(), grams.end());
  grams.erase(std::unique(grams.begin(), grams.end()), grams.end());
  return grams;
}

}  // namespace vexlo::elasticd
