#include "cli/operation_writer.h"

#include <sstream>
#include <string>

#include "cli/text.h"
#include "common/json.h"

namespace vexlo::cli {
namespace {

std::string ToJson(const fileindex::OP& op, const fileindex::OPNode& node) {
  std::string line = "{\"op\":" + std::to_string(op.op) + ",\"path\":";
  AppendJsonText(line, node.GetPath());
  line += ",\"path_old\":";
  AppendJsonText(line, op.path_old);
  line += ",\"data\":";
  line += op.data.isNull() ? "null" : JsonToString(op.data);
  line += "}";
  return line;
}

}  // namespace

void OperationWriter::Write(const std::shared_ptr<fileindex::OP>& op) {
  ++count_;
  if (as_json_) {
    console_.out << ToJson(*op, *op->node.lock());
  } else if (console_.out_is_terminal) {
    std::ostringstream text;
    text << op;
    console_.out << ForTerminal(text.str());
  } else {
    console_.out << op;
  }
  console_.out << '\n';
}

}  // namespace vexlo::cli
