#include "platform/linux/device_info_linux.h"

#include <sys/stat.h>

#include <fstream>
#include <sstream>

namespace kestrel::platform {

namespace {

constexpr std::string_view kWhitespace = " \t\r";

std::string_view trim(std::string_view text) {
  const auto first = text.find_first_not_of(kWhitespace);
  if (first == std::string_view::npos) return {};
  const auto last = text.find_last_not_of(kWhitespace);
  return text.substr(first, last - first + 1);
}

// One shell word: a run of unquoted, 'single-quoted' and "double-quoted" parts.
// Backslash escapes the next character outside single quotes; inside double
// quotes only $ ` " \ are escapable. An unquoted blank ends the word (what
// follows would be a command, which os-release never has).
std::string unquote(std::string_view value) {
  std::string out;
  std::size_t i = 0;
  while (i < value.size()) {
    const char c = value[i];
    if (c == '\'') {
      const auto close = value.find('\'', i + 1);
      const auto end = close == std::string_view::npos ? value.size() : close;
      out.append(value.substr(i + 1, end - i - 1));
      i = end + 1;
    } else if (c == '"') {
      ++i;
      while (i < value.size() && value[i] != '"') {
        if (value[i] == '\\' && i + 1 < value.size() &&
            std::string_view("$`\"\\").find(value[i + 1]) != std::string_view::npos) {
          ++i;
        }
        out.push_back(value[i]);
        ++i;
      }
      ++i;  // the closing quote
    } else if (c == '\\') {
      if (i + 1 < value.size()) out.push_back(value[i + 1]);
      i += 2;
    } else if (c == ' ' || c == '\t') {
      break;
    } else {
      out.push_back(c);
      ++i;
    }
  }
  return out;
}

}  // namespace

std::map<std::string, std::string> parseOsRelease(std::string_view text) {
  std::map<std::string, std::string> values;
  while (!text.empty()) {
    const auto newline = text.find('\n');
    const std::string_view line =
        trim(text.substr(0, newline == std::string_view::npos ? text.size() : newline));
    text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
    if (line.empty() || line.front() == '#') continue;
    const auto equals = line.find('=');
    if (equals == std::string_view::npos) continue;
    const std::string_view key = trim(line.substr(0, equals));
    if (key.empty()) continue;
    values[std::string(key)] = unquote(trim(line.substr(equals + 1)));
  }
  return values;
}

LinuxDeviceInfo::LinuxDeviceInfo(FilesystemRoot root) : root_(std::move(root)) {}

bool LinuxDeviceInfo::isInternalBuild() const {
  struct stat st {};
  return ::lstat(root_.resolve("/etc/kestrel/internal-build").c_str(), &st) == 0;
}

std::string LinuxDeviceInfo::buildVersion() const {
  std::ifstream in(root_.resolve("/etc/os-release"), std::ios::binary);
  if (!in) return "Unknown";
  std::ostringstream contents;
  contents << in.rdbuf();
  const auto values = parseOsRelease(contents.str());
  for (const char* key : {"BUILD_ID", "VERSION_ID"}) {
    const auto it = values.find(key);
    if (it != values.end() && !it->second.empty()) return it->second;
  }
  return "Unknown";
}

}  // namespace kestrel::platform
