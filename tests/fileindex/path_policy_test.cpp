#include "fileindex/util/path_policy.h"

#include <gtest/gtest.h>

#include <functional>
#include <map>

#include "fileindex/caught.h"
#include "fileindex/util/share_path.h"
#include "kavo/filesystem.h"
#include "kavo/share.h"
#include "support/faults.h"
#include "support/private_mounts.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

using vexlo::fileindex::CanFullPathBeIndexed;
using vexlo::fileindex::CanPathBeIndexed;
using vexlo::fileindex::ExplainFullPath;
using vexlo::fileindex::GetFullPath;
using vexlo::fileindex::GetShareNameByPath;
using vexlo::fileindex::IsFullPathInRecycleBin;
using vexlo::fileindex::ReplacePathShare;
using vexlo::fileindex::RuleVerdict;

namespace {

const PrivateRoot kRoot;
std::map<std::string, int> answers;  // What a function returns instead of the platform's own.

}  // namespace

#define ANSWERED(name, parameters, arguments)                            \
  INTERPOSED int name parameters {                                       \
    static const auto real = REAL_FUNCTION(int, name, parameters);       \
    return answers.contains(#name) ? answers.at(#name) : real arguments; \
  }

ANSWERED(KAVOGetFSType, (const char* path, int flags), (path, flags))
ANSWERED(KAVOFSIsRemoteFS, (int type), (type))
ANSWERED(KLIBShareIsReadOnlyGet, (const KAVO_SHARE* share, int* value), (share, value))

namespace {

// A volume with a few shares in it.
class PathPolicy : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    const std::string volume = kRoot.MakeFolder("volume1");
    std::string shares;
    for (const auto& [share, flags] : {std::pair{"photo", ""},
                                       {"homes", ""},
                                       {"locked", R"(, "encrypted": true)"},
                                       {"vault", R"(, "encryption": true)"}}) {
      shares.append(shares.empty() ? "" : ",").append(R"({"name": ")").append(share);
      shares.append(R"(", "path": ")").append(kRoot.MakeFolder(std::string("volume1/") + share));
      shares.append("\"").append(flags).append("}");
    }
    kRoot.SetShares(shares);
    for (const char* folder :
         {"photo/a/.git", "photo/#snapshot/.snapshots/1", "photo/#recycle/old", "photo/x#recycle",
          "homes/ann/#recycle", "homes/#recycle", "photo/#recycle/.git", "photo/a/@eaDir",
          "photo/@eaDirs", "photo/mounted", "vault/open"}) {
      kRoot.MakeFolder(std::string("volume1/") + folder);
    }
    WriteText(volume + "/photo/Thumbs.db", "");
    WriteText(volume + "/photo/thumbs.db", "");
    std::filesystem::create_symlink("a", volume + "/photo/link");
    kRoot.MakeFolder("elsewhere");
  }

  void SetUp() override { answers.clear(); }

  static std::string Path(const std::string& name) { return kRoot / "volume1/" + name; }

  // The rule that decides, with a "?" behind it when it cannot tell; "" when the path passes. Both
  // ways of asking must agree.
  static std::string Decides(const std::string& path) {
    SyslogCapture log;
    std::string decides;
    for (const RuleVerdict& verdict : ExplainFullPath(path)) {
      EXPECT_FALSE(verdict.reason.empty()) << verdict.rule;
      if (decides.empty() && verdict.answer != RuleVerdict::kPasses) {
        decides = verdict.rule + std::string(verdict.answer == RuleVerdict::kCannotTell ? "?" : "");
      }
    }
    bool can_be_indexed = false;
    const std::string thrown = Caught([&] { can_be_indexed = CanFullPathBeIndexed(path); });
    EXPECT_EQ(decides.ends_with("?"), !thrown.empty()) << thrown;
    EXPECT_EQ(can_be_indexed, decides.empty());
    return decides;
  }
};

TEST_F(PathPolicy, TheFirstRuleThatRefusesDecides) {
  for (const auto& [name, want] : {
           std::pair{"photo/thumbs.db", ""},
           std::pair{"photo/#snapshot", ""},
           std::pair{"photo/x#recycle", ""},
           std::pair{"photo/@eaDirs", ""},
           std::pair{"photo/#snapshot/.snapshots/1", "snapshot"},
           std::pair{"photo/missing", "file_system"},
           // Two rules refuse each of these.
           std::pair{"photo/#snapshot/.snapshots/missing", "snapshot"},
           std::pair{"photo/#recycle/.git", "recycle_bin"},
           std::pair{"locked", "share"},
           std::pair{"photo/#recycle/old", "recycle_bin"},
           std::pair{"homes/ann/#recycle", "recycle_bin"},
           std::pair{"photo/Thumbs.db", "name"},
           std::pair{"photo/a/@eaDir", "name"},
           std::pair{"photo/link", "canonical"},
           std::pair{"photo//a", "canonical"},
           std::pair{"../elsewhere", "share?"},
       }) {
    EXPECT_EQ(Decides(Path(name)), want) << name;
  }
  SyslogCapture log;
  EXPECT_FALSE(CanPathBeIndexed("/photo/link"));
  EXPECT_TRUE(CanPathBeIndexed("/photo/a"));
  EXPECT_TRUE(IsFullPathInRecycleBin(Path("homes/ann/#recycle/x")));
  EXPECT_FALSE(IsFullPathInRecycleBin(Path("photo/ann/#recycle")));
  EXPECT_THROW(IsFullPathInRecycleBin(kRoot / "elsewhere"), vexlo::Error);
  EXPECT_THROW(CanPathBeIndexed("/films"), vexlo::Error);
}

TEST_F(PathPolicy, WhatThePlatformSaysIsReadAsTheRuleWants) {
  for (const auto& [function, result, want] : {
           std::tuple{"KAVOGetFSType", 12, "file_system"},
           std::tuple{"KAVOFSIsRemoteFS", 2, "file_system"},
           std::tuple{"KLIBShareIsReadOnlyGet", -1, "share?"},
       }) {
    answers = {{function, result}};
    EXPECT_EQ(Decides(Path("photo")), want) << function;
  }
}

TEST_F(PathPolicy, RealMountsAreJudgedByWhatTheyAre) {
  {
    const auto bind = ScopedMount::Bind(kRoot / "elsewhere", Path("photo/mounted"));
    SKIP_IF_REFUSED(bind);
    EXPECT_EQ(Decides(bind.Path()), "mount_point");
  }
  EXPECT_EQ(Decides(Path("photo/mounted")), "");
  {
    const auto bind = ScopedMount::Bind(kRoot / "elsewhere", Path("vault/open"));
    SKIP_IF_REFUSED(bind);
    EXPECT_EQ(Decides(bind.Path()), "");
  }
  {
    const auto tmpfs = ScopedMount::Tmpfs(Path("photo"), "", MS_RDONLY);
    SKIP_IF_REFUSED(tmpfs);
    EXPECT_EQ(Decides(tmpfs.Path()), "share");  // Read-only, whatever the shares file says.
  }
  const auto squashfs = ScopedMount::Image(
      "mksquashfs " + kRoot / "elsewhere" + " $IMAGE -quiet -no-progress -noappend",
      kRoot / "volume1/photo/mounted", "ro");
  SKIP_IF_REFUSED(squashfs);
  EXPECT_EQ(Decides(squashfs.Path()), "file_system");
}

TEST_F(PathPolicy, PathsBeginWithTheirShare) {
  struct Row {
    std::function<std::string()> ask;
    std::string want;  // The result, or the code and the reason of the error.
  };
  for (const Row& row : {
           Row{[] { return GetShareNameByPath("/photo/a/b"); }, "photo"},
           Row{[] { return GetShareNameByPath("//a"); }, ""},
           Row{[] { return GetShareNameByPath("photo/a"); }, "120 photo/a"},
           Row{[] { return GetShareNameByPath(""); }, "120 "},
           Row{[] { return GetFullPath("/photo/a"); }, Path("photo/a")},
           Row{[] { return GetFullPath("/photo"); }, Path("photo")},
           Row{[] { return GetFullPath("/films/a"); }, "800 films"},
           Row{[] { return ReplacePathShare("/music/music/x", "audio", "music"); },
               "/audio/music/x"},
           Row{[] { return ReplacePathShare("/v/music/x/", "audio", "music"); }, "/v/audio/x/"},
           Row{[] { return ReplacePathShare("/music2/Music/x", "audio", "music"); },
               "120 Cannot find share: music"},
       }) {
    const SyslogCapture quiet;
    std::string got;
    const std::string error = Caught([&] { got = row.ask(); });
    EXPECT_EQ(error.empty() ? got : error, row.want);
  }
}

}  // namespace
