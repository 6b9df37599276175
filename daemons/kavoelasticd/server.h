// The search engine's socket: requests and replies as JSON texts.
#ifndef DAEMONS_KAVOELASTICD_SERVER_H_
#define DAEMONS_KAVOELASTICD_SERVER_H_

#include <json/value.h>

#include <functional>
#include <string>

#include "daemons/common/frame_server.h"
#include "daemons/common/run_daemon.h"

namespace vexlo::elasticd {

// Answers a request, which is an object. Called on several threads at once.
using Handler = std::function<Json::Value(const Json::Value& request)>;

// The reply's text. A text that is no JSON object gets {"success":false,"error":{"code":120,...}}
// without the handler. Bytes that are not valid UTF-8 come through both ways.
std::string AnswerText(const Handler& handler, const std::string& request);

// The daemon's name and pid file.
daemon::DaemonOptions ElasticdOptions();

// Answers a search for this client. Called on several threads at once.
using SearchHandler =
    std::function<Json::Value(const Json::Value& request, const daemon::Peer& peer)>;

// The daemon's work: serves "/var/run/kavoelasticd.sock" below the root until the daemon is to end,
// for root and its own user. With a `search_handler` it serves "kavoelasticd.search.sock" beside
// it, too; to others only when `is_open`. Requests in work are finished; when one takes over ten
// seconds, the process ends without it.
void Serve(daemon::Daemon& daemon, const Handler& handler,
           const SearchHandler& search_handler = nullptr, bool is_open = false);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_SERVER_H_
