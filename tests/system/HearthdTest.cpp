// The service manager, with small jobs.
#include "platform/linux/BusClient.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/Paths.hpp"
#include "tests/system/Device.hpp"

namespace processes {
namespace {

using platform::List;
using platform::Value;
using platform::linux_::BusClient;
using platform::linux_::BusError;
using platform::linux_::BusReply;

constexpr const char* alarmStream = "com.kestrel.alarm";

std::int64_t fromNow(double seconds) {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return std::chrono::nanoseconds(now).count() + static_cast<std::int64_t>(seconds * 1e9);
}

struct HearthdTest : Device {
  using Texts = std::vector<std::string>;

  // A job that runs `script`; `fields` are further ones of its file.
  void addJob(const std::string& name, const std::string& script, const std::string& fields = "") {
    write(name + ".sh", "#!/bin/sh\n" + script + "\n");
    fs::permissions(root / (name + ".sh"), fs::perms(0755));
    write("etc/jobs/" + name + ".json",
          R"({"name": ")" + name + R"(", "program": ")" + name + R"(.sh")" + fields + "}");
  }
  void startWithAlarmJob() {
    write("etc/jobs/alarms.json",
          R"({"name": "alarms", "program": ")" PROGRAMS
          R"(/alarm_job", "streams": ["com.kestrel.alarm"], "matching": ["listed"]})");
    start();
  }
  // The lines of a file of the root.
  Texts lines(const char* file) const {
    std::ifstream text(root / file);
    Texts all;
    for (std::string line; std::getline(text, line);) all.push_back(line);
    return all;
  }
  // The process whose number is the file's last line.
  pid_t processIn(const char* file, std::size_t lineCount) {
    EXPECT_TRUE(eventually([&] { return lines(file).size() == lineCount; })) << log();
    return std::atoi(lines(file).back().c_str());
  }

  // The results, or the error's name.
  std::string call(const std::string& operation, const List& arguments = {}) {
    const BusReply reply = askHearthd(root, operation, arguments);
    if (const auto* error = std::get_if<BusError>(&reply)) return error->name;
    return platform::describe(Value(std::get<List>(reply)));
  }
  // The n-th column of a listing, by the name in its first.
  Texts listed(const std::string& operation, std::size_t column) {
    Texts found;
    const BusReply reply = askHearthd(root, operation);
    for (const Value& row : *std::get<List>(reply)[0].as<List>())
      found.push_back(platform::describe((*row.as<List>())[column]));
    return found;
  }
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
  for (const std::string& line :
       Texts{"CONDUIT_SERVICE_NAME=com.kestrel.one", "EXTRA=a b", "HEARTH_LOG_LEVEL=info",
             "HEARTH_ROOT=" + root.string(), "LISTEN_FDS=4", "LISTEN_PID=" + pid,
             "LISTEN_FDNAMES=com.kestrel.one:com.kestrel.two:hearthd.link:hearthd.life",
             "SigBlk:\t0000000000000000", "6 -> " + root.string() + "/run/job.life"})
    EXPECT_THAT(seen, HasSubstr(line + "\n"));
  EXPECT_EQ(::getpgid(std::atoi(pid.c_str())), std::atoi(pid.c_str()));
  // Clients wait: the socket takes them though the job has not read any.
  for (const char* service : {"com.kestrel.one", "com.kestrel.two"})
    EXPECT_TRUE(fakes::socketAt(platform::linux_::Paths::under(root).serviceSocket(service), ::connect));
}

TEST_F(HearthdTest, BrokenFilesAndJobsAreNamedAndDisturbNobody) {
  addJob("good", "exec sleep 1000");
  addJob("dies", "echo >> $HEARTH_ROOT/runs; exit 3");
  const struct {
    const char *file, *text, *problem;
  } rows[] = {
      {"broken.json", "{\"name\": \"x\",\n  oops}", ": line 2"},
      {"typed.json", R"({"name": "typed", "program": "p", "streams": "s"})",
       ": \"streams\" is not a list of texts"},
      {"second.json", R"({"name": "good", "program": "p"})", ": a second job good"},
      {"path.json", R"({"name": "../x", "program": "p"})", ": \"name\" cannot be a file's name"},
  };
  for (const auto& row : rows) write(fs::path("etc/jobs") / row.file, row.text);
  fs::create_directory(root / "etc/jobs/folder.json");
  fs::create_symlink("nowhere", root / "etc/jobs/link.json");
  write("etc/jobs/long.json",
        R"({"name": "long", "program": "p", "services": [")" + std::string(200, 's') + R"("]})");
  write("etc/jobs/taken.json", R"({"name": "taken", "program": "p", "services": ["folder"]})");
  fs::create_directories(root / "run/folder.sock");
  write("etc/jobs/missing.json", R"({"name": "missing", "program": "nowhere"})");
  start();
  EXPECT_THAT(listed("ListJobs", 0), ElementsAre("dies", "good", "missing"));
  ASSERT_TRUE(eventually([&] { return logged("exited with status 3; next start in 400 ms"); }));
  EXPECT_EQ(lines("runs").size(), 3u);
  EXPECT_THAT(listed("ListJobs", 1), ElementsAre("waiting", "running", "waiting"));
  EXPECT_EQ(listed("ListJobs", 3)[0], "exited with status 3");
  for (const auto& row : rows) {
    EXPECT_THAT(log(), HasSubstr(std::string(row.file) + row.problem));
  }
  EXPECT_THAT(log(),
              AllOf(HasSubstr("folder.json: Is a directory; the file is skipped"),
                    HasSubstr("link.json: No such file or directory; the file is skipped"),
                    HasSubstr("folder.sock: Is a directory"), HasSubstr("s.sock: File name too long")));
  EXPECT_THAT(log(), HasSubstr("nowhere: No such file or directory; next start in 100 ms"));
}

TEST_F(HearthdTest, SecondOnTheSameRootIsRefused) {
  start();
  const Outcome second = run("hearthd");
  EXPECT_EQ(second.status, 1);
  EXPECT_THAT(second.errors, HasSubstr("already running"));
  EXPECT_EQ(call("ListJobs"), "[[]]") << "the first is undisturbed";
}

TEST_F(HearthdTest, OrphansOfAKilledPredecessorAreEndedFirst) {
  // Deaf to its parent's death, as a hung one is; a stopped one would be woken by it.
  addJob("job", "trap '' TERM HUP; echo $$ >> $HEARTH_ROOT/pids; exec sleep 1000");
  start();
  const pid_t orphan = processIn("pids", 1);
  stop(SIGKILL);
  ASSERT_EQ(::kill(orphan, 0), 0);
  start();
  EXPECT_TRUE(logged("job: ended 1 processes")) << log();
  EXPECT_NE(processIn("pids", 2), orphan);
  const std::string state = contents("/proc/" + std::to_string(orphan) + "/stat");
  EXPECT_TRUE(state.empty() || state.find(") Z ") != std::string::npos) << state;
}

TEST_F(HearthdTest, StopEndsJobsAlsoTheStubbornAndNotifiesWhenReady) {
  const std::string path = root / "notify";
  const auto notify = fakes::socketAt(path, ::bind, SOCK_DGRAM);
  ASSERT_TRUE(notify);
  ::setenv("NOTIFY_SOCKET", path.c_str(), 1);
  addJob("stubborn", "trap '' TERM; echo $$ > $HEARTH_ROOT/pid; while :; do sleep 1000; done");
  start();
  ::unsetenv("NOTIFY_SOCKET");
  char message[64] = {};
  // The line on standard error comes before it.
  ASSERT_TRUE(
      eventually([&] { return ::recv(notify.get(), message, sizeof message - 1, MSG_DONTWAIT) > 0; }));
  EXPECT_STREQ(message, "READY=1");
  const pid_t job = processIn("pid", 1);
  EXPECT_EQ(stop(), 0);
  EXPECT_TRUE(logged("stubborn did not end when told to: killed"));
  EXPECT_EQ(::kill(job, 0), -1);
}

TEST_F(HearthdTest, AlarmsOutliveEverythingAndEventsReachTheirJobs) {
  write("var/hearthd/alarms.json", "{\"alarms\": [");
  startWithAlarmJob();
  EXPECT_TRUE(logged("alarms.json: "));
  EXPECT_EQ(contents(root / "var/hearthd/alarms.json.damaged-1"), "{\"alarms\": [");
  call("SetEvent", {alarmStream, "far", fromNow(3600)});
  call("SetEvent", {alarmStream, "soon", fromNow(0.2)});
  ASSERT_TRUE(eventually([&] { return lines("events").size() == 1; }));
  EXPECT_TRUE(eventually([&] { return listed("ListAlarms", 2) == Texts{"far"}; }));
  stop(SIGKILL);
  start();
  EXPECT_THAT(listed("ListAlarms", 2), ElementsAre("far"));
  // One that the disk refuses is stored when it can be, though nothing else happens.
  const fs::path inTheWay = root / "var/hearthd/alarms.json.new";
  fs::create_directory(inTheWay);
  call("SetEvent", {alarmStream, "refused", fromNow(3600)});
  fs::remove(inTheWay);
  const auto isStored = [&] {
    return contents(root / "var/hearthd/alarms.json").find("refused") != std::string::npos;
  };
  EXPECT_FALSE(isStored());
  EXPECT_TRUE(eventually(isStored));
  EXPECT_EQ(call("CancelAlarm", {"refused"}), "[1]");
  EXPECT_EQ(call("CancelAlarm", {"far"}), "[1]");
  EXPECT_THAT(listed("ListAlarms", 2), ElementsAre());
  EXPECT_THAT(lines("events"), ElementsAre("com.kestrel.alarm soon"));
  // The other events of a job.
  call("Post", {"unlisted"});
  call("Post", {"listed"});
  ASSERT_TRUE(eventually([&] { return lines("events").size() == 2; }));
  call("DeliverEvent", {alarmStream, "hand"});
  ASSERT_TRUE(eventually([&] { return lines("events").size() == 3; }));
  EXPECT_EQ(lines("events")[1], "com.kestrel.tidingsd.matching listed");
  EXPECT_EQ(lines("events")[2], "com.kestrel.alarm hand");
}

TEST_F(HearthdTest, SocketGivesNoJobsRightsAndStrangersOnlyPostAndWatch) {
  const std::string refused = "com.kestrel.hearth.NotPermitted";
  startWithAlarmJob();
  EXPECT_EQ(call("InstallHandler", {alarmStream}), refused);
  EXPECT_EQ(call("Taken", {alarmStream, "x", std::int64_t{1}}), refused);
  if (::geteuid() != 0) GTEST_SKIP() << "only root can be another user";
  const std::pair<const char*, List> operations[] = {{"SetEvent", {alarmStream, "x", std::int64_t{1}}},
                                                     {"ClearEvent", {alarmStream, "x"}},
                                                     {"DeliverEvent", {alarmStream, "x"}},
                                                     {"ControlJob", {"stop", "alarms"}},
                                                     {"CancelAlarm", {"x"}}};
  const pid_t stranger = ::fork();
  if (stranger == 0) {
    if (::setgid(nobody) < 0 || ::setuid(nobody) < 0) ::_exit(100);
    int wrong = call("Post", {"listed"}) != "[]";
    for (const auto& [operation, arguments] : operations)
      wrong = wrong * 2 + (call(operation, arguments) != refused);
    ::_exit(wrong);
  }
  EXPECT_EQ(finish(stranger, "stranger").status, 0);
}

}  // namespace
}  // namespace processes
