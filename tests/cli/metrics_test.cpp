// What monitoring reads.
#include "cli/metrics.h"

#include <gtest/gtest.h>
#include <regex.h>

#include <iterator>
#include <set>
#include <sstream>
#include <vector>

#include "common/json.h"
#include "daemons/kavoelasticd/request_stats.h"
#include "support/temp_folder.h"

namespace vexlo::cli {
namespace {

using namespace std::chrono_literals;

// Groups of the first match, the whole of it first; none where the text does not match.
std::vector<std::string> Match(const std::string& text, const char* pattern) {
  regex_t compiled;
  EXPECT_EQ(regcomp(&compiled, pattern, REG_EXTENDED), 0);
  regmatch_t found[3];
  std::vector<std::string> groups;
  if (regexec(&compiled, text.c_str(), std::size(found), found, 0) == 0) {
    for (const regmatch_t& group : found) {
      groups.push_back(group.rm_so < 0
                           ? ""
                           : text.substr(static_cast<size_t>(group.rm_so),
                                         static_cast<size_t>(group.rm_eo - group.rm_so)));
    }
  }
  regfree(&compiled);
  return groups;
}

// Every sample is announced, has the form of the text format, and comes once.
void ExpectValid(const std::string& text) {
  std::set<std::string> seen;
  std::string announced;
  std::istringstream lines(text);
  for (std::string line; std::getline(lines, line);) {
    if (const auto parts = Match(line, "^# (HELP|TYPE) ([a-z_]+) .+$"); !parts.empty()) {
      announced = parts[2];
      EXPECT_TRUE(seen.insert(line).second) << line;
      continue;
    }
    const auto parts =
        Match(line, R"re(^([a-z_]+)(\{([a-z]+="([^"\\]|\\["\\n])*",?)+\})? -?[0-9.e+-]+$)re");
    ASSERT_FALSE(parts.empty()) << line;
    EXPECT_TRUE(parts[1].starts_with(announced)) << line;
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
