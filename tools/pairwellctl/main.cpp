// pairwellctl: the daemon's client on the command line.
#include <CLI/CLI.hpp>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <string>

#include "pairwelld/service/RadixDistributedDebugLogging.hpp"
#include "platform/linux/Json.hpp"
#include "platform/linux/Paths.hpp"
#include "tools/pairwellctl/Client.hpp"

namespace {

using pairwellctl::Client;
using platform::Dictionary;
using platform::List;
using platform::Outcome;
using platform::Value;

enum Exit { done = 0, failed = 1, wrongUsage = 2, unreachable = 3, refused = 4 };

int report(std::error_code error, const std::string& what) {
  std::fprintf(stderr, "pairwellctl: %s: %s\n", what.c_str(), error.message().c_str());
  if (error == Outcome::notPermitted) return refused;
  return error == Outcome::notConnected || error == Outcome::timedOut ? unreachable : failed;
}

void print(const std::string& line) {
  std::printf("%s\n", line.c_str());
  std::fflush(stdout);
}

void printJson(const Dictionary& object) {
  if (const auto line = platform::linux_::printJson(object, platform::linux_::JsonStyle::line)) print(*line);
}

// The two largest units.
std::string describeSpan(std::int64_t seconds) {
  const std::pair<const char*, std::int64_t> units[] = {{"d", 86400}, {"h", 3600}, {"min", 60}, {"s", 1}};
  std::string text;
  int used = 0;
  for (const auto& [name, length] : units) {
    if (used == 2 || (used == 0 && seconds < length && length > 1)) continue;
    text += (used > 0 ? " " : "") + std::to_string(seconds / length) + " " + name;
    seconds %= length;
    ++used;
  }
  return text;
}

std::string describeTime(double time) {
  const auto seconds = static_cast<std::time_t>(time);
  std::tm local{};
  localtime_r(&seconds, &local);
  char text[40];
  std::strftime(text, sizeof text, "%F %T %z", &local);
  return text;
}

struct Options {
  std::string root;
  double timeout = 5;
  bool json = false;
  std::uint32_t status = 0;
  std::string state;
};

int status(const Client& client, const Options& options) {
  std::string what;
  const auto result = client.call("GetDistributedLoggingStatus", {}, what);
  if (!result) return report(result.error(), what);
  const pairwell::RadixDistributedDebugLogging set(
      static_cast<std::uint32_t>(*result->at(0).as<std::int64_t>()));
  const std::string text(set.description());
  if (options.json) {
    printJson({{"status", std::int64_t{set.rawValue}}, {"text", text}});
  } else {
    print(std::to_string(set.rawValue) + (text.empty() ? "" : " " + text));
  }
  return done;
}

int set(const Client& client, const std::string& operation, Value value) {
  std::string what;
  const auto result = client.call(operation, {std::move(value)}, what);
  return result ? done : report(result.error(), what);
}

std::error_code printLogging(const Client& client, const Options& options, std::string& what) {
  const auto result = client.call("KestrelAudioAccessoryLimitedLogging", {}, what);
  if (!result) return result.error();
  const bool on = *result->at(0).as<bool>();
  const double end = on ? client.end() : 0;
  const double now =
      std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
  if (options.json) {
    Dictionary object{{"logging", on}};
    if (end > 0) object.insert({{"end", end}, {"remaining", end - now}});
    printJson(object);
  } else {
    std::string line = on ? "on" : "off";
    if (end > 0) {
      const auto left = static_cast<std::int64_t>(std::ceil(end - now));
      line += " until " + describeTime(end) + " (in " + describeSpan(left) + ")";
    }
    print(line);
  }
  return {};
}

int logging(const Client& client, const Options& options) {
  std::string what;
  const auto error = printLogging(client, options, what);
  return error ? report(error, what) : done;
}

int givenName(const Client& client, const Options& options) {
  std::string what;
  const auto result = client.call("GetCurrentUserGivenName", {}, what);
  if (!result) return report(result.error(), what);
  const List& names = *result->at(0).as<List>();
  if (options.json) {
    printJson({{"givenName", names.empty() ? Value() : names[0]}});
  } else if (!names.empty()) {
    print(*names[0].as<std::string>());
  }
  return done;
}

int watch(const Client& client, const Options& options) {
  std::string what;
  std::string asked;
  const auto error = client.watch(
      [&] {
        const auto problem = printLogging(client, options, asked);
        if (problem) what = asked;
        return problem;
      },
      what);
  return report(error, what);
}

}  // namespace

int main(int count, char** arguments) {
  Options options;
  CLI::App app("Reads and sets pairwelld's audio-accessory debug logging.", "pairwellctl");
  app.require_subcommand(1);
  app.add_option("--root", options.root, "the folder of the device; by default the system's")
      ->envname("HEARTH_ROOT");
  app.add_option("--timeout", options.timeout, "seconds to wait for an answer")
      ->capture_default_str()
      ->check(CLI::Range(0.001, 1e6));
  app.add_flag("--json", options.json, "print one JSON object a line");

  auto* statusCommand = app.add_subcommand("status", "print the logging status, its number and text");
  auto* statusSet = statusCommand->add_subcommand("set", "set the logging status");
  statusSet->add_option("N", options.status, "an unsigned number, bit 0 audio accessory")->required();
  auto* loggingCommand = app.add_subcommand("logging", "print whether logging is on, or switch it");
  auto* loggingState = loggingCommand->add_option("STATE", options.state, "on or off");
  loggingState->check(CLI::IsMember({"on", "off"}));
  auto* nameCommand = app.add_subcommand("given-name", "print the current user's given name");
  auto* watchCommand = app.add_subcommand("watch", "print the state whenever it has changed");
  try {
    app.parse(count, arguments);
  } catch (const CLI::ParseError& error) {
    return app.exit(error) == 0 ? done : wrongUsage;
  }

  if (!options.root.empty()) options.root = std::filesystem::absolute(options.root).lexically_normal();
  const Client client(platform::linux_::Paths::under(options.root),
                      std::chrono::milliseconds(std::llround(options.timeout * 1000)));
  if (*statusSet) return set(client, "SetDistributedLoggingStatus", std::int64_t{options.status});
  if (*statusCommand) return status(client, options);
  if (*loggingCommand) {
    if (*loggingState) return set(client, "SetKestrelAudioAccessoryLimitedLogging", options.state == "on");
    return logging(client, options);
  }
  if (*nameCommand) return givenName(client, options);
  if (*watchCommand) return watch(client, options);
  return wrongUsage;
}
