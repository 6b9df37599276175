// Operations as lines.
#ifndef CLI_OPERATION_WRITER_H_
#define CLI_OPERATION_WRITER_H_

#include <cstdint>
#include <memory>

#include "cli/command.h"
#include "fileindex/optree/op.h"

namespace vexlo::cli {

// Writes one line for each operation:
//   [05] /volume1/s/a -> /volume1/s/b
//   {"op":5,"path":"/volume1/s/b","path_old":"/volume1/s/a","data":null}
// In the first form control characters are escaped where the output is a terminal; the second one,
// for programs, always holds the bytes of the names.
class OperationWriter {
 public:
  OperationWriter(const Console& console, bool as_json) : console_(console), as_json_(as_json) {}

  void Write(const std::shared_ptr<fileindex::OP>& op);

  uint64_t GetCount() const { return count_; }

 private:
  const Console& console_;
  const bool as_json_;
  uint64_t count_ = 0;
};

}  // namespace vexlo::cli

#endif  // CLI_OPERATION_WRITER_H_
