#include "tools/hearthctl/Settings.hpp"

#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <utility>

#include "platform/NotificationCentre.hpp"
#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/Json.hpp"
#include "platform/linux/LinuxEnvironment.hpp"
#include "platform/linux/ReplicaFileCloudStore.hpp"
#include "platform/linux/SettingsDocument.hpp"
#include "platform/linux/SettingsFile.hpp"
#include "tools/StoredSettings.hpp"

namespace tools {
namespace {

using pairwell::KeyValueSource;
using platform::Dictionary;
using platform::Outcome;
using platform::Result;
using platform::Value;
using platform::linux_::SettingsFile;

template <class Number>
std::optional<Number> whole(const std::string& text) {
  Number number{};
  const char* end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, number);
  return error == std::errc() && stop == end ? std::optional(number) : std::nullopt;
}

// What is done with a cloud store lasts no longer than one call; nobody hears its notifications.
struct Cloud {
  Cloud(platform::linux_::FileSystem& files, const std::string& path)
      : store(platform::linux_::ReplicaFileCloudStore::create(files, nullptr, centre, clock, path)) {}
  platform::NotificationCentre centre;
  platform::linux_::LinuxClock clock;
  const std::shared_ptr<platform::linux_::ReplicaFileCloudStore> store;
};

// A private copy for the editor. A fixed folder: its name needs no quoting in the editor's command.
Result<std::string> makeCopy(const std::string& text) {
  std::string path = "/tmp/hearthctl-XXXXXX.json";
  const int descriptor = ::mkstemps(path.data(), 5);
  if (descriptor < 0) return std::error_code(errno, std::system_category());
  ::close(descriptor);
  std::ofstream file(path);
  file << text;
  file.close();
  if (!file) return std::make_error_code(std::errc::io_error);
  return path;
}

bool runEditor(const std::string& path) {
  std::string editor = "vi";
  for (const char* name : {"EDITOR", "VISUAL"}) {
    if (const char* value = std::getenv(name); value && *value) editor = value;
  }
  return std::system((editor + " " + path).c_str()) == 0;
}

}  // namespace

std::optional<Value> valueFromText(const std::string& text, const std::string& type) {
  const auto mayBe = [&](const char* name) { return type.empty() || type == name; };
  if (mayBe("bool") && (text == "true" || text == "false")) return Value(text == "true");
  if (const auto number = whole<std::int64_t>(text); mayBe("int") && number) return Value(*number);
  // "inf" is a text unless it is said to be a number.
  if (const auto number = whole<double>(text);
      mayBe("double") && number && (!type.empty() || std::isfinite(*number)))
    return Value(*number);
  return mayBe("string") ? std::optional(Value(text)) : std::nullopt;
}

Result<Dictionary> parseObject(std::string_view text, std::string& problem) {
  auto value = platform::linux_::parseJson(text, problem);
  if (!value) return value.error();
  if (auto* object = std::get_if<Dictionary>(&value->storage)) return std::move(*object);
  problem = "line 1, column 1: not an object";
  return Outcome::malformedFile;
}

Settings::Settings(const platform::linux_::Paths& paths_, KeyValueSource source_,
                   platform::linux_::FileSystem& files_, Hearth& hearth_)
    : paths(paths_), source(source_), path(settingsPath(paths_, source_)), files(files_), hearth(hearth_) {}

Result<Dictionary> Settings::values(std::string& problem) const {
  auto stored = storedValues(files, paths, source, problem);
  if (stored || stored.error() == Outcome::malformedFile) return stored;
  const std::string aside = path + ".damaged-1";
  const bool isMissing = stored.error() == std::errc::no_such_file_or_directory;
  if (isMissing && !files.identity(aside)) return Dictionary();
  // A running daemon still holds its last good contents, which a new file would take from it.
  problem = isMissing ? "was damaged, and is now " + aside +
                            ": mend that, remove its checksum line and move it back, or delete it"
                      : stored.error().message();
  return stored;
}

Exit Settings::list(Output& output) const {
  std::string problem;
  const auto all = values(problem);
  if (!all) return say(path + ": " + problem), failed;
  for (const auto& [key, value] : *all) {
    output.add({{"key", key}, {"value", value}}, {key, platform::describe(value)});
  }
  output.print();
  return done;
}

Exit Settings::get(Output& output, const std::string& key) const {
  std::string problem;
  const auto all = values(problem);
  if (!all) return say(path + ": " + problem), failed;
  const auto found = all->find(key);
  if (found == all->end()) return failed;
  output.add({{"key", key}, {"value", found->second}}, {platform::describe(found->second)});
  output.print();
  return done;
}

Exit Settings::set(const std::string& key, const std::optional<Value>& value) {
  // A write would move a damaged file aside and begin an empty one, which would take from a running daemon
  // the good contents that it holds.
  std::string problem;
  if (const auto there = values(problem); !there) {
    const bool isDamaged = there.error() == Outcome::malformedFile;
    say(path + ": " + problem + "; nothing is changed" +
        (isDamaged ? ". To mend it: hearthctl settings edit " + std::string(platform::rawValue(source))
                   : ""));
    return failed;
  }
  return finish(write(key, value));
}

Result<void> Settings::write(const std::string& key, const std::optional<Value>& value) {
  if (source == KeyValueSource::cloud) return Cloud(files, path).store->write(value, key);
  return SettingsFile::create(files, path)->setValue(key, value);
}

Exit Settings::finish(const Result<void>& written) {
  if (!written) return fail(path, written.error());
  if (source == KeyValueSource::root) hearth.announceRootChange();
  return done;
}

// People edit the values alone; a damaged file they get as it is.
Exit Settings::edit() {
  std::string problem;
  const auto before = values(problem);
  auto text = before ? platform::linux_::printJson(*before, platform::linux_::JsonStyle::indented)
                     : Result<std::string>(before.error());
  if (text) *text += "\n";
  if (!text && text.error() == Outcome::malformedFile) {
    say(path + ": " + problem + "; the copy to mend is the whole file");
    text = platform::linux_::readFile(files, path, SettingsFile::sizeLimit);
  }
  if (!text) return say(path + ": " + problem), failed;
  const auto copy = makeCopy(*text);
  if (!copy) return fail("/tmp", copy.error());
  const Exit exit = takeEdited(*copy, *text, before);
  if (exit == done) {
    static_cast<void>(files.remove(*copy));
  } else {
    say(*copy + ": the copy stays here; nothing is changed");
  }
  return exit;
}

Exit Settings::takeEdited(const std::string& copy, const std::string& text,
                          const Result<Dictionary>& before) {
  if (!runEditor(copy)) return say("the editor failed"), failed;
  const auto edited = platform::linux_::readFile(files, copy, SettingsFile::sizeLimit);
  if (!edited) return fail(copy, edited.error());
  if (*edited == text) return say(path + ": nothing is changed"), done;
  std::string problem;
  const auto after =
      before ? parseObject(*edited, problem) : platform::linux_::decodeEditedSettings(*edited, problem);
  if (!after) return say(copy + ": " + problem), failed;
  return finish(before ? install(*before, *after) : installWhole(*after));
}

Result<void> Settings::install(const Dictionary& before, const Dictionary& after) {
  if (source == KeyValueSource::cloud) {
    const Cloud cloud(files, path);
    Dictionary next = cloud.store->dictionaryRepresentation();
    platform::linux_::carryOver(before, after, next);
    return cloud.store->replaceValues(next);
  }
  return SettingsFile::create(files, path)->update([&](Dictionary& document) {
    platform::linux_::carryOver(before, after, platform::linux_::settingsValues(document));
    return true;
  });
}

Result<void> Settings::installWhole(const Dictionary& document) {
  return SettingsFile::create(files, path)->update([&](Dictionary& whole) {
    whole = document;
    return true;
  });
}

}  // namespace tools
