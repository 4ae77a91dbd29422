#include "cloudsyncd/Synchroniser.hpp"

#include "cloudsyncd/core/Document.hpp"
#include "cloudsyncd/core/Replica.hpp"
#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/ReplicaFileCloudStore.hpp"
#include "platform/linux/SettingsDocument.hpp"
#include "tests/linux/files/World.hpp"

namespace cloudsync {
namespace {

using platform::Dictionary;
using platform::Value;
using platform::linux_::settingsValues;
using testing::ElementsAre;
using testing::IsEmpty;

struct FakeTransport : Transport {
  void start(TransportClient&) override {}
  void publish(const std::string& device, std::string document) override {
    sent.emplace_back(device, std::move(document));
  }
  void forget(const std::string&, std::function<void(const std::string&)>) override {}
  std::optional<Steady> deadline() const override { return std::nullopt; }
  void timePassed(Steady) override {}

  std::vector<std::pair<std::string, std::string>> sent;
};

Value entry(Value value, std::int64_t time, const std::string& device = "peer") {
  return platform::linux_::CloudEntry{std::move(value), {time, 0}, device}.toValue();
}

// A device of the account "home", its cloud store, and cloudsyncd on the same file.
struct SynchroniserTest : platform::linux_::World {
  SynchroniserTest() {
    replica->startWatching(*device.delivery, [this](const Dictionary& before, const Dictionary& after) {
      synchroniser.replicaChanged(before, after);
    });
  }

  static std::string document(const std::string& name, const Dictionary& entries,
                              const std::string& writer = "w") {
    return *encodeDocument({"home", name, writer, entries});
  }
  void connect() {
    synchroniser.connected();
    deliver();
  }
  void write(const std::string& key, const Value& value) {
    store->setValue(value, key);
    deliver();
  }
  // Time passes to the next deadline; what was published since, if anything.
  std::optional<Document> publishNext() {
    if (const auto due = synchroniser.deadline()) now = *due;
    synchroniser.timePassed();
    if (transport.sent.empty()) return std::nullopt;
    const auto [name, text] = transport.sent.back();
    transport.sent.clear();
    std::string problem;
    const auto sent = decodeDocument(text, "home", name, device.manualClock.now(), problem);
    EXPECT_TRUE(sent) << problem;
    synchroniser.published({}, {});
    return *sent;
  }
  Dictionary whole() { return *replica->contents(); }
  std::string values() { return platform::describe(store->dictionaryRepresentation()); }
  void make(Dictionary contents) {
    files.put(path, *platform::linux_::encodeSettings(contents));
    deliver();
  }

  Steady now;
  FakeTransport transport;
  const std::shared_ptr<platform::linux_::ReplicaFileCloudStore> store =
      platform::linux_::ReplicaFileCloudStore::create(files, device.delivery.get(), device.centre,
                                                      device.manualClock, path);
  const std::shared_ptr<platform::linux_::SettingsFile> replica =
      platform::linux_::SettingsFile::create(files, path);
  std::optional<std::string> settled;
  Synchroniser synchroniser{{files, path, *replica, transport, device.manualClock, [this] { return now; },
                             "home", "writer", [] { return platform::Result<void>(); },
                             [this](const std::string& problem) { settled = problem; }}};
};

TEST_F(SynchroniserTest, FirstDownloadWinsAndPairsStayTogether) {
  write("flag", true);
  write("flagExpiration", 9e9);
  write("own", 1);
  synchroniser.received("peer", document("peer", {{"flag", entry(false, 1)}}));
  EXPECT_FALSE(settled);
  connect();
  EXPECT_EQ(settled, "");
  EXPECT_EQ(values(), R"(["flag": false, "own": 1])");
  EXPECT_EQ(whole().at("reason"), Value(1));
  const auto sent = publishNext();
  ASSERT_TRUE(sent) << "the account lacks \"own\"";
  EXPECT_EQ(sent->entries.size(), 2u);
  EXPECT_THAT(synchroniser.status().waiting, IsEmpty());
  EXPECT_FALSE(synchroniser.deadline());
}

TEST_F(SynchroniserTest, PublishesOwnWritesTogetherAndNothingThatItMerged) {
  connect();
  EXPECT_FALSE(publishNext()) << "there is nothing to tell";
  synchroniser.received("peer", document("peer", {{"theirs", entry(1, 1)}}));
  deliver();
  EXPECT_EQ(values(), R"(["theirs": 1])");
  EXPECT_FALSE(synchroniser.deadline());
  for (int count = 0; count < 30; ++count) {
    write("key", count);
    synchroniser.timePassed();
    EXPECT_EQ(transport.sent.size(), count * 20 >= 500 ? 1u : 0u) << count;
    if (!transport.sent.empty()) break;
    now += std::chrono::milliseconds(20);
  }
  synchroniser.received(transport.sent.at(0).first, transport.sent.at(0).second);
  EXPECT_THAT(synchroniser.status().waiting, ElementsAre("key")) << "heard of, but not answered for";
  synchroniser.disconnected("away");  // takes what is under way with it
  write("later", 1);
  EXPECT_FALSE(synchroniser.deadline());
  synchroniser.received("peer", document("peer", {{"theirs", entry(1, 1)}}));
  connect();
  transport.sent.clear();
  const auto sent = publishNext();
  ASSERT_TRUE(sent);
  EXPECT_EQ(platform::linux_::cloudValues(sent->entries).at("later"), Value(1));

  device.manualClock.time += platform::Time(1e10);
  write("ahead", 1);
  device.manualClock.time -= platform::Time(1e10);
  const auto without = publishNext();
  ASSERT_TRUE(without);
  EXPECT_FALSE(without->entries.contains("ahead")) << "the others would refuse all for it";
  synchroniser.received("peer", document("peer", {{"ahead", entry("theirs", 1)}}));
  EXPECT_THAT(values(), testing::HasSubstr(R"("ahead": "theirs")"));
  write("ahead", 2);
  const auto with = publishNext();
  ASSERT_TRUE(with) << values();
  EXPECT_TRUE(with->entries.contains("ahead"));
}

TEST_F(SynchroniserTest, RefusesBadDocumentsWithOneLineEach) {
  make({{"account", "home"}, {"device", "me"}});
  connect();
  logged();
  const std::string good = document("peer", {{"key", entry(1, 5)}});
  const auto with = [&](const std::string& from, const std::string& to) {
    std::string text = good;
    text.replace(text.find(from), from.size(), to);
    const auto fields = platform::linux_::decodeEditedSettings(text, text);
    return *platform::linux_::encodeSettings(*fields);
  };
  const std::pair<std::string, const char*> cases[] = {
      {good.substr(0, good.size() / 2), "does not parse"},
      {with("\"format\": 1", "\"format\": 2"), "its format version is not 1"},
      {with("\"home\"", "\"work\""), "it is of another account"},
      {with("\"tick\": 0", "\"tick\": \"0\""), "it has an entry of another form"},
      {with("\"writer\": \"w\"", "\"writer\": 1"), "it has no writer"},
      {document("other", {}), "it is of another device"},
      {std::string(documentBytes + 1, ' '), "larger than 1048576 bytes"},
      {document("peer", {{"key", entry(1, std::int64_t{1} << 60)}}), "more than a hundred years ahead"},
  };
  for (const auto& [text, cause] : cases) {
    synchroniser.received("peer", text);
    synchroniser.received("peer", text);
    const auto lines = logged();
    ASSERT_EQ(lines.size(), 1u) << cause;
    EXPECT_THAT(lines[0], testing::AllOf(testing::HasSubstr("device peer"), testing::HasSubstr(cause)));
  }
  for (const std::string& text : {std::string(100'000, '['), good.substr(0, good.size() / 3)}) {
    synchroniser.received("peer", document("peer", {}));
    synchroniser.removed("peer");
    synchroniser.received("peer", text);
    EXPECT_THAT(logged(), IsEmpty()) << "however far it has been copied, and however often it comes back";
    EXPECT_THAT(synchroniser.status().devices.at("peer").problem, testing::HasSubstr("does not parse"));
  }
  EXPECT_EQ(values(), "[:]");
  synchroniser.received("peer", with("\"time\": 5", "\"time\": \"5\""));
  EXPECT_EQ(values(), "[:]");
  synchroniser.received("peer", good);
  EXPECT_EQ(values(), R"(["key": 1])");
}

TEST_F(SynchroniserTest, KeepsWhatExceedsTheQuotaHereAndSaysSoOnce) {
  Dictionary entries;
  for (std::size_t key = 0; key < documentKeys; ++key) entries[std::to_string(key)] = entry(1, 1, "me");
  make({{"account", "home"}, {"device", "me"}, {"values", entries}});
  connect();
  EXPECT_TRUE(publishNext());
  write("more", 1);
  EXPECT_FALSE(publishNext());
  EXPECT_EQ(whole().at("reason"), Value(2));
  const Value sequence = whole().at("reasonSequence");
  write("still more", 1);
  EXPECT_FALSE(publishNext());
  EXPECT_EQ(whole().at("reasonSequence"), sequence);
  EXPECT_THAT(synchroniser.status().waiting, ElementsAre("more", "still more"));
  EXPECT_THAT(synchroniser.status().problem, testing::HasSubstr("exceed"));
  for (const char* key : {"0", "1", "2"}) store->setValue(std::nullopt, key);
  write("more", std::string(documentBytes, 'x'));
  EXPECT_FALSE(publishNext()) << "few keys, but too many bytes";
  write("more", 1);
  EXPECT_TRUE(publishNext());
  EXPECT_EQ(synchroniser.status().problem, "");

  write("more", 2);
  now = *synchroniser.deadline();
  synchroniser.timePassed();
  synchroniser.published(std::make_error_code(std::errc::message_size), "too big for the engine");
  EXPECT_TRUE(publishNext()) << "by then the engine may take it";
}

TEST_F(SynchroniserTest, PutsBackWhatSomebodyHasReplacedByLess) {
  make({{"account", "home"}, {"device", "me"}, {"values", Dictionary{{"key", entry(1, 5, "me")}}}});
  connect();
  EXPECT_TRUE(publishNext());
  synchroniser.received("me", "{");
  EXPECT_TRUE(publishNext());
  synchroniser.received("peer", document("peer", {{"theirs", entry(2, 7)}}));
  EXPECT_FALSE(publishNext()) << "that would be everybody's messages to everybody";
  synchroniser.received("peer", document("peer", {}));
  EXPECT_THAT(publishNext()->entries, testing::Contains(testing::Key("theirs")));
}

TEST_F(SynchroniserTest, AFullDiskAndALostOrDamagedReplicaHealByThemselves) {
  make({{"account", "home"}, {"device", "me"}});
  connect();
  logged();
  files.failFrom = 0;
  synchroniser.received("peer", document("peer", {{"key", entry(1, 5)}}));
  ASSERT_TRUE(synchroniser.deadline());
  now = *synchroniser.deadline();
  synchroniser.timePassed();
  EXPECT_EQ(logged().size(), 2u) << "the reading and the writing, each once";
  files.failFrom = std::numeric_limits<int>::max();
  now = *synchroniser.deadline();
  synchroniser.timePassed();
  EXPECT_EQ(values(), R"(["key": 1])");
  EXPECT_FALSE(synchroniser.deadline());

  EXPECT_TRUE(files.remove(path));
  deliver();
  EXPECT_EQ(values(), R"(["key": 1])");
  EXPECT_EQ(whole().at("device"), Value("me"));
  files.put(path, "{");
  deliver();
  synchroniser.received("peer", document("peer", {{"key", entry(2, 6)}}));
  deliver();
  EXPECT_EQ(values(), R"(["key": 2])");
  EXPECT_EQ(whole().at("device"), Value("me"));
  EXPECT_THAT(transport.sent, IsEmpty());

  write("mine", 2);
  EXPECT_TRUE(files.remove(path));
  EXPECT_FALSE(publishNext()) << "gone, though no event has said so";
  EXPECT_EQ(values(), R"(["key": 2])");
}

}  // namespace
}  // namespace cloudsync
