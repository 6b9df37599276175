// The state of the indexing service that is no folder's configuration: until when it is paused, and
// a word of status bits for each share.
#ifndef FILEINDEX_STATUS_MGR_H_
#define FILEINDEX_STATUS_MGR_H_

#include <json/value.h>

#include <string>

#include "common/export.h"

namespace vexlo::fileindex {

// A share's status bits. Stored: never renumber.
enum ShareStatus : unsigned int {
  SS_NEED_REINDEX = 1,  // Something about the share went unindexed: a reindex makes up for it.
  SS_NEED_REBUILD = 2,  // Asked for by a folder's reindex; nothing in the library sets it.
};

// The status file as it was when the object was made, and changes to it.
//
// - The file is read once, without a lock. It is replaced whole, so what is read is what some
//   writer saved.
// - A change is made to what this object read and is saved with the rest of it, under the status
//   lock file. What others saved in between is lost: make the object right before the change, or
//   hold a lock of one's own around both.
// - A save that fails leaves the old file; the object keeps the change.
//
// Whatever saves makes the process root as SDKCredentials does, for good when it was someone else
// before, and throws Error 503 when it cannot. Whatever takes the status lock waits for it up to a
// minute and then throws Error 506; the lock is not recursive, so a holder calls none of these. For
// one thread at a time.
class VEXLO_EXPORT StatusMgr {
 public:
  // A missing file, or one that holds null, is no pause and no bits. Throws Error 504 when the file
  // cannot be read or is no JSON.
  StatusMgr();

  // Seconds since the epoch at which indexing goes on; 0 when it is paused until further notice, -1
  // when it is not paused. A pause that has run out still has its instant here. The two questions
  // throw Error 120 when the file holds something else than an object, or "share" does.
  long GetPauseInfo() const;
  unsigned int GetShareStatus(const std::string& share) const;

  // Pauses indexing for `hours` hours from now, or until Resume() when `hours` is 0, and tells the
  // daemon ("pause", {"resume_time": the instant as above}). The hours are made seconds in 32 bits,
  // which wrap: from 596,524 on the instant may lie in the past.
  // Throws Error 120 when `hours` is negative and nothing changes.
  void Pause(int hours);

  // Ends a pause, and tells the daemon ("resume", null).
  void Resume();

  // Both hold the status lock throughout. The file is saved before the daemon hears of it, and
  // stays so when the daemon cannot be told: they throw, and block, as SendCommandToDaemon() does,
  // besides what Save() and the lock throw.

  // Add bits to a share's word, take bits away (a share that had no word has one of 0 then), and
  // drop the word. Throw as GetShareStatus() and Save() do, and for the lock.
  void SetShareStatus(const std::string& share, int bits);
  void UnsetShareStatus(const std::string& share, int bits);
  void ClearShareStatus(const std::string& share);

  // Writes the file, mode 0644. Takes no lock. Throws Error 505 when the file cannot be written,
  // 502 when its mode cannot be set.
  void Save() const;

 private:
  Json::Value GetShares() const;
  void SaveResumeTime(Json::Int64 resume_time);

  Json::Value data_;
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_STATUS_MGR_H_
