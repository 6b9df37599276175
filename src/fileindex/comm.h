// The one way to the search-engine daemon: a JSON request over its socket, and the JSON reply.
#ifndef FILEINDEX_COMM_H_
#define FILEINDEX_COMM_H_

#include <json/value.h>

#include "common/export.h"

namespace vexlo {

// Whether a code of the engine's says that it is too busy at present to do what was asked.
constexpr bool IsElasticdBusy(int code) { return code == 1400 || code == 1401; }

// Sends one request over a connection of its own and fills `response` with the reply, an object
// whose "success" is true. Waits up to 31 seconds for the engine's socket to appear, logging a line
// each second, and then for the engine as long as it takes.
//
// Throws Error 913 when there is no connection or no proper reply. A reply whose "success" is false
// gives an Error with the engine's own code and "Request failed, msg=" before its message; 120 when
// the reply has none of these. That Error is not logged: which of the codes are failures is for the
// caller to say.
//
// A request with a "compound" member is a list of requests in one. When the reply has a true
// "has_fail", its items are looked through: the first that the engine was too busy for is thrown
// with its code and message alone, every other that failed is logged, and is no failure of the
// whole.
//
// The commands are described in docs/engine.md. Any thread may call: nothing is kept between two
// calls.
VEXLO_EXPORT void SendRequestImpl(Json::Value& response, const Json::Value& request);

}  // namespace vexlo

#endif  // FILEINDEX_COMM_H_
