#include "daemons/kavoelasticd/disk.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <system_error>
#include <vector>

#include "daemons/common/folders.h"
#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/sqlite.h"

namespace vexlo::elasticd {
namespace {

constexpr const char* kSuffixes[] = {"", "-wal", "-shm", "-journal"};

[[noreturn]] void Fail(const std::string& what, const std::string& path) {
  throw Failure(errno == ENOSPC ? Code::kNoSpace : Code::kStorage, ErrnoText(what, path));
}

std::string Database(const std::string& folder) { return folder + "/index.db"; }

void Remove(const std::string& path) {
  if (unlink(path.c_str()) != 0 && errno != ENOENT && errno != ENOTDIR) {
    Fail("removing failed", path);
  }
}

void Sync(const std::string& path) {
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    Fail("opening to sync failed", path);
  }
  const bool synced = fsync(fd) == 0;
  const int error = errno;
  close(fd);
  if (!synced) {
    errno = error;
    Fail("syncing failed", path);
  }
}

// As far as it came: it may fill the disk.
void RemoveCopy(const std::string& folder) noexcept {
  for (const char* suffix : {".copy-journal", ".copy", ""}) {
    unlink((Database(folder) + suffix).c_str());
  }
}

void CopyDatabase(const std::string& from, const std::string& to) {
  const std::string copy = Database(to) + ".copy";
  Remove(copy);
  try {
    MakePrivateFile(copy);
    {
      Connection db(Database(from), Connection::Use::kWrite);
      Sql(db, "VACUUM INTO ?").Text(copy).Run();
    }
    Sync(copy);
    if (rename(copy.c_str(), Database(to).c_str()) != 0) {
      Fail("renaming failed", copy);
    }
    SyncFolder(to);
  } catch (...) {
    RemoveCopy(to);
    throw;
  }
}

}  // namespace

std::string ErrnoText(const std::string& what, const std::string& path) {
  return what + ", path=" + path + ", reason=" + std::generic_category().message(errno);
}

bool Exists(const std::string& path) {
  struct stat status;
  if (lstat(path.c_str(), &status) == 0) {
    return true;
  }
  if (errno != ENOENT && errno != ENOTDIR) {
    Fail("looking for it failed", path);
  }
  return false;
}

bool IsSameFile(const std::string& a, const std::string& b) {
  struct stat first;
  struct stat second;
  return stat(a.c_str(), &first) == 0 && stat(b.c_str(), &second) == 0 &&
         first.st_dev == second.st_dev && first.st_ino == second.st_ino;
}

bool OnOneDisk(const std::string& a, const std::string& b) {
  struct stat first;
  struct stat second;
  return stat(a.c_str(), &first) == 0 && stat(b.c_str(), &second) == 0 &&
         first.st_dev == second.st_dev;
}

void MakeFolders(const std::string& path) {
  if (!daemon::MakeFolders(path)) {
    Fail("making a folder failed", path);
  }
}

void MakePrivateFile(const std::string& path) {
  const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  if (fd < 0) {
    Fail("making a file failed", path);
  }
  close(fd);
}

void SyncFolder(const std::string& path) {
  if (!daemon::SyncFolder(path)) {
    Fail("syncing failed", path);
  }
}

void RemoveDatabase(const std::string& folder) {
  // The file itself last: as long as it stands, its log belongs to it.
  for (const char* suffix : {"-shm", "-wal", "-journal", ".copy-journal", ".copy", ""}) {
    Remove(Database(folder) + suffix);
  }
}

void RemoveIndexFolder(const std::string& folder) {
  RemoveDatabase(folder);
  std::error_code error;
  std::vector<std::string> aside;
  for (const auto& entry : std::filesystem::directory_iterator(folder, error)) {
    if (entry.path().filename().string().starts_with("index.db.damaged-")) {
      aside.push_back(entry.path().string());
    }
  }
  for (const std::string& path : aside) {
    std::filesystem::remove_all(path, error);  // What was set aside may be anything.
  }
  rmdir(folder.c_str());  // It may hold what others put there.
}

void MoveDatabase(const std::string& from, const std::string& to) {
  MakeFolders(to);
  if (rename(Database(from).c_str(), Database(to).c_str()) != 0) {
    if (errno != EXDEV) {
      Fail("moving the database failed", Database(from));
    }
    CopyDatabase(from, to);
    RemoveDatabase(from);
  }
  SyncFolder(to);
  SyncFolder(from);
  rmdir(from.c_str());
}

std::string SetAside(const std::string& folder, const std::string& why) {
  if (!Exists(Database(folder))) {
    return "";
  }
  std::string aside;
  for (int n = 1; aside.empty() || Exists(aside); ++n) {
    aside = Database(folder) + "." + why + "-" + std::to_string(n);
  }
  for (const char* suffix : kSuffixes) {
    const std::string file = Database(folder) + suffix;
    if (rename(file.c_str(), (aside + suffix).c_str()) != 0 && errno != ENOENT) {
      Fail("setting aside failed", file);
    }
  }
  SyncFolder(folder);
  return aside;
}

}  // namespace vexlo::elasticd
