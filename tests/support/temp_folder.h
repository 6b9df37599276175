// A folder for one test.
#ifndef SUPPORT_TEMP_FOLDER_H_
#define SUPPORT_TEMP_FOLDER_H_

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>
#include <string>

// Made below `parent` with mode 0755, and removed with all that it holds.
class TempFolder {
 public:
  explicit TempFolder(const std::string& parent = "/tmp") : path_(parent + "/test.XXXXXX") {
    EXPECT_TRUE(mkdtemp(path_.data()) != nullptr && chmod(path_.c_str(), 0755) == 0) << path_;
  }
  ~TempFolder() { std::filesystem::remove_all(path_); }
  TempFolder(const TempFolder&) = delete;
  TempFolder& operator=(const TempFolder&) = delete;

  const std::string& Path() const { return path_; }
  std::string operator/(const std::string& name) const { return path_ + "/" + name; }

  // The names in the folder.
  std::set<std::string> Names() const {
    std::set<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(path_)) {
      names.insert(entry.path().filename());
    }
    return names;
  }

 private:
  std::string path_;
};

inline void WriteText(const std::string& path, const std::string& text) {
  ASSERT_TRUE(std::ofstream(path, std::ios::binary) << text << std::flush) << path;
}

// "<missing>" for what cannot be opened.
inline std::string ReadText(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  std::ostringstream text;
  text << file.rdbuf();  // Ends where reading fails, as of a process that ends meanwhile.
  return file.is_open() ? text.str() : "<missing>";
}

#endif  // SUPPORT_TEMP_FOLDER_H_
