#include "fileindex/util/share_path.h"

#include "common/check.h"
#include "common/error.h"
#include "common/sdk/share.h"
#include "common/string.h"
#include "kavo/share.h"

namespace vexlo::fileindex {
namespace {

constexpr size_t kNameBytes = 492;  // As much as the platform ever writes.
constexpr size_t kPathBytes = 4096;

}  // namespace

void GetShareNameByPath(std::string& share_name, const std::string& share_path) {
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__,
                          "1 > share_path.size() || '/' != share_path.at(0)"}),
                 !share_path.starts_with('/'), ERR_BAD_PARAMETER, share_path);
  share_name = share_path.substr(1, share_path.find('/', 1) - 1);
}

std::string GetShareNameByPath(const std::string& share_path) {
  std::string share_name;
  GetShareNameByPath(share_name, share_path);
  return share_name;
}

void GetFullPath(std::string& full_path, const std::string& share_path) {
  full_path = Dirname(sdk::SDKShare(GetShareNameByPath(share_path)).GetPath()) + share_path;
}

std::string GetFullPath(const std::string& share_path) {
  std::string full_path;
  GetFullPath(full_path, share_path);
  return full_path;
}

void GetShareNamePathByFullPath(std::string& share_name, std::string& share_dir,
                                const std::string& full_path) {
  char name[kNameBytes] = {};
  char path[kPathBytes] = {};
  VEXLO_CHECK_AT(
      (LogSite{VEXLO_SOURCE, __LINE__, __func__,
               "0 > KAVOShareNamePathGet(full_path.c_str(), szShareName, "
               "sizeof(szShareName), szSharePath, sizeof(szSharePath))"}),
      KAVOShareNamePathGet(full_path.c_str(), name, sizeof(name), path, sizeof(path)) < 0,
      ERR_SYSTEM, "KAVOShareNamePathGet failed, full_path=" + full_path);
  share_name = name;
  share_dir = path;
}

std::string ReplacePathShare(const std::string& path, const std::string& new_share,
                             const std::string& old_share) {
  // The slash behind the path lets its last component match.
  const size_t pos = (path + "/").find("/" + old_share + "/");
  VEXLO_CHECK_AT((LogSite{VEXLO_SOURCE, __LINE__, __func__, "string::npos == pos"}),
                 pos == std::string::npos, ERR_BAD_PARAMETER, "Cannot find share: " + old_share);
  return path.substr(0, pos + 1) + new_share + path.substr(pos + 1 + old_share.size());
}

}  // namespace vexlo::fileindex
