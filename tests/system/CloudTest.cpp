// Devices that meet in a shared folder.
#include <sys/stat.h>

#include "tests/system/Account.hpp"

namespace processes {
namespace {

struct CloudTest : Account {
  CloudTest() {
    fs::create_directory(share);
    for (const char* name : {"one", "two"}) EXPECT_EQ(join(name, url).status, 0);
  }

  const fs::path share = root / "share";
  const std::string url = "dir:" + share.string();
};

TEST_F(CloudTest, SwitchIsSharedAndWhoeverWasDownCatchesUp) {
  for (const char* name : {"one", "two"}) start(name);
  switchTo("one", "on");
  EXPECT_TRUE(followsOn("two", "one"));
  switchTo("two", "off");
  EXPECT_TRUE(followsOff("one"));

  EXPECT_EQ(stop("two", SIGKILL), -SIGKILL);
  switchTo("one", "on");
  ASSERT_TRUE(comesToSay("one", "waiting to go out  nothing"));
  start("two");
  EXPECT_TRUE(followsOn("two", "one"));
  for (const char* name : {"one", "two"}) EXPECT_EQ(on(name, "hearthctl", "check").status, 0);

  const Outcome second = run("env HEARTH_ROOT=" + (root / "two").string() + " cloudsyncd");
  EXPECT_EQ(second.status, 1);
  EXPECT_EQ(second.errors, "cloudsyncd: already running\n");
  EXPECT_EQ(on("two", "hearthctl", "jobs stop com.kestrel.cloudsyncd").status, 0);
  ASSERT_TRUE(comesTo(
      "two", [&] { return on("two", "hearthctl", "jobs").output.find("stopped") != std::string::npos; }));
  switchTo("two", "off");
  const pid_t byHand = spawn("env HEARTH_ROOT=" + (root / "two").string() + " cloudsyncd", "hand");
  EXPECT_TRUE(followsOff("one")) << "without hearthd, too";
  ::kill(byHand, SIGTERM);
  EXPECT_EQ(finish(byHand, "hand").status, 0);
}

TEST_F(CloudTest, FolderThatGoesAwayIsSaidAndComesBack) {
  const fs::path elsewhere = root / "elsewhere";
  for (const char* name : {"one", "two"}) start(name);
  ASSERT_TRUE(comesToSay("one", "connected          yes"));
  fs::rename(share, elsewhere);
  ASSERT_TRUE(comesToSay("one", "connected          no, since 20"));
  switchTo("one", "on");
  EXPECT_TRUE(comesToSay("one", "waiting to go out  " + flagKey + ", " + endKey));
  EXPECT_THAT(cloud("one", "status").output,
              HasSubstr("problem            " + share.string() + ": No such file"));
  EXPECT_EQ(timesLogged("not connected: ", "one"), 1u);
  fs::rename(elsewhere, share);
  EXPECT_TRUE(followsOn("two", "one"));
  EXPECT_TRUE(comesToSay("one", "waiting to go out  nothing"));
  // That of the account alone: a link, then a folder in its place, then none.
  fs::rename(share / "home", elsewhere);
  fs::create_symlink(elsewhere, share / "home");
  switchTo("two", "off");
  EXPECT_TRUE(followsOff("one"));
  fs::remove(share / "home");
  fs::rename(elsewhere, share / "home");
  switchTo("one", "on");
  EXPECT_TRUE(followsOn("two", "one"));
  fs::remove_all(share / "home");
  switchTo("two", "off");
  EXPECT_TRUE(followsOff("one"));
}

TEST_F(CloudTest, AnotherAccountIsTakenWholeOrNotAtAll) {
  for (const char* name : {"one", "two"}) start(name);
  EXPECT_EQ(cloud("two", "use " + url + " --account work").status, 0);
  on("two", "hearthctl", "settings set cloud theirs 2");
  EXPECT_TRUE(comesToSay("two", "waiting to go out  nothing"));
  on("one", "hearthctl", "settings set cloud ours 1");

  const std::string before = contents(root / "one/etc/cloud.json");
  const Outcome away = cloud("one", "use dir:" + (root / "nowhere").string() + " --account work");
  EXPECT_EQ(away.status, 1);
  EXPECT_THAT(away.errors, HasSubstr("/nowhere: No such file or directory"));
  for (const char* wrong : {"ftp:x --account work", "dir:relative --account work", "dir:/tmp --account .."})
    EXPECT_NE(cloud("one", std::string("use ") + wrong).status, 0) << wrong;
  const fs::path replica = root / "one/var/settings/cloud/com.kestrel.bluetooth.cloud.settings.json";
  for (const fs::path& file : {root / "one/etc/cloud.json", fs::path(replica.string() + ".account-home")}) {
    const fs::path inTheWay = file.string() + ".new";
    fs::create_directory(inTheWay);
    EXPECT_EQ(cloud("one", "use " + url + " --account work").status, 1) << file << " cannot be written";
    fs::remove(inTheWay);
    EXPECT_EQ(contents(root / "one/etc/cloud.json"), before) << file;
  }
  EXPECT_THAT(cloud("one", "status").output, HasSubstr(url + ", account home\n"));
  EXPECT_EQ(setting("one", "ours"), "1\n");

  EXPECT_EQ(cloud("one", "use " + url + " --account work").status, 0);
  EXPECT_EQ(on("one", "hearthctl", "settings list cloud").output, "theirs  2\n");
  EXPECT_TRUE(eventually([&] {
    return timesLogged(
               "Cloud KVS Notification: [\"ChangeReason\": 3, \"ChangedKeys\": [\"ours\", \"theirs\"]]",
               "one") == 1;
  })) << log("one");
  EXPECT_THAT(contents(replica.string() + ".account-home"), HasSubstr("\"ours\""));
  // The same account elsewhere.
  const std::string moved = "dir:" + (root / "moved").string();
  fs::create_directory(root / "moved");
  for (const char* name : {"one", "two"})
    EXPECT_EQ(cloud(name, "use " + moved + " --account work").status, 0);
  stop("one");
  start("one");
  EXPECT_THAT(cloud("one", "status").output, HasSubstr(moved + ", account work\n"));
  switchTo("one", "on");
  EXPECT_TRUE(followsOn("two", "one"));
}

TEST_F(CloudTest, CopyOfADiskIsToldToTakeANewIdentity) {
  start("one");
  switchTo("one", "on");
  ASSERT_TRUE(comesToSay("one", "device             "));
  stop("one");
  for (const char* part : {"etc", "var"}) {
    fs::create_directories(root / "copy");
    fs::copy(root / "one" / part, root / "copy" / part, fs::copy_options::recursive);
  }
  start("one");
  switchTo("one", "off");
  EXPECT_TRUE(comesToSay("one", "waiting to go out  nothing"));
  start("copy");
  EXPECT_TRUE(comesToSay("copy", "hearthctl cloud new-identity"));
  EXPECT_TRUE(comesTo("copy", [&] { return on("copy", "pairwellctl", "logging").output == "off\n"; }));
  switchTo("copy", "on");
  EXPECT_TRUE(comesToSay("copy", "waiting to go out  " + flagKey));
  // By then what was to go out would have.
  on("one", "hearthctl", "settings set cloud later 1");
  EXPECT_TRUE(comesTo("copy", [&] { return setting("copy", "later") == "1\n"; })) << "it reads on";
  EXPECT_EQ(setting("one", endKey), "");
  EXPECT_EQ(cloud("copy", "new-identity").status, 0);
  EXPECT_TRUE(followsOn("one", "copy"));
  EXPECT_EQ(timesLogged("publishes under this device's name", "copy"), 1u);
  EXPECT_EQ(timesLogged("publishes under this device's name", "one"), 0u);
}

TEST_F(CloudTest, StrangersDocumentsAreRefusedOnceAndForgotten) {
  write("share/precious.json", "");
  fs::create_directory(share / "home");
  ASSERT_EQ(::mkfifo((share / "home/pipe.json").c_str(), 0600), 0);
  fs::create_symlink(share / "precious.json", share / "home/link.json");
  for (const char* name : {"one", "two"}) start(name);
  const std::string problem = "the document of device stranger is refused: ";
  for (const char* text : {"{", "{", "{"}) {
    write("share/home/stranger.json", text);
    switchTo("two", "on");
    EXPECT_TRUE(followsOn("one", "two"));
    switchTo("two", "off");
    EXPECT_TRUE(followsOff("one"));
  }
  EXPECT_EQ(timesLogged(problem, "one"), 1u) << log("one");
  EXPECT_TRUE(comesToSay("one", "device             stranger, newest change never, refused: "));
  for (const std::string planted : {"link", "pipe"}) {
    EXPECT_TRUE(comesToSay("one", planted + ", newest change never, refused: it is no plain file"));
    fs::remove(share / "home" / (planted + ".json"));
    EXPECT_TRUE(eventually([&] { return cloud("one", "status").output.find(planted) == std::string::npos; }));
  }
  EXPECT_EQ(cloud("one", "forget ../precious").status, 1);
  EXPECT_TRUE(fs::exists(share / "precious.json"));
  EXPECT_EQ(cloud("one", "forget stranger").status, 0);
  EXPECT_FALSE(fs::exists(share / "home/stranger.json"));
  EXPECT_TRUE(
      eventually([&] { return cloud("one", "status").output.find("stranger") == std::string::npos; }));
  EXPECT_THAT(cloud("one", "--json status").output,
              AllOf(testing::StartsWith("{\"account\":\"home\",\"connected\":true,"), HasSubstr("\"in\":1"),
                    HasSubstr("\"newest\":1")));
  if (::geteuid() != 0) GTEST_SKIP() << "only root can be another user";
  EXPECT_EQ(run("hearthctl --root " + (root / "one").string() + " cloud forget x", nobody).status, 4);
}

TEST_F(CloudTest, WhatIsWrongIsSaidBeforeAnythingIsWritten) {
  for (const char* wrong : {"--cloud dir:/tmp", "--account home", "--cloud http:x --account home",
                            "--cloud dir:tmp --account home", "--cloud dir:/tmp?poll=0 --account home",
                            "--cloud dir:/tmp --account a/b"})
    EXPECT_EQ(on("three", "hearthctl", std::string("init ") + wrong).status, 2) << wrong;
  EXPECT_FALSE(fs::exists(root / "three"));
  const std::string before = contents(root / "one/etc/cloud.json");
  EXPECT_THAT(join("one", url + "?poll=1").output, HasSubstr("kept"));
  EXPECT_EQ(contents(root / "one/etc/cloud.json"), before);
  const Outcome unreachable = cloud("one", "status");
  EXPECT_EQ(unreachable.status, 3);
  EXPECT_THAT(unreachable.errors, HasSubstr("cloudsyncd"));

  write("one/etc/cloud.json", "{\n oops}");
  start("one");
  EXPECT_EQ(timesLogged("one/etc/cloud.json: line 2", "one"), 1u) << log("one");
  EXPECT_THAT(on("one", "hearthctl", "check").output, HasSubstr("one/etc/cloud.json: line 2"));
  EXPECT_EQ(cloud("one", "use '" + url + "?poll=0.1' --account home").status, 0) << "which mends it";
  start("two");
  switchTo("two", "on");
  EXPECT_TRUE(followsOn("one", "two")) << "by looking alone";
}

}  // namespace
}  // namespace processes
