#include "cli/text.h"

#include <algorithm>
#include <filesystem>

namespace vexlo::cli {
namespace {

struct Character {
  char32_t code_point;
  size_t bytes;
};

// A byte that is no UTF-8 is a character of its own, with its number: there are terminals that take
// it for one. A form that is longer than it need be is read as what it stands for.
Character FirstOf(std::string_view text) {
  const auto lead = static_cast<unsigned char>(text[0]);
  const size_t bytes = lead < 0xC0 ? 1 : lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : 4;
  if (bytes == 1 || lead >= 0xF8 || text.size() < bytes) {
    return {lead, 1};
  }
  char32_t code_point = lead & (0xFFU >> (bytes + 1));
  for (const char c : text.substr(1, bytes - 1)) {
    const auto byte = static_cast<unsigned char>(c);
    if ((byte & 0xC0) != 0x80) {
      return {lead, 1};
    }
    code_point = code_point << 6 | (byte & 0x3FU);
  }
  return {code_point, bytes};
}

// The control characters, also those behind ASCII, and those that turn the direction of writing,
// with which "gpj.exe" looks like "exe.jpg".
bool IsObeyed(char32_t c) {
  return c < 0x20 || (c >= 0x7F && c < 0xA0) || (c >= 0x202A && c <= 0x202E) ||
         (c >= 0x2066 && c <= 0x2069);
}

}  // namespace

std::vector<std::string> Split(std::string_view text, char separator) {
  std::vector<std::string> parts;
  while (true) {
    const size_t end = text.find(separator);
    parts.emplace_back(text.substr(0, end));
    if (end == std::string_view::npos) {
      return parts;
    }
    text.remove_prefix(end + 1);
  }
}

std::string Grouped(uint64_t number) {
  std::string text = std::to_string(number);
  for (size_t at = text.size(); at > 3;) {
    at -= 3;
    text.insert(at, ",");
  }
  return text;
}

std::string Counted(uint64_t number, std::string_view noun) {
  std::string text = Grouped(number) + " ";
  text += noun;
  return number == 1 ? text : text + "s";
}

std::string ForTerminal(std::string_view text) {
  std::string shown;
  while (!text.empty()) {
    const Character first = FirstOf(text);
    for (const char c : text.substr(0, first.bytes)) {
      const auto byte = static_cast<unsigned char>(c);
      if (!IsObeyed(first.code_point)) {
        shown += c;
      } else {
        shown += {'\\', static_cast<char>('0' + (byte >> 6)),
                  static_cast<char>('0' + (byte >> 3 & 7)), static_cast<char>('0' + (byte & 7))};
      }
    }
    text.remove_prefix(first.bytes);
  }
  return shown;
}

std::string ForShell(const std::string& word) {
  constexpr std::string_view kPlain =
      "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789_-+./:,@%";
  if (!word.empty() && word.find_first_not_of(kPlain) == std::string::npos) {
    return word;
  }
  std::string quoted = "'";
  for (const char c : word) {
    quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
  }
  return quoted + "'";
}

std::string CauseOf(std::string_view reason) {
  constexpr std::string_view kMark = "reason=";
  const size_t at = reason.rfind(kMark);
  return std::string(at == std::string_view::npos ? reason : reason.substr(at + kMark.size()));
}

std::string TextOf(const Error& error) {
  std::string reason = error.what();
  if (reason.empty() && error.GetErrorCode() == ERR_CREDENTIALS) {
    reason = "this user has not the rights for it; root has";
  }
  return ForTerminal(reason) + " (error " + std::to_string(static_cast<int>(error.GetErrorCode())) +
         ")";
}

std::string AbsolutePath(const std::string& path) {
  std::string absolute = std::filesystem::absolute(path).lexically_normal().string();
  if (absolute.size() > 1 && absolute.back() == '/') {
    absolute.pop_back();
  }
  return absolute;
}

std::string Table(const std::vector<std::vector<std::string>>& rows) {
  const auto width = [](const std::string& text) {
    return static_cast<size_t>(
        std::count_if(text.begin(), text.end(), [](char c) { return (c & 0xC0) != 0x80; }));
  };
  std::vector<size_t> widths;
  for (const std::vector<std::string>& row : rows) {
    widths.resize(std::max(widths.size(), row.size()));
    for (size_t i = 0; i < row.size(); ++i) {
      widths[i] = std::max(widths[i], width(row[i]));
    }
  }
  std::string table;
  for (const std::vector<std::string>& row : rows) {
    for (size_t i = 0; i < row.size(); ++i) {
      table += row[i];
      table.append(i + 1 < row.size() ? widths[i] + 2 - width(row[i]) : 0, ' ');
    }
    table += '\n';
  }
  return table;
}

}  // namespace vexlo::cli
