#include "tools/CommandLine.hpp"

namespace tools {
namespace {

void shareCommonOptions(CLI::App& app, const std::string& program) {
  for (CLI::App* command : app.get_subcommands([](const CLI::App*) { return true; })) {
    command->fallthrough();
    command->footer("--root and --json: see " + program + " --help");
    shareCommonOptions(*command, program);
  }
}

}  // namespace

std::optional<Exit> parse(CLI::App& app, CommonOptions& options, int count, char** arguments) {
  app.require_subcommand(1);
  app.add_option("--root", options.root, "the folder of the device; by default the system's")
      ->envname("HEARTH_ROOT");
  app.add_flag("--json", options.json, "print one JSON object a line");
  shareCommonOptions(app, app.get_name());
  try {
    app.parse(count, arguments);
  } catch (const CLI::RequiredError& error) {
    // The library misses the command that an unknown word stands in place of.
    const auto unknown = app.remaining(true);
    say(unknown.empty() ? std::string(error.what()) : "unknown: " + unknown.front());
    return wrongUsage;
  } catch (const CLI::ParseError& error) {
    if (error.get_exit_code() == 0) return app.exit(error), done;
    say(error.what());
    return wrongUsage;
  }
  return std::nullopt;
}

}  // namespace tools
