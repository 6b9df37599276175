#include "daemons/kavoelasticd/document.h"

#include <charconv>
#include <cmath>
#include <system_error>
#include <utility>

#include "common/json.h"
#include "common/string.h"
#include "daemons/kavoelasticd/failure.h"

namespace vexlo::elasticd {
namespace {

// Shorter texts stand in the record, where they are read with everything else.
constexpr size_t kBodyBytes = 400;

[[noreturn]] void Refuse(const Field& field, const std::string& what) {
  throw Failure(Code::kBadDocument, field.name + " is no " + what);
}

template <typename T>
bool Parse(const std::string& text, T* out) {
  const char* const end = text.data() + text.size();
  const auto [behind, error] = std::from_chars(text.data(), end, *out);
  return error == std::errc() && behind == end;
}

bool ToInt(const Json::Value& value, int64_t* out) {
  if (value.isInt64()) {
    *out = value.asInt64();
    return true;
  }
  if (value.isBool()) {
    *out = value.asBool() ? 1 : 0;
    return true;
  }
  return value.isString() && Parse(value.asString(), out);
}

bool ToDouble(const Json::Value& value, double* out) {
  if (value.isNumeric()) {
    *out = value.asDouble();
    return true;
  }
  return value.isString() && Parse(value.asString(), out) && std::isfinite(*out);
}

bool ToBool(const Json::Value& value, bool* out) {
  int64_t number = 0;
  if (value.isString() && (value.asString() == "true" || value.asString() == "false")) {
    *out = value.asString() == "true";
    return true;
  }
  if (!ToInt(value, &number) || (number != 0 && number != 1)) {
    return false;
  }
  *out = number == 1;
  return true;
}

// The same for ever: a text index forgets only what is spelled as it was learnt.
std::string Printed(double value) {
  char text[64];
  const auto [end, error] = std::to_chars(text, text + sizeof(text), value);
  return error == std::errc() ? std::string(text, end) : std::string();
}

void SetText(Record* record, uint32_t id, std::string text, const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash != std::string::npos && text == std::string_view(path).substr(0, slash)) {
    record->PutBare(id, Kind::kParent);
  } else if (slash != std::string::npos && text == std::string_view(path).substr(slash + 1)) {
    record->PutBare(id, Kind::kName);
  } else if (text.size() >= kBodyBytes && id < kBodyFields) {
    record->Fill(id, std::move(text));
  } else {
    record->Put(id, Kind::kString, std::move(text));
  }
}

}  // namespace

void SetField(Record* record, uint32_t id, const Field& field, const Json::Value& value,
              const std::string& path) {
  if (value.isArray() || value.isObject()) {
    if (value.isObject() && field.lookup == Lookup::kNumber) {
      Refuse(field, "number");
    }
    record->Put(id, Kind::kJson, JsonToString(value));
    return;
  }
  switch (field.type) {
    case FieldType::kInt: {
      int64_t number = 0;
      if (!ToInt(value, &number)) {
        Refuse(field, "whole number");
      }
      record->PutInt(id, number);
      return;
    }
    case FieldType::kDouble: {
      double number = 0;
      if (!ToDouble(value, &number)) {
        Refuse(field, "number");
      }
      record->PutDouble(id, number);
      return;
    }
    case FieldType::kBool: {
      bool truth = false;
      if (!ToBool(value, &truth)) {
        Refuse(field, "truth value");
      }
      record->PutBare(id, truth ? Kind::kTrue : Kind::kFalse);
      return;
    }
    case FieldType::kString:
    case FieldType::kText:
      SetText(record, id, value.isString() ? value.asString() : JsonToString(value), path);
      return;
  }
}

Json::Value JsonOf(const Item& item, const std::string& path) {
  switch (item.kind) {
    case Kind::kInt:
      return Json::Value(static_cast<Json::Int64>(IntOf(item)));
    case Kind::kDouble:
      return Json::Value(DoubleOf(item));
    case Kind::kTrue:
    case Kind::kFalse:
      return Json::Value(item.kind == Kind::kTrue);
    case Kind::kJson: {
      Json::Value value;
      if (!JsonFromString(value, item.bytes)) {
        throw Failure(Code::kIndexDamaged, "a stored list is damaged");
      }
      return value;
    }
    default:
      return Json::Value(TextOf(item, path));
  }
}

bool IsText(const Item& item) {
  return item.kind == Kind::kString || item.kind == Kind::kParent || item.kind == Kind::kName ||
         item.kind == Kind::kBody;
}

std::string TextOf(const Item& item, const std::string& path) {
  if (item.kind == Kind::kParent) {
    return Dirname(path);
  }
  return item.kind == Kind::kName ? Basename(path) : std::string(item.bytes);
}

std::vector<std::string> TextsOf(const Item& item, const std::string& path) {
  if (IsText(item)) {
    return {TextOf(item, path)};
  }
  std::vector<std::string> texts;
  if (item.kind == Kind::kJson) {
    const Json::Value list = JsonOf(item, path);
    if (list.isArray()) {
      for (const Json::Value& element : list) {
        if (element.isString()) {
          texts.push_back(element.asString());
        } else if (element.isInt64()) {
          texts.push_back(std::to_string(element.asInt64()));
        } else if (element.isNumeric()) {
          texts.push_back(Printed(element.asDouble()));
        }
      }
    }
  } else if (item.kind == Kind::kInt) {
    texts.push_back(std::to_string(IntOf(item)));
  } else if (item.kind == Kind::kDouble) {
    texts.push_back(Printed(DoubleOf(item)));
  }
  return texts;
}

std::string JoinedTexts(const Item& item, const std::string& path) {
  if (IsText(item)) {
    return TextOf(item, path);
  }
  std::string joined;
  for (const std::string& text : TextsOf(item, path)) {
    joined += joined.empty() ? "" : "\n";
    joined += text;
  }
  return joined;
}

bool SameNumber(const Item& item, const Json::Value& wanted) {
  int64_t whole = 0;
  double number = 0;
  bool truth = false;
  switch (item.kind) {
    case Kind::kInt:
      return ToInt(wanted, &whole)
                 ? IntOf(item) == whole
                 : ToDouble(wanted, &number) && static_cast<double>(IntOf(item)) == number;
    case Kind::kDouble:
      return ToDouble(wanted, &number) && DoubleOf(item) == number;
    case Kind::kTrue:
    case Kind::kFalse:
      return ToBool(wanted, &truth) && truth == (item.kind == Kind::kTrue);
    default:
      return false;
  }
}

}  // namespace vexlo::elasticd
