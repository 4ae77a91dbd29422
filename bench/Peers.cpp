#include "bench/Peers.hpp"

#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <mutex>
#include <stdexcept>
#include <thread>

namespace bench {
namespace {

void check(bool done, const char* what) {
  if (!done) throw std::runtime_error(what);
}

bool readWhole(int descriptor, std::vector<char>& buffer) {
  std::size_t count = 0;
  while (count < buffer.size()) {
    const ssize_t got = ::read(descriptor, buffer.data() + count, buffer.size() - count);
    if (got <= 0) return false;
    count += static_cast<std::size_t>(got);
  }
  return true;
}

[[noreturn]] void answer(int descriptor, std::size_t bytes) {
  std::mutex mutex;
  std::condition_variable arrived;
  bool waiting = false;
  std::thread worker([&] {
    const std::vector<char> reply(bytes);
    for (;;) {
      std::unique_lock lock(mutex);
      arrived.wait(lock, [&] { return waiting; });
      waiting = false;
      lock.unlock();
      if (::write(descriptor, reply.data(), reply.size()) < 0) ::_exit(0);
    }
  });
  std::vector<char> request(bytes);
  while (readWhole(descriptor, request)) {
    std::lock_guard lock(mutex);
    waiting = true;
    arrived.notify_one();
  }
  ::_exit(0);
}

}  // namespace

double now() {
  return std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

std::vector<double> pingPongWithHop(std::size_t rounds, std::size_t bytes) {
  int ends[2];
  check(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) == 0, "socketpair");
  const pid_t child = ::fork();
  check(child >= 0, "fork");
  if (child == 0) {
    ::close(ends[0]);
    answer(ends[1], bytes);
  }
  ::close(ends[1]);
  std::vector<char> buffer(bytes);
  std::vector<double> times;
  for (std::size_t round = 0; round < rounds; ++round) {
    const double start = now();
    check(::write(ends[0], buffer.data(), buffer.size()) == static_cast<ssize_t>(bytes), "write");
    check(readWhole(ends[0], buffer), "read");
    times.push_back(now() - start);
  }
  ::close(ends[0]);
  ::waitpid(child, nullptr, 0);
  return times;
}

std::vector<double> bareDurableWrites(const std::string& folder, std::size_t rounds, int writes) {
  const std::string path = folder + "/bare", temporary = path + ".new";
  const std::string contents(400, 'x');  // about what a store of three keys takes
  const int folderDescriptor = ::open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  check(folderDescriptor >= 0, "open the folder");
  std::vector<double> times;
  for (std::size_t round = 0; round < rounds; ++round) {
    const double start = now();
    for (int write = 0; write < writes; ++write) {
      const int file = ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
      check(file >= 0, "open");
      check(::write(file, contents.data(), contents.size()) == static_cast<ssize_t>(contents.size()),
            "write");
      check(::fsync(file) == 0, "fsync");
      ::close(file);
      check(::rename(temporary.c_str(), path.c_str()) == 0, "rename");
      check(::fsync(folderDescriptor) == 0, "fsync of the folder");
    }
    times.push_back(now() - start);
  }
  ::close(folderDescriptor);
  ::unlink(path.c_str());
  return times;
}

}  // namespace bench
