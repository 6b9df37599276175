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

// As RFC 3629 has it: no longer forms than need be, no halves of pairs, nothing over U+10FFFF.
bool IsUtf8(std::string_view text) {
  for (size_t i = 0; i < text.size();) {
    const auto lead = static_cast<unsigned char>(text[i]);
    const size_t length = lead < 0x80 ? 1 : lead < 0xC2 ? 0 : lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : 4;
    if (length == 0 || lead > 0xF4 || length > text.size() - i) {
      return false;
    }
    uint32_t character = length == 1 ? lead : lead & (0x7FU >> length);
    for (size_t j = 1; j < length; ++j) {
      const auto byte = static_cast<unsigned char>(text[i + j]);
      if ((byte & 0xC0) != 0x80) {
        return false;
      }
      character = character << 6 | (byte & 0x3FU);
    }
    const bool is_short_form =
        (length == 3 && character < 0x800) || (length == 4 && character < 0x10000);
    if (is_short_form || (character >= 0xD800 && character < 0xE000) || character > 0x10FFFF) {
      return false;
    }
    i += length;
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
