#include "store/file_url.h"

namespace kestrel {

KSTFileURL::KSTFileURL(std::string path, bool isDirectory)
    : path_(std::move(path)), isDirectory_(isDirectory) {
  while (path_.size() > 1 && path_.back() == '/') path_.pop_back();
}

KSTFileURL KSTFileURL::appending(std::string_view component, bool isDirectory) const {
  while (!component.empty() && component.front() == '/') component.remove_prefix(1);
  while (!component.empty() && component.back() == '/') component.remove_suffix(1);
  if (component.empty()) return KSTFileURL(path_, isDirectory);
  if (path_.empty() || path_ == "/") return KSTFileURL("/" + std::string(component), isDirectory);
  return KSTFileURL(path_ + "/" + std::string(component), isDirectory);
}

std::string_view KSTFileURL::parentPath(std::string_view path) {
  const auto slash = path.rfind('/');
  if (slash == std::string_view::npos) return ".";
  if (slash == 0) return "/";
  path = path.substr(0, slash);
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  return path;
}

KSTFileURL KSTFileURL::deletingLastPathComponent() const {
  return KSTFileURL(std::string(parentPath(path_)), true);
}

std::string KSTFileURL::lastPathComponent() const {
  if (path_ == "/") return "/";
  const auto slash = path_.rfind('/');
  return slash == std::string::npos ? path_ : path_.substr(slash + 1);
}

}  // namespace kestrel
