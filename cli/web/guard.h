// Who may ask the web server what.
#ifndef CLI_WEB_GUARD_H_
#define CLI_WEB_GUARD_H_

#include <optional>
#include <string>

#include "cli/web/http_server.h"

namespace vexlo::cli {

// The header that carries the token.
constexpr const char* kTokenHeader = "X-Fileindex-Token";

// 128 random bits as 32 hexadecimal digits. Throws Failure when the system gives none.
std::string MakeToken();

// A reply that is {"error":{"message":...}}.
HttpResponse ErrorResponse(unsigned int status, const std::string& message);

// What every response carries: the page loads from its own server alone, runs no script but its own
// files, stands in nobody's frame, and leaves nothing in caches and Referer headers.
void AddSafeHeaders(HttpResponse& response);

// Why the request is refused, none when it is not. Pure but for time: how long it takes tells
// nothing about the token.
//
// - On every request "Host" must be one, and name a loopback address or localhost, with any port. A
//   name of the attacker's own that is made to lead here (DNS rebinding) is none of them.
// - Without `needs_token`, nothing else is asked.
// - "Sec-Fetch-Site" and "Origin", where they come, must be those of this server's own page.
// - The token must be in its header. A cookie would do on a machine of one's own, but browsers send
//   cookies to all ports of a host: also to a server of somebody else on the same machine.
std::optional<HttpResponse> Refuse(const HttpRequest& request, bool needs_token,
                                   const std::string& token);

// Whether a "Host" header names a loopback address or localhost.
bool IsLocalHost(std::string_view host);

}  // namespace vexlo::cli

#endif  // CLI_WEB_GUARD_H_
