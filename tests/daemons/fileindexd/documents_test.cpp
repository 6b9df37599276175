#include "daemons/fileindexd/documents.h"

#include <gtest/gtest.h>

#include <deque>
#include <string>
#include <vector>

#include "common/error.h"
#include "common/json.h"
#include "fileindex/paths.h"
#include "support/fake_engine.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

namespace {

const PrivateRoot kRoot;

constexpr char kAll[] =
    R"({"command":"document_move_below","data":{"folder_field":["KAVOMDParent","KAVOMDSearchAncestor"],"from":"/v/a","id":"i","size":5000,"to":"/v/b"}})";
constexpr char kRest[] =
    R"({"command":"document_move_below","data":{"after":"/v/a/x","folder_field":["KAVOMDParent","KAVOMDSearchAncestor"],"from":"/v/a","id":"i","size":5000,"to":"/v/b"}})";
constexpr char kList[] =
    R"({"command":"document_get_by_query","data":{"id":"i","query":{"load_field":["KAVOMDPath"],"qsl":{"prefix":{"KAVOMDPath":"/v/a/"}},"size":2000}}})";
constexpr char kMoves[] =
    R"({"compound":[{"command":"document_set_by_id","data":{"data":{"KAVOMDParent":"/v/b","KAVOMDPath":"/v/b/x","KAVOMDSearchAncestor":"/v/b"},"doc_id":"/v/a/x","id":"i"}},{"command":"document_set_by_id","data":{"data":{"KAVOMDParent":"/v/b/c","KAVOMDPath":"/v/b/c/y","KAVOMDSearchAncestor":"/v/b/c"},"doc_id":"/v/a/c/y","id":"i"}}]})";

constexpr char kDone[] = R"({"success":true,"data":{"failed":[]}})";
constexpr char kSomeFailed[] =
    R"({"success":true,"data":{"after":"/v/a/x","failed":[{"success":false,"doc_id":"/v/a/q","error":{"code":2007,"msg":"m"}}]}})";
constexpr char kUnknown[] =
    R"({"success":false,"error":{"code":2000,"msg":"the command is not known"}})";
constexpr char kNoSpace[] = R"({"success":false,"error":{"code":2010,"msg":"full"}})";
constexpr char kPage[] =
    R"({"success":true,"data":[{"KAVOMDPath":"/v/a/x"},{"KAVOMDPath":"/v/a/c/y"}]})";
constexpr char kSecondFailed[] =
    R"({"success":true,"has_fail":true,"data":[{"success":true},{"success":false,"error":{"code":2006,"msg":"m"}}]})";

TEST(Documents, AFolderMovesInPortionsOrPageByPage) {
  const struct {
    const char* name;
    std::deque<std::string> replies;
    std::vector<std::string> requests;
    std::string told;  // Of documents that did not move, then of the whole.
  } cases[] = {
      {"InPortions", {kSomeFailed, kDone}, {kAll, kRest}, "/v/a/q 2007 "},
      {"PageByPage", {kUnknown, kPage, kSecondFailed}, {kAll, kList, kMoves}, "/v/a/c/y 2006 "},
      {"Fails", {kSomeFailed, kNoSpace}, {kAll, kRest}, "/v/a/q 2007 2010"},
      {"NoList", {R"({"success":true})"}, {kAll}, "916"},
  };
  kRoot.MakeFolder("var/run");
  FakeEngine engine(vexlo::fileindex::kElasticdSocketPath.Get());
  const SyslogCapture log;
  for (const auto& c : cases) {
    engine.Script(c.replies);
    std::string told;
    size_t checks = 0;
    try {
      vexlo::fileindexd::MoveBelow(
          "i", "/v/b", "/v/a", [&] { ++checks; },
          [&](const std::string& path, const vexlo::fileindexd::FailedItem& item) {
            told += path + " " + std::to_string(item.code) + " ";
          });
    } catch (const vexlo::Error& error) {
      told += std::to_string(error.GetErrorCode());
    }
    EXPECT_EQ(told, c.told) << c.name;
    EXPECT_GE(checks, c.requests.size() / 2) << c.name;
    std::vector<std::string> requests;
    for (const std::string& text : engine.Take()) {
      Json::Value request;
      ASSERT_TRUE(vexlo::JsonFromString(request, text)) << c.name;
      requests.push_back(vexlo::JsonToString(request));
    }
    EXPECT_EQ(requests, c.requests) << c.name;
  }
}

}  // namespace
