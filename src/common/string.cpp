#include "common/string.h"

#include <algorithm>

namespace vexlo {
namespace {

constexpr std::string_view kWhiteSpace = " \t\n\v\f\r";

char AsciiLower(char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c; }

}  // namespace

bool StringStartWith(const std::string& str, const std::string& prefix) {
  return str.starts_with(prefix);
}

bool IsSameOrBelow(std::string_view path, std::string_view folder) {
  return path.starts_with(folder) && (path.size() == folder.size() || path[folder.size()] == '/');
}

std::string Basename(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

std::string Dirname(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(0, slash);
}

std::string GetFileExtension(const std::string& path, bool lower) {
  const std::string name = Basename(path);
  const size_t dot = name.rfind('.');
  if (dot == std::string::npos) {
    return "";
  }
  const std::string extension = name.substr(dot + 1);
  return lower ? ToLower(extension) : extension;
}

std::string Trim(const std::string& text) { return LTrim(RTrim(text)); }

std::string LTrim(const std::string& text) {
  const size_t first = text.find_first_not_of(kWhiteSpace);
  return first == std::string::npos ? "" : text.substr(first);
}

std::string RTrim(const std::string& text) {
  const size_t last = text.find_last_not_of(kWhiteSpace);
  return last == std::string::npos ? "" : text.substr(0, last + 1);
}

std::string ToLower(const std::string& text) {
  std::string lower = text;
  std::transform(lower.begin(), lower.end(), lower.begin(), AsciiLower);
  return lower;
}

namespace fileindex {

bool StringStartWith(const std::string& str, const std::string& prefix) {
  return vexlo::StringStartWith(str, prefix);
}

std::string Basename(const std::string& path) { return vexlo::Basename(path); }

std::string Dirname(const std::string& path) { return vexlo::Dirname(path); }

std::string GetFileExtension(const std::string& path, bool lower) {
  return vexlo::GetFileExtension(path, lower);
}

}  // namespace fileindex
}  // namespace vexlo
