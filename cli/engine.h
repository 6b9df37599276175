// What commands share that talk to the search engine.
#ifndef CLI_ENGINE_H_
#define CLI_ENGINE_H_

#include <json/value.h>

#include <functional>

#include "cli/command.h"

namespace vexlo::cli {

// Calls `work` and puts into words for people what can go wrong with the engine and the shares. An
// engine that does not run is reported at once; the library would wait for it.
void WithEngine(const std::function<void()>& work);

// Sends one request within WithEngine(). The reply's "data".
Json::Value AskEngine(const Json::Value& request, Json::Value* reply = nullptr);

}  // namespace vexlo::cli

#endif  // CLI_ENGINE_H_
