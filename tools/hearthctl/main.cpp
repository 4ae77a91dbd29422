// hearthctl: the operator's command line.
#include <CLI/CLI.hpp>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/Paths.hpp"
#include "tools/CommandLine.hpp"
#include "tools/Output.hpp"
#include "tools/hearthctl/Check.hpp"
#include "tools/hearthctl/Cloud.hpp"
#include "tools/hearthctl/Hearth.hpp"
#include "tools/hearthctl/Init.hpp"
#include "tools/hearthctl/Settings.hpp"

namespace {

using platform::linux_::HearthOperation;
using tools::Exit;

struct Options : tools::CommonOptions {
  tools::Device device{"", "21A5248v", false};
  std::string source, key, value, type;
  std::string name, stream;
  std::vector<std::string> names;
  std::optional<unsigned> count;
  std::optional<double> timeout;
};

void addSettings(CLI::App& app, Options& options) {
  auto* settings = app.add_subcommand("settings", "read and write the stores")->require_subcommand(1);
  const auto add = [&](const char* name, const char* text, bool hasKey) {
    auto* command = settings->add_subcommand(name, text);
    command->add_option("SOURCE", options.source, "user, root or cloud")
        ->required()
        ->check(CLI::IsMember({"user", "root", "cloud"}));
    if (hasKey) command->add_option("KEY", options.key)->required();
    return command;
  };
  add("list", "print every key with its value", false);
  add("get", "print a value; exit 1 if there is none", true);
  auto* set = add("set", "store a value", true);
  set->add_option("VALUE", options.value)->required();
  set->add_option("--type", options.type, "what VALUE is; by default what it looks like")
      ->check(CLI::IsMember({"bool", "int", "double", "string"}));
  add("unset", "remove a key", true);
  add("edit", "edit all values in $VISUAL, $EDITOR or vi", false);
}

void addNotify(CLI::App& app, Options& options) {
  auto* notify = app.add_subcommand("notify", "named notifications")->require_subcommand(1);
  notify->add_subcommand("post", "post one")->add_option("NAME", options.name)->required();
  auto* watch = notify->add_subcommand("watch", "print each name when it is posted");
  watch->add_option("NAME", options.names)->required();
  watch->add_option("--count", options.count, "end after so many")->check(CLI::PositiveNumber);
  watch
      ->add_option("--timeout", options.timeout,
                   "end after so many seconds; exit 3 if --count is not reached")
      ->check(CLI::Range(0.0, 1e6));
}

const std::string urlText = "dir:PATH, dir:PATH?poll=SECONDS or nats://[USER@]HOST[:PORT][,HOST[:PORT]...]";
constexpr const char* accessText =
    "a file with the further fields of etc/cloud.json, such as {\"password\": ...}; may be /dev/stdin";

void addCloud(CLI::App& app, Options& options) {
  auto* cloud = app.add_subcommand("cloud", "the account that shares the cloud store")->require_subcommand(1);
  cloud->add_subcommand("status", "print how the exchange with the other devices stands");
  auto* use = cloud->add_subcommand("use", "change to another account; the old one's values are kept aside");
  use->add_option("URL", options.device.account.url, urlText)->required();
  use->add_option("--account", options.device.account.name, "the account there")->required();
  use->add_option("--access", options.device.account.access, accessText);
  cloud->add_subcommand("forget", "take a lost device's document out of the account")
      ->add_option("DEVICE", options.name, "its name, as cloud status prints it")
      ->required();
  cloud->add_subcommand("new-identity",
                        "make this copy of another device's disk a device of its own; prints its name");
}

Exit runCloud(const std::string& command, const Options& options, tools::Cloud cloud, tools::Output& output) {
  if (command == "status") return cloud.status(output);
  if (command == "use") return cloud.use(options.device.account);
  if (command == "forget") return cloud.forget(options.name);
  return cloud.makeNewIdentity(output);
}

void addCommands(CLI::App& app, Options& options) {
  auto* init = app.add_subcommand(
      "init", "lay out etc/ of a root, which hearthd reads at its start; files that are there are kept");
  init->add_option("--device-name", options.device.name, "by default the machine's host name");
  init->add_option("--build", options.device.build, "the operating system's build")->capture_default_str();
  init->add_flag("--internal", options.device.isInternal, "an internal build of the operating system");
  auto* url =
      init->add_option("--cloud", options.device.account.url, "where the account's devices meet: " + urlText);
  auto* account = init->add_option("--account", options.device.account.name, "the account there");
  url->needs(account);
  account->needs(url);
  init->add_option("--access", options.device.account.access, accessText)->needs(url);
  auto* jobs = app.add_subcommand("jobs", "print the jobs, each with its state and process, or control one")
                   ->require_subcommand(0, 1);
  for (const char* action : {"start", "stop", "restart"}) {
    jobs->add_subcommand(action, std::string(action) + " a job")
        ->add_option("NAME", options.name, "the job's, as jobs prints it")
        ->required();
  }
  addSettings(app, options);
  addNotify(app, options);
  auto* alarms = app.add_subcommand("alarms", "print the alarms, or cancel some")->require_subcommand(0, 1);
  alarms->add_subcommand("cancel", "cancel all of a name")
      ->add_option("NAME", options.name, "as alarms prints it")
      ->required();
  auto* event = app.add_subcommand("event", "deliver an event by hand");
  event->add_option("STREAM", options.stream, "as in the job's file and in alarms: com.kestrel.alarm, …")
      ->required();
  event->add_option("NAME", options.name, "the event's")->required();
  addCloud(app, options);
  app.add_subcommand("grants", "print what is granted to which program, and what does not count");
  app.add_subcommand("check", "say whether stores and alarms agree; exit 1 if not");
}

Exit runSettings(const std::string& command, const Options& options, tools::Settings settings,
                 tools::Output& output) {
  if (command == "list") return settings.list(output);
  if (command == "get") return settings.get(output, options.key);
  if (command == "unset") return settings.set(options.key, std::nullopt);
  if (command == "edit") return settings.edit();
  const auto value = tools::valueFromText(options.value, options.type);
  if (value) return settings.set(options.key, *value);
  tools::say("\"" + options.value + "\" is no " + options.type);
  return tools::wrongUsage;
}

// `part` is the subcommand's own, or empty.
Exit run(const std::string& command, const std::string& part, const Options& options) {
  const auto paths = platform::linux_::Paths::ofArgument(options.root);
  platform::linux_::LinuxFileSystem files(nullptr);
  tools::Hearth hearth(paths);
  tools::Output output(options.json);
  if (command == "init") return tools::init(output, paths, files, options.device);
  if (command == "grants") return tools::listGrants(output, paths, files);
  if (command == "check") return tools::check(output, paths, files, hearth);
  if (command == "cloud") return runCloud(part, options, {paths, files}, output);
  if (command == "event")
    return hearth.perform(HearthOperation::deliverEvent, {options.stream, options.name});
  if (command == "alarms")
    return part.empty() ? hearth.listAlarms(output) : hearth.cancelAlarms(output, options.name);
  if (command == "jobs")
    return part.empty() ? hearth.listJobs(output)
                        : hearth.perform(HearthOperation::controlJob, {part, options.name});
  if (command == "notify") {
    if (part == "post") return hearth.perform(HearthOperation::post, {options.name});
    return hearth.watch(output, options.names, options.count, options.timeout);
  }
  const auto source = *platform::fromRawValue<pairwell::KeyValueSource>(options.source);
  return runSettings(part, options, {paths, source, files, hearth}, output);
}

}  // namespace

int main(int count, char** arguments) {
  Options options;
  CLI::App app("Operates hearthd and the settings of a device.", "hearthctl");
  addCommands(app, options);
  if (const auto exit = tools::parse(app, options, count, arguments)) return *exit;

  tools::SayingLog log;
  platform::installLogSink(log);
  const CLI::App& command = *app.get_subcommands().front();
  const auto parts = command.get_subcommands();
  return run(command.get_name(), parts.empty() ? "" : parts.front()->get_name(), options);
}
