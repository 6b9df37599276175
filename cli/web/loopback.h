// Where the web server listens.
#ifndef CLI_WEB_LOOPBACK_H_
#define CLI_WEB_LOOPBACK_H_

#include <netinet/in.h>
#include <sys/socket.h>

#include <string>

namespace vexlo::cli {

// "127.0.0.1:8410", "[::1]:0" or "localhost:8410", as the system wants it. Throws UsageError for
// anything that is no such address, or none of this machine's own.
sockaddr_storage ReadLoopbackAddress(const std::string& text);

// A listening socket there, the caller's. Throws Failure, in words for a port that is taken.
int ListenOn(const sockaddr_storage& address);

// What `socket` listens on, as ReadLoopbackAddress() reads it, with the port that the system chose
// where 0 was asked for.
std::string ListeningPlace(int socket);

}  // namespace vexlo::cli

#endif  // CLI_WEB_LOOPBACK_H_
