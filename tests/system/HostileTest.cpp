// Clients that do what they should not, and what an innocent one beside them notices of it: nothing.
#include <sys/resource.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstring>
#include <map>

#include "platform/linux/Paths.hpp"
#include "tests/linux/bus/BusWorld.hpp"
#include "tests/system/Device.hpp"

namespace processes {
namespace {

namespace limits = platform::limits;
using platform::linux_::answerTo;
using platform::linux_::Callee;
using platform::linux_::callMessage;
using platform::linux_::handshakeAhead;
using platform::linux_::number;
using platform::linux_::text;
using platform::linux_::UniqueDescriptor;
using platform::linux_::Wire;

constexpr std::size_t mebibyte = 1024 * 1024;
constexpr const char* clientOption = "--client";

// Bytes, and descriptors beside them.
void pass(int socket, std::string_view bytes, const std::vector<int>& descriptors) {
  std::string control(CMSG_SPACE(descriptors.size() * sizeof(int)), '\0');
  iovec piece{const_cast<char*>(bytes.data()), bytes.size()};
  msghdr message{nullptr, 0, &piece, 1, control.data(), control.size(), 0};
  cmsghdr* const header = CMSG_FIRSTHDR(&message);
  header->cmsg_len = CMSG_LEN(descriptors.size() * sizeof(int));
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  std::memcpy(CMSG_DATA(header), descriptors.data(), descriptors.size() * sizeof(int));
  EXPECT_GT(::sendmsg(socket, &message, MSG_NOSIGNAL), 0);
}
UniqueDescriptor receiveDescriptor(int socket) {
  char byte, control[CMSG_SPACE(sizeof(int))];
  iovec piece{&byte, 1};
  msghdr message{nullptr, 0, &piece, 1, control, sizeof control, 0};
  int descriptor = -1;
  if (::recvmsg(socket, &message, MSG_CMSG_CLOEXEC) > 0 && CMSG_FIRSTHDR(&message))
    std::memcpy(&descriptor, CMSG_DATA(CMSG_FIRSTHDR(&message)), sizeof descriptor);
  return UniqueDescriptor(descriptor);
}

// A client's process: connects to each path that it reads, and hands the socket over; a path at which nobody
// listens is a program, which it becomes.
int runClient(const char* argument) {
  const int control = std::atoi(argument);
  char path[256];
  for (ssize_t size; (size = ::recv(control, path, sizeof path - 1, 0)) > 0;) {
    path[size] = '\0';
    const UniqueDescriptor socket = fakes::socketAt(path, ::connect);
    if (!socket) return ::execl(path, path, clientOption, argument, nullptr);
    pass(control, "x", {socket.get()});
  }
  return 0;
}

// It is a process that is admitted; what it sends is written by the test.
struct Client {
  Client(Device& device, const std::string& command, uid_t user = 0) {
    int ends[2];
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends), 0);
    const UniqueDescriptor theirs(::dup(ends[1]));
    ::close(ends[1]);
    control.reset(ends[0]);
    pid = device.spawn(command + " " + clientOption + " " + std::to_string(theirs.get()), "client", user);
  }
  ~Client() { end(); }
  void end() {
    control.reset();
    if (pid > 0) ::kill(pid, SIGKILL), ::waitpid(std::exchange(pid, 0), nullptr, 0);
  }
  void tell(const std::string& path) const {
    EXPECT_GT(::send(control.get(), path.data(), path.size(), MSG_NOSIGNAL), 0);
  }
  Wire connect(const std::string& path) const {
    tell(path);
    Wire wire("");
    wire.socket = receiveDescriptor(control.get());
    EXPECT_TRUE(wire.socket) << path;
    return wire;
  }
  std::string program() const { return fs::read_symlink("/proc/" + std::to_string(pid) + "/exe"); }

  UniqueDescriptor control;
  pid_t pid;
};

// A daemon's socket, and a process that attacks it.
struct Target {
  std::string name, socket, member;
  Callee callee;
  pid_t daemon = 0;
  std::unique_ptr<Client> guest = nullptr;

  Wire connect() const { return guest->connect(socket); }
  // Admitted, and through the handshake.
  Wire enter() const {
    Wire wire = connect();
    wire.shakeHands();
    return wire;
  }
  std::string call(std::uint32_t serial = 1) const { return callMessage(member, "attack", serial, callee); }
  bool serves(Wire& wire, std::uint32_t serial = 1) const {
    return wire.send(call(serial)) && wire.reads(answerTo(serial));
  }

  fs::directory_iterator inProc(const char* folder) const {
    return fs::directory_iterator("/proc/" + std::to_string(daemon) + folder);
  }
  std::ptrdiff_t openDescriptors() const { return std::distance(inProc("/fd"), {}); }
  // A tenth of a second, almost none of which is spent on a processor.
  bool comesToRest() const {
    std::vector<std::uint64_t> times;
    return eventually([&] {
      std::uint64_t all = 0, one = 0;
      for (const auto& task : inProc("/task"))
        if (std::ifstream(task.path() / "schedstat") >> one) all += one;
      times.push_back(all);
      return times.size() > 20 && all - times[times.size() - 21] < 2'000'000;
    });
  }
  bool isStopped() const {
    return std::all_of(inProc("/task"), {}, [](const auto& task) {
      return contents(task.path() / "stat").find(") T ") != std::string::npos;
    });
  }
};

struct HostileTest : Device {
  HostileTest() {
    EXPECT_EQ(run("hearthctl init --internal").status, 0);
    for (const char* program : {"client", "stranger"})
      fs::copy_file("/proc/self/exe", root / "bin" / program);
    grant("client");
    ::getrlimit(RLIMIT_NOFILE, &descriptors);
    descriptors.rlim_cur = descriptors.rlim_max;
    ::setrlimit(RLIMIT_NOFILE, &descriptors);
    start();
    EXPECT_EQ(run("pairwellctl status").status, 0) << log();
    ofHearthd.daemon = hearthd;
    ofPairwelld.daemon = pairwelld();
    for (Target* target : targets) target->guest = std::make_unique<Client>(*this, "client", attacker);
    innocent = std::make_unique<Client>(*this, "client");
  }
  void grant(const std::string& program, const std::string& narrowing = "") {
    write("etc/entitlements.d/" + program + ".json",
          R"({"executable": "bin/)" + program + "\", " + narrowing +
              R"("entitlements": {"com.kestrel.bluetooth.system": true}})");
  }

  // Calls both daemons once, perhaps on new connections.
  void serveInnocent(bool comesIn) {
    for (const Target* target : targets) {
      std::string bytes = target->call(++serial);
      if (comesIn) {
        innocents.insert_or_assign(target->name, innocent->connect(target->socket));
        bytes.insert(0, handshakeAhead);
      }
      Wire& wire = innocents.at(target->name);
      wire.received.clear();
      const auto start = std::chrono::steady_clock::now();
      EXPECT_GT(wire.sendSome(bytes), 0);
      pollfd entry{wire.socket.get(), POLLIN, 0};
      while (wire.received.find(answerTo(serial)) == std::string::npos) {
        ASSERT_EQ(::poll(&entry, 1, 30'000), 1) << target->name << " does not answer";
        wire.receive();
        ASSERT_FALSE(wire.ended) << target->name;
      }
      const std::chrono::duration<double, std::milli> time = std::chrono::steady_clock::now() - start;
      times[target->name + (comesIn ? " anew" : "")].push_back(time.count());
    }
  }
  // And prints the 99th percentiles.
  void serveInnocentWhile(const char* name, const std::function<bool()>& goesOn) {
    times.clear();
    for (int count = 0; count < 300 || goesOn(); ++count) serveInnocent(count % 10 == 0);
    std::printf("%-22s p99 in ms:", name);
    for (auto& [what, list] : times) {
      std::sort(list.begin(), list.end());
      std::printf("  %s %.2f", what.c_str(), list[list.size() * 99 / 100]);
    }
    std::printf("\n");
  }

  static bool isLetIn(Wire wire) { return wire.send(handshakeAhead) && wire.reads("OK "); }

  // Until SIGCONT: what happens between a client's connecting and the look at it.
  bool pausePairwelld() {
    ::kill(ofPairwelld.daemon, SIGSTOP);
    return eventually([&] { return ofPairwelld.isStopped(); });
  }

  // Attacks, each in a thread of its own for each daemon.
  void damagedMessages(const Target& target) {
    const std::string good = target.call();
    const auto damaged = [&](std::size_t at, const std::string& bytes) {
      return std::string(good).replace(at, bytes.size(), bytes);
    };
    const std::string giant = damaged(4, number(120 * mebibyte));
    const std::pair<const char*, std::string> rows[] = {
        {"giant", giant},
        {"damaged, then giant", damaged(17, "\t") + giant},
        {"no byte order", damaged(0, "x")},
        {"the other byte order", damaged(0, "B")},
        {"another version", damaged(3, "\2")},
        {"descriptors that are not there", damaged(16, "\t")}};
    for (const auto& [name, bytes] : rows) {
      SCOPED_TRACE(name);
      Wire wire = target.enter();
      std::size_t sent = bytes.size();
      // Until the daemon has had enough; what is not damaged in itself it would go on reading.
      for (bool taken = wire.send(bytes + good); taken && sent < 120 * mebibyte; sent += 4096)
        taken = wire.send(std::string(4096, '\0'));
      EXPECT_LT(sent, mebibyte) << "what is not read takes no memory";
      EXPECT_EQ(wire.readToEnd(), "");
    }
  }
  void callsThatDoNotFit(const Target& target) {
    Callee nobodys = target.callee, wrong = target.callee;
    nobodys.path += "/none";
    wrong.signature = "g";
    const std::pair<std::string, std::string> rows[] = {
        {callMessage("Missing", "", 1, target.callee), "Error.UnknownMethod"},
        {callMessage(target.member, "", 1, nobodys), "Error.UnknownObject"},
        {callMessage(target.member, "", 1, wrong), "Error.InvalidArgs"}};
    Wire wire = target.enter();
    for (const auto& [message, answer] : rows)
      EXPECT_TRUE(wire.send(message) && wire.reads(answer)) << answer;
    // What only looks odd is answered, in the server's own order.
    Callee foreign = target.callee;
    foreign.order = std::endian::big;
    EXPECT_TRUE(wire.send(callMessage(target.member, "attack", 0x01020304, foreign)));
    EXPECT_TRUE(wire.reads(answerTo(0x01020304)));
    for (std::uint32_t number = 1; number <= 100; ++number) {
      pass(wire.socket.get(), target.call(number), std::vector<int>(10, STDERR_FILENO));
      EXPECT_TRUE(wire.reads(answerTo(number)));
    }
  }
  void falseHandshakes(const Target& target) {
    std::string blank(1, '\0');
    while (blank.size() < 2000) blank += "\r\n";
    for (const std::string& bytes : {blank, std::string("\0AUTH ", 6) + std::string(mebibyte, 'x'),
                                     std::string("\0AUTH EXTERNAL 31\r\nBEGIN\r\n", 27), target.call()}) {
      Wire wire = target.connect();
      wire.send(bytes + target.call());
      EXPECT_THAT(wire.readToEnd(), testing::Not(HasSubstr("OK ")));
    }
  }
  void silentAndSlowOnes(const Target& target) {
    std::vector<Wire> halfOpen;
    for (int count = 0; count < 30; ++count) {
      halfOpen.push_back(target.connect());
      halfOpen.push_back(target.connect());
      halfOpen.back().send(handshakeAhead.substr(0, 16));
      halfOpen.push_back(target.enter());
      halfOpen.back().send(target.call().substr(0, 40));
    }
    Wire slow = target.enter();
    for (const char byte : target.call()) EXPECT_TRUE(slow.send({&byte, 1}));
    EXPECT_TRUE(slow.reads(answerTo(1)));
    Wire deaf = target.enter();
    const std::string call = target.call();
    std::size_t sent = 0;
    EXPECT_TRUE(eventually([&] {
      ssize_t count;
      while ((count = deaf.sendSome(call.substr(sent % call.size()))) > 0)
        sent += static_cast<std::size_t>(count);
      return errno != EAGAIN;
    })) << "never reads, and is never disconnected";
    EXPECT_LT(sent, 4 * mebibyte);
    for (Wire& wire : halfOpen)
      EXPECT_TRUE(eventually([&] { return wire.sendSome("x") < 0 && errno != EAGAIN; }));
  }
  void twoThousandConnections(const Target& target) {
    if (attacker == 0) GTEST_SKIP() << "2,000 connections: only root can be another user";
    if (descriptors.rlim_max < 4 * limits::connections + 200)
      GTEST_SKIP() << "2,000 connections: this machine allows " << descriptors.rlim_max << " descriptors";
    std::vector<Wire> wires;
    while (wires.size() < 2000) {
      wires.push_back(target.connect());
      wires.back().send(handshakeAhead);
    }
    EXPECT_EQ(std::count_if(wires.begin(), wires.end(), [](Wire& wire) { return wire.reads("OK "); }),
              std::ptrdiff_t{limits::connections / limits::usersShare});
    wires.clear();
    EXPECT_TRUE(eventually([&] { return isLetIn(target.connect()); })) << "those that have gone make room";
  }
  // Sends all, taking the answers as they come.
  static bool sendAll(Wire& wire, const std::string& calls, std::uint32_t last) {
    wire.meanwhile = [&wire] { wire.receive(); };
    const bool answered = wire.send(calls) && wire.reads(answerTo(last));
    wire.meanwhile = [] {};
    return answered;
  }
  void tenThousandCalls(const Target& target) {
    std::string calls;
    for (std::uint32_t number = 1; number <= 10'000; ++number) calls += target.call(number);
    Wire wire = target.enter();
    EXPECT_TRUE(sendAll(wire, calls, 10'000));
  }
  void goneInTheMiddle(const Target& target) {
    std::string calls;
    while (calls.size() < 8 * 1024) calls += target.call();
    for (std::size_t round = 0; round < 50; ++round) {
      target.connect();
      target.enter().send(calls.substr(0, round * 2));
      target.enter().send(calls);
      Wire half = target.enter();
      half.send(calls.substr(0, calls.size() - 40));
      ::shutdown(half.socket.get(), SHUT_WR);
      half.readToEnd();
    }
    Client dying(*this, "client", attacker);
    Wire orphan = dying.connect(target.socket);
    EXPECT_TRUE(orphan.send(std::string(handshakeAhead) + calls));
    dying.end();
    orphan.readToEnd();
  }
  // Each watches all that it may and reads nothing of it, while it is posted.
  void deafWatchers(const Target& target) {
    if (&target != &ofHearthd) return;
    const auto calls = [&](const char* member, std::uint32_t count, std::uint32_t names) {
      std::string all;
      for (std::uint32_t number = 1; number <= count; ++number)
        all += callMessage(member, "name " + std::to_string(number % names), number, target.callee);
      return all;
    };
    Wire greedy = target.enter();
    EXPECT_TRUE(sendAll(greedy, calls("Watch", 10'000, 10'000), 10'000));
    EXPECT_THAT(greedy.received, HasSubstr("Error.LimitsExceeded"));
    std::vector<Wire> deaf;
    while (deaf.size() < 200) {
      deaf.push_back(target.enter());
      EXPECT_TRUE(sendAll(deaf.back(), calls("Watch", 64, 64), 64));
    }
    Wire poster = target.enter();
    EXPECT_TRUE(sendAll(poster, calls("Post", 10'000, 64), 10'000));
  }
  void othersEvents(const Target& target) {
    if (&target != &ofHearthd) return;
    if (attacker == 0) GTEST_SKIP() << "events of others: only root can be another user";
    Callee three = target.callee;
    three.signature = "ssx";
    const std::string date(sizeof(std::int64_t), '\x1f');  // far ahead
    std::string calls;
    for (std::uint32_t number = 1; number <= 10'000; ++number)
      calls += callMessage("SetEvent", text("com.kestrel.alarm") + std::string(2, '\0') + text("any") + date,
                           number, three);
    Wire wire = target.enter();
    EXPECT_TRUE(sendAll(wire, calls, 10'000));
    EXPECT_THAT(wire.received, HasSubstr("hearth.NotPermitted"));
    EXPECT_EQ(run("hearthctl alarms").output, "");
  }
  rlimit descriptors{};
  const uid_t attacker = ::geteuid() == 0 ? nobody : 0;
  const platform::linux_::Paths paths = platform::linux_::Paths::under(root);
  Target ofHearthd{
      "hearthd", paths.hearthdSocket(), "Post", {"/com/kestrel/hearth", "com.kestrel.hearth.Manager", "s"}};
  Target ofPairwelld{"pairwelld",
                     paths.serviceSocket("com.kestrel.pairwell.conduit"),
                     "GetDistributedLoggingStatus",
                     {"/com/kestrel/pairwell/conduit", "com.kestrel.pairwell.RadixUserController", ""}};
  Target* const targets[2] = {&ofHearthd, &ofPairwelld};
  std::unique_ptr<Client> innocent;
  std::map<std::string, Wire> innocents;  // by daemon
  std::map<std::string, std::vector<double>> times;
  std::uint32_t serial = 0;
};

TEST_F(HostileTest, NobodyElseNoticesAnAttackAndNothingIsLeftOfIt) {
  const struct {
    const char* name;
    void (HostileTest::*attack)(const Target&);
  } rows[] = {{"damaged messages", &HostileTest::damagedMessages},
              {"calls that do not fit", &HostileTest::callsThatDoNotFit},
              {"false handshakes", &HostileTest::falseHandshakes},
              {"silent and slow ones", &HostileTest::silentAndSlowOnes},
              {"2,000 connections", &HostileTest::twoThousandConnections},
              {"10,000 calls at once", &HostileTest::tenThousandCalls},
              {"gone in the middle", &HostileTest::goneInTheMiddle},
              {"deaf watchers", &HostileTest::deafWatchers},
              {"events of others", &HostileTest::othersEvents}};
  serveInnocentWhile("nobody else", [] { return false; });
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    const std::ptrdiff_t before[] = {ofHearthd.openDescriptors(), ofPairwelld.openDescriptors()};
    std::atomic<int> attacks{2};
    std::vector<std::thread> attackers;
    for (const Target* target : targets) {
      attackers.emplace_back([&, target] {
        (this->*row.attack)(*target);
        --attacks;
      });
    }
    serveInnocentWhile(row.name, [&] { return attacks > 0; });
    for (std::thread& thread : attackers) thread.join();
    for (int index = 0; index < 2; ++index) {
      EXPECT_TRUE(eventually([&] { return targets[index]->openDescriptors() <= before[index]; }));
      EXPECT_TRUE(targets[index]->comesToRest());
    }
  }
  EXPECT_EQ(timesLogged(" started as process "), 1u);
  EXPECT_FALSE(logged("Too many open files"));
}

TEST_F(HostileTest, WhereDescriptorsAreFewOneUserGetsAShareAndAllOfThemTogetherWait) {
  if (attacker == 0) GTEST_SKIP() << "only root can be other users";
  const rlimit few{256, descriptors.rlim_max};
  for (const Target* target : targets) {
    SCOPED_TRACE(target->name);
    std::vector<std::unique_ptr<Client>> others;
    ::prlimit(target->daemon, RLIMIT_NOFILE, &few, nullptr);
    std::vector<Wire> wires;
    while (wires.size() < 120) wires.push_back(target->connect());
    serveInnocent(true);
    const std::size_t rested = timesLogged("accepting rests");
    for (uid_t user = 1; user < 8; ++user) {
      others.push_back(std::make_unique<Client>(*this, "client", user));
      for (int count = 0; count < 20; ++count) wires.push_back(others.back()->connect(target->socket));
    }
    EXPECT_TRUE(eventually([&] { return timesLogged("accepting rests") > rested; }));
    EXPECT_TRUE(target->comesToRest());
    // Whoever speaks takes more descriptors than while he was silent; he has been promised them.
    for (Wire& wire : wires) wire.send(std::string(handshakeAhead) + target->call());
    for (Wire& wire : wires) {
      const bool isIn = wire.reads("OK ");
      EXPECT_EQ(isIn, isIn && wire.reads(answerTo(1)));
      serveInnocent(false);
      wire.socket.reset();
    }
    serveInnocent(true);
    ::prlimit(target->daemon, RLIMIT_NOFILE, &descriptors, nullptr);
  }
  EXPECT_FALSE(logged("Too many open files"));
}

TEST_F(HostileTest, NobodyPassesForAGrantedProgram) {
  if (attacker == 0) GTEST_SKIP() << "only root can be another user";
  const std::string bin = root / "bin/", client = bin + "client", stranger = bin + "stranger";
  const auto comesIn = [&](const std::string& command, uid_t user = nobody) {
    return isLetIn(Client(*this, command, user).connect(ofPairwelld.socket));
  };
  for (const char* program : {"owned", "old", "new"}) fs::copy_file(client, bin + program);
  grant("owned", R"("uid": 1, )");
  grant("old");
  fs::create_directory(root / "other");
  fs::create_hard_link(stranger, root / "other/client");
  EXPECT_TRUE(comesIn("client"));
  EXPECT_FALSE(comesIn("stranger"));
  EXPECT_FALSE(comesIn(root / "other/client")) << "a granted program's name";
  EXPECT_FALSE(
      comesIn("unshare -m sh -c 'mount --bind $0 $1 && exec $1 $2 $3' " + stranger + " " + client, 0))
      << "a granted program's place, elsewhere";
  EXPECT_TRUE(comesIn("owned", 1));
  EXPECT_FALSE(comesIn("owned"));

  const Client running(*this, "old", nobody);
  Wire inside = running.connect(ofPairwelld.socket);
  inside.shakeHands();
  fs::rename(bin + "new", bin + "old");
  EXPECT_TRUE(ofPairwelld.serves(inside)) << "who is in stays in";
  EXPECT_FALSE(isLetIn(running.connect(ofPairwelld.socket))) << "what runs is granted no longer";
  EXPECT_TRUE(comesIn("old"));

  Client becoming(*this, "stranger", nobody);
  ASSERT_TRUE(pausePairwelld());
  Wire early = becoming.connect(ofPairwelld.socket);
  becoming.tell(client);
  EXPECT_TRUE(eventually([&] { return becoming.program() == client; }));
  ::kill(ofPairwelld.daemon, SIGCONT);
  EXPECT_TRUE(isLetIn(std::move(early))) << "the boundary is the user";
}

TEST_F(HostileTest, AProcessOfTheSameNumberIsAnother) {
  const char* const lastPid = "/proc/sys/kernel/ns_last_pid";
  if (::access(lastPid, W_OK) != 0) GTEST_SKIP() << "only root can choose a process's number";
  ASSERT_TRUE(pausePairwelld());
  Wire stale("");
  std::unique_ptr<Client> successor;
  EXPECT_TRUE(eventually([&] {
    Client gone(*this, "stranger", nobody);
    stale = gone.connect(ofPairwelld.socket);
    stale.send(std::string(handshakeAhead) + ofPairwelld.call());
    const pid_t pid = gone.pid;
    gone.end();
    std::ofstream(lastPid) << pid - 1;
    successor = std::make_unique<Client>(*this, "client", nobody);
    return successor->pid == pid;  // unless somebody else was faster
  }));
  EXPECT_TRUE(eventually([&] { return successor->program() == root / "bin/client"; }));
  ::kill(ofPairwelld.daemon, SIGCONT);
  EXPECT_FALSE(stale.reads("OK "));
}

TEST_F(HostileTest, ALogThatNobodyReadsHoldsNobodyUp) {
  stop();
  const std::string pipe = root / "pipe";
  ASSERT_EQ(::mkfifo(pipe.c_str(), 0600), 0);
  const UniqueDescriptor reader(::open(pipe.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  hearthd = spawn("hearthd 2>" + pipe, "hearthd");
  ASSERT_TRUE(eventually([&] { return run("pairwellctl status").status == 0; }));
  tenThousandCalls(ofPairwelld);
  serveInnocent(true);
  std::string lines(64 * mebibyte / 1024, '\0');
  EXPECT_TRUE(eventually([&] {
    const ssize_t size = ::read(reader.get(), lines.data(), lines.size());
    serveInnocent(false);
    return size > 0 && lines.find(" lines were dropped") < static_cast<std::size_t>(size);
  }));
}

}  // namespace
}  // namespace processes

int main(int count, char** arguments) {
  if (count == 3 && std::string_view(arguments[1]) == processes::clientOption)
    return processes::runClient(arguments[2]);
  testing::InitGoogleMock(&count, arguments);
  return RUN_ALL_TESTS();
}
