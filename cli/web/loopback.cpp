#include "cli/web/loopback.h"

#include <arpa/inet.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdint>
#include <system_error>

#include "cli/command.h"

namespace vexlo::cli {
namespace {

constexpr int kBacklog = 1024;

socklen_t LengthOf(const sockaddr_storage& address) {
  return address.ss_family == AF_INET6 ? sizeof(sockaddr_in6) : sizeof(sockaddr_in);
}

std::string PlaceOf(const sockaddr_storage& address) {
  char text[INET6_ADDRSTRLEN] = "";
  if (address.ss_family == AF_INET6) {
    const auto& ipv6 = reinterpret_cast<const sockaddr_in6&>(address);
    inet_ntop(AF_INET6, &ipv6.sin6_addr, text, sizeof(text));
    return "[" + std::string(text) + "]:" + std::to_string(ntohs(ipv6.sin6_port));
  }
  const auto& ipv4 = reinterpret_cast<const sockaddr_in&>(address);
  inet_ntop(AF_INET, &ipv4.sin_addr, text, sizeof(text));
  return std::string(text) + ":" + std::to_string(ntohs(ipv4.sin_port));
}

}  // namespace

sockaddr_storage ReadLoopbackAddress(const std::string& text) {
  const size_t colon = text.rfind(':');
  std::string host = text.substr(0, colon);
  const std::string port_text = colon == std::string::npos ? "" : text.substr(colon + 1);
  uint16_t port = 0;
  const char* const port_end = port_text.data() + port_text.size();
  const auto [end, error] = std::from_chars(port_text.data(), port_end, port);
  if (port_text.empty() || error != std::errc() || end != port_end) {
    throw UsageError("'" + text + "' is no address: 127.0.0.1:PORT is wanted");
  }
  if (host == "localhost") {
    host = "127.0.0.1";
  }
  sockaddr_storage address{};
  auto& ipv4 = reinterpret_cast<sockaddr_in&>(address);
  auto& ipv6 = reinterpret_cast<sockaddr_in6&>(address);
  bool is_loopback = false;
  if (host.starts_with('[') && host.ends_with(']') &&
      inet_pton(AF_INET6, host.substr(1, host.size() - 2).c_str(), &ipv6.sin6_addr) == 1) {
    ipv6.sin6_family = AF_INET6;
    ipv6.sin6_port = htons(port);
    is_loopback = IN6_IS_ADDR_LOOPBACK(&ipv6.sin6_addr);
  } else if (inet_pton(AF_INET, host.c_str(), &ipv4.sin_addr) == 1) {
    ipv4.sin_family = AF_INET;
    ipv4.sin_port = htons(port);
    is_loopback = ntohl(ipv4.sin_addr.s_addr) >> 24 == IN_LOOPBACKNET;
  } else {
    throw UsageError("'" + host + "' is no address: 127.0.0.1, [::1] or localhost is wanted");
  }
  if (!is_loopback) {
    throw UsageError("'" + host +
                     "' can be reached from other machines, and what this page shows would cross "
                     "the network unprotected; from there, use 'ssh -L 8410:127.0.0.1:8410 "
                     "THIS-MACHINE', or a reverse proxy with TLS and a login");
  }
  return address;
}

int ListenOn(const sockaddr_storage& address) {
  const int listener = socket(address.ss_family, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  // A server that has just ended leaves connections behind that hold the port for a minute.
  const int on = 1;
  if (listener >= 0 && setsockopt(listener, SOL_SOCKET, SO_REUSEADDR, &on, sizeof(on)) == 0 &&
      bind(listener, reinterpret_cast<const sockaddr*>(&address), LengthOf(address)) == 0 &&
      listen(listener, kBacklog) == 0) {
    return listener;
  }
  const int cause = errno;
  if (listener >= 0) {
    close(listener);
  }
  if (cause == EADDRINUSE) {
    throw Failure("another program listens on " + PlaceOf(address) +
                  "; '--listen 127.0.0.1:0' takes any port that is free");
  }
  throw Failure("cannot listen on " + PlaceOf(address) + ": " +
                std::generic_category().message(cause));
}

std::string ListeningPlace(int socket) {
  sockaddr_storage address{};
  socklen_t length = sizeof(address);
  if (getsockname(socket, reinterpret_cast<sockaddr*>(&address), &length) != 0) {
    throw Failure("the socket's address cannot be read: " + std::generic_category().message(errno));
  }
  return PlaceOf(address);
}

}  // namespace vexlo::cli
