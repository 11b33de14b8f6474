#include "support/scratch_root.h"

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

namespace kestrel::testing {

namespace fs = std::filesystem;

namespace {

// A death test's child runs its test again from the start in a new process,
// and dies without running destructors. Its root goes beneath a directory
// that the parent's root names here ("<pid>:<path>") and removes with itself.
constexpr const char* kChildRootsVariable = "KESTREL_TEST_CHILD_ROOTS";

// The directory named by a parent process, or nothing in the parent itself.
std::string parentsChildRoots() {
  const char* value = std::getenv(kChildRootsVariable);
  if (value == nullptr) return {};
  const std::string_view text(value);
  const std::size_t colon = text.find(':');
  if (colon == std::string_view::npos) return {};
  if (text.substr(0, colon) == std::to_string(::getpid())) return {};
  return std::string(text.substr(colon + 1));
}

}  // namespace

ScratchRoot::ScratchRoot() {
  const std::string childRoots = parentsChildRoots();
  fs::path parent = fs::temp_directory_path();
  if (!childRoots.empty()) {
    parent = childRoots;
    fs::create_directories(parent);
  }
  std::string pattern = (parent / "kestrel-test-XXXXXX").string();
  if (mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("mkdtemp failed");
  path_ = pattern;
  if (childRoots.empty() && std::getenv(kChildRootsVariable) == nullptr) {
    childRoots_ = path_ + ".children";
    const std::string value = std::to_string(::getpid()) + ":" + childRoots_;
    ::setenv(kChildRootsVariable, value.c_str(), 1);
  }
  fs::permissions(path_, fs::perms(0755));
  // The accounts the daemon expects (the same seed the demo uses).
  const fs::path seed = fs::path(KESTREL_SOURCE_DIR) / "tools/scratch-root/etc";
  fs::create_directories(resolve("/etc"));
  fs::copy_file(seed / "passwd", resolve("/etc/passwd"));
  fs::copy_file(seed / "group", resolve("/etc/group"));
  // The directories the demo's roots have too.
  std::ifstream directories(fs::path(KESTREL_SOURCE_DIR) / "tools/scratch-root/directories");
  for (std::string line; std::getline(directories, line);) {
    if (line.empty() || line.front() == '#') continue;
    std::istringstream fields(line);
    std::string path, mode;
    unsigned owner = 0;
    fields >> path >> mode >> owner;
    fs::create_directories(resolve(path));
    fs::permissions(resolve(path), fs::perms(std::stoul(mode, nullptr, 8)));
    if (::chown(resolve(path).c_str(), owner, owner) != 0) {
      throw std::runtime_error("chown of " + path + " failed (tests run as root)");
    }
  }
}

ScratchRoot::~ScratchRoot() {
  const char* keep = std::getenv("KESTREL_KEEP_SCRATCH");
  if (keep != nullptr && std::string_view(keep) == "1") return;
  std::error_code ec;
  fs::remove_all(path_, ec);
  if (!childRoots_.empty()) {
    fs::remove_all(childRoots_, ec);
    ::unsetenv(kChildRootsVariable);
  }
}

void ScratchRoot::writeFile(std::string_view systemPath, std::string_view contents) const {
  const fs::path p = resolve(systemPath);
  fs::create_directories(p.parent_path());
  std::ofstream out(p, std::ios::binary | std::ios::trunc);
  out << contents;
}

std::string ScratchRoot::readFile(std::string_view systemPath) const {
  std::ifstream in(resolve(systemPath), std::ios::binary);
  std::ostringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

bool ScratchRoot::exists(std::string_view systemPath) const {
  std::error_code ec;
  return fs::symlink_status(resolve(systemPath), ec).type() != fs::file_type::not_found;
}

}  // namespace kestrel::testing
