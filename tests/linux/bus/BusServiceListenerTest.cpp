// The client service: who is let in, how a refusal reaches a client, and how it all ends.
#include "platform/linux/BusServiceListener.hpp"

#include <atomic>
#include <thread>

#include "platform/linux/BusClient.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/ThreadPool.hpp"
#include "tests/linux/bus/BusWorld.hpp"

namespace platform::linux_ {
namespace {

using namespace std::chrono_literals;

// Holds status reads back, fails writes.
struct Controller : RadixUserControllerInterface {
  void getDistributedLoggingStatus(std::function<void(std::uint32_t, OptionalError)> completion) override {
    held = std::move(completion);
    isHeld = true;
  }
  void setDistributedLoggingStatus(std::uint32_t, std::function<void(OptionalError)> completion) override {
    completion(std::make_error_code(std::errc::no_space_on_device));
  }
  void kestrelAudioAccessoryLimitedLogging(std::function<void(bool, OptionalError)> completion) override {
    completion(true, {});
  }
  void setKestrelAudioAccessoryLimitedLogging(bool, std::function<void(OptionalError)> completion) override {
    completion({});
  }
  void getCurrentUserGivenName(
      std::function<void(std::optional<std::string>, OptionalError)> completion) override {
    completion("Ada", {});
  }
  std::function<void(std::uint32_t, OptionalError)> held;
  std::atomic<bool> isHeld = false;
};

class BusServiceListenerTest : public testing::Test, public ServiceListenerDelegate {
 protected:
  BusServiceListenerTest() {
    listener = BusServiceListener::create(loop, entitlements, "test.service", listenAt(path));
    listener->setQueue(pool);
    listener->setDelegate(std::shared_ptr<ServiceListenerDelegate>(self, this));
    listener->resume();
    thread = std::thread([this] { loop.run(); });
  }
  ~BusServiceListenerTest() override {
    listener.reset();
    pool->waitUntilIdle(std::chrono::steady_clock::now() + deadline);
    loop.stop();
    thread.join();
  }

  bool listenerShouldAcceptNewConnection(const std::shared_ptr<ServiceListener>&,
                                         const std::shared_ptr<ClientConnection>& connection) override {
    EXPECT_EQ(connection->processIdentifier(), ::getpid());
    EXPECT_FALSE(connection->valueForEntitlement("name"));
    connection->setExportedInterface(RadixUserControllerConduitInterface());
    connection->setExportedObject(controller);
    connection->setInvalidationHandler([this] { ++invalidated; });
    if (resumes) connection->resume();
    return accepts;
  }

  // The answer to a call as text, or why there is none.
  std::string call(BusClient& client, const std::string& operation, const List& arguments = {}) {
    const auto reply = client.call(clientInterface("test.service"), operation, arguments, deadline);
    if (!reply) return reply.error().message();
    if (const auto* error = std::get_if<BusError>(&*reply)) return error->name + ": " + error->message;
    return describe(Value(std::get<List>(*reply)));
  }
  std::error_code refusal() {
    const auto client = BusClient::connect(path, deadline);
    return client ? std::error_code() : client.error();
  }

  TemporaryFolder folder;
  const std::string path = folder.path + "/socket";
  LinuxFileSystem files{nullptr};
  Entitlements entitlements{files, Paths::under(folder.path)};
  std::atomic<bool> accepts = true, resumes = true;
  std::atomic<int> invalidated = 0;
  std::shared_ptr<Controller> controller = std::make_shared<Controller>();
  const std::shared_ptr<int> self = std::make_shared<int>();  // stands for this test's life
  const std::shared_ptr<ThreadPool> pool = std::make_shared<ThreadPool>(1);
  EventLoop loop;
  std::shared_ptr<BusServiceListener> listener;
  std::thread thread;
};

TEST_F(BusServiceListenerTest, TheClientsOperationsAreCalledAndItsEndIsToldOnce) {
  auto client = BusClient::connect(path, deadline);
  ASSERT_TRUE(client);
  EXPECT_EQ(call(**client, "GetCurrentUserGivenName"), "[[\"Ada\"]]");
  EXPECT_EQ(call(**client, "SetDistributedLoggingStatus", {1}),
            "com.kestrel.hearth.Failed: No space left on device");
  EXPECT_EQ(invalidated, 0);
  client->reset();
  EXPECT_TRUE(eventually([&] { return invalidated == 1 && controller.use_count() == 1; }));
}

TEST_F(BusServiceListenerTest, EveryClientThatIsRefusedIsToldSo) {
  const std::size_t before = openDescriptors();
  resumes = false;
  EXPECT_EQ(refusal(), Outcome::notPermitted) << "accepted, but never resumed";
  resumes = true;
  accepts = false;
  for (int count = 0; count < 600; ++count) ASSERT_EQ(refusal(), Outcome::notPermitted) << count;
  const std::string refused = "REJECTED EXTERNAL\r\nREJECTED EXTERNAL\r\nREJECTED EXTERNAL\r\n";
  for (unsigned count = 0; count < 400; ++count) {
    const bool isLate = count % 2 == 1;
    const std::size_t piece = count % 4 < 2 ? handshakeAhead.size() : 1;
    Wire wire(path);
    std::string told = isLate ? wire.readToEnd() : "";
    for (std::size_t at = 0; at < handshakeAhead.size(); at += piece)
      ASSERT_TRUE(wire.send(handshakeAhead.substr(at, piece))) << "a broken pipe is no refusal";
    if (!isLate) told = wire.readToEnd();
    ASSERT_EQ(told, refused);
  }
  EXPECT_TRUE(eventually([&] { return openDescriptors() == before; }));
  EXPECT_EQ(invalidated, 0);
}

TEST_F(BusServiceListenerTest, DrainingWaitsForTheAnswersThatAreLeft) {
  auto client = BusClient::connect(path, deadline);
  ASSERT_TRUE(client);
  std::string answer;
  std::thread caller([&] { answer = call(**client, "GetDistributedLoggingStatus"); });
  ASSERT_TRUE(eventually([&] { return controller->isHeld.load(); }));
  Wire late(path);
  late.shakeHands();
  std::atomic<bool> drained = false;
  listener->drain([&] { drained = true; });
  // A turn of the loop later it would have been told.
  std::atomic<bool> passed = false;
  loop.async([&] { loop.async([&] { passed = true; }); });
  ASSERT_TRUE(eventually([&] { return passed.load(); }));
  EXPECT_FALSE(drained);
  controller->held(7, {});
  caller.join();
  EXPECT_EQ(answer, "[7]");
  EXPECT_TRUE(eventually([&] { return drained.load(); }));
  EXPECT_EQ(invalidated, 0);
}

TEST(BusClientTest, AServiceThatHangsCostsAClientItsTimeoutAndNoMore) {
  const TemporaryFolder folder;
  const std::string hanging = folder.path + "/hanging";
  const UniqueDescriptor nobodyAccepts = listenAt(hanging);
  EXPECT_EQ(BusClient::connect(hanging, 50ms).error(), Outcome::timedOut);
  EXPECT_EQ(BusClient::connect(folder.path + "/none", deadline).error(), Outcome::notConnected);
}

}  // namespace
}  // namespace platform::linux_
