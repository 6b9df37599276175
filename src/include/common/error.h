// The one exception type of the library and the numbers it carries.
#ifndef COMMON_ERROR_H_
#define COMMON_ERROR_H_

#include <cstdint>
#include <stdexcept>
#include <string>

#include "common/export.h"

// The foundation, which knows nothing of indexing: errors and log lines, texts, files, JSON, locks;
// and the channel to the search engine.
namespace vexlo {

// Callers pass these numbers on to their own clients: never renumber. The enumeration is open: an
// Error also carries any code that the search engine answered with, unchanged.
enum ErrorCode : int32_t {
  ERR_BAD_PARAMETER = 120,      // a caller's argument or a record is missing something or mistyped
  ERR_SHARE_ENUM = 121,         // the shares of the system cannot be enumerated
  ERR_SYSTEM = 502,             // a platform or operating-system call failed
  ERR_CREDENTIALS = 503,        // the effective user or group cannot be switched
  ERR_LOAD = 504,               // a configuration or state file cannot be loaded
  ERR_SAVE = 505,               // a configuration or state file cannot be written
  ERR_LOCK = 506,               // a lock file cannot be opened or locked
  ERR_SHARE_NOT_FOUND = 800,    // no share of that name
  ERR_CHOWN = 801,              // a file cannot be handed to the package's own user
  ERR_FOLDER_DUPLICATED = 901,  // a folder is created whose path is configured already
  ERR_FOLDER_NOT_FOUND = 902,   // a folder is looked up that is not configured
  ERR_PATH_CANNOT_INDEX = 903,  // a folder's path may not be indexed
  ERR_BAD_EVENT = 906,          // a queue line cannot be parsed into an event
  ERR_ELASTIC_REQUEST = 913,    // the search engine cannot be reached, or its reply is no response
  ERR_PARSE_FILE = 914,         // a file's metadata cannot be extracted
  ERR_BAD_RESPONSE = 916,       // a search-engine reply lacks its "data" array
  ERR_DOC_NOT_FOUND = 917,      // a document to be updated or renamed is not in the index
  ERR_SPACE_NOT_ENOUGH = 1003,  // the volume of a share has too little free space
  ERR_INTERNAL = 9999,          // the operation tree lacks a node that must exist
};

// "Vexlo error, code=N", with ", reason=[...]" behind it when `reason` is not empty.
VEXLO_EXPORT std::string ErrorString(ErrorCode code, const std::string& reason);

// Thrown by everything in the library that fails. Whoever throws it has logged it.
class VEXLO_EXPORT Error : public std::runtime_error {
 public:
  // With what the caller may show to people, or without. Logs nothing.
  explicit Error(ErrorCode code);
  Error(ErrorCode code, const std::string& reason);
  Error(const Error&) = default;
  Error& operator=(const Error&) = default;
  Error(Error&&) = default;
  Error& operator=(Error&&) = default;
  ~Error() override;

  // The reason alone, empty when there is none: it is meant to be shown as it stands. The text of
  // ErrorString() is what the base class's what() returns.
  const char* what() const noexcept override;
  // One of the above, or the engine's own.
  ErrorCode GetErrorCode() const noexcept { return code_; }

 private:
  ErrorCode code_;
  std::string reason_;
};

namespace fileindex {

// 7 turns on one debug line for each queue line read; every other value leaves them off. Error
// lines are written whatever it is. Set by the embedding program before it starts threads.
VEXLO_EXPORT extern int log_level;

}  // namespace fileindex
}  // namespace vexlo

#endif  // COMMON_ERROR_H_
