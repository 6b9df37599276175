// Commands to the running index daemon.
//
// The daemon listens on a stream socket. A command is one frame, and so is the answer: a length of
// 8 bytes in the host's byte order, then that many bytes. A command's bytes are the JSON text
//   {"data": ARGUMENTS, "type": COMMAND}
// and one NUL; what the answer says is free, and a length of 0 will do.
#ifndef FILEINDEX_COMMUNICATION_H_
#define FILEINDEX_COMMUNICATION_H_

#include <json/value.h>

#include <string>

#include "common/export.h"

namespace vexlo::fileindex {

// Sends one command, and reads the answer only to drop it.
//
// Throws Error 502: "socket failed, ..." or "setsockopt failed, ..."; "write failed, ..." when
// there is no daemon (that the connection failed shows here and nowhere else) or it takes nothing
// for a second; "read failed, ...".
//
// Waits up to 4 seconds for a socket that is not there yet; one that nobody listens on fails at
// once. Then waits for the answer, however long it takes: a daemon that accepts and never answers
// holds the caller, and the locks it holds, for ever. So a daemon must answer from a thread that
// takes none of the service's locks.
//
// From the first call on the process ignores SIGPIPE. Any thread may call, each call has a socket
// of its own.
VEXLO_EXPORT void SendCommandToDaemon(const std::string& command, const Json::Value& data);

// Transfer exactly `length` bytes, at most 1,024 with a system call; 0 touches nothing. Up to 10
// interruptions by signals are made up for. Throw Error 502, "write failed, reason=..." and "read
// failed, reason=...". A write of 0 bytes is a failure. A read of 0 bytes, the end of what is
// there, is not: it is tried again, after 1 ms and then after twice as long each time up to 100 ms,
// until the rest has come.
VEXLO_EXPORT void BufferWrite(int fd, unsigned long length, const unsigned char* buffer);
VEXLO_EXPORT void BufferRead(int fd, unsigned long length, unsigned char* buffer);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_COMMUNICATION_H_
