// The program itself, on a temporary root, with small jobs.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/BusClient.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/Paths.hpp"

namespace hearth {
namespace {

namespace fs = std::filesystem;
using platform::List;
using platform::Value;
using platform::linux_::BusClient;
using platform::linux_::BusError;
using platform::linux_::BusReply;
using platform::linux_::hearthInterface;
using testing::ElementsAre;
using testing::HasSubstr;

constexpr std::chrono::seconds patience{20};
constexpr const char* alarmStream = "com.kestrel.alarm";

bool eventually(const std::function<bool()>& condition) {
  const auto end = std::chrono::steady_clock::now() + patience;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > end) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return true;
}

std::string contents(const fs::path& path) {
  std::ifstream file(path);
  return {std::istreambuf_iterator<char>(file), {}};
}

std::vector<std::string> lines(const fs::path& path) {
  std::istringstream text(contents(path));
  std::vector<std::string> all;
  for (std::string line; std::getline(text, line);) all.push_back(line);
  return all;
}

std::int64_t fromNow(double seconds) {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return std::chrono::nanoseconds(now).count() + static_cast<std::int64_t>(seconds * 1e9);
}

class HearthdTest : public testing::Test {
 protected:
  HearthdTest() {
    std::string name = (fs::temp_directory_path() / "hearthdXXXXXX").string();
    root = ::mkdtemp(name.data());
    fs::permissions(root, fs::perms(0755));  // for clients of other users
    fs::create_directories(root / "etc/jobs");
  }
  ~HearthdTest() override {
    if (hearthd > 0) {
      ::kill(hearthd, SIGTERM);
      EXPECT_EQ(exitStatus(), 0) << contents(log());
    }
    fs::remove_all(root);
  }

  fs::path log() const { return root / "log"; }
  void addFile(const std::string& name, const std::string& text) {
    std::ofstream(root / "etc/jobs" / name) << text;
  }
  // A job that runs `script`; `fields` are further ones of its file.
  void addJob(const std::string& name, const std::string& script, const std::string& fields = "") {
    const fs::path program = root / (name + ".sh");
    std::ofstream(program) << "#!/bin/sh\n" << script << '\n';
    fs::permissions(program, fs::perms(0755));
    addFile(name + ".json", R"({"name": ")" + name + R"(", "program": ")" + name + R"(.sh")" + fields + "}");
  }
  void addAlarmJob() {
    addFile("alarms.json",
            R"({"name": "alarms", "program": ")" ALARM_JOB R"(", "streams": ["com.kestrel.alarm"],
            "matching": ["listed"]})");
  }

  pid_t spawn(const fs::path& output) {
    const pid_t pid = ::fork();
    if (pid != 0) return pid;
    const int file = ::open(output.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    ::dup2(file, STDERR_FILENO);
    ::setenv("HEARTH_LOG_LEVEL", "info", 1);
    ::execl(HEARTHD, "hearthd", "--root", root.c_str(), nullptr);
    ::_exit(126);
  }
  void start() {
    fs::remove(log());
    hearthd = spawn(log());
    ASSERT_TRUE(eventually([&] { return contents(log()).find("hearthd: ready\n") != std::string::npos; }))
        << contents(log());
  }
  // As after kill -9: nothing of hearthd's own runs to its end.
  void killHearthd() {
    ::kill(hearthd, SIGKILL);
    exitStatus();
  }
  int exitStatus() {
    int status = 0;
    ::waitpid(hearthd, &status, 0);
    hearthd = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
  }
  bool logged(const std::string& text) const { return contents(log()).find(text) != std::string::npos; }

  BusReply call(const std::string& operation, const List& arguments = {}) {
    const auto socket = platform::linux_::Paths::under(root).hearthdSocket();
    auto client = BusClient::connect(socket, patience);
    if (!client) return BusError{"connect", client.error().message()};
    auto reply = (*client)->call(hearthInterface(), operation, arguments, patience);
    return reply ? *reply : BusReply(BusError{"call", reply.error().message()});
  }
  static std::string describe(const BusReply& reply) {
    if (const auto* error = std::get_if<BusError>(&reply)) return error->name;
    return platform::describe(Value(std::get<List>(reply)));
  }
  // The n-th column of a listing, by the name in its first.
  std::vector<std::string> listed(const std::string& operation, std::size_t column) {
    std::vector<std::string> found;
    const BusReply reply = call(operation);
    const auto* results = std::get_if<List>(&reply);
    if (!results) return {describe(reply)};
    for (const Value& row : *(*results)[0].as<List>()) {
      found.push_back(platform::describe((*row.as<List>())[column]));
    }
    return found;
  }

  fs::path root;
  pid_t hearthd = -1;
};

TEST_F(HearthdTest, JobGetsWhatItsContractAsksFor) {
  addJob("job",
         "(echo pid=$$; cat /proc/self/status; env; ls -l /proc/$$/fd) > $HEARTH_ROOT/seen.part\n"
         "mv $HEARTH_ROOT/seen.part $HEARTH_ROOT/seen; exec sleep 1000",
         R"(, "services": ["com.kestrel.one", "com.kestrel.two"], "environment": {"EXTRA": "a b"})");
  start();
  ASSERT_TRUE(eventually([&] { return fs::exists(root / "seen"); }));
  const std::string seen = contents(root / "seen");
  const std::string pid = seen.substr(4, seen.find('\n') - 4);
  for (const char* line :
       {"CONDUIT_SERVICE_NAME=com.kestrel.one", "EXTRA=a b", "HEARTH_LOG_LEVEL=info", "LISTEN_FDS=4",
        "LISTEN_FDNAMES=com.kestrel.one:com.kestrel.two:hearthd.link:hearthd.life"}) {
    EXPECT_THAT(seen, HasSubstr(std::string(line) + "\n"));
  }
  EXPECT_THAT(seen, HasSubstr("HEARTH_ROOT=" + root.string() + "\n"));
  EXPECT_THAT(seen, HasSubstr("LISTEN_PID=" + pid + "\n"));
  EXPECT_THAT(seen, HasSubstr("SigBlk:\t0000000000000000\n"));
  EXPECT_THAT(seen, HasSubstr("6 -> " + root.string() + "/run/job.life"));
  EXPECT_EQ(::getpgid(std::atoi(pid.c_str())), std::atoi(pid.c_str()));
  // Clients wait: the socket takes them though the job has not read any.
  for (const char* service : {"com.kestrel.one", "com.kestrel.two"}) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = platform::linux_::Paths::under(root).serviceSocket(service);
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    const platform::linux_::UniqueDescriptor client(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    EXPECT_EQ(::connect(client.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  }
}

TEST_F(HearthdTest, BrokenFilesAndMissingProgramsAreNamedAndDisturbNobody) {
  addJob("good", "exec sleep 1000");
  addFile("broken.json", "{\"name\": \"x\",\n  oops}");
  addFile("typed.json", R"({"name": "typed", "program": "p", "streams": "s"})");
  addFile("second.json", R"({"name": "good", "program": "p"})");
  addFile("path.json", R"({"name": "../x", "program": "p"})");
  addFile("missing.json", R"({"name": "missing", "program": "nowhere"})");
  start();
  EXPECT_THAT(listed("ListJobs", 0), ElementsAre("good", "missing"));
  EXPECT_THAT(listed("ListJobs", 1), ElementsAre("running", "waiting"));
  const std::string text = contents(log());
  EXPECT_THAT(text, testing::ContainsRegex("broken.json: .*line 2"));
  EXPECT_THAT(text, HasSubstr("typed.json: \"streams\" is not a list of texts"));
  EXPECT_THAT(text, HasSubstr("second.json: a second job good"));
  EXPECT_THAT(text, HasSubstr("path.json: \"name\" cannot be a file's name"));
  EXPECT_THAT(text, HasSubstr("nowhere: No such file or directory; next start in 100 ms"));
}

TEST_F(HearthdTest, JobThatDiesAtOnceWaitsLongerEachTime) {
  addJob("dies", "echo >> $HEARTH_ROOT/runs; exit 3");
  start();
  ASSERT_TRUE(eventually([&] { return logged("exited with status 3; next start in 400 ms"); }));
  EXPECT_EQ(lines(root / "runs").size(), 3u);
  EXPECT_THAT(listed("ListJobs", 3), ElementsAre("exited with status 3"));
}

TEST_F(HearthdTest, SecondOnTheSameRootIsRefused) {
  start();
  const pid_t second = spawn(root / "second");
  int status = 0;
  ::waitpid(second, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 1);
  EXPECT_THAT(contents(root / "second"), HasSubstr("already running"));
  EXPECT_EQ(describe(call("ListJobs")), "[[]]") << "the first is undisturbed";
}

TEST_F(HearthdTest, OrphansOfAKilledPredecessorAreEndedFirst) {
  // Deaf to its parent's death, as a hung one is; a stopped one would be woken by it.
  addJob("job", "trap '' TERM HUP; echo $$ >> $HEARTH_ROOT/pids; exec sleep 1000");
  start();
  ASSERT_TRUE(eventually([&] { return lines(root / "pids").size() == 1; }));
  const pid_t orphan = std::atoi(lines(root / "pids")[0].c_str());
  killHearthd();
  ASSERT_EQ(::kill(orphan, 0), 0);
  start();
  EXPECT_TRUE(logged("job: ended 1 processes")) << contents(log());
  ASSERT_TRUE(eventually([&] { return lines(root / "pids").size() == 2; }));
  const std::string state = contents("/proc/" + std::to_string(orphan) + "/stat");
  EXPECT_TRUE(state.empty() || state.find(") Z ") != std::string::npos) << state;
}

TEST_F(HearthdTest, StopEndsJobsAlsoTheStubbornAndNotifiesWhenReady) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  (root / "notify").string().copy(address.sun_path, sizeof address.sun_path - 1);
  const platform::linux_::UniqueDescriptor notify(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  ASSERT_EQ(::bind(notify.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  ::setenv("NOTIFY_SOCKET", address.sun_path, 1);
  addJob("stubborn", "trap '' TERM; echo $$ > $HEARTH_ROOT/pid; while :; do sleep 1000; done");
  start();
  ::unsetenv("NOTIFY_SOCKET");
  char message[64] = {};
  ASSERT_GT(::recv(notify.get(), message, sizeof message - 1, MSG_DONTWAIT), 0);
  EXPECT_STREQ(message, "READY=1");
  ASSERT_TRUE(eventually([&] { return lines(root / "pid").size() == 1; }));
  ::kill(hearthd, SIGTERM);
  EXPECT_EQ(exitStatus(), 0);
  EXPECT_TRUE(logged("stubborn did not end when told to: killed"));
  EXPECT_EQ(::kill(std::atoi(lines(root / "pid")[0].c_str()), 0), -1);
}

TEST_F(HearthdTest, JobsAreStoppedStartedAndRestartedByHand) {
  addJob("job", "echo >> $HEARTH_ROOT/runs; exec sleep 1000");
  start();
  const auto becomes = [&](const char* state) {
    return eventually([&] { return listed("ListJobs", 1) == std::vector<std::string>{state}; });
  };
  EXPECT_EQ(describe(call("ControlJob", {"restart", "job"})), "[]");
  EXPECT_TRUE(eventually([&] { return lines(root / "runs").size() == 2; }));
  EXPECT_EQ(describe(call("ControlJob", {"stop", "job"})), "[]");
  EXPECT_TRUE(becomes("stopped"));
  EXPECT_EQ(describe(call("ControlJob", {"start", "job"})), "[]");
  EXPECT_TRUE(becomes("running"));
  EXPECT_EQ(describe(call("ControlJob", {"start", "nobody"})), "com.kestrel.hearth.UnknownJob");
  EXPECT_EQ(describe(call("ControlJob", {"shake", "job"})), "org.freedesktop.DBus.Error.InvalidArgs");
}

TEST_F(HearthdTest, AlarmsOutliveEverythingAndGoWhenTaken) {
  addAlarmJob();
  start();
  call("SetEvent", {alarmStream, "far", fromNow(3600)});
  call("SetEvent", {alarmStream, "soon", fromNow(0.2)});
  ASSERT_TRUE(eventually([&] { return lines(root / "events").size() == 1; }));
  EXPECT_TRUE(eventually([&] { return listed("ListAlarms", 2) == std::vector<std::string>{"far"}; }));
  killHearthd();
  start();
  EXPECT_THAT(listed("ListAlarms", 2), ElementsAre("far"));
  EXPECT_EQ(describe(call("CancelAlarm", {"far"})), "[1]");
  EXPECT_THAT(listed("ListAlarms", 2), ElementsAre());
  EXPECT_THAT(lines(root / "events"), ElementsAre("com.kestrel.alarm soon"));
}

TEST_F(HearthdTest, OverdueAlarmComesASecondAfterTheJobIsThere) {
  addAlarmJob();
  start();
  call("ControlJob", {"stop", "alarms"});
  ASSERT_TRUE(eventually([&] { return listed("ListJobs", 1) == std::vector<std::string>{"stopped"}; }));
  call("SetEvent", {alarmStream, "missed", fromNow(-60)});
  fs::remove(root / "installed");
  const auto before = std::chrono::steady_clock::now();
  call("ControlJob", {"start", "alarms"});
  ASSERT_TRUE(eventually([&] { return lines(root / "events").size() == 1; }));
  EXPECT_GE(std::chrono::steady_clock::now() - before, std::chrono::seconds(1));
}

TEST_F(HearthdTest, DamagedAlarmFileIsMovedAside) {
  addAlarmJob();
  fs::create_directories(root / "var/hearthd");
  std::ofstream(root / "var/hearthd/alarms.json") << "{\"alarms\": [";
  start();
  EXPECT_TRUE(logged("alarms.json: "));
  EXPECT_EQ(contents(root / "var/hearthd/alarms.json.damaged-1"), "{\"alarms\": [");
  call("SetEvent", {alarmStream, "new", fromNow(3600)});
  EXPECT_THAT(listed("ListAlarms", 2), ElementsAre("new"));
}

TEST_F(HearthdTest, EventsReachJobsThatListThemOrByHand) {
  addAlarmJob();
  start();
  call("Post", {"unlisted"});
  call("Post", {"listed"});
  ASSERT_TRUE(eventually([&] { return lines(root / "events").size() == 1; }));
  call("DeliverEvent", {alarmStream, "hand"});
  ASSERT_TRUE(eventually([&] { return lines(root / "events").size() == 2; }));
  EXPECT_THAT(lines(root / "events"),
              ElementsAre("com.kestrel.tidingsd.matching listed", "com.kestrel.alarm hand"));
  EXPECT_EQ(describe(call("DeliverEvent", {"com.kestrel.other", "x"})), "com.kestrel.hearth.UnknownStream");
}

TEST_F(HearthdTest, SocketGivesNoJobsRightsAndStrangersOnlyPostAndWatch) {
  addAlarmJob();
  start();
  EXPECT_EQ(describe(call("InstallHandler", {alarmStream})), "com.kestrel.hearth.NotPermitted");
  EXPECT_EQ(describe(call("Taken", {alarmStream, "x", std::int64_t{1}})), "com.kestrel.hearth.NotPermitted");
  if (::geteuid() != 0) GTEST_SKIP() << "only root can be another user";
  const pid_t stranger = ::fork();
  if (stranger == 0) {
    if (::setgid(65534) < 0 || ::setuid(65534) < 0) ::_exit(100);
    int wrong = 0;
    const std::string refused = "com.kestrel.hearth.NotPermitted";
    if (describe(call("Post", {"listed"})) != "[]") wrong |= 1;
    if (describe(call("SetEvent", {alarmStream, "x", std::int64_t{1}})) != refused) wrong |= 2;
    if (describe(call("ClearEvent", {alarmStream, "x"})) != refused) wrong |= 4;
    if (describe(call("DeliverEvent", {alarmStream, "x"})) != refused) wrong |= 8;
    if (describe(call("ControlJob", {"stop", "alarms"})) != refused) wrong |= 16;
    if (describe(call("CancelAlarm", {"x"})) != refused) wrong |= 32;
    ::_exit(wrong);
  }
  int status = 0;
  ::waitpid(stranger, &status, 0);
  EXPECT_EQ(WIFEXITED(status) ? WEXITSTATUS(status) : -1, 0);
}

}  // namespace
}  // namespace hearth
