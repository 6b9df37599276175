#include "kavo/share.h"

#include <sys/statvfs.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <memory>
#include <string_view>

#include "platform/local/boundary.h"
#include "platform/local/share_table.h"

using kavo::local::Fail;
using kavo::local::Guarded;
using kavo::local::PresentShares;
using kavo::local::Share;

namespace {

constexpr std::string_view kRecycleBin = "#recycle";
constexpr std::string_view kHomes = "homes";

int FailForParameter() { return Fail(KAVO_ERR_BAD_PARAMETER, EINVAL); }
int FailForMissing() { return Fail(KAVO_ERR_NOT_FOUND, ENOENT); }

// Sets `*answer` to 1 or 0 by what question(share, is_true) finds for the share of that name; it
// returns what the function is to.
template <typename Question>
int Ask(const struct KAVO_SHARE* record, int* answer, Question question) noexcept {
  if (record == nullptr || record->szName == nullptr || answer == nullptr) {
    return FailForParameter();
  }
  const auto table = PresentShares();
  if (table == nullptr) {
    return -1;
  }
  const Share* const share = table->FindName(record->szName);
  if (share == nullptr) {
    return FailForMissing();
  }
  bool is_true = false;
  const int result = question(*share, is_true);
  if (result == 0) {
    *answer = is_true ? 1 : 0;
  }
  return result;
}

int AskFlag(const struct KAVO_SHARE* record, int* answer, bool Share::*flag) noexcept {
  return Ask(record, answer, [flag](const Share& share, bool& is_true) {
    is_true = share.*flag;
    return 0;
  });
}

// A record for as long as the table lives. Nobody writes through it.
struct KAVO_SHARE ViewOf(const Share& share) {
  return {const_cast<char*>(share.name.c_str()), const_cast<char*>(share.path.c_str()),
          share.ftp_privilege};
}

// Takes what stands behind the first `count` strings off a list again.
void Truncate(KLIBCSZLIST& list, int count) {
  while (list.nItem > count) {
    free(list.ppszItem[--list.nItem]);
  }
}

// Appends the names; negative when one fails, with those before it on the list.
int AppendNames(KLIBCSZLIST** list, const struct KLIB_SHARE_ENUM& which) {
  const auto table = PresentShares();
  if (table == nullptr) {
    return -1;
  }
  int count = 0;
  for (const Share& share : table->Shares()) {
    const struct KAVO_SHARE record = ViewOf(share);
    if (which.filter != nullptr && which.filter(&record) != 0) {
      continue;
    }
    if (KLIBCSzListPush(list, record.szName) < 0) {
      return -1;
    }
    ++count;
  }
  return count;
}

// Takes the first component off `path`, which begins with a slash or is empty.
std::string_view TakeComponent(std::string_view& path) {
  path.remove_prefix(path.empty() ? 0 : 1);
  const std::string_view component = path.substr(0, path.find('/'));
  path.remove_prefix(component.size());
  return component;
}

}  // namespace

int KAVOShareGet(const char* name, struct KAVO_SHARE** share) {
  if (share == nullptr) {
    return FailForParameter();
  }
  *share = nullptr;
  if (name == nullptr) {
    return FailForParameter();
  }
  const auto table = PresentShares();
  if (table == nullptr) {
    return -1;
  }
  const Share* const found = table->FindName(name);
  if (found == nullptr) {
    return FailForMissing();
  }
  // One block: the record, then its texts.
  void* const block = malloc(sizeof(KAVO_SHARE) + found->name.size() + found->path.size() + 2);
  if (block == nullptr) {
    return Fail(KAVO_ERR_SYSTEM, ENOMEM);
  }
  auto* const record = static_cast<KAVO_SHARE*>(block);
  char* const name_copy = static_cast<char*>(block) + sizeof(KAVO_SHARE);
  char* const path_copy = name_copy + found->name.size() + 1;
  std::copy_n(found->name.c_str(), found->name.size() + 1, name_copy);
  std::copy_n(found->path.c_str(), found->path.size() + 1, path_copy);
  *record = {name_copy, path_copy, found->ftp_privilege};
  *share = record;
  return 0;
}

void KAVOShareFree(struct KAVO_SHARE* share) { free(share); }

int KLIBShareIsEncryptedGet(const struct KAVO_SHARE* share, int* is_encrypted) {
  return AskFlag(share, is_encrypted, &Share::encrypted);
}

int KLIBShareIsEncryptionGet(const struct KAVO_SHARE* share, int* is_encryption) {
  return AskFlag(share, is_encryption, &Share::encryption);
}

int KLIBShareIsReadOnlyGet(const struct KAVO_SHARE* share, int* is_read_only) {
  return Ask(share, is_read_only, [](const Share& found, bool& is_true) {
    struct statvfs info {};
    if (!found.read_only && statvfs(found.path.c_str(), &info) != 0) {
      if (found.encrypted && errno == ENOENT) {
        is_true = false;  // The folder of a locked share need not be there.
        return 0;
      }
      return kavo::local::SetLastError(KAVO_ERR_SYSTEM);
    }
    is_true = found.read_only || (info.f_flag & ST_RDONLY) != 0;
    return 0;
  });
}

int KLIBShareRecycleStatusGet(const struct KAVO_SHARE* share, int* is_enabled) {
  return AskFlag(share, is_enabled, &Share::recycle);
}

int KLIBShareHideUnreadableGet(const struct KAVO_SHARE* share, int* is_hidden) {
  return AskFlag(share, is_hidden, &Share::hide_unreadable);
}

int KLIBShareEnum(KLIBCSZLIST** list, const struct KLIB_SHARE_ENUM* which) {
  if (list == nullptr || *list == nullptr || which == nullptr) {
    return FailForParameter();
  }
  const int before = (*list)->nItem;
  const int count = Guarded([list, which] { return AppendNames(list, *which); });
  if (count < 0) {
    Truncate(**list, before);
  }
  return count;
}

int KAVOShareNamePathGet(const char* full_path, char* name, int name_bytes, char* path,
                         int path_bytes) {
  if (full_path == nullptr || name == nullptr || path == nullptr) {
    return FailForParameter();
  }
  const auto table = PresentShares();
  if (table == nullptr) {
    return -1;
  }
  const Share* const share = table->FindHolder(full_path);
  if (share == nullptr) {
    return FailForMissing();
  }
  if (name_bytes < 0 || static_cast<size_t>(name_bytes) <= share->name.size() || path_bytes < 0 ||
      static_cast<size_t>(path_bytes) <= share->path.size()) {
    return Fail(KAVO_ERR_BAD_PARAMETER, ERANGE);
  }
  std::copy_n(share->name.c_str(), share->name.size() + 1, name);
  std::copy_n(share->path.c_str(), share->path.size() + 1, path);
  return 0;
}

int KAVOShareIsShareRecycle(const char* full_path) {
  if (full_path == nullptr) {
    return FailForParameter();
  }
  const auto table = PresentShares();
  if (table == nullptr) {
    return -1;
  }
  std::string_view path = full_path;
  const Share* const share = table->FindHolder(path);
  if (share == nullptr) {
    return 0;
  }
  path.remove_prefix(share->path.size());
  return TakeComponent(path) == kRecycleBin ? 1 : 0;
}

int KAVORecycleUserHomePathIsExist(const char* full_path, int /*kind*/) {
  if (full_path == nullptr) {
    return FailForParameter();
  }
  const auto table = PresentShares();
  if (table == nullptr) {
    return -1;
  }
  std::string_view path = full_path;
  const Share* const homes = table->FindName(kHomes);
  if (homes == nullptr || !path.starts_with(homes->path)) {
    return 0;
  }
  path.remove_prefix(homes->path.size());
  if (!path.starts_with('/')) {
    return 0;
  }
  const std::string_view user = TakeComponent(path);
  return !user.empty() && TakeComponent(path) == kRecycleBin ? 1 : 0;
}
