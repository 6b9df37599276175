#include "common/json.h"

#include <json/reader.h>
#include <json/writer.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <deque>
#include <memory>
#include <new>
#include <ostream>
#include <streambuf>
#include <type_traits>
#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"

namespace vexlo {
namespace {

// The reader throws the same for a text that is nested too deep and for want of memory, which says
// nothing about the text.
void RethrowNoMemory(const Json::Exception& error) {
  if (strstr(error.what(), "allocate") != nullptr) {
    throw std::bad_alloc();
  }
}

Json::CharReader* NewReader() {
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  builder["failIfExtra"] = true;
  builder["allowTrailingCommas"] = false;
  builder["skipBom"] = false;
  return builder.newCharReader();
}

// Made once a thread: building a reader costs more than parsing a queue line.
Json::CharReader& Reader() {
  thread_local const std::unique_ptr<Json::CharReader> reader(NewReader());
  return *reader;  // NOLINT(clang-analyzer-cplusplus.NewDelete): it lives as long as the thread.
}

// Collects what is written in blocks. A text that is grown in one piece takes up to three times its
// length on the way, which for a request of ten thousand documents is memory to speak of.
class BlockBuffer : public std::streambuf {
 public:
  // Empties the buffer: each block goes as soon as it is copied.
  std::string Take() {
    if (blocks_.size() == 1) {
      return std::move(blocks_.front());
    }
    std::string text;
    text.reserve(size_);
    for (std::string& block : blocks_) {
      text += block;
      block = std::string();
    }
    return text;
  }

 protected:
  int_type overflow(int_type byte) override {
    const char c = traits_type::to_char_type(byte);
    return xsputn(&c, 1) == 1 ? byte : traits_type::eof();
  }
  std::streamsize xsputn(const char* text, std::streamsize count) override {
    std::string_view rest(text, static_cast<size_t>(count));
    size_ += rest.size();
    while (!rest.empty()) {
      if (blocks_.empty() || blocks_.back().size() == blocks_.back().capacity()) {
        blocks_.emplace_back().reserve(std::clamp(size_, kMinBlockBytes, kMaxBlockBytes));
      }
      std::string& block = blocks_.back();
      const size_t taken = std::min(rest.size(), block.capacity() - block.size());
      block.append(rest.substr(0, taken));
      rest.remove_prefix(taken);
    }
    return count;
  }

 private:
  static constexpr size_t kMinBlockBytes = 256;
  static constexpr size_t kMaxBlockBytes = size_t{256} * 1024;

  std::deque<std::string> blocks_;
  size_t size_ = 0;
};

// A value that another program's reader made keeps its comments, which no text of one line may
// have.
Json::StreamWriter* NewWriter(const char* indentation) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = indentation;
  builder["emitUTF8"] = true;  // Every other form replaces bytes that are not UTF-8.
  builder["commentStyle"] = "None";
  return builder.newStreamWriter();
}

std::string Write(const Json::Value& value, Json::StreamWriter& writer) {
  BlockBuffer buffer;
  std::ostream stream(&buffer);
  stream.exceptions(std::ios::badbit);  // Or want of memory would end the text early.
  writer.write(value, &stream);
  return buffer.Take();
}

}  // namespace

bool JsonFromString(Json::Value& value, std::string_view text) {
  try {
    return Reader().parse(text.data(), text.data() + text.size(), &value, nullptr);
  } catch (const Json::Exception& error) {
    RethrowNoMemory(error);
    return false;  // Nested too deep.
  }
}

std::string JsonFault(std::string_view text) {
  Json::Value value;
  std::string errors;
  try {
    if (Reader().parse(text.data(), text.data() + text.size(), &value, &errors)) {
      return "";
    }
  } catch (const Json::Exception& error) {
    RethrowNoMemory(error);
    return error.what();
  }
  // The first of several faults, as "* Line 3, Column 9\n  Missing ...\n".
  unsigned line = 0;
  unsigned column = 0;
  int what_from = 0;
  sscanf(errors.c_str(), "* Line %u, Column %u %n", &line, &column, &what_from);
  std::string what = errors.substr(static_cast<size_t>(what_from));
  what.resize(std::min(what.find('\n'), what.size()));
  return "line " + std::to_string(line) + ", column " + std::to_string(column) + ": " + what;
}

bool JsonFromFile(Json::Value& value, const std::string& path) {
  std::string text;
  return ReadFile(text, path) && JsonFromString(value, text);
}

// With a writer that is made once a thread, as the reader is.
std::string JsonToString(const Json::Value& value) {
  thread_local const std::unique_ptr<Json::StreamWriter> writer(NewWriter(""));
  return Write(value, *writer);
}

void AppendJsonText(std::string& out, std::string_view text) {
  constexpr char kHex[] = "0123456789abcdef";
  out += '"';
  size_t plain_from = 0;
  for (size_t i = 0; i < text.size(); ++i) {
    const auto byte = static_cast<unsigned char>(text[i]);
    if (byte >= 0x20 && byte != '"' && byte != '\\') {
      continue;
    }
    out.append(text, plain_from, i - plain_from);
    plain_from = i + 1;
    if (byte >= 0x20) {
      out += {'\\', text[i]};
    } else {
      out += {'\\', 'u', '0', '0', kHex[byte >> 4], kHex[byte & 15]};
    }
  }
  out.append(text, plain_from);
  out += '"';
}

std::string JsonToStyledString(const Json::Value& value) {
  const std::unique_ptr<Json::StreamWriter> writer(NewWriter("   "));
  const std::string text = Write(value, *writer);
  std::string styled;
  styled.reserve(text.size() + 1);
  // What takes several lines begins behind its name, and not on the next line. No string of the
  // text has a line break in it.
  size_t from = 0;
  for (size_t at = 0; (at = text.find(" : \n", from)) != std::string::npos;) {
    styled.append(text, from, at + 3 - from);
    from = text.find_first_not_of(' ', at + 4);
  }
  return styled.append(text, from) + "\n";
}

bool JsonToFile(const Json::Value& value, const std::string& path) {
  return ReplaceFile(path, JsonToStyledString(value));
}

template <>
bool isJsonType<std::string>(const Json::Value& value) {
  return value.isConvertibleTo(Json::stringValue);
}
template <>
std::string asJsonType<std::string>(const Json::Value& value) {
  return value.asString();
}
template <>
bool isJsonType<bool>(const Json::Value& value) {
  return value.isConvertibleTo(Json::booleanValue);
}
template <>
bool asJsonType<bool>(const Json::Value& value) {
  return value.asBool();
}
template <>
bool isJsonType<int>(const Json::Value& value) {
  return value.isConvertibleTo(Json::intValue);
}
template <>
int asJsonType<int>(const Json::Value& value) {
  return value.asInt();
}
template <>
bool isJsonType<unsigned int>(const Json::Value& value) {
  return value.isConvertibleTo(Json::uintValue);
}
template <>
unsigned int asJsonType<unsigned int>(const Json::Value& value) {
  return value.asUInt();
}
template <>
bool isJsonType<long>(const Json::Value& value) {
  // Asking for the stored type alone would let a number over INT64_MAX through to a throwing read.
  return (value.type() == Json::intValue || value.type() == Json::uintValue) && value.isInt64();
}
template <>
long asJsonType<long>(const Json::Value& value) {
  return static_cast<long>(value.asInt64());
}
template <>
bool isJsonType<double>(const Json::Value& value) {
  return value.isConvertibleTo(Json::realValue);
}
template <>
double asJsonType<double>(const Json::Value& value) {
  return value.asDouble();
}

template <typename T>
void GetJsonValue(T& out, const Json::Value& object, const std::string& key, bool required) {
  VEXLO_CHECK(!object.isObject(), ERR_BAD_PARAMETER, "Not an object" + AppendData(object));
  const Json::Value* member = object.find(key.data(), key.data() + key.size());
  if (!required && member == nullptr) {
    return;
  }
  VEXLO_CHECK(!object.isMember(key), ERR_BAD_PARAMETER,
              "Missing property: " + key + AppendData(object));
  if constexpr (std::is_same_v<T, Json::Value>) {
    out = *member;
  } else {
    const bool readable = isJsonType<T>(*member);
    if (!required && !readable) {
      return;
    }
    VEXLO_CHECK(!readable, ERR_BAD_PARAMETER, "Not a string" + AppendData(object));
    out = asJsonType<T>(*member);
  }
}

template void GetJsonValue<std::string>(std::string&, const Json::Value&, const std::string&, bool);
template void GetJsonValue<bool>(bool&, const Json::Value&, const std::string&, bool);
template void GetJsonValue<int>(int&, const Json::Value&, const std::string&, bool);
template void GetJsonValue<unsigned int>(unsigned int&, const Json::Value&, const std::string&,
                                         bool);
template void GetJsonValue<long>(long&, const Json::Value&, const std::string&, bool);
template void GetJsonValue<double>(double&, const Json::Value&, const std::string&, bool);
template void GetJsonValue<Json::Value>(Json::Value&, const Json::Value&, const std::string&, bool);

void JsonApplyChanges(Json::Value& target, const Json::Value& changes) {
  if (target.isNull()) {
    target = Json::objectValue;
  }
  VEXLO_CHECK(!target.isObject(), ERR_BAD_PARAMETER, "Not an object" + AppendData(target));
  if (changes.isNull()) {
    return;
  }
  VEXLO_CHECK(!changes.isObject(), ERR_BAD_PARAMETER, "Not an object" + AppendData(changes));
  for (auto change = changes.begin(); change != changes.end(); ++change) {
    const std::string name = change.name();
    if (change->isNull()) {
      target.removeMember(name.data(), name.data() + name.size(), nullptr);  // A NUL is part of it.
    } else if (change->isObject()) {
      Json::Value& member = target[name];
      if (!member.isObject()) {
        member = Json::objectValue;
      }
      JsonApplyChanges(member, *change);
    } else {
      target[name] = *change;
    }
  }
}

std::string AppendData(const Json::Value& value) { return ", data=" + JsonToStyledString(value); }

template <>
Json::Value Vec2JsonArr<std::string>(const std::vector<std::string>& values) {
  Json::Value array(Json::arrayValue);
  for (const std::string& value : values) {
    array.append(value);
  }
  return array;
}

template <>
std::vector<std::string> JsonArr2Vec<std::string>(const Json::Value& array) {
  VEXLO_CHECK(!array.isArray() && !array.isNull(), ERR_BAD_PARAMETER,
              "Not an array" + AppendData(array));
  std::vector<std::string> values;
  values.reserve(array.size());
  for (const Json::Value& element : array) {
    VEXLO_CHECK(!isJsonType<std::string>(element), ERR_BAD_PARAMETER,
                "Not a string" + AppendData(array));
    values.push_back(element.asString());
  }
  return values;
}

}  // namespace vexlo
