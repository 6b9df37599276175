// Why a command was refused or failed, with the number that the reply carries.
#ifndef DAEMONS_KAVOELASTICD_FAILURE_H_
#define DAEMONS_KAVOELASTICD_FAILURE_H_

#include <stdexcept>
#include <string>

namespace vexlo::elasticd {

// Sent to clients, which pass them on: never renumber. None may be 607, 608, 610, 1400 or 1401,
// which make a client wait and ask again for ever.
enum class Code {
  kBadRequest = 2000,       // a member is missing or of another type, or the command is unknown
  kUnknownQuery = 2001,     // a query holds something else than the forms that are known
  kIndexMissing = 2002,     // no index of that id
  kIndexExists = 2003,      // the id, or the folder, belongs to an index already
  kIndexPaused = 2004,      // the index takes no work until it is resumed
  kIndexDamaged = 2005,     // the index must be made anew and filled again
  kDocumentMissing = 2006,  // no document at that path
  kBadDocument = 2007,      // a field does not fit the mappings
  kBadMappings = 2008,      // the mappings or settings cannot be used
  kStorage = 2009,          // the disk, the database or the memory refused
  kNoSpace = 2010,          // the disk is full
  kLost = 2011,             // changes since the last commit were rolled back; send them again
  kInternal = 2012,         // a fault of this program
  kTimeIsUp = 2013,         // it takes longer than the one who asks may make it take
};

inline constexpr char kNoMemory[] = "there is no memory at present";

// Becomes {"success": false, "error": {...}}. Not logged by whoever throws it: most are answers.
class Failure : public std::runtime_error {
 public:
  Failure(Code code, const std::string& message) : std::runtime_error(message), code_(code) {}
  Code GetCode() const { return code_; }
  // Whether it is an answer to what was asked, given before anything was changed.
  bool IsAnswer() const {
    return code_ <= Code::kUnknownQuery || code_ == Code::kDocumentMissing ||
           code_ == Code::kBadDocument;
  }

 private:
  Code code_;
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_FAILURE_H_
