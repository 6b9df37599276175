// The plain extraction: what the file system tells of every file, and the text of files that are
// text as they stand. It reads no document, photo or media format and starts no helper.
#include "kavo/content_extract.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <iterator>
#include <string_view>
#include <system_error>
#include <utility>

#include "platform/local/fd.h"

using kavo::local::ScopedFd;

namespace {

constexpr size_t kMaxTextBytes = size_t{1} << 20;
constexpr size_t kBinaryProbeBytes = size_t{64} << 10;
constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";

[[noreturn]] void Fail(const std::string& path) {
  throw std::system_error(errno, std::generic_category(), path);
}

// The text after the last dot of the name, ASCII letters in lower case.
std::string ExtensionOf(const std::string& name) {
  const size_t dot = name.rfind('.');
  std::string extension = dot == std::string::npos ? "" : name.substr(dot + 1);
  for (char& c : extension) {
    c = c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
  }
  return extension;
}

// The leading bytes of UTF-8 characters, and what the second byte may be: over-long forms,
// surrogates and what is over U+10FFFF are none. Every byte behind it is 0x80 to 0xBF.
struct Lead {
  unsigned char first, last;
  unsigned char low, high;
  size_t bytes;
};
constexpr Lead kLeads[] = {
    {0x00, 0x7F, 0x00, 0x00, 1}, {0xC2, 0xDF, 0x80, 0xBF, 2}, {0xE0, 0xE0, 0xA0, 0xBF, 3},
    {0xE1, 0xEC, 0x80, 0xBF, 3}, {0xED, 0xED, 0x80, 0x9F, 3}, {0xEE, 0xEF, 0x80, 0xBF, 3},
    {0xF0, 0xF0, 0x90, 0xBF, 4}, {0xF1, 0xF3, 0x80, 0xBF, 4}, {0xF4, 0xF4, 0x80, 0x8F, 4},
};

// How many bytes the UTF-8 character at the start of `text` has: 0 when none begins there, or more
// than are there when it is cut off.
size_t CharacterBytes(std::string_view text) {
  const auto is_within = [&text](size_t i, unsigned char low, unsigned char high) {
    const auto byte = static_cast<unsigned char>(text[i]);
    return byte >= low && byte <= high;
  };
  const Lead* const lead = std::find_if(std::begin(kLeads), std::end(kLeads), [&](const Lead& row) {
    return is_within(0, row.first, row.last);
  });
  if (lead == std::end(kLeads)) {
    return 0;
  }
  for (size_t i = 1; i < std::min(lead->bytes, text.size()); ++i) {
    if (!is_within(i, i == 1 ? lead->low : 0x80, i == 1 ? lead->high : 0xBF)) {
      return 0;
    }
  }
  return lead->bytes;
}

// The length of the longest beginning that is UTF-8; `cut_off` tells that only the end of the last
// character is missing.
size_t Utf8Prefix(std::string_view text, bool& cut_off) {
  size_t at = 0;
  cut_off = false;
  while (at < text.size()) {
    const size_t bytes = CharacterBytes(text.substr(at));
    cut_off = bytes > text.size() - at;
    if (bytes == 0 || cut_off) {
      break;
    }
    at += bytes;
  }
  return at;
}

// Of the control characters plain text has white space, backspace and escape sequences; compressed
// data without a NUL has others, too.
bool HasBinaryControls(std::string_view text) {
  return std::any_of(text.begin(), text.end(), [](char c) {
    const auto byte = static_cast<unsigned char>(c);
    return byte < 0x20 && (byte < '\b' || byte > '\r') && byte != 0x1B;
  });
}

std::string Latin1ToUtf8(std::string_view text) {
  std::string utf8;
  utf8.reserve(text.size() + text.size() / 4);
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte < 0x80) {
      utf8 += c;
    } else {
      utf8 += static_cast<char>(0xC0 | (byte >> 6));
      utf8 += static_cast<char>(0x80 | (byte & 0x3F));
    }
  }
  return utf8;
}

// `text` is a file, or the beginning of one that has more. "" for what is no plain text.
std::string PlainText(std::string text, bool has_more) {
  const size_t nul = text.find('\0');
  if (nul < kBinaryProbeBytes) {
    return "";
  }
  if (nul != std::string::npos) {  // Text with something else behind it.
    text.resize(nul);
    has_more = true;
  }
  bool cut_off = false;
  const size_t prefix = Utf8Prefix(text, cut_off);
  if (prefix == text.size() || (cut_off && has_more)) {
    text.resize(prefix);
    return text.starts_with(kByteOrderMark) ? text.substr(kByteOrderMark.size()) : text;
  }
  return HasBinaryControls(text) ? "" : Latin1ToUtf8(text);
}

// Reading for an index is no use of the file, so its access time is left alone where that is
// allowed.
int OpenQuietly(const std::string& path) {
  constexpr int kFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
  const int fd = open(path.c_str(), kFlags | O_NOATIME);
  return fd < 0 && errno == EPERM ? open(path.c_str(), kFlags) : fd;
}

// "" for a file that is no regular one any more.
std::string ReadText(const std::string& path) {
  const ScopedFd file(OpenQuietly(path));
  struct stat info {};
  if (file.Get() < 0 || fstat(file.Get(), &info) != 0) {
    Fail(path);
  }
  if (!S_ISREG(info.st_mode)) {
    return "";
  }
  std::string text(std::min(kMaxTextBytes, static_cast<size_t>(info.st_size)) + 1, '\0');
  size_t size = 0;
  while (size < text.size()) {
    const ssize_t count = read(file.Get(), text.data() + size, text.size() - size);
    if (count == 0) {
      break;
    }
    if (count < 0 && errno != EINTR) {
      Fail(path);
    }
    size += count > 0 ? static_cast<size_t>(count) : 0;
  }
  // The one byte more was read to tell whether there is more.
  const bool has_more = size == text.size();
  text.resize(has_more ? size - 1 : size);
  return PlainText(std::move(text), has_more);
}

std::string Octal(unsigned mode) {
  char text[16];
  snprintf(text, sizeof(text), "%04o", mode);
  return text;
}

Json::Value AttributesOf(const std::string& path, const struct statx& info) {
  const size_t slash = path.rfind('/');
  const std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
  Json::Value fields(Json::objectValue);
  fields["KAVOMDPath"] = path;
  fields["KAVOMDFSName"] = name;
  fields["KAVOMDParent"] = slash == std::string::npos ? path : path.substr(0, slash);
  fields["KAVOMDDisplayName"] = name;
  fields["KAVOMDExtension"] = ExtensionOf(name);
  fields["KAVOMDKind"] = fields["KAVOMDExtension"];
  fields["KAVOMDIsDir"] = S_ISDIR(info.stx_mode);
  fields["KAVOMDIsEncrypted"] = false;
  fields["KAVOMDFSSize"] = static_cast<Json::UInt64>(info.stx_size);
  const std::pair<const char*, int64_t> dates[] = {
      {"KAVOMDFSContentChangeDate", info.stx_mtime.tv_sec},
      {"KAVOMDContentModificationDate", info.stx_mtime.tv_sec},
      {"KAVOMDAttributeChangeDate", info.stx_ctime.tv_sec},
      {"KAVOMDLastUsedDate", info.stx_atime.tv_sec}};
  for (const auto& [field, seconds] : dates) {
    fields[field] = static_cast<Json::Int64>(seconds);
  }
  if ((info.stx_mask & STATX_BTIME) != 0) {  // Not every file system keeps it.
    fields["KAVOMDFSCreationDate"] = static_cast<Json::Int64>(info.stx_btime.tv_sec);
  }
  // Texts, as they are searched whole.
  fields["KAVOMDOwnerUserID"] = std::to_string(info.stx_uid);
  fields["KAVOMDOwnerGroupID"] = std::to_string(info.stx_gid);
  fields["KAVOMDPrivilege"] = Octal(info.stx_mode & 07777U);
  return fields;
}

}  // namespace

// NOLINTNEXTLINE(readability-identifier-naming): these are the platform's names.
namespace KAVO::CONTENT_EXTRACT {

void ParseFile(const std::string& path, const Json::Value& options, Json::Value& metadata) {
  struct statx info {};
  if (statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS | STATX_BTIME, &info) !=
      0) {
    Fail(path);
  }
  Json::Value fields = AttributesOf(path, info);
  if (options["need_meta"].isBool() && options["need_meta"].asBool() && S_ISREG(info.stx_mode)) {
    const std::string text = ReadText(path);
    if (!text.empty()) {
      fields["KAVOMDTextContent"] = text;
    }
  }
  metadata = std::move(fields);
}

}  // namespace KAVO::CONTENT_EXTRACT
