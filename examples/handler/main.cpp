// A web server's handler of one's own, as CGI runs it: one JSON request on standard input, one
// reply on standard output, for the user whom the server has authenticated (REMOTE_USER).
//
//   {"method":"search","words":"harbour","from":0,"size":10}
//   {"method":"folders"}
//   {"method":"status"}
//
// The reply is {"success":true,"data":...} or {"success":false,"error":{"code":N,"reason":"..."}}.
#include <json/value.h>

#include <cstdlib>
#include <iostream>
#include <iterator>
#include <set>
#include <string>

#include "common/error.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "fileindex/comm.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/folder.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/index_mgr/folder_ops.h"
#include "fileindex/index_mgr/status_report.h"
#include "kavo/share.h"

namespace {

constexpr size_t kMaxRequestBytes = size_t{64} * 1024;
constexpr int kMaxPage = 100;

// The indexed shares that the user may read. A negative answer is an unknown user.
std::set<std::string> ReadableShares(const std::string& user) {
  std::set<std::string> shares;
  const vexlo::fileindex::FolderMgr folders;
  for (const std::string& share : vexlo::sdk::SDKShare::Enum()) {
    if (!folders.IsShareIndexed(share)) {
      continue;
    }
    const int privilege = vexlo::sdk::SDKShare(share).GetPrivilege(user);
    if (privilege > 0 && (privilege & KAVO_SHARE_PRIVILEGE_READ) != 0) {
      shares.insert(share);
    }
  }
  return shares;
}

Json::Value Search(const Json::Value& request, const std::string& user) {
  std::string words;
  int from = 0;
  int size = 10;
  vexlo::GetJsonValue(words, request, "words", /*required=*/true);
  vexlo::GetJsonValue(from, request, "from", /*required=*/false);
  vexlo::GetJsonValue(size, request, "size", /*required=*/false);
  if (from < 0 || size < 1 || size > kMaxPage) {
    throw vexlo::Error(vexlo::ERR_BAD_PARAMETER,
                       "a page has 1 to 100 hits and begins at 0 or later");
  }
  Json::Value reply;
  reply["data"] = Json::Value(Json::arrayValue);
  reply["total"] = 0;
  Json::Value question;
  question["command"] = "search";
  Json::Value& data = question["data"];
  for (const std::string& share : ReadableShares(user)) {
    data["ids"].append(vexlo::fileindex::elastic::GetFileIndexID(share));
  }
  if (!data["ids"].empty()) {  // Without a list every index would be searched.
    data["words"] = words;
    data["from"] = from;
    data["size"] = size;
    vexlo::SendRequestImpl(reply, question);
  }
  Json::Value result;
  result["total"] = reply["total"];
  result["hits"] = reply["data"];
  return result;
}

Json::Value Folders(const std::string& user) {
  Json::Value list;
  vexlo::fileindex::FolderList(list, /*offset=*/0, /*limit=*/0, /*sort_by=*/"name",
                               /*sort_direction=*/"ASC", /*group=*/"", /*keyword=*/"",
                               /*additional=*/Json::Value(Json::arrayValue));
  const std::set<std::string> readable = ReadableShares(user);
  Json::Value result(Json::arrayValue);
  for (const Json::Value& record : list["folder"]) {
    if (readable.contains(vexlo::fileindex::Folder(record).GetShare())) {
      result.append(record);
    }
  }
  return result;
}

Json::Value Answer(const std::string& text) {
  Json::Value request;
  if (text.size() > kMaxRequestBytes || !vexlo::JsonFromString(request, text)) {
    throw vexlo::Error(vexlo::ERR_BAD_PARAMETER, "the request is too long or no JSON");
  }
  const char* const user = std::getenv("REMOTE_USER");
  if (user == nullptr || *user == '\0') {
    throw vexlo::Error(vexlo::ERR_CREDENTIALS, "nobody is logged in");
  }
  std::string method;
  vexlo::GetJsonValue(method, request, "method", /*required=*/true);
  if (method == "search") {
    return Search(request, user);
  }
  if (method == "folders") {
    return Folders(user);
  }
  if (method == "status") {
    return vexlo::fileindex::GetIndexProcessingStatus();
  }
  throw vexlo::Error(vexlo::ERR_BAD_PARAMETER, "no such method: " + method);
}

}  // namespace

int main() {
  std::string text;
  text.reserve(kMaxRequestBytes + 1);
  for (std::istreambuf_iterator<char> byte(std::cin), end;
       byte != end && text.size() <= kMaxRequestBytes; ++byte) {
    text += *byte;
  }
  Json::Value reply;
  try {
    reply["data"] = Answer(text);
    reply["success"] = true;
  } catch (const vexlo::Error& error) {
    reply["success"] = false;
    reply["error"]["code"] = error.GetErrorCode();
    reply["error"]["reason"] = error.what();
  }
  std::cout << "Content-Type: application/json\r\n\r\n" << vexlo::JsonToString(reply) << "\n";
  return std::cout.flush() ? 0 : 1;
}
