#include "cli/text.h"

#include <gtest/gtest.h>

namespace vexlo::cli {
namespace {

TEST(Text, SendsNothingToATerminalThatItObeys) {
  const struct {
    std::string text;
    std::string shown;
  } rows[] = {
      {"a\033[1m\x7f\n", "a\\033[1m\\177\\012"},
      {"\u00e9 \u017b \u2028\u2019 \U0001f642", "\u00e9 \u017b \u2028\u2019 \U0001f642"},
      {"\xc2\x9b"
       "2J\u0080\u00a0",
       "\\302\\2332J\\302\\200\u00a0"},
      {"exe.\u202egpj", "exe.\\342\\200\\256gpj"},
      {"\u2066\u2069\u206a", "\\342\\201\\246\\342\\201\\251\u206a"},
      {"caf\xe9 \x9b \xe2\x80", "caf\xe9 \\233 \xe2\\200"},
      {"\xc0\x9b \xe0\x82\x9b", "\\300\\233 \\340\\202\\233"},
      {"\xe1\xc2\x9b", "\xe1\\302\\233"},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(ForTerminal(row.text), row.shown);
  }
}

}  // namespace
}  // namespace vexlo::cli
