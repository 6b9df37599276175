// What commands share that take folders.
#ifndef CLI_FOLDER_PATHS_H_
#define CLI_FOLDER_PATHS_H_

#include <string>

namespace vexlo::cli {

// The full path of what a person names, as the index has it: symbolic links, which nobody follows
// there, are followed here where that leads into a share or to a folder of shares. Nothing needs to
// exist.
std::string IndexedPath(const std::string& named);

// The share path of what a person names by its full path, relative or absolute, or by its share
// path: "/photo/2019" for "/volume1/photo/2019", which need not exist. A full path prevails. Throws
// Failure when neither lies in a share.
std::string ToSharePath(const std::string& named);

// The same for an existing folder, whose symbolic links are followed; "" when no share holds it.
std::string SharePathOf(const std::string& full_path);

}  // namespace vexlo::cli

#endif  // CLI_FOLDER_PATHS_H_
