// The files of an index as files: made, moved, set aside, removed.
#ifndef DAEMONS_KAVOELASTICD_DISK_H_
#define DAEMONS_KAVOELASTICD_DISK_H_

#include <string>

namespace vexlo::elasticd {

// "WHAT, path=PATH, reason=..." with the meaning of errno.
std::string ErrnoText(const std::string& what, const std::string& path);

// Throws Failure kStorage when that cannot be told: what counts as missing is made anew.
bool Exists(const std::string& path);

// Whether both names lead to one file or folder. False where there is none.
bool IsSameFile(const std::string& a, const std::string& b);
// Whether both are on one file system. False where there is none.
bool OnOneDisk(const std::string& a, const std::string& b);

// Makes the folder with those above it. Throws Failure kStorage.
void MakeFolders(const std::string& path);

// Makes an empty file that only its owner may read: an index holds the text of everybody's files.
// SQLite gives the files beside it the same mode. Throws Failure kStorage.
void MakePrivateFile(const std::string& path);

// Syncs what a folder holds. Throws Failure kStorage.
void SyncFolder(const std::string& path);

// Removes the database in `folder`. Throws Failure kStorage when it stays.
void RemoveDatabase(const std::string& folder);

// Removes also what was set aside, and the folder when nothing else is in it.
void RemoveIndexFolder(const std::string& folder);

// Moves the database, which is closed and whole in its one file, to another folder, instead of what
// is there; across disks as a copy that stands whole before the old one goes, for which it may be
// open, with its log. Throws Failure; where no database stands in `to` then, the one in `from` is
// as it was, and nothing is left of a copy.
void MoveDatabase(const std::string& from, const std::string& to);

// Renames the database to "index.db.WHY-N" with a new N; the name, or "" when there was nothing.
// RemoveIndexFolder() removes those that are "damaged". Throws Failure kStorage.
std::string SetAside(const std::string& folder, const std::string& why = "damaged");

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_DISK_H_
