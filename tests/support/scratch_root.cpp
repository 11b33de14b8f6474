#include "support/scratch_root.h"

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

namespace kestrel::testing {

namespace fs = std::filesystem;

ScratchRoot::ScratchRoot() {
  std::string pattern = (fs::temp_directory_path() / "kestrel-test-XXXXXX").string();
  if (mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("mkdtemp failed");
  path_ = pattern;
  fs::permissions(path_, fs::perms(0755));
  // The accounts the daemon expects (the same seed the demo uses).
  const fs::path seed = fs::path(KESTREL_SOURCE_DIR) / "tools/scratch-root/etc";
  fs::create_directories(resolve("/etc"));
  fs::copy_file(seed / "passwd", resolve("/etc/passwd"));
  fs::copy_file(seed / "group", resolve("/etc/group"));
  fs::create_directories(resolve("/private/var/mobile"));
  // Where death row puts what it cannot remove.
  fs::create_directories(resolve("/tmp"));
  fs::permissions(resolve("/tmp"), fs::perms(01777));
  fs::create_directories(resolve("/private/var/mobile2"));
  if (::chown(resolve("/private/var/mobile").c_str(), 501, 501) != 0 ||
      ::chown(resolve("/private/var/mobile2").c_str(), 502, 502) != 0) {
    throw std::runtime_error("chown of the mobile homes failed (tests run as root)");
  }
}

ScratchRoot::~ScratchRoot() {
  const char* keep = std::getenv("KESTREL_KEEP_SCRATCH");
  if (keep != nullptr && std::string_view(keep) == "1") return;
  std::error_code ec;
  fs::remove_all(path_, ec);
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
