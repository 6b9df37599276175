// The documents of an index, one after the other.
#ifndef CLI_INDEX_LISTING_H_
#define CLI_INDEX_LISTING_H_

#include <json/value.h>

#include <optional>
#include <string>
#include <vector>

namespace vexlo::cli {

// Reads page by page, so memory does not depend on the size of the index. For one thread.
class IndexListing {
 public:
  // The documents of the index `id` at and below the path `root`, "" for all of them; each with its
  // path and these fields.
  IndexListing(std::string id, std::string root, const std::vector<std::string>& fields);

  // The next one in the order of their paths as bytes; none at the end. What was written and
  // deleted meanwhile may be in it or not. Throws Error 913, 916 and what the engine answers.
  std::optional<Json::Value> Next();

  // The document of exactly this path, as it is now. Throws the same.
  std::optional<Json::Value> Find(const std::string& path) const;

 private:
  Json::Value Query(Json::Value query) const;

  const std::string id_;
  const std::string root_;
  Json::Value fields_ = Json::Value(Json::arrayValue);
  std::string after_;
  Json::Value page_ = Json::Value(Json::arrayValue);
  Json::ArrayIndex next_ = 0;
  bool is_root_done_;
  bool is_last_page_ = false;
};

}  // namespace vexlo::cli

#endif  // CLI_INDEX_LISTING_H_
