// The shares as they are at present, kept ready for questions. Not installed.
#ifndef PLATFORM_LOCAL_SHARE_TABLE_H_
#define PLATFORM_LOCAL_SHARE_TABLE_H_

#include <cstddef>
#include <memory>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "kavo/local/shares.h"

namespace kavo::local {

// One state of the shares file. Does not change, and so is for any number of threads.
class ShareTable {
 public:
  explicit ShareTable(std::vector<Share> shares);
  ~ShareTable() = default;
  ShareTable(const ShareTable&) = delete;
  ShareTable& operator=(const ShareTable&) = delete;

  // In the file's order.
  const std::vector<Share>& Shares() const { return shares_; }
  // Null when there is none.
  const Share* FindName(std::string_view name) const;
  // The innermost share whose directory the path is or lies below; null when there is none. Takes
  // as long as the longest share's path has components, however many shares there are.
  const Share* FindHolder(std::string_view full_path) const;

 private:
  using Index = std::unordered_map<std::string_view, const Share*>;

  std::vector<Share> shares_;
  Index by_name_;
  Index by_path_;
  size_t longest_path_ = 0;
};

// The table for SharesFile(), read again when the file has changed. Null when the file is bad or
// cannot be read, with errno and the last error set; each state of such a file is logged once. Safe
// to call from several threads.
std::shared_ptr<const ShareTable> PresentShares() noexcept;

}  // namespace kavo::local

#endif  // PLATFORM_LOCAL_SHARE_TABLE_H_
