// What a folder holds on the disk, and what the index has of its share, told apart naively.
#ifndef SUPPORT_INDEX_LISTING_H_
#define SUPPORT_INDEX_LISTING_H_

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "common/json.h"
#include "fileindex/comm.h"
#include "support/temp_folder.h"

// Words by which files are told apart: "q" and 15 digits.
constexpr size_t kTokenBytes = 16;

// The facts of each path, in words, and the paths in which each token stands.
struct Listing {
  std::map<std::string, std::string> paths;
  std::map<std::string, std::set<std::string>> tokens;
};

// The tokens in a text.
inline std::set<std::string> TokensOf(const std::string& text) {
  std::set<std::string> tokens;
  for (size_t at = 0; (at = text.find('q', at)) != std::string::npos; ++at) {
    const size_t end = std::min(text.find_first_not_of("0123456789", at + 1), text.size());
    if (end - at == kTokenBytes) {
      tokens.insert(text.substr(at, kTokenBytes));
    }
  }
  return tokens;
}

// Whether a file of this name is text for everybody.
inline bool IsTextName(const std::string& path) {
  const std::string extension = std::filesystem::path(path).extension();
  return extension == ".txt" || extension == ".html";
}

// All of the folder that belongs into an index, the folder itself too: no links, nothing that a
// system keeps for itself.
inline Listing ListDisk(const std::string& folder) {
  static const std::set<std::string> kReserved = {"@eaDir", ".git", "Thumbs.db"};
  Listing listing;
  std::vector<std::string> open = {folder};
  while (!open.empty()) {
    const std::string path = open.back();
    open.pop_back();
    struct stat info {};
    if (lstat(path.c_str(), &info) != 0 || S_ISLNK(info.st_mode) ||
        kReserved.contains(std::filesystem::path(path).filename())) {
      continue;
    }
    char mode[8];
    snprintf(mode, sizeof(mode), "%04o", info.st_mode & 07777U);
    if (S_ISDIR(info.st_mode)) {
      listing.paths[path] = std::string("folder ") + mode;
      for (const auto& entry : std::filesystem::directory_iterator(path)) {
        open.push_back(entry.path());
      }
      continue;
    }
    listing.paths[path] = std::string("file ") + mode + " " + std::to_string(info.st_size) +
                          " bytes of " + std::to_string(info.st_mtim.tv_sec);
    if (IsTextName(path)) {
      for (const std::string& token : TokensOf(ReadText(path))) {
        listing.tokens[token].insert(path);
      }
    }
  }
  return listing;
}

inline Json::Value AskIndex(const char* command, const Json::Value& data) {
  Json::Value request;
  request["command"] = command;
  request["data"] = data;
  Json::Value reply;
  vexlo::SendRequestImpl(reply, request);
  return reply["data"];
}

// All that the share's index has, whatever folder it is from. `tokens` are searched for.
inline Listing ListIndex(const std::string& share, const std::set<std::string>& tokens) {
  constexpr Json::ArrayIndex kPage = 1000;
  Listing listing;
  Json::Value data;
  data["id"] = "fileindex_" + share;
  data["query"]["qsl"]["prefix"]["KAVOMDPath"] = "/";
  for (const char* const name : {"KAVOMDPath", "KAVOMDIsDir", "KAVOMDFSSize", "KAVOMDPrivilege",
                                 "KAVOMDFSContentChangeDate"}) {
    data["query"]["load_field"].append(name);
  }
  data["query"]["size"] = kPage;
  Json::Value page;
  do {
    page = AskIndex("document_get_by_query", data);
    for (const Json::Value& hit : page) {
      const std::string path = hit["KAVOMDPath"].asString();
      data["query"]["after"] = path;
      const std::string mode = hit["KAVOMDPrivilege"].asString();
      EXPECT_EQ(listing.paths.count(path), 0U) << path << " is listed twice";
      listing.paths[path] = hit["KAVOMDIsDir"].asBool()
                                ? "folder " + mode
                                : "file " + mode + " " + hit["KAVOMDFSSize"].asString() +
                                      " bytes of " + hit["KAVOMDFSContentChangeDate"].asString();
    }
  } while (page.size() == kPage);
  for (const std::string& token : tokens) {
    Json::Value query;
    query["words"] = token;
    query["size"] = 1000;
    for (const Json::Value& hit : AskIndex("search", query)) {
      const std::string path = hit["path"].asString();
      if (IsTextName(path)) {
        listing.tokens[token].insert(path);
      }
    }
  }
  return listing;
}

// "" when both are the same, otherwise what is not, the first of it.
inline std::string Differences(const Listing& disk, const Listing& index) {
  constexpr int kMost = 12;
  std::string text;
  int count = 0;
  const auto add = [&](const std::string& what, const auto& on_disk, const auto& indexed) {
    if (on_disk != indexed && ++count <= kMost) {
      text += "  " + testing::PrintToString(what) + ": disk " + testing::PrintToString(on_disk) +
              ", index " + testing::PrintToString(indexed) + "\n";
    }
  };
  const auto compare = [&](const auto& left, const auto& right) {
    for (const auto& [what, facts] : left) {
      const auto found = right.find(what);
      add(what, facts, found == right.end() ? decltype(facts){} : found->second);
    }
    for (const auto& [what, facts] : right) {
      if (!left.contains(what)) {
        add(what, decltype(facts){}, facts);
      }
    }
  };
  compare(disk.paths, index.paths);
  compare(disk.tokens, index.tokens);
  return count == 0 ? "" : std::to_string(count) + " differences:\n" + text;
}

#endif  // SUPPORT_INDEX_LISTING_H_
