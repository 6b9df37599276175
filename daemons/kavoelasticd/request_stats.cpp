#include "daemons/kavoelasticd/request_stats.h"

#include <algorithm>

#include "common/error.h"

namespace vexlo::elasticd {
namespace {

// Names come from clients: only the engine's own are kept, so that nobody can fill the table.
constexpr std::array kNames = {"commit",
                               "compound",
                               "document_del_by_id",
                               "document_del_by_query",
                               "document_get_by_query",
                               "document_set_by_id",
                               "document_upsert_by_id",
                               "index_config_set",
                               "index_create",
                               "index_delete",
                               "index_list",
                               "index_pause",
                               "index_resume",
                               "search"};

std::string NameOf(const Json::Value& request) {
  if (!request.isObject()) {
    return "other";
  }
  if (request.isMember("compound")) {
    return "compound";
  }
  const Json::Value& command = request["command"];
  const bool is_known = command.isString() &&
                        std::find(kNames.begin(), kNames.end(), command.asString()) != kNames.end();
  return is_known ? command.asString() : "other";
}

}  // namespace

Json::Value RequestStats::Answer(const Json::Value& request,
                                 const std::function<Json::Value(const Json::Value&)>& handle) {
  if (request.isObject() && request["command"] == "stats") {
    return ToJson();
  }
  return Measure(request, handle);
}

Json::Value RequestStats::Measure(const Json::Value& request,
                                  const std::function<Json::Value(const Json::Value&)>& handle) {
  const auto began = std::chrono::steady_clock::now();
  Json::Value reply = handle(request);
  Count(request, reply, std::chrono::steady_clock::now() - began);
  return reply;
}

void RequestStats::Count(const Json::Value& request, const Json::Value& reply,
                         std::chrono::nanoseconds time) {
  const double seconds = std::chrono::duration<double>(time).count();
  const auto* const bound = std::lower_bound(kBounds.begin(), kBounds.end(), seconds);
  const std::lock_guard lock(mutex_);
  Command& command = commands_[NameOf(request)];
  ++command.count;
  command.seconds += seconds;
  if (bound != kBounds.end()) {
    ++command.steps.at(static_cast<size_t>(bound - kBounds.begin()));
  }
  CountError(reply);
  if (reply["has_fail"].isBool() && reply["has_fail"].asBool()) {
    for (const Json::Value& item : reply["data"]) {
      CountError(item);
    }
  }
}

void RequestStats::CountError(const Json::Value& reply) {
  if (reply["success"].isBool() && !reply["success"].asBool()) {
    const Json::Value& code = reply["error"]["code"];
    ++errors_[code.isInt() ? code.asInt() : static_cast<int>(ERR_INTERNAL)];
  }
}

Json::Value RequestStats::ToJson() const {
  const std::lock_guard lock(mutex_);
  Json::Value value(Json::objectValue);
  value["success"] = true;
  for (const double bound : kBounds) {
    value["bounds"].append(bound);
  }
  value["commands"] = Json::Value(Json::objectValue);
  for (const auto& [name, command] : commands_) {
    Json::Value& entry = value["commands"][name];
    entry["count"] = static_cast<Json::UInt64>(command.count);
    entry["seconds"] = command.seconds;
    for (const uint64_t step : command.steps) {
      entry["steps"].append(static_cast<Json::UInt64>(step));
    }
  }
  value["errors"] = Json::Value(Json::objectValue);
  for (const auto& [code, count] : errors_) {
    value["errors"][std::to_string(code)] = static_cast<Json::UInt64>(count);
  }
  return value;
}

}  // namespace vexlo::elasticd
