#include "tools/Output.hpp"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <ctime>

#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/Json.hpp"

namespace tools {
namespace {

void printLine(const std::string& line) {
  std::printf("%s\n", line.c_str());
  std::fflush(stdout);
}

}  // namespace

void Output::add(const platform::Dictionary& object, std::vector<std::string> cells) {
  if (!json) {
    rows.push_back(std::move(cells));
    return;
  }
  const auto line = platform::linux_::printJson(object, platform::linux_::JsonStyle::line);
  if (line) {
    printLine(*line);
  } else {
    say("a result cannot be printed: " + line.error().message());
  }
}

void Output::print() {
  // A last cell needs no width: it may be a long text among short ones.
  std::vector<std::size_t> widths;
  for (const auto& row : rows) {
    widths.resize(std::max(widths.size(), row.size()));
    for (std::size_t column = 0; column + 1 < row.size(); ++column) {
      widths[column] = std::max(widths[column], row[column].size());
    }
  }
  for (const auto& row : rows) {
    std::string line;
    for (std::size_t column = 0; column < row.size(); ++column) {
      line += row[column];
      if (column + 1 < row.size()) line.append(widths[column] - row[column].size() + 2, ' ');
    }
    printLine(line.substr(0, line.find_last_not_of(' ') + 1));
  }
  rows.clear();
}

void say(const std::string& text) {
  std::fprintf(stderr, "%s: %s\n", ::program_invocation_short_name, text.c_str());
}

platform::Result<platform::List> resultsOf(platform::Result<platform::linux_::BusReply> reply,
                                           std::string& answer) {
  if (!reply) return reply.error();
  if (auto* results = std::get_if<platform::List>(&*reply)) return std::move(*results);
  const auto& error = std::get<platform::linux_::BusError>(*reply);
  answer = error.message.empty() ? error.name : error.message;
  if (error.name == platform::linux_::notPermittedError) return platform::Outcome::notPermitted;
  return std::make_error_code(std::errc::protocol_error);
}

Exit fail(const std::string& file, std::error_code error) {
  say(file + ": " + error.message());
  return failed;
}

Exit fail(const std::string& service, std::error_code error, const std::string& answer) {
  const std::string hint = error == platform::Outcome::notConnected ? "; is hearthd running?" : "";
  say(service + ": " + (answer.empty() ? error.message() : answer) + hint);
  if (error == platform::Outcome::notPermitted) return refused;
  const bool isAbsent = error == platform::Outcome::notConnected || error == platform::Outcome::timedOut ||
                        error == std::errc::permission_denied;
  return isAbsent ? unreachable : failed;
}

std::string describeTime(double secondsSince1970) {
  constexpr double farAway = 2e11;  // the year 8307
  const auto seconds = static_cast<std::time_t>(std::clamp(secondsSince1970, -farAway, farAway));
  std::tm local{};
  char text[40];
  if (!(std::abs(secondsSince1970) < farAway) || !::localtime_r(&seconds, &local) ||
      std::strftime(text, sizeof text, "%FT%T%z", &local) == 0) {
    return platform::describe(secondsSince1970);
  }
  return text;
}

}  // namespace tools
