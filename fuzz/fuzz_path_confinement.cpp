// The confinement check over random layouts: directories, files, fifos and
// links (absolute, relative, looping, through other links, with dots), some
// inside the base and some outside, then a random path beneath the base
// string. Whenever the check gives a real path, that path must lie under the
// base's own real path, component by component.
#include <fcntl.h>
#include <fuzzer/FuzzedDataProvider.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <optional>
#include <string>

#include "store/file_manager.h"
#include "support/fuzz_environment.h"

namespace {

using namespace kestrel;
using namespace kestrel::fuzz;
namespace fs = std::filesystem;

// Names worth combining: plain ones, the dot forms, the alias's name, and
// names that only look like dot forms.
constexpr const char* kNames[] = {"a", "b", "sub", ".", "..", "", "private", "a..b", "...", ".x"};

// Where an item of the layout goes: plain names only, and every directory on
// the way a real one (made when missing), so that the harness itself never
// writes through a link it made. Nothing when a component is in the way.
std::optional<std::string> placeItem(FuzzedDataProvider& in, const std::string& top) {
  constexpr const char* kPlain[] = {"a", "b", "sub", "private", "a..b", "...", ".x"};
  std::string path = top;
  const std::size_t depth = in.ConsumeIntegralInRange<std::size_t>(1, 3);
  for (std::size_t i = 0; i < depth; ++i) {
    if (i > 0) {
      struct stat st {};
      if (::lstat(path.c_str(), &st) != 0) {
        if (::mkdir(path.c_str(), 0755) != 0) return std::nullopt;
      } else if (!S_ISDIR(st.st_mode)) {
        return std::nullopt;
      }
    }
    path += "/";
    path += in.PickValueInArray(kPlain);
  }
  return path;
}

std::string drawRelative(FuzzedDataProvider& in, std::size_t maxComponents) {
  std::string path;
  const std::size_t count = in.ConsumeIntegralInRange<std::size_t>(0, maxComponents);
  for (std::size_t i = 0; i < count; ++i) {
    if (i > 0) path += '/';
    path += in.PickValueInArray(kNames);
  }
  return path;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const platform::FilesystemRoot& root = environment();
  FuzzedDataProvider in(data, size);
  const std::string tree = root.resolve("/private/var/fuzz-tree");
  std::error_code ec;
  fs::remove_all(tree, ec);
  const std::string base = tree + "/base";
  const std::string outside = tree + "/outside";
  makeDirectoriesOrDie(base);
  makeDirectoriesOrDie(outside);

  const std::size_t items = in.ConsumeIntegralInRange<std::size_t>(0, 12);
  for (std::size_t i = 0; i < items; ++i) {
    const std::optional<std::string> at = placeItem(in, in.ConsumeBool() ? base : outside);
    if (!at) continue;
    switch (in.ConsumeIntegralInRange<int>(0, 4)) {
      case 0:
        ::mkdir(at->c_str(), 0755);
        break;
      case 1:
        ::close(::open(at->c_str(), O_CREAT | O_EXCL | O_WRONLY | O_NOFOLLOW | O_CLOEXEC, 0644));
        break;
      case 2:
        ::mkfifo(at->c_str(), 0600);
        break;
      case 3:  // relative, possibly climbing
        ::symlink(drawRelative(in, 5).c_str(), at->c_str());
        break;
      default: {  // absolute, into the base, the outside or anywhere
        const std::string target = in.PickValueInArray({base, outside, tree, std::string("/")}) +
                                   "/" + drawRelative(in, 3);
        ::symlink(target.c_str(), at->c_str());
        break;
      }
    }
  }
  const std::string suspicious = base + "/" + drawRelative(in, 6);

  const KSTFileManager& files = KSTFileManager::defaultManager();
  const std::optional<KSTFileURL> real =
      files.realPathForURL(KSTFileURL(suspicious), KSTFileURL(base));
  if (real) {
    char baseReal[PATH_MAX];
    KESTREL_FUZZ_CHECK(::realpath(base.c_str(), baseReal) != nullptr, base);
    const std::string within = std::string(baseReal) + "/";
    KESTREL_FUZZ_CHECK(real->path() == baseReal || real->path().starts_with(within),
                       suspicious + " -> " + real->path());
  }
  return 0;
}
