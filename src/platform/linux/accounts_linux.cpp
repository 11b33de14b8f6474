#include "platform/linux/accounts_linux.h"

#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <memory>
#include <string>
#include <vector>

namespace kestrel::platform {

namespace {

struct FileCloser {
  void operator()(FILE* file) const { std::fclose(file); }
};
using UniqueFile = std::unique_ptr<FILE, FileCloser>;

// The reentrant lookups want a caller-supplied buffer for the strings of the
// entry; long group member lists can outgrow any fixed size.
constexpr std::size_t kInitialBufferSize = 1024;
constexpr std::size_t kMaxBufferSize = std::size_t{1} << 20;

std::size_t initialBufferSize(int sysconfName) {
  const long suggested = ::sysconf(sysconfName);
  if (suggested > 0 && static_cast<std::size_t>(suggested) <= kMaxBufferSize) {
    return static_cast<std::size_t>(suggested);
  }
  return kInitialBufferSize;
}

// Runs a get*_r lookup against the host database, growing the buffer on ERANGE.
// Lookup: int(Entry*, char*, size_t, Entry**).
template <typename Entry, typename Out, typename Lookup, typename Convert>
std::optional<Out> hostLookup(int sysconfName, Lookup lookup, Convert convert) {
  std::vector<char> buffer(initialBufferSize(sysconfName));
  Entry entry{};
  Entry* result = nullptr;
  for (;;) {
    const int rc = lookup(&entry, buffer.data(), buffer.size(), &result);
    if (rc == ERANGE && buffer.size() < kMaxBufferSize) {
      buffer.resize(buffer.size() * 2);
      continue;
    }
    if (rc != 0 || result == nullptr) return std::nullopt;
    return convert(*result);
  }
}

// Scans an account file with fgetpwent_r/fgetgrent_r for the first entry that
// matches. Malformed lines are skipped by the parser; on ERANGE the parser
// rewinds to the start of the entry, so the read is retried with a larger buffer.
template <typename Entry, typename Out, typename Next, typename Match, typename Convert>
std::optional<Out> scanFile(const std::string& path, Next next, Match match, Convert convert) {
  UniqueFile file(std::fopen(path.c_str(), "re"));
  if (!file) return std::nullopt;
  std::vector<char> buffer(kInitialBufferSize);
  Entry entry{};
  Entry* result = nullptr;
  for (;;) {
    const int rc = next(file.get(), &entry, buffer.data(), buffer.size(), &result);
    if (rc == ERANGE && buffer.size() < kMaxBufferSize) {
      buffer.resize(buffer.size() * 2);
      continue;
    }
    if (rc != 0 || result == nullptr) return std::nullopt;
    if (match(*result)) return convert(*result);
  }
}

std::string nonNull(const char* text) {
  return text != nullptr ? text : "";
}

// Home directories name system paths; beneath a scratch root they live beneath it.
UserAccount toUser(const FilesystemRoot& root, const passwd& pw) {
  const std::string home = nonNull(pw.pw_dir);
  return UserAccount{nonNull(pw.pw_name), pw.pw_uid, pw.pw_gid,
                     home.empty() ? home : root.resolve(home)};
}

GroupAccount toGroup(const group& gr) {
  return GroupAccount{nonNull(gr.gr_name), gr.gr_gid};
}

// A name with an embedded NUL would be cut short by the C interfaces and match
// a different account.
bool isValidName(std::string_view name) {
  return !name.empty() && name.find('\0') == std::string_view::npos;
}

}  // namespace

LinuxAccounts::LinuxAccounts(FilesystemRoot root) : root_(std::move(root)) {}

std::optional<UserAccount> LinuxAccounts::userByName(std::string_view name) const {
  const auto convert = [this](const passwd& pw) { return toUser(root_, pw); };
  if (!isValidName(name)) return std::nullopt;
  const std::string wanted(name);
  if (root_.isHostRoot()) {
    return hostLookup<passwd, UserAccount>(
        _SC_GETPW_R_SIZE_MAX,
        [&](passwd* pw, char* buf, std::size_t len, passwd** out) {
          return ::getpwnam_r(wanted.c_str(), pw, buf, len, out);
        },
        convert);
  }
  return scanFile<passwd, UserAccount>(
      root_.resolve("/etc/passwd"), ::fgetpwent_r,
      [&](const passwd& pw) { return pw.pw_name != nullptr && wanted == pw.pw_name; }, convert);
}

std::optional<UserAccount> LinuxAccounts::userById(uid_t uid) const {
  const auto convert = [this](const passwd& pw) { return toUser(root_, pw); };
  if (root_.isHostRoot()) {
    return hostLookup<passwd, UserAccount>(
        _SC_GETPW_R_SIZE_MAX,
        [&](passwd* pw, char* buf, std::size_t len, passwd** out) {
          return ::getpwuid_r(uid, pw, buf, len, out);
        },
        convert);
  }
  return scanFile<passwd, UserAccount>(
      root_.resolve("/etc/passwd"), ::fgetpwent_r,
      [&](const passwd& pw) { return pw.pw_uid == uid; }, convert);
}

std::optional<GroupAccount> LinuxAccounts::groupByName(std::string_view name) const {
  const auto convert = [](const group& gr) { return toGroup(gr); };
  if (!isValidName(name)) return std::nullopt;
  const std::string wanted(name);
  if (root_.isHostRoot()) {
    return hostLookup<group, GroupAccount>(
        _SC_GETGR_R_SIZE_MAX,
        [&](group* gr, char* buf, std::size_t len, group** out) {
          return ::getgrnam_r(wanted.c_str(), gr, buf, len, out);
        },
        convert);
  }
  return scanFile<group, GroupAccount>(
      root_.resolve("/etc/group"), ::fgetgrent_r,
      [&](const group& gr) { return gr.gr_name != nullptr && wanted == gr.gr_name; }, convert);
}

std::optional<GroupAccount> LinuxAccounts::groupById(gid_t gid) const {
  const auto convert = [](const group& gr) { return toGroup(gr); };
  if (root_.isHostRoot()) {
    return hostLookup<group, GroupAccount>(
        _SC_GETGR_R_SIZE_MAX,
        [&](group* gr, char* buf, std::size_t len, group** out) {
          return ::getgrgid_r(gid, gr, buf, len, out);
        },
        convert);
  }
  return scanFile<group, GroupAccount>(
      root_.resolve("/etc/group"), ::fgetgrent_r, [&](const group& gr) { return gr.gr_gid == gid; },
      convert);
}

}  // namespace kestrel::platform
