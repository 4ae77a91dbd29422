// pairwellctl: the daemon's client on the command line.
#include <CLI/CLI.hpp>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <string>
#include <utility>

#include "pairwelld/service/RadixDistributedDebugLogging.hpp"
#include "tools/CommandLine.hpp"
#include "tools/Output.hpp"
#include "tools/pairwellctl/Client.hpp"

namespace {

using platform::Dictionary;
using platform::List;
using platform::Value;
using tools::Client;
using tools::Exit;
using tools::Output;

struct Options : tools::CommonOptions {
  double timeout = 5;
  std::uint32_t status = 0;
  std::string state;
};

// The two largest units.
std::string describeSpan(std::int64_t seconds) {
  constexpr std::pair<const char*, std::int64_t> units[] = {{"d", 86400}, {"h", 3600}, {"min", 60}, {"s", 1}};
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

void print(const Options& options, const Dictionary& object, std::string line) {
  Output output(options.json);
  output.add(object, {std::move(line)});
  output.print();
}

Exit printStatus(Client& client, const Options& options) {
  const auto result = client.call("GetDistributedLoggingStatus");
  if (!result) return client.fail(result.error());
  const pairwell::RadixDistributedDebugLogging set(
      static_cast<std::uint32_t>(*result->at(0).as<std::int64_t>()));
  const std::string text(set.description());
  print(options, {{"status", std::int64_t{set.rawValue}}, {"text", text}},
        std::to_string(set.rawValue) + " " + text);
  return tools::done;
}

Exit set(Client& client, const std::string& operation, Value value) {
  const auto result = client.call(operation, {std::move(value)});
  return result ? tools::done : client.fail(result.error());
}

std::error_code printLogging(Client& client, const Options& options) {
  const auto result = client.call("KestrelAudioAccessoryLimitedLogging");
  if (!result) return result.error();
  const bool on = *result->at(0).as<bool>();
  const double now =
      std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
  Dictionary object{{"logging", on}};
  std::string line = on ? "on" : "off";
  if (const double end = on ? client.end() : 0; end > 0) {
    object.insert({{"end", end}, {"remaining", end - now}});
    line += " until " + tools::describeTime(end) + " (in " +
            describeSpan(static_cast<std::int64_t>(std::ceil(end - now))) + ")";
  }
  print(options, object, std::move(line));
  return {};
}

Exit printGivenName(Client& client, const Options& options) {
  const auto result = client.call("GetCurrentUserGivenName");
  if (!result) return client.fail(result.error());
  const List& names = *result->at(0).as<List>();
  if (!names.empty() || options.json) {
    const Value name = names.empty() ? Value() : names[0];
    print(options, {{"givenName", name}}, platform::describe(name));
  }
  return tools::done;
}

Exit run(const CLI::App& command, Client& client, const Options& options) {
  if (command.get_name() == "status") {
    if (command.get_subcommands().empty()) return printStatus(client, options);
    return set(client, "SetDistributedLoggingStatus", std::int64_t{options.status});
  }
  if (command.get_name() == "given-name") return printGivenName(client, options);
  if (command.get_name() == "watch")
    return client.fail(client.watch([&] { return printLogging(client, options); }));
  if (!options.state.empty())
    return set(client, "SetKestrelAudioAccessoryLimitedLogging", options.state == "on");
  const auto error = printLogging(client, options);
  return error ? client.fail(error) : tools::done;
}

}  // namespace

int main(int count, char** arguments) {
  Options options;
  CLI::App app("Reads and sets pairwelld's audio-accessory debug logging.", "pairwellctl");
  app.add_option("--timeout", options.timeout, "seconds to wait for an answer")
      ->capture_default_str()
      ->check(CLI::Range(0.001, 1e6));
  app.add_subcommand("status", "print the logging status, its number and text")
      ->require_subcommand(0, 1)
      ->add_subcommand("set", "set the logging status")
      ->add_option("N", options.status, "an unsigned number; bit 0 is the audio accessory's")
      ->required();
  app.add_subcommand("logging", "print whether logging is on, or switch it")
      ->add_option("STATE", options.state, "on or off")
      ->check(CLI::IsMember({"on", "off"}));
  app.add_subcommand("given-name", "print the current user's given name");
  app.add_subcommand("watch", "print the state whenever it has changed");
  if (const auto exit = tools::parse(app, options, count, arguments)) return *exit;

  Client client(platform::linux_::Paths::ofArgument(options.root),
                std::chrono::milliseconds(std::llround(options.timeout * 1000)));
  return run(*app.get_subcommands().front(), client, options);
}
