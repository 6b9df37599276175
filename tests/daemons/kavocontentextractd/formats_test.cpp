#include <fcntl.h>
#include <json/writer.h>

#include <cmath>

#include "common/json.h"
#include "daemons/kavocontentextractd/document.h"
#include "daemons/kavocontentextractd/extract.h"
#include "samples.h"
#include "support/raw_client.h"

namespace vexlo::extractd {
namespace {

Json::Value Extract(const std::string& name, const std::string& bytes) {
  static const Extractor extractor;
  const TempFolder folder;
  WriteText(folder / "file", bytes);
  const RawClient file(open((folder / "file").c_str(), O_RDONLY | O_CLOEXEC));
  return extractor.Extract(file.fd, name);
}

Json::Value Parsed(const std::string& json) {
  Json::Value value;
  EXPECT_TRUE(JsonFromString(value, json)) << json;
  return value;
}

TEST(Formats, FindsWhatStandsInFiles) {
  for (const Sample& sample : Samples()) {
    SCOPED_TRACE(sample.name);
    const Json::Value fields = Extract("file", sample.bytes);
    const Json::Value wanted = Parsed(sample.fields);
    for (auto member = wanted.begin(); member != wanted.end(); ++member) {
      const Json::Value& found = fields[member.name()];
      const bool is_close = member->isDouble() && found.isDouble() &&
                            std::abs(found.asDouble() - member->asDouble()) < 1e-6;
      EXPECT_TRUE(is_close || found == *member) << member.name() << ": " << found;
    }
  }
}

TEST(Formats, DecodesPlainTextInAnyEncoding) {
  const std::string mib(1 << 20, 'm');
  std::string wide = "\xFF\xFE";
  for (int i = 0; i < 1000; ++i) {
    wide += std::string("w\0", 2);
  }
  const struct {
    const char* name;
    std::string bytes;
    std::string text;
    bool is_truncated = false;
  } rows[] = {
      {"UTF-16LE", {"\xFF\xFE\x1F\x04 \0", 6}, "\xD0\x9F "},
      {"UTF-32LE", {"\xFF\xFE\0\0\x1F\x04\0\0", 8}, "\xD0\x9F"},
      {"UTF-16 of some length", wide, std::string(1000, 'w')},
      {"Latin-1", "Le gar\xE7on a mang\xE9 des cr\xEApes \xE0 la cr\xE8me, d\xE9j\xE0 vu",
       "Le gar\xC3\xA7on a mang\xC3\xA9 des cr\xC3\xAApes \xC3\xA0 la cr\xC3\xA8me, "
       "d\xC3\xA9j\xC3\xA0 vu"},
      {"Shift-JIS",
       "\x82\xB1\x82\xEA\x82\xCD\x93\xFA\x96\x7B\x8C\xEA\x82\xCC\x95\xB6\x8F\xCD\x82\xC5\x82\xB7"
       "\x81\x42\x8D\x60\x82\xCC\x8C\x76\x89\xE6\x82\xC9\x82\xC2\x82\xA2\x82\xC4",
       "\xE3\x81\x93\xE3\x82\x8C\xE3\x81\xAF\xE6\x97\xA5\xE6\x9C\xAC\xE8\xAA\x9E\xE3\x81\xAE"
       "\xE6\x96\x87\xE7\xAB\xA0\xE3\x81\xA7\xE3\x81\x99\xE3\x80\x82\xE6\xB8\xAF\xE3\x81\xAE"
       "\xE8\xA8\x88\xE7\x94\xBB\xE3\x81\xAB\xE3\x81\xA4\xE3\x81\x84\xE3\x81\xA6"},
      {"ISO-2022-JP", "\x1B$B4A;z\x1B(B \x1B$B4A;z\x1B(B",
       "\xE6\xBC\xA2\xE5\xAD\x97 \xE6\xBC\xA2\xE5\xAD\x97"},
      {"UHC",
       "\xC7\xD7\xB1\xB8\xC0\xC7 \xB0\xE8\xC8\xB9\xC0\xBA \xB4\xD9\xC0\xBD\xB0\xFA "
       "\xB0\xB0\xBD\xC0\xB4\xCF\xB4\xD9. \x8C\x63",
       "\xED\x95\xAD\xEA\xB5\xAC\xEC\x9D\x98 \xEA\xB3\x84\xED\x9A\x8D\xEC\x9D\x80 "
       "\xEB\x8B\xA4\xEC\x9D\x8C\xEA\xB3\xBC \xEA\xB0\x99\xEC\x8A\xB5\xEB\x8B\x88\xEB\x8B\xA4. "
       "\xEB\x98\xA0"},
      {"UTF-8 with a byte that is none", "gr\xC3\xBCn, \xC3\xA4 \xE9 \xC3\xBC",
       "gr\xC3\xBCn, \xC3\xA4 \xEF\xBF\xBD \xC3\xBC"},
      {"UTF-8 with escape sequences", "gr\xC3\xBCn\x1B(B\x1B[m x", "gr\xC3\xBCn (B [m x"},
      {"control characters", "a\x1B[1mb\x08", "a [1mb "},
      {"compressed", "\x1F\x8B\x08\x04\xFF\xFE", ""},
      {"NUL", {"te\0xt", 5}, ""},
      {"a character across the limit", mib.substr(1) + "\xC3\xAF", mib.substr(1), true},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    const Json::Value fields = Extract("file.txt", row.bytes);
    EXPECT_TRUE(fields["KAVOMDTextContent"].asString() == row.text)
        << fields["KAVOMDTextContent"].asString().substr(0, 200);
    EXPECT_EQ(fields["KAVOMDTextTruncated"].asBool(), row.is_truncated);
    EXPECT_EQ(fields["KAVOMDContentType"] == "text/plain", !row.text.empty());
  }
}

TEST(Formats, ReadsDates) {
  const struct {
    const char* text;
    int64_t seconds;  // -1 for no date.
  } rows[] = {
      {"2024-05-31T12:00:00Z", 1717156800},
      {"2024:05:31 12:00:00", 1717156800},
      {"2024-05-31T14:00:00.123+02:00", 1717156800},
      {"2024-05-31", 1717113600},
      {"2024-02-30", -1},
      {"2024-05-31T24:00", -1},
      {"0000:00:00 00:00:00", -1},
      {"", -1},
  };
  for (const auto& row : rows) {
    int64_t seconds = -1;
    EXPECT_EQ(ParseDate(row.text, seconds), row.seconds >= 0) << row.text;
    EXPECT_EQ(seconds, row.seconds) << row.text;
  }
}

}  // namespace
}  // namespace vexlo::extractd
