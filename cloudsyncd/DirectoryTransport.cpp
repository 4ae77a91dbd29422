#include "cloudsyncd/DirectoryTransport.hpp"

#include <set>
#include <utility>

#include "cloudsyncd/core/Document.hpp"
#include "platform/LogSink.hpp"

namespace cloudsync {
namespace {

using platform::Outcome;
using platform::Result;

// An account's devices are a few; this bounds what a folder full of strangers' files can cost.
constexpr std::size_t devicesRead = 256;
constexpr std::string_view ending = ".json";

// Absent for what is no document: temporary files, files of other programs.
std::optional<std::string> deviceOf(const std::string& file) {
  if (!file.ends_with(ending)) return std::nullopt;
  std::string device = file.substr(0, file.size() - ending.size());
  return isName(device) ? std::optional(std::move(device)) : std::nullopt;
}

bool isMissing(const std::error_code& error) { return error == std::errc::no_such_file_or_directory; }

}  // namespace

std::shared_ptr<DirectoryTransport> DirectoryTransport::create(platform::linux_::FileSystem& files,
                                                               platform::WorkQueue& queue,
                                                               std::function<Steady()> steady, Place place) {
  return std::shared_ptr<DirectoryTransport>(
      new DirectoryTransport(files, queue, std::move(steady), std::move(place)));
}

DirectoryTransport::DirectoryTransport(platform::linux_::FileSystem& files_, platform::WorkQueue& queue_,
                                       std::function<Steady()> steady_, Place place_)
    : files(files_),
      queue(queue_),
      steady(std::move(steady_)),
      place(std::move(place_)),
      folder(place.folder + "/" + place.account) {}

void DirectoryTransport::start(TransportClient& client_) {
  client = &client_;
  later([](DirectoryTransport& self) { self.connect(); });
}

void DirectoryTransport::later(std::function<void(DirectoryTransport&)> work) {
  queue.async([weak = weak_from_this(), work = std::move(work)] {
    if (const auto self = weak.lock()) work(*self);
  });
}

void DirectoryTransport::connect() {
  const auto there = files.identity(place.folder);
  if (!there) return disconnect(there.error());
  if (const auto made = files.makeFolder(folder); !made) return disconnect(made.error());
  if (!place.poll) {
    if (const auto begun = beginWatching(); !begun) return disconnect(begun.error());
  }
  known.clear();
  isConnected = true;
  look();
  if (!isConnected) return;
  retry.succeeded();
  client->connected();
}

Result<void> DirectoryTransport::beginWatching() {
  auto inner = files.watch(folder, [this](const std::string& name) { changed(name); });
  if (!inner) return inner.error();
  auto outer = files.watch(place.folder, [this](const std::string& name) {
    // It was renamed or deleted, and what is there in its place by now is another.
    if (name.empty() && isConnected) disconnect(std::make_error_code(std::errc::no_such_file_or_directory));
  });
  if (!outer) return outer.error();
  watch = std::move(*inner);
  outerWatch = std::move(*outer);
  return {};
}

// Tried again from the beginning: what comes back may be another folder.
void DirectoryTransport::disconnect(const std::error_code& error) {
  isConnected = false;
  watch.reset();
  outerWatch.reset();
  nextLook.reset();
  retry.failed(steady(), "");
  client->disconnected(place.folder + ": " + error.message());
}

void DirectoryTransport::changed(const std::string& name) {
  if (name.empty()) return look();
  if (const auto device = deviceOf(name)) lookAt(*device);
}

void DirectoryTransport::look() {
  const auto names = files.list(folder);
  if (!names) return disconnect(names.error());
  std::set<std::string> devices;
  for (const std::string& name : *names) {
    if (auto device = deviceOf(name)) devices.insert(std::move(*device));
  }
  for (const auto& [device, identity] : std::map(known)) devices.insert(device);
  for (const std::string& device : devices) lookAt(device);
  if (place.poll) nextLook = steady() + *place.poll;
}

void DirectoryTransport::lookAt(const std::string& device) {
  const auto before = known.find(device);
  const auto identity = files.identity(pathOf(device));
  if (!identity && isMissing(identity.error())) {
    if (before == known.end()) return;
    known.erase(before);
    return client->removed(device);
  }
  if (before == known.end() && known.size() >= devicesRead) {
    if (!std::exchange(isCrowded, true))
      platform::hearthLog("cloud").error("%s: more than %u documents; further ones are not read", folder,
                                         static_cast<unsigned>(devicesRead));
    return;
  }
  // Where there are events, each is a change.
  if (place.poll && before != known.end() && identity && before->second == *identity) return;
  const auto text = identity ? platform::linux_::readFile(files, pathOf(device), documentBytes)
                             : Result<std::string>(identity.error());
  known[device] = identity && text ? std::optional(*identity) : std::nullopt;
  if (text) return client->received(device, *text);
  client->unreadable(device, text.error() == Outcome::tooLarge
                                 ? "it is larger than " + std::to_string(documentBytes) + " bytes"
                                 : text.error().message());
}

void DirectoryTransport::publish(const std::string& device, std::string document) {
  const auto written = platform::linux_::replaceFile(files, pathOf(device), document);
  later([error = written ? std::error_code() : written.error()](DirectoryTransport& self) {
    if (!self.isConnected) return;
    if (isMissing(error)) return self.disconnect(error);
    self.client->published(error);
  });
}

Result<void> DirectoryTransport::forget(const std::string& device) {
  const auto removed = files.remove(pathOf(device));
  if (!removed && !isMissing(removed.error())) return removed;
  return files.syncFolder(folder);
}

std::optional<Steady> DirectoryTransport::deadline() const {
  return isConnected ? nextLook : retry.deadline();
}

void DirectoryTransport::timePassed(Steady now) {
  const auto due = deadline();
  if (!due || now < *due) return;
  if (isConnected) return look();
  retry.begin();
  connect();
}

}  // namespace cloudsync
