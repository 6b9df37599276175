#include "daemons/kavoelasticd/schema.h"

#include <algorithm>
#include <string_view>

#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/fields.h"
#include "daemons/kavoelasticd/fold.h"

namespace vexlo::elasticd {
namespace {

[[noreturn]] void Refuse(const std::string& what) { throw Failure(Code::kBadMappings, what); }

template <typename T>
struct Named {
  std::string_view name;
  T value;
};

constexpr Named<FieldType> kTypes[] = {{"string", FieldType::kString},
                                       {"text", FieldType::kText},
                                       {"int", FieldType::kInt},
                                       {"double", FieldType::kDouble},
                                       {"bool", FieldType::kBool}};
constexpr Named<Analyzer> kAnalyzers[] = {{"kavostandard", Analyzer::kStandard},
                                          {"keyword", Analyzer::kKeyword},
                                          {"white space", Analyzer::kWhiteSpace},
                                          {"white space escaped", Analyzer::kWhiteSpaceEscaped}};
constexpr Named<bool Field::*> kFlags[] = {
    {"required", &Field::required}, {"stored", &Field::stored}, {"_all", &Field::all}};
constexpr Named<bool Field::*> kSteps[] = {{"tolower", &Field::tolower},
                                           {"ngram", &Field::ngram},
                                           {"list_ancestor", &Field::list_ancestor}};

template <typename T, size_t N>
T ByName(const Named<T> (&table)[N], const Json::Value& name, const std::string& where) {
  if (name.isString()) {
    for (const Named<T>& row : table) {
      if (name.asString() == row.name) {
        return row.value;
      }
    }
  }
  Refuse("mappings: " + where + " is not known");
}

// `field` with the attributes that `attributes` gives.
Field Apply(Field field, const Json::Value& attributes) {
  const std::string where = field.name.empty() ? "default" : field.name;
  if (!attributes.isObject()) {
    Refuse("mappings: " + where + " is no object");
  }
  if (attributes.isMember("type")) {
    field.type = ByName(kTypes, attributes["type"], where + ".type");
  }
  if (attributes.isMember("analyzer")) {
    field.analyzer = ByName(kAnalyzers, attributes["analyzer"], where + ".analyzer");
  }
  for (const auto& flag : kFlags) {
    const std::string name(flag.name);
    if (attributes.isMember(name)) {
      if (!attributes[name].isBool()) {
        Refuse(std::string("mappings: ").append(where) + "." + name + " is neither true nor false");
      }
      field.*flag.value = attributes[name].asBool();
    }
  }
  if (attributes.isMember("preprocess")) {
    if (!attributes["preprocess"].isArray()) {
      Refuse("mappings: " + where + ".preprocess is no list");
    }
    for (const auto& step : kSteps) {
      field.*step.value = false;
    }
    for (const Json::Value& step : attributes["preprocess"]) {
      field.*ByName(kSteps, step, where + ".preprocess") = true;
    }
  }
  return field;
}

Lookup LookupOf(const Field& field, bool listed) {
  if (field.type != FieldType::kString && field.type != FieldType::kText) {
    return Lookup::kNumber;
  }
  if (field.list_ancestor) {
    return Lookup::kAncestor;
  }
  // Tables have the columns that they were made with: fields that come later share one.
  if (field.ngram && listed) {
    return Lookup::kGrams;
  }
  if (field.analyzer != Analyzer::kStandard) {
    return Lookup::kExact;
  }
  return listed && field.type == FieldType::kText ? Lookup::kText : Lookup::kWords;
}

bool IsFilter(std::string_view name) {
  return name == kExtensionField || name == kSizeField || name == kModifiedField;
}

constexpr std::string_view kSpace = " \t\n\r\v\f";

std::vector<std::string> SplitAtSpace(std::string_view text, bool escaped) {
  std::vector<std::string> parts;
  std::string part;
  bool open = false;
  const auto finish = [&] {
    if (open) {
      parts.push_back(part);
      part.clear();
      open = false;
    }
  };
  for (size_t i = 0; i < text.size(); ++i) {
    if (escaped && text[i] == '\\' && i + 1 < text.size()) {
      part += text[++i];
      open = true;
    } else if (kSpace.find(text[i]) != std::string_view::npos) {
      finish();
    } else {
      part += text[i];
      open = true;
    }
  }
  finish();
  return parts;
}

}  // namespace

Schema::Schema(const Json::Value& mappings) {
  if (!mappings.isObject() || !mappings["property_id"].isString() ||
      mappings["property_id"].asString().empty()) {
    Refuse("mappings: property_id is missing");
  }
  key_ = mappings["property_id"].asString();
  if (mappings.isMember("default")) {
    default_ = Apply(default_, mappings["default"]);
  }
  default_.lookup = LookupOf(default_, /*listed=*/false);
  const Json::Value& properties = mappings["properties"];
  if (!properties.isNull() && !properties.isObject()) {
    Refuse("mappings: properties is no object");
  }
  for (const std::string& name : properties.getMemberNames()) {
    Field field = default_;
    field.name = name;
    field = Apply(field, properties[name]);
    field.filter = IsFilter(name);
    field.lookup = name == key_ ? Lookup::kKey : LookupOf(field, /*listed=*/true);
    if (field.lookup == Lookup::kText) {
      field.column = static_cast<int>(text_columns_.size());
      text_columns_.push_back(name);
    } else if (field.lookup == Lookup::kGrams) {
      field.column = static_cast<int>(gram_columns_.size());
      gram_columns_.push_back(name);
    }
    listed_.emplace(name, field);
  }
  if (!listed_.contains(key_)) {
    Field key = default_;
    key.name = key_;
    key.lookup = Lookup::kKey;
    listed_.emplace(key_, key);
  }
}

Field Schema::Rules(const std::string& name) const {
  const auto found = listed_.find(name);
  if (found != listed_.end()) {
    return found->second;
  }
  Field field = default_;
  field.name = name;
  field.filter = IsFilter(name);
  return field;
}

bool FoundByPath(const Field& field) {
  return !field.tolower &&
         (field.lookup == Lookup::kAncestor ||
          (field.lookup == Lookup::kExact && field.analyzer == Analyzer::kKeyword));
}

std::vector<std::string> ExactValues(const Field& field, const std::string& text) {
  const std::string value = field.tolower ? Fold(text) : text;
  if (field.lookup == Lookup::kAncestor) {
    std::vector<std::string> folders = {value};
    for (size_t slash = value.rfind('/'); slash != std::string::npos && slash > 0;
         slash = value.rfind('/', slash - 1)) {
      folders.push_back(value.substr(0, slash));
    }
    return folders;
  }
  if (field.analyzer == Analyzer::kWhiteSpace || field.analyzer == Analyzer::kWhiteSpaceEscaped) {
    return SplitAtSpace(value, field.analyzer == Analyzer::kWhiteSpaceEscaped);
  }
  return {value};
}

bool MatchesExactly(const Field& field, const std::string& text, const std::string& wanted,
                    bool prefix) {
  const std::vector<std::string> values = ExactValues(field, text);
  const std::string folded = field.tolower ? Fold(wanted) : wanted;
  return std::any_of(values.begin(), values.end(), [&](const std::string& value) {
    return prefix ? value.starts_with(folded) : value == folded;
  });
}

}  // namespace vexlo::elasticd
