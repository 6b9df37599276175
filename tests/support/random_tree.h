// Changes of a folder as people and programs make them, at random.
#ifndef SUPPORT_RANDOM_TREE_H_
#define SUPPORT_RANDOM_TREE_H_

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "support/index_listing.h"

// The same seed makes the same changes in folders that are empty at first.
class RandomTree {
 public:
  // What is in `in` is indexed, what is in `out` is not. A hard link gives the other names of a
  // file a new date, of which nobody is told, so there are none where dates are compared.
  RandomTree(std::string in, std::string out, unsigned seed, bool with_links = true)
      : in_(std::move(in)),
        out_(std::move(out)),
        seed_(seed),
        with_links_(with_links),
        random_(seed) {}

  // Makes one change. One that is not possible is none.
  void Change() {
    const std::vector<std::string> inside = List(in_);
    if (inside.size() > kMostEntries) {
      RemoveTree(Pick(inside));
      return;
    }
    const std::string old = Pick(inside);
    const std::string fresh = NewPath(in_);
    switch (Below(18)) {
      case 0:
      case 1:
      case 2:
        return Write(fresh, /*append=*/false);
      case 3:
        return Write(old, /*append=*/false);
      case 4:
        return Write(old, /*append=*/true);
      case 5:
      case 6:
        return Rename(old, fresh);
      case 7:
        return Rename(old, Pick(inside));  // Over something that is there.
      case 8:
        return Rename(old, NewPath(out_));
      case 9:
        return Rename(Pick(List(out_)), fresh);
      case 10:
        return RemoveTree(old);
      case 11:
        if (with_links_) {
          Log("link", old, fresh);
          (void)link(old.c_str(), fresh.c_str());
        }
        return;
      case 12:
        Log("symlink", old, fresh);
        (void)symlink(old.c_str(), fresh.c_str());
        return;
      case 13:
      case 14:
        return MakeFolders(fresh);
      case 15:
        return Save(old);
      case 16:
        return Copy(old, fresh);
      default:
        return ChangeAttributes(old);
    }
  }

  // All that were ever written.
  const std::set<std::string>& Tokens() const { return tokens_; }
  unsigned Below(unsigned limit) { return static_cast<unsigned>(random_() % limit); }
  // What was done, one change a line.
  const std::string& Text() const { return text_; }

 private:
  static constexpr size_t kMostEntries = 120;
  static constexpr size_t kLongestFolder = 1200;  // So that what is moved below it still fits.

  // All paths below the folder, in order.
  static std::vector<std::string> List(const std::string& folder) {
    std::set<std::string> paths;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(folder)) {
      paths.insert(entry.path());
    }
    return {paths.begin(), paths.end()};
  }

  // "" of none.
  std::string Pick(const std::vector<std::string>& paths) {
    return paths.empty() ? "" : paths[Below(static_cast<unsigned>(paths.size()))];
  }

  std::string NewPath(const std::string& root) {
    static const std::string kLong = std::string(250, 'l') + ".txt";
    static const std::vector<std::string> kNames = {
        "a",          "b",         "c.txt",     "d e.txt",      "new\nline.txt",   "\xFF\xFE.txt",
        "-rf",        "-x.html",   kLong,       "quote\".html", "back\\slash.txt", "\xC3\xA4.html",
        "100%41.txt", "load.part", "photo.jpg", "a.b",          ".hidden.txt",     "Thumbs.db",
        ".git",       "@eaDir"};
    std::vector<std::string> folders = {root};
    for (const std::string& path : List(root)) {
      struct stat info {};
      if (lstat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode) &&
          path.size() < kLongestFolder) {
        folders.push_back(path);
      }
    }
    const std::string folder = Pick(folders);
    return folder + "/" + Pick(kNames);
  }

  std::string NewToken() {
    char token[32];
    snprintf(token, sizeof(token), "q%07u%08zu", seed_, tokens_.size());
    return *tokens_.insert(token).first;
  }

  // A file whose other names nobody would be told of.
  static bool IsAlone(const std::string& path) {
    struct stat info {};
    return lstat(path.c_str(), &info) != 0 || (S_ISREG(info.st_mode) && info.st_nlink == 1);
  }

  void Write(const std::string& path, bool append) {
    if (!path.empty() && IsAlone(path)) {
      Log(append ? "append" : "write", path);
      std::ofstream(path, append ? std::ios::app : std::ios::trunc) << NewToken() << "\n";
    }
  }

  void Rename(const std::string& from, const std::string& to) {
    Log("rename", from, to);
    (void)rename(from.c_str(), to.c_str());
  }

  void RemoveTree(const std::string& path) {
    if (!path.empty()) {
      Log("remove", path);
      std::filesystem::remove_all(path);
    }
  }

  // Folders in folders, with files that are there before anybody can look.
  void MakeFolders(const std::string& path) {
    Log("folders", path);
    if (mkdir(path.c_str(), 0755) == 0 && mkdir((path + "/a").c_str(), 0755) == 0) {
      Write(path + "/c.txt", /*append=*/false);
      Write(path + "/a/d e.txt", /*append=*/false);
    }
  }

  // As an editor does.
  void Save(const std::string& path) {
    struct stat info {};
    if (lstat(path.c_str(), &info) == 0 && S_ISREG(info.st_mode)) {
      Write(path + "~", /*append=*/false);
      Rename(path + "~", path);
    }
  }

  // As "cp -p" does.
  void Copy(const std::string& from, const std::string& to) {
    struct stat info {};
    if (lstat(from.c_str(), &info) != 0 || !S_ISREG(info.st_mode) || from == to || !IsAlone(to)) {
      return;
    }
    Log("copy", from, to);
    std::ofstream(to, std::ios::trunc) << ReadText(from);
    const timespec times[] = {info.st_atim, info.st_mtim};
    chmod(to.c_str(), info.st_mode & 07777U);
    utimensat(AT_FDCWD, to.c_str(), times, 0);
  }

  void ChangeAttributes(const std::string& path) {
    struct stat info {};
    if (lstat(path.c_str(), &info) != 0 || S_ISLNK(info.st_mode) ||
        (S_ISREG(info.st_mode) && info.st_nlink > 1)) {
      return;
    }
    if (Below(2) == 0) {
      Log("chmod", path);
      chmod(path.c_str(), (info.st_mode & 07777U) ^ 07U);
    } else {
      Log("touch", path);
      const timespec time = {static_cast<time_t>(1'000'000'000 + Below(500'000'000)), 0};
      const timespec times[] = {time, time};
      utimensat(AT_FDCWD, path.c_str(), times, 0);
    }
  }

  void Log(const std::string& deed, const std::string& path, const std::string& other = "") {
    const size_t skipped = std::filesystem::path(in_).parent_path().parent_path().string().size();
    text_ += deed;
    text_.append(" ").append(testing::PrintToString(path.substr(std::min(skipped, path.size()))));
    text_.append(" ").append(testing::PrintToString(other.substr(std::min(skipped, other.size()))));
    text_.append("\n");
  }

  const std::string in_;
  const std::string out_;
  const unsigned seed_;
  const bool with_links_;
  std::mt19937 random_;
  std::set<std::string> tokens_;
  std::string text_;
};

#endif  // SUPPORT_RANDOM_TREE_H_
