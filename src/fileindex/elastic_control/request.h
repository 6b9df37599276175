// Requests to the search engine that wait until it can take them. Not installed.
#ifndef FILEINDEX_ELASTIC_CONTROL_REQUEST_H_
#define FILEINDEX_ELASTIC_CONTROL_REQUEST_H_

#include <json/value.h>

#include <string>

namespace vexlo::fileindex::elastic {

// {"command": command, "data": {"id": id}}.
Json::Value MakeRequest(const char* command, const std::string& id);

// SendRequestImpl(), again and again while the engine's database is not ready (after 30 seconds) or
// the engine is busy (after 15 to 19 minutes), with a log line each time and without a limit. The
// administrators are told once, when the engine was busy for the eleventh time. Throws what
// SendRequestImpl() throws otherwise.
void SendRequestWithRetry(Json::Value& response, const Json::Value& request);

// The same for a command whose reply says nothing but that it is done.
void SendRequest(const Json::Value& request);

}  // namespace vexlo::fileindex::elastic

#endif  // FILEINDEX_ELASTIC_CONTROL_REQUEST_H_
