// What an index's mappings say about each field. Pure: no I/O, immutable once made.
#ifndef DAEMONS_KAVOELASTICD_SCHEMA_H_
#define DAEMONS_KAVOELASTICD_SCHEMA_H_

#include <json/value.h>

#include <map>
#include <string>
#include <vector>

namespace vexlo::elasticd {

enum class FieldType { kString, kText, kInt, kDouble, kBool };
enum class Analyzer { kStandard, kKeyword, kWhiteSpace, kWhiteSpaceEscaped };

// How a field's value is found.
enum class Lookup {
  kKey,       // it identifies the document
  kNumber,    // compared as a number
  kAncestor,  // a path, found by itself and by every folder above it
  kGrams,     // by any part of it
  kText,      // by words; long, and so apart from what a rename changes
  kWords,     // by words
  kExact,     // by the whole value, or by what white space separates
};

struct Field {
  std::string name;
  FieldType type = FieldType::kString;
  Analyzer analyzer = Analyzer::kStandard;
  bool required = false;
  bool stored = true;  // Whether queries return it.
  bool all = true;     // Whether a search without a field looks at it.
  bool tolower = false;
  bool ngram = false;
  bool list_ancestor = false;
  Lookup lookup = Lookup::kWords;
  int column = -1;      // Of the table for kText or kGrams.
  bool filter = false;  // Searches filter and sort by it.
};

class Schema {
 public:
  // Throws Failure kBadMappings for mappings without "property_id", and for a type, analyzer or
  // preprocessing step that is not known.
  explicit Schema(const Json::Value& mappings);

  const std::string& Key() const { return key_; }
  // The listed fields by name.
  const std::map<std::string, Field>& Listed() const { return listed_; }
  // The rules for `name`, listed or not.
  Field Rules(const std::string& name) const;
  // The names of the columns' fields, in the order of their columns.
  const std::vector<std::string>& TextColumns() const { return text_columns_; }
  const std::vector<std::string>& GramColumns() const { return gram_columns_; }

 private:
  std::string key_;
  Field default_;
  std::map<std::string, Field> listed_;
  std::vector<std::string> text_columns_;
  std::vector<std::string> gram_columns_;
};

// Whether a value that is the folder of the document's path is found through the path, and so has
// no entry of its own: a rename then leaves the field's entries as they are.
bool FoundByPath(const Field& field);

// The values that a kExact or kAncestor field is found by: `text` itself, its parts, or the path
// and the folders above it.
std::vector<std::string> ExactValues(const Field& field, const std::string& text);

// Whether the field's value `text` is found by `wanted` as a whole or, with `prefix`, by its
// beginning. For kExact and kAncestor.
bool MatchesExactly(const Field& field, const std::string& text, const std::string& wanted,
                    bool prefix);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_SCHEMA_H_
