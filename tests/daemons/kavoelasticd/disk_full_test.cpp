#include <fstream>

#include "daemons/kavoelasticd/engine_fixture.h"
#include "support/private_mounts.h"

namespace {

TEST(DiskFull, WhatIsCommittedStaysAndWorkGoesOnWhenThereIsRoom) {
  EngineFixture engine;
  const auto disk = ScopedMount::Tmpfs(engine.Folder() / "disk", "size=4m");
  SKIP_IF_REFUSED(disk);
  ASSERT_EQ(engine.Create("small", disk / "index"), "ok");
  const auto add = [&engine](int i) {
    const std::string path = "/v/" + std::to_string(i);
    const std::string text = "kept " + std::string(20000, static_cast<char>('a' + i % 26));
    return Answer(engine.Send(
        WriteRequest("document_upsert_by_id", path,
                     MakeDocument(path, R"({"KAVOMDTextContent":")" + text + "\"}"), "small")));
  };
  const auto find = [&engine] {
    return engine.Send("search", Parsed(R"({"ids":["small"],"words":"kept","size":1000})"))["total"]
        .asInt();
  };
  for (int i = 0; i < 5; ++i) {
    ASSERT_EQ(add(i), "ok");
  }
  ASSERT_EQ(engine.Do("commit", "{}", "small"), "ok");
  // Something else takes the rest of the disk, and more is written than is left.
  std::ofstream filler(disk / "filler", std::ios::binary);
  while (filler << std::string(4096, 'x') << std::flush) {
  }
  std::string answer = "ok";
  for (int i = 5; i < 1000 && answer == "ok"; ++i) {
    answer = i % 10 == 9 ? engine.Do("commit", "{}", "small") : add(i);
  }
  EXPECT_EQ(answer, "2010");
  EXPECT_EQ(find(), 5);
  engine.Do("commit", "{}", "small");  // May say that work was lost, but once only.
  filler.close();
  EXPECT_EQ(unlink((disk / "filler").c_str()), 0);
  EXPECT_EQ(add(2000), "ok");
  EXPECT_EQ(engine.Do("commit", "{}", "small"), "ok");
  EXPECT_EQ(find(), 6);
  engine.Restart();
  EXPECT_EQ(find(), 6);
}

}  // namespace
