#include "watch/directory.h"

#include <fcntl.h>

#include <cerrno>
#include <functional>

namespace vexlo::watch {
namespace {

constexpr int kOpenFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;

uint64_t Mix(uint64_t hash, uint64_t value) {
  hash = (hash ^ value) * 0xbf58476d1ce4e5b9;
  return hash ^ (hash >> 29);
}

uint64_t Mix(uint64_t hash, const struct timespec& time) {
  return Mix(Mix(hash, static_cast<uint64_t>(time.tv_sec)), static_cast<uint64_t>(time.tv_nsec));
}

}  // namespace

Fd OpenDirectory(int parent, const std::string& name) {
  return Fd(openat(parent, name.c_str(), kOpenFlags));
}

Fd OpenDirectory(const std::string& path) {
  Fd fd(open(path.c_str(), kOpenFlags));
  if (fd || errno != ENAMETOOLONG) {
    return fd;
  }
  fd = Fd(open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
  size_t at = 1;
  for (size_t slash; fd && (slash = path.find('/', at)) != std::string::npos; at = slash + 1) {
    fd =
        Fd(openat(fd.Get(), path.substr(at, slash - at).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  }
  return fd ? OpenDirectory(fd.Get(), path.substr(at)) : Fd();
}

bool MeansNoDirectory(int error) {
  return error == ENOENT || error == ENOTDIR || error == ELOOP || error == ESTALE;
}

uint64_t EntryHash(std::string_view name, const struct stat& attributes) {
  uint64_t hash = std::hash<std::string_view>()(name);
  hash = Mix(hash, attributes.st_ino);
  hash = Mix(hash, attributes.st_mode);
  hash = Mix(hash, (uint64_t{attributes.st_uid} << 32) | attributes.st_gid);
  if (!S_ISDIR(attributes.st_mode)) {
    hash = Mix(hash, static_cast<uint64_t>(attributes.st_size));
    hash = Mix(hash, attributes.st_mtim);
    hash = Mix(hash, attributes.st_ctim);
  }
  return hash;
}

}  // namespace vexlo::watch
