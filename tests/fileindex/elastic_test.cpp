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
#include "fileindex/comm.h"
#include "fileindex/elastic_control/documents.h"
#include "fileindex/elastic_control/share_index.h"
#include "kavo/content_extract.h"
#include "kavo/last_error.h"
#include "kavo/quota.h"
#include "support/fake_engine.h"
#include "support/faults.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

using vexlo::fileindex::elastic::IndexAttr;
using vexlo::fileindex::elastic::IndexCommit;
using vexlo::fileindex::elastic::IndexDel;
using vexlo::fileindex::elastic::IndexDelDir;
using vexlo::fileindex::elastic::IndexGetByPrefixPath;
using vexlo::fileindex::elastic::IndexRename;
using vexlo::fileindex::elastic::IndexUpsert;
using vexlo::fileindex::elastic::ShareIndexCreate;
using vexlo::fileindex::elastic::ShareIndexDelete;
using vexlo::fileindex::elastic::ShareIndexMigrate;
using vexlo::fileindex::elastic::ShareIndexPause;
using vexlo::fileindex::elastic::ShareIndexRename;
using vexlo::fileindex::elastic::ShareIndexResume;

namespace {

const PrivateRoot kRoot;
std::string happened;  // Requests, sleeps, what was logged and thrown, a line each.
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
  if (path == "/array") {
    metadata = Json::arrayValue;
  } else if (path != "/nothing") {
    metadata["KAVOMDFSName"] = "name";
    metadata["KAVOMDParent"] = "parent";
    metadata["options"] = options;
  }
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
    SyslogCapture log;
    std::string thrown;
    try {
      call();
    } catch (const vexlo::Error& error) {
      thrown = "! " + std::to_string(error.GetErrorCode()) + " " + error.what();
    }
    for (const std::string& request : engine_.Take()) {
      happened += "\n> " + request;
    }
    for (const std::string& line :
         log.Take()) {  // "<3>source:line (pid, uid) text", or without pid.
      std::string text = line.substr(line.find(' '));
      text.erase(0, text[1] == '(' && isdigit(text[2]) != 0 ? text.find(')') + 1 : 0);
      happened += "\n: " + line.substr(3, line.find(':') - 3) + OneLine(text);
    }
    happened += (thrown.empty() ? "" : "\n") + OneLine(thrown) + "\n";
  }
  static std::string OneLine(const std::string& text) {
    std::string line;
    for (size_t i = 0; i < text.size(); ++i) {
      if (text[i] != '\n') {
        line += text[i];
      } else {
        line += ' ';
        i = text.find_first_not_of(' ', i + 1) - 1;
      }
    }
    return line.substr(0, line.find_last_not_of(' ') + 1);
  }
  // What happened, less the lines that begin so.
  static std::string HappenedBut(const std::string& prefix) {
    std::string rest;
    std::istringstream lines(happened);
    for (std::string line; std::getline(lines, line);) {
      rest += line.starts_with(prefix) ? "" : line + "\n";
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
    bool is_compound = false;
  };
  for (const Row& row : {Row{"closed", ""}, Row{"no JSON", "yes"}, Row{"array", "[]"},
                         Row{"number", R"({"success":1})"}, Row{"refused", Refusal(-7)},
                         Row{"no error", R"({"success":false})"},
                         Row{"no msg", R"({"success":false,"error":{"code":5}})"},
                         Row{"text", R"({"success":false,"error":{"code":"5","msg":""}})"},
                         Row{"failed", items + R"(,{"success":true},7]})", true},
                         Row{"busy", items + "," + busy + "," + failed + "]}", true},
                         Row{"unmarked", Found(busy), true}, Row{"not compound", items + "]}"}}) {
    Do(row.name, {row.reply}, [&row] {
      Json::Value response = "stale";
      Json::Value request;
      request[row.is_compound ? "compound" : "command"].append("x");
      vexlo::SendRequestImpl(response, request);
    });
  }
  const ScopedFault fault("sendmsg", EPIPE);
  Do("not sent", {}, [] { IndexDel("s", "/a"); });
  const std::string no_reply =
      R"(: comm (SendRequestImpl) Failed [!conn.Recv(resp_raw) || !res.fromString(resp_raw) || )"
      R"(!res.isMember("success") || !res["success"].isBool()], reason: Recv failed, res=)";
  EXPECT_EQ(HappenedBut(">"), "# closed\n" + no_reply + R"(null [err: Connection reset by peer]
! 913 Recv failed, res=null
# no JSON
)" + no_reply + R"(null
! 913 Recv failed, res=null
# array
)" + no_reply + R"([]
! 913 Recv failed, res=[]
# number
)" + no_reply + R"({ "success" : 1 }
! 913 Recv failed, res={ "success" : 1 }
# refused
! -7 Request failed, msg=no
# no error
: json (GetJsonValue) Failed [!object.isMember(key)], reason: Missing property: error, data={ "success" : false }
! 120 Missing property: error, data={ "success" : false }
# no msg
: json (GetJsonValue) Failed [!object.isMember(key)], reason: Missing property: msg, data={ "code" : 5 }
! 120 Missing property: msg, data={ "code" : 5 }
# text
: json (GetJsonValue) Failed [!readable], reason: Not a string, data={ "code" : "5", "msg" : "" }
! 120 Not a string, data={ "code" : "5", "msg" : "" }
# failed
: comm (SendRequestImpl) Compound failed: "x" (500) bad
: comm (SendRequestImpl) Compound failed: null (0)
# busy
: comm (SendRequestImpl) Compound failed: "x" (500) bad
! 1400 busy
# unmarked
# not compound
# not sent
: comm (SendRequestImpl) Failed [!conn.Send(req.toString())], reason: Send failed [err: Broken pipe]
! 913 Send failed
)");
}

TEST(ElasticSocket, IsAwaitedFor31SecondsAndConnectedToAnyway) {
  SyslogCapture log;
  happened.clear();
  EXPECT_THROW(IndexDel("s", "/a"), vexlo::Error);
  const std::vector<std::string> lines = log.Take();
  ASSERT_EQ(lines.size(), 32U);
  EXPECT_EQ(happened.size(), 31 * std::string(" 1").size());
  EXPECT_TRUE(lines[0].ends_with(" elastic socket is not ready, retry ... 1")) << lines[0];
  EXPECT_TRUE(lines[30].ends_with(" elastic socket is not ready, retry ... 31")) << lines[30];
  EXPECT_TRUE(
      lines[31].ends_with(" Failed [!conn.Connect(kElasticdConnectTimeout)], reason: "
                          "Connect failed [err: No such file or directory]"));
}

TEST_F(Elastic, ABusyEngineIsAwaited) {
  const std::string tool = kRoot.MakeFolder("usr/kavo/bin") + "/kavoqpxnotify";
  WriteText(tool, "#!/bin/sh\nprintf x >> '" + kRoot / "notices" + "'\n");
  ASSERT_EQ(chmod(tool.c_str(), 0755), 0);
  const auto pause = [] { ShareIndexPause("s"); };
  Do("not ready", Refusals({607, 608, 610, 609}), pause);
  Do("busy", Refusals({1400, 607, 1401, 1400, 1400, 1400, 1400}), pause);
  EXPECT_EQ(HappenedBut(">"),
            R"(# not ready 30 30 30
: request DB is not good yet, retry... (Error Code: 607)
: request DB is not good yet, retry... (Error Code: 608)
: request DB is not good yet, retry... (Error Code: 610)
! 609 Request failed, msg=no
# busy 900 30 960 1020 1080 1140 900
: request Retry[0] since kavoelasticd is busy. Command: index_pause, db: fileindex_s
: request DB is not good yet, retry... (Error Code: 607)
: request Retry[1] since kavoelasticd is busy. Command: index_pause, db: fileindex_s
: request Retry[2] since kavoelasticd is busy. Command: index_pause, db: fileindex_s
: request Retry[3] since kavoelasticd is busy. Command: index_pause, db: fileindex_s
: request Retry[4] since kavoelasticd is busy. Command: index_pause, db: fileindex_s
: request Retry[5] since kavoelasticd is busy. Command: index_pause, db: fileindex_s
)");
  std::vector<int> codes(10, 1400);
  codes.push_back(608);
  Do("ten times", Refusals(codes), pause);
  EXPECT_EQ(ReadText(kRoot / "notices"), "<missing>");
  Do("twelve times", Refusals(std::vector<int>(12, 1401)), pause);
  EXPECT_EQ(ReadText(kRoot / "notices"), "x");
}

TEST_F(Elastic, EachOperationHasItsRequest) {
  Do("delete", {}, [] { ShareIndexDelete("s"); });
  Do("pause", {}, [] { ShareIndexPause("S %"); });
  Do("resume", {}, [] { ShareIndexResume("s"); });
  Do("rename", {}, [] { ShareIndexRename("old", "new", "/db"); });
  Do("migrate", {}, [] { ShareIndexMigrate("s", "/db"); });
  Do("create, no share", {}, [] { ShareIndexCreate("gone"); });
  Do("upsert", {}, [] { IndexUpsert("s", "/a", true); });
  Do("upsert, no names", {}, [] { IndexUpsert("s", "/nothing", true); });
  Do("upsert, no object", {}, [] { IndexUpsert("s", "/array", true); });
  Do("attributes", {Found("{}")}, [] { IndexAttr("s", "/a"); });
  Do("attributes, no document", {Found("")}, [] { IndexAttr("s", "/int"); });
  Do("attributes, no list", {}, [] { IndexAttr("s", "/int"); });
  Do("attributes, extraction throws", {Found("{}")}, [] { IndexAttr("s", "/int"); });
  Do("delete document", {}, [] { IndexDel("s", "/a"); });
  Do("delete below", {}, [] { IndexDelDir("s", "/a"); });
  std::vector<std::string> paths = {"0"};
  Do("paths", {Found(R"({"KAVOMDPath":"2"},{},7,{"KAVOMDPath":"1"})")},
     [&paths] { IndexGetByPrefixPath("an id", "/a", paths); });
  EXPECT_EQ(paths, (std::vector<std::string>{"0", "2", "1"}));
  Do("commit", {}, [] { IndexCommit("s"); });
  Do("commit, room left", {Refusal(500)}, [] { IndexCommit("my photo"); });
  Do("commit, no share", {Refusal(500)}, [] { IndexCommit("gone"); });
  EXPECT_EQ(HappenedBut(": share "), R"(# delete
> {"command":"index_delete","data":{"id":"fileindex_s"}}
# pause
> {"command":"index_pause","data":{"id":"fileindex_S %"}}
# resume
> {"command":"index_resume","data":{"id":"fileindex_s"}}
# rename
> {"command":"index_config_set","data":{"data":{"id":"fileindex_new","path":"/db"},"id":"fileindex_old"}}
# migrate
> {"command":"index_config_set","data":{"data":{"path":"/db"},"id":"fileindex_s"}}
# create, no share
! 800 gone
# upsert
> {"command":"document_upsert_by_id","data":{"data":{"KAVOMDFSName":"name","KAVOMDParent":"parent","KAVOMDSearchAncestor":"parent","KAVOMDSearchFileName":"name","options":{"need_meta":true}},"doc_id":"/a","id":"fileindex_s"}}
# upsert, no names
> {"command":"document_upsert_by_id","data":{"data":{"KAVOMDSearchAncestor":null,"KAVOMDSearchFileName":null},"doc_id":"/nothing","id":"fileindex_s"}}
# upsert, no object
: documents (Extract) Failed [ParseFile(path, options, metadata)], reason: Parse failed, path=/array
! 914 Parse failed, path=/array
# attributes
> {"command":"document_get_by_query","data":{"id":"fileindex_s","query":{"qsl":{"term":{"KAVOMDPath":"/a"}}}}}
> {"command":"document_set_by_id","data":{"data":{"KAVOMDFSName":"name","KAVOMDParent":"parent","KAVOMDSearchAncestor":"parent","KAVOMDSearchFileName":"name","options":{"need_meta":false}},"doc_id":"/a","id":"fileindex_s"}}
# attributes, no document
> {"command":"document_get_by_query","data":{"id":"fileindex_s","query":{"qsl":{"term":{"KAVOMDPath":"/int"}}}}}
! 917
# attributes, no list
> {"command":"document_get_by_query","data":{"id":"fileindex_s","query":{"qsl":{"term":{"KAVOMDPath":"/int"}}}}}
: documents (Find) Failed [!res.isMember("data") || !res["data"].isArray()], reason: { "success" : true }
! 916 { "success" : true }
# attributes, extraction throws
> {"command":"document_get_by_query","data":{"id":"fileindex_s","query":{"qsl":{"term":{"KAVOMDPath":"/int"}}}}}
: documents (Extract) Failed [ParseFile(path, options, metadata)], reason: Parse failed, path=/int
! 914 Parse failed, path=/int
# delete document
> {"command":"document_del_by_id","data":{"doc_id":"/a","id":"fileindex_s"}}
# delete below
> {"command":"document_del_by_query","data":{"id":"fileindex_s","query":{"qsl":{"prefix":{"KAVOMDPath":"/a/"}}}}}
# paths
> {"command":"document_get_by_query","data":{"id":"an id","query":{"load_field":["KAVOMDPath"],"qsl":{"prefix":{"KAVOMDPath":"/a/"}}}}}
# commit
> {"command":"commit","data":{"id":"fileindex_s"}}
# commit, room left
> {"command":"commit","data":{"id":"fileindex_my photo"}}
! 500 Request failed, msg=no
# commit, no share
> {"command":"commit","data":{"id":"fileindex_gone"}}
! 800 gone
)");
}

TEST_F(Elastic, ANewIndexGetsTheMappings) {
  ShareIndexCreate("my photo");
  Json::Value request;
  ASSERT_TRUE(vexlo::JsonFromString(request, engine_.Take().at(0)));
  Json::Value properties;
  request["data"]["mappings"].removeMember("properties", &properties);
  EXPECT_EQ(
      vexlo::JsonToString(request),
      R"({"command":"index_create","data":{"event_handler":{"lib_path":"/var/packages/Vexlo/target/handler/fileindex_event_handler.so"},"id":"fileindex_my photo","mappings":{"default":{"_all":true,"analyzer":"kavostandard","required":false,"stored":true,"type":"string"},"property_id":"KAVOMDPath"},"path":")" +
          kRoot / "var/lib/kavo/fileindex/db/%2Fv%2Fmy photo" + R"(","settings":{}}})");
  std::map<std::string, std::string> groups;
  for (std::string name : properties.getMemberNames()) {
    std::string& group = groups[vexlo::JsonToString(properties[name])];
    group += " " + name.erase(name.find("KAVOMD"), strlen("KAVOMD"));
  }
  std::string got;
  for (const auto& [attributes, names] : groups) {
    got += attributes + names + "\n";
  }
  EXPECT_EQ(got, R"({"_all":false,"analyzer":"keyword","required":true} Path
{"_all":false,"analyzer":"keyword","type":"text"} Identifier
{"_all":false,"analyzer":"keyword"} Extension FSName OwnerGroupID OwnerUserID Parent Privilege
{"_all":false,"analyzer":"white space escaped","preprocess":["list_ancestor"],"type":"text"} SearchAncestor
{"_all":false,"type":"bool"} IsDir IsEncrypted
{"analyzer":"keyword"} Aperture ExposureTimeString GroupId MediaTypes StarRating
{"analyzer":"white space","preprocess":["tolower","ngram"],"type":"text"} SearchFileName
{"analyzer":"white space","type":"text"} AcquisitionMake AcquisitionModel Authors Codecs Composer Creator SpotlightBoost
{"type":"double"} DurationSecond
{"type":"int"} AttributeChangeDate AudioBitRate AudioChannelCount AudioSampleRate AudioTrackNumber ContentCreationDate ContentModificationDate DateAdded FSContentChangeDate FSCreationDate FSSize FinderLabel FinderOpenDate ISOSpeed LastUsedDate LogicalSize PhysicalSize RecordingYear ResolutionHeightDPI ResolutionWidthDPI TotalBitRate VideoBitRate
{"type":"text"} Album Comment Description MusicalGenre TextContent Title _UserTags
{} Keywords
)");
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
    IndexRename("s", "/w/N.Dir.TXT", "/v/a");
    EXPECT_TRUE(engine_.Take() == want);
    EXPECT_EQ(log.Take().size(), count / 10000);
  }
  Do("no document", {Found("")}, [] { IndexRename("s", "/w", "/v/a"); });
  EXPECT_TRUE(happened.ends_with("\n! 917\n")) << happened;
  Do("no parent", {Found("{}"), ok, Found(R"({"KAVOMDFSName":""})")},
     [] { IndexRename("s", "/w", "/v/a"); });
  EXPECT_NE(happened.find("\n! 120 Missing property: KAVOMDParent, data="), std::string::npos);
}

TEST_F(Elastic, ACommitWithoutRoomMarksTheShare) {
  if (geteuid() != 0) {
    GTEST_SKIP() << "the status file is root's";
  }
  kRoot.MakeFolder("tmp");
  const std::string status = kRoot.MakeFolder("var/packages/Vexlo/etc") + "/fileindex.status";
  WriteText(status, R"({"share": {"full": 2}, "resume_time": 5})");
  Do("full", {Refusal(500)}, [] { IndexCommit("full"); });
  EXPECT_NE(happened.find("\n! 1003 Share (full) space not enough\n"), std::string::npos);
  Json::Value saved;
  ASSERT_TRUE(vexlo::JsonFromString(saved, ReadText(status)));
  EXPECT_EQ(vexlo::JsonToString(saved), R"({"resume_time":5,"share":{"full":3}})");
}

}  // namespace
