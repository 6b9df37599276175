// Tells the files from each other that stand at one path in the course of time.
#ifndef DAEMONS_FILEINDEXD_FILE_VERSION_H_
#define DAEMONS_FILEINDEXD_FILE_VERSION_H_

#include <string>

namespace vexlo::fileindexd {

// Another text for each file that replaces one at the path, and after each change of it. "" while
// nothing is there, or where that cannot be told, with errno.
std::string FileVersion(const std::string& path);

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_FILE_VERSION_H_
