// Admission of clients, and what they may ask.
#include "pairwelld/service/ConduitListener.hpp"

#include "pairwelld/service/ConduitConnection.hpp"
#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

using Interface = platform::RadixUserControllerInterface;
constexpr auto statusRead = &Interface::getDistributedLoggingStatus;
constexpr auto statusWrite = &Interface::setDistributedLoggingStatus;
constexpr auto switchRead = &Interface::kestrelAudioAccessoryLimitedLogging;
constexpr auto switchWrite = &Interface::setKestrelAudioAccessoryLimitedLogging;

// Says what it is asked, and answers what it was told to.
struct RecordingManager : DebugManager {
  RecordingManager(std::shared_ptr<KeyValueStoreManager> store, Effects& effects_)
      : DebugManager(std::move(store)), effects(effects_) {}
  bool audioAccessoryLimitedLoggingEnabled() override {
    effects.record(Effects::client, "read");
    return answer;
  }
  void setAudioAccessoryLimitedLoggingEnabled(bool enabled) override {
    effects.record(Effects::client, enabled ? "on" : "off");
  }
  Effects& effects;
  bool answer = false;
};

struct ConduitListenerTest : World {
  ConduitListenerTest() {
    listener->activate();
    run();
    // Clients that end at the test's end leave the list, and so the listener.
    platform.cutSubscriptions.push_back([queue = listener->serialQueue] { queue->sync([] {}); });
    mark();
  }
  std::vector<std::int32_t> connected() {
    std::vector<std::int32_t> processes;
    listener->serialQueue->sync([&] {
      listener->serialQueue->assertCurrent();
      for (const auto& connection : listener->connections()) {
        processes.push_back(connection->conduitConnection->processIdentifier());
      }
    });
    return processes;
  }
  void record(platform::OptionalError error) {
    platform.effects.record(Effects::client, error ? "error" : "done");
  }
  template <class Result>
  void record(Result result, platform::OptionalError error) {
    platform.effects.record(Effects::client, error ? "error" : std::to_string(result));
  }
  auto answer() {
    return [this](auto... parts) { record(parts...); };
  }
  // What the operation did, its answer last; none of it before the pool's turn.
  template <class Operation, class... Arguments>
  Calls outcome(Operation operation, Arguments... arguments) {
    mark();
    (client->exportedObject.get()->*operation)(arguments..., answer());
    EXPECT_THAT(effects(~0u), IsEmpty());
    run();
    return effects(Effects::log | Effects::client);
  }

  std::shared_ptr<ConduitListener> listener = ConduitListener::create();
  std::shared_ptr<fakes::FakeClientConnection> client;
};

TEST_F(ConduitListenerTest, OnlyTheBooleanTrueOfEitherEntitlementAdmits) {
  const std::string systemKey = "com.kestrel.bluetooth.system",
                    internalKey = "com.kestrel.bluetooth.internal";
  const struct {
    const char* name;
    platform::Dictionary entitlements;
    bool admitted;
  } table[] = {
      {"system", {{systemKey, true}}, true},
      {"system false, internal true", {{systemKey, false}, {internalKey, true}}, true},
      {"text", {{systemKey, "true"}, {internalKey, platform::List{true}}}, false},
      {"number", {{systemKey, 1}, {internalKey, 1}}, false},
      {"none", {}, false},
  };
  // It is set up before it is resumed.
  const Calls admission = {
      "exported interface", "exported object", "invalidation handler",
      "remote interface",   "resumed",         "conduit default: Conduit connection started: 7"};
  for (const int internalBuild : {0, 2}) {
    platform.device.internalBuild = internalBuild;
    const std::string denial = std::string("conduit error: Conduit connection denied, 7") +
                               (internalBuild ? ", add com.kestrel.bluetooth.system entitlement" : "");
    for (const auto& row : table) {
      SCOPED_TRACE(row.name);
      mark();
      const auto offered = offerClient(7, row.entitlements);
      EXPECT_EQ(offered->admitted, row.admitted);
      EXPECT_EQ(effects(~0u), row.admitted ? admission : Calls{denial});
    }
  }
}

TEST_F(ConduitListenerTest, AForeignListenerIsRefusedAfterTheEntitlement) {
  const auto other = platform.listeners.emplace_back(std::make_shared<fakes::FakeServiceListener>());
  other->setDelegate(listener);
  other->setQueue(listener->serialQueue);
  other->resume();
  EXPECT_FALSE(*offerClient(7)->admitted);
  EXPECT_FALSE(*offerClient(8, {})->admitted);
  EXPECT_THAT(log(), ElementsAre("conduit error: Conduit connection denied bad listener, 7",
                                 "conduit error: Conduit connection denied, 8"));
  EXPECT_THAT(connected(), IsEmpty());
}

TEST_F(ConduitListenerTest, ConnectionsStayInOrderUntilTheyEnd) {
  const auto first = offerClient(1), second = offerClient(2), third = offerClient(3);
  EXPECT_THAT(connected(), ElementsAre(1, 2, 3));
  const std::weak_ptr<Interface> weak = second->exportedObject;
  second->end();
  EXPECT_THAT(connected(), ElementsAre(1, 3));
  run();
  EXPECT_TRUE(weak.expired());
  listener->invalidate();
  run();
  EXPECT_TRUE(platform.listeners[0]->invalidated);
  EXPECT_THAT(connected(), ElementsAre(1, 3));
}

TEST_F(ConduitListenerTest, OperationsReachTheDebugManagerOfTheMoment) {
  client = offerClient(7);
  const std::string channel = "conduit default: ", status = channel + "Distributed logging status: ",
                    changed = channel + "Distributed logging status changed: ",
                    limited = channel + "Kestrel audio accessory limited logging enabled: ",
                    enable = channel + "Enable Kestrel audio accessory limited logging: ";
  EXPECT_THAT(outcome(statusRead), ElementsAre(status + "0", "0"));
  EXPECT_THAT(outcome(statusWrite, 3u), ElementsAre(changed + "3", "done"));
  EXPECT_THAT(outcome(switchRead), ElementsAre("0"));
  EXPECT_THAT(outcome(switchWrite, true), ElementsAre(enable + "Yes", "done"));

  const auto manager = std::make_shared<RecordingManager>(makeManager(), platform.effects);
  listener->debugManager = manager;
  EXPECT_THAT(outcome(statusRead), ElementsAre("read", status + "0", "0"));
  EXPECT_THAT(outcome(switchRead), ElementsAre("read", limited + "false", "0"));
  manager->answer = true;
  EXPECT_THAT(outcome(statusRead), ElementsAre("read", status + "1", "1"));
  EXPECT_THAT(outcome(switchRead), ElementsAre("read", limited + "true", "1"));
  EXPECT_THAT(outcome(statusWrite, 2u), ElementsAre("off", changed + "2", "done"));
  EXPECT_THAT(outcome(statusWrite, 0x80000001u), ElementsAre("on", changed + "2147483649", "done"));
  EXPECT_THAT(outcome(switchWrite, true), ElementsAre(enable + "Yes", "on", "done"));
  EXPECT_THAT(outcome(switchWrite, false), ElementsAre(enable + "No", "off", "done"));
}

TEST_F(ConduitListenerTest, AnAcceptedCallCompletesThoughClientAndListenerHaveGone) {
  listener->debugManager = makeDebugManager();
  client = offerClient(7);
  client->exportedObject->setDistributedLoggingStatus(1, answer());
  client->exportedObject->getDistributedLoggingStatus(answer());
  const std::weak_ptr<Interface> object = client->exportedObject;
  const std::weak_ptr<ConduitListener> weak = listener;
  platform.listeners[0]->clients.clear();
  std::exchange(client, nullptr)->end();
  // Its end is seen to before the calls have their turn.
  std::exchange(listener, nullptr)->serialQueue->sync([] {});
  EXPECT_FALSE(weak.expired()) << "the calls need it";
  mark();
  run();
  EXPECT_THAT(effects(Effects::client), ElementsAre("done", "1"));
  EXPECT_EQ(platform.cloud->value(flagKey), Value(true));
  EXPECT_TRUE(object.expired() && weak.expired());
  mark();
  EXPECT_FALSE(*offerClient(8)->admitted);
  EXPECT_THAT(log(), IsEmpty());
}

}  // namespace
}  // namespace pairwell
