// Preloaded into a device's processes: the Nth system call that one of them makes for its files, alarms or
// jobs fails once. Left out are connections and who is at their other end, the log, and what lies elsewhere.
#include "tests/system/Faults.hpp"

#include <dirent.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

namespace {

using namespace faults;

// Not by the functions that this library replaces.
Control* control() {
  static Control* const mapped = [] {
    const char* path = std::getenv("FAULTS");
    const long file = path ? ::syscall(SYS_openat, AT_FDCWD, path, O_RDWR | O_CLOEXEC) : -1;
    if (file < 0) return static_cast<Control*>(nullptr);
    void* page =
        ::mmap(nullptr, sizeof(Control), PROT_READ | PROT_WRITE, MAP_SHARED, static_cast<int>(file), 0);
    ::close(static_cast<int>(file));
    return page == MAP_FAILED ? nullptr : static_cast<Control*>(page);
  }();
  return mapped;
}

// Of the kernel's, as "anon_inode:inotify", or in the folder of the shared page.
bool isCounted(const std::string& object) {
  static const std::string page = std::getenv("FAULTS"), folder = page.substr(0, page.rfind('/') + 1);
  for (const char* part :
       {"/var/", "/run/", "/share/", "/etc/jobs/", "/etc/device.json/", "/etc/cloud.json/"}) {
    if (object.starts_with(folder) && (object + "/").find(part) != object.npos) return true;
  }
  return object.find(':') != object.npos;
}

std::string of(const char* path) { return path; }
std::string of(int descriptor) {
  char target[256];
  const std::string link = "/proc/self/fd/" + std::to_string(descriptor);
  const ssize_t length = ::readlink(link.c_str(), target, sizeof target);
  const std::string found(target, length < 0 ? 0 : static_cast<std::size_t>(length));
  return found.starts_with("/") || found.ends_with("inotify") ? found : "";
}

// Which failure is due now, with errno set; `kinds` are those that the call can have.
int fails(int kinds, const char* call, const std::string& object) {
  Control* shared = control();
  if (!shared) return none;
  const int error = errno, kind = shared->kind;
  const bool isTheirs = (kinds & kind) != 0 && isCounted(object) &&
                        std::strcmp(program_invocation_short_name, shared->program) == 0;
  const bool isDue = isTheirs && ++shared->calls == shared->failAt;
  if (isDue) std::snprintf(shared->failed, sizeof shared->failed, "%s %s", call, object.c_str());
  errno = isDue ? errorOf(kind) : error;
  return isDue ? kind : none;
}

constexpr int making = full | broken | interrupted | noDescriptor;

}  // namespace

// A result, and -1 for a failure, or a null pointer.
#define FAILING(Result, name, parameters, arguments, kinds, object)                             \
  extern "C" Result name parameters {                                                           \
    static const auto real = reinterpret_cast<Result(*) parameters>(::dlsym(RTLD_NEXT, #name)); \
    if (fails(kinds, #name, object) != none) return Result(-1);                                 \
    return real arguments;                                                                      \
  }

#define OPENING(name)                                                                                     \
  extern "C" int name(const char* path, int flags, ...) {                                                 \
    static const auto real = reinterpret_cast<int (*)(const char*, int, ...)>(::dlsym(RTLD_NEXT, #name)); \
    va_list rest;                                                                                         \
    va_start(rest, flags);                                                                                \
    const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(rest, mode_t) : 0;                                \
    va_end(rest);                                                                                         \
    const bool isNew = (flags & O_CREAT) != 0;                                                            \
    if (fails(isNew ? making : making & ~full, isNew ? #name "+" : #name, path) != none) return -1;       \
    return real(path, flags, mode);                                                                       \
  }

// What is cut short does half of its work, but something.
#define MOVING(name, parameters, size, arguments, halved, kinds)                                 \
  extern "C" ssize_t name parameters {                                                           \
    static const auto real = reinterpret_cast<ssize_t(*) parameters>(::dlsym(RTLD_NEXT, #name)); \
    const int failure = fails(kinds, #name, of(descriptor));                                     \
    if (failure == partial && size > 1) return real halved;                                      \
    if (failure != none && failure != partial) return -1;                                        \
    return real arguments;                                                                       \
  }

OPENING(open)
OPENING(open64)
MOVING(write, (int descriptor, const void* bytes, std::size_t size), size, (descriptor, bytes, size),
       (descriptor, bytes, size / 2), full | broken | interrupted | partial)
// An event of inotify's is not read by half.
MOVING(read, (int descriptor, void* bytes, std::size_t size), size, (descriptor, bytes, size),
       (descriptor, bytes, size), broken | interrupted)
MOVING(pread, (int descriptor, void* bytes, std::size_t size, off_t offset), size,
       (descriptor, bytes, size, offset), (descriptor, bytes, 7, offset), broken | interrupted | partial)
FAILING(int, fsync, (int descriptor), (descriptor), full | broken | interrupted, of(descriptor))
FAILING(int, rename, (const char* from, const char* to) noexcept, (from, to), full | broken, of(from))
FAILING(int, unlink, (const char* path) noexcept, (path), broken, of(path))
FAILING(int, mkdir, (const char* path, mode_t mode) noexcept, (path, mode), full | broken, of(path))
FAILING(int, chmod, (const char* path, mode_t mode) noexcept, (path, mode), broken, of(path))
FAILING(int, stat, (const char* path, struct stat* status) noexcept, (path, status), broken, of(path))
FAILING(int, lstat, (const char* path, struct stat* status) noexcept, (path, status), broken, of(path))
FAILING(int, fstat, (int descriptor, struct stat* status) noexcept, (descriptor, status), broken,
        of(descriptor))
FAILING(int, flock, (int descriptor, int operation) noexcept, (descriptor, operation), broken | interrupted,
        of(descriptor))
FAILING(int, inotify_init1, (int flags) noexcept, (flags), noDescriptor, ":inotify")
FAILING(int, inotify_add_watch, (int descriptor, const char* path, std::uint32_t mask) noexcept,
        (descriptor, path, mask), full | broken, of(path))
FAILING(int, timerfd_create, (int clock, int flags) noexcept, (clock, flags), noDescriptor, ":timer")
FAILING(int, socket, (int domain, int type, int protocol) noexcept, (domain, type, protocol), noDescriptor,
        ":socket")
// One that does not block is a connection's.
FAILING(int, pipe2, (int ends[2], int flags) noexcept, (ends, flags), noDescriptor,
        (flags & O_NONBLOCK) != 0 ? "" : ":pipe")
FAILING(int, accept4, (int listener, sockaddr* address, socklen_t* size, int flags),
        (listener, address, size, flags), noDescriptor | interrupted, ":accept")

extern "C" DIR* opendir(const char* path) {
  static const auto real = reinterpret_cast<DIR* (*)(const char*)>(::dlsym(RTLD_NEXT, "opendir"));
  return fails(broken | noDescriptor, "opendir", path) != none ? nullptr : real(path);
}

// glibc declares no function for this one to C++.
extern "C" long syscall(long number, ...) noexcept {
  static const auto real = reinterpret_cast<long (*)(long, ...)>(::dlsym(RTLD_NEXT, "syscall"));
  long given[6];
  va_list rest;
  va_start(rest, number);
  for (long& argument : given) argument = va_arg(rest, long);
  va_end(rest);
  if (number == SYS_pidfd_open && fails(noDescriptor, "pidfd_open", ":process") != none) return -1;
  return real(number, given[0], given[1], given[2], given[3], given[4], given[5]);
}
