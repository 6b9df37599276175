// Searching for somebody: what is found is what the kernel lets that user read.
#include "daemons/kavoelasticd/judge.h"

#include <acl/libacl.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <random>
#include <set>

#include "daemons/kavoelasticd/engine_fixture.h"
#include "support/as_user.h"

namespace vexlo::elasticd {
namespace {

// Users have a group of their own number, and are in the two behind it.
constexpr uid_t kFirstUser = 4700;
constexpr unsigned kUsers = 4;

daemon::Peer User(uid_t uid) { return {uid, uid, {uid + 1, uid + 2}}; }

class JudgeTest : public testing::Test {
 protected:
  void SetUp() override {
    if (!judge_.IsThere()) {
      GTEST_SKIP() << "only root can judge for others";
    }
    ASSERT_EQ(chmod(tree_.Path().c_str(), 0755), 0);
  }

  // A file or folder with a document that has the word "common", and a text of its own. Each is
  // smaller and older than the ones before.
  void Index(const std::string& path) {
    struct stat info {};
    ASSERT_EQ(lstat(path.c_str(), &info), 0);
    const int64_t changed =
        static_cast<int64_t>(info.st_ctim.tv_sec) * 1000000000 + info.st_ctim.tv_nsec;
    ASSERT_EQ(
        engine_.Add(path, R"({"Free":"common text of )" + path + R"(","FileIndexStamp":{"ctime":)" +
                              std::to_string(changed) +
                              "},\"KAVOMDFSSize\":" + std::to_string(rank_) +
                              ",\"KAVOMDFSContentChangeDate\":" + std::to_string(rank_) + "}"),
        "ok");
    --rank_;
  }
  Json::Value SearchAs(const daemon::Peer& peer, const std::string& data) {
    engine_.Do("commit");
    Json::Value request;
    request["command"] = "search";
    request["data"] = Parsed(data);
    return engine_.SearchFor(
        request, [&](const std::vector<std::string>& paths) { return judge_.Ask(peer, paths); });
  }

  Judge judge_;  // Before anything starts threads.
  const TempFolder tree_;
  EngineFixture engine_;
  int rank_ = 40;
};

// The paths that a process of the user can open for reading.
std::set<std::string> Readable(uid_t uid, const std::vector<std::string>& paths) {
  const std::string heard = HearAs(uid, [&] {
    std::string answers;
    for (const std::string& path : paths) {
      answers += access(path.c_str(), R_OK) == 0 ? '1' : '0';
    }
    return answers;
  });
  EXPECT_EQ(heard.size(), paths.size());
  std::set<std::string> readable;
  for (size_t i = 0; i < heard.size(); ++i) {
    if (heard[i] == '1') {
      readable.insert(paths[i]);
    }
  }
  return readable;
}

using Random = std::mt19937;

unsigned Pick(Random& random, unsigned count) { return static_cast<unsigned>(random() % count); }

// An owner, a mode, and now and then an access control list.
void SetRights(Random& random, const std::string& path) {
  const bool is_folder = std::filesystem::is_directory(path);
  ASSERT_EQ(
      chown(path.c_str(), kFirstUser + Pick(random, kUsers), kFirstUser + Pick(random, kUsers + 2)),
      0);
  const mode_t modes[] = {0777, 0755, 0750, 0700, 0711, 0070, 0007, 0705, 0440, 0404};
  const mode_t mode = modes[Pick(random, is_folder ? 8 : 10)];
  ASSERT_EQ(chmod(path.c_str(), mode), 0);
  if (Pick(random, 3) == 0) {
    const char* const rights[] = {"---", "r--", "r-x", "--x", "rwx"};
    const std::string text =
        "u::rwx,g::" + std::string(rights[Pick(random, 5)]) + ",o::" + rights[Pick(random, 5)] +
        ",u:" + std::to_string(kFirstUser + Pick(random, kUsers)) + ":" + rights[Pick(random, 5)] +
        ",g:" + std::to_string(kFirstUser + Pick(random, kUsers + 2)) + ":" +
        rights[Pick(random, 5)] + ",m::" + rights[Pick(random, 5)];
    acl_t list = acl_from_text(text.c_str());
    ASSERT_NE(list, nullptr) << text;
    // File systems without lists have modes alone.
    EXPECT_TRUE(acl_set_file(path.c_str(), ACL_TYPE_ACCESS, list) == 0 || errno == ENOTSUP) << text;
    acl_free(list);
  }
}

TEST_F(JudgeTest, FindsWhatTheUserCanRead) {
  for (unsigned seed = 0; seed < 12; ++seed) {
    Random random(seed);
    const std::string top = tree_ / ("tree" + std::to_string(seed));
    std::filesystem::create_directory(top);
    std::vector<std::string> folders = {top};
    std::vector<std::string> paths;
    for (int i = 0; i < 60; ++i) {
      const std::string& folder = folders[Pick(random, static_cast<unsigned>(folders.size()))];
      const std::string path = folder + "/n" + std::to_string(i);
      if (Pick(random, 3) == 0) {
        std::filesystem::create_directory(path);
        folders.push_back(path);
      } else {
        WriteText(path, "");
      }
      paths.push_back(path);
    }
    for (const std::string& path : paths) {
      SetRights(random, path);
      Index(path);
    }
    for (uid_t uid = kFirstUser; uid <= kFirstUser + kUsers; ++uid) {
      const daemon::Peer peer = User(uid);
      const std::set<std::string> wanted = Readable(uid, paths);
      const std::string below = R"("below":")" + top + "\"";
      for (const std::string& data :
           {R"({"words":"common","size":1000,)" + below + "}", R"({"size":1000,)" + below + "}"}) {
        const Json::Value reply = SearchAs(peer, data);
        std::set<std::string> found;
        for (const Json::Value& hit : reply["data"]) {
          found.insert(hit["path"].asString());
        }
        EXPECT_EQ(found, wanted) << "seed " << seed << ", user " << peer.uid << ", " << data;
        EXPECT_EQ(reply["total"].asUInt64(), wanted.size()) << "seed " << seed;
      }
      // Two pages are what one page of both is.
      const std::string sorted = R"({"words":"common","sort":"path",)" + below;
      Json::Value pages = SearchAs(peer, sorted + R"(,"size":3})")["data"];
      const Json::Value second = SearchAs(peer, sorted + R"(,"from":3,"size":4})")["data"];
      for (const Json::Value& hit : second) {
        pages.append(hit);
      }
      EXPECT_EQ(pages, SearchAs(peer, sorted + R"(,"size":7})")["data"]) << "seed " << seed;
    }
  }
}

TEST_F(JudgeTest, TellsNothingOfAFileThatStoodThereBefore) {
  const daemon::Peer peer = User(kFirstUser);
  const std::string path = tree_ / "tiger note";
  WriteText(path, "");
  Index(path);
  WriteText(tree_ / "zebra", "");
  Index(tree_ / "zebra");
  const std::string data = R"({"words":"common","snippet":true,"load_field":["Free"]})";
  const Json::Value own = SearchAs(peer, data)["data"][0];
  EXPECT_NE(own["snippet"].asString(), "");
  EXPECT_NE(own["Free"].asString(), "");
  EXPECT_FALSE(own.isMember("score")) << "it depends on files of others";
  // Somebody's file under the name of another's, which is in the index still.
  WriteText(tree_ / "other", "");
  std::filesystem::rename(tree_ / "other", path);
  const struct {
    const char* data;
    bool is_found;
  } rows[] = {
      {R"({"words":"common"})", false},
      {R"({"words":"tiger text"})", false},
      {R"({"words":"\"text of\""})", false},
      {R"({"words":"comm*"})", false},
      {R"({"words":"40","size":5})", false},
      {R"({"name":"tiger","size_min":40})", false},
      {R"({"name":"tiger","modified_max":50})", false},
      {R"({"words":"tiger not*"})", true},
      {R"({"words":"\"tiger note\"","name":"note","snippet":true,"load_field":["Free"]})", true},
      {R"({"name":"tiger"})", true},
      {R"({})", true},
      // Before or behind what has a size and a date, whatever its own were.
      {R"({"sort":"size"})", true},
      {R"({"sort":"modified"})", true},
  };
  for (const auto& row : rows) {
    const Json::Value reply = SearchAs(peer, row.data);
    Json::Value stale;
    for (const Json::Value& hit : reply["data"]) {
      stale = hit["path"] == path ? hit : stale;
    }
    EXPECT_EQ(!stale.isNull(), row.is_found) << row.data << reply;
    for (const char* const member : {"snippet", "Free", "size", "modified"}) {
      EXPECT_FALSE(stale.isMember(member)) << row.data << stale;
    }
    EXPECT_EQ(reply["data"].size(), reply["total"].asUInt()) << row.data;
  }
  for (const char* const sort : {"size", "modified"}) {
    EXPECT_EQ(SearchAs(peer, R"({"sort":")" + std::string(sort) + "\"}")["data"][0]["path"], path);
  }
}

TEST_F(JudgeTest, AnswersSearchesAloneAndNotEndlessOnes) {
  const daemon::Peer peer = User(kFirstUser);
  const std::string path = tree_ / "file";
  WriteText(path, "");
  Index(path);
  const char* const refused[] = {
      R"({"command":"index_delete","data":{"id":"i"}})",
      R"({"compound":[{"command":"search","data":{}}],"command":"search"})",
      R"({"command":"search","data":{"from":9999,"size":2}})",
  };
  for (const char* const request : refused) {
    const Json::Value reply = engine_.SearchFor(
        Parsed(request),
        [&](const std::vector<std::string>& paths) { return judge_.Ask(peer, paths); });
    EXPECT_EQ(reply["error"]["code"].asInt(), 2000) << request;
  }
  EXPECT_EQ(SearchAs(peer, "{}")["total"].asInt(), 1) << "the index is still there";
  EXPECT_EQ(SearchAs({0, 0, {}}, "{}")["total"].asInt(), 0) << "it never acts as root";
  const Verdict relative = judge_.Ask(peer, {"etc/passwd"})[0];
  EXPECT_FALSE(relative.is_readable);
}

}  // namespace
}  // namespace vexlo::elasticd
