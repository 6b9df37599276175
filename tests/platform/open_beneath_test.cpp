#include "platform/local/open_beneath.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <thread>

#include "kavo/content_extract.h"
#include "kavo/local/open.h"
#include "support/private_root.h"
#include "support/temp_folder.h"

namespace {

const PrivateRoot kRoot;

// What stands in the file, or the error.
std::string Outcome(int fd) {
  if (fd < 0) {
    return strerror(errno);
  }
  char text[64];
  const ssize_t count = read(fd, text, sizeof(text));
  close(fd);
  return std::string(text, count > 0 ? static_cast<size_t>(count) : 0);
}

TEST(OpenBeneath, FollowsNoLinkAtOnceOrStepwise) {
  const TempFolder folder;
  std::filesystem::create_directories(folder / "a/b");
  WriteText(folder / "a/b/file", "text");
  ASSERT_EQ(symlink("a", (folder / "link").c_str()), 0);
  ASSERT_EQ(symlink("file", (folder / "a/b/last").c_str()), 0);
  const int base = open(folder.Path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
  const struct {
    const char* name;
    std::string path;
    std::string outcome;
  } rows[] = {
      {"below", "a/b/file", "text"},
      {"absolute", folder / "a/b/file", "text"},
      {"over a link", "link/b/file", strerror(ELOOP)},
      {"absolute over a link", folder / "link/b/file", strerror(ELOOP)},
      {"a link", "a/b/last", strerror(ELOOP)},
      {"missing", "a/c/file", strerror(ENOENT)},
  };
  for (const auto& row : rows) {
    const int flags = O_RDONLY | O_NOFOLLOW | O_CLOEXEC;
    EXPECT_EQ(Outcome(kavo::local::OpenWithoutLinks(base, row.path, flags)), row.outcome)
        << row.name;
    EXPECT_EQ(Outcome(kavo::local::OpenStepwise(base, row.path, flags)), row.outcome) << row.name;
  }
  close(base);
}

TEST(OpenBeneath, LinksAreFollowedDownToTheShareOnly) {
  const std::string volume = kRoot.MakeFolder("volume");
  for (const char* const name : {"volume/docs/in", "secret", "volume/docs/inner/deep"}) {
    WriteText(kRoot.MakeFolder(name) + "/file", name);
  }
  ASSERT_EQ(symlink("volume", (kRoot / "v").c_str()), 0);
  ASSERT_EQ(symlink((kRoot / "secret").c_str(), (volume + "/docs/out").c_str()), 0);
  ASSERT_EQ(symlink("in/file", (volume + "/docs/last").c_str()), 0);
  std::filesystem::rename(volume + "/docs/inner", volume + "/docs/gone");
  ASSERT_EQ(symlink((kRoot / "secret").c_str(), (volume + "/docs/inner").c_str()), 0);
  kRoot.SetShares(R"({"name":"docs","path":")" + kRoot / "v/docs" + R"("},)" +
                  R"({"name":"inner","path":")" + kRoot / "v/docs/inner" + "\"}");
  const struct {
    const char* name;
    std::string path;
    int flags;
    std::string outcome;
  } rows[] = {
      {"the share's way", kRoot / "v/docs/in/file", O_RDONLY, "volume/docs/in"},
      {"a link in the share", kRoot / "v/docs/out/file", O_RDONLY, strerror(ELOOP)},
      {"its attributes", kRoot / "v/docs/out/file", O_PATH, strerror(ENOTDIR)},
      {"a share in the share", kRoot / "v/docs/inner/file", O_RDONLY, strerror(ELOOP)},
      {"the link itself", kRoot / "v/docs/last", O_PATH, ""},
      {"of no share", kRoot / "v/docs", O_PATH, ""},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(Outcome(kavo::local::OpenInShare(row.path, row.flags)), row.outcome) << row.name;
  }
}

TEST(OpenBeneath, NothingIsReadBehindAFolderThatIsSwappedForALink) {
  const std::string share = kRoot.MakeFolder("files");
  kRoot.SetShares(R"({"name":"files","path":")" + share + "\"}");
  WriteText(kRoot.MakeFolder("files/in") + "/note.txt", "mine");
  WriteText(kRoot.MakeFolder("secret") + "/note.txt", "secret of others");
  std::atomic<bool> is_done = false;
  std::thread swapper([&] {
    const std::string in = share + "/in";
    const std::string aside = share + "/aside";
    while (!is_done) {
      rename(in.c_str(), aside.c_str());
      EXPECT_EQ(symlink((kRoot / "secret").c_str(), in.c_str()), 0);
      unlink(in.c_str());
      rename(aside.c_str(), in.c_str());
    }
  });
  Json::Value options;
  options["need_meta"] = true;
  int read = 0;
  int refused = 0;
  for (int i = 0; i < 200000 && (i < 3000 || read == 0 || refused == 0); ++i) {
    Json::Value fields;
    try {
      KAVO::CONTENT_EXTRACT::ParseFile(share + "/in/note.txt", options, fields);
      const std::string text = fields["KAVOMDTextContent"].asString();
      EXPECT_TRUE(text.empty() || text == "mine") << text;
      EXPECT_EQ(fields["KAVOMDFSSize"].asInt(), 4);
      read += text.empty() ? 0 : 1;
    } catch (const std::exception&) {
      ++refused;
    }
  }
  is_done = true;
  swapper.join();
  EXPECT_GT(read, 0);
  EXPECT_GT(refused, 0);
}

}  // namespace
