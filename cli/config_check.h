// What is wrong with the files that say what is indexed.
#ifndef CLI_CONFIG_CHECK_H_
#define CLI_CONFIG_CHECK_H_

#include <cstddef>
#include <string>
#include <vector>

namespace vexlo::cli {

struct ConfigFinding {
  std::string file;
  std::string place;  // In the file, as jq would be asked for it: ".[2].owner"; "" for all of it.
  std::string what;   // A sentence for people, without its full stop.
};

// Looks through the files of folders, shares and status, and changes nothing. `folders` becomes the
// number of usable records.
std::vector<ConfigFinding> CheckConfig(size_t& folders);

}  // namespace vexlo::cli

#endif  // CLI_CONFIG_CHECK_H_
