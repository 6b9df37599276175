// Between a field's JSON value, the item that is kept of it, and what it is found by. Pure.
#ifndef DAEMONS_KAVOELASTICD_DOCUMENT_H_
#define DAEMONS_KAVOELASTICD_DOCUMENT_H_

#include <json/value.h>

#include <cstdint>
#include <string>
#include <vector>

#include "daemons/kavoelasticd/record.h"
#include "daemons/kavoelasticd/schema.h"

namespace vexlo::elasticd {

// Fields with this number or a higher one have their texts in the record, however long.
constexpr uint32_t kBodyFields = 65536;

// `path` is always the path of the document that the item belongs to.

// Sets the field to a value that is not null. Numbers and truth values are converted where nothing
// is lost ("12" is a number, 1 is true); throws Failure kBadDocument where they cannot be.
void SetField(Record* record, uint32_t id, const Field& field, const Json::Value& value,
              const std::string& path);

Json::Value JsonOf(const Item& item, const std::string& path);

// Whether the item is a text, and which. Of a kBody item the text must be known.
bool IsText(const Item& item);
std::string TextOf(const Item& item, const std::string& path);

// All texts of a field: one, those of a list, or a number as it prints.
std::vector<std::string> TextsOf(const Item& item, const std::string& path);

// The texts with line breaks between them.
std::string JoinedTexts(const Item& item, const std::string& path);

// Whether both are numbers, or truth values, and equal. Numbers compare as the types that they are
// stored with.
bool SameNumber(const Item& item, const Json::Value& wanted);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_DOCUMENT_H_
