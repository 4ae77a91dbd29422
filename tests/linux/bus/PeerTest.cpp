// Who is at the other end, and what the administrator grants him.
#include <sys/stat.h>
#include <sys/wait.h>

#include "platform/linux/Entitlements.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/PeerIdentity.hpp"
#include "tests/linux/bus/BusWorld.hpp"

namespace platform::linux_ {
namespace {

namespace fs = std::filesystem;
using testing::HasSubstr;

constexpr uid_t nobody = 65534;
constexpr int unknownOption = 9999;  // as SO_PEERPIDFD to older kernels

PeerIdentity::Executable executableAt(const std::string& path) {
  struct stat status {};
  EXPECT_EQ(::stat(path.c_str(), &status), 0);
  return {status.st_dev, status.st_ino};
}

TEST(PeerIdentityTest, IsTheSameWithAndWithoutTheKernelsHandle) {
  int ends[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
  const UniqueDescriptor one(ends[0]), other(ends[1]);
  for (const int option : {peerPidfdOption, unknownOption}) {
    const PeerIdentity peer = establishPeer(one.get(), option);
    EXPECT_TRUE(peer.pid == ::getpid() && peer.uid == ::getuid() && peer.gid == ::getgid() && peer.process);
    EXPECT_EQ(peer.executable, executableAt("/proc/self/exe"));
  }
  EXPECT_FALSE(establishPeer(-1).executable);
}

TEST(PeerIdentityTest, AProcessThatHasEndedHasNoExecutable) {
  const TemporaryFolder folder;
  const UniqueDescriptor listener = listenAt(folder.path + "/socket");
  for (const bool reaped : {false, true}) {
    const pid_t child = ::fork();
    if (child == 0) ::_exit(!fakes::socketAt(folder.path + "/socket", ::connect));
    siginfo_t ended{};
    ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(child), &ended, WEXITED | (reaped ? 0 : WNOWAIT)), 0);
    const UniqueDescriptor socket(::accept(listener.get(), nullptr, nullptr));
    for (const int option : {peerPidfdOption, unknownOption})
      EXPECT_FALSE(establishPeer(socket.get(), option).executable) << reaped << option;
    ::waitpid(child, nullptr, 0);
  }
}

// A root with one grant, of bin/prog.
struct EntitlementsTest : testing::Test {
  EntitlementsTest() {
    fs::create_directories(root + "/bin");
    fs::create_directories(paths.entitlements());
    write(program, "a program");
    write(grant, R"({"executable": "bin/prog", "entitlements": {"name": true}})");
  }
  static void write(const std::string& file, const std::string& text) { std::ofstream(file) << text; }
  std::string problem() { return readGrants(files, paths).front().problem; }
  std::string granted(const PeerIdentity& peer) { return describe(entitlements.of(peer)); }

  TemporaryFolder folder;
  const std::string root = folder.path;
  const Paths paths = Paths::under(root);
  const std::string grant = paths.entitlements() + "/a.json";
  const std::string program = root + "/bin/prog";
  LinuxFileSystem files{nullptr};
  Entitlements entitlements{files, paths};
};

TEST_F(EntitlementsTest, CountOnlyIfNobodyElseCanChangeThem) {
  const std::string open = root + "/open";
  const auto execute = [&](const std::string& path) {
    write(grant, R"({"executable": ")" + path + R"(", "entitlements": {}})");
  };
  fs::create_directory(open);
  fs::copy_file(program, open + "/prog");
  fs::create_directory(open + "/inner");
  ::chmod(open.c_str(), 0777);
  fs::create_symlink("../bin/prog", open + "/link");
  fs::create_symlink("bin/prog", root + "/link");
  fs::create_symlink("open/inner", root + "/inner");
  fs::create_symlink("loop", root + "/loop");
  const struct {
    const char* name;
    std::function<void()> change;
    std::string problem;
  } rows[] = {
      {"writable file", [&] { ::chmod(grant.c_str(), 0666); }, "a.json can be written by others"},
      {"sound again", [&] { ::chmod(grant.c_str(), 0644); }, ""},
      {"the group's program", [&] { ::chmod(program.c_str(), 0775); }, "bin/prog can be written by others"},
      {"writable folder", [&] { ::chmod(program.c_str(), 0755), ::chmod((root + "/bin").c_str(), 0777); },
       "bin can be written by others"},
      {"sticky folder", [&] { ::chmod((root + "/bin").c_str(), 01777); }, ""},
      {"link", [&] { execute("link"); }, ""},
      {"link in a folder of others", [&] { execute("open/link"); }, "open can be written by others"},
      {"above a link's target", [&] { execute("inner/../prog"); }, "open can be written by others"},
      {"loop", [&] { execute("loop"); }, "too many links"},
      {"missing", [&] { execute("bin/none"); }, "bin/none: No such file"},
      {"no program", [&] { write(grant, R"({"entitlements": {}})"); }, "\"executable\" is not"},
      {"a NUL", [&] { execute("bin/prog\\u0000"); }, "\"executable\" is not"},
      {"no entitlements", [&] { write(grant, R"({"executable": "bin/prog", "entitlements": []})"); },
       "\"entitlements\" is not"},
      {"group below 0", [&] { write(grant, R"({"executable": "bin/prog", "gid": -1})"); }, "\"gid\" is not"},
  };
  for (const auto& row : rows) {
    row.change();
    EXPECT_THAT(problem(), HasSubstr(row.problem)) << row.name;
    EXPECT_EQ(problem().empty(), row.problem.empty()) << row.name;
  }
  if (::getuid() != 0) return;  // only root gives things away
  execute("bin/prog");
  for (const std::string& file : {program, grant}) {
    EXPECT_EQ(::chown(file.c_str(), nobody, nobody), 0);
    EXPECT_THAT(problem(), HasSubstr(file + " belongs to another user"));
    EXPECT_EQ(::chown(file.c_str(), 0, 0), 0);
  }
}

TEST_F(EntitlementsTest, BelongToTheProgramOfTheUserThatTheyName) {
  fs::create_hard_link(program, root + "/hard");
  fs::copy_file(program, root + "/copy");
  PeerIdentity peer;
  peer.uid = 1000;
  peer.gid = 100;
  EXPECT_EQ(granted(peer), "[:]") << "an executable that is not known is none";
  peer.executable = executableAt(root + "/copy");
  EXPECT_EQ(granted(peer), "[:]");
  peer.executable = executableAt(root + "/hard");
  EXPECT_EQ(granted(peer), R"(["name": true])");
  const auto add = [&](const std::string& file, const std::string& narrowing) {
    write(paths.entitlements() + "/" + file,
          R"({"executable": "bin/prog", )" + narrowing + R"( "entitlements": {"name": ")" + file + "\"}}");
  };
  add("b.json", R"("uid": 1000, "gid": 100,)");
  add("c.json", R"("uid": 1001,)");
  add("d.json", R"("gid": 101,)");
  add("e.text", "");
  EXPECT_EQ(granted(peer), R"(["name": "b.json"])");
  add("f.json", "nonsense");
  EXPECT_EQ(granted(peer), R"(["name": "b.json"])");
  ::chmod(program.c_str(), 0777);
  EXPECT_EQ(granted(peer), "[:]") << "others can change it";
}

}  // namespace
}  // namespace platform::linux_
