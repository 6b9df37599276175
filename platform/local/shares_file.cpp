#include "platform/local/shares_file.h"

#include <fcntl.h>
#include <json/reader.h>
#include <json/value.h>
#include <json/writer.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <functional>
#include <limits>
#include <memory>
#include <sstream>
#include <string_view>
#include <unordered_set>

#include "platform/local/edit_file.h"
#include "platform/local/fd.h"
#include "platform/local/index_path.h"

namespace kavo::local {
namespace {

constexpr size_t kMaxNameBytes = 255;
constexpr size_t kMaxShownBytes = 100;
constexpr int kMaxNesting = 16;

constexpr char kShares[] = "shares";
constexpr char kName[] = "name";
constexpr char kPath[] = "path";
constexpr char kFtpPrivilege[] = "ftp_privilege";

struct Flag {
  const char* key;
  bool Share::*value;
};
constexpr Flag kFlags[] = {
    {"encrypted", &Share::encrypted},
    {"encryption", &Share::encryption},
    {"read_only", &Share::read_only},
    {"recycle", &Share::recycle},
    {"hide_unreadable", &Share::hide_unreadable},
};

// In quotes and on one line, whatever it holds.
std::string Quoted(std::string_view text) {
  std::string quoted = "\"";
  for (const char byte : text.substr(0, kMaxShownBytes)) {
    const auto value = static_cast<unsigned char>(byte);
    if (value < 0x20 || value == 0x7f) {
      char escape[sizeof("\\xff")];
      snprintf(escape, sizeof(escape), "\\x%02x", value);
      quoted += escape;
    } else {
      quoted += byte;
    }
  }
  return quoted + (text.size() > kMaxShownBytes ? "..." : "") + '"';
}

bool Contains(std::string_view folder, std::string_view path) {
  return path.starts_with(folder) && (path.size() == folder.size() || path[folder.size()] == '/');
}

// What is wrong with a share's name; "" when nothing is.
std::string NameFault(const std::string& name) {
  if (name.empty() || name.size() > kMaxNameBytes) {
    return "must have 1 to " + std::to_string(kMaxNameBytes) + " bytes";
  }
  if (name == "." || name == ".." || name.find('/') != std::string::npos ||
      name.find('\0') != std::string::npos) {
    return "must be a folder's name: without \"/\" and NUL, and not \".\" or \"..\"";
  }
  return "";
}

// What is wrong with a share's path; "" when nothing is.
std::string PathFault(const std::string& path, const std::string& name) {
  if (!IsNormalised(path) || path.find('\0') != std::string::npos) {
    return "must be absolute, without \".\", \"..\", NUL and doubled or trailing slashes, unlike " +
           Quoted(path);
  }
  if (!path.ends_with("/" + name)) {
    return "must end in the share's name, unlike " + Quoted(path);
  }
  if (const size_t bytes = EncodedBytes(path); bytes > kMaxEncodedBytes) {
    return "is too long: the name of the share's queue file would have " + std::to_string(bytes) +
           " bytes, and " + std::to_string(kMaxEncodedBytes) + " are allowed";
  }
  // A queue that is watched itself grows by each line that is written to it.
  const std::string index_folder = Root() + kIndexFolder;
  if (Contains(path, index_folder) || Contains(index_folder, path)) {
    return "must lie apart from the folder of queues and indexes, " + Quoted(index_folder);
  }
  return "";
}

class Parser {
 public:
  Parser(const std::string& file, const std::string& text) : file_(file), text_(text) {}

  std::vector<Share> Parse() const {
    const Json::Value root = ParseJson();
    if (!root.isObject()) {
      Fail(root, "the file must hold an object with the key \"shares\"");
    }
    for (auto member = root.begin(); member != root.end(); ++member) {
      if (member.name() != kShares) {
        Fail(*member, "unknown key " + Quoted(member.name()));
      }
    }
    const Json::Value& list = root[kShares];
    if (!list.isArray()) {
      Fail(root.empty() ? root : list, "\"shares\" must be a list");
    }
    std::vector<Share> shares;
    shares.reserve(list.size());  // The names must stay where they are.
    std::unordered_set<std::string_view> names(list.size());
    for (const Json::Value& entry : list) {
      shares.push_back(ReadShare(entry, shares.size() + 1));
      // That the paths differ follows: the name is the last component.
      if (!names.insert(shares.back().name).second) {
        Fail(entry[kName], Title(shares.back().name) + "\"name\" is that of another share, too");
      }
    }
    return shares;
  }

 private:
  static std::string Title(const std::string& name) { return "share " + Quoted(name) + ": "; }

  [[noreturn]] void FailInLine(const std::string& line, const std::string& what) const {
    throw SharesError(file_ + ":" + line + ": " + what);
  }
  [[noreturn]] void Fail(const Json::Value& at, const std::string& what) const {
    const auto offset = std::min(static_cast<size_t>(at.getOffsetStart()), text_.size());
    const auto end = text_.begin() + static_cast<std::ptrdiff_t>(offset);
    FailInLine(std::to_string(1 + std::count(text_.begin(), end, '\n')), what);
  }

  Json::Value ParseJson() const {
    Json::CharReaderBuilder builder;
    Json::CharReaderBuilder::strictMode(&builder.settings_);
    builder["allowComments"] = true;
    builder["collectComments"] = false;
    builder["skipBom"] = false;
    builder["stackLimit"] = kMaxNesting;
    const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    Json::Value root;
    std::string errors;
    bool is_json = false;
    try {
      is_json = reader->parse(text_.data(), text_.data() + text_.size(), &root, &errors);
    } catch (const Json::Exception& error) {
      RethrowNoMemory(error);
      throw SharesError(file_ + ": not JSON: nested too deep");
    }
    if (!is_json) {
      // The first of a list: "* Line 3, Column 5\n  WHAT\n".
      unsigned line = 1;
      int what_from = 0;
      sscanf(errors.c_str(), "* Line %u, Column %*u %n", &line, &what_from);
      std::string what = errors.substr(static_cast<size_t>(what_from));
      what = what.substr(0, what.find("\n* Line"));
      std::replace_if(
          what.begin(), what.end(), [](char byte) { return byte >= 0 && byte < 0x20; }, ' ');
      FailInLine(std::to_string(line),
                 "not JSON: " + what.substr(0, what.find_last_not_of(' ') + 1));
    }
    return root;
  }

  Share ReadShare(const Json::Value& entry, size_t number) const {
    std::string title = "share " + std::to_string(number) + ": ";
    if (!entry.isObject()) {
      Fail(entry, title + "must be an object");
    }
    Share share;
    share.name = ReadText(entry, kName, title);
    if (const std::string fault = NameFault(share.name); !fault.empty()) {
      Fail(entry[kName], title + "\"name\" " + fault + ", unlike " + Quoted(share.name));
    }
    title = Title(share.name);
    share.path = ReadText(entry, kPath, title);
    if (const std::string fault = PathFault(share.path, share.name); !fault.empty()) {
      Fail(entry[kPath], title + "\"path\" " + fault);
    }
    for (auto member = entry.begin(); member != entry.end(); ++member) {
      ReadSetting(member.name(), *member, title, share);
    }
    return share;
  }

  std::string ReadText(const Json::Value& entry, const char* key, const std::string& title) const {
    if (!entry.isMember(key)) {
      Fail(entry, title + Quoted(key) + " is missing");
    }
    if (!entry[key].isString()) {
      Fail(entry[key], title + Quoted(key) + " must be a text");
    }
    return entry[key].asString();
  }

  void ReadSetting(const std::string& key, const Json::Value& value, const std::string& title,
                   Share& share) const {
    if (key == kName || key == kPath) {
      return;
    }
    if (key == kFtpPrivilege) {
      const bool is_whole = value.type() == Json::intValue || value.type() == Json::uintValue;
      if (!is_whole || !value.isUInt()) {
        Fail(value, title + Quoted(key) + " must be a whole number from 0 to " +
                        std::to_string(std::numeric_limits<uint32_t>::max()));
      }
      share.ftp_privilege = value.asUInt();
      return;
    }
    for (const Flag& flag : kFlags) {
      if (key == flag.key) {
        if (!value.isBool()) {
          Fail(value, title + Quoted(key) + " must be true or false");
        }
        share.*flag.value = value.asBool();
        return;
      }
    }
    Fail(value, title + "unknown key " + Quoted(key));
  }

  const std::string& file_;
  const std::string& text_;
};

// A share a line, and without what has its default.
std::string Serialise(const std::vector<Share>& shares) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;  // Every other form replaces bytes that are not UTF-8.
  const std::unique_ptr<Json::StreamWriter> writer(builder.newStreamWriter());
  std::ostringstream out;
  out.exceptions(std::ios::badbit);  // Or want of memory would end the text early.
  out << "{\n  \"shares\": [";
  const char* separator = "\n    {\"name\": ";
  for (const Share& share : shares) {
    out << separator;
    writer->write(share.name, &out);
    out << ", \"path\": ";
    writer->write(share.path, &out);
    for (const Flag& flag : kFlags) {
      if (share.*flag.value) {
        out << ", \"" << flag.key << "\": true";
      }
    }
    if (share.ftp_privilege != 0) {
      out << ", \"" << kFtpPrivilege << "\": " << share.ftp_privilege;
    }
    out << '}';
    separator = ",\n    {\"name\": ";
  }
  out << "\n  ]\n}\n";
  return out.str();
}

// Replaces the list by what change(list) makes of it.
void Edit(const std::string& file, const std::function<void(std::vector<Share>&)>& change) {
  try {
    MakeFolders(FolderOf(file));
    const EditLock lock(file);
    std::vector<Share> shares = ReadShares(file);
    change(shares);
    SharesText text;
    text.exists = true;
    text.text = Serialise(shares);
    if (ParseShares(file, text) != shares) {
      throw SharesError(file + ": the new list would not read back as it is");
    }
    ReplaceWhole(file, text.text);
  } catch (const FileError& error) {
    throw SharesError(error.what());
  }
}

}  // namespace

FileVersion VersionOf(const struct stat& info) {
  constexpr int64_t kSecond = 1'000'000'000;
  return {info.st_dev, info.st_ino, info.st_size,
          info.st_mtim.tv_sec * kSecond + info.st_mtim.tv_nsec,
          info.st_ctim.tv_sec * kSecond + info.st_ctim.tv_nsec};
}

int ReadSharesText(const std::string& file, SharesText& read) {
  read = {};
  // A FIFO in the file's place must not hold up whoever asks.
  const ScopedFd fd(open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (fd.Get() < 0) {
    return errno == ENOENT ? 0 : errno;
  }
  struct stat info {};
  if (fstat(fd.Get(), &info) != 0 ||
      !ReadAll(fd.Get(), static_cast<size_t>(info.st_size), read.text)) {
    return errno;
  }
  if (read.text.size() > kMaxFileBytes) {
    return EFBIG;
  }
  read.version = VersionOf(info);
  read.exists = true;
  return 0;
}

std::string UnreadableMessage(const std::string& file, int error) {
  return file + ": cannot be read: " + strerror(error);
}

std::vector<Share> ParseShares(const std::string& file, const SharesText& read) {
  return read.exists ? Parser(file, read.text).Parse() : std::vector<Share>();
}

std::string SharesFile() { return Root() + "/etc/kavo/shares.json"; }

std::vector<Share> ReadShares(const std::string& file) {
  SharesText text;
  if (const int error = ReadSharesText(file, text); error != 0) {
    throw SharesError(UnreadableMessage(file, error));
  }
  return ParseShares(file, text);
}

void AddShare(const std::string& file, const Share& share) {
  Edit(file, [&share](std::vector<Share>& shares) { shares.push_back(share); });
}

void RemoveShare(const std::string& file, const std::string& name) {
  Edit(file, [&file, &name](std::vector<Share>& shares) {
    if (std::erase_if(shares, [&name](const Share& share) { return share.name == name; }) == 0) {
      throw SharesError(file + ": share " + Quoted(name) + ": there is no such share");
    }
  });
}

}  // namespace kavo::local
