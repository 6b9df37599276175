// What monitoring reads.
#include "cli/metrics.h"

#include <gtest/gtest.h>

#include <fstream>
#include <regex>
#include <set>
#include <sstream>

#include "common/json.h"
#include "daemons/kavoelasticd/request_stats.h"
#include "support/temp_folder.h"

namespace vexlo::cli {
namespace {

// Every sample is announced, has the form of the text format, and comes once.
void ExpectValid(const std::string& text) {
  static const std::regex kAnnouncement("# (HELP|TYPE) ([a-z_]+) .+");
  static const std::regex kSample(
      R"re(([a-z_]+)(\{([a-z]+="([^"\\]|\\["\\n])*",?)+\})? -?[0-9.e+-]+)re");
  std::set<std::string> seen;
  std::string announced;
  std::istringstream lines(text);
  for (std::string line; std::getline(lines, line);) {
    std::smatch parts;
    if (std::regex_match(line, parts, kAnnouncement)) {
      announced = parts[2];
      EXPECT_TRUE(seen.insert(line).second) << line;
      continue;
    }
    ASSERT_TRUE(std::regex_match(line, parts, kSample)) << line;
    EXPECT_TRUE(parts.str(1).starts_with(announced)) << line;
    EXPECT_TRUE(seen.insert(line.substr(0, line.rfind(' '))).second) << line;
  }
}

TEST(MetricsTest, TextOfAState) {
  elasticd::RequestStats engine;
  Json::Value request;
  const auto answer = [&](const char* asked, const char* reply_text) {
    Json::Value reply;
    EXPECT_TRUE(JsonFromString(request, asked) && JsonFromString(reply, reply_text));
    return engine.Answer(request, [&](const Json::Value&) { return reply; });
  };
  answer(R"({"command":"search"})", R"({"success":true})");
  answer(R"({"command":"nonsense \" 1"})", R"({"success":false,"error":{"code":2000}})");
  answer(R"({"compound":[]})",
         R"({"success":true,"has_fail":true,"data":[{"success":true},
            {"success":false,"error":{"code":2002}},{"success":false,"error":{"code":2002}}]})");
  Json::Value state;
  ASSERT_TRUE(JsonFromString(state, R"({"resume_time":0,
    "daemons":[{"name":"kavoelasticd","running":true},{"name":"evnotifyd","running":false,"stats":null}],
    "shares":[{"share":"a \"b\\c\n","state":"idle","kinds":{"2":12,"9":1},"files":7,"errors":{"502":3},
      "progress":{"done":1,"found":2},"watch":{"watches":5,"lines":40,"overflows":1},
      "backlog":{"lines":3,"bytes":300,"age":1.5}},
      {"share":"b","state":"failing","watch":null}]})"));
  state["daemons"][0]["stats"] = answer(R"({"command":"stats"})", "{}");
  const std::string text = MetricsText(state);
  ExpectValid(text);
  for (const char* const line : {
           "fileindex_up{daemon=\"kavoelasticd\"} 1\n",
           "fileindex_up{daemon=\"evnotifyd\"} 0\n",
           "fileindex_paused 1\n",
           "fileindex_operations_total{share=\"a \\\"b\\\\c\\n\",kind=\"upsert\"} 12\n",
           "fileindex_freshness_seconds{share=\"a \\\"b\\\\c\\n\"} 1.5\n",
           "fileindex_worker_state{share=\"b\",state=\"failing\"} 1\n",
           "fileindex_engine_request_seconds_bucket{command=\"search\",le=\"+Inf\"} 1\n",
           "fileindex_engine_request_seconds_count{command=\"other\"} 1\n",
           "fileindex_engine_errors_total{code=\"2000\"} 1\n",
           "fileindex_engine_errors_total{code=\"2002\"} 2\n",
       }) {
    EXPECT_NE(text.find(line), std::string::npos) << line << "in\n" << text;
  }
}

TEST(MetricsTest, BacklogIsQueueAndSnapshot) {
  const TempFolder folder;
  const std::string queue = folder / "queue";
  EXPECT_EQ(BacklogOf(queue).lines, 0U);
  std::ofstream(queue + ".tmp") << "1\n2\n";
  std::ofstream(queue) << "3\ntorn";
  const Backlog backlog = BacklogOf(queue);
  EXPECT_EQ(backlog.lines, 3U);
  EXPECT_EQ(backlog.bytes, 10U);
  EXPECT_GT(backlog.age, 0);
  EXPECT_LT(backlog.age, 100);
}

}  // namespace
}  // namespace vexlo::cli
