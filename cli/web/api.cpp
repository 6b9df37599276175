#include "cli/web/api.h"

#include <algorithm>
#include <charconv>
#include <functional>
#include <set>

#include "cli/command.h"
#include "cli/engine.h"
#include "cli/folder_change.h"
#include "cli/pause.h"
#include "cli/search_request.h"
#include "cli/stack_report.h"
#include "cli/text.h"
#include "cli/web/guard.h"
#include "cli/web/pages.h"
#include "common/error.h"
#include "common/json.h"
#include "fileindex/folder.h"
#include "fileindex/index_mgr/folder_ops.h"

namespace vexlo::cli {
namespace {

using Query = std::map<std::string, std::string>;

constexpr unsigned long kMostFrom = 100'000;
constexpr unsigned long kMostHits = 100;
constexpr unsigned long kFoldersAPage = 100;
constexpr unsigned long kMostFolders = 1000;

// An engine that does not answer keeps searches waiting, and nothing else.
enum LaneNumber : size_t { kSearchLane, kReadLane, kChangeLane };

// Each name once, without those that have no value: what an empty field of a form sends.
Query ReadQuery(const HttpRequest& request, const std::set<std::string>& known) {
  Query query;
  for (const auto& [name, values] : request.arguments) {
    if (!known.contains(name)) {
      throw UsageError("there is no argument '" + name + "'");
    }
    if (values.size() != 1) {
      throw UsageError("the argument '" + name + "' was given more than once");
    }
    if (values[0].find('\0') != std::string::npos) {
      throw UsageError("the argument '" + name + "' holds a NUL");
    }
    if (!values[0].empty()) {
      query[name] = values[0];
    }
  }
  return query;
}

unsigned long ReadNumber(const Query& query, const std::string& name, unsigned long least,
                         unsigned long most, unsigned long otherwise) {
  const auto found = query.find(name);
  if (found == query.end()) {
    return otherwise;
  }
  const std::string& text = found->second;
  unsigned long number = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (error != std::errc() || end != text.data() + text.size() || number < least || number > most) {
    throw UsageError("the argument '" + name + "', '" + text + "', is no number from " +
                     std::to_string(least) + " to " + std::to_string(most));
  }
  return number;
}

Json::Value Search(const HttpRequest& request) {
  const Query query = ReadQuery(request, {"words", "share", "below", "name", "type", "larger",
                                          "smaller", "newer", "older", "sort", "limit", "from"});
  Arguments arguments;
  for (const auto& [name, value] : query) {
    if (name == "words") {
      arguments.positional.push_back(value);
    } else if (name != "from") {
      arguments.options["--" + name] = value;
    }
  }
  if (query.contains("below") && !query.at("below").starts_with('/')) {
    throw UsageError("'" + query.at("below") + "' is no folder: its full path is wanted");
  }
  ReadNumber(query, "limit", 1, kMostHits, kMostHits);
  const unsigned long from = ReadNumber(query, "from", 0, kMostFrom, 0);
  Json::Value search = MakeSearchRequest(arguments);
  search["data"]["snippet"] = true;
  search["data"]["from"] = Json::UInt64{from};
  Json::Value reply;
  AskSearch(search, &reply);
  return reply;
}

Json::Value Folders(const HttpRequest& request) {
  const Query query = ReadQuery(request, {"from", "limit"});
  Json::Value additional(Json::arrayValue);
  additional.append("status");
  const unsigned long from = ReadNumber(query, "from", 0, kMostFrom, 0);
  const unsigned long limit = ReadNumber(query, "limit", 1, kMostFolders, kFoldersAPage);
  Json::Value result;
  WithFolders([&] {
    fileindex::FolderList(result, from, limit, "path", "ASC", /*group=*/"", /*keyword=*/"",
                          additional);
  });
  for (Json::Value& folder : result["folder"]) {
    try {
      folder["full_path"] = fileindex::Folder(folder).GetFullPath();
    } catch (const Error&) {
      // Its share is gone, which its status says; its place is not known then.
    }
  }
  return result;
}

Json::Value Status(const HttpRequest& request) {
  ReadQuery(request, {});
  return AskWholeStack();
}

Json::Value Pause(const HttpRequest& request) {
  const Query query = ReadQuery(request, {"hours"});
  const int hours = query.contains("hours") ? ReadPauseHours(query.at("hours")) : 0;
  ChangePause([hours](fileindex::StatusMgr& status) { status.Pause(hours); });
  return AskWholeStack();
}

Json::Value Resume(const HttpRequest& request) {
  ReadQuery(request, {});
  ChangePause([](fileindex::StatusMgr& status) { status.Resume(); });
  return AskWholeStack();
}

struct Route {
  std::string_view method;
  std::string_view path;
  LaneNumber lane;
  Json::Value (*run)(const HttpRequest& request);
};

constexpr Route kRoutes[] = {
    {"GET", "/api/search", kSearchLane, Search},  {"GET", "/api/folders", kReadLane, Folders},
    {"GET", "/api/status", kReadLane, Status},    {"POST", "/api/pause", kChangeLane, Pause},
    {"POST", "/api/resume", kChangeLane, Resume},
};

HttpResponse Safe(HttpResponse response) {
  AddSafeHeaders(response);
  return response;
}

HttpResponse Run(const Route& route, const HttpRequest& request) {
  try {
    return Safe({200, "application/json", JsonToString(route.run(request)), {}});
  } catch (const UsageError& error) {
    return Safe(ErrorResponse(400, error.what()));
  } catch (const Error& error) {
    return Safe(ErrorResponse(503, TextOf(error)));
  } catch (const std::exception& error) {
    return Safe(ErrorResponse(503, error.what()));
  }
}

HttpResponse WrongMethod(std::string_view allowed) {
  HttpResponse response =
      ErrorResponse(405, "only " + std::string(allowed) + " can be done with this");
  response.headers.emplace_back("Allow", allowed);
  return response;
}

bool IsMethod(const std::string& method, std::string_view wanted) {
  return method == wanted || (wanted == "GET" && method == "HEAD");
}

HttpResponse AnswerForPage(const HttpRequest& request) {
  const std::span<const Page> pages = EmbeddedPages();
  const auto page = std::find_if(pages.begin(), pages.end(), [&](const Page& candidate) {
    return candidate.path == (request.path == "/" ? "/index.html" : request.path);
  });
  if (page == pages.end()) {
    return ErrorResponse(404, "there is nothing at this address");
  }
  if (!IsMethod(request.method, "GET")) {
    return WrongMethod("GET");
  }
  return {200, std::string(page->type), std::string(page->text), {}};
}

}  // namespace

std::vector<HttpServer::Lane> WebLanes() {
  std::vector<HttpServer::Lane> lanes(3);
  lanes[kSearchLane] = {/*threads=*/2, /*queue=*/8};
  lanes[kReadLane] = {/*threads=*/2, /*queue=*/8};
  // One, as changes of the status file are not for several at a time.
  lanes[kChangeLane] = {/*threads=*/1, /*queue=*/4};
  return lanes;
}

HttpServer::Answer AnswerRequest(const HttpRequest& request, const std::string& token) {
  const bool is_data = request.path.starts_with("/api/");
  if (std::optional<HttpResponse> refusal = Refuse(request, is_data, token)) {
    return Safe(*std::move(refusal));
  }
  if (request.has_body) {
    return Safe(ErrorResponse(413, "a request with a body is not taken"));
  }
  if (!is_data) {
    return Safe(AnswerForPage(request));
  }
  const auto route = std::find_if(std::begin(kRoutes), std::end(kRoutes),
                                  [&](const Route& known) { return known.path == request.path; });
  if (route == std::end(kRoutes)) {
    return Safe(ErrorResponse(404, "there is nothing at this address"));
  }
  if (!IsMethod(request.method, route->method)) {
    return Safe(WrongMethod(route->method));
  }
  return std::pair<size_t, HttpServer::Work>{route->lane,
                                             [route, request] { return Run(*route, request); }};
}

}  // namespace vexlo::cli
