#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "daemons/kavoelasticd/engine_fixture.h"

namespace {

// Each round moves the same documents to another folder in one compound: a search must find all of
// them, in one folder.
TEST(Threads, SearchesSeeOneCommitWhileDocumentsMove) {
  EngineFixture engine;
  constexpr int kDocuments = 50;
  constexpr int kRounds = 20;
  for (int i = 0; i < kDocuments; ++i) {
    engine.Add("/0/d" + std::to_string(i), R"({"KAVOMDTextContent":"shared text"})");
  }
  ASSERT_EQ(engine.Do("commit"), "ok");
  std::atomic<bool> done = false;
  std::vector<std::thread> readers;
  readers.reserve(2);
  std::atomic<int> searches = 0;
  for (int t = 0; t < 2; ++t) {
    readers.emplace_back([&] {
      do {
        const Json::Value reply =
            engine.Send("search", Parsed(R"({"words":"shared","size":100,"snippet":true})"));
        ASSERT_EQ(reply["data"].size(), static_cast<unsigned>(kDocuments)) << reply;
        const std::string folder = reply["data"][0]["path"].asString();
        for (const Json::Value& hit : reply["data"]) {
          ASSERT_EQ(hit["path"].asString().substr(0, hit["path"].asString().rfind('/')),
                    folder.substr(0, folder.rfind('/')));
        }
        ++searches;
      } while (!done);
    });
  }
  std::thread idle([&] {
    while (!done) {
      engine.Engine().CommitIdle(std::chrono::seconds(0));
      std::this_thread::yield();
    }
  });
  for (int round = 0; round < kRounds; ++round) {
    Json::Value request;
    for (int i = 0; i < kDocuments; ++i) {
      const std::string name = "/d" + std::to_string(i);
      request["compound"].append(RenameRequest("/" + std::to_string(round) + name,
                                               "/" + std::to_string(round + 1) + name));
    }
    EXPECT_FALSE(engine.Send(request)["has_fail"].asBool());
  }
  done = true;
  idle.join();
  for (std::thread& reader : readers) {
    reader.join();
  }
  EXPECT_GE(searches, 2);
}

// A writer that holds its turn does not hold up searches: they answer while it waits for them.
TEST(Threads, ASearchDoesNotWaitForAWriter) {
  TempFolder folder;
  const vexlo::elasticd::IndexInfo info = {"token", Parsed(kMappings), Json::objectValue, {}};
  vexlo::elasticd::Store::Create(folder / "i", info);
  vexlo::elasticd::Store store(folder / "i", "token");
  store.Write([&](vexlo::elasticd::Writer& writer, vexlo::elasticd::Session& /*session*/) {
    writer.Upsert("/a", Parsed("{}"));
    int seen = -1;
    std::async(std::launch::async, [&] {
      store.ReadCommitted([&](vexlo::elasticd::Session& session) {
        vexlo::elasticd::Sql row(session.db, "SELECT count(*) FROM docs");
        seen = row.Row() ? static_cast<int>(row.IntAt(0)) : -2;
      });
    }).get();
    EXPECT_EQ(seen, 0);
  });
}

TEST(Threads, PausesAndRenamesWaitForWhatIsRunning) {
  EngineFixture engine;
  engine.Add("/v/a", R"({"KAVOMDTitle":"kept"})");
  std::atomic<bool> done = false;
  std::vector<std::thread> users;
  users.reserve(3);
  for (int t = 0; t < 3; ++t) {
    users.emplace_back([&, t] {
      while (!done) {
        const std::string answer =
            t == 0 ? engine.Do("document_upsert_by_id", R"({"doc_id":"/v/b","data":{}})")
                   : engine.Do("search", R"({"ids":["i"],"words":"kept"})");
        ASSERT_TRUE(answer == "ok" || answer == "2004" || answer == "2002") << answer;
      }
    });
  }
  for (int i = 0; i < 15; ++i) {
    EXPECT_EQ(engine.Do("index_pause"), "ok");
    EXPECT_EQ(engine.Do("index_resume"), "ok");
    EXPECT_EQ(engine.Do("index_config_set", R"({"data":{"id":"other"}})"), "ok");
    EXPECT_EQ(engine.Do("index_config_set", R"({"data":{"id":"i"}})", "other"), "ok");
  }
  done = true;
  for (std::thread& user : users) {
    user.join();
  }
  EXPECT_EQ(engine.Search(R"({"words":"kept"})"), "/v/a");
}

}  // namespace
