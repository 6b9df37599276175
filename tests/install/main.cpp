// Queues one event in the file that is named on the command line and prints what comes of it.
#include <iostream>
#include <memory>
#include <string>

#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "fileindex/queue_mgr.h"

int main(int argc, char** argv) {
  if (argc != 2) {
    return 2;
  }
  try {
    const vexlo::fileindex::Event event("not JSON");
    return 1;
  } catch (const vexlo::Error& error) {  // Caught by type only when the library exports it whole.
    if (error.GetErrorCode() != vexlo::ERR_BAD_EVENT) {
      return 1;
    }
  }
  Json::Value event;
  event["event"] = vexlo::fileindex::EV_CLOSE_WRITE;
  event["path"] = "/volume/docs/report.txt";
  std::string path;
  vexlo::GetJsonValue(path, event, "path", /*required=*/true);  // A template that is exported.
  vexlo::AppendLines(argv[1], vexlo::JsonToString(event) + "\n");
  vexlo::fileindex::QueueMgr queue(argv[1]);
  queue.ProcessOP([](std::shared_ptr<vexlo::fileindex::OP> op) { std::cout << op << "\n"; },
                  /*use_tmp=*/false);
  return 0;
}
