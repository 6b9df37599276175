#include <gtest/gtest.h>

#include <string>

#include "daemons/kavoelasticd/engine_fixture.h"

namespace vexlo::elasticd {
namespace {

struct SearchCase {
  const char* name;
  std::string data;
  std::string want;  // Paths in the order of the reply, or a code.
};

std::string Again(const std::string& text, int count) {
  std::string all;
  for (int i = 0; i < count; ++i) {
    all += text;
  }
  return all;
}

std::string Numbers(int count) {
  std::string numbers;
  for (int i = 0; i < count; ++i) {
    numbers += std::to_string(i);
    numbers += ' ';
  }
  return numbers;
}

TEST(Search, FindsWordsNamesAndWhatTheFiltersLeave) {
  EngineFixture engine;
  engine.Add("/v/a/report.txt",
             R"({"KAVOMDTextContent":"The quick brown foxes jumped over a lazy dog. Budget 2020.",
                 "KAVOMDFSSize":100,"KAVOMDFSContentChangeDate":1000})");
  engine.Add("/v/a/fox.JPG", R"({"KAVOMDTitle":"Winter in Zu\u0308rich","KAVOMDFSSize":200,
                 "KAVOMDFSContentChangeDate":3000,"KAVOMDAuthors":"Ada Lovelace"})");
  engine.Add("/v/ab/notes.md", R"({"KAVOMDTextContent":"dog brown quick fox","KAVOMDFSSize":300,
                 "KAVOMDFSContentChangeDate":2000,"Quiet":"whisper","Quiet text":"murmur","Hidden":"secretly"})");
  engine.Add("/v/b/\u6771\u4eac\u90fd\u306e\u5730\u56f3.pdf",
             "{\"KAVOMDTextContent\":\"\u65e5\u672c\u8a9e\u306e\u6587\u7ae0\"}");
  const SearchCase cases[] = {
      {"Stem", R"({"words":"fox","sort":"path"})", "/v/a/fox.JPG /v/a/report.txt /v/ab/notes.md"},
      {"NameCountsMost", R"({"words":"fox","size":1})", "/v/a/fox.JPG"},
      {"WordsOfDifferentFields", R"({"words":"fox winter"})", "/v/a/fox.JPG"},
      {"Phrase", R"({"words":"\"quick brown\""})", "/v/a/report.txt"},
      {"BeginningBeyondTheStem", R"({"words":"lovelac*"})", "/v/a/fox.JPG"},
      {"NumberInCatchAll", R"({"words":"300"})", "/v/ab/notes.md"},
      {"OutsideCatchAll", R"({"words":"whisper"})", ""},
      {"TextOutsideCatchAll", R"({"words":"murmur"})", ""},
      {"NotStoredButFound", R"({"words":"secretly"})", "/v/ab/notes.md"},
      {"PathIsNotSearched", R"({"words":"ab"})", ""},
      {"Operators", R"({"words":"fox) OR (NEAR"})", ""},
      {"IdeographsApart", "{\"words\":\"\u65e5\u8a9e\"}", ""},
      {"PartOfName", R"({"name":"OTE"})", "/v/ab/notes.md"},
      {"GramsApart", R"({"name":"reporeport"})", ""},
      {"NameAndWords", R"({"name":"o","words":"brown"})", "/v/ab/notes.md /v/a/report.txt"},
      {"Below", R"({"words":"fox","below":"/v/a","sort":"name"})", "/v/a/fox.JPG /v/a/report.txt"},
      {"BelowWithSlash", R"({"below":"/v/ab/"})", "/v/ab/notes.md"},
      {"BelowItself", R"({"below":"/v/ab/notes.md"})", ""},
      {"Types", R"({"types":["jpg",".MD"],"sort":"path"})", "/v/a/fox.JPG /v/ab/notes.md"},
      {"Sizes", R"({"size_min":101,"size_max":300,"sort":"size","descending":true})",
       "/v/ab/notes.md /v/a/fox.JPG"},
      {"Dates", R"({"modified_max":2000,"sort":"modified"})", "/v/a/report.txt /v/ab/notes.md"},
      {"SameWordsAgain", R"({"words":")" + Again("FOX wint* fox ", 40) + "\"}", "/v/a/fox.JPG"},
      {"UnknownMembers", R"({"words":"budget","colour":"red"})", "/v/a/report.txt"},
  };
  for (const SearchCase& c : cases) {
    EXPECT_EQ(engine.Search(c.data), c.want) << c.name;
  }
  const SearchCase refused[] = {
      {"Sort", R"({"sort":"colour"})", "2000"},
      {"From", R"({"from":1e30})", "2000"},
      {"Below", R"({"below":{}})", "2000"},
      {"Ids", R"({"ids":["nowhere"]})", "2002"},
      {"IdsAsText", R"({"ids":"i"})", "2000"},
      {"Words", R"({"words":")" + Numbers(65) + "\"}", "2000"},
      {"WordsOfAPhrase", R"({"words":"\")" + Again("fox ", 1001) + R"(\""})", "2000"},
  };
  for (const SearchCase& c : refused) {
    EXPECT_EQ(engine.Do("search", c.data), c.want) << c.name;
  }
}

TEST(Search, ShowsWhyAndWhat) {
  EngineFixture engine;
  std::string text = "\u00e9";
  for (int i = 0; i < 300; ++i) {
    text += " w\u00f6rd" + std::to_string(i);
  }
  engine.Add("/v/long.txt", "{\"KAVOMDTextContent\":\"" + text +
                                " foxes\\nand GEESE\",\"KAVOMDFSSize\":7,\"KAVOMDIsDir\":false}");
  EXPECT_EQ(engine.Create("j", engine.Folder() / "j"), "ok");
  EXPECT_EQ(engine.Do("commit"), "ok");
  const Json::Value reply = engine.Send("search", Parsed(R"({"words":"fox geese","snippet":true,
                                       "load_field":["KAVOMDFSName","Hidden","none"]})"));
  EXPECT_EQ(reply["total"].asInt(), 1);
  Json::Value hit = reply["data"][0];
  EXPECT_GT(hit["score"].asDouble(), 0);
  hit.removeMember("score");
  const std::string snippet = hit["snippet"].asString();
  hit.removeMember("snippet");
  EXPECT_EQ(hit, Parsed(R"({"id":"i","path":"/v/long.txt","name":"long.txt","size":7,
                            "modified":null,"is_dir":false,"KAVOMDFSName":"long.txt"})"));
  EXPECT_TRUE(snippet.starts_with("\u2026w\u00f6rd")) << snippet;
  EXPECT_TRUE(
      snippet.ends_with("\x02"
                        "foxes\x03 and \x02"
                        "GEESE\x03"))
      << snippet;
  // A paused index is left out of a search of all, and refused when it is named.
  EXPECT_EQ(engine.Do("index_pause", "{}", "j"), "ok");
  EXPECT_EQ(engine.Send("search", Parsed(R"({"words":"fox"})"))["skipped"],
            Parsed(R"([{"id":"j","code":2004}])"));
  EXPECT_EQ(engine.Do("search", R"({"ids":["i","j"]})"), "2004");
}

TEST(Search, MergesThePagesOfSeveralIndexes) {
  EngineFixture engine;
  EXPECT_EQ(engine.Create("j", engine.Folder() / "j"), "ok");
  for (int i = 0; i < 10; ++i) {
    const std::string path = "/v/" + std::to_string(i);
    EXPECT_EQ(Answer(engine.Send(WriteRequest("document_upsert_by_id", path, MakeDocument(path),
                                              i % 3 == 0 ? "i" : "j"))),
              "ok");
  }
  // They fit equally well, and their paths are in the other order than their numbers.
  for (int i = 40; i-- > 20;) {
    const std::string path = "/w/" + std::to_string(i);
    engine.Send(WriteRequest("document_upsert_by_id", path,
                             MakeDocument(path, R"({"KAVOMDTextContent":"quarterly report"})"),
                             i % 2 == 0 ? "i" : "j"));
  }
  EXPECT_EQ(engine.Do("commit", "{}", "j"), "ok");
  std::string pages;
  for (int from = 0; from < 20; from += 4) {
    pages += from == 0 ? "" : " ";
    pages += engine.Search(R"({"words":"quarterly","size":4,"from":)" + std::to_string(from) + "}");
  }
  EXPECT_EQ(pages, engine.Search(R"({"words":"quarterly","size":20})"));
  EXPECT_EQ(engine.Search(R"({"sort":"path","from":2,"size":4})"), "/v/2 /v/3 /v/4 /v/5");
  EXPECT_EQ(engine.Search(R"({"ids":["j","j"],"sort":"path","from":2,"size":2})"), "/v/4 /v/5");
}

TEST(Search, EndsAtItsDeadline) {
  const TempFolder folder;
  Connection db(folder / "any.db", Connection::Use::kCreate);
  const auto count = [&](const std::string& to) {
    Sql(db, "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n WHERE i < " + to +
                ") SELECT count(*) FROM n")
        .Run();
  };
  {
    const TimeLimit limit(db, std::chrono::steady_clock::now() + std::chrono::milliseconds(50));
    try {
      count("1e15");
      FAIL();
    } catch (const Failure& failure) {
      EXPECT_EQ(failure.GetCode(), Code::kTimeIsUp);
    }
    EXPECT_THROW(count("1"), Failure) << "it is not begun";
  }
  EXPECT_NO_THROW(count("100000"));
}

}  // namespace
}  // namespace vexlo::elasticd
