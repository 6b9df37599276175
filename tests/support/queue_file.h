// Queue files for tests, and the real tree's answer to one.
#ifndef SUPPORT_QUEUE_FILE_H_
#define SUPPORT_QUEUE_FILE_H_

#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "common/json.h"
#include "fileindex/optree/optree.h"
#include "support/naive_tree.h"
#include "support/syslog_capture.h"

// A queue line without its newline. `data` is JSON text, and left out when empty, as `path_old` is.
inline std::string Line(uint32_t event, const std::string& path, const std::string& path_old = "",
                        bool is_dir = false, const std::string& data = "") {
  return "{\"event\":" + std::to_string(event) + (is_dir ? ",\"is_dir\":true" : "") +
         ",\"path\":" + vexlo::JsonToString(path) +
         (path_old.empty() ? "" : ",\"path_old\":" + vexlo::JsonToString(path_old)) +
         (data.empty() ? "" : ",\"data\":" + data) + "}";
}

// The lines with a newline behind each.
inline std::string Join(const std::vector<std::string>& lines) {
  std::string text;
  for (const std::string& line : lines) {
    text += line + "\n";
  }
  return text;
}

// Folds a queue file with the library's tree.
inline naive::Result FoldFile(const std::string& path) {
  naive::Result result;
  SyslogCapture log;
  vexlo::fileindex::OPTree tree(path);
  result.crashed = tree.crashed;
  for (const std::string& line : log.Take()) {
    if (const size_t at = line.find("InsertEvent failed, "); at != std::string::npos) {
      result.skipped.push_back(line.substr(at + 20));
    }
  }
  result.count = tree.ProcessOP([&](std::shared_ptr<vexlo::fileindex::OP> op) {
    std::ostringstream out;
    out << op;
    std::string text = out.str();
    if (op->op == vexlo::fileindex::OP_UPDATE_DIRECTORY) {
      // The layout of a payload is free; what it says is not.
      const size_t at = text.find(", data=") + 7;
      Json::Value printed;
      EXPECT_TRUE(vexlo::JsonFromString(printed, text.substr(at)) && printed == op->data) << text;
      text = text.substr(0, at) + vexlo::JsonToString(op->data);
    }
    result.delivered.push_back(naive::Show(text, op->path_old, op->data));
  });
  return result;
}

#endif  // SUPPORT_QUEUE_FILE_H_
