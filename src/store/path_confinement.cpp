// Path confinement: whether a path that a client named lies within a base
// directory, once its symbolic links and the system's "/private" alias are
// resolved. The check reads the file system as it is at that moment; what
// acts on the path afterwards must not resolve it again (shared-content
// staging works through descriptors beneath the base).
#include <limits.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "daemon/log.h"
#include "platform/services.h"
#include "store/file_manager.h"
#include "store/plist_io.h"

namespace kestrel {

namespace {

constexpr std::size_t kLinkTargetBufferSize = 1024;
constexpr std::size_t kRealPathBufferSize = 1024;
constexpr const char* kPrivate = "/private";

// The components of a path as the system splits them: "/" first for an
// absolute path, then every name between slashes (empty ones dropped), and
// "/" again for a trailing slash.
std::vector<std::string> pathComponents(std::string_view path) {
  std::vector<std::string> components;
  if (path.empty()) return components;
  if (path.front() == '/') components.emplace_back("/");
  std::size_t start = 0;
  while (start < path.size()) {
    const std::size_t slash = path.find('/', start);
    const std::size_t end = slash == std::string_view::npos ? path.size() : slash;
    if (end > start) components.emplace_back(path.substr(start, end - start));
    if (slash == std::string_view::npos) break;
    start = slash + 1;
  }
  if (path.size() > 1 && path.back() == '/') components.emplace_back("/");
  return components;
}

std::string joined(const std::vector<std::string>& components, std::size_t from, std::size_t to) {
  std::string path;
  for (std::size_t i = from; i < to; ++i) {
    if (components[i] == "/") {
      if (path.empty()) path = "/";
      continue;
    }
    if (!path.empty() && path.back() != '/') path += '/';
    path += components[i];
  }
  return path;
}

// The system's paths lie beneath the filesystem root; its "/private" alias
// is the root's "private" directory.
const std::string& rootPath() {
  return platform::services().root.path();
}

// "<root>/private/x" -> "<root>/x".
std::string withoutPrivateAlias(const std::string& path) {
  const std::string root = rootPath() == "/" ? "" : rootPath();
  const std::string prefix = root + kPrivate + "/";
  if (!path.starts_with(prefix)) return path;
  return root + path.substr(root.size() + std::strlen(kPrivate));
}

}  // namespace

bool KSTContainsDotDotPathComponents(std::string_view path) {
  for (const std::string& component : pathComponents(path)) {
    if (component == "..") return true;
  }
  return false;
}

bool KSTFileManager::_validateSymlink(const std::optional<std::string>& path,
                                      std::int32_t withStartingDepth,
                                      std::int32_t* andEndingDepth) const {
  if (!path) return false;
  std::int32_t depth = withStartingDepth;
  for (const std::string& component : pathComponents(*path)) {
    if (component == "..") {
      --depth;
    } else if (component != "" && component != "." && component != "/") {
      ++depth;
    }
    if (depth < withStartingDepth) return false;
  }
  if (andEndingDepth != nullptr) *andEndingDepth = depth;
  return true;
}

std::optional<KSTFileURL> KSTFileManager::_realPathForURL(
    const KSTFileURL& url, bool allowNonExistentPathComponents) const {
  std::array<char, PATH_MAX> buffer{};
  if (::realpath(url.fileSystemRepresentation(), buffer.data()) != nullptr) {
    // Paths longer than the system keeps are not ours to look at.
    if (std::strlen(buffer.data()) < kRealPathBufferSize) return KSTFileURL(buffer.data());
    errno = ENAMETOOLONG;
  }
  const int error = errno;
  if (error == ENOENT && allowNonExistentPathComponents) {
    return _realPathWhatExistsInPath(url.path());
  }
  KSTLog(kLogError, "Failed to realpath %s : %s at %s", url.path(), std::strerror(error),
         buffer.data());
  return std::nullopt;
}

std::optional<KSTFileURL> KSTFileManager::_realPathWhatExistsInPath(const std::string& path) const {
  const std::vector<std::string> components = pathComponents(path);
  const std::size_t n = components.size();
  if (n <= 1) return std::nullopt;
  for (std::size_t k = n; k >= 2; --k) {
    const KSTFileURL prefix(joined(components, 0, k));
    if (!itemExistsAtURL(prefix)) continue;
    const std::optional<KSTFileURL> real = _realPathForURL(prefix, false);
    if (!real) continue;
    const std::string remainder = joined(components, k, n);
    KSTLog(kLogDebug, "Realpathed %@ ; appending non-existing components %@", *real, remainder);
    return real->appending(remainder);
  }
  return std::nullopt;
}

std::optional<KSTFileURL> KSTFileManager::realPathForURL(
    const std::optional<KSTFileURL>& url, const std::optional<KSTFileURL>& ifChildOfURL) const {
  const char* const function = __func__;
  const auto reject = [function](const char* format, auto&&... args) -> std::optional<KSTFileURL> {
    KSTLogTag(kLogError, function, format, std::forward<decltype(args)>(args)...);
    return std::nullopt;
  };
  if (!url || !ifChildOfURL || url->empty() || ifChildOfURL->empty()) {
    return reject("The base path %@ and/or suspicious path %@ were nil", ifChildOfURL, url);
  }
  // The strings are compared without the alias; the file system is asked
  // about the paths as they were given, since on Linux "<root>/var" is a
  // directory of its own unless the system made it the alias.
  const std::string base = withoutPrivateAlias(ifChildOfURL->path());
  const std::string suspicious = withoutPrivateAlias(url->path());
  if (!suspicious.starts_with(base)) {
    return reject("supiscious path %@ does not contain base path %@ as a prefix", suspicious, base);
  }
  if (KSTContainsDotDotPathComponents(suspicious)) {
    return reject("The suspicious path %@ contains '..' paths, which are invalid", suspicious);
  }

  // A link named by the path itself: relative and within the base, by its
  // target's own components.
  std::array<char, kLinkTargetBufferSize + 1> target{};
  const ssize_t length =
      ::readlink(url->fileSystemRepresentation(), target.data(), kLinkTargetBufferSize);
  if (length < 0) {
    if (errno != EINVAL && errno != ENOENT)
      return reject("Readlink failed: %s", std::strerror(errno));
  } else {
    // A target that fills the buffer is cut there, and so never names more.
    target[static_cast<std::size_t>(length)] = '\0';
    if (target[0] == '/') {
      return reject("Rejecting %@ -> %s, as absolute symlinks are not allowed", suspicious,
                    target.data());
    }
    std::int32_t baseDepth = 0;
    if (!_validateSymlink(base, 0, &baseDepth)) {
      return reject("Failed to retrieve depth of %@", base);
    }
    const std::string inBase = suspicious.substr(base.size());
    const std::string resolved =
        KSTFileURL(inBase).deletingLastPathComponent().appending(target.data()).path();
    if (!_validateSymlink(resolved, baseDepth, nullptr)) {
      return reject("Rejecting %@ -> %@, as it is points outside or to the base %@", suspicious,
                    resolved, base);
    }
  }

  const std::optional<KSTFileURL> baseReal = _realPathForURL(*ifChildOfURL, false);
  if (!baseReal) return reject("Failed to retrieve realpath for base path %@ ", base);
  const std::optional<KSTFileURL> suspReal = _realPathForURL(*url, true);
  if (!suspReal) return reject("Failed to retrieve realpath for suspicious path %@", suspicious);

  // A validated link is compared too: its target passed by its own
  // components, but may still lead out through another link on its way.
  // Every path is compared, a validated link too: its target passed by its
  // own components, but may still lead out through another link on its way.
  // Where the system has the "/private" alias, both real paths carry it;
  // where one would and the other not, they lie in two trees on Linux (its
  // "/var" is a directory of its own), so no component is skipped for it.
  const std::vector<std::string> baseComps = pathComponents(baseReal->path());
  const std::vector<std::string> suspComps = pathComponents(suspReal->path());
  if (baseComps.size() < 2 || suspComps.size() < 2) {
    return reject(
        "Rejecting %@ with base %@ because real component counts don't make sense (reals %@ ; "
        "%@)",
        suspicious, base, *suspReal, *baseReal);
  }
  std::size_t i = 1;
  std::size_t j = 1;
  if (baseComps.size() - i > suspComps.size() - j) {
    return reject(
        "Rejecting %@ with base %@ because base component count is greater than child component "
        "count (reals %@ ; %@)",
        suspicious, base, *suspReal, *baseReal);
  }
  for (; i < baseComps.size(); ++i, ++j) {
    if (baseComps[i] != suspComps[j]) {
      return reject(
          "Rejecting %@ with base %@ (reals %@ ; %@) because components diverge at %@ != %@",
          suspicious, base, *suspReal, *baseReal, baseComps[i], suspComps[j]);
    }
  }
  return suspReal;
}

}  // namespace kestrel
