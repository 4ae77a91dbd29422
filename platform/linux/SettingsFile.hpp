// One store in one JSON file, which several processes read and write.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>

#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/WorkQueue.hpp"
#include "platform/linux/FileSystem.hpp"

namespace platform::linux_ {

// Any thread; one a file and process. A missing file is an empty one; its folder is made when it is needed.
//
// What does not parse or does not match its checksum is moved aside, never overwritten; the last good
// contents then stay in force while the process lives, and the next write is made on top of them.
class SettingsFile : public std::enable_shared_from_this<SettingsFile> {
 public:
  // A file's contents without the checksum; never null.
  using Document = std::shared_ptr<const Dictionary>;
  // On the delivery thread, no lock held.
  using Changed = std::function<void(const Dictionary& before, const Dictionary& after)>;

  static constexpr std::size_t sizeLimit = 4 << 20;  // four times what an account may hold

  // `files` outlives the object.
  static std::shared_ptr<SettingsFile> create(FileSystem& files, std::string path);

  // What is stored at this moment. Takes the file's lock only to move damage aside; an error only where the
  // file cannot be read at all, which is logged (once, until it is another).
  Result<Document> read();
  // The same, but then the last good contents answer.
  Document contents();

  // Runs `change` on what is stored, and makes the outcome durable unless it answers false; no other process
  // writes in between. On failure the old contents are whole.
  Result<void> update(const std::function<bool(Dictionary& document)>& change);
  // An update of one key of "values"; no value removes it.
  Result<void> setValue(std::string_view key, const std::optional<Value>& value);

  // Once. From now on `changed` hears of what others wrote, once, and of nothing that this object wrote.
  // `delivery`, on whose thread the file system reports, outlives the object. False after a failure, which is
  // logged: reports stay away until a read, which tries again, meets no failure.
  bool startWatching(WorkQueue& delivery, Changed changed);

 private:
  SettingsFile(FileSystem& files, std::string path);
  Result<std::unique_ptr<FileLock>> lockForWriting();
  struct Written {
    Document document;
    HeldFile made;  // none where there was nothing to write
  };
  Result<Written> write(const Dictionary& next);
  void finishWrite(const Document& before, const Dictionary& next, Result<Written> written);
  void clearDamage();
  void look();
  void lookLater();
  // `mutex` held:
  void tryToWatch();
  void recordFailure(const std::error_code& error);
  Result<void> refresh();
  Result<void> load();
  void hold(HeldFile file, Document contents);
  void moveAside();
  bool recordOwnChange(const Dictionary& before, const Dictionary& next, bool written);

  FileSystem& files;
  const std::string path;
  Changed changed;  // set before the watch begins

  // Guards the rest. The file's lock is taken first, if both are needed: a reader, who needs only this one,
  // must not wait for a writer in another process.
  std::mutex mutex;
  WorkQueue* delivery = nullptr;  // null without a wish to watch
  Document document;
  HeldFile held;                 // that `document`, or `damage`, came from; its inode is not reused meanwhile
  std::string damage;            // what is wrong with the held file
  bool damageStays = false;      // it could not be moved
  bool lastGoodInForce = false;  // the file is missing because it was damaged
  std::error_code failure;       // of the last read
  std::error_code watchFailure;  // of the last attempt to watch
  bool writing = false;
  bool unsynced = false;  // the last write failed, perhaps after its rename
  Document reported;      // what `changed` has heard of, own writes included; null without a wish to watch

  std::unique_ptr<FolderWatch> watch;  // ends first
};

}  // namespace platform::linux_
