// Records what the program does to the files below a folder, and makes of it what a power cut may
// leave. For a test program that has power_cut.cpp linked in, which takes the place of the C
// library's functions that change files. Nothing is synced in it: what would be is known.
#ifndef FAULTS_POWER_CUT_H_
#define FAULTS_POWER_CUT_H_

#include <cstddef>
#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

struct DiskState {
  std::map<std::string, std::string> files;  // By their paths.
  std::set<std::string> folders;
  bool operator==(const DiskState&) const = default;
};

// What is below the folder, less the shared memory of databases, which the first who opens one
// makes anew; and the way back.
DiskState ReadDisk(const std::string& folder);
void WriteDisk(const std::string& folder, const DiskState& state);

struct DiskOp {
  enum class Kind { kWrite, kResize, kSync, kMake, kMakeFolder, kRename, kRemove, kSyncFolder };
  Kind kind;
  int file = 0;  // The number of a file, whatever its name is.
  std::string path = {};
  std::string path_old = {};
  size_t at = 0;
  std::string bytes = {};
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
  ~PowerCut() { Stop(); }
  PowerCut(const PowerCut&) = delete;
  PowerCut& operator=(const PowerCut&) = delete;

  // Puts a number into the record. Any thread.
  void Note(int number);
  // Ends the recording. It has missed nothing when the state after all of it is ReadDisk().
  void Stop();

  size_t Count() const { return ops_.size(); }
  // What was noted last before the operation of that number, and what that was.
  int NoteAt(size_t count) const;
  std::string PathAt(size_t count) const;
  // When the power fails after `count` operations. `seed` chooses.
  DiskState After(size_t count, Survives survives, uint32_t seed) const;

 private:
  friend struct Recorder;

  const std::string folder_;
  std::map<std::string, int> files_;  // By their names now.
  std::vector<DiskOp> before_;        // What makes the disk as it was.
  std::vector<DiskOp> ops_;
  std::map<size_t, int> notes_;  // By the number of the operation that follows.
};

#endif  // FAULTS_POWER_CUT_H_
