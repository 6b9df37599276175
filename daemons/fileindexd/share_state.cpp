#include "daemons/fileindexd/share_state.h"

#include <cerrno>
#include <vector>

#include "common/check.h"
#include "common/error.h"
#include "common/file.h"
#include "common/json.h"
#include "common/string.h"
#include "daemons/common/folders.h"
#include "daemons/common/log.h"
#include "fileindex/paths.h"

namespace vexlo::fileindexd {
namespace {

constexpr fileindex::FixedPath kFolder("/var/lib/kavo/fileindexd");

ShareState FromJson(const Json::Value& value) {
  ShareState state;
  const std::vector<std::string> crawled = JsonArr2Vec<std::string>(value["crawled"]);
  state.crawled.insert(crawled.begin(), crawled.end());
  if (const Json::Value& settings = value["settings"]; settings.isObject()) {
    for (const std::string& folder : settings.getMemberNames()) {
      GetJsonValue(state.settings[folder], settings, folder, /*required=*/true);
    }
  }
  GetJsonValue(state.rebuilt, value, "rebuilt", /*required=*/false);
  if (value.isMember("missed")) {
    for (const std::string& path : JsonArr2Vec<std::string>(value["missed"])) {
      state.missed.Note(path);
    }
  }
  if (const Json::Value& crawl = value["crawl"]; !crawl.isNull()) {
    CrawlPoint& point = state.crawl.emplace();
    GetJsonValue(point.root, crawl, "root", /*required=*/true);
    GetJsonValue(point.cause, crawl, "cause", /*required=*/true);
    GetJsonValue(point.after, crawl, "after", /*required=*/true);
    GetJsonValue(point.pass, crawl, "pass", /*required=*/true);
    GetJsonValue(point.saw_gone, crawl, "saw_gone", /*required=*/true);
  }
  return state;
}

}  // namespace

std::string ShareStateFile(const std::string& share) {
  return kFolder.Get() + "/" + share + ".json";
}

ShareState LoadShareState(const std::string& file) {
  if (!IsFileExist(file)) {
    return {};
  }
  try {
    Json::Value value;
    VEXLO_CHECK(!JsonFromFile(value, file) || !value.isObject(), ERR_LOAD, file);
    return FromJson(value);
  } catch (const Error& error) {
    daemon::Log(daemon::Level::kWarning, VEXLO_SOURCE, __LINE__,
                "starting without " + file + ", reason=" + error.what());
    return {};
  }
}

void SaveShareState(const std::string& file, const ShareState& state) {
  Json::Value value(Json::objectValue);
  value["crawled"] = Vec2JsonArr<std::string>({state.crawled.begin(), state.crawled.end()});
  for (const auto& [folder, settings] : state.settings) {
    value["settings"][folder] = settings;
  }
  value["rebuilt"] = state.rebuilt;
  if (const std::set<std::string>& missed = state.missed.Paths(); !missed.empty()) {
    value["missed"] = Vec2JsonArr<std::string>({missed.begin(), missed.end()});
  }
  if (state.crawl) {
    Json::Value& crawl = value["crawl"];
    crawl["root"] = state.crawl->root;
    crawl["cause"] = state.crawl->cause;
    crawl["after"] = state.crawl->after;
    crawl["pass"] = state.crawl->pass;
    crawl["saw_gone"] = state.crawl->saw_gone;
  }
  daemon::MakeFolders(Dirname(file));
  errno = 0;
  if (!JsonToFile(value, file)) {
    LogFailure({VEXLO_SOURCE, __LINE__, __func__, "!JsonToFile(value, file)"}, file, errno);
  }
}

}  // namespace vexlo::fileindexd
