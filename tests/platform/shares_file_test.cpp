#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>

#include "kavo/local/shares.h"
#include "support/faults.h"
#include "support/temp_folder.h"

using kavo::local::Share;

FAULTABLE(int, fsync, (int fd), (fd))
FAULTABLE(int, rename, (const char* from, const char* to), (from, to))
FAULTABLE(ssize_t, read, (int fd, void* buffer, size_t size), (fd, buffer, size))
FAULTABLE(ssize_t, write, (int fd, const void* data, size_t size), (fd, data, size))

const std::set<std::string> kFiles = {"shares.json", "shares.json.lock"};

// "" when the deed succeeds.
template <typename Deed>
std::string ErrorOf(Deed deed) {
  try {
    deed();
    return "";
  } catch (const kavo::local::SharesError& error) {
    return error.what();
  }
}

// A share whose name and path are good, and then `more`, which is on line 3.
std::string With(const std::string& more) {
  return "{\"shares\": [\n{\"name\": \"photo\", \"path\": \"/volume1/photo\"" + more + "}]}";
}
std::string Named(const std::string& name, const std::string& path) {
  return "{\"shares\": [\n{\"name\": " + name + ",\n\"path\": " + path + "}]}";
}

TEST(ReadShares, SaysWhatIsWrongAndWhere) {
  struct BadFile {
    const char* name;
    std::string text;
    std::string want;  // Behind the file's path, up to where the message is the reader's own.
  };
  const std::string unlike =
      "\"path\" must be absolute, without \".\", \"..\", NUL and doubled or "
      "trailing slashes, unlike ";
  const std::string photo = "share \"photo\": ";
  const std::string long_name(255, 'n');
  const BadFile bad_files[] = {
      {"Empty", "", ":1: not JSON: "},
      {"CutShort", With("").substr(0, 50), ":2: not JSON: "},
      {"Bom", "\xEF\xBB\xBF{\"shares\": []}", ":1: not JSON: "},
      {"TrailingComma", With(",\n"), ":3: not JSON: "},
      {"Extra", "{\"shares\": []}\n{}", ":2: not JSON: "},
      {"DuplicateKey", With(",\n\"path\": \"/x\""), ":3: not JSON: Duplicate key: 'path'"},
      {"NestingBomb", "{\"shares\": " + std::string(1'000'000, '['), ": not JSON: nested too deep"},
      {"RootIsAList", "[]", ":1: the file must hold an object with the key \"shares\""},
      {"NoShares", "//\n{}", ":2: \"shares\" must be a list"},
      {"SharesIsNull", "{\n\"shares\": null}", ":2: \"shares\" must be a list"},
      {"OtherKey", "{\"shares\": [],\n\"share\": []}", ":2: unknown key \"share\""},
      {"ShareIsAText", "{\"shares\": [\n\"photo\"]}", ":2: share 1: must be an object"},
      {"NoName", "{\"shares\": [\n{\"path\": \"/x\"}]}", ":2: share 1: \"name\" is missing"},
      {"NoPath", "{\"shares\": [\n{\"name\": \"x\"}]}", ":2: share \"x\": \"path\" is missing"},
      {"NameIsANumber", Named("5", "\"/5\""), ":2: share 1: \"name\" must be a text"},
      {"NameEmpty", Named("\"\"", "\"/\""), ":2: share 1: \"name\" must have 1 to 255 bytes"},
      {"NameTooLong", Named('"' + long_name + "n\"", "\"/x\""), ":2: share 1: \"name\" must have"},
      {"NameWithSlash", Named("\"a/b\"", "\"/a/b\""), ":2: share 1: \"name\" must be a folder's"},
      {"NameDot", Named("\".\"", "\"/.\""), ":2: share 1: \"name\" must be a folder's name"},
      {"NameDotDot", Named("\"..\"", "\"/..\""), ":2: share 1: \"name\" must be a folder's name"},
      {"NameNul", Named(R"("a\u0000")", R"("/a\u0000")"),
       ":2: share 1: \"name\" must be a folder's"},
      {"PathNull", Named("\"a\"", "null"), ":3: share \"a\": \"path\" must be a text"},
      {"PathRelative", Named("\"a\"", "\"b/a\""), ":3: share \"a\": " + unlike + "\"b/a\""},
      {"PathEmpty", Named("\"a\"", "\"\""), ":3: share \"a\": " + unlike + "\"\""},
      {"PathDoubled", Named("\"a\"", "\"/b//a\""), ":3: share \"a\": " + unlike},
      {"PathTrailing", Named("\"a\"", "\"/b/a/\""), ":3: share \"a\": " + unlike},
      {"PathDot", Named("\"a\"", "\"/b/./a\""), ":3: share \"a\": " + unlike},
      {"PathDotDot", Named("\"a\"", "\"/b/../a\""), ":3: share \"a\": " + unlike},
      {"PathNul", Named("\"a\"", R"("/b\u0000/a")"),
       ":3: share \"a\": " + unlike + "\"/b\\x00/a\""},
      {"PathOther", Named("\"a\"", "\"/b/aa\""),
       ":3: share \"a\": \"path\" must end in the share's"},
      {"PathTooLong",
       Named("\"" + long_name.substr(17) + "\"", "\"/" + long_name.substr(17) + "\""),
       ":3: share \"" + long_name.substr(155) + "...\": \"path\" is too long: the name of the " +
           "share's queue file would have 241 bytes, and 240 are allowed"},
      {"AroundTheQueues", Named("\"kavo\"", "\"" + kavo::local::Root() + "/var/lib/kavo\""),
       ":3: share \"kavo\": \"path\" must lie apart from"},
      {"AmongTheQueues",
       Named("\"a\"", "\"" + kavo::local::Root() + "/var/lib/kavo/fileindex/db/a\""),
       ":3: share \"a\": \"path\" must lie apart from"},
      {"SameName", With("},\n{\"name\": \"photo\", \"path\": \"/volume2/photo\""),
       ":3: " + photo + "\"name\" is that of another share, too"},
      {"UnknownKey", With(",\n\"readonly\": true"), ":3: " + photo + "unknown key \"readonly\""},
      {"FlagIsANumber", With(",\n\"recycle\": 1"), ":3: " + photo + "\"recycle\" must be true or"},
      {"FlagIsNull", With(",\n\"read_only\": null"), ":3: " + photo + "\"read_only\" must be true"},
      {"FtpOver", With(",\n\"ftp_privilege\": 4294967296"),
       ":3: " + photo + "\"ftp_privilege\" must be a whole number from 0 to 4294967295"},
      {"FtpBelow", With(",\n\"ftp_privilege\": -1"), ":3: " + photo + "\"ftp_privilege\" must be"},
      {"FtpReal", With(",\n\"ftp_privilege\": 1.0"), ":3: " + photo + "\"ftp_privilege\" must be"},
  };
  const TempFolder folder;
  const std::string file = folder / "shares.json";
  for (const BadFile& row : bad_files) {
    WriteText(file, row.text);
    const std::string error = ErrorOf([&file] { kavo::local::ReadShares(file); });
    EXPECT_TRUE(error.starts_with(file + row.want)) << row.name << ": " << error;
  }
}

TEST(ReadShares, TellsMissingFromUnreadable) {
  const TempFolder folder;
  const std::string file = folder / "shares.json";
  EXPECT_TRUE(kavo::local::ReadShares(file).empty());
  const auto read = [](const std::string& path) {
    return ErrorOf([&path] { kavo::local::ReadShares(path); });
  };
  WriteText(file, With(""));
  EXPECT_EQ(read(file), "");
  EXPECT_EQ(read(folder.Path()), folder.Path() + ": cannot be read: Is a directory");
  EXPECT_EQ(read(file + "/x"), file + "/x: cannot be read: Not a directory");
  {
    const ScopedFault fault("read", EIO);
    EXPECT_EQ(read(file), file + ": cannot be read: Input/output error");
  }
  {
    const ScopedFault fault("read", EINTR);
    EXPECT_EQ(read(file), "");
  }
  ASSERT_EQ(truncate(file.c_str(), (64 << 20) + 1), 0);
  EXPECT_EQ(read(file), file + ": cannot be read: File too large");
}

TEST(EditShares, KeepsEveryByteAndSetting) {
  const TempFolder folder;
  const std::string file = folder / "etc/kavo/shares.json";
  const std::string bytes = "caf\xE9 \xFF\"\\\n\x7f%/ok";
  const std::string longest(237, 'n');  // With the slash as "%2F": 240.
  std::vector<Share> want = {
      {.name = "ok", .path = "/v/" + bytes, .encrypted = true, .recycle = true},
      {.name = bytes.substr(0, 11), .path = "/v/" + bytes.substr(0, 11), .encryption = true},
      {.name = longest, .path = "/" + longest, .read_only = true, .ftp_privilege = 4294967295},
      {.name = "inner", .path = "/v/" + bytes + "/inner", .hide_unreadable = true},
  };
  for (const Share& share : want) {
    kavo::local::AddShare(file, share);
  }
  EXPECT_EQ(kavo::local::ReadShares(file), want);
  // What a crash left, another mode and owner.
  WriteText(file + ".tmp", "half");
  ASSERT_EQ(chmod(file.c_str(), 0600), 0);
  const uid_t owner = geteuid() == 0 ? 60001 : geteuid();
  ASSERT_EQ(chown(file.c_str(), owner, static_cast<gid_t>(-1)), 0);
  kavo::local::RemoveShare(file, want[1].name);
  want.erase(want.begin() + 1);
  EXPECT_EQ(kavo::local::ReadShares(file), want);
  EXPECT_NE(access((file + ".tmp").c_str(), F_OK), 0);
  struct stat info {};
  ASSERT_EQ(stat(file.c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & ALLPERMS, 0644U);
  EXPECT_EQ(info.st_uid, owner);
}

TEST(EditShares, LeavesTheFileWhenItFails) {
  const TempFolder folder;
  const std::string file = folder / "shares.json";
  const Share music = {.name = "music", .path = "/volume1/music"};
  const auto add = [&file](const Share& share) {
    return ErrorOf([&] { kavo::local::AddShare(file, share); });
  };
  WriteText(file, With(""));
  struct FaultCase {
    const char* function;
    int error;
    std::string want;
  };
  for (const FaultCase& row :
       {FaultCase{"write", ENOSPC, file + ".tmp: write failed: No space left on device"},
        FaultCase{"fsync", EIO, file + ".tmp: fsync failed: Input/output error"},
        FaultCase{"rename", EROFS, file + ": rename failed: Read-only file system"}}) {
    const ScopedFault fault(row.function, row.error);
    EXPECT_EQ(add(music), row.want);
    EXPECT_EQ(ErrorOf([&file] { kavo::local::RemoveShare(file, "photo"); }), "") << row.function;
    EXPECT_EQ(kavo::local::ReadShares(file).size(), 0U);
    WriteText(file, With(""));
    EXPECT_EQ(folder.Names(), kFiles);
  }
  EXPECT_TRUE(add({.name = "photo", .path = "/volume2/photo"})
                  .ends_with("share \"photo\": \"name\" is that of another share, too"));
  EXPECT_TRUE(add({.name = "a/b", .path = "/volume2/a/b"}).starts_with(file + ":4: share 2: "));
  EXPECT_EQ(ErrorOf([&file] { kavo::local::RemoveShare(file, "musi\n"); }),
            file + ": share \"musi\\x0a\": there is no such share");
  EXPECT_EQ(ReadText(file), With(""));
  WriteText(file, "{");
  EXPECT_TRUE(add(music).starts_with(file + ":1: not JSON"));
  EXPECT_EQ(ReadText(file), "{");
  EXPECT_EQ(folder.Names(), kFiles);
  unlink(file.c_str());
  const ScopedFault fault("fsync", EIO, 2);
  EXPECT_TRUE(add(music).starts_with(file + ": the change is made but")) << "the folder's fsync";
  EXPECT_EQ(kavo::local::ReadShares(file), std::vector<Share>{music});
}

TEST(EditShares, EditorsAtOnceLoseNothing) {
  constexpr int kEditors = 8;
  constexpr int kShares = 6;
  const TempFolder folder;
  const std::string file = folder / "etc/shares.json";
  std::vector<pid_t> editors;
  for (int editor = 0; editor < kEditors; ++editor) {
    editors.push_back(fork());
    if (editors.back() == 0) {
      const std::string error = ErrorOf([&] {
        for (int i = 0; i <= kShares; ++i) {
          const std::string name = std::to_string(editor) + "-" + std::to_string(i);
          kavo::local::AddShare(file, {.name = name, .path = "/v/" + name});
        }
        kavo::local::RemoveShare(file, std::to_string(editor) + "-0");
      });
      _exit(error.empty() ? 0 : 1);
    }
  }
  for (const pid_t editor : editors) {
    int status = -1;
    ASSERT_EQ(waitpid(editor, &status, 0), editor);
    EXPECT_EQ(status, 0);
  }
  EXPECT_EQ(kavo::local::ReadShares(file).size(), size_t{kEditors * kShares});
}
