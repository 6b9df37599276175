// The fixed paths of the service, in one place.
#ifndef FILEINDEX_PATHS_H_
#define FILEINDEX_PATHS_H_

#include <string>

#include "common/export.h"

namespace vexlo::fileindex {

// What stands before every fixed path: "" on a system's own installation. A library that was
// configured with a root (FILEINDEX_ROOT) takes another one from FILEINDEX_ROOT in the environment,
// read once; one configured for "" never looks there.
VEXLO_EXPORT const std::string& GetFileIndexRoot();

// A path that is fixed on a system's own installation.
class FixedPath {
 public:
  // Takes an absolute path, whose text outlives the object.
  constexpr explicit FixedPath(const char* path) : path_(path) {}
  // With the root before it. Any thread may ask.
  std::string Get() const { return GetFileIndexRoot() + path_; }

 private:
  const char* path_;
};

// The two configuration files with the lock files of their writers (docs/state.md), the sockets of
// the index daemon and the engine, and the tool behind SendQPXNotify().
inline constexpr FixedPath kFileIndexFoldersCfgPath("/var/packages/Vexlo/etc/fileindex.folders");
inline constexpr FixedPath kFileIndexFoldersLockPath("/tmp/vexlo_cfg_folder.lock");
inline constexpr FixedPath kFileIndexStatusCfgPath("/var/packages/Vexlo/etc/fileindex.status");
inline constexpr FixedPath kFileIndexStatusLockPath("/tmp/vexlo_cfg_fi_status.lock");
inline constexpr FixedPath kFileIndexDaemonSocketPath("/var/run/fileindexd.sock");
inline constexpr FixedPath kElasticdSocketPath("/var/run/kavoelasticd.sock");
inline constexpr FixedPath kNotifyToolPath("/usr/kavo/bin/kavoqpxnotify");

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_PATHS_H_
