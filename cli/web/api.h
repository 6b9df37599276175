// What the page asks for, as JSON.
#ifndef CLI_WEB_API_H_
#define CLI_WEB_API_H_

#include <string>

#include "cli/web/http_server.h"

namespace vexlo::cli {

// The lanes for HttpServer that AnswerRequest() names.
std::vector<HttpServer::Lane> WebLanes();

// Answers requests for the page's files at once, and has those for data carried out in a lane:
//
//   GET  /api/search   the engine's reply to a search with snippets. Arguments are "words" and the
//                      options of "fileindex search" without their dashes (share, below, name,
//                      type, larger, smaller, newer, older, sort, limit up to 100), and "from", the
//                      number of hits to leave out.
//   GET  /api/folders  FolderList() with the status of each, and "full_path" where its share is
//                      known. Arguments "from" and "limit" (100, up to 1000).
//   GET  /api/status   AskWholeStack()
//   POST /api/pause    pauses indexing for "hours", or until it is resumed; AskWholeStack() then
//   POST /api/resume   the same for going on
//
// All of these need the token (see Refuse()). Texts are bytes, in arguments and replies, as
// everywhere in the library. An error is {"error":{"message":TEXT}} with status 400 for arguments
// that are wrong, 404 and 405 for what there is not, 413 for a request with a body, and 503 for
// what failed in the service.
HttpServer::Answer AnswerRequest(const HttpRequest& request, const std::string& token);

}  // namespace vexlo::cli

#endif  // CLI_WEB_API_H_
