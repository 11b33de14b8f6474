#include "user_groups.h"

#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <string_view>

namespace kestrel::run {

namespace {

// The whole file, or nothing when it cannot be read.
std::optional<std::string> contentsOf(const std::string& path) {
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return std::nullopt;
  std::string text;
  char buffer[16384];
  ssize_t got = 0;
  while ((got = ::read(fd, buffer, sizeof buffer)) > 0 || (got < 0 && errno == EINTR)) {
    if (got > 0) text.append(buffer, got);
  }
  ::close(fd);
  if (got < 0) return std::nullopt;
  return text;
}

// A numeric field as the C library's account files reader takes it: what
// strtoul reads, if it reads something and then nothing is left, cut to 32 bits.
std::optional<std::uint32_t> idOf(std::string_view field) {
  const std::string text(field);
  char* end = nullptr;
  const unsigned long id = std::strtoul(text.c_str(), &end, 10);
  if (end == text.c_str() || *end != '\0') return std::nullopt;
  return static_cast<std::uint32_t>(id);
}

// The first `count` - 1 colon-ended fields of a line, then the rest of it;
// false when the line has fewer colons.
template <std::size_t count>
bool split(std::string_view line, std::string_view (&fields)[count]) {
  for (std::size_t i = 0; i + 1 < count; ++i) {
    const std::size_t colon = line.find(':');
    if (colon == std::string_view::npos) return false;
    fields[i] = line.substr(0, colon);
    line.remove_prefix(colon + 1);
  }
  fields[count - 1] = line;
  return true;
}

// Calls `entry(line)` for each line until it returns true.
template <typename Entry>
void forEachLine(std::string_view text, Entry&& entry) {
  while (!text.empty()) {
    const std::size_t newline = text.find('\n');
    const std::string_view line = text.substr(0, newline);
    text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
    if (entry(line)) return;
  }
}

bool isBlank(char c) {
  return std::isspace(static_cast<unsigned char>(c)) != 0;
}

std::optional<Account> accountFromFiles(uid_t uid, const std::string& path) {
  const std::optional<std::string> text = contentsOf(path);
  if (!text) return std::nullopt;
  std::optional<Account> account;
  forEachLine(*text, [&](std::string_view line) {
    while (!line.empty() && isBlank(line.front())) line.remove_prefix(1);
    if (line.empty() || line.front() == '#') return false;
    // name:password:uid:gid[:...]
    std::string_view fields[4];
    if (!split(line, fields)) return false;
    // An entry whose group is no number is no entry.
    if (idOf(fields[2]) != uid || !idOf(fields[3].substr(0, fields[3].find(':')))) return false;
    account = Account{std::string(fields[0]), true};
    return true;
  });
  return account;
}

std::optional<Account> accountFromSystem(uid_t uid) {
  struct passwd entry {};
  struct passwd* found = nullptr;
  std::vector<char> buffer(16384);
  if (::getpwuid_r(uid, &entry, buffer.data(), buffer.size(), &found) != 0 || found == nullptr) {
    return std::nullopt;
  }
  return Account{entry.pw_name, false};
}

}  // namespace

std::optional<Account> accountOf(uid_t uid, const AccountFiles& files) {
  if (std::optional<Account> account = accountFromFiles(uid, files.passwd)) return account;
  return accountFromSystem(uid);
}

std::vector<gid_t> groupsOf(const Account& account, gid_t gid, const AccountFiles& files) {
  if (!account.inFiles) {
    int count = 64;
    std::vector<gid_t> groups(count);
    while (::getgrouplist(account.name.c_str(), gid, groups.data(), &count) < 0) {
      groups.resize(count);
    }
    groups.resize(count);
    return groups;
  }
  std::vector<gid_t> groups = {gid};
  const std::optional<std::string> text = contentsOf(files.group);
  if (!text) return groups;
  // name:password:gid:member,member,... Like the C library's reader of
  // memberships, every line is read, even one that starts with '#'; blanks
  // before a member's name are skipped, not those after it.
  forEachLine(*text, [&](std::string_view line) {
    std::string_view fields[4];
    if (!split(line, fields)) return false;
    const auto id = idOf(fields[2]);
    if (!id || *id == gid) return false;
    std::string_view members = fields[3];
    while (!members.empty()) {
      while (!members.empty() && isBlank(members.front())) members.remove_prefix(1);
      const std::size_t comma = members.find(',');
      if (members.substr(0, comma) == account.name) {
        groups.push_back(*id);
        break;
      }
      members.remove_prefix(comma == std::string_view::npos ? members.size() : comma + 1);
    }
    return false;
  });
  return groups;
}

}  // namespace kestrel::run
