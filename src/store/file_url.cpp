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

KSTFileURL KSTFileURL::deletingLastPathComponent() const {
  const auto slash = path_.rfind('/');
  if (slash == std::string::npos) return KSTFileURL(".", true);
  if (slash == 0) return KSTFileURL("/", true);
  return KSTFileURL(path_.substr(0, slash), true);
}

std::string KSTFileURL::lastPathComponent() const {
  if (path_ == "/") return "/";
  const auto slash = path_.rfind('/');
  return slash == std::string::npos ? path_ : path_.substr(slash + 1);
}

}  // namespace kestrel
