#include "tools/hearthctl/Hearth.hpp"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <utility>

#include "pairwelld/Names.hpp"

namespace tools {
namespace {

using platform::Dictionary;
using platform::List;
using platform::Outcome;
using platform::Result;
using platform::Value;
using platform::linux_::BusClient;
using platform::linux_::HearthOperation;
using std::chrono::milliseconds;

constexpr milliseconds patience{5000};

const List& rows(const List& results) { return *results[0].as<List>(); }
const std::string& text(const Value& row, std::size_t column) {
  return *(*row.as<List>())[column].as<std::string>();
}
std::int64_t integer(const Value& row, std::size_t column) {
  return *(*row.as<List>())[column].as<std::int64_t>();
}

}  // namespace

Result<List> Hearth::call(HearthOperation operation, const List& arguments) {
  answer.clear();
  if (!client) {
    auto connected = BusClient::connect(socket, patience);
    if (!connected) return connected.error();
    client = std::move(*connected);
  }
  const auto& interface = platform::linux_::hearthInterface();
  const auto& name = interface.operations[static_cast<std::size_t>(operation)].name;
  return resultsOf(client->call(interface, name, arguments, patience), answer);
}

Exit Hearth::perform(HearthOperation operation, const List& arguments) {
  const auto results = call(operation, arguments);
  return results ? done : fail(results.error());
}

Result<std::vector<Alarm>> Hearth::alarms() {
  const auto results = call(HearthOperation::listAlarms);
  if (!results) return results.error();
  std::vector<Alarm> alarms;
  for (const Value& row : rows(*results)) {
    alarms.push_back({text(row, 0), text(row, 1), text(row, 2), static_cast<double>(integer(row, 3)) / 1e9});
  }
  return alarms;
}

Result<std::vector<Job>> Hearth::jobs() {
  const auto results = call(HearthOperation::listJobs);
  if (!results) return results.error();
  std::vector<Job> jobs;
  for (const Value& row : rows(*results))
    jobs.push_back({text(row, 0), text(row, 1), integer(row, 2), text(row, 3)});
  return jobs;
}

Exit Hearth::listJobs(Output& output) {
  const auto all = jobs();
  if (!all) return fail(all.error());
  for (const Job& job : *all) {
    output.add({{"name", job.name}, {"state", job.state}, {"pid", job.pid}, {"detail", job.detail}},
               {job.name, job.state, job.pid > 0 ? std::to_string(job.pid) : "-",
                job.detail.empty() ? "" : "last: " + job.detail});
  }
  output.print();
  return done;
}

Exit Hearth::listAlarms(Output& output) {
  const auto all = alarms();
  if (!all) return fail(all.error());
  for (const Alarm& alarm : *all) {
    output.add({{"job", alarm.job}, {"stream", alarm.stream}, {"name", alarm.name}, {"date", alarm.date}},
               {alarm.job, alarm.stream, alarm.name, describeTime(alarm.date)});
  }
  output.print();
  return done;
}

Exit Hearth::cancelAlarms(Output& output, const std::string& name) {
  const auto results = call(HearthOperation::cancelAlarm, {name});
  if (!results) return fail(results.error());
  const auto count = *(*results)[0].as<std::int64_t>();
  if (count == 0) {
    say("no alarm is called " + name);
    return failed;
  }
  output.add({{"cancelled", count}}, {"cancelled " + std::to_string(count)});
  output.print();
  return done;
}

void Hearth::announceRootChange() {
  const auto posted = call(HearthOperation::post, {std::string(pairwell::names::rootPrefsChanged)});
  if (!posted) say("the change is made, but nobody was told: " + socket + ": " + posted.error().message());
}

Exit Hearth::fail(std::error_code error) const { return tools::fail(socket, error, answer); }

Exit Hearth::watch(Output& output, const std::vector<std::string>& names, std::optional<unsigned> count,
                   std::optional<double> timeout) {
  using Clock = std::chrono::steady_clock;
  const auto end = Clock::now() + milliseconds(std::llround(timeout.value_or(0) * 1000));
  for (const std::string& name : names) {
    if (const auto watched = call(HearthOperation::watch, {name}); !watched) return fail(watched.error());
  }
  for (unsigned seen = 0; !count || seen < *count; ++seen) {
    std::optional<milliseconds> left;
    if (timeout) left = std::max(milliseconds(0), std::chrono::ceil<milliseconds>(end - Clock::now()));
    const auto signal = client->nextSignal(left);
    if (!signal) return fail(signal.error());
    if (!*signal) return count ? fail(Outcome::timedOut) : done;
    const std::string& name = *(*signal)->arguments.at(0).as<std::string>();
    output.add({{"name", name}}, {name});
    output.print();
  }
  return done;
}

}  // namespace tools
