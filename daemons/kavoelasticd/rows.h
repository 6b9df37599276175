// What each table of an index holds of a document. No I/O but for the numbers of fields.
#ifndef DAEMONS_KAVOELASTICD_ROWS_H_
#define DAEMONS_KAVOELASTICD_ROWS_H_

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "daemons/kavoelasticd/schema.h"
#include "daemons/kavoelasticd/session.h"
#include "daemons/kavoelasticd/text_batch.h"

namespace vexlo::elasticd {

enum Table : unsigned {
  kTexts = 1,
  kWordTable = 2,
  kGramTable = 4,
  kExactTable = 8,
  kDocsTable = 16,  // Its columns beside the path.
};

// Those that hold something of a field.
unsigned TablesOf(const Field& field);

// What one of the three text tables holds; bodies must be known.
TextRow TextRowOf(Session& session, const StoredDocument& document, unsigned table, size_t columns);

// Of the table of whole values: in order, each once; bodies must be known.
using ExactRows = std::vector<std::pair<uint32_t, std::string>>;
ExactRows ExactRowsOf(Session& session, const StoredDocument& document);

// What docs holds of the fields, for the filters and orders of a search.
struct DocsRow {
  std::optional<std::string> extension;
  std::optional<int64_t> size;
  std::optional<int64_t> modified;
};
DocsRow DocsRowOf(Session& session, const StoredDocument& document);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_ROWS_H_
