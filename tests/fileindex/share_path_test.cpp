#include "fileindex/util/share_path.h"

#include <gtest/gtest.h>

#include <functional>

#include "common/error.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

using vexlo::fileindex::GetFullPath;
using vexlo::fileindex::GetShareNameByPath;
using vexlo::fileindex::GetShareNamePathByFullPath;
using vexlo::fileindex::ReplacePathShare;

namespace {

const PrivateRoot kRoot;

std::string ShareOf(const std::string& full_path) {
  std::string name;
  std::string folder;
  GetShareNamePathByFullPath(name, folder, full_path);
  return name + " in " + folder;
}

struct Row {
  std::function<std::string()> ask;
  std::string want;         // The result, or the reason of the error.
  int code = 0;             // 0 for none.
  const char* logged = "";  // "(function) Failed [condition]"
};

const Row kRows[] = {
    {[] { return GetShareNameByPath("/music/a/b"); }, "music"},
    {[] { return GetShareNameByPath("/music"); }, "music"},
    {[] { return GetShareNameByPath("/"); }, ""},
    {[] { return GetShareNameByPath("//a"); }, ""},
    {[] { return GetShareNameByPath("music/a"); }, "music/a", 120,
     "(GetShareNameByPath) Failed [1 > share_path.size() || '/' != share_path.at(0)]"},
    {[] { return GetShareNameByPath(""); }, "", 120, "(GetShareNameByPath)"},
    {[] { return GetFullPath("/music/a"); }, "/volume2/music/a"},
    {[] { return GetFullPath("/music"); }, "/volume2/music"},
    {[] { return GetFullPath("/photo/a"); }, "/photo/a"},
    {[] { return GetFullPath("/"); }, "", 800, "(SDKShare)"},
    {[] { return GetFullPath("/films/a"); }, "films", 800, "(SDKShare)"},
    {[] { return ShareOf("/volume2/music/live/2019"); }, "music in /volume2/music"},
    {[] { return ShareOf("/volume2/music2"); },
     "KAVOShareNamePathGet failed, full_path=/volume2/music2", 502,
     "(GetShareNamePathByFullPath) Failed [0 > KAVOShareNamePathGet(full_path.c_str(), "
     "szShareName, sizeof(szShareName), szSharePath, sizeof(szSharePath))]"},
    {[] { return ReplacePathShare("/music", "audio", "music"); }, "/audio"},
    {[] { return ReplacePathShare("/music/music/x", "audio", "music"); }, "/audio/music/x"},
    {[] { return ReplacePathShare("/volume2/music/x/", "audio", "music"); }, "/volume2/audio/x/"},
    {[] { return ReplacePathShare("/music2/Music/x", "audio", "music"); },
     "Cannot find share: music", 120, "(ReplacePathShare) Failed [string::npos == pos]"},
    {[] { return ReplacePathShare("music/x", "audio", "music"); }, "Cannot find share: music", 120,
     "(ReplacePathShare)"},
};

TEST(SharePath, Answers) {
  kRoot.SetShares(R"({"name": "music", "path": "/volume2/music"},
                    {"name": "photo", "path": "/photo"})");
  for (size_t i = 0; i < std::size(kRows); ++i) {
    SCOPED_TRACE(i);
    const Row& row = kRows[i];
    SyslogCapture log;
    try {
      EXPECT_EQ(row.ask(), row.want);
      EXPECT_EQ(row.code, 0);
    } catch (const vexlo::Error& error) {
      EXPECT_EQ(error.GetErrorCode(), row.code);
      EXPECT_EQ(error.what(), row.want);
      const std::string line = log.Take().at(0);
      EXPECT_TRUE(line.starts_with(row.code == 800 ? "<3>share:" : "<3>util:")) << line;
      EXPECT_NE(line.find(row.logged), std::string::npos) << line;
    }
  }
}

}  // namespace
