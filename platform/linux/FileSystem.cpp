#include "platform/linux/FileSystem.hpp"

#include <utility>

namespace platform::linux_ {
namespace {

Result<void> writeNew(FileSystem& files, const std::string& path, std::string_view bytes) {
  auto file = files.create(path);
  if (!file && file.error() == std::errc::file_exists) {
    // Left by a writer that was cut off: the caller's lock says that nobody writes it now.
    if (const auto removed = files.remove(path); !removed) return removed;
    file = files.create(path);
  }
  if (!file) return file.error();
  if (const auto written = (*file)->writeAll(bytes); !written) return written;
  return (*file)->sync();
}

}  // namespace

std::string folderOf(const std::string& path) {
  const auto slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

Result<HeldFile> hold(FileSystem& files, const std::string& path) {
  auto file = files.openToRead(path);
  if (!file) return file.error();
  const auto identity = (*file)->identity();
  if (!identity) return identity.error();
  return HeldFile{std::move(*file), *identity};
}

Result<std::string> readFile(FileSystem& files, const std::string& path, std::size_t limit) {
  const auto file = files.openToRead(path);
  if (!file) return file.error();
  return (*file)->readAll(limit);
}

Result<void> makeFolderDurably(FileSystem& files, const std::string& folder) {
  if (const auto made = files.makeFolder(folder); !made) return made;
  for (std::string path = folder; path != folderOf(path); path = folderOf(path)) {
    const auto synced = files.syncFolder(folderOf(path));
    // What may not be opened was not made here, either; nor was anything above it.
    if (!synced && synced.error() == std::errc::permission_denied) break;
    if (!synced && synced.error() != std::errc::read_only_file_system) return synced;
  }
  return {};
}

Result<std::string> moveAside(FileSystem& files, const std::string& path) {
  for (int number = 1;; ++number) {
    const std::string aside = path + ".damaged-" + std::to_string(number);
    const auto there = files.identity(aside);
    if (there) continue;
    if (there.error() != std::errc::no_such_file_or_directory) return there.error();
    if (const auto moved = files.rename(path, aside); !moved) return moved.error();
    return aside;
  }
}

Result<HeldFile> replaceFile(FileSystem& files, const std::string& path, std::string_view bytes) {
  const std::string temporary = path + ".new";
  const auto written = writeNew(files, temporary, bytes);
  // Opened anew: to let go of one that was written to is an event for whoever watches the folder.
  auto made = written ? hold(files, temporary) : Result<HeldFile>(written.error());
  const auto renamed = made ? files.rename(temporary, path) : Result<void>(made.error());
  if (!renamed) {
    static_cast<void>(files.remove(temporary));  // the first failure is the one to tell
    return renamed.error();
  }
  if (const auto synced = files.syncFolder(folderOf(path)); !synced) return synced.error();
  return made;
}

}  // namespace platform::linux_
