#include "platform/local/index_path.h"

#include <algorithm>
#include <cstring>

#include "kavo/index_path.h"
#include "kavo/local/shares.h"
#include "platform/local/boundary.h"

namespace kavo::local {
namespace {

constexpr char kQueueFolder[] = "/queue/";
constexpr char kDbFolder[] = "/db/";
constexpr char kIndexPrefix[] = "fileindex_";
constexpr char kHex[] = "0123456789ABCDEF";

bool IsEncoded(char byte) {
  const auto value = static_cast<unsigned char>(byte);
  return byte == '%' || byte == '/' || value < 0x20 || value == 0x7f;
}

// The snapshot of a queue is the queue's name with this, so no queue may end so.
constexpr std::string_view kSnapshotSuffix = ".tmp";

// Where the "." of such an end stands; the path's length where it has another.
size_t EncodedDot(std::string_view path) {
  return path.ends_with(kSnapshotSuffix) ? path.size() - kSnapshotSuffix.size() : path.size();
}

char* Append(char* out, std::string_view text) { return std::copy(text.begin(), text.end(), out); }

int Compose(const char* subfolder, const char* share_path, char* buffer, size_t bytes) {
  if (share_path == nullptr || buffer == nullptr || *share_path != '/') {
    return Fail(KAVO_ERR_BAD_PARAMETER, EINVAL);
  }
  const std::string_view path = share_path;
  const size_t encoded = EncodedBytes(path);
  if (encoded > kMaxEncodedBytes) {
    return Fail(KAVO_ERR_BAD_PARAMETER, ENAMETOOLONG);
  }
  const std::string& root = Root();
  if (bytes <= root.size() + strlen(kIndexFolder) + strlen(subfolder) + encoded) {
    return Fail(KAVO_ERR_BAD_PARAMETER, ERANGE);
  }
  char* out = Append(Append(Append(buffer, root), kIndexFolder), subfolder);
  for (size_t i = 0; i < path.size(); ++i) {
    const char byte = path[i];
    if (IsEncoded(byte) || i == EncodedDot(path)) {
      const auto value = static_cast<unsigned char>(byte);
      *out++ = '%';
      *out++ = kHex[value >> 4];
      *out++ = kHex[value & 15];
    } else {
      *out++ = byte;
    }
  }
  *out = '\0';
  return 0;
}

}  // namespace

size_t EncodedBytes(std::string_view share_path) {
  const auto encoded = std::count_if(share_path.begin(), share_path.end(), IsEncoded) +
                       (EncodedDot(share_path) < share_path.size() ? 1 : 0);
  return share_path.size() + 2 * static_cast<size_t>(encoded);
}

}  // namespace kavo::local

using kavo::local::Fail;
using kavo::local::Guarded;

int FILEIDXQueuePathCompose(const char* share_path, char* buffer, size_t bytes) {
  return Guarded(
      [&] { return kavo::local::Compose(kavo::local::kQueueFolder, share_path, buffer, bytes); });
}

int FILEIDXDBPathCompose(const char* share_path, char* buffer, size_t bytes) {
  return Guarded(
      [&] { return kavo::local::Compose(kavo::local::kDbFolder, share_path, buffer, bytes); });
}

int FILEIDXGetIndexID(const char* share_name, char* buffer, size_t bytes) {
  if (share_name == nullptr || buffer == nullptr || *share_name == '\0') {
    return Fail(KAVO_ERR_BAD_PARAMETER, EINVAL);
  }
  const std::string_view name = share_name;
  if (bytes <= strlen(kavo::local::kIndexPrefix) + name.size()) {
    return Fail(KAVO_ERR_BAD_PARAMETER, ERANGE);
  }
  *kavo::local::Append(kavo::local::Append(buffer, kavo::local::kIndexPrefix), name) = '\0';
  return 0;
}
