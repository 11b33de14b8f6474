// A file URL: an absolute path on this machine (beneath the filesystem root
// already) and whether it names a directory. Its description is the path.
#pragma once

#include <string>
#include <string_view>

namespace kestrel {

class KSTFileURL {
 public:
  KSTFileURL() = default;
  explicit KSTFileURL(std::string path, bool isDirectory = false);

  const std::string& path() const { return path_; }
  bool isDirectory() const { return isDirectory_; }
  bool empty() const { return path_.empty(); }
  // The file-system representation handed to POSIX calls.
  const char* fileSystemRepresentation() const { return path_.c_str(); }

  KSTFileURL appending(std::string_view component, bool isDirectory = false) const;
  KSTFileURL deletingLastPathComponent() const;
  // The path deletingLastPathComponent gives, without building a URL.
  static std::string_view parentPath(std::string_view path);
  std::string lastPathComponent() const;

  std::string description() const { return path_; }
  friend bool operator==(const KSTFileURL& a, const KSTFileURL& b) { return a.path_ == b.path_; }
  friend auto operator<=>(const KSTFileURL& a, const KSTFileURL& b) { return a.path_ <=> b.path_; }

 private:
  std::string path_;
  bool isDirectory_ = false;
};

}  // namespace kestrel
