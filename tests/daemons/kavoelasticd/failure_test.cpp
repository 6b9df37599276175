// What the engine says and keeps when its files are damaged, or the disk and the database refuse.
#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <functional>
#include <string>

#include "daemons/kavoelasticd/engine_fixture.h"
#include "support/faults.h"
#include "support/private_mounts.h"
#include "support/syslog_capture.h"

namespace {

FAULTABLE(int, fsync, (int fd), (fd))

TEST(EngineFailure, ADamagedIndexIsSetAsideUntilItIsMadeAnew) {
  struct Case {
    const char* name;
    std::function<void(const std::string&)> damage;
  };
  const auto sql = [](const char* text) {
    return [text](const std::string& file) {
      using vexlo::elasticd::Connection;
      Connection(file, Connection::Use::kWrite).Run(text);
    };
  };
  const Case cases[] = {
      {"Empty", [](const std::string& f) { std::ofstream(f, std::ios::trunc); }},
      {"APage",
       [](const std::string& f) {
         std::fstream(f, std::ios::in | std::ios::out).seekp(8192 * 3) << std::string(8192, 'Z');
       }},
      {"Gone", [](const std::string& f) { unlink(f.c_str()); }},
      {"AFolder", [](const std::string& f) { unlink(f.c_str()), mkdir(f.c_str(), 0755); }},
      {"AnotherDatabase", sql("DROP TABLE records")},
      {"AnotherIndex", sql("UPDATE meta SET v = 'x' WHERE k = 'token'")},
      {"AnotherVersion", sql("UPDATE meta SET v = '0' WHERE k = 'version'")},
      {"ARecord", sql("UPDATE records SET record = x'ff'")},
      {"ATextIndex", sql("UPDATE texts_data SET block = x'00' WHERE id > 10")},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    EngineFixture engine;
    SyslogCapture log;
    for (int i = 0; i < 200; ++i) {
      engine.Add("/v/" + std::to_string(i), R"({"KAVOMDTitle":"a title"})");
    }
    engine.Do("index_pause");
    const std::string file = engine.Folder() / "i/index.db";
    c.damage(file);
    engine.Do("index_resume");
    engine.Restart();
    const std::string query = R"({"query":{"qsl":{"term":{"KAVOMDTitle":"title"}}}})";
    for (int i = 0; i < 2; ++i) {
      EXPECT_EQ(engine.Do("document_get_by_query", query), "2005");
      EXPECT_EQ(engine.Do("document_upsert_by_id", R"({"doc_id":"/x","data":{}})"), "2005");
      EXPECT_EQ(engine.Do("index_pause"), "2005");
      engine.Restart();
    }
    EXPECT_EQ(std::filesystem::exists(file + ".damaged-1"), std::string(c.name) != "Gone");
    EXPECT_FALSE(std::filesystem::exists(file + ".damaged-2"));
    EXPECT_FALSE(log.Take().empty());
    EXPECT_EQ(engine.Create("i", engine.Folder() / "i"), "ok");
    EXPECT_EQ(engine.Add("/v/new"), "ok");
    EXPECT_EQ(engine.Query(R"({"prefix":{"KAVOMDPath":"/"}})"), "/v/new");
    EXPECT_EQ(engine.Do("index_delete"), "ok");
    EXPECT_EQ(engine.Folder().Names(), std::set<std::string>({"registry.json"}));
  }
}

TEST(EngineFailure, WhatTheDatabaseRefusesIsToldAtTheCommit) {
  EngineFixture engine;
  SyslogCapture log;
  engine.Add("/v/before");
  // Stands for whatever one statement may be refused for.
  engine.ChangeDatabase(
      "CREATE TRIGGER refuse BEFORE INSERT ON records WHEN instr(new.record, 'bad')"
      " BEGIN SELECT RAISE(ABORT, 'refused'); END");
  const auto document = [](const std::string& path, const std::string& text) {
    return WriteRequest("document_upsert_by_id", path,
                        MakeDocument(path, R"({"KAVOMDTextContent":")" + text + "\"}"));
  };
  // In a compound it fails alone, and leaves no part of it behind, nor of the words that waited
  // for their index before it.
  EXPECT_EQ(Answer(engine.Send(document("/v/0", "first"))), "ok");
  EXPECT_EQ(Answer(engine.Send(document("/v/0", "second"))), "ok");
  Json::Value request;
  request["compound"].append(document("/v/0", "third"));
  request["compound"].append(document("/v/1", "good "));
  request["compound"].append(document("/v/2", "bad "));
  request["compound"].append(document("/v/3", "good "));
  const Json::Value reply = engine.Send(request);
  EXPECT_TRUE(reply["has_fail"].asBool());
  EXPECT_EQ(Answer(reply["data"][2]), "2009");
  EXPECT_EQ(engine.Search(R"({"words":"third"})"), "/v/0");
  EXPECT_EQ(engine.Search(R"({"words":"second"})") + engine.Search(R"({"words":"first"})"), "");
  EXPECT_EQ(engine.Search(R"({"words":"good","sort":"path"})"), "/v/1 /v/3");
  EXPECT_EQ(engine.Search(R"({"words":"bad"})"), "");
  // Alone it takes what was not committed with it, and the commit says so.
  EXPECT_EQ(engine.Add("/v/4"), "ok");
  EXPECT_EQ(Answer(engine.Send(document("/v/5", "bad "))), "2009");
  EXPECT_EQ(engine.Add("/v/6"), "ok");
  EXPECT_EQ(engine.Do("commit"), "2011");
  EXPECT_EQ(engine.Do("commit"), "ok");
  EXPECT_EQ(engine.Query(R"({"prefix":{"KAVOMDPath":"/v"}})"), "/v/0 /v/1 /v/3 /v/6 /v/before");
}

TEST(EngineFailure, AFullDiskIsToldAndTakesNothingThatIsCommitted) {
  EngineFixture engine;
  const SyslogCapture log;
  const auto disk = ScopedMount::Tmpfs(engine.Folder() / "disk", "size=4m");
  SKIP_IF_REFUSED(disk);
  ASSERT_EQ(engine.Move(disk / "index"), "ok");
  engine.Add("/v/a", R"({"KAVOMDTitle":"kept"})");
  // More than there is room for in the file while it is in the log, too.
  for (int i = 0; i < 300; ++i) {
    engine.Add("/w/" + std::to_string(i), R"({"Quiet":")" + std::string(390, 'x') + "\"}");
  }
  EXPECT_EQ(engine.Do("commit"), "ok");
  std::ofstream filler(disk / "filler", std::ios::binary);
  while (filler << std::string(4096, 'x') << std::flush) {
  }
  std::string answer = "ok";
  for (int i = 0; i < 1000 && answer == "ok"; ++i) {
    answer = i % 10 == 9 ? engine.Do("commit") : engine.Add("/v/" + std::to_string(i));
  }
  EXPECT_EQ(answer, "2010");
  engine.Do("commit");  // May say that work was lost, but once only.
  EXPECT_EQ(engine.Search(R"({"words":"kept"})"), "/v/a");
  // Another disk takes it, with what cannot be brought from the log into its file.
  EXPECT_EQ(engine.Do("index_pause"), "2010") << "the log still fits into its file";
  EXPECT_EQ(engine.Move(engine.Folder() / "roomy"), "ok");
  EXPECT_FALSE(std::filesystem::exists(disk / "index"));
  EXPECT_EQ(engine.Add("/v/b", R"({"KAVOMDTitle":"kept"})"), "ok");
  EXPECT_EQ(engine.Search(R"({"words":"kept","sort":"path"})"), "/v/a /v/b");
}

TEST(EngineFailure, AMoveThatFailsLeavesTheIndexAndTheRoom) {
  EngineFixture engine;
  const SyslogCapture log;
  const auto disk = ScopedMount::Tmpfs(engine.Folder() / "disk", "size=64k");
  SKIP_IF_REFUSED(disk);
  for (int i = 0; i < 300; ++i) {
    engine.Add("/v/" + std::to_string(i), R"({"KAVOMDTitle":"kept"})");
  }
  EXPECT_EQ(engine.Move(disk / "index"), "2010");
  EXPECT_TRUE(std::filesystem::is_empty(disk / "index"));
  // A database that comes there later is another one.
  EXPECT_EQ(ReadText(engine.Folder() / "registry.json").find("move_to"), std::string::npos);
  engine.Restart();
  EXPECT_EQ(engine.Send("search", Parsed(R"({"words":"kept"})"))["total"].asInt(), 300);
}

TEST(EngineFailure, ADocumentThatCannotMoveStaysAlone) {
  EngineFixture engine;
  const SyslogCapture log;
  // What says where it was is written anew.
  for (const char* path : {"/v/a/1", "/v/a/bad", "/v/a/x", "/w/1"}) {
    engine.Add(path,
               R"({"KAVOMDTitle":"kept","Note":"/v/a","Quiet":")" + std::string(path) + "\"}");
  }
  engine.ChangeDatabase(
      "CREATE TRIGGER refuse BEFORE UPDATE ON records WHEN instr(new.record, 'bad')"
      " BEGIN SELECT RAISE(ABORT, 'refused'); END");
  // A folder is no number.
  Json::Value answer =
      engine.Send("document_move_below",
                  Parsed(R"({"from":"/v/a","to":"/w","size":2,"folder_field":["KAVOMDFSSize"]})"));
  EXPECT_EQ(answer["data"]["after"], "/v/a/bad");
  ASSERT_EQ(answer["data"]["failed"].size(), 2U) << answer;
  EXPECT_EQ(Answer(answer["data"]["failed"][0]), "2007");
  answer = engine.Send(
      "document_move_below",
      Parsed(
          R"({"from":"/v/a","to":"/w","folder_field":["KAVOMDParent","KAVOMDSearchAncestor"]})"));
  ASSERT_EQ(answer["data"]["failed"].size(), 1U) << answer;
  EXPECT_EQ(answer["data"]["failed"][0]["doc_id"], "/v/a/bad");
  EXPECT_EQ(engine.Search(R"({"words":"kept","sort":"path"})"), "/v/a/bad /w/1 /w/x");
}

TEST(EngineFailure, AChangeOfTheRegistryThatCannotBeWrittenChangesNothing) {
  EngineFixture engine;
  const SyslogCapture log;
  engine.Add("/v/a", R"({"KAVOMDTitle":"kept"})");
  for (const char* command : {"index_delete", "index_pause", "index_create"}) {
    const ScopedFault fault("fsync", EIO, 1, /*lasting=*/true);
    const std::string path = engine.Folder() / "j";
    EXPECT_EQ(
        std::string(command) == "index_create" ? engine.Create("j", path) : engine.Do(command),
        "2009")
        << command;
  }
  EXPECT_EQ(engine.Search(R"({"words":"kept"})"), "/v/a");
  engine.Restart();
  EXPECT_EQ(engine.Search(R"({"words":"kept"})"), "/v/a");
}

}  // namespace
