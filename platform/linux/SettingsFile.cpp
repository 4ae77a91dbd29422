#include "platform/linux/SettingsFile.hpp"

#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/SettingsDocument.hpp"

namespace platform::linux_ {
namespace {

const Logger& log() {
  static const Logger logger = hearthLog("files");
  return logger;
}

bool isMissing(std::error_code error) { return error == std::errc::no_such_file_or_directory; }

// A `problem` is damage; an error without one says that the file cannot be read.
Result<SettingsFile::Document> readDocument(File& file, std::string& problem) {
  const auto text = file.readAll(SettingsFile::sizeLimit);
  if (!text && text.error() == Outcome::tooLarge)
    problem = "larger than " + std::to_string(SettingsFile::sizeLimit) + " bytes";
  auto decoded = text ? decodeSettings(*text, problem) : Result<Dictionary>(text.error());
  if (!decoded) return decoded.error();
  return std::make_shared<const Dictionary>(std::move(*decoded));
}

}  // namespace

std::shared_ptr<SettingsFile> SettingsFile::create(FileSystem& files, std::string path) {
  return std::shared_ptr<SettingsFile>(new SettingsFile(files, std::move(path)));
}

SettingsFile::SettingsFile(FileSystem& files_, std::string path_)
    : files(files_), path(std::move(path_)), document(std::make_shared<const Dictionary>()) {}

Result<SettingsFile::Document> SettingsFile::read() {
  Result<void> fresh;
  bool isDamaged;
  {
    std::lock_guard lock(mutex);
    if (delivery && !watch) tryToWatch();
    fresh = refresh();
    isDamaged = fresh && !damage.empty() && !damageStays;
  }
  if (isDamaged) clearDamage();
  std::lock_guard lock(mutex);
  recordFailure(fresh ? std::error_code() : fresh.error());
  if (!fresh) return fresh.error();
  return document;
}

// What changed while nothing could be read has not been reported, and its event has passed: so a failure, and
// the end of one, are looked at again.
void SettingsFile::recordFailure(const std::error_code& error) {
  if (std::exchange(failure, error) == error) return;
  if (error) log().error("%s: cannot be read: %s", path, error.message());
  if (delivery) lookLater();
}

SettingsFile::Document SettingsFile::contents() {
  const auto current = read();
  std::lock_guard lock(mutex);
  return current ? *current : document;
}

Result<void> SettingsFile::refresh() {
  const auto current = files.identity(path);
  if (current && held.file && *current == held.identity) return {};
  const auto loaded = current ? load() : Result<void>(current.error());
  if (loaded || !isMissing(loaded.error())) return loaded;
  held = {};
  // Whoever moved it aside: this process has seen that it was damaged.
  if (!std::exchange(damage, "").empty()) lastGoodInForce = true;
  if (!lastGoodInForce && !document->empty()) document = std::make_shared<const Dictionary>();
  return {};
}

Result<void> SettingsFile::load() {
  auto there = linux_::hold(files, path);
  if (!there) return there.error();
  std::string problem;
  const auto loaded = readDocument(*there->file, problem);
  if (!loaded && problem.empty()) return loaded.error();
  hold(std::move(*there), loaded ? *loaded : nullptr);
  damage = loaded ? "" : problem;
  return {};
}

void SettingsFile::hold(HeldFile file, Document contents) {
  held = std::move(file);
  damage.clear();
  damageStays = false;
  if (!contents) return;
  document = std::move(contents);
  lastGoodInForce = false;
}

// Only under the file's lock, and after another look: between the two a writer may have put a good file
// there.
void SettingsFile::clearDamage() {
  const auto fileLock = lockForWriting();
  std::lock_guard lock(mutex);
  if (!fileLock) {
    log().error("%s: %s; cannot be moved aside: %s", path, damage, fileLock.error().message());
    damageStays = true;
  } else if (refresh() && !damage.empty()) {
    moveAside();
  }
}

void SettingsFile::moveAside() {
  const auto moved = linux_::moveAside(files, path);
  damageStays = !moved;
  if (!moved) {
    log().error("%s: %s; cannot be moved aside: %s", path, damage, moved.error().message());
    return;
  }
  log().error("%s: %s; moved to %s. To use it, mend it, remove its checksum line, and move it back", path,
              damage, *moved);
  damage.clear();
  held = {};
  lastGoodInForce = true;
}

// A file that is there is proof that its folders are durable: they are made so before it is.
Result<std::unique_ptr<FileLock>> SettingsFile::lockForWriting() {
  if (!files.identity(path)) {
    if (const auto made = makeFolderDurably(files, folderOf(path)); !made) return made.error();
  }
  return files.lock(path + ".lock");
}

Result<void> SettingsFile::update(const std::function<bool(Dictionary& document)>& change) {
  const auto fileLock = lockForWriting();
  if (!fileLock) return fileLock.error();
  Document before;
  bool again;
  {
    std::lock_guard lock(mutex);
    if (const auto fresh = refresh(); !fresh) return fresh;
    if (!damage.empty()) moveAside();
    if (!damage.empty()) return Outcome::malformedFile;
    before = document;
    again = unsynced;
    writing = true;
  }
  Dictionary next = *before;
  const bool differs = change(next);
  if (!differs) next = *before;
  auto written = differs || again ? write(next) : Written{before, {}};
  const Result<void> outcome = written;
  finishWrite(before, next, std::move(written));
  return outcome;
}

Result<SettingsFile::Written> SettingsFile::write(const Dictionary& next) {
  const auto text = encodeSettings(next);
  if (!text) return text.error();
  // What could not be read back is not written: keys, say, that are one after invalid UTF-8 has been
  // replaced.
  std::string problem;
  if (text->size() > sizeLimit) return Outcome::tooLarge;
  auto back = decodeSettings(*text, problem);
  if (!back) return back.error();
  auto made = replaceFile(files, path, *text);
  if (!made) return made.error();
  return Written{std::make_shared<const Dictionary>(std::move(*back)), std::move(*made)};
}

void SettingsFile::finishWrite(const Document& before, const Dictionary& next, Result<Written> written) {
  bool looks = false;
  {
    std::lock_guard lock(mutex);
    writing = false;
    unsynced = !written;
    if (written && written->made.file) hold(std::move(written->made), written->document);
    const auto fresh = refresh();  // somebody may have replaced it since
    if (reported && written && reported == before && document == written->document) {
      reported = document;  // as nearly always: there is nothing but the own change
    } else if (reported) {
      looks = recordOwnChange(*before, next, written.has_value());
    }
    // Nobody has looked meanwhile.
    looks = looks || (reported && (!fresh || !damage.empty()));
  }
  if (looks) lookLater();
}

void SettingsFile::lookLater() {
  delivery->async([weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->look();
  });
}

// Whether what is stored now differs by more than the own change from what was reported. A write that failed
// after its rename has changed the file, too.
bool SettingsFile::recordOwnChange(const Dictionary& before, const Dictionary& next, bool written) {
  if (written || sameValue(*document, next)) {
    Dictionary known = *reported;
    carryOver(before, next, known);
    reported = std::make_shared<const Dictionary>(std::move(known));
  }
  if (!sameValue(*reported, *document)) return true;
  reported = document;
  return false;
}

Result<void> SettingsFile::setValue(std::string_view key, const std::optional<Value>& value) {
  return update([&](Dictionary& whole) {
    Dictionary& values = settingsValues(whole);
    const auto found = values.find(key);
    if (found == values.end() ? !value : value && sameValue(found->second, *value)) return false;
    if (value) {
      values.insert_or_assign(std::string(key), *value);
    } else {
      values.erase(found);
    }
    return true;
  });
}

bool SettingsFile::startWatching(WorkQueue& delivery_, Changed changed_) {
  changed = std::move(changed_);
  {
    std::lock_guard lock(mutex);
    delivery = &delivery_;
    tryToWatch();
  }
  // After the watch has begun, and what is in force by then: a change of the meantime, which look() could not
  // report yet, is read, not told.
  static_cast<void>(contents());
  std::lock_guard lock(mutex);
  reported = document;
  return watch != nullptr;
}

void SettingsFile::tryToWatch() {
  const std::string folder = folderOf(path);
  const auto made = files.makeFolder(folder);
  auto begun = made ? files.watch(folder,
                                  [weak = weak_from_this()](const std::string&) {
                                    if (const auto self = weak.lock()) self->look();
                                  })
                    : Result<std::unique_ptr<FolderWatch>>(made.error());
  const auto previous = std::exchange(watchFailure, begun ? std::error_code() : begun.error());
  if (begun) {
    watch = std::move(*begun);
    if (previous) lookLater();  // what came meanwhile
  } else if (watchFailure != previous) {
    log().error("%s: changes by others will not be noticed: %s", folder, watchFailure.message());
  }
}

// Compares instead of trusting events: they merge, overflow, and come for own writes, too.
void SettingsFile::look() {
  // The file may hold an own change that is not recorded yet. Its writer looks for others' when it is.
  if (std::lock_guard lock(mutex); writing) return;
  static_cast<void>(contents());
  Document before, after;
  {
    std::lock_guard lock(mutex);
    if (writing || !reported) return;
    before = std::exchange(reported, document);
    after = document;
  }
  if (before != after && !sameValue(*before, *after)) changed(*before, *after);
}

}  // namespace platform::linux_
