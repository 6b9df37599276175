// Commands to the index daemon, one a line, while there is no engine.
#include <unistd.h>

#include <chrono>
#include <filesystem>

#include "common/json.h"
#include "daemons/fileindexd/service.h"
#include "fileindex/paths.h"
#include "fuzz/target.h"
#include "kavo/local/shares.h"

namespace {

constexpr int kMostCommands = 8;

void Prepare() {
  const std::string& root = fuzz::Folder();
  for (const char* folder :
       {"/etc/kavo", "/tmp", "/var/run", "/var/packages/Vexlo/etc", "/volume1/photo",
        "/var/lib/kavo/fileindex/queue", "/var/lib/kavo/fileindex/db"}) {
    std::filesystem::create_directories(root + folder);
  }
  // Nobody waits for a socket that is there already.
  fuzz::WriteFile(vexlo::fileindex::kElasticdSocketPath.Get(), "");
  fuzz::WriteFile(kavo::local::SharesFile(),
                  R"({"shares": [{"name": "photo", "path": ")" + root + "/volume1/photo\"}]}");
}

void CheckAnswer(const std::string& text) {
  Json::Value answer;
  fuzz::Require(
      vexlo::JsonFromString(answer, text) && answer.isObject() && answer["success"].isBool(),
      "an answer does not say how it went");
  fuzz::Require(answer["success"].asBool() ||
                    (answer["error"]["code"].isInt() && !answer["error"]["msg"].asString().empty()),
                "a refusal has no reason");
}

// That a share's name is the name of a file, or the command is refused.
void CheckShare(const std::string& command, const std::string& answer) {
  Json::Value value;
  Json::Value answered;
  if (!vexlo::JsonFromString(value, command) || !value.isObject() || !value["data"].isObject() ||
      !vexlo::JsonFromString(answered, answer)) {
    return;
  }
  const Json::Value& type = value["type"];
  const Json::Value& share = value["data"]["share_name"];
  if (share.isString() && share.asString().find('/') != std::string::npos &&
      (type == "worker_create" || type == "worker_delete" || type == "notify_setting_changed")) {
    fuzz::Require(!answered["success"].asBool(), "a worker would keep its state anywhere");
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const bool is_prepared = (Prepare(), true);
  fuzz::Require(is_prepared, "the root is not made");
  vexlo::fileindexd::Service service({std::chrono::milliseconds(0)});
  std::string_view rest = fuzz::TextOf(data, size);
  for (int i = 0; i < kMostCommands && !rest.empty(); ++i) {
    const std::string command(fuzz::TakeLine(rest));
    const std::string answer = service.Answer(command);
    CheckAnswer(answer);
    CheckShare(command, answer);
  }
  fuzz::Require(service.Answer(R"({"type":"stats"})").starts_with("{"),
                "the service answers no more");
  fuzz::Require(service.Stop(std::chrono::seconds(60)), "a worker does not end");
  return 0;
}
