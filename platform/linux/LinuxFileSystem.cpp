#include "platform/linux/LinuxFileSystem.hpp"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <mutex>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace platform::linux_ {
namespace {

Result<void> answer(int result) {
  if (result < 0) return lastError();
  return {};
}

FileIdentity identityOf(const struct stat& status) {
  return {status.st_dev, status.st_ino, status.st_size,
          std::int64_t{status.st_mtim.tv_sec} * 1'000'000'000 + status.st_mtim.tv_nsec};
}

class LinuxFile : public File {
 public:
  explicit LinuxFile(UniqueDescriptor descriptor_) : descriptor(std::move(descriptor_)) {}

  Result<FileIdentity> identity() override {
    struct stat status {};
    if (::fstat(descriptor.get(), &status) < 0) return lastError();
    return identityOf(status);
  }

  Result<std::string> readAll(std::size_t limit) override {
    std::string bytes;
    char buffer[16 * 1024];
    for (;;) {
      const ssize_t count = retried(
          [&] { return ::pread(descriptor.get(), buffer, sizeof buffer, static_cast<off_t>(bytes.size())); });
      if (count < 0) return lastError();
      if (count == 0) return bytes;
      bytes.append(buffer, static_cast<std::size_t>(count));
      if (bytes.size() > limit) return Outcome::tooLarge;
    }
  }

  Result<void> writeAll(std::string_view bytes) override {
    while (!bytes.empty()) {
      const ssize_t count = retried([&] { return ::write(descriptor.get(), bytes.data(), bytes.size()); });
      if (count < 0) return lastError();
      bytes.remove_prefix(static_cast<std::size_t>(count));
    }
    return {};
  }

  Result<void> sync() override {
    return answer(retried([&] { return ::fsync(descriptor.get()); }));
  }

 private:
  const UniqueDescriptor descriptor;
};

class LinuxFileLock : public FileLock {
 public:
  explicit LinuxFileLock(UniqueDescriptor descriptor_) : descriptor(std::move(descriptor_)) {}

 private:
  const UniqueDescriptor descriptor;
};

UniqueDescriptor openDescriptor(const std::string& path, int flags) {
  return UniqueDescriptor(retried([&] { return ::open(path.c_str(), flags | O_CLOEXEC, 0600); }));
}

Result<std::unique_ptr<File>> openFile(const std::string& path, int flags) {
  // Non-blocking: a pipe in a file's place must not hold up the daemon.
  UniqueDescriptor descriptor = openDescriptor(path, O_RDONLY | O_NONBLOCK | flags);
  if (!descriptor) return lastError();
  return std::unique_ptr<File>(std::make_unique<LinuxFile>(std::move(descriptor)));
}

constexpr std::uint32_t folderEvents =
    IN_MOVED_TO | IN_MOVED_FROM | IN_CLOSE_WRITE | IN_DELETE | IN_MOVE_SELF | IN_DELETE_SELF | IN_ONLYDIR;
constexpr std::uint32_t parentEvents = IN_MOVED_TO | IN_CREATE | IN_ONLYDIR;

// A watch follows a renamed folder, not its name. So the parent is watched, too, and says when a folder of
// the name is there again.
class Watched {
 public:
  Watched(std::string folder_, std::function<void(const std::string&)> changed_)
      : folder(std::move(folder_)),
        inotify(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK)),
        changed(std::move(changed_)) {}

  Result<void> begin() {
    if (!inotify) return lastError();
    const std::filesystem::path path(folder);
    parent = ::inotify_add_watch(inotify.get(), path.parent_path().c_str(), parentEvents);
    if (parent < 0 || !watchFolder()) return lastError();
    return {};
  }

  int descriptor() const { return inotify.get(); }

  void readEvents() {
    alignas(inotify_event) char buffer[16 * 1024];
    for (;;) {
      const ssize_t count = retried([&] { return ::read(inotify.get(), buffer, sizeof buffer); });
      if (count <= 0) return;
      for (const char* at = buffer; at < buffer + count;) {
        const auto* event = reinterpret_cast<const inotify_event*>(at);
        at += sizeof(inotify_event) + event->len;
        handle(*event, event->len > 0 ? event->name : "");
      }
    }
  }

  // Waits for a report that is under way, but for one that ends the watch itself.
  void end() {
    std::lock_guard lock(mutex);
    changed = nullptr;
  }

  EventSource source;  // the loop's thread

 private:
  bool watchFolder() {
    current = ::inotify_add_watch(inotify.get(), folder.c_str(), folderEvents);
    return current >= 0;
  }

  // Where it is not there, its parent will tell when it is.
  void watchAgain() {
    if (watchFolder() || errno == ENOENT) return;
    hearthLog("files").error("%s: changes by others will not be noticed: %s", folder, lastError().message());
  }

  void handle(const inotify_event& event, const std::string& name) {
    if (event.mask & IN_Q_OVERFLOW) {
      report("");
    } else if (event.wd == parent) {
      if (name != std::filesystem::path(folder).filename()) return;
      watchAgain();
      report("");
    } else if (event.wd == current) {
      if (event.mask & IN_MOVE_SELF) {
        // It may have moved to its name, in place of a link to it: it was watched before its parent told.
        ::inotify_rm_watch(inotify.get(), current);
        watchAgain();
      }
      const bool all = (event.mask & (IN_MOVE_SELF | IN_DELETE_SELF | IN_UNMOUNT)) != 0;
      if (all || !name.empty()) report(all ? "" : name);
    }
  }

  void report(const std::string& name) {
    std::lock_guard lock(mutex);
    if (const auto call = changed) call(name);
  }

  const std::string folder;
  const UniqueDescriptor inotify;
  int parent = -1;
  int current = -1;
  std::recursive_mutex mutex;                       // held during a report, which may end the watch
  std::function<void(const std::string&)> changed;  // guarded by `mutex`
};

class LinuxFolderWatch : public FolderWatch {
 public:
  LinuxFolderWatch(EventLoop& delivery_, std::shared_ptr<Watched> watched_)
      : delivery(delivery_), watched(std::move(watched_)) {
    delivery.async([&loop = delivery, watched = watched] {
      watched->source = loop.watchDescriptor(watched->descriptor(), EPOLLIN,
                                             [weak = std::weak_ptr(watched)](std::uint32_t) {
                                               if (const auto self = weak.lock()) self->readEvents();
                                             });
    });
  }
  ~LinuxFolderWatch() override {
    watched->end();
    delivery.async([watched = watched] { watched->source = EventSource(); });
  }

 private:
  EventLoop& delivery;
  const std::shared_ptr<Watched> watched;
};

}  // namespace

Result<std::unique_ptr<File>> LinuxFileSystem::openToRead(const std::string& path) {
  return openFile(path, 0);
}

Result<std::unique_ptr<File>> LinuxFileSystem::openUntrusted(const std::string& path) {
  struct stat status {};
  if (::lstat(path.c_str(), &status) < 0) return lastError();
  // Before it is opened, which is enough to set some devices going.
  if (!S_ISREG(status.st_mode)) return Outcome::notPermitted;
  return openFile(path, O_NOFOLLOW);
}

Result<std::unique_ptr<File>> LinuxFileSystem::create(const std::string& path) {
  UniqueDescriptor descriptor = openDescriptor(path, O_WRONLY | O_CREAT | O_EXCL);
  if (!descriptor) return lastError();
  return std::unique_ptr<File>(std::make_unique<LinuxFile>(std::move(descriptor)));
}

Result<FileIdentity> LinuxFileSystem::identity(const std::string& path) {
  struct stat status {};
  if (::stat(path.c_str(), &status) < 0) return lastError();
  return identityOf(status);
}

Result<void> LinuxFileSystem::rename(const std::string& from, const std::string& to) {
  return answer(::rename(from.c_str(), to.c_str()));
}

Result<void> LinuxFileSystem::remove(const std::string& path) { return answer(::unlink(path.c_str())); }

Result<void> LinuxFileSystem::syncFolder(const std::string& path) {
  const UniqueDescriptor folder = openDescriptor(path, O_RDONLY | O_DIRECTORY);
  if (!folder) return lastError();
  const auto synced = answer(retried([&] { return ::fsync(folder.get()); }));
  // A file system that has no such thing for folders, as some shared ones, keeps its names in its own way.
  if (!synced && synced.error() == std::errc::invalid_argument) return {};
  return synced;
}

Result<void> LinuxFileSystem::makeFolder(const std::string& path) {
  const std::filesystem::path parent = std::filesystem::path(path).parent_path();
  if (!parent.empty() && ::access(parent.c_str(), F_OK) < 0) {
    if (const auto made = makeFolder(parent.string()); !made) return made;
  }
  if (::mkdir(path.c_str(), 0700) < 0 && errno != EEXIST) return lastError();
  return {};
}

Result<std::vector<std::string>> LinuxFileSystem::list(const std::string& folder) {
  std::error_code error;
  std::vector<std::string> names;
  for (std::filesystem::directory_iterator entry(folder, error), end; !error && entry != end;
       entry.increment(error)) {
    names.push_back(entry->path().filename().string());
  }
  if (error) return error;
  std::sort(names.begin(), names.end());
  return names;
}

Result<std::unique_ptr<FileLock>> LinuxFileSystem::lock(const std::string& path) {
  UniqueDescriptor descriptor = openDescriptor(path, O_RDONLY | O_CREAT | O_NONBLOCK);
  if (!descriptor) return lastError();
  if (retried([&] { return ::flock(descriptor.get(), LOCK_EX); }) < 0) return lastError();
  return std::unique_ptr<FileLock>(std::make_unique<LinuxFileLock>(std::move(descriptor)));
}

Result<std::unique_ptr<FolderWatch>> LinuxFileSystem::watch(
    const std::string& folder, std::function<void(const std::string& name)> changed) {
  if (!delivery) return std::make_error_code(std::errc::not_supported);
  auto watched = std::make_shared<Watched>(folder, std::move(changed));
  if (const auto begun = watched->begin(); !begun) return begun.error();
  return std::unique_ptr<FolderWatch>(std::make_unique<LinuxFolderWatch>(*delivery, std::move(watched)));
}

}  // namespace platform::linux_
