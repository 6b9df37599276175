#include "kavo/file.h"

#include <acl/libacl.h>
#include <fcntl.h>
#include <sys/acl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

#include "platform/local/fd.h"

using kavo::local::ScopedFd;
using kavo::local::WriteAll;

namespace {

constexpr size_t kBufferBytes = size_t{128} * 1024;
constexpr size_t kRangeBytes = size_t{1} << 30;
constexpr int kNameAttempts = 100;
constexpr char kAccessAcl[] = "system.posix_acl_access";
constexpr std::string_view kAclPrefix = "system.posix_acl_";

// With the slash that ends it; "" for the working directory.
std::string FolderPrefixOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? "" : path.substr(0, slash + 1);
}

// The copy in the making. It lies beside the target under a short name of its own, as the target's
// may be as long as the file system allows. What still has that name goes with the object.
class Temporary {
 public:
  explicit Temporary(const std::string& target) : prefix_(FolderPrefixOf(target) + ".copy.") {}
  ~Temporary() {
    if (made_) {
      const int saved = errno;
      unlink(path_.c_str());
      errno = saved;
    }
  }
  Temporary(const Temporary&) = delete;
  Temporary& operator=(const Temporary&) = delete;

  // Calls make(path) with fresh names until it returns something else than -1 with EEXIST.
  template <typename Maker>
  int Make(Maker make) {
    for (int attempt = 0; attempt < kNameAttempts; ++attempt) {
      unsigned long long random = 0;
      if (getrandom(&random, sizeof(random), 0) != static_cast<ssize_t>(sizeof(random))) {
        return -1;
      }
      char suffix[2 * sizeof(random) + 1];
      snprintf(suffix, sizeof(suffix), "%016llx", random);
      path_ = prefix_ + suffix;
      const int result = make(path_.c_str());
      if (result >= 0) {
        made_ = true;
        return result;
      }
      if (errno != EEXIST) {
        return -1;
      }
    }
    return -1;
  }
  const char* Path() const { return path_.c_str(); }

 private:
  std::string prefix_;
  std::string path_;
  bool made_ = false;
};

// A regular file by its descriptor, or a symbolic link (fd -1) by its path.
struct Object {
  int fd;
  const char* path;

  ssize_t ListXattr(char* names, size_t size) const {
    return fd >= 0 ? flistxattr(fd, names, size) : llistxattr(path, names, size);
  }
  ssize_t GetXattr(const char* name, char* value, size_t size) const {
    return fd >= 0 ? fgetxattr(fd, name, value, size) : lgetxattr(path, name, value, size);
  }
  int SetXattr(const char* name, const std::string& value) const {
    return fd >= 0 ? fsetxattr(fd, name, value.data(), value.size(), 0)
                   : lsetxattr(path, name, value.data(), value.size(), 0);
  }
  int Chown(uid_t user, gid_t group) const {
    return fd >= 0 ? fchown(fd, user, group) : lchown(path, user, group);
  }
  int SetTimes(const struct timespec (&times)[2]) const {
    return fd >= 0 ? futimens(fd, times) : utimensat(AT_FDCWD, path, times, AT_SYMLINK_NOFOLLOW);
  }
};

// Fills `bytes` from read(buffer, size), which tells the size when it is asked for none of it.
template <typename Reader>
bool ReadGrowing(std::string& bytes, Reader read) {
  while (true) {
    const ssize_t needed = read(nullptr, 0);
    if (needed < 0) {
      return false;
    }
    bytes.resize(static_cast<size_t>(needed));
    const ssize_t count = needed == 0 ? 0 : read(bytes.data(), bytes.size());
    if (count >= 0) {
      bytes.resize(static_cast<size_t>(count));
      return true;
    }
    if (errno != ERANGE) {
      return false;
    }
  }
}

bool IsUnsupported(int error) { return error == ENOTSUP || error == ENOSYS; }

// Whether a copy may go without an attribute: nobody but root writes most namespaces, and many file
// systems have none of them.
bool MayLoseXattr(const char* name, int error) {
  return IsUnsupported(error) ||
         ((error == EPERM || error == EACCES) && !std::string_view(name).starts_with("user."));
}

// All but the ACLs.
bool CopyXattrs(const Object& from, const Object& to) {
  std::string names;
  if (!ReadGrowing(names,
                   [&from](char* buffer, size_t size) { return from.ListXattr(buffer, size); })) {
    return IsUnsupported(errno);
  }
  std::string value;
  for (const char* name = names.c_str(); name < names.c_str() + names.size();
       name += strlen(name) + 1) {
    if (std::string_view(name).starts_with(kAclPrefix)) {
      continue;
    }
    if (!ReadGrowing(value, [&from, name](char* buffer, size_t size) {
          return from.GetXattr(name, buffer, size);
        })) {
      if (errno == ENODATA || MayLoseXattr(name, errno)) {
        continue;
      }
      return false;
    }
    if (to.SetXattr(name, value) != 0 && !MayLoseXattr(name, errno)) {
      return false;
    }
  }
  return true;
}

// The mode for a file whose ACL is lost. With an ACL the group bits are its mask, which may well
// allow more than the file's group is given.
mode_t ModeWithoutAcl(int fd, mode_t mode) {
  const std::unique_ptr<std::remove_pointer_t<acl_t>, decltype(&acl_free)> acl(acl_get_fd(fd),
                                                                               &acl_free);
  acl_entry_t entry = nullptr;
  for (int which = ACL_FIRST_ENTRY; acl != nullptr && acl_get_entry(acl.get(), which, &entry) == 1;
       which = ACL_NEXT_ENTRY) {
    acl_tag_t tag = ACL_UNDEFINED_TAG;
    acl_permset_t set = nullptr;
    if (acl_get_tag_type(entry, &tag) == 0 && tag == ACL_GROUP_OBJ &&
        acl_get_permset(entry, &set) == 0) {
      const mode_t group = (acl_get_perm(set, ACL_READ) == 1 ? S_IRGRP : 0U) |
                           (acl_get_perm(set, ACL_WRITE) == 1 ? S_IWGRP : 0U) |
                           (acl_get_perm(set, ACL_EXECUTE) == 1 ? S_IXGRP : 0U);
      return mode & (~static_cast<mode_t>(S_IRWXG) | group);
    }
  }
  return mode & ~static_cast<mode_t>(S_IRWXG);
}

// Gives `to` the ACL of `from`, or none where `from` has none: the folder's default ACL may have
// given it one. Takes from `mode` what must not be allowed without the ACL.
bool CopyAcl(const Object& from, const Object& to, mode_t& mode) {
  std::string acl;
  if (ReadGrowing(acl, [&from](char* buffer, size_t size) {
        return from.GetXattr(kAccessAcl, buffer, size);
      })) {
    if (to.SetXattr(kAccessAcl, acl) == 0) {
      return true;
    }
    const int error = errno;
    mode = ModeWithoutAcl(from.fd, mode);
    errno = error;
    return error == EPERM || IsUnsupported(error);
  }
  if (errno != ENODATA && !IsUnsupported(errno)) {
    return false;
  }
  return fremovexattr(to.fd, kAccessAcl) == 0 || errno == ENODATA || IsUnsupported(errno);
}

// Best effort: only root gives files away, and an id may have no meaning to the file system.
bool CopyOwner(const Object& to, const struct stat& source) {
  const auto may_fail = [] { return errno == EPERM || errno == EINVAL || IsUnsupported(errno); };
  if (to.Chown(source.st_uid, source.st_gid) == 0) {
    return true;
  }
  return may_fail() && (to.Chown(static_cast<uid_t>(-1), source.st_gid) == 0 || may_fail());
}

// In this order: a change of owner takes the setuid bits and file capabilities away; the ACL and
// the mode may take away the right to write other attributes; and each of them changes the times.
bool CopyAttributes(const Object& from, const Object& to, const struct stat& source) {
  if (!CopyOwner(to, source) || !CopyXattrs(from, to)) {
    return false;
  }
  if (to.fd >= 0) {
    mode_t mode = source.st_mode & ALLPERMS;
    struct stat copy {};
    if (!CopyAcl(from, to, mode) || fstat(to.fd, &copy) != 0) {
      return false;
    }
    // Set for another owner these bits would lend the wrong rights.
    if (copy.st_uid != source.st_uid) {
      mode &= ~static_cast<mode_t>(S_ISUID);
    }
    if (copy.st_gid != source.st_gid) {
      mode &= ~static_cast<mode_t>(S_ISGID);
    }
    if (fchmod(to.fd, mode) != 0) {
      return false;
    }
  }
  return to.SetTimes({source.st_atim, source.st_mtim}) == 0;
}

// From where both files stand to the end.
bool CopyThroughMemory(int from, int to) {
  std::vector<char> buffer(kBufferBytes);
  while (true) {
    const ssize_t count = read(from, buffer.data(), buffer.size());
    if (count == 0) {
      return true;
    }
    if (count > 0) {
      if (!WriteAll(to, {buffer.data(), static_cast<size_t>(count)})) {
        return false;
      }
    } else if (errno != EINTR) {
      return false;
    }
  }
}

// The kernel cannot, or this file system and that; reading and writing may still do.
bool IsBeyondKernelCopy(int error) {
  return error == EXDEV || error == EINVAL || error == EPERM || IsUnsupported(error);
}

bool CopyData(int from, int to) {
  bool copied_some = false;
  while (true) {
    const ssize_t count = copy_file_range(from, nullptr, to, nullptr, kRangeBytes, 0);
    if (count > 0) {
      copied_some = true;
    } else if (count == 0) {
      // Nothing at all: empty, or made up by the kernel while it is read, as below /proc.
      return copied_some || CopyThroughMemory(from, to);
    } else if (errno != EINTR) {
      return IsBeyondKernelCopy(errno) && CopyThroughMemory(from, to);
    }
  }
}

bool CopyFile(const char* from, bool keep_attributes, Temporary& temporary) {
  // O_NONBLOCK for a FIFO that took the file's place meanwhile.
  const ScopedFd in(open(from, O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY));
  struct stat opened {};
  if (in.Get() < 0 || fstat(in.Get(), &opened) != 0) {
    return false;
  }
  if (!S_ISREG(opened.st_mode)) {
    errno = ENOTSUP;
    return false;
  }
  // Nobody else reads a copy that is not yet dressed; a bare copy is no more open than its source.
  const mode_t mode = keep_attributes ? 0600 : opened.st_mode & ACCESSPERMS;
  ScopedFd out(temporary.Make([mode](const char* path) {
    return open(path, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, mode);
  }));
  if (out.Get() < 0 || !CopyData(in.Get(), out.Get())) {
    return false;
  }
  if (keep_attributes && !CopyAttributes({in.Get(), from}, {out.Get(), temporary.Path()}, opened)) {
    return false;
  }
  return fsync(out.Get()) == 0 && out.Close();
}

bool CopyLink(const char* from, const struct stat& source, bool keep_attributes,
              Temporary& temporary) {
  std::string text(256, '\0');
  ssize_t length = 0;
  while ((length = readlink(from, text.data(), text.size())) == static_cast<ssize_t>(text.size())) {
    text.resize(2 * text.size());
  }
  if (length < 0) {
    return false;
  }
  text.resize(static_cast<size_t>(length));
  if (temporary.Make([&text](const char* path) { return symlink(text.c_str(), path); }) < 0) {
    return false;
  }
  return !keep_attributes || CopyAttributes({-1, from}, {-1, temporary.Path()}, source);
}

// False only when a file system tells that entries may be lost: not every folder may be opened, and
// not every file system has something to sync.
bool SyncFolderOf(const std::string& path) {
  const ScopedFd folder(
      open((FolderPrefixOf(path) + ".").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return folder.Get() < 0 || fsync(folder.Get()) == 0 || (errno != EIO && errno != ENOSPC);
}

// A source that was written to meanwhile must not be removed: the copy lacks what was written.
bool IsUnchanged(const char* path, const struct stat& before) {
  struct stat now {};
  if (lstat(path, &now) != 0) {
    return errno == ENOENT;
  }
  if (now.st_dev != before.st_dev || now.st_ino != before.st_ino || now.st_size != before.st_size ||
      now.st_mtim.tv_sec != before.st_mtim.tv_sec ||
      now.st_mtim.tv_nsec != before.st_mtim.tv_nsec) {
    errno = EBUSY;
    return false;
  }
  return true;
}

bool Exchange(const char* a, const char* b) {
  return renameat2(AT_FDCWD, a, AT_FDCWD, b, RENAME_EXCHANGE) == 0;
}

// The last steps of a move to another file system. The old target is kept under the temporary's
// name, where the file system can, until the source is gone: a medium that is mounted read-only
// lets itself be read to the end and refuses only the unlink.
bool MoveIntoPlace(const Temporary& temporary, const char* from, const struct stat& source,
                   const char* to) {
  const bool exchanged = Exchange(temporary.Path(), to);
  const bool was_empty = !exchanged && errno == ENOENT;
  if (!exchanged && rename(temporary.Path(), to) != 0) {
    return false;
  }
  if (SyncFolderOf(to) && IsUnchanged(from, source) && (unlink(from) == 0 || errno == ENOENT)) {
    return true;
  }
  const int saved = errno;
  if (exchanged) {
    Exchange(temporary.Path(), to);
  } else if (was_empty) {
    unlink(to);
  }
  errno = saved;
  return false;
}

bool IsSame(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

// Whether two paths to one file are one entry of one folder, and not two hard links.
bool IsSameEntry(const std::string& a, const std::string& b) {
  struct stat folder_a {};
  struct stat folder_b {};
  const std::string prefix_a = FolderPrefixOf(a);
  const std::string prefix_b = FolderPrefixOf(b);
  return a.substr(prefix_a.size()) == b.substr(prefix_b.size()) &&
         stat((prefix_a + ".").c_str(), &folder_a) == 0 &&
         stat((prefix_b + ".").c_str(), &folder_b) == 0 && IsSame(folder_a, folder_b);
}

bool CopyOrMove(const char* from, const char* to, const KAVO_FILE_COPY_ARGS& args) {
  struct stat source {};
  if (lstat(from, &source) != 0) {
    return false;
  }
  struct stat target {};
  const bool has_target = lstat(to, &target) == 0;
  if (args.remove_source != 0) {
    // rename() does nothing between two links to one file, and a copy between two mounts of one
    // folder would end with the unlink of the only entry.
    if (has_target && IsSame(source, target) && !S_ISDIR(source.st_mode)) {
      return IsSameEntry(from, to) || unlink(from) == 0;
    }
    if (rename(from, to) == 0) {
      return true;
    }
    if (errno != EXDEV) {
      return false;
    }
  }
  if (S_ISDIR(source.st_mode) || (has_target && S_ISDIR(target.st_mode))) {
    errno = EISDIR;
    return false;
  }
  if (!S_ISREG(source.st_mode) && !S_ISLNK(source.st_mode)) {
    errno = ENOTSUP;
    return false;
  }
  Temporary temporary(to);
  const bool keep_attributes = args.keep_attributes != 0;
  if (!(S_ISREG(source.st_mode) ? CopyFile(from, keep_attributes, temporary)
                                : CopyLink(from, source, keep_attributes, temporary))) {
    return false;
  }
  if (args.remove_source != 0) {
    return MoveIntoPlace(temporary, from, source, to);
  }
  if (rename(temporary.Path(), to) != 0) {
    return false;
  }
  SyncFolderOf(to);  // The copy stands; whether it outlives a power failure is all that is open.
  return true;
}

}  // namespace

int KAVOFileCopy(const char* from, const char* to, const struct KAVO_FILE_COPY_ARGS* args) {
  try {
    return CopyOrMove(from, to, *args) ? 0 : -1;
  } catch (const std::bad_alloc&) {
    errno = ENOMEM;
    return -1;
  }
}
