#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>

#include "kavo/local/shares.h"
#include "support/faults.h"
#include "support/temp_folder.h"

using kavo::local::Share;

FAULTABLE(int, fsync, (int fd), (fd))
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
  const std::string a = ":3: share \"a\": \"path\" ";
  const std::string photo = ":3: share \"photo\": ";
  const std::string bad_name = ":2: share 1: \"name\" must be a folder's name: without";
  const std::string bad_path = a + "must be absolute, without";
  const std::string n238(238, 'n');
  const std::string queues = kavo::local::Root() + "/var/lib/kavo";
  const BadFile bad_files[] = {
      {"CutShort", With("").substr(0, 50), ":2: not JSON: "},
      {"Extra", "{\"shares\": []}\n{}", ":2: not JSON: "},
      {"DuplicateKey", With(",\n\"path\": \"/x\""), ":3: not JSON: Duplicate key: 'path'"},
      {"NestingBomb", "{\"shares\": " + std::string(1'000'000, '['), ": not JSON: nested too deep"},
      {"RootIsAList", "[]", ":1: the file must hold an object with the key \"shares\""},
      {"NoShares", "//\n{}", ":2: \"shares\" must be a list"},
      {"OtherKey", "{\"shares\": [],\n\"share\": []}", ":2: unknown key \"share\""},
      {"NoPath", "{\"shares\": [\n{\"name\": \"x\"}]}", ":2: share \"x\": \"path\" is missing"},
      {"NameIsANumber", Named("5", "\"/5\""), ":2: share 1: \"name\" must be a text"},
      {"NameEmpty", Named("\"\"", "\"/\""), ":2: share 1: \"name\" must have 1 to 255 bytes"},
      {"NameWithSlash", Named("\"a/b\"", "\"/a/b\""), bad_name},
      {"NameDotDot", Named("\"..\"", "\"/..\""), bad_name},
      {"NameNul", Named(R"("a\u0000")", R"("/a\u0000")"), bad_name},
      {"PathRelative", Named("\"a\"", "\"b/a\""), bad_path},
      {"PathDotDot", Named("\"a\"", "\"/b/../a\""), bad_path},
      {"PathOther", Named("\"a\"", "\"/b/aa\""), a + "must end in the share's name"},
      {"PathLong", Named("\"a\"", "\"/" + n238 + "/a\""), a + "is too long: the name of the share"},
      {"AroundQueues", Named("\"kavo\"", '"' + queues + '"'),
       ":3: share \"kavo\": \"path\" must lie"},
      {"AmongQueues", Named("\"a\"", '"' + queues + "/fileindex/db/a\""), a + "must lie apart"},
      {"SameName", With("},\n{\"name\": \"photo\", \"path\": \"/photo\""), photo + "\"name\" is"},
      {"UnknownKey", With(",\n\"readonly\": true"), photo + "unknown key \"readonly\""},
      {"FlagIsANumber", With(",\n\"recycle\": 1"), photo + "\"recycle\" must be true or false"},
      {"FtpOver", With(",\n\"ftp_privilege\": 4294967296"), photo + "\"ftp_privilege\" must"},
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
  const auto read = [](const std::string& path) {
    return ErrorOf([&path] { kavo::local::ReadShares(path); });
  };
  EXPECT_EQ(read(file), "");
  WriteText(file, With(""));
  EXPECT_EQ(read(folder.Path()), folder.Path() + ": cannot be read: Is a directory");
  EXPECT_EQ(read(file + "/x"), file + "/x: cannot be read: Not a directory");
  for (const auto& [error, want] :
       {std::pair{EIO, file + ": cannot be read: Input/output error"}, {EINTR, ""}}) {
    const ScopedFault fault("read", error);
    EXPECT_EQ(read(file), want);
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
  {
    const ScopedFault fault("write", ENOSPC);
    EXPECT_EQ(add(music), file + ".tmp: write failed: No space left on device");
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
  WriteText(file, "{\"shares\": []}");
  const ScopedFault fault("fsync", EIO, 2);
  EXPECT_TRUE(add(music).starts_with(file + ": the change is made but")) << "the folder's fsync";
  EXPECT_EQ(kavo::local::ReadShares(file), std::vector<Share>{music});
}

TEST(EditShares, EditorsAtOnceLoseNothing) {
  const TempFolder folder;
  const std::string file = folder / "etc/shares.json";
  for (char editor = 'a'; editor < 'i'; ++editor) {
    if (fork() == 0) {
      _exit(ErrorOf([&] {
              for (std::string name = {editor}; name.size() <= 6; name += editor) {
                kavo::local::AddShare(file, {.name = name, .path = "/v/" + name});
              }
              kavo::local::RemoveShare(file, {editor});
            }).empty()
                ? 0
                : 1);
    }
  }
  for (int status = 0; wait(&status) > 0;) {
    EXPECT_EQ(status, 0);
  }
  EXPECT_EQ(kavo::local::ReadShares(file).size(), 40U);
}
