// What comes through a socket; the first byte says to whom. The client service: from a client that is
// refused, one that is let in, one that is through its handshake. hearthd: from root, a stranger, a job on
// its link. A job: from hearthd. The sockets are real, and so is the code that serves them, all on one
// thread.
#include <sys/epoll.h>
#include <sys/socket.h>

#include "fuzz/Target.hpp"
#include "hearthd/AlarmFile.hpp"
#include "hearthd/Connection.hpp"
#include "hearthd/ListeningSocket.hpp"
#include "hearthd/ServiceManager.hpp"
#include "pairwelld/Names.hpp"
#include "pairwelld/service/ConduitConnection.hpp"
#include "pairwelld/service/ConduitListener.hpp"
#include "platform/linux/BusHandshake.hpp"
#include "platform/linux/BusServiceListener.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/HearthLink.hpp"
#include "tests/fakes/BusMessage.hpp"
#include "tests/fakes/RealFiles.hpp"
#include "tests/pairwelld/World.hpp"

namespace linux_ = platform::linux_;
using linux_::UniqueDescriptor;

namespace {

enum class Whom { refused, admitted, authenticated, root, stranger, job, hearthd, count };

const std::string clientsHandshake(fakes::handshakeAhead);
const std::string hearthsHandshake = "DATA\r\nOK 0123456789abcdef0123456789abcdef\r\nERROR\r\n";

struct World : pairwell::World {
  // Sends `bytes`, then shuts that side, and lets everybody do what this brings forth; what comes back.
  std::string talk(const UniqueDescriptor& socket, std::string_view bytes) {
    constexpr int quiet = 20;  // turns; whatever moves needs some four to be seen here
    std::string answers;
    int idle = 0;
    const std::function<void()> turn = [&] {
      run();
      const ssize_t sent = ::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
      if (sent > 0) bytes.remove_prefix(static_cast<std::size_t>(sent));
      char buffer[4096];
      const ssize_t got = ::recv(socket.get(), buffer, sizeof buffer, MSG_DONTWAIT);
      if (got > 0) answers.append(buffer, static_cast<std::size_t>(got));
      idle = sent > 0 || got > 0 ? 0 : idle + 1;
      if (idle == quiet) ::shutdown(socket.get(), SHUT_WR);
      idle < 2 * quiet ? loop.async(turn) : loop.stop();
    };
    turn();
    loop.run();
    return answers;
  }

  // Alike for all inputs, which share the sockets' names.
  static std::string folder() {
    static const fakes::TemporaryFolder made;
    return made.path;
  }
  linux_::EventLoop loop;
  fakes::MemoryFileSystem files;
};

std::pair<UniqueDescriptor, UniqueDescriptor> makePair() {
  int ends[2];
  fuzz::require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends) == 0);
  return {UniqueDescriptor(ends[0]), UniqueDescriptor(ends[1])};
}

// Lets everybody in: what a grant needs depends on where the build lies.
struct Admitting : pairwell::ConduitListener {
  bool listenerShouldAcceptNewConnection(
      const std::shared_ptr<platform::ServiceListener>&,
      const std::shared_ptr<platform::ClientConnection>& connection) override {
    connection->setExportedInterface(platform::RadixUserControllerConduitInterface());
    connection->setExportedObject(pairwell::ConduitConnection::create(
        std::static_pointer_cast<ConduitListener>(shared_from_this()), serialQueue, connection));
    connection->resume();
    return true;
  }
};

void callService(World& world, Whom whom, const std::string& bytes) {
  const std::string path = World::folder() + "/service.sock";
  linux_::Entitlements entitlements(world.files, linux_::Paths::under("/nowhere"));
  const auto listener = linux_::BusServiceListener::create(world.loop, entitlements, pairwell::names::service,
                                                           std::move(*hearth::listenAt(path)));
  const auto delegate =
      whom == Whom::refused ? pairwell::ConduitListener::create() : std::make_shared<Admitting>();
  delegate->debugManager = world.makeDebugManager();
  listener->setDelegate(delegate);
  listener->setQueue(delegate->serialQueue);
  listener->resume();
  const auto answers = world.talk(fakes::socketAt(path, ::connect), bytes);
  if (whom == Whom::refused) fuzz::require(answers == linux_::busRefusal);
  if (whom == Whom::authenticated) fuzz::require(answers.starts_with("DATA\r\nOK "));
}

// A job is there that is never started, as its lock cannot be had.
void callHearth(World& world, Whom whom, const std::string& bytes) {
  const auto paths = linux_::Paths::under(World::folder());
  std::filesystem::create_directories(paths.run + "/a.life");
  world.files.put(paths.jobs() + "/a.json",
                  R"({"name": "a", "program": "/a", "streams": ["s"], "matching": ["n"]})");
  hearth::ServiceManager manager(world.loop, world.files, paths);
  fuzz::require(manager.start([] {}).has_value());
  linux_::BusServer server(linux_::hearthInterface());
  const auto watch = world.loop.watchDescriptor(server.descriptor(), EPOLLIN, [&](std::uint32_t) {
    server.dispatch();
    manager.tellPosted();
  });
  auto [own, other] = makePair();
  const hearth::Connection::Rights rights{whom == Whom::root, whom == Whom::job ? "a" : ""};
  manager.connected(99, server.adopt(std::move(other), linux_::PeerIdentity(),
                                     std::make_shared<hearth::Connection>(manager, 99, rights)));
  fuzz::require(world.talk(own, bytes).starts_with("DATA\r\nOK "));
  // What it has promised is on disk.
  const auto promised = manager.listAlarms();
  const auto kept = hearth::AlarmFile(world.files, paths.alarms()).load()->list();
  fuzz::require(kept.size() == promised.size() && (kept.empty() || whom != Whom::stranger));
  for (std::size_t index = 0; index < kept.size(); ++index)
    fuzz::require(kept[index].key == promised[index].key && kept[index].date == promised[index].date);
}

void answerJob(World& world, const std::string& bytes) {
  auto [own, other] = makePair();
  const auto& queue = world.platform.loop.queue;
  linux_::HearthLink hearth(world.loop, std::move(other), queue, [] {});
  std::int32_t token = 0;
  hearth.setHandler("s", queue, [](const platform::Dictionary&) {});
  hearth.setEvent("s", "n", platform::Dictionary{{"Date", platform::Date{5}}});
  hearth.registerHandler("n", token, queue, [](std::int32_t) {});
  world.talk(own, bytes);
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  const auto whom = static_cast<Whom>(data[0] % static_cast<int>(Whom::count));
  const std::string bytes(fuzz::textOf(data + 1, size - 1));
  World world;
  if (whom <= Whom::authenticated) {
    callService(world, whom, (whom == Whom::authenticated ? clientsHandshake : "") + bytes);
  } else if (whom == Whom::hearthd) {
    answerJob(world, hearthsHandshake + bytes);
  } else {
    callHearth(world, whom, clientsHandshake + bytes);
  }
  return 0;
}
