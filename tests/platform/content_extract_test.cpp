#include "kavo/content_extract.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <json/writer.h>  // Prints values where they differ.
#include <sys/stat.h>

#include "support/private_root.h"
#include "support/temp_folder.h"

namespace {

const PrivateRoot kRoot;

Json::Value Extract(const std::string& path, bool need_meta = true) {
  Json::Value options;
  options["need_meta"] = need_meta;
  Json::Value metadata = "stale";
  KAVO::CONTENT_EXTRACT::ParseFile(path, options, metadata);
  return metadata;
}

struct Text {
  const char* name;
  const char* file;
  std::string content;
  std::string text;   // "" for none.
  std::string error;  // How it begins; "" for none.
};

TEST(ContentExtract, TakesTextFromPlainTextFilesAndElseAsksTheDaemon) {
  const TempFolder folder;
  std::string mib(1 << 20, 'm');
  const std::string nobody = "unavailable: kavocontentextractd does not run";
  const std::string utf8 = "na\xC3\xAFve \xE2\x82\xAC \xF0\x9F\x98\x80\n";
  const Text rows[] = {
      {"UTF-8", "a.txt", utf8, utf8, ""},
      {"extension in capitals", "a.MD", utf8, utf8, ""},
      {"last extension of the table", "a.zsh", utf8, utf8, ""},
      {"no extension of a text", "a.html", utf8, "", nobody},
      {"byte-order mark", "a.txt", "\xEF\xBB\xBFtext", "text", ""},
      {"Latin-1", "a.txt", "na\xEFve", "", nobody},
      {"cut off at the end of the file", "a.txt", "x\xC3", "", nobody},
      {"surrogate", "a.txt", "\xED\xA0\x80", "", nobody},
      {"over-long", "a.txt", "\xC0\xAF\xE0\x80\x80", "", nobody},
      {"ISO-2022-JP", "a.txt", "\x1B$B8l\x1B(B", "", nobody},
      {"NUL", "a.txt", std::string("a\0b", 3), "", nobody},
      {"at the limit", "a.txt", mib, mib, ""},
      {"over the limit", "a.txt", mib + "m", "", nobody},
  };
  for (const Text& row : rows) {
    const std::string path = folder / row.file;
    WriteText(path, row.content);
    const Json::Value metadata = Extract(path);
    EXPECT_TRUE(metadata["KAVOMDTextContent"].asString() == row.text) << row.name;
    EXPECT_EQ(metadata.isMember("KAVOMDTextContent"), !row.text.empty()) << row.name;
    EXPECT_TRUE(metadata["KAVOMDContentError"].asString().starts_with(row.error)) << row.name;
    EXPECT_EQ(metadata.isMember("KAVOMDContentError"), !row.error.empty()) << row.name;
    EXPECT_EQ(metadata["KAVOMDFSSize"].asUInt64(), row.content.size()) << row.name;
    const Json::Value attributes = Extract(path, false);
    EXPECT_FALSE(attributes.isMember("KAVOMDTextContent")) << row.name;
    EXPECT_FALSE(attributes.isMember("KAVOMDContentError")) << row.name;
  }
}

TEST(ContentExtract, TellsWhatTheFileSystemKnows) {
  const TempFolder folder;
  const std::string file = folder / "A.\xC9.TXT";
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
    metadata.removeMember("KAVOMDContentType");
    Json::Value want;
    want["KAVOMDPath"] = file;
    want["KAVOMDFSName"] = want["KAVOMDDisplayName"] = "A.\xC9.TXT";
    want["KAVOMDParent"] = folder.Path();
    want["KAVOMDExtension"] = want["KAVOMDKind"] = "txt";
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
