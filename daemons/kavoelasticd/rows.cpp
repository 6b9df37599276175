#include "daemons/kavoelasticd/rows.h"

#include <algorithm>

#include "daemons/kavoelasticd/document.h"
#include "daemons/kavoelasticd/fields.h"
#include "daemons/kavoelasticd/fold.h"

namespace vexlo::elasticd {
namespace {

void Append(std::string* column, std::string text) {
  if (column->empty()) {
    *column = std::move(text);
    return;
  }
  *column += '\n';
  *column += text;
}

}  // namespace

unsigned TablesOf(const Field& field) {
  const unsigned filter = field.filter ? static_cast<unsigned>(kDocsTable) : 0;
  const unsigned all = filter | (field.all ? static_cast<unsigned>(kWordTable) : 0);
  switch (field.lookup) {
    case Lookup::kKey:
      return 0;
    case Lookup::kNumber:
      return all;
    case Lookup::kAncestor:
    case Lookup::kExact:
      return all | kExactTable;
    case Lookup::kGrams:
      return all | kGramTable;
    case Lookup::kText:
      return filter | kTexts;
    case Lookup::kWords:
      return filter | kWordTable;
  }
  return 0;
}

TextRow TextRowOf(Session& session, const StoredDocument& document, unsigned table,
                  size_t columns) {
  TextRow row(columns);
  for (const Item& item : document.record.Items()) {
    const Field& field = session.FieldOf(item.field);
    if ((TablesOf(field) & table) == 0) {
      continue;
    }
    size_t column = static_cast<size_t>(std::max(0, field.column));
    if (table == kWordTable) {
      column = field.lookup == Lookup::kGrams ? 0 : field.all ? 1 : 2;
    }
    Append(&row[column], JoinedTexts(item, document.path));
  }
  return row;
}

ExactRows ExactRowsOf(Session& session, const StoredDocument& document) {
  ExactRows rows;
  for (const Item& item : document.record.Items()) {
    const Field& field = session.FieldOf(item.field);
    if ((TablesOf(field) & kExactTable) == 0 ||
        (item.kind == Kind::kParent && FoundByPath(field))) {
      continue;
    }
    for (const std::string& text : TextsOf(item, document.path)) {
      for (std::string& value : ExactValues(field, text)) {
        rows.emplace_back(item.field, std::move(value));
      }
    }
  }
  std::sort(rows.begin(), rows.end());
  rows.erase(std::unique(rows.begin(), rows.end()), rows.end());
  return rows;
}

DocsRow DocsRowOf(Session& session, const StoredDocument& document) {
  DocsRow row;
  const auto find = [&](const char* name) -> const Item* {
    const auto id = session.IdOf(name);
    return id ? document.record.Find(*id) : nullptr;
  };
  // A folder's name has no extension in this sense: a search for types is one for files.
  const Item* const is_dir = find(kIsDirField);
  const bool is_folder = is_dir != nullptr && JsonOf(*is_dir, document.path).asBool();
  if (const Item* item = find(kExtensionField); !is_folder && item != nullptr && IsText(*item)) {
    row.extension = Fold(TextOf(*item, document.path));
  }
  if (const Item* item = find(kSizeField); item != nullptr && item->kind == Kind::kInt) {
    row.size = IntOf(*item);
  }
  if (const Item* item = find(kModifiedField); item != nullptr && item->kind == Kind::kInt) {
    row.modified = IntOf(*item);
  }
  return row;
}

}  // namespace vexlo::elasticd
