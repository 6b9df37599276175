#include "platform/local/access.h"

#include <acl/libacl.h>
#include <sys/acl.h>

#include <algorithm>
#include <cerrno>
#include <memory>
#include <type_traits>

#include "kavo/acl.h"

namespace kavo::local {
namespace {

constexpr unsigned kRead = KAVO_ACL_READ;
constexpr unsigned kWrite = KAVO_ACL_WRITE;
constexpr unsigned kExecute = KAVO_ACL_EXECUTE;
constexpr unsigned kAll = kRead | kWrite | kExecute;

using Acl = std::unique_ptr<std::remove_pointer_t<acl_t>, decltype(&acl_free)>;

unsigned PermOf(acl_entry_t entry) {
  acl_permset_t set = nullptr;
  if (acl_get_permset(entry, &set) != 0) {
    return 0;
  }
  unsigned perm = 0;
  perm |= acl_get_perm(set, ACL_READ) == 1 ? kRead : 0;
  perm |= acl_get_perm(set, ACL_WRITE) == 1 ? kWrite : 0;
  perm |= acl_get_perm(set, ACL_EXECUTE) == 1 ? kExecute : 0;
  return perm;
}

// The user or group (their ids are one type) that an entry names; -1, which no entry names, when it
// cannot be told.
id_t QualifierOf(acl_entry_t entry) {
  const std::unique_ptr<void, decltype(&acl_free)> id(acl_get_qualifier(entry), &acl_free);
  return id == nullptr ? static_cast<id_t>(-1) : *static_cast<const id_t*>(id.get());
}

// The rights of a user who does not own the file. A named user is looked for first; then every
// group that matches adds its rights; only who matches nothing is "other". `groups` holds no -1.
unsigned EvaluateAcl(acl_t acl, uid_t user, gid_t file_group, const std::vector<gid_t>& groups) {
  const auto is_member = [&groups](gid_t group) {
    return std::find(groups.begin(), groups.end(), group) != groups.end();
  };
  unsigned by_group = 0;
  unsigned by_user = 0;
  unsigned other = 0;
  unsigned mask = kAll;
  bool user_named = false;
  bool group_matched = false;
  acl_entry_t entry = nullptr;
  for (int which = ACL_FIRST_ENTRY; acl_get_entry(acl, which, &entry) == 1;
       which = ACL_NEXT_ENTRY) {
    acl_tag_t tag = ACL_UNDEFINED_TAG;
    acl_get_tag_type(entry, &tag);
    const unsigned perm = PermOf(entry);
    if (tag == ACL_MASK) {
      mask = perm;
    } else if (tag == ACL_OTHER) {
      other = perm;
    } else if (tag == ACL_USER && QualifierOf(entry) == user) {
      user_named = true;
      by_user = perm;
    } else if ((tag == ACL_GROUP_OBJ && is_member(file_group)) ||
               (tag == ACL_GROUP && is_member(QualifierOf(entry)))) {
      group_matched = true;
      by_group |= perm;
    }
  }
  if (user_named) {
    return by_user & mask;
  }
  return group_matched ? by_group & mask : other;
}

}  // namespace

bool GetAccess(const char* path, const struct stat& info, uid_t user,
               const std::vector<gid_t>& groups, unsigned& perm) {
  if (user == 0) {
    const bool may_execute = S_ISDIR(info.st_mode) || (info.st_mode & 0111) != 0;
    perm = may_execute ? kAll : kRead | kWrite;
    return true;
  }
  if (user == info.st_uid) {
    perm = (info.st_mode >> 6) & kAll;
    return true;
  }
  // The kernel does not look at an ACL that masks everything: not even a named user is found in it
  // then, and gets what others get.
  if ((info.st_mode & S_IRWXG) != 0) {
    const Acl acl(acl_get_file(path, ACL_TYPE_ACCESS), &acl_free);
    if (acl != nullptr) {
      perm = EvaluateAcl(acl.get(), user, info.st_gid, groups);
      return true;
    }
    if (errno != ENOTSUP && errno != ENOSYS) {
      return false;
    }
  }
  const bool is_member = std::find(groups.begin(), groups.end(), info.st_gid) != groups.end();
  perm = (is_member ? info.st_mode >> 3 : info.st_mode) & kAll;
  return true;
}

}  // namespace kavo::local
