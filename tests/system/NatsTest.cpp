// Devices that meet at a cluster of real servers, configured as in packaging/nats.
#include <poll.h>
#include <sys/socket.h>

#include <array>
#include <atomic>
#include <future>
#include <memory>
#include <optional>
#include <string_view>
#include <thread>
#include <utility>

#include "cloudsyncd/NatsTransport.hpp"
#include "platform/linux/UniqueDescriptor.hpp"
#include "tests/system/Account.hpp"

namespace processes {
namespace {

using fakes::freePort;
using fakes::listening;
using platform::linux_::UniqueDescriptor;

struct NatsTest : Account {
  NatsTest() {
    fakes::deadline = std::chrono::seconds(90);  // a cluster killed whole has taken 40 to elect its leaders
    for (Server& server : servers) server = {freePort(), freePort(), freePort()};
    write("nats/routes.conf", "routes: [ nats://127.0.0.1:" + std::to_string(servers[0].cluster) +
                                  ", nats://127.0.0.1:" + std::to_string(servers[1].cluster) +
                                  ", nats://127.0.0.1:" + std::to_string(servers[2].cluster) + " ]");
    fs::copy_file(fs::path(SOURCE_ROOT) / "packaging/nats/nats-server.conf", conf);
    makeCertificate("server", "DNS:localhost");
    write("access.json", "{\"password\": \"hp\", \"authorities\": \"" + tls("ca.pem") + "\"}");
  }
  ~NatsTest() override {
    stopAll();
    stopServers();
  }

  std::string tls(const std::string& file) const { return (root / "nats" / file).string(); }
  void makeCertificate(const std::string& name, const std::string& host) {
    const std::string key = "-newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -keyout ";
    const std::string authority = "-CA " + tls("ca.pem") + " -CAkey " + tls("ca.key") + " ";
    write("nats/" + name + ".ext", "subjectAltName=" + host);
    if (!fs::exists(tls("ca.pem")))
      run("openssl req -x509 -subj /CN=tests -out " + tls("ca.pem") + " " + key + tls("ca.key"));
    run("openssl req -subj /CN=" + name + " -out " + tls(name + ".csr") + " " + key + tls(name + ".key"));
    ASSERT_EQ(run("openssl x509 -req -CAcreateserial " + authority + "-in " + tls(name + ".csr") +
                  " -extfile " + tls(name + ".ext") + " -out " + tls(name + ".pem"))
                  .status,
              0);
  }
  void change(const std::string& from, const std::string& to) {
    std::string text = contents(conf);
    const auto at = text.find(from);
    ASSERT_NE(at, std::string::npos) << from;
    std::ofstream(conf) << text.replace(at, from.size(), to);
  }

  void startServer(std::size_t number, const std::string& certificate = "server",
                   const std::string& within = "") {
    const Server& server = servers[number];
    const std::string name = "n" + std::to_string(number);
    servers[number].pid = spawn(
        "env NATS_NAME=" + name + " NATS_LISTEN=127.0.0.1:" + std::to_string(server.port) +
            " NATS_CLUSTER=127.0.0.1:" + std::to_string(server.cluster) + " NATS_STORE=" + tls(name) +
            " NATS_AUTHORITIES=" + tls("ca.pem") + " NATS_CERTIFICATE=" + tls(certificate + ".pem") +
            " NATS_KEY=" + tls(certificate + ".key") + " NATS_HOME_PASSWORD=hp NATS_WORK_PASSWORD=wp " +
            within + "/usr/sbin/nats-server -c " + conf.string() + " -m " + std::to_string(server.monitor),
        name);
  }
  // By hand, in the clear.
  UniqueDescriptor connectTo(std::size_t number) const {
    UniqueDescriptor raw(::socket(AF_INET, SOCK_STREAM, 0));
    const sockaddr_in address = fakes::loopback(servers[number].port);
    EXPECT_EQ(::connect(raw.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    return raw;
  }
  static std::string publication(const std::string& subject, const std::string& text) {
    return "PUB " + subject + " " + std::to_string(text.size()) + "\r\n" + text + "\r\n";
  }
  void startServers() {
    for (std::size_t number = 0; number < servers.size(); ++number) startServer(number);
  }
  void stopServer(std::size_t number) {
    if (servers[number].pid <= 0) return;
    ::kill(servers[number].pid, SIGKILL);
    finish(std::exchange(servers[number].pid, -1), "n" + std::to_string(number));
  }
  void stopServers() {
    for (std::size_t number = 0; number < servers.size(); ++number) stopServer(number);
  }
  // Of the account's stream, as its servers see it.
  std::optional<std::size_t> leader() {
    const std::string mark = "\"leader\": \"n", ask = "GET /jsz?streams=1 HTTP/1.0\\r\\n\\r\\n";
    for (const Server& server : servers) {
      if (server.pid <= 0) continue;
      const std::string all = run("bash -c 'exec 3<>/dev/tcp/127.0.0.1/" + std::to_string(server.monitor) +
                                  "; printf \"" + ask + "\" >&3; cat <&3'")
                                  .output;
      const auto stream = all.find("pairwell-home");
      const auto at = stream == all.npos ? stream : all.find(mark, stream);
      if (at != all.npos) return static_cast<std::size_t>(all[at + mark.size()] - '0');
    }
    return std::nullopt;
  }

  std::string url(const std::string& user = "home") const {
    std::string text = "nats://" + user + "@";
    for (const Server& server : servers)
      text += (text.ends_with('@') ? "localhost:" : ",localhost:") + std::to_string(server.port);
    return text;
  }
  void joinAndStart(const std::string& name) {
    EXPECT_EQ(join(name, url(), "--access " + access).status, 0);
    start(name);
  }
  testing::AssertionResult isInStep(const std::string& name) {
    const auto connected = comesToSay(name, "connected          yes");
    return connected ? comesToSay(name, "waiting to go out  nothing") : connected;
  }

  struct Server {
    int port, cluster, monitor;
    pid_t pid = -1;
  };
  std::array<Server, 3> servers;
  const fs::path conf = root / "nats/nats-server.conf";
  const std::string access = (root / "access.json").string();
};

TEST_F(NatsTest, SwitchesOutliveTheirLeaderAndAllServers) {
  for (const char* name : {"one", "two"}) joinAndStart(name);
  EXPECT_TRUE(comesToSay("one", "No server available"));
  switchTo("one", "on");
  startServers();
  EXPECT_TRUE(followsOn("two", "one"));
  ASSERT_TRUE(isInStep("one"));

  const auto former = leader();
  ASSERT_TRUE(former);
  stopServer(*former);
  switchTo("two", "off");
  EXPECT_TRUE(followsOff("one"));
  EXPECT_TRUE(isInStep("two")) << "once there is another leader";
  startServer(*former);

  stopServers();
  fs::create_directory(tls("older"));
  for (const std::string store : {"n0", "n1", "n2"})
    fs::copy(tls(store), tls("older/" + store), fs::copy_options::recursive);
  startServers();
  switchTo("one", "on");
  ASSERT_TRUE(isInStep("one"));
  stopServers();
  for (const std::string store : {"n0", "n1", "n2"}) {
    fs::remove_all(tls(store));
    fs::rename(tls("older/" + store), tls(store));
  }
  startServers();
  joinAndStart("three");
  EXPECT_TRUE(followsOn("three", "one")) << "though the engine had forgotten it";
  EXPECT_TRUE(followsOn("two", "one"));
  EXPECT_EQ(timesLogged("was made anew", "two"), 0u);

  stopServers();
  for (const char* store : {"n0", "n1", "n2"}) fs::remove_all(tls(store));
  ASSERT_TRUE(comesToSay("two", "connected          no"));
  switchTo("two", "off");
  startServers();
  ASSERT_TRUE(isInStep("two"));
  EXPECT_TRUE(followsOff("three"));
  EXPECT_EQ(timesLogged("stream of account home was made anew", "two"), 1u);
}

TEST_F(NatsTest, StoppedServerIsLeftAndWhatItStillHoldsDoesNoHarm) {
  startServers();
  for (const char* name : {"one", "two"}) joinAndStart(name);
  for (const char* name : {"one", "two"}) ASSERT_TRUE(isInStep(name));
  switchTo("one", "on");
  EXPECT_TRUE(followsOn("two", "one"));
  const auto silent = leader();
  ASSERT_TRUE(silent);
  ::kill(servers[*silent].pid, SIGSTOP);
  switchTo("one", "off");
  EXPECT_TRUE(isInStep("one"));
  switchTo("one", "on");
  EXPECT_TRUE(isInStep("one"));
  ::kill(servers[*silent].pid, SIGCONT);
  EXPECT_TRUE(followsOn("two", "one"));
}

TEST_F(NatsTest, OnlyItsUsersComeIntoAnAccountAndOnlyToServersThatAreTrusted) {
  startServers();
  joinAndStart("one");
  ASSERT_TRUE(isInStep("one"));
  const auto refusal = [&](const std::string& at, const std::string& further) {
    write("other.json", "{" + further + "}");
    const Outcome tried =
        run("cat " + (root / "other.json").string() + " | hearthctl --root " + (root / "one").string() +
            " cloud use " + at + " --account home --access /dev/stdin");
    EXPECT_NE(tried.status, 0);
    return tried.errors;
  };
  const std::string trusted = "\"authorities\": \"" + tls("ca.pem") + "\"";
  EXPECT_THAT(refusal(url(), trusted + ", \"password\": \"wrong\""), HasSubstr("Authorization Violation"));
  EXPECT_THAT(refusal(url(), "\"tls\": true, \"password\": \"hp\""), HasSubstr("issuer certificate"));
  EXPECT_THAT(refusal(url("work"), trusted + ", \"password\": \"wp\""), HasSubstr("Permissions Violation"))
      << "each is alone with its account";
  EXPECT_THAT(refusal(url("home:hp"), trusted), HasSubstr("a password does not belong into the URL"));
  EXPECT_THAT(refusal(url(), "\"passwort\": \"hp\""), HasSubstr("\"passwort\" is no field"));
  const auto [silent, port] = listening();
  std::thread halts([&silent = silent] {
    const UniqueDescriptor client(::accept(silent.get(), nullptr, nullptr));
    constexpr std::string_view greeting = "INFO {\"server_id\":\"s\",\"tls_required\":true}\r\n";
    ::send(client.get(), greeting.data(), greeting.size(), MSG_NOSIGNAL);
    pollfd closed{client.get(), POLLRDHUP, 0};
    ::poll(&closed, 1, 20'000);
  });
  EXPECT_THAT(refusal("nats://home@localhost:" + std::to_string(port), trusted), HasSubstr("no answer"))
      << "of a server that goes no further than to say it encrypts";
  halts.join();

  makeCertificate("other", "DNS:elsewhere.example");
  stopServers();
  for (std::size_t number = 0; number < servers.size(); ++number) startServer(number, "other");
  EXPECT_TRUE(comesToSay("one", "hostname mismatch"));
  EXPECT_THAT(cloud("one", "status").output, Not(HasSubstr("hp")));
}

TEST_F(NatsTest, WhatTheEngineHasNoRoomForStaysHere) {
  change("max_payload: 2MB", "max_payload: 8KB");
  change("max_file: 64MB", "max_file: 12KB");
  startServers();
  joinAndStart("one");
  const auto set = [&](const char* size) {
    EXPECT_EQ(run("sh -c 'hearthctl --root " + (root / "one").string() +
                  " settings set cloud big $(head -c " + size + " /dev/zero | tr \"\\0\" x)'")
                  .status,
              0);
  };
  set("9000");
  EXPECT_TRUE(comesToSay("one", "the settings exceed what an account may hold"));
  set("100");
  EXPECT_TRUE(isInStep("one"));
  set("7000");
  EXPECT_TRUE(comesToSay("one", "nothing can be published: stream pairwell-home: "));
  switchTo("one", "on");
  set("100");
  EXPECT_TRUE(isInStep("one"));
}

TEST_F(NatsTest, SwitchWaitsHereWhileTheDiskOfASingleServerIsFull) {
  if (run("unshare -m true").status != 0) GTEST_SKIP() << "no file system of its own to be had";
  const fs::path operators = fs::path(SOURCE_ROOT) / "tests/system/nats";
  write(conf, R"(listen: $NATS_LISTEN, jetstream { store_dir: $NATS_STORE }, include operator.conf
tls { cert_file: $NATS_CERTIFICATE, key_file: $NATS_KEY, verify: true, ca_file: $NATS_AUTHORITIES })");
  fs::copy_file(operators / "operator.conf", tls("operator.conf"));
  makeCertificate("device", "DNS:device");
  write("access.json", R"({"credentials": ")" + (operators / "home.creds").string() +
                           R"(", "authorities": ")" + tls("ca.pem") + R"(", "certificate": ")" +
                           tls("device.pem") + R"(", "key": ")" + tls("device.key") + R"("})");
  fs::create_directory(tls("n0"));
  startServer(0, "server",
              "unshare -m sh -c 'mount -t tmpfs -o size=1m none " + tls("n0") + " && exec \"$@\"' - ");
  const auto joinIt = [&](const std::string& name) {
    EXPECT_EQ(join(name, "nats://localhost:" + std::to_string(servers[0].port), "--access " + access).status,
              0);
    start(name);
    ASSERT_TRUE(isInStep(name));
  };
  joinIt("one");
  const fs::path filled = "/proc/" + std::to_string(servers[0].pid) + "/root" + tls("n0") + "/filled";
  std::ofstream(filled) << std::string(1 << 20, 'x');
  switchTo("one", "on");
  EXPECT_TRUE(comesToSay("one", "no space left on device"));
  fs::remove(filled);
  EXPECT_TRUE(isInStep("one"));
  joinIt("two");
  EXPECT_TRUE(followsOn("two", "one"));
}

// Counts what it is told.
struct Client : cloudsync::TransportClient {
  void connected() override {}
  void disconnected(const std::string&) override {}
  void received(const std::string&, std::string_view) override { ++documents; }
  void unreadable(const std::string&, const std::string&) override {}
  void removed(const std::string&) override { ++removals; }
  void published(const std::error_code&, const std::string&) override {}
  void deadlineMoved() override {}
  std::atomic<int> documents = 0, removals = 0;
};

// Of what a broken route between servers lost nobody hears; nor of a purge, which stands for it here.
TEST_F(NatsTest, StreamIsReadAgainEveryQuarterOfAnHour) {
  using std::chrono::minutes;
  write(conf, "listen: $NATS_LISTEN, jetstream { store_dir: $NATS_STORE }");
  startServer(0);
  const auto say = [&](const std::string& subject, const std::string& text) {
    const UniqueDescriptor raw = connectTo(0);
    const std::string all = "CONNECT {\"verbose\":false}\r\n" + publication(subject, text);
    ::send(raw.get(), all.data(), all.size(), MSG_NOSIGNAL);
    ::shutdown(raw.get(), SHUT_WR);
    pollfd closed{raw.get(), POLLRDHUP, 0};
    ::poll(&closed, 1, 10'000);
  };

  Client client;
  std::atomic<minutes> ahead{minutes(0)};
  const auto now = [&] { return std::chrono::steady_clock::now() + ahead.load(); };
  std::shared_ptr<cloudsync::NatsTransport> transport;
  platform::linux_::ThreadPool loop{1};
  const auto onLoop = [&](const std::function<void()>& work) {
    std::promise<void> done;
    loop.async([&] {
      work();
      done.set_value();
    });
    done.get_future().wait();
  };
  // Until the next reading.
  const auto left = [&] {
    minutes span{-1};
    onLoop([&] {
      transport->timePassed(now());
      if (const auto due = transport->deadline()) span = std::chrono::ceil<minutes>(*due - now());
    });
    return span;
  };
  cloudsync::NatsAccess open;
  open.isEncrypted = false;
  onLoop([&] {
    transport = cloudsync::NatsTransport::create(
        loop, now, {{"127.0.0.1:" + std::to_string(servers[0].port)}, open, "home"});
    transport->start(client);
  });
  EXPECT_TRUE(eventually([&] { return left() == minutes(15); }));
  say("pairwell.home.other", "{}");
  EXPECT_TRUE(eventually([&] { return client.documents == 1; }));
  say("$JS.API.STREAM.PURGE.pairwell-home", "");
  ahead = minutes(14);
  EXPECT_EQ(left(), minutes(1));
  EXPECT_EQ(client.removals, 0);
  ahead = minutes(15);
  EXPECT_TRUE(eventually([&] { return left() == minutes(15) && client.removals == 1; }));
  onLoop([&] { transport.reset(); });
}

// Of whatever has the account's password.
TEST_F(NatsTest, FloodOfOneDeviceKeepsNoOtherWaiting) {
  change("max_payload: 2MB", "allow_non_tls: true");
  write("access.json", "{\"password\": \"hp\"}");
  startServers();
  for (const char* name : {"one", "two"}) joinAndStart(name);
  for (const char* name : {"one", "two"}) ASSERT_TRUE(isInStep(name));
  const UniqueDescriptor flood = connectTo(0);
  const std::string message = publication("pairwell.home.flood", std::string(100'000, '{'));
  const std::string all =
      "CONNECT {\"user\":\"home\",\"pass\":\"hp\",\"verbose\":false,\"pedantic\":false}\r\n";
  std::atomic<bool> isEnough = false;
  std::thread flooder([&] {
    ::send(flood.get(), all.data(), all.size(), MSG_NOSIGNAL);
    while (!isEnough && ::send(flood.get(), message.data(), message.size(), MSG_NOSIGNAL) > 0) {
    }
  });
  EXPECT_TRUE(comesToSay("two", "flood, newest change never, refused: "));
  switchTo("one", "on");
  EXPECT_TRUE(followsOn("two", "one"));
  switchTo("two", "off");
  EXPECT_TRUE(followsOff("one"));
  isEnough = true;
  flooder.join();
  EXPECT_EQ(timesLogged("the document of device flood is refused", "two"), 1u);
  EXPECT_TRUE(eventually([&] {
    return cloud("one", "forget flood").status == 0 &&
           cloud("two", "status").output.find("flood") == std::string::npos;
  })) << "however much of it is still on its way within the servers";
}

}  // namespace
}  // namespace processes
