// What commands share that need the local platform's shares.
#ifndef CLI_SHARES_H_
#define CLI_SHARES_H_

#include <set>
#include <string>

namespace vexlo::cli {

// Throws Failure with the file, the line and the key when the shares file cannot be used: the
// library's errors only tell that a share was not found.
void CheckSharesFile();

// The names of the shares. Throws Failure as above.
std::set<std::string> ShareNames();

}  // namespace vexlo::cli

#endif  // CLI_SHARES_H_
