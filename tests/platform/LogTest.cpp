#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "platform/linux/UnifiedLog.hpp"

namespace platform::linux_ {
namespace {

// Standard error is a pipe for as long as this lives.
class CapturedStandardError {
 public:
  CapturedStandardError() : original(::dup(STDERR_FILENO)) {
    EXPECT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    ::fcntl(ends[0], F_SETFL, O_NONBLOCK);
    ::dup2(ends[1], STDERR_FILENO);
  }
  ~CapturedStandardError() {
    ::dup2(original, STDERR_FILENO);
    for (const int descriptor : {original, ends[0], ends[1]}) ::close(descriptor);
  }
  std::string read() {
    std::string text;
    char buffer[4096];
    for (ssize_t count; (count = ::read(ends[0], buffer, sizeof buffer)) > 0;)
      text.append(buffer, static_cast<std::size_t>(count));
    return text;
  }

 private:
  int original;
  int ends[2];
};

using testing::HasSubstr;

const LogChannel channel{"com.kestrel.pairwell", "daemon", true}, clear{"com.kestrel.hearth", "files", false};

void write(UnifiedLog& log, const LogChannel& to, std::string_view format, const std::string& text) {
  const LogArgument arguments[] = {text};
  log.write(to, LogLevel::default_, format, arguments);
}

TEST(UnifiedLogTest, OneLineAnEventWithTextsHiddenAndControlsEscapedAtTheLevelAskedFor) {
  ::setenv("HEARTH_LOG_LEVEL", "error", 1);
  CapturedStandardError output;
  UnifiedLog log(true);
  ::unsetenv("HEARTH_LOG_LEVEL");
  EXPECT_FALSE(log.enabled(channel, LogLevel::default_));
  write(log, channel, "Launching pairwelld (%s)", "secret");
  write(log, clear, "cannot read %s", "a\nb\x1b");
  const std::string text = output.read();
  EXPECT_THAT(text, HasSubstr("Z default com.kestrel.pairwell:daemon Launching pairwelld (<private>)\n"));
  EXPECT_THAT(text, HasSubstr("com.kestrel.hearth:files cannot read a\\nb\\x1b\n"));
}

TEST(UnifiedLogTest, AReaderThatStopsLosesLinesAndIsToldHowMany) {
  CapturedStandardError output;
  UnifiedLog log(true);
  const std::string kilobyte(1000, 'x');
  for (int i = 0; i < 200; ++i) write(log, clear, "%s", kilobyte);  // a pipe holds 64 KiB: this returns
  const std::string kept = output.read();
  const auto lines = std::count(kept.begin(), kept.end(), '\n');
  EXPECT_LT(lines, 200);
  EXPECT_EQ(kept.back(), '\n') << "no line is cut";
  write(log, clear, "%s", "after");
  const std::string text = output.read();
  EXPECT_THAT(text, HasSubstr(std::to_string(200 - lines) + " lines were dropped"));
  EXPECT_THAT(text, HasSubstr("after\n"));
}

}  // namespace
}  // namespace platform::linux_
