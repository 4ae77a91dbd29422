// What both command lines have in common.
#pragma once

#include <CLI/CLI.hpp>
#include <optional>
#include <string>

#include "tools/Output.hpp"

namespace tools {

struct CommonOptions {
  std::string root;
  bool json = false;
};

// Adds the common options, which may also follow the command, and parses. The exit code where that is all:
// help was asked for, or the usage is wrong, which has been said.
std::optional<Exit> parse(CLI::App& app, CommonOptions& options, int count, char** arguments);

}  // namespace tools
