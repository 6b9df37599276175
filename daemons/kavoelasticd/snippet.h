// The part of a text that shows why it was found. Pure.
#ifndef DAEMONS_KAVOELASTICD_SNIPPET_H_
#define DAEMONS_KAVOELASTICD_SNIPPET_H_

#include <string>
#include <string_view>
#include <vector>

#include "daemons/kavoelasticd/tokens.h"

namespace vexlo::elasticd {

// Around a word that was looked for. Control characters, as a text shown as it stands holds none:
// those of the text are replaced by spaces.
constexpr char kMarkBegin = '\x02';
constexpr char kMarkEnd = '\x03';

struct Wanted {
  std::vector<std::string> tokens;
  bool prefix = false;  // The last token is the beginning of a word.
};

// About 200 bytes of the text with as many different words of `wanted` as can be, marked; "" when
// there is none among the first 256 KiB. "…" stands for what is left out at either end.
std::string MakeSnippet(WordCutter& words, std::string_view text,
                        const std::vector<Wanted>& wanted);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_SNIPPET_H_
