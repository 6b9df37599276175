// What stands in each folder of a tree, as digests to be compared with those of an index.
#ifndef DAEMONS_FILEINDEXD_DISK_SCAN_H_
#define DAEMONS_FILEINDEXD_DISK_SCAN_H_

#include <array>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "daemons/common/entry_digest.h"
#include "daemons/fileindexd/disk_walk.h"
#include "kavo/local/mutex.h"

namespace vexlo::fileindexd {

// Whether files are indexed with what stands in them, by their FileType.
using ContentByType = std::array<bool, 5>;

// What a scan asks besides, on the thread that calls Next().
struct ContentRules {
  std::function<bool(const std::string& path)> wants;
  // The same for the files directly in a folder; none where it depends on more than their type.
  std::function<std::optional<ContentByType>(const std::string& folder)> in;
};

struct ScannedFolder {
  std::string path;  // With "/" behind it.
  daemon::FolderDigest digest;
  // Whether the digest stands for all that DiskWalk gives directly in the folder.
  bool is_whole = true;
  int error = 0;  // An errno: nothing is known of what is in the folder, and below it.
};

// Looks at every file, on the caller's thread and one of its own, and keeps no names of files; so
// it takes little more than the calls of the kernel do. Nothing is followed that DiskWalk does not
// follow, and the same is left out.
class DiskScan {
 public:
  // `check` is called every now and then, by Next() on its thread, and may throw to end the scan.
  DiskScan(std::string root, WalkRules rules, ContentRules content, uint64_t seed,
           std::function<void()> check);
  // Waits for what is under way.
  ~DiskScan();
  DiskScan(const DiskScan&) = delete;
  DiskScan& operator=(const DiskScan&) = delete;

  // The next folder, in the order of their paths, with "/" behind them, as bytes: each right before
  // those below it. Throws what the rules and the check throw; it is not to be asked again then.
  std::optional<ScannedFolder> Next();

  // Whether it has ended early, as more folders wait than are to be kept in mind.
  bool HasGivenUp() const { return has_given_up_; }

 private:
  struct Folder;
  struct Batch;
  struct Level;
  using FolderPtr = std::shared_ptr<Folder>;

  void OpenRoot();
  void Open(int parent, const std::string& name, std::string path);
  void Read(const FolderPtr& folder);
  void Meet(const FolderPtr& folder, std::string_view name, unsigned type, Level* level,
            Batch* batch);
  void MeetFolder(const FolderPtr& folder, std::string path, Level* level, Batch* batch);
  bool WalkOn();
  void Hand(Batch batch);
  ScannedFolder Finished(const Folder& folder);
  Batch TakeBatch() KAVO_REQUIRES(mutex_);
  void LookAt(const Batch& batch);
  void Work();

  const std::string root_;
  const WalkRules rules_;
  const ContentRules content_;
  const uint64_t seed_;
  const std::function<void()> check_;
  std::vector<Level> levels_;
  bool has_begun_ = false;
  size_t waiting_below_ = 0;  // Names in all levels.
  bool has_given_up_ = false;
  std::vector<char> buffer_;
  std::string name_;

  std::deque<FolderPtr> ahead_;  // Opened and not given yet.
  kavo::local::Mutex mutex_;     // Guards also what is counted in a folder.
  kavo::local::Condition has_batch_;
  kavo::local::Condition is_done_;
  std::deque<Batch> batches_ KAVO_GUARDED_BY(mutex_);
  bool ending_ KAVO_GUARDED_BY(mutex_) = false;
  std::thread thread_;  // Last: it uses the others.
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_DISK_SCAN_H_
