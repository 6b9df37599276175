#include "common/json.h"

#include <gtest/gtest.h>

#include <array>

#include "common/error.h"
#include "support/syslog_capture.h"

namespace vexlo {

using std::string_literals::operator""s;

Json::Value Parse(const std::string& text) {
  Json::Value value;
  EXPECT_TRUE(JsonFromString(value, text)) << text;
  return value;
}

// The reading of `object["k"]` as T, as text; the reason when it is refused.
template <typename T>
std::string Read(const Json::Value& object) {
  T optional{};
  T out{};
  try {
    GetJsonValue(optional, object, "k", /*required=*/false);
    GetJsonValue(out, object, "k", /*required=*/true);
    EXPECT_EQ(out, optional);
    return testing::PrintToString(out);
  } catch (const Error& error) {
    EXPECT_EQ(optional, T{}) << "an optional value of another type changes nothing";
    const std::string reason = error.what();
    return reason.substr(0, reason.find(AppendData(object)));
  }
}

TEST(Json, ValuesAreReadWithTheseConversions) {
  const SyslogCapture quiet;
  const std::string no = "Not a string";
  const std::vector<std::array<std::string, 6>> rows = {
      // Value, string, bool, int, unsigned, long.
      {"null", R"("")", "false", "0", "0", no},
      {"3.7", R"("3.7000000000000002")", "true", "3", "3", no},
      {"2147483648", R"("2147483648")", "true", no, "2147483648", "2147483648"},
      {"9223372036854775808", R"("9223372036854775808")", "true", no, no, no},
      {R"("5")", R"("5")", no, no, no, no},
      {"[]", no, no, no, no, no},
  };
  for (const auto& row : rows) {
    const Json::Value object = Parse("{\"k\":" + row[0] + "}");
    EXPECT_EQ((std::array{row[0], Read<std::string>(object), Read<bool>(object), Read<int>(object),
                          Read<unsigned int>(object), Read<long>(object)}),
              row);
  }
  EXPECT_EQ(Read<double>(Parse(R"({"k":3.5})")), "3.5");
  EXPECT_EQ(Read<Json::Value>(Parse("{}")), "Missing property: k");
  EXPECT_EQ(Read<int>(Parse("[]")), "Not an object");
  EXPECT_EQ(JsonArr2Vec<std::string>(Parse(R"(["b",5])")), (std::vector<std::string>{"b", "5"}));
  EXPECT_THROW(JsonArr2Vec<std::string>(Parse(R"(["a",[]])")), Error);
}

TEST(Json, TextsAreReadStrictly) {
  const auto nested = [](size_t n) { return std::string(n, '[') + std::string(n, ']'); };
  Json::Value value;
  for (const std::string& text :
       {" \t\r\n{\"a\":[1,2.5,null,true]} \n"s, "5"s, "{}// said"s, "{}\0"s, nested(1000)}) {
    EXPECT_TRUE(JsonFromString(value, text)) << text;
  }
  for (const std::string& text :
       {""s, "{}{}"s, "[1,]"s, "\xEF\xBB\xBF{}"s, "{'a':1}"s, "{\"a\":1"s, "NaN"s, nested(1001)}) {
    EXPECT_FALSE(JsonFromString(value, text)) << text;
  }
}

TEST(Json, ChangesAreMerged) {
  const SyslogCapture quiet;
  const std::vector<std::array<std::string, 3>> rows = {
      // Target, changes, what comes of it ("" for an error).
      {R"({"a":1,"b":{"d":2}})", R"({"a":null,"b":{"c":1}})", R"({"b":{"c":1,"d":2}})"},
      {R"({"a":1})", R"({"a":{"x":{"y":null}}})", R"({"a":{"x":{}}})"},
      {"null", R"({"a":1})", R"({"a":1})"},
      {R"({"k":1,"k\u0000x":2})", R"({"k\u0000x":null})", R"({"k":1})"},
      {R"({"a":1})", "[1]", ""},
      {"[1]", "{}", ""},
  };
  for (const auto& [target, changes, want] : rows) {
    Json::Value value = Parse(target);
    try {
      JsonApplyChanges(value, Parse(changes));
      EXPECT_EQ(JsonToString(value), want);
    } catch (const Error& error) {
      EXPECT_EQ(want, "") << error.what();
      EXPECT_EQ(value, Parse(target));
    }
  }
}

TEST(Json, StyledTextHasEachValueBehindItsName) {
  EXPECT_EQ(JsonToStyledString(Parse(R"({"a":[1,"x"],"b":{"c":[{"d":" : "}],"e":{}}})")),
            "{\n   \"a\" : [ 1, \"x\" ],\n   \"b\" : {\n      \"c\" : [\n         {\n"
            "            \"d\" : \" : \"\n         }\n      ],\n      \"e\" : {}\n   }\n}\n");
}

}  // namespace vexlo
