#include "hearthd/LifeLock.hpp"

#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <system_error>

#include "hearthd/ProcessHandle.hpp"

namespace hearth {
namespace {

namespace fs = std::filesystem;
using platform::linux_::UniqueDescriptor;

// Calls `visit` with each entry; processes and descriptors may vanish meanwhile, and others' may not be read.
template <class Visit>
void forEachEntry(const fs::path& folder, Visit visit) {
  std::error_code error;
  for (fs::directory_iterator entry(folder, error), end; !error && entry != end; entry.increment(error)) {
    visit(entry->path());
  }
}

bool holds(const fs::path& process, const struct stat& file) {
  bool found = false;
  forEachEntry(process / "fd", [&](const fs::path& descriptor) {
    struct stat status {};
    if (::stat(descriptor.c_str(), &status) != 0) return;
    if (status.st_dev == file.st_dev && status.st_ino == file.st_ino) found = true;
  });
  return found;
}

}  // namespace

std::vector<UniqueDescriptor> endHolders(const std::string& path) {
  std::vector<UniqueDescriptor> ended;
  struct stat file {};
  if (::stat(path.c_str(), &file) != 0) return ended;
  forEachEntry("/proc", [&](const fs::path& process) {
    const pid_t pid = std::atoi(process.filename().c_str());  // NOLINT(cert-err34-c): 0 where it is no number
    if (pid <= 0 || pid == ::getpid()) return;
    // The handle first: what is then found to hold the file is what the handle stands for, or has ended.
    UniqueDescriptor handle = openProcess(pid);
    if (!handle || !holds(process, file)) return;
    if (signalProcess(handle, SIGKILL) == 0) ended.push_back(std::move(handle));
  });
  return ended;
}

}  // namespace hearth
