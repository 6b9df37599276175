#include "cli/index_listing.h"

#include <utility>

#include "common/check.h"
#include "common/error.h"
#include "fileindex/comm.h"
#include "fileindex/elastic_control/schema.h"

namespace vexlo::cli {
namespace {

constexpr unsigned kPage = 5000;

using fileindex::elastic::field::KAVOMDPath;

}  // namespace

IndexListing::IndexListing(std::string id, std::string root, const std::vector<std::string>& fields)
    : id_(std::move(id)), root_(std::move(root)), is_root_done_(root_.empty()) {
  fields_.append(KAVOMDPath);
  for (const std::string& field : fields) {
    fields_.append(field);
  }
}

std::optional<Json::Value> IndexListing::Next() {
  if (!is_root_done_) {
    is_root_done_ = true;
    if (auto document = Find(root_)) {
      return document;
    }
  }
  while (next_ == page_.size() && !is_last_page_) {
    Json::Value query;
    query["qsl"]["prefix"][KAVOMDPath] = root_ + "/";
    query["size"] = kPage;
    if (!after_.empty()) {
      query["after"] = after_;
    }
    page_ = Query(std::move(query));
    next_ = 0;
    is_last_page_ = page_.size() < kPage;
    if (!page_.empty()) {
      after_ = page_[page_.size() - 1][KAVOMDPath].asString();
    }
  }
  if (next_ == page_.size()) {
    return std::nullopt;
  }
  return std::exchange(page_[next_++], Json::Value());
}

std::optional<Json::Value> IndexListing::Find(const std::string& path) const {
  Json::Value query;
  query["qsl"]["term"][KAVOMDPath] = path;
  Json::Value found = Query(std::move(query));
  return found.empty() ? std::nullopt : std::optional(std::move(found[0]));
}

Json::Value IndexListing::Query(Json::Value query) const {
  query["load_field"] = fields_;
  Json::Value request;
  request["command"] = "document_get_by_query";
  request["data"]["id"] = id_;
  request["data"]["query"] = std::move(query);
  Json::Value response;
  SendRequestImpl(response, request);
  Json::Value documents = std::move(response["data"]);
  VEXLO_CHECK(!documents.isArray(), ERR_BAD_RESPONSE, "the engine's reply has no list");
  for (const Json::Value& document : documents) {
    VEXLO_CHECK(!document.isObject() || !document[KAVOMDPath].isString(), ERR_BAD_RESPONSE,
                "the engine's reply has a document without a path");
  }
  return documents;
}

}  // namespace vexlo::cli
