// The shares file of the local platform, "etc/kavo/shares.json" below the root: what a NAS's own
// settings are elsewhere. Its form is described in docs/shares.md.
//
// On disk: the file is replaced whole (temporary file beside it, fsync, rename, fsync of the
// folder), so a reader finds the old list or the new one. Editors exclude each other by an flock on
// "shares.json.lock" beside it; readers take no lock.
#ifndef KAVO_LOCAL_SHARES_H_
#define KAVO_LOCAL_SHARES_H_

#include <cstdint>
#include <stdexcept>
#include <string>
#include <vector>

// What only the local platform has.
namespace kavo::local {

// One share as the file has it. A key that is missing has the value given here; a key that is not
// named here makes the file bad, so that a mistyped one is not taken for absent.
struct Share {
  std::string name;              // "name": 1 to 255 bytes without "/", and not "." or "..".
  std::string path;              // "path": absolute, without ".", ".." and doubled or trailing
                                 // slashes; the last component is the name. Its encoded form, by
                                 // which FILEIDXQueuePathCompose names the queue, has at most 240
                                 // bytes. Does not hold the queues and indexes, nor lie in them.
  bool encrypted = false;        // "encrypted": locked at present.
  bool encryption = false;       // "encryption": of the encrypted kind.
  bool read_only = false;        // "read_only"
  bool recycle = false;          // "recycle": the recycle bin is on.
  bool hide_unreadable = false;  // "hide_unreadable"
  uint32_t ftp_privilege = 0;    // "ftp_privilege"

  bool operator==(const Share&) const = default;
};

// A shares file that cannot be used. The message is "PATH:LINE: ..." for people, naming share and
// key, or "PATH: ..." when no line is at fault (it cannot be read).
class SharesError : public std::runtime_error {
  using std::runtime_error::runtime_error;
};

// The file that the platform's functions read.
std::string SharesFile();

// The list in order; empty when there is no file. Throws SharesError.
std::vector<Share> ReadShares(const std::string& file);

// Appends a share, or takes one out. The file as it stands must be good, the new list is checked as
// a file is when it is read, and only then written, with mode 0644, the owner that it had where
// that is permitted, and without the comments that it had. The folder is made when it is missing.
// Throws SharesError and leaves the file as it was, for a name that is there already or is not
// there, too; only when the folder cannot be synced at last, the change is there but may not
// outlive a power failure. Blocks while another edits.
void AddShare(const std::string& file, const Share& share);
void RemoveShare(const std::string& file, const std::string& name);

// What has been put before each fixed path of this platform: "" for a system's own. A build that is
// configured with a root takes another one from FILEINDEX_ROOT in the environment, so that tests
// and trials each have their own; a build for "" never looks there.
const std::string& Root();

// What is wrong with FILEINDEX_ROOT in the environment where it would be taken, for people; "" for
// nothing. Root() passes over a value that is not absolute, so programs ask this at their start:
// otherwise they would work on another root than the one that was meant.
std::string RootFault();

}  // namespace kavo::local

#endif  // KAVO_LOCAL_SHARES_H_
