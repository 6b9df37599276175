// Search for somebody who may not read everything: hits of which nothing may be told are taken out
// before they are counted.
#ifndef DAEMONS_KAVOELASTICD_READABLE_H_
#define DAEMONS_KAVOELASTICD_READABLE_H_

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "daemons/kavoelasticd/snippet.h"

namespace vexlo::elasticd {

struct SearchPage;
struct SearchRequest;
struct StoredDocument;
class Session;

struct Verdict {
  bool is_readable = false;
  int64_t changed = 0;  // When its attributes were last changed, in ns; of a readable one.
};

// The verdict about each path, in their order.
using JudgePaths = std::function<std::vector<Verdict>(const std::vector<std::string>& paths)>;

// So many hits of an index are judged at most, the first in the order asked for.
constexpr size_t kMostJudged = 200000;

// Leaves on the page the hits that may be read, each with its `changed`, and counts them; where
// there were more than `most` to judge, the rest is left out and the total is the least there is.
// That a document of another file than the one that was judged is found, and where in the order,
// tells nothing but what its path does: `wanted`, the words of the request, are all in its name,
// and it has no size, no date and no score.
void KeepReadable(Session& session, const SearchRequest& request, const std::vector<Wanted>& wanted,
                  const JudgePaths& judge, SearchPage* page, size_t most = kMostJudged);

// Whether what stands in the document is of the file that was judged, and not of one that was at
// its path before. False for a document that does not say of what it is.
bool IsOfFile(Session& session, StoredDocument& document, int64_t changed);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_READABLE_H_
