// What the file system tells of every file, and the text of small files that are UTF-8 as they
// stand. Whatever else is in files is asked of the daemon kavocontentextractd: the libraries that
// read documents and media are not to be trusted with the caller's process.
#include "kavo/content_extract.h"

#include <fcntl.h>
#include <json/reader.h>
#include <json/writer.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <iterator>
#include <memory>
#include <optional>
#include <string_view>
#include <system_error>
#include <utility>

#include "kavo/local/content.h"
#include "kavo/local/frames.h"
#include "kavo/local/open.h"
#include "kavo/local/shares.h"
#include "platform/local/fd.h"

using kavo::local::kMaxTextBytes;
using kavo::local::ScopedFd;

namespace reason = kavo::local::content_reason;

namespace {

using Clock = std::chrono::steady_clock;

// What the daemon takes with its usual limits: two tries of ten seconds, and the way to them.
constexpr std::chrono::seconds kUsualWait(25);
constexpr std::chrono::seconds kConnectWait(5);
constexpr size_t kMaxReplyBytes = size_t{8} << 20;
constexpr size_t kMaxStatsBytes = size_t{64} << 10;
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

// False, too, when the last character is cut off.
bool IsUtf8(std::string_view text) {
  while (!text.empty()) {
    const size_t bytes = CharacterBytes(text);
    if (bytes == 0 || bytes > text.size()) {
      return false;
    }
    text.remove_prefix(bytes);
  }
  return true;
}

// Of the control characters plain text has white space, backspace and escape sequences. A shift of
// the character set (ESC $, ESC ( ) makes another encoding of what looks like ASCII.
bool IsPlainText(std::string_view text) {
  const auto is_binary = [](char c) {
    const auto byte = static_cast<unsigned char>(c);
    return byte < 0x20 && (byte < '\b' || byte > '\r') && byte != 0x1B;
  };
  return std::none_of(text.begin(), text.end(), is_binary) &&
         text.find("\x1B$") == std::string_view::npos &&
         text.find("\x1B(") == std::string_view::npos && IsUtf8(text);
}

// Files with these names are text by themselves, without markup to take out.
constexpr std::string_view kTextExtensions[] = {
    "asm", "awk", "bash",  "bat",  "bib",  "c",    "cc",  "cfg",   "cmake", "conf", "cpp",
    "cs",  "css", "csv",   "cxx",  "diff", "eml",  "go",  "h",     "hh",    "hpp",  "hxx",
    "in",  "inc", "ini",   "java", "js",   "json", "kt",  "log",   "lua",   "m",    "md",
    "mk",  "nfo", "patch", "php",  "pl",   "pm",   "po",  "proto", "py",    "r",    "rb",
    "rs",  "rst", "scala", "sh",   "sql",  "srt",  "sub", "swift", "tcl",   "tex",  "toml",
    "ts",  "tsv", "txt",   "vbs",  "vim",  "yaml", "yml", "zsh"};
static_assert(std::is_sorted(std::begin(kTextExtensions), std::end(kTextExtensions)));

// Reading for an index is no use of the file, so its access time is left alone where that is
// allowed.
int OpenQuietly(const std::string& path) {
  constexpr int kFlags = O_RDONLY | O_NONBLOCK | O_NOCTTY;
  const int fd = kavo::local::OpenInShare(path, kFlags | O_NOATIME);
  return fd < 0 && errno == EPERM ? kavo::local::OpenInShare(path, kFlags) : fd;
}

// Nothing when the file is longer than `most` bytes, or cannot be read.
std::optional<std::string> ReadShort(int file, size_t most) {
  std::string text(most + 1, '\0');
  size_t size = 0;
  while (size < text.size()) {
    const ssize_t count =
        pread(file, text.data() + size, text.size() - size, static_cast<off_t>(size));
    if (count == 0) {
      text.resize(size);
      return text;
    }
    if (count < 0 && errno != EINTR) {
      return std::nullopt;
    }
    size += count > 0 ? static_cast<size_t>(count) : 0;
  }
  return std::nullopt;
}

void SetError(Json::Value& fields, const std::string& word, const std::string& message) {
  fields[kavo::local::kContentErrorField] = word + ": " + message;
}

// True when the text is in `fields` without the daemon's help.
bool TakePlainText(int file, uint64_t size, Json::Value& fields) {
  const std::string extension = fields["KAVOMDExtension"].asString();
  if (size > kMaxTextBytes ||
      !std::binary_search(std::begin(kTextExtensions), std::end(kTextExtensions), extension)) {
    return false;
  }
  std::optional<std::string> text = ReadShort(file, static_cast<size_t>(size));
  if (!text || !IsPlainText(*text)) {
    return false;
  }
  fields["KAVOMDContentType"] = "text/plain";
  fields["KAVOMDTextContent"] =
      text->starts_with(kByteOrderMark) ? text->substr(kByteOrderMark.size()) : *std::move(text);
  return true;
}

bool ParseReply(const std::string& text, Json::Value& reply) {
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  try {
    return reader->parse(text.data(), text.data() + text.size(), &reply, nullptr) &&
           reply.isObject();
  } catch (const Json::Exception&) {  // Nested too deep.
    return false;
  }
}

std::string ToText(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  return Json::writeString(builder, value);
}

// "" for what is no text.
std::string TextOf(const Json::Value& object, const char* member) {
  const Json::Value text = object.isObject() ? object[member] : Json::Value();
  return text.isString() ? text.asString() : "";
}

// How long a daemon that has not answered in the usual time may take with the limits that it was
// started with; zero when it does not say.
std::chrono::seconds LongerWait() {
  const kavo::local::Deadline deadline = Clock::now() + kConnectWait;
  const ScopedFd socket(kavo::local::ConnectWithin(kavo::local::ContentSocket(), deadline));
  Json::Value stats;
  std::string text;
  if (socket.Get() < 0 ||
      !kavo::local::SendFrame(socket.Get(), R"({"command":"stats"})", -1, deadline) ||
      !kavo::local::ReceiveFrame(socket.Get(), kMaxStatsBytes, text, nullptr, deadline) ||
      !ParseReply(text, stats) || !stats["deadline"].isUInt()) {
    return std::chrono::seconds(0);
  }
  return std::chrono::seconds(int64_t{2} * stats["deadline"].asUInt() + 5);
}

// The daemon's reply about the file; false with errno.
bool AskDaemon(const std::string& path, int file, Json::Value& reply) {
  const Clock::time_point start = Clock::now();
  const ScopedFd socket(
      kavo::local::ConnectWithin(kavo::local::ContentSocket(), start + kConnectWait));
  if (socket.Get() < 0) {
    return false;
  }
  Json::Value request;
  request["command"] = "extract";
  request["path"] = path;
  if (!kavo::local::SendFrame(socket.Get(), ToText(request), file, start + kUsualWait)) {
    return false;
  }
  struct pollfd answer = {socket.Get(), POLLIN, 0};
  int count = 0;
  do {  // Most of the time the whole reply comes at once, so only its beginning is waited for here.
    const auto left =
        std::chrono::ceil<std::chrono::milliseconds>(start + kUsualWait - Clock::now()).count();
    count = poll(&answer, 1, static_cast<int>(std::max<int64_t>(left, 0)));
  } while (count < 0 && errno == EINTR);
  const auto wait = count == 0 ? LongerWait() : kUsualWait + kConnectWait;
  std::string text;
  if (!kavo::local::ReceiveFrame(socket.Get(), kMaxReplyBytes, text, nullptr, start + wait)) {
    return false;
  }
  if (!ParseReply(text, reply)) {
    errno = EBADMSG;
    return false;
  }
  return true;
}

std::string UnavailableText(int error) {
  const std::string socket = kavo::local::ContentSocket();
  return error == ENOENT || error == ECONNREFUSED
             ? "kavocontentextractd does not run (nobody answers on " + socket + ")"
             : "kavocontentextractd gives no answer on " + socket + ", " +
                   std::generic_category().message(error);
}

// Adds what stands in the content, or why it is missing.
void AddContent(const std::string& path, Json::Value& fields) {
  const ScopedFd file(OpenQuietly(path));
  struct stat info {};
  if (file.Get() < 0 || fstat(file.Get(), &info) != 0) {
    const bool passes = errno == EMFILE || errno == ENFILE || errno == ENOMEM;
    SetError(fields, passes ? reason::kUnavailable : reason::kUnreadable,
             std::generic_category().message(errno));
    return;
  }
  if (!S_ISREG(info.st_mode) || info.st_size == 0 ||
      TakePlainText(file.Get(), static_cast<uint64_t>(info.st_size), fields)) {
    return;
  }
  Json::Value reply;
  if (!AskDaemon(path, file.Get(), reply)) {
    SetError(fields, reason::kUnavailable, UnavailableText(errno));
    return;
  }
  if (reply.isMember("error")) {
    SetError(fields, TextOf(reply["error"], "reason"), TextOf(reply["error"], "msg"));
    return;
  }
  for (const std::string& name : reply.getMemberNames()) {
    if (!fields.isMember(name)) {  // What the file system says stands.
      fields[name] = std::move(reply[name]);
    }
  }
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

namespace kavo::local {

std::string ContentSocket() { return Root() + "/var/run/kavocontentextractd.sock"; }

}  // namespace kavo::local

// NOLINTNEXTLINE(readability-identifier-naming): these are the platform's names.
namespace KAVO::CONTENT_EXTRACT {

void ParseFile(const std::string& path, const Json::Value& options, Json::Value& metadata) {
  struct statx info {};
  {
    const ScopedFd file(kavo::local::OpenInShare(path, O_PATH));
    if (file.Get() < 0 || statx(file.Get(), "", AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW,
                                STATX_BASIC_STATS | STATX_BTIME, &info) != 0) {
      Fail(path);
    }
  }
  Json::Value fields = AttributesOf(path, info);
  if (options["need_meta"].isBool() && options["need_meta"].asBool() && S_ISREG(info.stx_mode)) {
    AddContent(path, fields);
  }
  metadata = std::move(fields);
}

}  // namespace KAVO::CONTENT_EXTRACT
