// What a share has on the disk that belongs into its index, one path after the other.
#ifndef CLI_DISK_LISTING_H_
#define CLI_DISK_LISTING_H_

#include <sys/stat.h>

#include <functional>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "cli/audit_scope.h"

namespace vexlo::cli {

struct DiskFile {
  std::string path;
  struct stat info {};
};

// Gives wanted files and folders in the order of their full paths as bytes: "a", "a.txt", "a/b".
// Names of a folder are read in portions, anew for each, so that memory depends on neither the
// number of files nor the size of a folder. For one thread.
class DiskListing {
 public:
  // Told of each folder that cannot be read and each file that cannot be looked at, with errno.
  using OnUnknown = std::function<void(const std::string& path, int error)>;

  // What is at and below `root`, a folder in the share. `portion` is the most names of a folder
  // that are held. `scope` outlives the object.
  DiskListing(const AuditScope& scope, const std::string& root, OnUnknown on_unknown,
              size_t portion = 100000);

  std::optional<DiskFile> Next();

  // Whether it could not be seen what is at the path.
  bool IsUnknown(const std::string& path) const;

 private:
  struct Frame {
    std::string path;
    // Names in order; one with "/" behind it stands for what is below.
    std::vector<std::string> keys;
    size_t next = 0;
    std::string last;  // Keys up to here are done with.
    bool is_complete = false;
  };

  std::optional<DiskFile> Look(const std::string& path);
  void Enter(const std::string& path);
  void Fill(Frame& frame);
  void AddUnknown(const std::string& path, int error);

  const AuditScope& scope_;
  const OnUnknown on_unknown_;
  const size_t portion_;
  std::vector<Frame> frames_;
  std::vector<char> buffer_;
  std::set<std::string> unknown_;
};

}  // namespace vexlo::cli

#endif  // CLI_DISK_LISTING_H_
