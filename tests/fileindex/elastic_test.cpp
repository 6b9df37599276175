// The engine's channel, the index of a share and its documents, against an engine that records.
#include <gtest/gtest.h>
#include <json/writer.h>
#include <sys/stat.h>

#include <algorithm>
#include <functional>
#include <map>
#include <sstream>

#include "common/error.h"
#include "common/json.h"
#include "fileindex/caught.h"
#include "fileindex/comm.h"
#include "fileindex/elastic_control/documents.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/util/notification.h"
#include "kavo/content_extract.h"
#include "kavo/last_error.h"
#include "kavo/quota.h"
#include "support/fake_engine.h"
#include "support/faults.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

namespace elastic = vexlo::fileindex::elastic;

namespace {

const PrivateRoot kRoot;
std::string happened;  // Requests, sleeps, and what was thrown, a line each.
int random_number = 0;

}  // namespace

INTERPOSED unsigned sleep(unsigned seconds) {
  happened += " " + std::to_string(seconds);
  return 0;
}
INTERPOSED int rand() noexcept { return random_number++; }  // NOLINT: the C library's name.
INTERPOSED int KAVOQuotaIsEnough(uid_t, const char* path, uint64_t) {
  return std::string(path).ends_with("full") ? 0 : 1;
}
INTERPOSED int KLIBCErrGet() { return KAVO_ERR_NO_SPACE; }
FAULTABLE(ssize_t, sendmsg, (int fd, const msghdr* message, int flags), (fd, message, flags))

namespace KAVO::CONTENT_EXTRACT {  // NOLINT(readability-identifier-naming)
void ParseFile(const std::string& path, const Json::Value& options, Json::Value& metadata) {
  if (path == "/int") {
    throw 7;  // NOLINT: any type may come.
  }
  metadata["KAVOMDFSName"] = "name";
  metadata["KAVOMDParent"] = "parent";
  metadata["options"] = options;
}
}  // namespace KAVO::CONTENT_EXTRACT

namespace {

using Replies = std::deque<std::string>;

std::string Refusal(int code) {
  return R"({"success":false,"error":{"code":)" + std::to_string(code) + R"(,"msg":"no"}})";
}
std::string Found(const std::string& hits) { return R"({"success":true,"data":[)" + hits + "]}"; }
Replies Refusals(const std::vector<int>& codes) {
  Replies replies;
  std::transform(codes.begin(), codes.end(), std::back_inserter(replies), Refusal);
  return replies;
}

class Elastic : public testing::Test {
 protected:
  Elastic() : engine_(kRoot.MakeFolder("var/run") + "/kavoelasticd.sock") {
    happened.clear();
    kRoot.SetShares(
        R"({"name": "my photo", "path": "/v/my photo"}, {"name": "full", "path": "/v/full"})");
  }
  void Do(const std::string& name, const Replies& replies, const std::function<void()>& call) {
    engine_.Script(replies);
    happened += "# " + name;
    random_number = 0;
    const SyslogCapture quiet;
    const std::string thrown = Caught(call);
    for (const std::string& request : engine_.Take()) {
      happened += "\n> " + request;
    }
    happened += (thrown.empty() ? "" : "\n! ") + thrown + "\n";
  }
  // What happened, less the requests.
  static std::string WithoutRequests() {
    std::string rest;
    std::istringstream lines(happened);
    for (std::string line; std::getline(lines, line);) {
      rest += line.starts_with(">") ? "" : line + "\n";
    }
    return rest;
  }

  FakeEngine engine_;
};

TEST_F(Elastic, AReplyIsCheckedInDepth) {
  const std::string failed = R"({"success":false,"error":{"code":500,"msg":"bad"}})";
  const std::string busy = R"({"success":false,"error":{"code":1400,"msg":"busy"}})";
  const std::string items = R"({"success":true,"has_fail":true,"data":[)" + failed;
  struct Row {
    const char* name;
    std::string reply;
    std::string want;
    bool is_compound = false;
    size_t want_logged = 0;
  };
  for (const Row& row : {
           Row{"closed", "", "913 Recv failed, res=null", false, 1},
           Row{"no JSON", "yes", "913 Recv failed, res=null", false, 1},
           Row{"number", R"({"success":1})", "913 Recv failed, res={", false, 1},
           Row{"refused", Refusal(-7), "-7 Request failed, msg=no"},
           Row{"no error", R"({"success":false})", "120 Missing property: error, data=", false, 1},
           Row{"failed", items + R"(,{"success":true},7]})", "", true, 2},
           Row{"busy", items + "," + busy + "," + failed + "]}", "1400 busy", true, 1},
           Row{"unmarked", Found(busy), "", true},
           Row{"not compound", items + "]}", ""},
       }) {
    SCOPED_TRACE(row.name);
    engine_.Script({row.reply});
    SyslogCapture log;
    const std::string thrown = Caught([&row] {
      Json::Value response = "stale";
      Json::Value request;
      request[row.is_compound ? "compound" : "command"].append("x");
      vexlo::SendRequestImpl(response, request);
    });
    EXPECT_EQ(thrown.substr(0, row.want.empty() ? thrown.size() : row.want.size()), row.want);
    EXPECT_EQ(log.Take().size(), row.want_logged);
  }
  const ScopedFault fault("sendmsg", EPIPE);
  Do("not sent", {}, [] { elastic::IndexDel("s", "/a"); });
  EXPECT_TRUE(happened.ends_with("\n! 913 Send failed\n")) << happened;
}

TEST(ElasticSocket, IsAwaitedFor31SecondsAndConnectedToAnyway) {
  SyslogCapture log;
  happened.clear();
  EXPECT_THROW(elastic::IndexDel("s", "/a"), vexlo::Error);
  const std::vector<std::string> lines = log.Take();
  ASSERT_EQ(lines.size(), 32U);
  EXPECT_EQ(happened.size(), 31 * std::string(" 1").size());
  EXPECT_TRUE(lines[30].ends_with(" elastic socket is not ready, retry ... 31")) << lines[30];
}

TEST_F(Elastic, ABusyEngineIsAwaited) {
  const std::string tool = kRoot.MakeFolder("usr/kavo/bin") + "/kavoqpxnotify";
  WriteText(tool, "#!/bin/sh\nprintf '%s\\n' \"$@\" >> '" + kRoot / "notices" + "'\nexit 5\n");
  ASSERT_EQ(chmod(tool.c_str(), 0755), 0);
  const auto pause = [] { elastic::ShareIndexPause("s"); };
  Do("not ready", Refusals({607, 608, 610, 609}), pause);
  Do("busy", Refusals({1400, 607, 1401, 1400, 1400, 1400, 1400}), pause);
  EXPECT_EQ(WithoutRequests(), R"(# not ready 30 30 30
! 609 Request failed, msg=no
# busy 900 30 960 1020 1080 1140 900
)");
  std::vector<int> codes(10, 1400);
  codes.push_back(608);
  Do("ten times", Refusals(codes), pause);
  EXPECT_EQ(ReadText(kRoot / "notices"), "<missing>");
  Do("twelve times", Refusals(std::vector<int>(12, 1401)), pause);
  EXPECT_EQ(ReadText(kRoot / "notices"),
            "-c\nKAVO.Vexlo.Application\n@administrators\napp:displayname\nerror:lack_of_memory\n");
  std::filesystem::remove(kRoot / "notices");
  EXPECT_EQ(vexlo::fileindex::SendQPXNotify(), 5) << "the tool's own answer";
  EXPECT_EQ(ReadText(kRoot / "notices"),
            "-c\nKAVO.Vexlo.Application\n-b\ntrue\n-e\nfalse\n@administrators\napp:displayname\n"
            "error:index_no_space\n"
            "<a data-kavo-app=\"KAVO.Vexlo.Application\" data-kavo-fn=\"preference\">\n</a>\n");
}

TEST_F(Elastic, EachOperationHasItsRequest) {
  Do("rename", {}, [] { elastic::ShareIndexRename("old", "new", "/db"); });
  Do("migrate", {}, [] { elastic::ShareIndexMigrate("s", "/db"); });
  Do("create, no share", {}, [] { elastic::ShareIndexCreate("gone"); });
  Do("upsert", {}, [] { elastic::IndexUpsert("s", "/a", true); });
  Do("upsert, extraction throws", {}, [] { elastic::IndexUpsert("s", "/int", true); });
  Do("attributes", {Found("{}")}, [] { elastic::IndexAttr("s", "/a"); });
  Do("attributes, no document", {Found("")}, [] { elastic::IndexAttr("s", "/int"); });
  Do("delete document", {}, [] { elastic::IndexDel("s", "/a"); });
  Do("delete below", {}, [] { elastic::IndexDelDir("s", "/a"); });
  std::vector<std::string> paths = {"0"};
  Do("paths", {Found(R"({"KAVOMDPath":"2"},{},7,{"KAVOMDPath":"1"})")},
     [&paths] { elastic::IndexGetByPrefixPath("an id", "/a", paths); });
  EXPECT_EQ(paths, (std::vector<std::string>{"0", "2", "1"}));
  Do("commit, room left", {Refusal(500)}, [] { elastic::IndexCommit("my photo"); });
  Do("commit, no share", {Refusal(500)}, [] { elastic::IndexCommit("gone"); });
  EXPECT_EQ(happened, R"(# rename
> {"command":"index_config_set","data":{"data":{"id":"fileindex_new","path":"/db"},"id":"fileindex_old"}}
# migrate
> {"command":"index_config_set","data":{"data":{"path":"/db"},"id":"fileindex_s"}}
# create, no share
! 800 gone
# upsert
> {"command":"document_upsert_by_id","data":{"data":{"KAVOMDFSName":"name","KAVOMDParent":"parent","KAVOMDSearchAncestor":"parent","KAVOMDSearchFileName":"name","options":{"need_meta":true}},"doc_id":"/a","id":"fileindex_s"}}
# upsert, extraction throws
! 914 Parse failed, path=/int
# attributes
> {"command":"document_get_by_query","data":{"id":"fileindex_s","query":{"qsl":{"term":{"KAVOMDPath":"/a"}}}}}
> {"command":"document_set_by_id","data":{"data":{"KAVOMDFSName":"name","KAVOMDParent":"parent","KAVOMDSearchAncestor":"parent","KAVOMDSearchFileName":"name","options":{"need_meta":false}},"doc_id":"/a","id":"fileindex_s"}}
# attributes, no document
> {"command":"document_get_by_query","data":{"id":"fileindex_s","query":{"qsl":{"term":{"KAVOMDPath":"/int"}}}}}
! 917 
# delete document
> {"command":"document_del_by_id","data":{"doc_id":"/a","id":"fileindex_s"}}
# delete below
> {"command":"document_del_by_query","data":{"id":"fileindex_s","query":{"qsl":{"prefix":{"KAVOMDPath":"/a/"}}}}}
# paths
> {"command":"document_get_by_query","data":{"id":"an id","query":{"load_field":["KAVOMDPath"],"qsl":{"prefix":{"KAVOMDPath":"/a/"}}}}}
# commit, room left
> {"command":"commit","data":{"id":"fileindex_my photo"}}
! 500 Request failed, msg=no
# commit, no share
> {"command":"commit","data":{"id":"fileindex_gone"}}
! 800 gone
)");
}

TEST_F(Elastic, ANewIndexGetsTheMappings) {
  elastic::ShareIndexCreate("my photo");
  Json::Value request;
  ASSERT_TRUE(vexlo::JsonFromString(request, engine_.Take().at(0)));
  Json::Value properties;
  request["data"]["mappings"].removeMember("properties", &properties);
  EXPECT_EQ(
      vexlo::JsonToString(request),
      R"({"command":"index_create","data":{"event_handler":{"lib_path":"/var/packages/Vexlo/target/handler/fileindex_event_handler.so"},"id":"fileindex_my photo","mappings":{"default":{"_all":true,"analyzer":"kavostandard","required":false,"stored":true,"type":"string"},"property_id":"KAVOMDPath"},"path":")" +
          kRoot / "var/lib/kavo/fileindex/db/%2Fv%2Fmy photo" + R"(","settings":{}}})");
  for (const auto& [name, want] : std::map<std::string, std::string>{
           {"Path", R"({"_all":false,"analyzer":"keyword","required":true})"},
           {"SearchFileName",
            R"({"analyzer":"white space","preprocess":["tolower","ngram"],"type":"text"})"},
           {"FSSize", R"({"type":"int"})"},
       }) {
    EXPECT_EQ(vexlo::JsonToString(properties["KAVOMD" + name]), want) << name;
  }
}

TEST_F(Elastic, ARenameMovesWhatLiesBelowInBatches) {
  const std::string ok = R"({"success":true})";
  for (const unsigned count : {0U, 1U, 9999U, 10000U, 10001U}) {
    SCOPED_TRACE(count);
    Replies replies = {Found("{}"), ok};
    std::vector<std::string> want = {
        R"({"command":"document_get_by_query","data":{"id":"fileindex_s","query":{"qsl":{"term":{"KAVOMDPath":"/v/a"}}}}})",
        R"({"command":"document_set_by_id","data":{"data":{"KAVOMDDisplayName":"N.Dir.TXT","KAVOMDExtension":"txt","KAVOMDFSName":"N.Dir.TXT","KAVOMDKind":"txt","KAVOMDParent":"/w","KAVOMDPath":"/w/N.Dir.TXT","KAVOMDSearchAncestor":"/w","KAVOMDSearchFileName":"N.Dir.TXT"},"doc_id":"/v/a","id":"fileindex_s"}})"};
    std::string load;
    bool full = true;
    for (unsigned i = 0; full;) {
      load +=
          (load.empty() ? "" : ",") + std::string(R"("KAVOMDPath","KAVOMDFSName","KAVOMDParent")");
      const std::string query = R"("id":"fileindex_s","query":{"from":0,"load_field":[)" + load +
                                R"(],"qsl":{"prefix":{"KAVOMDPath":"/v/a/"}},"size":10000}}})";
      std::string hits;
      std::string moves;
      const unsigned end = std::min(count, i + 10000);
      full = end - i == 10000;
      for (; i < end; ++i) {  // The old path comes again in that of its documents.
        const std::string name = "n" + std::to_string(i);
        hits += (hits.empty() ? "" : ",") + (R"({"KAVOMDFSName":")" + name) +
                R"(","KAVOMDParent":"/v/a/v/a","KAVOMDPath":"/v/a/v/a/)" + name + "\"}";
        moves += (moves.empty() ? "" : ",") +
                 std::string(R"({"command":"document_set_by_id","data":)") +
                 R"({"data":{"KAVOMDParent":"/w/N.Dir.TXT/v/a","KAVOMDPath":"/w/N.Dir.TXT/v/a/)" +
                 name + R"(","KAVOMDSearchAncestor":"/w/N.Dir.TXT/v/a","KAVOMDSearchFileName":")" +
                 name + R"("},"doc_id":"/v/a/v/a/)" + name + "\"," + query;
      }
      want.push_back(R"({"command":"document_get_by_query","data":{)" + query);
      replies.insert(replies.end(), {Found(hits), ok, ok});
      if (moves.empty()) {
        break;
      }
      want.push_back(R"({"compound":[)" + moves + "]}");
      if (full) {
        want.emplace_back(R"({"command":"commit","data":{"id":"fileindex_s"}})");
      }
    }
    engine_.Script(replies);
    SyslogCapture log;
    elastic::IndexRename("s", "/w/N.Dir.TXT", "/v/a");
    EXPECT_TRUE(engine_.Take() == want);
    EXPECT_EQ(log.Take().size(), count / 10000);
  }
  Do("no document", {Found("")}, [] { elastic::IndexRename("s", "/w", "/v/a"); });
  EXPECT_TRUE(happened.ends_with("\n! 917 \n")) << happened;
  Do("no parent", {Found("{}"), ok, Found(R"({"KAVOMDFSName":""})")},
     [] { elastic::IndexRename("s", "/w", "/v/a"); });
  EXPECT_NE(happened.find("\n! 120 Missing property: KAVOMDParent, data="), std::string::npos);
}

TEST_F(Elastic, ACommitWithoutRoomMarksTheShare) {
  if (geteuid() != 0) {
    GTEST_SKIP() << "the status file is root's";
  }
  kRoot.MakeFolder("tmp");
  const std::string status = kRoot.MakeFolder("var/packages/Vexlo/etc") + "/fileindex.status";
  WriteText(status, R"({"share": {"full": 2}, "resume_time": 5})");
  Do("full", {Refusal(500)}, [] { elastic::IndexCommit("full"); });
  EXPECT_NE(happened.find("\n! 1003 Share (full) space not enough\n"), std::string::npos);
  Json::Value saved;
  ASSERT_TRUE(vexlo::JsonFromString(saved, ReadText(status)));
  EXPECT_EQ(vexlo::JsonToString(saved), R"({"resume_time":5,"share":{"full":3}})");
}

}  // namespace
