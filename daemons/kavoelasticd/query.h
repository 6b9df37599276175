// Finds documents by the values of fields.
#ifndef DAEMONS_KAVOELASTICD_QUERY_H_
#define DAEMONS_KAVOELASTICD_QUERY_H_

#include <json/value.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "daemons/kavoelasticd/session.h"

namespace vexlo::elasticd {

struct Condition {
  std::string field;
  bool prefix = false;
  Json::Value value;  // A text, number or truth value.
};
// All must hold.
using Conditions = std::vector<Condition>;

// Reads {"term": {FIELD: VALUE..}}, {"prefix": {FIELD: TEXT..}}, {"and": [..]}, or several of them
// in one object. Throws Failure kUnknownQuery for anything else, and for an empty query.
Conditions ParseQuery(const Json::Value& qsl);

// Which of the documents that were found.
struct Page {
  std::string after = {};  // Only paths behind this one; "" for all.
  size_t from = 0;
  size_t size = 0;
  // Only paths without a "/" behind the prefix, which is the one condition. Folders between them
  // are passed over at one look each.
  bool flat = false;
};

// The documents for which all hold, in the order of their paths as bytes, `size` of them from the
// one numbered `from`. Conditions on the path alone read only what they return, and what `from`
// passes over; conditions on words, parts of names and whole values read what one of them finds;
// conditions on numbers read every document. Throws Failure.
std::vector<int64_t> Find(Session& session, const Conditions& conditions, const Page& page);

// The documents with a file name that may hold `part`, in the order of their numbers; for parts of
// up to three characters, that do.
std::vector<int64_t> FindGrams(Session& session, const std::string& part);

// The first path behind all that begin with `prefix`; false when there is none.
bool EndOfPrefix(std::string prefix, std::string* end);

// `text` as an FTS5 string.
std::string Quote(const std::string& text);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_QUERY_H_
