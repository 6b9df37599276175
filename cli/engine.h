// What commands share that talk to the search engine.
#ifndef CLI_ENGINE_H_
#define CLI_ENGINE_H_

#include <json/value.h>

#include <functional>

#include "cli/command.h"
#include "common/error.h"

namespace vexlo::cli {

// Throws Failure when no engine has made its socket; the library would wait for it.
void RequireEngine();

// Calls `work` and puts into words for people what can go wrong with the engine and the shares. An
// engine that does not run is reported at once.
void WithEngine(const std::function<void()>& work);

// Throws Failure with the words for an error that has to do with the engine or a share; returns for
// any other.
void ExplainEngineError(const Error& error);

// The same for a search, which anybody may ask: who may not ask the engine everything gets what he
// may read, of the first 10,000 hits.
Json::Value AskSearch(const Json::Value& request, Json::Value* reply);

// Sends one request within WithEngine(). The reply's "data".
Json::Value AskEngine(const Json::Value& request, Json::Value* reply = nullptr);

}  // namespace vexlo::cli

#endif  // CLI_ENGINE_H_
