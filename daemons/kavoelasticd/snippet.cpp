#include "daemons/kavoelasticd/snippet.h"

#include <algorithm>
#include <cstddef>
#include <set>

namespace vexlo::elasticd {
namespace {

constexpr size_t kReadBytes = size_t{256} * 1024;
constexpr size_t kShownBytes = 200;
constexpr size_t kLeadBytes = 40;

struct Match {
  size_t begin;
  size_t end;
  size_t word;  // Which of the wanted words.
};

// Up to where the best start is certain, and what is shown from there ends.
std::vector<Match> Matches(WordCutter& words, std::string_view text,
                           const std::vector<Wanted>& wanted) {
  std::vector<Match> matches;
  size_t count = 0;
  for (const Wanted& term : wanted) {
    count += term.tokens.size();
  }
  std::vector<size_t> last(count, std::string_view::npos);  // Where each wanted word stood last.
  size_t stop = std::string_view::npos;
  words.Words(text, Cut::kDocument, [&](const Token& token) {
    size_t word = 0;
    for (const Wanted& term : wanted) {
      for (size_t i = 0; i < term.tokens.size(); ++i, ++word) {
        const bool fits = term.prefix && i + 1 == term.tokens.size()
                              ? token.text.starts_with(term.tokens[i])
                              : token.text == term.tokens[i];
        if (fits && (matches.empty() || matches.back().begin != token.begin)) {
          matches.push_back({token.begin, token.end, word});
          last[word] = token.begin;
          const auto [first, latest] = std::minmax_element(last.begin(), last.end());
          if (stop == std::string_view::npos && *latest != std::string_view::npos &&
              token.end - *first < kShownBytes) {
            stop = token.end + kShownBytes;
          }
        }
      }
    }
    return token.begin <= stop;
  });
  return matches;
}

// The first of the matches that the most different words follow within what is shown.
size_t BestStart(const std::vector<Match>& matches) {
  size_t best = 0;
  size_t most = 0;
  for (size_t i = 0; i < matches.size() && i < 200; ++i) {
    std::set<size_t> seen;
    for (size_t j = i; j < matches.size() && matches[j].end - matches[i].begin < kShownBytes; ++j) {
      seen.insert(matches[j].word);
    }
    if (seen.size() > most) {
      most = seen.size();
      best = i;
    }
  }
  return best;
}

bool IsInsideCharacter(std::string_view text, size_t at) {
  return at < text.size() && (static_cast<unsigned char>(text[at]) & 0xC0) == 0x80;
}

// A place at or behind `at` where a word may begin, not behind `limit`.
size_t WordStart(std::string_view text, size_t at, size_t limit) {
  for (size_t i = at; i < limit; ++i) {
    if (text[i] == ' ' || text[i] == '\n') {
      return i + 1;
    }
  }
  while (at < limit && IsInsideCharacter(text, at)) {
    ++at;
  }
  return at;
}

}  // namespace

std::string MakeSnippet(WordCutter& words, std::string_view text,
                        const std::vector<Wanted>& wanted) {
  text = text.substr(0, kReadBytes);
  const std::vector<Match> matches = Matches(words, text, wanted);
  if (matches.empty()) {
    return "";
  }
  const size_t first = BestStart(matches);
  size_t begin = matches[first].begin;
  begin = begin <= kLeadBytes ? 0 : WordStart(text, begin - kLeadBytes, begin);
  size_t end = std::min(text.size(), std::max(begin + kShownBytes, matches[first].end));
  while (IsInsideCharacter(text, end)) {
    ++end;
  }
  std::string out = begin > 0 ? "…" : "";
  size_t next = first;
  for (size_t i = begin; i < end; ++i) {
    if (next < matches.size() && i == matches[next].begin && matches[next].end <= end) {
      out += kMarkBegin;
    }
    out += static_cast<unsigned char>(text[i]) < ' ' ? ' ' : text[i];
    if (next < matches.size() && i + 1 == matches[next].end && matches[next].begin >= begin) {
      out += kMarkEnd;
      // Pairs of ideographs overlap: one that begins inside the last one stays unmarked.
      while (next < matches.size() && matches[next].begin <= i) {
        ++next;
      }
    }
  }
  return out + (end < text.size() ? "…" : "");
}

}  // namespace vexlo::elasticd
