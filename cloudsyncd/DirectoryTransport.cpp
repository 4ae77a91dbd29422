#include "cloudsyncd/DirectoryTransport.hpp"

#include <algorithm>
#include <cerrno>
#include <set>
#include <utility>

#include "cloudsyncd/core/Document.hpp"
#include "platform/LogSink.hpp"

namespace cloudsync {
namespace {

using platform::Outcome;
using platform::Result;
using platform::linux_::FileIdentity;

// An account's devices are a few; this bounds what a folder full of strangers' files can cost.
constexpr std::size_t devicesRead = 256;
constexpr std::string_view ending = ".json";

// Some file systems know times of changes to 2 s only, and give a new file the old one's number: until then
// an identity that stays the same proves nothing.
constexpr std::chrono::milliseconds coarsestTime{2000};
// No event tells that what could not be read now can be.
constexpr std::chrono::milliseconds untilReadAgain{30'000};

// Absent for what is no document: temporary files, files of other programs.
std::optional<std::string> deviceOf(const std::string& file) {
  if (!file.ends_with(ending)) return std::nullopt;
  std::string device = file.substr(0, file.size() - ending.size());
  return isName(device) ? std::optional(std::move(device)) : std::nullopt;
}

bool isMissing(const std::error_code& error) { return error == std::errc::no_such_file_or_directory; }

// Whether a folder is not there, rather than full or read-only: its own, or the file system around it.
bool isAway(const std::error_code& error) {
  return isMissing(error) || error == std::errc::not_a_directory || error == std::errc::no_such_device ||
         error == std::errc::not_connected || error == std::error_code(ESTALE, std::system_category());
}

Result<std::string> read(platform::linux_::FileSystem& files, const std::string& path) {
  const auto file = files.openUntrusted(path);
  if (!file) return file.error();
  return (*file)->readAll(documentBytes);
}

// What is wrong with the file itself; empty where it may be read another time.
std::string lastingProblem(const std::error_code& error) {
  if (error == Outcome::tooLarge) return "it is larger than " + std::to_string(documentBytes) + " bytes";
  return error == Outcome::notPermitted ? "it is no plain file" : "";
}

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
  const auto made = platform::linux_::makeFolderDurably(files, folder);
  if (!made) return disconnect(made.error());
  if (!place.poll) {
    if (const auto begun = beginWatching(); !begun) return disconnect(begun.error());
  }
  known.clear();
  isConnected = true;
  look(true);
  if (!isConnected) return;
  retry.succeeded();
  client->connected();
}

Result<void> DirectoryTransport::beginWatching() {
  auto inner = files.watch(folder, [this](const std::string& name) { changed(name); });
  if (!inner) return inner.error();
  auto outer = files.watch(place.folder, [this](const std::string& name) {
    // It was renamed or deleted, and what is there in its place by now is another.
    if (name.empty()) disconnect(std::make_error_code(std::errc::no_such_file_or_directory));
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
  retry.failed(steady(), "");
  client->disconnected(place.folder + ": " + error.message());
}

void DirectoryTransport::changed(const std::string& name) {
  if (name.empty()) return look(true);
  if (const auto device = deviceOf(name)) lookAt(*device, true);
}

void DirectoryTransport::look(bool all) {
  const auto names = files.list(folder);
  if (!names) return disconnect(names.error());
  nextLook = place.poll ? std::optional(steady() + *place.poll) : std::nullopt;
  std::set<std::string> devices;
  for (const auto& [device, seen] : known) devices.insert(device);
  for (const std::string& name : *names) {
    if (auto device = deviceOf(name)) devices.insert(std::move(*device));
  }
  for (const std::string& device : devices) lookAt(device, all);
}

void DirectoryTransport::lookAt(const std::string& device, bool always) {
  const auto identity = files.identity(pathOf(device));
  if (!identity && isMissing(identity.error())) {
    if (known.erase(device) > 0) client->removed(device);
    return;
  }
  if (!hasRoomFor(device)) return;
  Known& seen = known[device];
  const Steady now = steady();
  if (!identity || seen.identity != *identity) seen = {identity ? *identity : FileIdentity(), now};
  if (seen.isSettled && !always) return;
  const auto text = identity ? read(files, pathOf(device)) : Result<std::string>(identity.error());
  seen.isSettled = text && now - seen.since >= coarsestTime;
  if (text) return client->received(device, *text);
  const std::string problem = lastingProblem(text.error());
  seen.isSettled = !problem.empty();
  if (!seen.isSettled) nextLook = std::min(nextLook.value_or(Steady::max()), now + untilReadAgain);
  client->unreadable(device, seen.isSettled ? problem : text.error().message());
}

bool DirectoryTransport::hasRoomFor(const std::string& device) {
  if (known.size() < devicesRead || known.contains(device)) return true;
  if (!std::exchange(isCrowded, true))
    platform::hearthLog("cloud").error("%s: more than %u documents; further ones are not read", folder,
                                       static_cast<unsigned>(devicesRead));
  return false;
}

void DirectoryTransport::publish(const std::string& device, std::string document) {
  const auto written = platform::linux_::replaceFile(files, pathOf(device), document);
  later([error = written ? std::error_code() : written.error()](DirectoryTransport& self) {
    if (!self.isConnected) return;
    if (isAway(error)) return self.disconnect(error);
    self.client->published(error, error.message());
  });
}

void DirectoryTransport::forget(const std::string& device, std::function<void(const std::string&)> done) {
  auto removed = files.remove(pathOf(device));
  if (removed || isMissing(removed.error())) removed = files.syncFolder(folder);
  done(removed ? "" : removed.error().message());
}

std::optional<Steady> DirectoryTransport::deadline() const {
  return isConnected ? nextLook : retry.deadline();
}

void DirectoryTransport::timePassed(Steady now) {
  const auto due = deadline();
  if (!due || now < *due) return;
  retry.begin();
  nextLook.reset();
  if (isConnected && place.poll) nextLook = now + *place.poll;
  later([](DirectoryTransport& self) { return self.isConnected ? self.look(false) : self.connect(); });
}

}  // namespace cloudsync
