#include "tests/linux/bus/BusWorld.hpp"

#include <poll.h>
#include <sys/epoll.h>

#include <algorithm>
#include <cstring>
#include <future>

namespace platform::linux_ {
namespace {

std::string number(std::uint32_t value) {
  std::string bytes(4, '\0');
  std::memcpy(bytes.data(), &value, 4);
  return bytes;
}
std::uint32_t numberAt(const std::string& bytes, std::size_t at) {
  std::uint32_t value;
  std::memcpy(&value, bytes.data() + at, 4);
  return value;
}
std::size_t aligned(std::size_t at, std::size_t size) { return (at + size - 1) / size * size; }
std::string text(const std::string& value) {
  return number(static_cast<std::uint32_t>(value.size())) + value + '\0';
}
void addField(std::string& fields, char code, char type, const std::string& value) {
  fields.resize(aligned(fields.size(), 8));
  fields += std::string{code, 1, type, 0} + value;
}

}  // namespace

std::string callMessage(const std::string& member, const std::string& argument, const CallOptions& options) {
  std::string fields;
  addField(fields, 1, 'o', text(options.path));
  addField(fields, 2, 's', text(options.interface));
  addField(fields, 3, 's', text(member));
  addField(fields, 8, 'g', std::string("\1s\0", 3));
  const std::string body = text(argument);
  std::string message{'l', 1, static_cast<char>(options.flags), 1};
  message += number(static_cast<std::uint32_t>(body.size())) + number(options.serial) +
             number(static_cast<std::uint32_t>(fields.size())) + fields;
  message.resize(aligned(message.size(), 8));
  return message + body;
}

Wire::Wire(const std::string& path) : socket(fakes::socketAt(path, ::connect)) {
  const timeval limit{deadline.count(), 0};
  EXPECT_EQ(::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit), 0);
}

bool Wire::send(std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t sent = ::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (sent < 0) return false;
    bytes.remove_prefix(static_cast<std::size_t>(sent));
  }
  return true;
}

// Whether at least `size` bytes are there.
bool Wire::fill(std::size_t size) {
  char buffer[4096];
  while (received.size() < size) {
    const ssize_t count = ::recv(socket.get(), buffer, sizeof buffer, 0);
    EXPECT_FALSE(count < 0 && errno == EAGAIN) << "nothing comes";
    if (count <= 0) return false;
    received.append(buffer, static_cast<std::size_t>(count));
  }
  return true;
}

void Wire::shakeHands() {
  EXPECT_TRUE(send(handshakeAhead));
  std::size_t end;
  while ((end = received.find("OK ")) == received.npos || (end = received.find("\r\n", end)) == received.npos)
    ASSERT_TRUE(fill(received.size() + 1));
  received.erase(0, end + 2);
}

std::optional<Answer> Wire::next() {
  if (!fill(16)) return std::nullopt;
  const std::size_t end = 16 + numberAt(received, 12);
  const std::size_t body = aligned(end, 8);
  const std::size_t size = body + numberAt(received, 4);
  if (!fill(size)) return std::nullopt;
  Answer answer;
  for (std::size_t at = 16; at < end;) {
    at = aligned(at, 8);
    const char code = received[at], type = received[at + 2];
    at += 4;
    if (type == 'g') {
      if (received[at + 1] == 's') answer.text = received.substr(body + 4, numberAt(received, body));
      at += 2u + static_cast<unsigned char>(received[at]);
      continue;
    }
    const std::uint32_t value = numberAt(received, at);
    at += 4;
    if (code == 5) answer.serial = value;
    if (code == 3 || code == 4) answer.name = received.substr(at, value);
    if (type != 'u') at += value + 1;
  }
  received.erase(0, size);
  return answer;
}

std::string Wire::readToEnd() {
  while (fill(received.size() + 1)) {
  }
  return std::exchange(received, "");
}

bool Wire::waitForHangUp() {
  pollfd entry{socket.get(), 0, 0};
  return ::poll(&entry, 1, static_cast<int>(std::chrono::milliseconds(deadline).count())) == 1;
}

void Wire::closeOutput() { ::shutdown(socket.get(), SHUT_WR); }

bool Wire::isServed() {
  if (!send(callMessage("Echo", "served?"))) return false;
  const auto answer = next();
  return answer && answer->text == "served?";
}

UniqueDescriptor listenAt(const std::string& path) {
  UniqueDescriptor socket = fakes::socketAt(path, ::bind);
  EXPECT_EQ(::listen(socket.get(), 128), 0);
  return socket;
}

std::size_t openDescriptors() {
  return static_cast<std::size_t>(std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {}));
}

std::size_t residentBytes() {
  std::size_t total = 0, resident = 0;
  std::ifstream("/proc/self/statm") >> total >> resident;
  return resident * 4096;
}

class World::Handler : public BusHandler {
 public:
  explicit Handler(World& world_) : world(world_) {}
  void call(std::size_t operation, List arguments, BusCompletion completion) override {
    const auto* argument = arguments.front().as<std::string>();
    std::lock_guard lock(world.mutex);
    world.calls.push_back(argument ? *argument : "");
    if (operation == 0) completion(std::move(arguments));
    if (operation == 1) world.held.push_back({*argument, std::move(completion)});
    if (operation == 2) completion(List());
    world.changed.notify_all();
  }
  void closed() override {
    if (connection) std::erase(world.connections, std::exchange(connection, nullptr));
    std::lock_guard lock(world.mutex);
    ++world.closed;
    world.changed.notify_all();
  }
  std::shared_ptr<BusConnection> connection;  // the loop's thread's

 private:
  World& world;
};

World::World(limits::Patience patience) : hearthsOwn(listenAt(path)) {
  const BusInterface interface {
    "/test", "test.Interface", {{"Echo", "s", "s"}, {"Hold", "s", "s"}, {"Wide", "t", ""}}, {
      {"Changed", "s"}, { "Other", "s" }
    }
  };
  server = std::make_unique<BusServer>(interface, patience);
  server->listen(UniqueDescriptor(::dup(hearthsOwn.get())), [this](PeerIdentity, BusServer::Decide decide) {
    std::lock_guard lock(mutex);
    if (decides) return decide(admission());
    undecided.push_back(std::move(decide));
    changed.notify_all();
  });
  watch = loop.watchDescriptor(server->descriptor(), EPOLLIN, [this](std::uint32_t) { server->dispatch(); });
  thread = std::thread([this] { loop.run(); });
}

World::~World() {
  endServer();
  loop.stop();
  thread.join();
}

void World::endServer() {
  onLoop([this] {
    watch = EventSource();
    server.reset();
  });
}

void World::onLoop(const std::function<void()>& work) {
  std::promise<void> done;
  loop.async([&] {
    work();
    done.set_value();
  });
  done.get_future().wait();
}

bool World::waitFor(const std::function<bool()>& condition) {
  std::unique_lock lock(mutex);
  return changed.wait_for(lock, deadline, condition);
}

Wire World::client() {
  Wire wire(path);
  wire.shakeHands();
  return wire;
}

void World::complete(std::size_t index) {
  std::unique_lock lock(mutex);
  const Held call = held.at(index);
  held.erase(held.begin() + static_cast<std::ptrdiff_t>(index));
  lock.unlock();
  call.completion(List{call.text});
}

BusServer::Admission World::admission() {
  const auto handler = std::make_shared<Handler>(*this);
  return {handler, [this, handler](std::shared_ptr<BusConnection> connection) {
            handler->connection = connection;
            connections.push_back(std::move(connection));
          }};
}

}  // namespace platform::linux_
