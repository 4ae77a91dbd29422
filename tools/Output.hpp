// What the command lines print: results on standard output, everything else on standard error.
#pragma once

#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "platform/LogSink.hpp"
#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/BusServer.hpp"

namespace tools {

enum Exit { done = 0, failed = 1, wrongUsage = 2, unreachable = 3, refused = 4 };

// Results, each an object for programs and cells of a line for people. Objects are printed at once, lines
// when all their widths are known.
class Output {
 public:
  explicit Output(bool json_) : json(json_) {}
  void add(const platform::Dictionary& object, std::vector<std::string> cells);
  // A further line for people of the object added last.
  void addLine(std::vector<std::string> cells) {
    if (!json) rows.push_back(std::move(cells));
  }
  // Prints the lines that were added, in columns.
  void print();

 private:
  const bool json;
  std::vector<std::vector<std::string>> rows;
};

// One line, the program's name and the text.
void say(const std::string& text);
// Says what went wrong with `file`.
Exit fail(const std::string& file, std::error_code error);
// Says what went wrong with a question to `service`: what it answered, or the error; the exit code of that.
Exit fail(const std::string& service, std::error_code error, const std::string& answer);

// The results of a call, or its error; `answer` gets what the service itself said, if the error is of that
// kind.
platform::Result<platform::List> resultsOf(platform::Result<platform::linux_::BusReply> reply,
                                           std::string& answer);

// Local time as 2026-01-31T23:59:59+0100; a number where no calendar has the moment.
std::string describeTime(double secondsSince1970);

// Errors of the platform's own pieces, said as ours.
class SayingLog : public platform::LogSink {
 public:
  bool enabled(const platform::LogChannel&, platform::LogLevel level) override {
    return level == platform::LogLevel::error;
  }
  void write(const platform::LogChannel&, platform::LogLevel, std::string_view format,
             std::span<const platform::LogArgument> arguments) override {
    say(platform::formatLogMessage(format, arguments, false));
  }
};

}  // namespace tools
