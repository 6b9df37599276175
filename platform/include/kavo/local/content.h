// What the local platform's ParseFile() has to say of contents, and whom it asks: the daemon
// kavocontentextractd. Its formats, fields and requests are described in docs/extract.md.
#ifndef KAVO_LOCAL_CONTENT_H_
#define KAVO_LOCAL_CONTENT_H_

#include <cstddef>
#include <string>

namespace kavo::local {

// A field of a document whose content is missing, or missing in part: "REASON: what happened". A
// document without it is complete. Documents that are stored have it: the name stays.
inline constexpr char kContentErrorField[] = "KAVOMDContentError";
// True in a document whose text was cut off at kMaxTextBytes.
inline constexpr char kTextTruncatedField[] = "KAVOMDTextTruncated";

// How much text of a file is indexed; more is cut off at a character.
inline constexpr size_t kMaxTextBytes = size_t{1} << 20;

// The REASONs. Whoever looks for documents to index again compares with them: the words stay.
namespace content_reason {

inline constexpr char kUnavailable[] = "unavailable";  // Nobody, or nobody in time, was there to
                                                       // read it: worth another try.
inline constexpr char kUnreadable[] = "unreadable";    // It cannot be opened or read.
inline constexpr char kEncrypted[] = "encrypted";      // It wants a password.
inline constexpr char kDamaged[] = "damaged";          // Not what its beginning promises.
inline constexpr char kOversized[] = "oversized";      // Over a limit of its format.
// Reading it ended two processes, so it is left alone until it changes.
inline constexpr char kDeadline[] = "deadline";
inline constexpr char kMemory[] = "memory";
inline constexpr char kCrash[] = "crash";

}  // namespace content_reason

// The daemon's socket, below the root.
std::string ContentSocket();

}  // namespace kavo::local

#endif  // KAVO_LOCAL_CONTENT_H_
