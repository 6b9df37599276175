#include "kavo/user.h"

#include <pwd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>

namespace {

constexpr size_t kFirstBufferBytes = 1024;
constexpr size_t kMaxBufferBytes = size_t{1} << 24;  // No directory service's record comes near it.

}  // namespace

int KAVOUserGet(const char* name, struct KAVO_USER** user) {
  *user = nullptr;
  for (size_t bytes = kFirstBufferBytes; bytes <= kMaxBufferBytes; bytes *= 2) {
    const std::unique_ptr<char[]> buffer(new (std::nothrow) char[bytes]);
    if (buffer == nullptr) {
      errno = ENOMEM;
      return -1;
    }
    struct passwd entry {};
    struct passwd* found = nullptr;
    const int error = getpwnam_r(name, &entry, buffer.get(), bytes, &found);
    if (error == ERANGE) {
      continue;
    }
    if (found == nullptr) {
      errno = error == 0 ? ENOENT : error;
      return -1;
    }
    auto* record = static_cast<KAVO_USER*>(malloc(sizeof(KAVO_USER)));
    char* copy = strdup(found->pw_name);
    if (record == nullptr || copy == nullptr) {
      free(record);
      free(copy);
      errno = ENOMEM;
      return -1;
    }
    *record = {copy, found->pw_uid, found->pw_gid};
    *user = record;
    return 0;
  }
  errno = ERANGE;
  return -1;
}

void KAVOUserFree(struct KAVO_USER* user) {
  if (user != nullptr) {
    free(user->szName);
    free(user);
  }
}
