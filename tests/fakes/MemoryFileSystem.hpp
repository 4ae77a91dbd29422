// Files in memory. A power cut takes what was not synced: contents by the file's sync, names by their
// folder's. Unlike a real disk it runs on the test's thread alone, its clock stands still, and it gives a
// freed inode to the next file at once: so only an open file tells two of one size apart.
#pragma once

#include <limits>
#include <map>
#include <set>

#include "platform/linux/FileSystem.hpp"
#include "tests/fakes/Effects.hpp"

namespace fakes {

using namespace platform::linux_;

class MemoryFileSystem : public FileSystem {
 public:
  // Calls are counted; from the `failFrom`th on all fail with `failure`.
  int calls = 0;
  int failFrom = std::numeric_limits<int>::max();
  int failure = EIO;
  std::function<void()> onLock;        // where another process gets its chance: just before a write
  std::function<void()> onFolderSync;  // where another thread gets its chance: a file has just been replaced
  std::set<std::string> unreadable, immovable;  // paths that cannot be opened; or renamed

  // Everything that was not synced is gone, and all works again. Objects of before belong to a dead process.
  void powerCut() {
    for (auto& [path, node] : durable) node->bytes = node->synced;
    now = durable;
    std::erase_if(now, [&](const auto& entry) { return !hasFolder(parentOf(entry.first)); });
    durable = now;
    locks.clear();
    watches.clear();
    pending.clear();
    failFrom = std::numeric_limits<int>::max();
  }
  // The file has these bytes, as a new file put in the old one's place; all names are durable.
  void put(const std::string& path, std::string_view bytes) {
    makeFolders(parentOf(path));
    now[path] = std::make_shared<Node>(inodes);
    now[path]->bytes = now[path]->synced = bytes;
    durable = now;
    pending.push_back(path);
  }
  std::string bytes(const std::string& path) const { return now.at(path)->bytes; }
  bool hasEvents() const { return !pending.empty(); }
  bool exists(const std::string& path) const { return now.contains(path); }
  // With everything in it, as if it had been moved out of sight.
  void removeFolder(const std::string& path) {
    std::erase_if(now, [&](const auto& entry) { return (entry.first + "/").starts_with(path + "/"); });
    pending.push_back(path);
  }
  // Events are held back until now.
  void deliverEvents() {
    for (const std::string& path : std::exchange(pending, {})) {
      for (const Watched& watch : std::vector(watches)) {
        if (watch.token.expired()) continue;
        if (watch.folder == path) watch.changed("");
        if (watch.folder == parentOf(path)) watch.changed(path.substr(watch.folder.size() + 1));
      }
    }
  }

  Result<std::unique_ptr<File>> openToRead(const std::string& path) override {
    if (const int error = unreadable.contains(path) ? EACCES : check(path)) return code(error);
    return open(path);
  }
  // There are none but plain files.
  Result<std::unique_ptr<File>> openUntrusted(const std::string& path) override { return openToRead(path); }
  Result<std::unique_ptr<File>> create(const std::string& path) override {
    const int error = check(path);
    if (error != ENOENT || !hasFolder(parentOf(path))) return code(error != 0 ? error : EEXIST);
    now[path] = std::make_shared<Node>(inodes);
    return open(path);
  }
  Result<FileIdentity> identity(const std::string& path) override {
    if (const int error = check(path)) return code(error);
    return now[path]->identity();
  }
  Result<void> rename(const std::string& from, const std::string& to) override {
    if (const int error = immovable.contains(from) ? EPERM : check(from)) return code(error);
    now[to] = now[from];
    now.erase(from);
    pending.push_back(to);
    return {};
  }
  Result<void> remove(const std::string& path) override {
    if (const int error = check(path)) return code(error);
    now.erase(path);
    pending.push_back(path);
    return {};
  }
  Result<void> syncFolder(const std::string& path) override {
    if (onFolderSync) onFolderSync();
    if (const int error = check(path)) return code(error);
    const auto inFolder = [&](const auto& entry) { return parentOf(entry.first) == path; };
    std::erase_if(durable, inFolder);
    for (const auto& entry : now) {
      if (inFolder(entry)) durable.insert(entry);
    }
    return {};
  }
  Result<void> makeFolder(const std::string& path) override {
    if (const int error = check(path); error != ENOENT) return code(error);
    makeFolders(path);
    return {};
  }
  Result<std::vector<std::string>> list(const std::string& folder) override {
    if (const int error = check(folder)) return code(error);
    std::vector<std::string> names;
    for (const auto& [path, node] : now) {
      if (path != "/" && parentOf(path) == folder) names.push_back(path.substr(path.rfind('/') + 1));
    }
    return names;
  }
  // One that is held cannot be waited for on a single thread.
  Result<std::unique_ptr<FileLock>> lock(const std::string& path) override {
    if (onLock) onLock();
    const int error = check(path);
    if (error != 0 && (error != ENOENT || !hasFolder(parentOf(path)))) return code(error);
    if (error != 0) now[path] = std::make_shared<Node>(inodes);
    if (!locks[path].expired()) return code(EDEADLK);
    auto held = std::make_unique<Held<FileLock>>();
    locks[path] = held->token;
    return std::unique_ptr<FileLock>(std::move(held));
  }
  Result<std::unique_ptr<FolderWatch>> watch(const std::string& folder,
                                             std::function<void(const std::string&)> changed) override {
    if (const int error = unreadable.contains(folder) ? EACCES : check(folder)) return code(error);
    auto held = std::make_unique<Held<FolderWatch>>();
    watches.push_back({held->token, folder, std::move(changed)});
    return std::unique_ptr<FolderWatch>(std::move(held));
  }

 private:
  struct Node {
    explicit Node(std::shared_ptr<std::set<std::uint64_t>> used_) : used(std::move(used_)) {
      while (!used->insert(inode).second) ++inode;
    }
    ~Node() { used->erase(inode); }
    FileIdentity identity() const { return {1, inode, static_cast<std::int64_t>(bytes.size()), 0}; }
    std::string bytes, synced;
    const std::shared_ptr<std::set<std::uint64_t>> used;
    std::uint64_t inode = 1;
  };
  struct OpenFile : File {
    OpenFile(MemoryFileSystem& owner_, std::shared_ptr<Node> node_) : owner(owner_), node(std::move(node_)) {}
    Result<FileIdentity> identity() override {
      if (const int error = owner.count()) return code(error);
      return node->identity();
    }
    Result<std::string> readAll(std::size_t limit) override {
      if (const int error = owner.count()) return code(error);
      if (node->bytes.size() > limit) return platform::Outcome::tooLarge;
      return node->bytes;
    }
    Result<void> writeAll(std::string_view bytes) override {
      const int error = owner.count();
      node->bytes += error != 0 ? bytes.substr(0, bytes.size() / 2) : bytes;  // a failure got half of its way
      return code(error);
    }
    Result<void> sync() override {
      if (const int error = owner.count()) return code(error);
      node->synced = node->bytes;
      return {};
    }
    MemoryFileSystem& owner;
    const std::shared_ptr<Node> node;
  };
  template <class Registration>
  struct Held : Registration {
    const std::shared_ptr<int> token = std::make_shared<int>();
  };
  struct Watched {
    std::weak_ptr<int> token;
    std::string folder;
    std::function<void(const std::string&)> changed;
  };

  static std::error_code code(int error) { return {error, std::system_category()}; }
  static std::string parentOf(const std::string& path) {
    const auto slash = path.rfind('/');
    return slash == 0 ? "/" : path.substr(0, slash);
  }
  bool hasFolder(const std::string& path) const {
    return path == "/" || (now.contains(path) && hasFolder(parentOf(path)));
  }
  void makeFolders(const std::string& path) {
    if (hasFolder(path)) return;
    makeFolders(parentOf(path));
    now[path] = std::make_shared<Node>(inodes);
  }
  std::unique_ptr<File> open(const std::string& path) { return std::make_unique<OpenFile>(*this, now[path]); }
  int count() { return ++calls >= failFrom ? failure : 0; }
  int check(const std::string& path) {
    const int error = count();
    return error != 0 ? error : path == "/" || now.contains(path) ? 0 : ENOENT;
  }

  const std::shared_ptr<std::set<std::uint64_t>> inodes = std::make_shared<std::set<std::uint64_t>>();
  std::map<std::string, std::shared_ptr<Node>> now, durable;  // folders are entries, too
  std::map<std::string, std::weak_ptr<int>> locks;
  std::vector<Watched> watches;
  std::vector<std::string> pending;
};

}  // namespace fakes
