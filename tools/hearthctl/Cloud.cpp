#include "tools/hearthctl/Cloud.hpp"

#include <cerrno>
#include <fstream>
#include <utility>

#include "cloudsyncd/CloudInterface.hpp"
#include "cloudsyncd/Transports.hpp"
#include "cloudsyncd/core/Replica.hpp"
#include "pairwelld/Names.hpp"
#include "platform/linux/BusClient.hpp"
#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/Json.hpp"
#include "platform/linux/SettingsFile.hpp"
#include "tools/StoredSettings.hpp"

namespace tools {
namespace {

using platform::Dictionary;
using platform::List;
using platform::Result;
using platform::Value;
using std::chrono::milliseconds;

constexpr milliseconds patience{5000};
// An engine may be far, or not there at all, which takes its own time to find out.
constexpr milliseconds enginePatience{30'000};

std::string textIn(const Dictionary& fields, std::string_view name) {
  const auto* text = platform::find<std::string>(fields, name);
  return text ? *text : "";
}

std::string timeIn(const Dictionary& fields, std::string_view name) {
  const auto* time = platform::find<double>(fields, name);
  return time ? describeTime(*time) : "never";
}

const List& listIn(const Dictionary& fields, std::string_view name) {
  static const List none;
  const auto* list = platform::find<List>(fields, name);
  return list ? *list : none;
}

// The lines for people.
std::vector<std::vector<std::string>> linesOf(const Dictionary& status) {
  std::vector<std::vector<std::string>> lines;
  const auto* connected = platform::find<bool>(status, "connected");
  const bool isConnected = connected && *connected;
  if (status.contains("url"))
    lines.push_back({"engine", textIn(status, "url") + ", account " + textIn(status, "account")});
  // Its document may not be there: one that has only followed others has published nothing.
  if (const std::string own = textIn(status, "device"); !own.empty()) lines.push_back({"this device", own});
  lines.push_back({"connected", isConnected                ? "yes"
                                : status.contains("since") ? "no, since " + timeIn(status, "since")
                                                           : "no"});
  if (status.contains("problem")) lines.push_back({"problem", textIn(status, "problem")});
  lines.push_back({"last out", timeIn(status, "out")});
  lines.push_back({"last in", timeIn(status, "in")});
  std::string waiting;
  for (const Value& key : listIn(status, "waiting"))
    waiting += (waiting.empty() ? "" : ", ") + platform::describe(key);
  lines.push_back({"waiting to go out", waiting.empty() ? "nothing" : waiting});
  for (const Value& row : listIn(status, "devices")) {
    const auto* fields = row.as<Dictionary>();
    const Dictionary device = fields ? *fields : Dictionary();
    const std::string name = textIn(device, "device");
    std::string line = name + (name == textIn(status, "device") ? " (this one)" : "") + ", newest change " +
                       timeIn(device, "newest");
    if (device.contains("problem")) line += ", refused: " + textIn(device, "problem");
    lines.push_back({"device", std::move(line)});
  }
  return lines;
}

// A pipe's, too: the file layer would not wait for its writer.
Result<cloudsync::Membership> readAccess(const std::string& path, std::string& problem) {
  std::string text(64 << 10, '\0');
  std::ifstream file(path);
  file.read(text.data(), static_cast<std::streamsize>(text.size()));
  if (!file.is_open() || file.bad()) {
    const std::error_code error(errno, std::generic_category());
    problem = error.message();
    return error;
  }
  text.resize(static_cast<std::size_t>(file.gcount()));
  return cloudsync::parseMembership(text, problem);
}

}  // namespace

std::optional<cloudsync::Membership> membershipOf(const AccountOptions& options) {
  cloudsync::Membership membership;
  std::string problem;
  if (!options.access.empty()) {
    const auto read = readAccess(options.access, problem);
    if (!read) return say(options.access + ": " + problem), std::nullopt;
    membership = *read;
  }
  membership.url = options.url;
  membership.account = options.name;
  problem = cloudsync::problemOf(membership);
  return problem.empty() ? std::optional(membership) : (say(problem), std::nullopt);
}

Cloud::Cloud(const platform::linux_::Paths& paths_, platform::linux_::FileSystem& files_)
    : paths(paths_), files(files_), socket(paths_.serviceSocket(cloudsync::cloudService)) {}

Result<List> Cloud::call(const std::string& operation, const List& arguments, milliseconds timeout) {
  answer.clear();
  auto client = platform::linux_::BusClient::connect(socket, patience);
  if (!client) return client.error();
  return resultsOf((*client)->call(cloudsync::cloudInterface(), operation, arguments, timeout), answer);
}

Exit Cloud::perform(const std::string& operation, const std::string& argument, const std::string& refusal) {
  const auto results = call(operation, {argument}, enginePatience);
  if (results) return done;
  return answer.empty() ? fail(results.error()) : tools::fail(refusal, results.error(), answer);
}

Exit Cloud::fail(std::error_code error) const {
  const bool hasAccount = files.identity(paths.cloud()).has_value();
  if (hasAccount || error != platform::Outcome::notConnected)
    return tools::fail("cloudsyncd, " + socket, error, answer);
  say("this device is in no account: there is no " + paths.cloud() +
      "; hearthctl init --cloud URL --account NAME, then restart hearthd");
  return unreachable;
}

Exit Cloud::status(Output& output) {
  const auto results = call("Status", {}, patience);
  if (!results) return fail(results.error());
  std::string problem;
  const auto value = platform::linux_::parseJson(*results->at(0).as<std::string>(), problem);
  const auto* fields = value ? value->as<Dictionary>() : nullptr;
  if (!fields) return say(socket + ": " + problem), failed;
  const auto lines = linesOf(*fields);
  output.add(*fields, lines.front());
  for (std::size_t line = 1; line < lines.size(); ++line) output.addLine(lines[line]);
  output.print();
  return done;
}

Exit Cloud::use(const AccountOptions& account) {
  const auto membership = membershipOf(account);
  if (!membership) return wrongUsage;
  const auto text =
      platform::linux_::printJson(cloudsync::fieldsOf(*membership), platform::linux_::JsonStyle::line);
  if (!text) return tools::fail(account.access, text.error());
  return perform("Use", *text, "the account is not changed");
}

Exit Cloud::forget(const std::string& device) {
  return perform("Forget", device, device + " is not forgotten");
}

Exit Cloud::makeNewIdentity(Output& output) {
  const std::string path = paths.cloudSettings(pairwell::names::cloudStore);
  std::string name, problem;
  if (const auto there = storedValues(files, paths, pairwell::KeyValueSource::cloud, problem);
      !there && there.error() == platform::Outcome::malformedFile)
    return say(path + ": " + problem + "; nothing is changed"), failed;
  const auto written = platform::linux_::SettingsFile::create(files, path)->update([&](Dictionary& replica) {
    cloudsync::makeNewIdentity(replica);
    name = platform::linux_::cloudDeviceOf(replica);
    return true;
  });
  if (!written) return tools::fail(path, written.error());
  output.add({{"device", name}}, {name});
  output.print();
  return done;
}

}  // namespace tools
