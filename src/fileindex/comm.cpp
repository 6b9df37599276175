#include "fileindex/comm.h"

#include <unistd.h>

#include <cerrno>
#include <string>

#include "common/check.h"
#include "common/error.h"
#include "common/json.h"
#include "fileindex/paths.h"
#include "kavo/sock_connection.h"

namespace vexlo {
namespace {

constexpr int kSocketProbes = 32;
constexpr int kElasticdConnectTimeout = 864000;

// Comes back after the last probe, too: connecting says best what is wrong then.
void AwaitSocket(const std::string& path) {
  for (int probes = 1; access(path.c_str(), F_OK) != 0 && probes < kSocketProbes; ++probes) {
    LogLine(VEXLO_SOURCE, __LINE__,
            "elastic socket is not ready, retry ... " + std::to_string(probes));
    sleep(1);
  }
}

// Null for what is no object or has no such member.
const Json::Value& Member(const Json::Value& value, const char* name) {
  return value.isObject() ? value[name] : Json::Value::nullSingleton();
}

bool IsTrue(const Json::Value& value) { return value.isBool() && value.asBool(); }

template <typename T>
T ReadOr(const Json::Value& value, const T& fallback) {
  return isJsonType<T>(value) ? asJsonType<T>(value) : fallback;
}

bool ReceiveReply(kavodaemon::SockConnection& conn, Json::Value& response) {
  response = Json::Value();
  std::string text;
  return conn.Recv(text) && JsonFromString(response, text) && Member(response, "success").isBool();
}

void CheckItems(const Json::Value& response, const Json::Value& request) {
  const Json::Value& items = Member(response, "data");
  const Json::Value& requests = Member(request, "compound");
  for (Json::ArrayIndex i = 0; items.isArray() && i < items.size(); ++i) {
    if (IsTrue(Member(items[i], "success"))) {
      continue;
    }
    const Json::Value& error = Member(items[i], "error");
    const int code = ReadOr(Member(error, "code"), 0);
    const std::string message = ReadOr(Member(error, "msg"), std::string());
    if (IsElasticdBusy(code)) {
      throw Error(static_cast<ErrorCode>(code), message);
    }
    const int saved = errno;
    std::string text = "Compound failed: ";
    text += JsonToStyledString(requests.isArray() ? requests[i] : Json::Value::nullSingleton());
    text += " (" + std::to_string(code) + ") " + message;
    LogContext({VEXLO_SOURCE, __LINE__, "SendRequestImpl", ""}, text, saved);
  }
}

}  // namespace

// Log monitors match the conditions as they are written out here.
void SendRequestImpl(Json::Value& response, const Json::Value& request) {
  const std::string path = fileindex::kElasticdSocketPath.Get();
  AwaitSocket(path);
  errno = 0;  // What a probe left would be logged as the cause of a later failure.
  kavodaemon::DomainSockConnection conn(path);
  VEXLO_CHECK(!conn.Connect(kElasticdConnectTimeout), ERR_ELASTIC_REQUEST, "Connect failed");
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__, "!conn.Send(req.toString())"}),
                 !conn.Send(JsonToString(request)), ERR_ELASTIC_REQUEST, "Send failed");
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__,
                          "!conn.Recv(resp_raw) || !res.fromString(resp_raw) || "
                          "!res.isMember(\"success\") || !res[\"success\"].isBool()"}),
                 !ReceiveReply(conn, response), ERR_ELASTIC_REQUEST,
                 "Recv failed, res=" + JsonToStyledString(response));
  if (!response["success"].asBool()) {
    Json::Value error;
    int code = 0;
    std::string message;
    GetJsonValue(error, response, "error", /*required=*/true);
    GetJsonValue(code, error, "code", /*required=*/true);
    GetJsonValue(message, error, "msg", /*required=*/true);
    throw Error(static_cast<ErrorCode>(code), "Request failed, msg=" + message);
  }
  if (request.isObject() && request.isMember("compound") && IsTrue(Member(response, "has_fail"))) {
    CheckItems(response, request);
  }
}

}  // namespace vexlo
