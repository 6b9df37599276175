// Messages on a Unix stream socket within a time, each with a file if need be. On the wire they are
// those of kavo/sock_connection.h; a file goes with the first byte of its message (SCM_RIGHTS).
#ifndef KAVO_LOCAL_FRAMES_H_
#define KAVO_LOCAL_FRAMES_H_

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <string>
#include <string_view>

namespace kavo::local {

// When a call gives up; one that is past lets it do what needs no waiting.
using Deadline = std::chrono::steady_clock::time_point;

// A connection to the socket at the path, owned by the caller; -1 with errno. A server that is too
// busy to take it is waited for: ETIMEDOUT then.
int ConnectWithin(const std::string& path, Deadline deadline);

// Sends one message, and with it the descriptor `file`, unless that is -1; the caller keeps it.
// False with errno: ETIMEDOUT, or EPIPE when the peer is gone. No SIGPIPE is raised.
bool SendFrame(int socket, std::string_view body, int file, Deadline deadline);

// Receives one message of up to `most` bytes; memory is taken as they come. A descriptor that came
// with it is the caller's in `*file`, which is -1 without one; where `file` is null it is closed.
// False with errno, and no descriptor: ETIMEDOUT, ECONNRESET when the peer closes before all has
// come, EMSGSIZE for a longer one.
bool ReceiveFrame(int socket, size_t most, std::string& body, int* file, Deadline deadline);

// What has come by now of whatever is sent, up to `size` bytes, as recv() tells it. A descriptor
// that came with it is the caller's in `*file`, unless that holds one already or is null: it is
// closed then.
ssize_t ReceiveSome(int socket, char* buffer, size_t size, int* file);

}  // namespace kavo::local

#endif  // KAVO_LOCAL_FRAMES_H_
