#include "common/string.h"

#include <gtest/gtest.h>

#include <array>
#include <vector>

namespace vexlo {

TEST(String, EveryHelperAtTheEdges) {
  const std::vector<std::array<std::string, 4>> paths = {
      // Path, base name, folder, extension.
      {"/a/b", "b", "/a", ""},
      {"/a/b/", "", "/a/b", ""},
      {"abc", "abc", "abc", ""},
      {"", "", "", ""},
      {"/dir.d/file", "file", "/dir.d", ""},
      {"/s/a.tar.GZ", "a.tar.GZ", "/s", "GZ"},
      {"/s/.profile", ".profile", "/s", "profile"},
      {"/s/name.", "name.", "/s", ""},
      {"/s/a.\xC3\xE9Z", "a.\xC3\xE9Z", "/s", "\xC3\xE9Z"},
  };
  for (const auto& [path, base, dir, extension] : paths) {
    EXPECT_EQ(Basename(path) + "|" + fileindex::Basename(path), base + "|" + base) << path;
    EXPECT_EQ(Dirname(path) + "|" + fileindex::Dirname(path), dir + "|" + dir) << path;
    EXPECT_EQ(GetFileExtension(path, /*lower=*/false), extension) << path;
    EXPECT_EQ(GetFileExtension(path, /*lower=*/true), ToLower(extension)) << path;
    EXPECT_TRUE(StringStartWith(path + "x", path) && fileindex::StringStartWith(path, "")) << path;
    EXPECT_FALSE(StringStartWith("x" + path, path + "/")) << path;
  }
  for (int c = 0; c < 256; ++c) {
    const char lower = static_cast<char>(c >= 'A' && c <= 'Z' ? c + 32 : c);
    EXPECT_EQ(ToLower({static_cast<char>(c)}), std::string{lower});
    const std::string kept(c == ' ' || (c >= '\t' && c <= '\r') ? 0 : 1, static_cast<char>(c));
    const std::string text = {static_cast<char>(c), 'a', ' ', 'b', static_cast<char>(c)};
    EXPECT_EQ(LTrim(text) + RTrim(text), kept + text.substr(1) + text.substr(0, 4) + kept) << c;
    EXPECT_EQ(Trim(text), kept + "a b" + kept) << c;
  }
  EXPECT_EQ(Trim(" \n ") + LTrim("\t") + RTrim("") + LTrim(""), "");
}

}  // namespace vexlo
