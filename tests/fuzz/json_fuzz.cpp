// JSON texts: what is read is the same when it was written, in either form, and merging into it
// keeps to its rules.
#include "common/error.h"
#include "common/json.h"
#include "fuzz/target.h"

namespace {

Json::Value Merged(Json::Value target, const Json::Value& changes) {
  try {
    vexlo::JsonApplyChanges(target, changes);
  } catch (const vexlo::Error& error) {
    fuzz::Require(error.GetErrorCode() == 120, "a merge fails with another code");
  }
  return target;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text = fuzz::TextOf(data, size);
  std::string quoted;
  vexlo::AppendJsonText(quoted, text);
  Json::Value value;
  fuzz::Require(vexlo::JsonFromString(value, quoted) && value.asString() == text,
                "a text does not come back as it was");

  const bool is_good = vexlo::JsonFromString(value, text);
  fuzz::Require(vexlo::JsonFault(text).empty() == is_good,
                "the fault of a text and its reading differ");
  if (!is_good) {
    return 0;
  }
  for (const std::string& written :
       {vexlo::JsonToString(value), vexlo::JsonToStyledString(value)}) {
    Json::Value again;
    fuzz::Require(vexlo::JsonFromString(again, written), "what was written cannot be read");
    fuzz::RequireEqual(vexlo::JsonToString(again), vexlo::JsonToString(value),
                       "what was written reads otherwise");
  }
  fuzz::Require(vexlo::JsonToString(value).find('\n') == std::string::npos,
                "a line of JSON has a newline in it");
  const Json::Value once = Merged(Json::Value(), value);
  fuzz::RequireEqual(vexlo::JsonToString(Merged(once, value)), vexlo::JsonToString(once),
                     "merging twice is another thing than merging once");
  return 0;
}
