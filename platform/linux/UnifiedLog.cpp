#include "platform/linux/UnifiedLog.hpp"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <ctime>

namespace platform::linux_ {
namespace {

constexpr std::string_view journalSocket = "/run/systemd/journal/socket";

std::string_view levelName(LogLevel level) {
  switch (level) {
    case LogLevel::info:
      return "info";
    case LogLevel::default_:
      return "default";
    case LogLevel::error:
      return "error";
  }
  return "unknown";
}

// syslog(3)'s numbers, which the journal uses.
char priority(LogLevel level) {
  switch (level) {
    case LogLevel::info:
      return '6';
    case LogLevel::default_:
      return '5';
    case LogLevel::error:
      return '3';
  }
  return '3';
}

std::string escapeControls(std::string_view text) {
  std::string escaped;
  for (const char character : text) {
    const auto byte = static_cast<unsigned char>(character);
    if (byte >= 0x20 && byte != 0x7f) {
      escaped += character;
    } else if (character == '\n') {
      escaped += "\\n";
    } else if (character == '\t') {
      escaped += "\\t";
    } else {
      char buffer[5];
      std::snprintf(buffer, sizeof buffer, "\\x%02x", byte);
      escaped += buffer;
    }
  }
  return escaped;
}

std::string timestamp() {
  timespec now;
  clock_gettime(CLOCK_REALTIME, &now);
  tm parts;
  gmtime_r(&now.tv_sec, &parts);
  char buffer[40];
  const std::size_t length = std::strftime(buffer, sizeof buffer, "%Y-%m-%dT%H:%M:%S", &parts);
  std::snprintf(buffer + length, sizeof buffer - length, ".%03ldZ", now.tv_nsec / 1'000'000);
  return buffer;
}

std::string journalEntry(const LogChannel& channel, LogLevel level, const std::string& message) {
  return "MESSAGE=" + message + "\nPRIORITY=" + priority(level) + "\nSUBSYSTEM=" + channel.subsystem +
         "\nCATEGORY=" + channel.category + "\nSYSLOG_IDENTIFIER=" + program_invocation_short_name + "\n";
}

// At most what a pipe takes whole or not at all.
std::string line(const LogChannel& channel, LogLevel level, const std::string& message) {
  std::string text = timestamp() + ' ' + std::string(levelName(level)) + ' ' + channel.subsystem + ':' +
                     channel.category + ' ' + message;
  if (text.size() > PIPE_BUF - 1) text.replace(PIPE_BUF - 4, std::string::npos, "...");
  return text + '\n';
}

}  // namespace

UnifiedLog::UnifiedLog(bool rootIsSet_) : rootIsSet(rootIsSet_) {
  if (const char* level = std::getenv("HEARTH_LOG_LEVEL")) {
    if (level == levelName(LogLevel::default_)) leastLevel = LogLevel::default_;
    if (level == levelName(LogLevel::error)) leastLevel = LogLevel::error;
  }
  const char* privacy = std::getenv("HEARTH_LOG_PRIVATE");
  showPrivate = privacy && std::string_view(privacy) == "show";
}

void UnifiedLog::write(const LogChannel& channel, LogLevel level, std::string_view format,
                       std::span<const LogArgument> arguments) {
  const std::string message =
      escapeControls(formatLogMessage(format, arguments, channel.textIsPrivate && !showPrivate));
  std::lock_guard lock(mutex);
  if (kind == Kind::unopened) open();
  if (dropped > 0) {
    const LogChannel log{"com.kestrel.hearth", "log", false};
    if (send(log, LogLevel::error, std::to_string(dropped) + " lines were dropped: nobody read them")) {
      dropped = 0;
    }
  }
  if (dropped > 0 || !send(channel, level, message)) ++dropped;
}

void UnifiedLog::open() {
  if (!rootIsSet && ::access(journalSocket.data(), W_OK) == 0) {
    // Not through the journal's library: its calls wait when the journal does not read.
    own.reset(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    journalSocket.copy(address.sun_path, sizeof address.sun_path - 1);
    if (own && ::connect(own.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) {
      kind = Kind::journal;
      return;
    }
    own.reset();
  }
  struct stat status {};
  ::fstat(STDERR_FILENO, &status);
  kind = Kind::other;
  if (S_ISREG(status.st_mode)) kind = Kind::file;
  if (S_ISSOCK(status.st_mode)) kind = Kind::socket;
  if (S_ISFIFO(status.st_mode)) {
    // Opened anew to be non-blocking for us alone: other processes share the inherited one, and may fill it
    // between a poll and a write.
    own.reset(::open("/proc/self/fd/2", O_WRONLY | O_NONBLOCK | O_CLOEXEC));
    if (own) kind = Kind::pipe;
  }
}

bool UnifiedLog::send(const LogChannel& channel, LogLevel level, const std::string& message) {
  return sendBytes(kind == Kind::journal ? journalEntry(channel, level, message)
                                         : line(channel, level, message));
}

bool UnifiedLog::sendBytes(std::string_view bytes) {
  ssize_t sent = -1;
  switch (kind) {
    case Kind::journal:
    case Kind::pipe:
      sent = ::write(own.get(), bytes.data(), bytes.size());
      break;
    case Kind::file:  // it is always ready
      sent = ::write(STDERR_FILENO, bytes.data(), bytes.size());
      break;
    case Kind::socket:
      sent = ::send(STDERR_FILENO, bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
      break;
    case Kind::unopened:
    case Kind::other: {
      // A terminal, or a pipe that may not be opened anew, takes a line when it takes anything.
      pollfd ready{STDERR_FILENO, POLLOUT, 0};
      if (::poll(&ready, 1, 0) > 0 && (ready.revents & POLLOUT)) {
        sent = ::write(STDERR_FILENO, bytes.data(), bytes.size());
      }
      break;
    }
  }
  // A line of which a part was taken, by a stream socket or a full disk, runs into the next; it counts.
  return sent > 0;
}

}  // namespace platform::linux_
