// Why a file has no content, or only part of it.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_FAULT_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_FAULT_H_

#include <json/value.h>

#include <stdexcept>
#include <string>
#include <utility>

namespace vexlo::extractd {

class Fault : public std::runtime_error {
 public:
  // `reason` is one of kavo::local::content_reason; `message` is for people.
  Fault(std::string reason, const std::string& message)
      : std::runtime_error(message), reason_(std::move(reason)) {}

  const std::string& Reason() const { return reason_; }

 private:
  std::string reason_;
};

// The reply that consists of it: {"error":{"reason":..,"msg":..}}.
inline Json::Value ReplyOf(const Fault& fault) {
  Json::Value reply(Json::objectValue);
  reply["error"]["reason"] = fault.Reason();
  reply["error"]["msg"] = fault.what();
  return reply;
}

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_FAULT_H_
