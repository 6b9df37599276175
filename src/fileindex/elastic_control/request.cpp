#include "fileindex/elastic_control/request.h"

#include <unistd.h>

#include <cstdlib>

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "fileindex/comm.h"
#include "fileindex/util/notification.h"

namespace vexlo::fileindex::elastic {
namespace {

constexpr unsigned kDatabaseNotReadyPause = 30;
constexpr unsigned kBusyPause = 900;
constexpr unsigned kBusyPauseStep = 60;
constexpr int kBusyPauseSteps = 5;
constexpr unsigned kRetriesBeforeNotice = 10;

// 609 is none of them: that database will not get ready by waiting.
bool IsDatabaseNotReady(int code) { return code == 607 || code == 608 || code == 610; }

// "" for what is not there, as in a compound request.
std::string TextOf(const Json::Value& object, const char* name) {
  std::string text;
  if (object.isObject()) {
    GetJsonValue(text, object, name, /*required=*/false);
  }
  return text;
}

std::string IdOf(const Json::Value& request) {
  return request.isObject() ? TextOf(request["data"], "id") : "";
}

// So that the callers of a busy engine do not all come back at once.
unsigned BusyPause() {
  return kBusyPause + kBusyPauseStep * static_cast<unsigned>(rand() % kBusyPauseSteps);
}

}  // namespace

Json::Value MakeRequest(const char* command, const std::string& id) {
  Json::Value request;
  request["command"] = command;
  request["data"]["id"] = id;
  return request;
}

void SendRequestWithRetry(Json::Value& response, const Json::Value& request) {
  unsigned retries = 0;
  while (true) {
    int code = 0;
    try {
      SendRequestImpl(response, request);
      return;
    } catch (const Error& error) {
      code = error.GetErrorCode();
      if (!IsDatabaseNotReady(code) && !IsElasticdBusy(code)) {
        throw;
      }
    }
    if (IsDatabaseNotReady(code)) {
      LogLine(VEXLO_SOURCE, __LINE__,
              "DB is not good yet, retry... (Error Code: " + std::to_string(code) + ")");
      sleep(kDatabaseNotReadyPause);
      continue;
    }
    LogLine(VEXLO_SOURCE, __LINE__,
            "Retry[" + std::to_string(retries) + "] since kavoelasticd is busy. Command: " +
                TextOf(request, "command") + ", db: " + IdOf(request));
    ++retries;
    if (retries == kRetriesBeforeNotice + 1) {
      NotifyLackOfMemory();
    }
    sleep(BusyPause());
  }
}

void SendRequest(const Json::Value& request) {
  Json::Value response;
  SendRequestWithRetry(response, request);
}

}  // namespace vexlo::fileindex::elastic
