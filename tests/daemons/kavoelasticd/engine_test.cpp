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
  for (const char* const request :
       {"[]", R"({"command":"commit","data":7})", R"({"compound":{}})"}) {
    const Json::Value reply = engine.Send(Parsed(request));
    EXPECT_EQ(Answer(reply), "2000") << request;
    EXPECT_TRUE(reply["error"]["msg"].isString()) << request;
  }
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
      {"NoMappings", kCreate, R"({"id":"j","path":"/x"})", "2008"},
      {"UnknownLanguage", kCreate,
       R"({"id":"j","path":"/x","settings":{"language":"x' y"},)" + mappings + R"("x":1}})",
       "2008"},
      {"FolderIsAFile", kCreate, R"({"id":"j","path":"/dev/null/x",)" + mappings + R"("x":1}})",
       "2009"},
      {"UnknownQuery", kQuery, R"({"query":{"qsl":{"near":{}}}})", "2001"},
      {"EmptyTerm", kDelete, R"({"query":{"qsl":{"term":{}}}})", "2001"},
      {"FlatWithoutAFolder", kQuery,
       R"({"query":{"qsl":{"term":{"KAVOMDTitle":"x"}},"flat":true}})", "2001"},
      {"SetMissing", kSet, R"({"doc_id":"/v/b","data":{}})", "2006"},
      {"SetPathToNothing", kSet, R"({"doc_id":"/v/a","data":{"KAVOMDPath":""}})", "2007"},
      {"MoveIntoItself", kMove, R"({"from":"/v","to":"/v/w"})", "2000"},
      {"MoveOutOfItself", kMove, R"({"from":"/v/w","to":"/v"})", "2000"},
      {"NoDocument", kUpsert, R"({"doc_id":"/v/b"})", "2007"},
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
        {{"KeywordIsNoWord", R"({"term":{"KAVOMDIdentifier":"id"}})", ""},
         {"KeywordBeginning", R"({"prefix":{"KAVOMDIdentifier":"id"}})", doc},
         {"ListElement", "{\"term\":{\"KAVOMDAuthors\":\"B\u00e9la\"}}", doc},
         {"Escaped", R"({"term":{"Escaped":"one two"}})", doc},
         {"Lower", "{\"term\":{\"Lower\":\"mixed E\u0301\"}}", doc},
         {"TextPhrase", R"({"term":{"KAVOMDTitle":"water deep"}})", doc},
         {"TextNoPhrase", R"({"term":{"KAVOMDTitle":"deep water"}})", ""},
         {"TextBeginning", R"({"prefix":{"KAVOMDTitle":"wat"}})", doc},
         {"NotStored", R"({"term":{"Hidden":"found"}})", doc},
         {"IntAsText", R"({"term":{"KAVOMDFSSize":"12"}})", doc},
         {"Bool", R"({"term":{"KAVOMDIsDir":false}})", doc},
         {"Gram", R"({"term":{"KAVOMDSearchFileName":"GBLU"}})", doc},
         {"GramNotBeginning", R"({"prefix":{"KAVOMDSearchFileName":"blu"}})", ""},
         {"AncestorIsWhole", R"({"term":{"KAVOMDSearchAncestor":"/v/"}})", ""},
         {"And", R"({"and":[{"term":{"Free":"some"}},{"term":{"KAVOMDPath":"/v/dd/x"}}]})", ""},
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
  const std::string parent = R"({"term":{"KAVOMDParent":"/v/d"}})";
  for (const std::string& query : {below, parent}) {
    EXPECT_EQ(engine.Query(query, R"({"after":"/v/d/w"})"), "/v/d/x /v/d/y") << query;
    EXPECT_EQ(engine.Query(query, R"({"after":"/v/d/w","from":1,"size":1})"), "/v/d/y") << query;
    EXPECT_EQ(engine.Query(query, R"({"after":"/v/a"})"), engine.Query(query)) << query;
  }
  EXPECT_EQ(engine.Query(R"({"term":{"KAVOMDPath":"/v/d/x"}})", R"({"after":"/v/d/x"})"), "");
  EXPECT_EQ(engine.Do("document_del_by_query", R"({"query":{"qsl":)" + below + "}}"), "ok");
  EXPECT_EQ(engine.Query(R"({"prefix":{"KAVOMDPath":"/"}})"), "/v/d0");
}

TEST(Engine, ItemsOfACompoundFailAlone) {
  EngineFixture engine;
  EXPECT_EQ(engine.Create("j", engine.Folder() / "j"), "ok");
  engine.Add("/v/a", R"({"KAVOMDTitle":"alpha"})");
  // The second is gone from there; then another index, one that is not there, and no such items.
  const Json::Value reply = engine.Send(Parsed(R"({"compound":[
      {"command":"document_set_by_id","data":{"id":"i","doc_id":"/v/a","data":{"KAVOMDPath":"/v/b"}}},
      {"command":"document_set_by_id","data":{"id":"i","doc_id":"/v/a","data":{"KAVOMDPath":"/v/c"}}},
      {"command":"document_upsert_by_id","data":{"id":"j","doc_id":"/j","data":{}}},
      {"command":"document_upsert_by_id","data":{"id":"k","doc_id":"/k","data":{}}},
      {"command":"commit","data":{"id":"i"}}, 7,
      {"command":"document_set_by_id","data":{"id":"i","doc_id":"/v/b","data":{"KAVOMDPath":"/v/c"}}}
      ]})"));
  EXPECT_TRUE(reply["success"].asBool());
  EXPECT_TRUE(reply["has_fail"].asBool());
  std::string answers;
  for (const Json::Value& item : reply["data"]) {
    answers += Answer(item) + " ";
  }
  EXPECT_EQ(answers, "ok 2006 ok 2002 2000 2000 ok ");
  EXPECT_EQ(engine.Search(R"({"words":"alpha"})"), "/v/c");
}

TEST(Engine, IndexesArePausedMovedRenamedAndDeleted) {
  EngineFixture engine;
  const SyslogCapture log;
  TempFolder& folder = engine.Folder();
  // Another disk, where there is one.
  const TempFolder other(access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp");
  const auto state = [&] {
    std::string text;
    const Json::Value reply = engine.Send(Parsed(R"({"command":"index_list"})"));
    for (const Json::Value& index : reply["data"]) {
      text += index["id"].asString() + "=" + index["state"].asString() + "@" +
              std::filesystem::path(index["path"].asString()).filename().string() + " ";
    }
    return text;
  };
  const auto expect_private = [](const std::string& file) {
    struct stat status {};
    EXPECT_EQ(stat(file.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777, 0600U) << "the text of everybody's files";
  };
  engine.Add("/v/a", R"({"KAVOMDTitle":"kept"})");
  EXPECT_EQ(engine.Create("j", folder / "i"), "2003") << "another index's folder";
  // By another name it is the same place.
  std::filesystem::create_directory_symlink(folder / ".", folder / "link");
  EXPECT_EQ(engine.Create("j", folder / "link/i"), "2003");
  EXPECT_EQ(engine.Move(folder / "link/i"), "ok");
  EXPECT_EQ(engine.Search(R"({"words":"kept"})"), "/v/a");
  EXPECT_EQ(engine.Move(folder / "i"), "ok");
  std::filesystem::remove(folder / "link");
  EXPECT_EQ(engine.Create("j", folder / "j"), "ok");
  // Paused: everything in one file, no work, also after a restart.
  EXPECT_EQ(engine.Do("index_pause"), "ok");
  EXPECT_EQ(engine.Do("index_pause"), "ok");
  EXPECT_FALSE(std::filesystem::exists(folder / "i/index.db-wal"));
  expect_private(folder / "i/index.db");
  engine.Restart();
  for (const char* command : {"commit", "document_get_by_query", "document_upsert_by_id"}) {
    EXPECT_EQ(engine.Do(command, R"({"doc_id":"/x","data":{}})"), "2004") << command;
  }
  // Moved while it is paused, it stays so. What stands there is kept.
  std::filesystem::create_directories(other / "m/n");
  WriteText(other / "m/n/index.db", "a backup");
  EXPECT_EQ(engine.Move(other / "m/n"), "ok");
  EXPECT_EQ(state(), "i=paused@n j=active@j ");
  expect_private(other / "m/n/index.db");
  EXPECT_EQ(ReadText(other / "m/n/index.db.found-1"), "a backup");
  EXPECT_FALSE(std::filesystem::exists(folder / "i"));
  EXPECT_EQ(engine.Do("index_resume"), "ok");
  EXPECT_EQ(engine.Search(R"({"words":"kept"})"), "/v/a");
  // Renamed and moved with changes that are not committed yet.
  engine.Add("/v/b", R"({"KAVOMDTitle":"kept"})");
  EXPECT_EQ(engine.Do("index_config_set", R"({"data":{"id":"j"}})"), "2003");
  EXPECT_EQ(engine.Move(folder / "j"), "2003");
  EXPECT_EQ(
      engine.Do("index_config_set", R"({"data":{"id":"k","path":")" + (folder / "k/") + "\"}}"),
      "ok");
  EXPECT_EQ(state(), "j=active@j k=active@k ");
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
  EXPECT_EQ(folder.Names(), (std::set<std::string>{"j", "registry.json"}));
  EXPECT_EQ(ReadText(folder / "j/others"), "");
  // A new index of the same id and place is empty.
  EXPECT_EQ(engine.Create("j", folder / "j"), "ok");
  EXPECT_EQ(engine.Send("search", Parsed(R"({"words":"kept"})"))["total"].asInt(), 0);
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
  EXPECT_EQ(engine.Documents(R"({"term":{"KAVOMDTextContent":"word"}})", R"({"size":100})").size(),
            30U);
  EXPECT_EQ(engine.Search(R"({"name":"last"})"), "/v/last");
}

}  // namespace
