#include "daemons/kavoelasticd/engine.h"

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <string>
#include <vector>

#include "daemons/kavoelasticd/engine_fixture.h"
#include "support/syslog_capture.h"

namespace {

struct QueryCase {
  const char* name;
  std::string qsl;
  std::string want;  // Paths, or the code of a refusal.
};

void Check(EngineFixture& engine, const std::vector<QueryCase>& cases) {
  for (const QueryCase& c : cases) {
    EXPECT_EQ(engine.Query(c.qsl), c.want) << c.name;
  }
}

TEST(Engine, AnswersEveryRequest) {
  EngineFixture engine;
  engine.Add("/v/a");
  const char* const no_requests[] = {"[]", R"({"data":{"id":"i"}})", R"({"command":"commit"})",
                                     R"({"command":"commit","data":7})", R"({"compound":{}})"};
  for (const char* const request : no_requests) {
    const Json::Value reply = engine.Send(Parsed(request));
    EXPECT_EQ(Answer(reply), "2000") << request;
    EXPECT_TRUE(reply["error"]["msg"].isString()) << request;
  }
  EXPECT_EQ(Answer(engine.Send(Parsed(R"({"compound":[]})"))), "ok");
  const char* const kCreate = "index_create";
  const char* const kQuery = "document_get_by_query";
  const char* const kDelete = "document_del_by_query";
  const char* const kUpsert = "document_upsert_by_id";
  const char* const kSet = "document_set_by_id";
  const char* const kMove = "document_move_below";
  const std::string mappings = R"("mappings":{"property_id":"P",)";
  const struct {
    const char* name;
    const char* command;
    std::string data;  // Without "id" it is that of the index.
    std::string want;
  } cases[] = {
      {"UnknownCommand", "dance", "{}", "2000"},
      {"MissingIndex", "commit", R"({"id":"j"})", "2002"},
      {"CreateAgain", kCreate, R"({"path":"/x",)" + mappings + R"("x":1}})", "2003"},
      {"RelativePath", kCreate, R"({"id":"j","path":"x",)" + mappings + R"("x":1}})", "2000"},
      {"NoMappings", kCreate, R"({"id":"j","path":"/x"})", "2008"},
      {"UnknownAnalyzer", kCreate,
       R"({"id":"j","path":"/x",)" + mappings + R"("properties":{"f":{"analyzer":"magic"}}}})",
       "2008"},
      {"UnknownStep", kCreate,
       R"({"id":"j","path":"/x",)" + mappings + R"("default":{"preprocess":["cook"]}}})", "2008"},
      {"UnknownLanguage", kCreate,
       R"({"id":"j","path":"/x","settings":{"language":"x' y"},)" + mappings + R"("x":1}})",
       "2008"},
      {"FolderIsAFile", kCreate, R"({"id":"j","path":"/dev/null/x",)" + mappings + R"("x":1}})",
       "2009"},
      {"NoQuery", kQuery, "{}", "2000"},
      {"UnknownQuery", kQuery, R"({"query":{"qsl":{"near":{}}}})", "2001"},
      {"EmptyQuery", kDelete, R"({"query":{"qsl":{}}})", "2001"},
      {"EmptyTerm", kDelete, R"({"query":{"qsl":{"term":{}}}})", "2001"},
      {"PrefixNumber", kDelete, R"({"query":{"qsl":{"prefix":{"a":1}}}})", "2001"},
      {"PageIsText", kQuery, R"({"query":{"qsl":{"term":{"KAVOMDPath":"/v/a"}},"size":"all"}})",
       "2000"},
      {"AfterIsNoPath", kQuery, R"({"query":{"qsl":{"term":{"KAVOMDPath":"/v/a"}},"after":1}})",
       "2000"},
      {"FlatIsText", kQuery, R"({"query":{"qsl":{"prefix":{"KAVOMDPath":"/"}},"flat":"yes"}})",
       "2000"},
      {"FlatWithoutAFolder", kQuery,
       R"({"query":{"qsl":{"term":{"KAVOMDTitle":"x"}},"flat":true}})", "2001"},
      {"DigestsOfNothing", "folder_digests", "{}", "2000"},
      {"DigestsBehindNoPath", "folder_digests", R"({"below":"/v","after":1})", "2000"},
      {"SetMissing", kSet, R"({"doc_id":"/v/b","data":{}})", "2006"},
      {"SetPathToNothing", kSet, R"({"doc_id":"/v/a","data":{"KAVOMDPath":""}})", "2007"},
      {"MoveWithoutPlace", kMove, R"({"from":"/v"})", "2000"},
      {"MoveToItself", kMove, R"({"from":"/v","to":"/v"})", "2000"},
      {"MoveIntoItself", kMove, R"({"from":"/v","to":"/v/w"})", "2000"},
      {"MoveOutOfItself", kMove, R"({"from":"/v/w","to":"/v"})", "2000"},
      {"MoveBelowASlash", kMove, R"({"from":"/v/","to":"/w"})", "2000"},
      {"MoveNothingAtATime", kMove, R"({"from":"/v","to":"/w","size":0})", "2000"},
      {"MoveTooMany", kMove, R"({"from":"/v","to":"/w","size":10001})", "2000"},
      {"MoveFieldsAreNoList", kMove, R"({"from":"/v","to":"/w","folder_field":"x"})", "2000"},
      {"MoveNothing", kMove, R"({"from":"/v/a","to":"/v/b"})", "ok"},
      {"NoDocument", kUpsert, R"({"doc_id":"/v/b"})", "2007"},
      {"SizeIsNoNumber", kUpsert, R"({"doc_id":"/v/b","data":{"KAVOMDFSSize":"big"}})", "2007"},
      {"DeleteMissingIsDone", "document_del_by_id", R"({"doc_id":"/v/b"})", "ok"},
      {"DocIdStandsForThePath", kUpsert, R"({"doc_id":"/v/only id","data":{"x":"y"},"query":{}})",
       "ok"},
  };
  for (const auto& c : cases) {
    const Json::Value reply = engine.Send(c.command, Parsed(c.data));
    EXPECT_EQ(Answer(reply), c.want) << c.name;
    EXPECT_EQ(reply["error"]["msg"].isString(), c.want != "ok") << c.name;
  }
  EXPECT_EQ(engine.Query(R"({"prefix":{"KAVOMDPath":"/"}})"), "/v/a /v/only id");
}

TEST(Engine, MappingsDecideHowAFieldIsFound) {
  EngineFixture engine;
  engine.Add("/v/d/Bergbl\u00fcte.txt", R"({"KAVOMDTitle":"Running Waters deep",
    "KAVOMDAuthors":["Ann Lee","B\u00e9la"],"KAVOMDIdentifier":"id 7","KAVOMDDurationSecond":2.5,
    "KAVOMDIsDir":false,"KAVOMDFSSize":"12","Hidden":"found","Quiet":"night train",
    "Lower":"MiXed \u00c9","Escaped":"one\\ two three","Free":"some words","KAVOMDTextContent":null})");
  engine.Add("/v/d");
  engine.Add("/v/dd/x");
  const std::string doc = "/v/d/Bergbl\u00fcte.txt";
  Check(engine,
        {{"KeywordIsWhole", R"({"term":{"KAVOMDIdentifier":"id 7"}})", doc},
         {"KeywordIsNoWord", R"({"term":{"KAVOMDIdentifier":"id"}})", ""},
         {"KeywordBeginning", R"({"prefix":{"KAVOMDIdentifier":"id"}})", doc},
         {"WhiteSpace", R"({"term":{"KAVOMDAuthors":"Lee"}})", doc},
         {"WhiteSpaceKeepsCase", R"({"term":{"KAVOMDAuthors":"lee"}})", ""},
         {"ListElement", "{\"term\":{\"KAVOMDAuthors\":\"B\u00e9la\"}}", doc},
         {"Escaped", R"({"term":{"Escaped":"one two"}})", doc},
         {"EscapedPart", R"({"term":{"Escaped":"one"}})", ""},
         {"Lower", "{\"term\":{\"Lower\":\"mixed E\u0301\"}}", doc},
         {"TextWord", R"({"term":{"KAVOMDTitle":"run"}})", doc},
         {"TextPhrase", R"({"term":{"KAVOMDTitle":"water deep"}})", doc},
         {"TextNoPhrase", R"({"term":{"KAVOMDTitle":"deep water"}})", ""},
         {"TextBeginning", R"({"prefix":{"KAVOMDTitle":"wat"}})", doc},
         {"StringWord", R"({"term":{"Quiet":"train"}})", doc},
         {"NotListed", R"({"term":{"Free":"words"}})", doc},
         {"NotStored", R"({"term":{"Hidden":"found"}})", doc},
         {"Int", R"({"term":{"KAVOMDFSSize":12}})", doc},
         {"IntAsText", R"({"term":{"KAVOMDFSSize":"12"}})", doc},
         {"Double", R"({"term":{"KAVOMDDurationSecond":2.5}})", doc},
         {"Bool", R"({"term":{"KAVOMDIsDir":false}})", doc},
         {"Gram", R"({"term":{"KAVOMDSearchFileName":"GBLU"}})", doc},
         {"GramBeginning", R"({"prefix":{"KAVOMDSearchFileName":"berg"}})", doc},
         {"GramNotBeginning", R"({"prefix":{"KAVOMDSearchFileName":"blu"}})", ""},
         {"Ancestor", R"({"term":{"KAVOMDSearchAncestor":"/v/d"}})", doc},
         {"AncestorAbove", R"({"term":{"KAVOMDSearchAncestor":"/v"}})", "/v/d " + doc + " /v/dd/x"},
         {"AncestorIsWhole", R"({"term":{"KAVOMDSearchAncestor":"/v/"}})", ""},
         {"Both", R"({"term":{"KAVOMDIsDir":false},"prefix":{"KAVOMDPath":"/v/d/"}})", doc},
         {"And", R"({"and":[{"term":{"Free":"some"}},{"term":{"KAVOMDPath":"/v/dd/x"}}]})", ""},
         {"UnknownField", R"({"term":{"No such":"x"}})", ""},
         {"PathPrefix", R"({"prefix":{"KAVOMDPath":"/v/d"}})", "/v/d " + doc + " /v/dd/x"}});
  Json::Value shown = engine.Documents(R"({"term":{"Free":"some"}})")[0];
  Json::Value want = MakeDocument(doc, R"({"KAVOMDTitle":"Running Waters deep",
    "KAVOMDAuthors":["Ann Lee","B\u00e9la"],"KAVOMDIdentifier":"id 7","KAVOMDDurationSecond":2.5,
    "KAVOMDIsDir":false,"KAVOMDFSSize":12,"Quiet":"night train",
    "Lower":"MiXed \u00c9","Escaped":"one\\ two three","Free":"some words"})");
  EXPECT_EQ(shown, want);
  EXPECT_EQ(engine.Documents(R"({"term":{"Free":"some"}})",
                             R"({"load_field":["Free","Hidden","none","Free"]})"),
            Parsed(R"([{"Free":"some words"}])"));
  const std::string required = R"({"property_id":"P","properties":{"Must":{"required":true}}})";
  EXPECT_EQ(engine.Create("j", engine.Folder() / "j", required), "ok");
  EXPECT_EQ(engine.Do("document_upsert_by_id", R"({"doc_id":"/a","data":{"Other":1}})", "j"),
            "2007");
  EXPECT_EQ(engine.Do("document_upsert_by_id", R"({"doc_id":"/a","data":{"Must":1}})", "j"), "ok");
  EXPECT_EQ(engine.Do("document_set_by_id", R"({"doc_id":"/a","data":{"Must":null}})", "j"),
            "2007");
}

// What renames, merges and replacements leave is the oracle's; this is what it never sends.
TEST(Engine, SettingRemovesNullsAndTakesLists) {
  EngineFixture engine;
  engine.Add("/v/b", R"({"Note":"one","Old":"gone"})");
  EXPECT_EQ(engine.Do("document_set_by_id",
                      R"({"doc_id":"/v/b","data":{"Note":["two",2],"Old":null,"New":{"k":1}}})"),
            "ok");
  EXPECT_EQ(engine.Documents(R"({"term":{"KAVOMDPath":"/v/b"}})",
                             R"({"load_field":["Note","Old","New"]})"),
            Parsed(R"([{"Note":["two",2],"New":{"k":1}}])"));
  Check(engine, {{"NewNote", R"({"term":{"Note":"two"}})", "/v/b"},
                 {"OldNote", R"({"term":{"Note":"one"}})", ""},
                 {"Removed", R"({"term":{"Old":"gone"}})", ""}});
  EXPECT_EQ(engine.Do("document_set_by_id", R"({"doc_id":"/v/b","data":{"KAVOMDPath":"/w/c"}})"),
            "ok");
  Check(engine, {{"Ancestor", R"({"term":{"KAVOMDSearchAncestor":"/v"}})", "/w/c"},
                 {"Name", R"({"term":{"KAVOMDFSName":"b"}})", "/w/c"}});
}

// Beside an index whose documents are moved one by one.
TEST(Engine, MovingAFolderIsMovingEachDocumentInIt) {
  const std::pair<const char*, const char*> documents[] = {
      {"/v/a", "{}"},
      {"/v/a!/beside", "{}"},
      {"/v/a.txt", "{}"},
      {"/v/a/0 replaces", R"({"KAVOMDTitle":"new"})"},
      {"/v/a/1", R"({"KAVOMDTitle":"alpha"})"},
      {"/v/a/b/2", R"({"Note":"/v/a/b"})"},  // Says where it was, and goes on to say so.
      {"/v/a/b/3", R"({"KAVOMDSearchAncestor":"/elsewhere","KAVOMDIdentifier":"/v/a/b"})"},
      {"/v/a/b/4", R"({"KAVOMDTitle":"/w/b"})"},
      {"/v/a/bad\xff", R"({"KAVOMDTextContent":"beta"})"},
      {"/v/a0", "{}"},
      {"/w/0 replaces", R"({"KAVOMDTitle":"old"})"},
      {"/w/b/stays", "{}"}};
  for (const std::string extra : {"", "KAVOMDDisplayName", "Unheard of", "KAVOMDPath"}) {
    SCOPED_TRACE(extra);
    EngineFixture one_by_one;
    EngineFixture at_once;
    std::vector<std::string> fields = {"KAVOMDParent", "KAVOMDSearchAncestor"};
    if (!extra.empty()) {
      fields.push_back(extra);
    }
    Json::Value move = Parsed(R"({"from":"/v/a","to":"/w","size":3})");
    for (const std::string& name : fields) {
      move["folder_field"].append(name);
    }
    for (const auto& [path, more] : documents) {
      one_by_one.Add(path, more);
      at_once.Add(path, more);
    }
    for (const auto& [document, more] : documents) {
      const std::string path = document;
      if (path.starts_with("/v/a/")) {
        const std::string to = "/w" + path.substr(4);
        Json::Value data;
        for (const std::string& name : fields) {
          data[name] = to.substr(0, to.rfind('/'));
        }
        data["KAVOMDPath"] = to;
        EXPECT_EQ(Answer(one_by_one.Send(WriteRequest("document_set_by_id", path, data))), "ok");
      }
    }
    std::string portions;
    do {
      const Json::Value answer = at_once.Send("document_move_below", move)["data"];
      EXPECT_EQ(answer["failed"], Json::Value(Json::arrayValue));
      move["after"] = answer["after"];
      portions += answer["after"].asString() + " ";
    } while (move["after"].isString());
    EXPECT_EQ(portions, "/v/a/b/2 /v/a/bad\xff  ");
    for (const bool restarted : {false, true}) {
      for (const std::string query :
           {R"({"prefix":{"KAVOMDPath":"/"}})", R"({"term":{"KAVOMDParent":"/w/b"}})",
            R"({"term":{"KAVOMDParent":"/v/a"}})", R"({"term":{"KAVOMDSearchAncestor":"/w"}})",
            R"({"term":{"KAVOMDSearchAncestor":"/v/a"}})", R"({"term":{"Note":"v a b"}})",
            R"({"term":{"KAVOMDIdentifier":"/v/a/b"}})", R"({"term":{"KAVOMDTitle":"new"}})",
            R"({"term":{"KAVOMDTitle":"old"}})", R"({"term":{"KAVOMDDisplayName":"w b"}})"}) {
        EXPECT_EQ(at_once.Documents(query, R"({"size":100})"),
                  one_by_one.Documents(query, R"({"size":100})"))
            << query;
      }
      for (const std::string search :
           {R"({"words":"alpha"})", R"({"words":"beta"})", R"({"words":"b","sort":"path"})",
            R"({"name":"replaces"})", R"({"below":"/w","sort":"path"})", R"({"below":"/v/a"})"}) {
        EXPECT_EQ(at_once.Search(search), one_by_one.Search(search)) << search;
      }
      if (!restarted) {
        at_once.Restart();
      }
    }
  }
}

TEST(Engine, WhatCannotMoveIsToldAndStays) {
  EngineFixture engine;
  for (const char* path : {"/v/a/1", "/v/a/2", "/v/a/3"}) {
    engine.Add(path);
  }
  // A folder is no number.
  const Json::Value answer =
      engine.Send("document_move_below",
                  Parsed(R"({"from":"/v/a","to":"/w","size":2,"folder_field":["KAVOMDFSSize"]})"));
  EXPECT_EQ(Answer(answer), "ok");
  std::string failed;
  for (const Json::Value& item : answer["data"]["failed"]) {
    failed += item["doc_id"].asString() + " " + Answer(item) + " ";
  }
  EXPECT_EQ(failed, "/v/a/1 2007 /v/a/2 2007 ");
  EXPECT_EQ(answer["data"]["after"], "/v/a/2");
  EXPECT_EQ(engine.Query(R"({"prefix":{"KAVOMDPath":"/"}})"), "/v/a/1 /v/a/2 /v/a/3");
}

TEST(Engine, PathsAreBytes) {
  EngineFixture engine;
  std::string deep;
  for (int i = 0; i < 100; ++i) {
    deep += "/" + std::string(39, "abcdefghijklmnopqrstuvwxyz"[i % 26]);
  }
  const std::string paths[] = {"/v/\xff\xfe\x80",
                               "/v/caf\u00e9",
                               "/v/cafe\u0301",
                               "/v/new\nline \"quoted\" \\",
                               "/v/" + std::string(255, 'n'),
                               deep + "/" + std::string(4095 - deep.size() - 1, 'z'),
                               std::string("/v/nul\0x", 8)};
  for (const std::string& path : paths) {
    EXPECT_EQ(engine.Add(path), "ok");
  }
  engine.Do("commit");
  engine.Restart();
  for (const std::string& path : paths) {
    Json::Value data;
    data["query"]["qsl"]["term"]["KAVOMDPath"] = path;
    const Json::Value found = engine.Send("document_get_by_query", data)["data"];
    ASSERT_EQ(found.size(), 1U) << path;
    EXPECT_EQ(found[0], MakeDocument(path)) << path;
    EXPECT_EQ(Answer(engine.Send(RenameRequest(path, path + "'"))), "ok");
  }
  Json::Value everything;
  everything["query"]["qsl"]["prefix"]["KAVOMDPath"] = "";
  EXPECT_EQ(engine.Send("document_get_by_query", everything)["data"].size(), std::size(paths));
}

TEST(Engine, PagesAreInTheOrderOfPaths) {
  EngineFixture engine;
  for (int i = 25; i-- > 0;) {
    engine.Add("/v/d/" + std::string(1, static_cast<char>('a' + i)));
  }
  engine.Add("/v/d0");
  const std::string below = R"({"prefix":{"KAVOMDPath":"/v/d/"}})";
  EXPECT_EQ(engine.Documents(below).size(), 10U);
  EXPECT_EQ(engine.Query(below, R"({"from":23,"size":10000})"), "/v/d/x /v/d/y");
  EXPECT_EQ(engine.Query(R"({"term":{"KAVOMDParent":"/v/d"}})", R"({"from":24})"), "/v/d/y");
  const std::string parent = R"({"term":{"KAVOMDParent":"/v/d"}})";
  for (const std::string& query : {below, parent}) {
    EXPECT_EQ(engine.Query(query, R"({"after":"/v/d/w"})"), "/v/d/x /v/d/y") << query;
    EXPECT_EQ(engine.Query(query, R"({"after":"/v/d/x"})"), "/v/d/y") << query;
    EXPECT_EQ(engine.Query(query, R"({"after":"/v/d/w","from":1,"size":1})"), "/v/d/y") << query;
    EXPECT_EQ(engine.Query(query, R"({"after":"/v/a"})"), engine.Query(query)) << query;
    EXPECT_EQ(engine.Query(query, R"({"after":"/w"})"), "") << query;
  }
  EXPECT_EQ(engine.Query(R"({"term":{"KAVOMDPath":"/v/d/x"}})", R"({"after":"/v/d/x"})"), "");
  EXPECT_EQ(engine.Query(below, R"({"size":0})"), "");
  EXPECT_EQ(engine.Do("document_del_by_query", R"({"query":{"qsl":)" + below + "}}"), "ok");
  EXPECT_EQ(engine.Query(R"({"prefix":{"KAVOMDPath":"/"}})"), "/v/d0");
}

TEST(Engine, ItemsOfACompoundFailAlone) {
  EngineFixture engine;
  EXPECT_EQ(engine.Create("j", engine.Folder() / "j"), "ok");
  engine.Add("/v/a", R"({"KAVOMDTitle":"alpha"})");
  Json::Value request;
  Json::Value& list = request["compound"];
  list.append(RenameRequest("/v/a", "/v/b"));
  list.append(RenameRequest("/v/a", "/v/c"));  // It is gone from there.
  list.append(
      Parsed(R"({"command":"document_upsert_by_id","data":{"id":"j","doc_id":"/j","data":{}}})"));
  list.append(
      Parsed(R"({"command":"document_upsert_by_id","data":{"id":"k","doc_id":"/k","data":{}}})"));
  list.append(Parsed(R"({"command":"commit","data":{"id":"i"}})"));
  list.append(7);
  list.append(RenameRequest("/v/b", "/v/c"));
  const Json::Value reply = engine.Send(request);
  EXPECT_TRUE(reply["success"].asBool());
  EXPECT_TRUE(reply["has_fail"].asBool());
  std::string answers;
  for (const Json::Value& item : reply["data"]) {
    answers += Answer(item) + " ";
  }
  EXPECT_EQ(answers, "ok 2006 ok 2002 2000 2000 ok ");
  EXPECT_EQ(engine.Query(R"({"prefix":{"KAVOMDPath":"/"}})"), "/v/c");
  EXPECT_EQ(engine.Search(R"({"words":"alpha"})"), "/v/c");
}

TEST(Engine, IndexesArePausedMovedRenamedAndDeleted) {
  EngineFixture engine;
  const SyslogCapture log;
  TempFolder& folder = engine.Folder();
  const auto state = [&] {
    std::string text;
    const Json::Value reply = engine.Send(Parsed(R"({"command":"index_list"})"));
    for (const Json::Value& index : reply["data"]) {
      text += index["id"].asString() + "=" + index["state"].asString() + "@" +
              index["path"].asString().substr(folder.Path().size()) + " ";
    }
    return text;
  };
  engine.Add("/v/a", R"({"KAVOMDTitle":"kept"})");
  EXPECT_EQ(engine.Create("j", folder / "i"), "2003") << "another index's folder";
  EXPECT_EQ(engine.Create("j", folder / "j"), "ok");
  // Paused: everything in one file, no work, also after a restart.
  EXPECT_EQ(engine.Do("index_pause"), "ok");
  EXPECT_EQ(engine.Do("index_pause"), "ok");
  EXPECT_FALSE(std::filesystem::exists(folder / "i/index.db-wal"));
  struct stat status;
  ASSERT_EQ(stat((folder / "i/index.db").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777, 0600U) << "the text of everybody's files";
  engine.Restart();
  for (const char* command : {"commit", "document_get_by_query", "document_upsert_by_id"}) {
    EXPECT_EQ(engine.Do(command, R"({"doc_id":"/x","data":{}})"), "2004") << command;
  }
  // Moved while it is paused, it stays so.
  EXPECT_EQ(engine.Move(folder / "m/n"), "ok");
  EXPECT_EQ(state(), "i=paused@/m/n j=active@/j ");
  EXPECT_EQ(engine.Do("index_resume"), "ok");
  EXPECT_EQ(engine.Search(R"({"words":"kept"})"), "/v/a");
  // Renamed and moved with changes that are not committed yet.
  engine.Add("/v/b", R"({"KAVOMDTitle":"kept"})");
  EXPECT_EQ(engine.Do("index_config_set", R"({"data":{"id":"j"}})"), "2003");
  EXPECT_EQ(engine.Move(folder / "j"), "2003");
  EXPECT_EQ(
      engine.Do("index_config_set", R"({"data":{"id":"k","path":")" + (folder / "k/") + "\"}}"),
      "ok");
  EXPECT_EQ(state(), "j=active@/j k=active@/k ");
  EXPECT_EQ(engine.Do("commit"), "2002");
  EXPECT_EQ(Paths(engine.Send("search", Parsed(R"({"words":"kept"})"), "k")["data"], "path"),
            "/v/a /v/b");
  // Whoever moved the folder itself only tells where it is now.
  EXPECT_EQ(engine.Do("index_pause", "{}", "k"), "ok");
  std::filesystem::rename(folder / "k", folder / "by hand");
  EXPECT_EQ(engine.Move(folder / "by hand", "k"), "ok");
  EXPECT_EQ(engine.Do("index_resume", "{}", "k"), "ok");
  WriteText(folder / "j/others", "");
  EXPECT_EQ(engine.Do("index_delete", "{}", "j"), "ok");
  EXPECT_EQ(engine.Do("index_delete", "{}", "k"), "ok");
  EXPECT_EQ(engine.Do("index_delete", "{}", "k"), "2002");
  EXPECT_EQ(state(), "");
  EXPECT_EQ(folder.Names(), (std::set<std::string>{"j", "m", "registry.json"}));
  EXPECT_EQ(ReadText(folder / "j/others"), "");
  // A new index of the same id and place is empty.
  EXPECT_EQ(engine.Create("j", folder / "j"), "ok");
  EXPECT_EQ(engine.Send("search", Parsed(R"({"words":"kept"})"))["total"].asInt(), 0);
}

TEST(Engine, MovesToAnotherDisk) {
  EngineFixture engine;
  struct stat here;
  struct stat there;
  if (stat(engine.Folder().Path().c_str(), &here) != 0 || stat("/dev/shm", &there) != 0 ||
      access("/dev/shm", W_OK) != 0 || here.st_dev == there.st_dev) {
    GTEST_SKIP() << "/dev/shm is no other disk to write to";
  }
  TempFolder other("/dev/shm");
  engine.Add("/v/a", R"({"KAVOMDTitle":"kept"})");
  EXPECT_EQ(engine.Move(other / "x"), "ok");
  EXPECT_EQ(engine.Search(R"({"words":"kept"})"), "/v/a");
  EXPECT_FALSE(std::filesystem::exists(engine.Folder() / "i"));
  struct stat status;
  ASSERT_EQ(stat((other / "x/index.db").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777, 0600U) << "the text of everybody's files";
  engine.Restart();
  EXPECT_EQ(engine.Search(R"({"words":"kept"})"), "/v/a");
  EXPECT_EQ(engine.Do("index_delete"), "ok");
}

TEST(Engine, AtRestTheLogIsEmptyAndNothingIsLeftToDo) {
  using namespace std::chrono_literals;
  EngineFixture engine;
  const std::string log = engine.Folder() / "i/index.db-wal";
  EXPECT_FALSE(engine.Engine().CommitIdle(0s));
  // More segments than a text index keeps, each of a commit.
  for (int i = 0; i < 30; ++i) {
    engine.Add("/v/" + std::to_string(i),
               R"({"KAVOMDTextContent":"word )" + std::to_string(i) + "\"}");
    EXPECT_EQ(engine.Do("commit"), "ok");
  }
  engine.Add("/v/last");
  // Not before it has been quiet for so long.
  EXPECT_TRUE(engine.Engine().CommitIdle(1h));
  EXPECT_GT(std::filesystem::file_size(log), 0U);
  engine.Engine().AwaitChange({});
  for (int calls = 0; engine.Engine().CommitIdle(0s); ++calls) {
    ASSERT_LT(calls, 100);
  }
  EXPECT_EQ(std::filesystem::file_size(log), 0U);
  EXPECT_EQ(engine.Query(R"({"term":{"KAVOMDTextContent":"word"}})", R"({"size":0})"), "");
  EXPECT_EQ(engine.Documents(R"({"term":{"KAVOMDTextContent":"word"}})", R"({"size":100})").size(),
            30U);
  EXPECT_EQ(engine.Search(R"({"name":"last"})"), "/v/last");
}

TEST(Engine, WhatIsRemovedIsFoundNoMoreAndThenForgotten) {
  using namespace std::chrono_literals;
  EngineFixture engine;
  const auto total = [&engine] {
    return engine.Send("search", Parsed(R"({"words":"word"})"))["total"].asInt();
  };
  for (const char* path : {"/v/1", "/v/2", "/w/3"}) {
    engine.Add(path, R"({"KAVOMDTextContent":"word )" + std::string(500, 'x') + "\"}");
  }
  EXPECT_EQ(engine.Do("commit"), "ok");
  EXPECT_EQ(
      engine.Do("document_del_by_query", R"({"query":{"qsl":{"prefix":{"KAVOMDPath":"/w/"}}}})"),
      "ok");
  EXPECT_EQ(engine.Do("commit"), "ok");
  EXPECT_EQ(total(), 2);
  EXPECT_EQ(engine.Search(R"({"words":"word"})"), "/v/1 /v/2");
  EXPECT_EQ(engine.Query(R"({"term":{"KAVOMDTextContent":"word"}})"), "/v/1 /v/2");
  // A document that comes before it is forgotten, or after, has nothing of it.
  engine.Add("/w/4");
  engine.Restart();
  EXPECT_EQ(engine.Do("document_del_by_id", R"({"doc_id":"/w/4"})"), "ok");
  while (engine.Engine().CommitIdle(0s)) {
  }
  engine.Add("/w/5");
  EXPECT_EQ(engine.Search(R"({"words":"word"})"), "/v/1 /v/2");
  EXPECT_EQ(engine.Search(R"({"name":"3"})") + engine.Search(R"({"name":"4"})"), "");
  EXPECT_EQ(engine.Search(R"({"name":"5"})"), "/w/5");
}

}  // namespace
