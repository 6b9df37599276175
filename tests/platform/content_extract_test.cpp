#include "kavo/content_extract.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <json/writer.h>  // Prints values where they differ.
#include <sys/stat.h>

#include "support/temp_folder.h"

namespace {

Json::Value Extract(const std::string& path, bool need_meta = true) {
  Json::Value options;
  options["need_meta"] = need_meta;
  Json::Value metadata = "stale";
  KAVO::CONTENT_EXTRACT::ParseFile(path, options, metadata);
  return metadata;
}

struct Text {
  const char* name;
  std::string content;
  std::string text;
};

TEST(ContentExtract, TakesTextFromPlainTextFiles) {
  const TempFolder folder;
  const std::string kibs(64 * 1024, 'k');
  std::string mib(1 << 20, 'm');
  const Text rows[] = {
      {"empty", "", ""},
      {"UTF-8", "na\xC3\xAFve \xE2\x82\xAC \xF0\x9F\x98\x80\n",
       "na\xC3\xAFve \xE2\x82\xAC \xF0\x9F\x98\x80\n"},
      {"byte-order mark", "\xEF\xBB\xBFtext", "text"},
      {"Latin-1", "na\xEFve", "na\xC3\xAFve"},
      {"cut off at the end of the file", "x\xC3", "x\xC3\x83"},
      {"surrogate", "\xED\xA0\x80", "\xC3\xAD\xC2\xA0\xC2\x80"},
      {"over-long", "\xC0\xAF\xE0\x80\x80", "\xC3\x80\xC2\xAF\xC3\xA0\xC2\x80\xC2\x80"},
      {"over U+10FFFF", "\xF4\x90\x80\x80", "\xC3\xB4\xC2\x90\xC2\x80\xC2\x80"},
      {"compressed", "\x1F\x8B\x08\x04\xFF\xFE", ""},
      {"NUL at the end of the probe", kibs.substr(1) + '\0', ""},
      {"NUL behind the probe", kibs + '\0' + "\xFF", kibs},
      {"at the limit", mib, mib},
      {"over the limit", mib + "more", mib},
      {"a character across the limit", mib.substr(1) + "\xC3\xAF", mib.substr(1)},
  };
  for (const Text& row : rows) {
    WriteText(folder / "file", row.content);
    const Json::Value metadata = Extract(folder / "file");
    EXPECT_TRUE(metadata["KAVOMDTextContent"].asString() == row.text) << row.name;
    EXPECT_EQ(metadata.isMember("KAVOMDTextContent"), !row.text.empty()) << row.name;
    EXPECT_EQ(metadata["KAVOMDFSSize"].asUInt64(), row.content.size()) << row.name;
    EXPECT_FALSE(Extract(folder / "file", false).isMember("KAVOMDTextContent")) << row.name;
  }
}

TEST(ContentExtract, TellsWhatTheFileSystemKnows) {
  const TempFolder folder;
  const std::string file = folder / "A.tar.G\xC9Z";
  WriteText(file, "text");
  const struct timespec times[] = {{1000000001, 999999999}, {-5, 0}};
  ASSERT_TRUE(chmod(file.c_str(), 0640) == 0 && utimensat(AT_FDCWD, file.c_str(), times, 0) == 0);
  for (const bool need_meta : {true, false}) {  // The first must not count as a use of the file.
    Json::Value metadata = Extract(file, need_meta);
    for (const char* const date : {"KAVOMDAttributeChangeDate", "KAVOMDFSCreationDate"}) {
      EXPECT_TRUE(!metadata.isMember(date) || metadata[date].asInt64() > 1000000001) << date;
      metadata.removeMember(date);
    }
    metadata.removeMember("KAVOMDTextContent");
    Json::Value want;
    want["KAVOMDPath"] = file;
    want["KAVOMDFSName"] = want["KAVOMDDisplayName"] = "A.tar.G\xC9Z";
    want["KAVOMDParent"] = folder.Path();
    want["KAVOMDExtension"] = want["KAVOMDKind"] = "g\xC9z";
    want["KAVOMDIsDir"] = want["KAVOMDIsEncrypted"] = false;
    want["KAVOMDFSSize"] = Json::UInt64{4};
    want["KAVOMDFSContentChangeDate"] = want["KAVOMDContentModificationDate"] = Json::Int64{-5};
    want["KAVOMDLastUsedDate"] = Json::Int64{1000000001};
    want["KAVOMDOwnerUserID"] = std::to_string(geteuid());
    want["KAVOMDOwnerGroupID"] = std::to_string(getegid());
    want["KAVOMDPrivilege"] = "0640";
    EXPECT_EQ(metadata, want);
  }
}

TEST(ContentExtract, OpensNothingButFilesAndFollowsNoLink) {
  const TempFolder folder;
  WriteText(folder / "target", "text");
  ASSERT_EQ(mkfifo((folder / "fifo").c_str(), 0600), 0);
  ASSERT_EQ(symlink("target", (folder / "link").c_str()), 0);
  ASSERT_EQ(symlink("nowhere", (folder / "dangling").c_str()), 0);
  for (const char* const name : {"fifo", "link", "dangling"}) {
    const Json::Value metadata = Extract(folder / name);
    EXPECT_EQ(metadata["KAVOMDFSName"], name);
    EXPECT_FALSE(metadata.isMember("KAVOMDTextContent")) << name;
    EXPECT_FALSE(metadata["KAVOMDIsDir"].asBool()) << name;
  }
  EXPECT_TRUE(Extract(folder.Path())["KAVOMDIsDir"].asBool());
  EXPECT_ANY_THROW(Extract(folder / "missing"));
  EXPECT_ANY_THROW(Extract(folder / "target/below"));
}

}  // namespace
