#include "cli/web/guard.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/random.h>

#include <algorithm>
#include <cctype>

#include "cli/command.h"
#include "common/json.h"

namespace vexlo::cli {
namespace {

constexpr size_t kTokenBytes = 16;

std::string Lower(std::string_view text) {
  std::string lower(text);
  std::transform(lower.begin(), lower.end(), lower.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return lower;
}

bool IsToken(const std::string& given, const std::string& token) {
  unsigned int difference = given.size() == token.size() ? 0 : 1;
  for (size_t i = 0; i < given.size(); ++i) {
    difference |=
        static_cast<unsigned char>(given[i]) ^ static_cast<unsigned char>(token[i % token.size()]);
  }
  return difference == 0;
}

}  // namespace

std::string MakeToken() {
  unsigned char bytes[kTokenBytes];
  if (getentropy(bytes, sizeof(bytes)) != 0) {
    throw Failure("the system gives no random numbers for the token");
  }
  std::string token;
  for (const unsigned char byte : bytes) {
    token += "0123456789abcdef"[byte >> 4];
    token += "0123456789abcdef"[byte & 15];
  }
  return token;
}

HttpResponse ErrorResponse(unsigned int status, const std::string& message) {
  Json::Value reply;
  reply["error"]["message"] = message;
  return {status, "application/json", JsonToString(reply), {}};
}

void AddSafeHeaders(HttpResponse& response) {
  for (const auto& [name, value] :
       {std::pair{"Content-Security-Policy",
                  "default-src 'none'; script-src 'self'; style-src 'self'; img-src 'self'; "
                  "connect-src 'self'; base-uri 'none'; form-action 'none'; "
                  "frame-ancestors 'none'; require-trusted-types-for 'script'; trusted-types"},
        std::pair{"X-Content-Type-Options", "nosniff"}, std::pair{"X-Frame-Options", "DENY"},
        std::pair{"Referrer-Policy", "no-referrer"},
        std::pair{"Cross-Origin-Resource-Policy", "same-origin"},
        std::pair{"Cross-Origin-Opener-Policy", "same-origin"},
        std::pair{"Cache-Control", "no-store"}}) {
    response.headers.emplace_back(name, value);
  }
}

bool IsLocalHost(std::string_view host) {
  std::string_view name = host;
  std::string_view port;
  const size_t colon = host.rfind(':');
  if (colon != std::string_view::npos && !host.ends_with(']')) {
    name = host.substr(0, colon);
    port = host.substr(colon + 1);
    if (port.empty() || port.size() > 5 ||
        !std::all_of(port.begin(), port.end(), [](char c) { return c >= '0' && c <= '9'; })) {
      return false;
    }
  }
  in_addr address{};
  const bool is_ipv4 = inet_pton(AF_INET, std::string(name).c_str(), &address) == 1 &&
                       name.find('\0') == std::string_view::npos;
  return Lower(name) == "localhost" || name == "[::1]" ||
         (is_ipv4 && ntohl(address.s_addr) >> 24 == IN_LOOPBACKNET);
}

std::optional<HttpResponse> Refuse(const HttpRequest& request, bool needs_token,
                                   const std::string& token) {
  const std::vector<std::string> hosts = request.Header("Host");
  if (hosts.size() != 1 || !IsLocalHost(hosts[0])) {
    return ErrorResponse(
        421,
        "this server answers for localhost and loopback addresses only, not for the name that "
        "was asked for");
  }
  if (!needs_token) {
    return std::nullopt;
  }
  for (const std::string& site : request.Header("Sec-Fetch-Site")) {
    if (site != "same-origin") {
      return ErrorResponse(403, "the request comes from the page of another site");
    }
  }
  for (const std::string& origin : request.Header("Origin")) {
    if (Lower(origin) != "http://" + Lower(hosts[0])) {
      return ErrorResponse(403, "the request comes from the page of another site");
    }
  }
  const std::vector<std::string> tokens = request.Header(kTokenHeader);
  if (tokens.size() != 1 || !IsToken(tokens[0], token)) {
    return ErrorResponse(
        401, "the token is missing or wrong: open the address that 'fileindex web' printed");
  }
  return std::nullopt;
}

}  // namespace vexlo::cli
