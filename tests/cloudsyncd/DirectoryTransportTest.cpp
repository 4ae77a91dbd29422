// Devices that meet in a folder in memory, which fails at will.
#include "cloudsyncd/DirectoryTransport.hpp"

#include "cloudsyncd/Transports.hpp"
#include "cloudsyncd/core/Document.hpp"
#include "tests/linux/files/World.hpp"

namespace cloudsync {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::StartsWith;

// Writes down what it is told.
struct Client : TransportClient {
  void connected() override { tell("connected"); }
  void disconnected(const std::string& problem) override { tell("disconnected: " + problem); }
  void received(const std::string& device, std::string_view document) override {
    tell(device + " = " + std::string(document));
  }
  void unreadable(const std::string& device, const std::string& problem) override {
    tell(device + ": " + problem);
  }
  void removed(const std::string& device) override { tell(device + " removed"); }
  void published(const std::error_code& error, const std::string& problem) override {
    tell(error ? "published: " + problem : "published");
  }
  void deadlineMoved() override {}
  void tell(const std::string& text) {
    EXPECT_FALSE(isInCall) << text;
    told.push_back(text);
  }
  std::vector<std::string> takeTold() { return std::exchange(told, {}); }

  std::vector<std::string> told;
  bool isInCall = false;
};

struct DirectoryTransportTest : platform::linux_::World {
  DirectoryTransportTest() { files.put("/share/.keep", ""); }

  void start(std::optional<milliseconds> poll = {}) {
    transport =
        DirectoryTransport::create(files, *device.delivery, [this] { return now; }, {"/share", "home", poll});
    call([this] { transport->start(client); });
  }
  void call(const std::function<void()>& work) {
    client.isInCall = true;
    work();
    client.isInCall = false;
    deliver();
  }
  // What is told in reply to it.
  std::string forget() {
    std::string told = "?";
    transport->forget("me", [&](const std::string& problem) { told = problem; });
    return told;
  }
  std::vector<std::string> publish(const std::string& document) {
    call([&] { transport->publish("me", document); });
    return client.takeTold();
  }
  std::vector<std::string> delivered() {
    deliver();
    return client.takeTold();
  }
  // What is told once the next deadline has come; it must be `delay` away.
  std::vector<std::string> after(milliseconds delay) {
    EXPECT_EQ(transport->deadline(), now + delay);
    call([&] { transport->timePassed(now + delay - milliseconds(1)); });
    EXPECT_THAT(client.told, IsEmpty());
    now += delay;
    call([this] {
      transport->timePassed(now);
      EXPECT_GT(transport->deadline().value_or(Steady::max()), now) << "whoever drives it asks at once";
    });
    return client.takeTold();
  }

  Steady now{seconds(1000)};
  Client client;
  std::shared_ptr<DirectoryTransport> transport;
  const std::string away = "disconnected: /share: No such file or directory";
};

TEST_F(DirectoryTransportTest, DocumentsAreReadAtStartAndWhenTheyChange) {
  files.put("/share/home/b.json", "1");
  for (const char* other : {"b.json.new", "b.txt", ".json", ".b.json", "b c.json", "b.json~", "x/c.json"})
    files.put(std::string("/share/home/") + other, "");
  files.put("/share/other/d.json", "");
  files.put("/share/home/a.json", std::string(documentBytes + 1, ' '));
  files.unreadable.insert("/share/home/c.json");
  files.put("/share/home/c.json", "3");
  start();
  EXPECT_THAT(client.takeTold(), ElementsAre(HasSubstr("a: it is larger than 1048576"), "b = 1",
                                             "c: Permission denied", "connected"));
  files.unreadable.clear();
  EXPECT_THAT(after(seconds(30)), ElementsAre("b = 1", "c = 3")) << "no event tells of a permission";
  EXPECT_EQ(transport->deadline(), std::nullopt);

  // Twice, so that its number and size are the same again.
  for (const char* half : {"?", "{"}) files.put("/share/home/b.json", half);
  files.put("/share/home/d.json", "4");
  EXPECT_TRUE(files.remove("/share/home/c.json"));
  files.put("/share/home/b.json.new", "");
  EXPECT_THAT(delivered(), ElementsAre("b = {", "b = {", "d = 4", "c removed"));
  EXPECT_EQ(transport->deadline(), std::nullopt) << "when nothing happens, nothing wakes";
}

TEST_F(DirectoryTransportTest, PublishedIsDurableAndForgottenIsGone) {
  start();
  EXPECT_THAT(publish("1"), testing::UnorderedElementsAre("connected", "published", "me = 1"));
  files.powerCut();
  EXPECT_EQ(files.bytes("/share/home/me.json"), "1") << "with its folder";
  start();
  client.takeTold();
  EXPECT_EQ(forget(), "");
  EXPECT_THAT(delivered(), ElementsAre("me removed"));
  files.powerCut();
  EXPECT_FALSE(files.exists("/share/home/me.json"));
  EXPECT_EQ(forget(), "") << "gone already";
}

TEST_F(DirectoryTransportTest, FolderThatIsNotThereIsNeverMadeAndTriedLessAndLessOften) {
  files.removeFolder("/share");
  start();
  EXPECT_THAT(client.takeTold(), ElementsAre(away));
  for (const int delay : {1, 2, 4, 8, 16, 32}) EXPECT_THAT(after(seconds(delay)), ElementsAre(away));
  EXPECT_FALSE(files.exists("/share"));
  EXPECT_NE(forget(), "") << "it would be back with the folder";
  files.put("/share/home/b.json", "1");
  EXPECT_THAT(after(Retry::longest), ElementsAre("b = 1", "connected"));
  files.removeFolder("/share");
  EXPECT_THAT(delivered(), ElementsAre(away));
  EXPECT_THAT(after(seconds(1)), ElementsAre(away)) << "at the first pace again";
}

TEST_F(DirectoryTransportTest, FolderThatGoesIsNoticedAndReadAnewWhenItIsBack) {
  for (const bool publishing : {false, true}) {
    for (const char* gone : {"/share", "/share/home"}) {
      files.put("/share/home/b.json", "1");
      start();
      client.takeTold();
      files.removeFolder(gone);
      EXPECT_THAT(publishing ? publish("1") : delivered(), ElementsAre(away)) << gone;
      files.put("/share/home/c.json", "2");
      EXPECT_THAT(delivered(), IsEmpty());
      EXPECT_THAT(after(seconds(1)), ElementsAre("c = 2", "connected"));
      files.put("/share/home/c.json", "3");
      EXPECT_THAT(delivered(), ElementsAre("c = 3")) << "it is watched";
      // Made anew before anybody looked.
      files.removeFolder("/share/home");
      files.put("/share/home/d.json", "4");
      EXPECT_THAT(delivered(), testing::IsSupersetOf({"c removed", "d = 4"}));
      files.removeFolder("/share");
    }
  }
}

TEST_F(DirectoryTransportTest, WhatCannotBeWrittenIsAnsweredAndReadingGoesOn) {
  start();
  client.takeTold();
  EXPECT_THAT(publish("1"), ElementsAre("me = 1", "published"));
  for (const int error : {ENOSPC, EROFS, EACCES, EIO}) {
    files.failure = error;
    files.failFrom = files.calls + 2;  // the new file exists, what goes into it is refused
    transport->publish("me", "2");
    files.failFrom = std::numeric_limits<int>::max();
    EXPECT_THAT(delivered(), ElementsAre("published: " + std::generic_category().message(error)));
    files.put("/share/home/b.json", "1");
    EXPECT_THAT(delivered(), ElementsAre("b = 1"));
    EXPECT_EQ(files.bytes("/share/home/me.json"), "1");
  }
  for (const int error : {ENOTCONN, ENODEV, ESTALE}) {
    files.failure = error;
    files.failFrom = files.calls + 1;
    EXPECT_THAT(publish("2"), ElementsAre(StartsWith("disconnected: /share: "))) << error;
    files.failFrom = std::numeric_limits<int>::max();
    EXPECT_THAT(after(seconds(1)), ElementsAre("b = 1", "me = 1", "connected"));
  }
}

// Each call on the way to a connection fails once: it is said, and mended by the next attempt.
TEST_F(DirectoryTransportTest, ConnectionThatFailsAtAnyStepIsTriedAgain) {
  files.put("/share/home/b.json", "1");
  start();
  const int calls = files.calls;
  ASSERT_GT(calls, 5);
  for (int failing = 1; failing <= calls; ++failing) {
    files.failure = EIO;
    files.failFrom = files.calls + failing;
    client.takeTold();
    start();
    files.failFrom = std::numeric_limits<int>::max();
    const std::string problem = client.told.at(0);
    EXPECT_THAT(problem, HasSubstr("Input/output error")) << failing;
    const bool isConnected = client.told.back() == "connected";
    client.takeTold();
    EXPECT_THAT(after(seconds(isConnected ? 30 : 1)), testing::Contains("b = 1")) << failing;
  }
  client.takeTold();
  files.unreadable.insert("/share");
  start();
  EXPECT_THAT(client.takeTold(), ElementsAre("disconnected: /share: Permission denied"));
  start(seconds(5));
  EXPECT_THAT(client.takeTold(), ElementsAre("b = 1", "connected")) << "without events";
}

TEST_F(DirectoryTransportTest, PollingReadsNothingButWhatMayHaveChanged) {
  files.put("/share/home/b.json", "on!");
  start(seconds(5));
  EXPECT_THAT(client.takeTold(), ElementsAre("b = on!", "connected"));
  EXPECT_THAT(after(seconds(5)), ElementsAre("b = on!")) << "an old change's time may be too coarse";
  EXPECT_THAT(after(seconds(5)), IsEmpty());
  files.put("/share/home/b.json", "off");
  EXPECT_THAT(delivered(), IsEmpty()) << "without events";
  EXPECT_THAT(after(seconds(5)), ElementsAre("b = off"));
  // Twice, so that the number of the file is the same again.
  files.put("/share/home/b.json", "...");
  files.put("/share/home/b.json", "on!");
  EXPECT_THAT(after(seconds(5)), ElementsAre("b = on!"));
  EXPECT_TRUE(files.remove("/share/home/b.json"));
  EXPECT_THAT(after(seconds(5)), ElementsAre("b removed"));
  now += seconds(5);
  transport->timePassed(now);
  EXPECT_EQ(transport->deadline(), now + seconds(5));
  deliver();
  files.removeFolder("/share");
  EXPECT_THAT(after(seconds(5)), ElementsAre(away));
}

TEST_F(DirectoryTransportTest, FoldersFullOfStrangersFilesAreReadInPart) {
  for (int number = 0; number < 3000; ++number)
    files.put("/share/home/d" + std::to_string(number) + (number % 3 ? ".tmp" : ".json"), "x");
  start();
  EXPECT_EQ(client.takeTold().size(), 256u + 1);
  files.put("/share/home/d2997.json", "x");
  EXPECT_THAT(delivered(), IsEmpty());
  EXPECT_THAT(logged(), ElementsAre(HasSubstr("/share/home: more than 256 documents"))) << "once";
  EXPECT_THAT(publish("1"), ElementsAre("published"));
}

TEST(TransportsTest, WrongAddressesAreToldApart) {
  const std::pair<std::string, std::vector<std::string>> rows[] = {
      {"", {"dir:/a", "dir:/a//?poll=0.5", "dir:/", "nats://a", "nats://user@a:4222,b.example,[::1]:4222"}},
      {"dir: needs an absolute path", {"dir:a", "dir:", "dir:?poll=5"}},
      {"unknown engine; there are dir:PATH and nats://HOST", {"http://a", ""}},
      {"not nats://[",
       {"nats://", "nats://user@", "nats://a,,b", "nats://a/b", "nats://a:b", "nats://a:0", "nats://::1"}},
      {"a password does not belong into the URL", {"nats://user:word@a"}},
      {"after '?' only poll=SECONDS may stand",
       {"dir:/a?", "dir:/a?pol=1", "dir:/a?poll=0", "dir:/a?poll=-1", "dir:/a?poll=nan", "dir:/a?poll=1s"}}};
  for (const auto& [problem, urls] : rows) {
    for (const std::string& url : urls) {
      const std::string said = problemOf({url, "h_1-2.x"});
      EXPECT_TRUE(said.starts_with(problem) && said.empty() == problem.empty()) << url << ": " << said;
    }
  }
  for (const char* account : {"..", ""})
    EXPECT_THAT(problemOf({"dir:/a", account}), StartsWith("an account"));
}

}  // namespace
}  // namespace cloudsync
