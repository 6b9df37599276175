// Records what the program does to the files below a folder, and makes of it what a power cut may
// leave. A test program has power_cut.cpp linked in, which takes the place of the C library's
// functions that change files. No call syncs anything in it: what would have been synced is known.
#ifndef FAULTS_POWER_CUT_H_
#define FAULTS_POWER_CUT_H_

#include <cstddef>
#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

// Files by their paths, and folders.
struct DiskState {
  std::map<std::string, std::string> files;
  std::set<std::string> folders;
  bool operator==(const DiskState&) const = default;
};

// What is below the folder, less what no power cut leaves: sockets, and the shared memory of
// databases, which is made anew by the first who opens one.
DiskState ReadDisk(const std::string& folder);
// Makes it so.
void WriteDisk(const std::string& folder, const DiskState& state);

// One change, in the order in which they were made.
struct DiskOp {
  enum class Kind {
    kWrite,
    kResize,
    kSync,
    kMake,
    kMakeFolder,
    kRename,
    kRemove,
    kSyncFolder,
    kNote
  };
  Kind kind;
  int file = 0;  // The number of a file, whatever its name is; of kNote, what was noted.
  size_t at = 0;
  std::string bytes = {};
  std::string path = {};  // In the folder of which the entry is, or which is synced.
  std::string path_old = {};
};

enum class Survives {
  kAll,     // Everything up to the cut.
  kSynced,  // What was synced, be it data or entries of folders.
  kSome,    // Of the rest, too, a choice: any writes, of which the last is cut at 512 bytes, and of
            // each folder's entries those up to some point, as a journal keeps them in order.
};

class PowerCut {
 public:
  // Records from now on; what is below the folder is there for good. One at a time.
  explicit PowerCut(std::string folder);
  ~PowerCut();
  PowerCut(const PowerCut&) = delete;
  PowerCut& operator=(const PowerCut&) = delete;

  // Puts a note into the record. Any thread.
  void Note(int number);
  // Ends the recording. The record misses nothing when the state after all of it is ReadDisk().
  void Stop();

  const std::vector<DiskOp>& Ops() const { return ops_; }
  // When the power fails after the first `count` operations. `seed` chooses.
  DiskState After(size_t count, Survives survives, uint32_t seed) const;

 private:
  friend struct Recorder;

  const std::string folder_;
  DiskState before_;
  std::map<std::string, int> files_;  // By their names now.
  std::map<int, std::string> contents_;
  std::vector<DiskOp> ops_;
};

#endif  // FAULTS_POWER_CUT_H_
