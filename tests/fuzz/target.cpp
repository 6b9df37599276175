#include "fuzz/target.h"

#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>

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

// As RFC 3629 has it: the leading byte alone says how many follow it, and where the second of them
// begins and ends, so that there are no longer forms than need be, no halves of pairs, nothing over
// U+10FFFF.
bool IsUtf8(std::string_view text) {
  struct Row {
    unsigned first, last;  // Leading bytes.
    unsigned from, to;     // Of the second byte.
    size_t length;
  };
  constexpr Row kRows[] = {
      {0x00, 0x7F, 0, 0, 1},       {0xC2, 0xDF, 0x80, 0xBF, 2}, {0xE0, 0xE0, 0xA0, 0xBF, 3},
      {0xE1, 0xEC, 0x80, 0xBF, 3}, {0xED, 0xED, 0x80, 0x9F, 3}, {0xEE, 0xEF, 0x80, 0xBF, 3},
      {0xF0, 0xF0, 0x90, 0xBF, 4}, {0xF1, 0xF3, 0x80, 0xBF, 4}, {0xF4, 0xF4, 0x80, 0x8F, 4}};
  const auto byte_at = [text](size_t at) { return unsigned{static_cast<unsigned char>(text[at])}; };
  for (size_t i = 0; i < text.size();) {
    const auto* const row = std::find_if(std::begin(kRows), std::end(kRows), [&](const Row& r) {
      return byte_at(i) >= r.first && byte_at(i) <= r.last;
    });
    if (row == std::end(kRows) || row->length > text.size() - i ||
        (row->length > 1 && (byte_at(i + 1) < row->from || byte_at(i + 1) > row->to))) {
      return false;
    }
    for (size_t j = 2; j < row->length; ++j) {
      if ((byte_at(i + j) & 0xC0) != 0x80) {
        return false;
      }
    }
    i += row->length;
  }
  return true;
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
