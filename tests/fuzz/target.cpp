#include "fuzz/target.h"

#include <iconv.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>

namespace fuzz {
namespace {

class OwnFolder {
 public:
  OwnFolder() {
    const char* const parent = getenv("FUZZ_FOLDER");
    path_ = (parent != nullptr               ? std::string(parent)
             : access("/dev/shm", W_OK) == 0 ? "/dev/shm"
                                             : "/tmp") +
            "/fileindex-fuzz.XXXXXX";
    Require(mkdtemp(path_.data()) != nullptr, "there is no folder to work in");
    Require(setenv("FILEINDEX_ROOT", path_.c_str(), /*overwrite=*/1) == 0, "setenv");
  }
  ~OwnFolder() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  OwnFolder(const OwnFolder&) = delete;
  OwnFolder& operator=(const OwnFolder&) = delete;

  const std::string& Path() const { return path_; }

 private:
  std::string path_;
};

}  // namespace

void Require(bool holds, const char* what) {
  if (!holds) {
    fprintf(stderr, "wrong: %s\n", what);
    abort();
  }
}

void RequireEqual(const std::string& got, const std::string& want, const char* what) {
  if (got != want) {
    fprintf(stderr, "got:  %s\nwant: %s\n", got.c_str(), want.c_str());
    Require(false, what);
  }
}

const std::string& Folder() {
  static const OwnFolder folder;
  return folder.Path();
}

void WriteFile(const std::string& path, std::string_view content) {
  std::ofstream file(path, std::ios::binary);
  file.write(content.data(), static_cast<std::streamsize>(content.size())).flush();
  Require(file.good(), "a file of the target's own cannot be written");
}

// By the C library, as the daemons have another judge.
bool IsUtf8(std::string_view text) {
  static const iconv_t converter = iconv_open("UTF-32LE", "UTF-8");
  iconv(converter, nullptr, nullptr, nullptr, nullptr);  // Forgets the text before.
  std::string bytes(text);
  char* from = bytes.data();
  size_t left = bytes.size();
  size_t done = 0;
  do {
    char buffer[4096];
    char* to = buffer;
    size_t room = sizeof(buffer);
    done = iconv(converter, &from, &left, &to, &room);
  } while (done == static_cast<size_t>(-1) && errno == E2BIG);
  return done != static_cast<size_t>(-1);
}

std::string_view TakeLine(std::string_view& rest) {
  const size_t end = std::min(rest.find('\n'), rest.size());
  const std::string_view line = rest.substr(0, end);
  rest.remove_prefix(std::min(end + 1, rest.size()));
  return line;
}

}  // namespace fuzz

// Stands before the C library's, also for calls from the shared libraries: bad input is logged, and
// a run makes millions of it. The line is made all the same, which shows whether it can be.
extern "C" __attribute__((visibility("default"))) void syslog(int /*priority*/, const char* format,
                                                              ...) {
  char* text = nullptr;
  va_list arguments;
  va_start(arguments, format);
  if (vasprintf(&text, format, arguments) >= 0) {
    free(text);
  }
  va_end(arguments);
}
