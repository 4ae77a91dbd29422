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

struct ConduitListenerTest : World {
  ConduitListenerTest() {
    listener->activate();
    run();
    // Clients that end at the test's end leave the list, and so the listener.
    platform.cutSubscriptions.push_back([queue = listener->serialQueue] { queue->sync([] {}); });
    mark();
  }
  auto answer() {
    return [this](auto... parts) {
      calls.push_back("answer");
      (add(parts), ...);
    };
  }
  void add(std::uint32_t result) { calls.back() += " " + std::to_string(result); }
  void add(platform::OptionalError error) { calls.back() += error ? " failed" : ""; }
  // The service's lines and the answer; none of it before the pool's turn.
  template <class Operation, class... Arguments>
  Calls outcome(Operation operation, Arguments... arguments) {
    calls.clear();
    mark();
    (client->exportedObject.get()->*operation)(arguments..., answer());
    EXPECT_THAT(calls, IsEmpty());
    run();
    Calls all = log();
    std::erase_if(all, [](const std::string& line) { return !line.starts_with("conduit"); });
    all.insert(all.end(), calls.begin(), calls.end());
    return all;
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
}

TEST_F(ConduitListenerTest, OperationsReachTheDebugManagerOfTheMoment) {
  client = offerClient(7);
  const std::string status = "conduit default: Distributed logging status",
                    limited = "conduit default: Kestrel audio accessory limited logging enabled: ",
                    enable = "conduit default: Enable Kestrel audio accessory limited logging: ";
  EXPECT_THAT(outcome(statusRead), ElementsAre(status + ": 0", "answer 0"));
  EXPECT_THAT(outcome(statusWrite, 3u), ElementsAre(status + " changed: 3", "answer"));
  EXPECT_THAT(outcome(switchRead), ElementsAre("answer 0"));
  EXPECT_THAT(outcome(switchWrite, true), ElementsAre(enable + "Yes", "answer"));

  listener->debugManager = makeDebugManager();
  EXPECT_THAT(outcome(statusRead), ElementsAre(status + ": 0", "answer 0"));
  EXPECT_THAT(outcome(statusWrite, 0x80000001u), ElementsAre(status + " changed: 2147483649", "answer"));
  EXPECT_THAT(outcome(statusRead), ElementsAre(status + ": 1", "answer 1"));
  EXPECT_THAT(outcome(statusWrite, 2u), ElementsAre(status + " changed: 2", "answer"));
  EXPECT_THAT(outcome(switchRead), ElementsAre(limited + "false", "answer 0"));
  EXPECT_THAT(outcome(switchWrite, true), ElementsAre(enable + "Yes", "answer"));
  EXPECT_THAT(outcome(switchRead), ElementsAre(limited + "true", "answer 1"));
  EXPECT_THAT(outcome(switchWrite, false), ElementsAre(enable + "No", "answer"));
  EXPECT_FALSE(listener->debugManager->audioAccessoryLimitedLoggingEnabled());
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
  EXPECT_THAT(calls, ElementsAre("answer", "answer 1"));
  EXPECT_EQ(platform.cloud->value(flagKey), Value(true));
  EXPECT_TRUE(object.expired() && weak.expired());
  mark();
  EXPECT_FALSE(*offerClient(8)->admitted);
  EXPECT_THAT(log(), IsEmpty());
}

}  // namespace
}  // namespace pairwell
