#include "tools/hearthctl/Check.hpp"

#include <chrono>
#include <cmath>
#include <filesystem>
#include <map>
#include <thread>
#include <utility>

#include "pairwelld/Names.hpp"
#include "pairwelld/settings/Defaults.hpp"
#include "platform/EventStreams.hpp"
#include "platform/linux/Entitlements.hpp"
#include "platform/linux/LinuxEnvironment.hpp"
#include "tools/StoredSettings.hpp"
#include "tools/hearthctl/Settings.hpp"

namespace tools {
namespace {

using pairwell::Defaults;
using pairwell::KeyValueSource;
using platform::Dictionary;
using platform::List;
using platform::Outcome;
using platform::Value;
using platform::linux_::FileSystem;
using platform::linux_::Paths;

constexpr std::size_t fileLimit = 64 << 20;
// What a switch writes is written in far less.
constexpr std::chrono::milliseconds switchTime{300};

const std::string daemonJob(pairwell::names::job);
const std::string flagKey(platform::rawValue(Defaults::velaLogCloudCollectionEnabled));
const std::string endKey(platform::rawValue(Defaults::velaLogCloudCollectionEnabledExpiration));

bool flagIn(const Dictionary& values) {
  const Value* flag = platform::find(values, flagKey);
  return flag && platform::toBool(*flag).value_or(false);
}

struct Finding {
  std::string problem;
  std::string remedy;
};

// A period of limited logging, as it is told in four places.
struct Period {
  bool rootFlag = false;
  bool cloudFlag = false;
  std::optional<double> end;    // seconds since 1970; absent where the daemon takes it for none
  std::optional<double> alarm;  // likewise
};

// One look at everything.
class Look {
 public:
  Look(const Paths& paths_, FileSystem& files_, Hearth& hearth_)
      : paths(paths_), files(files_), hearth(hearth_) {}

  // Answers the exit code of a hearthd that runs and does not answer.
  Exit take();

  std::vector<Finding> findings;
  bool hearthdRuns = true;

 private:
  void add(std::string problem, std::string remedy) {
    findings.push_back({std::move(problem), std::move(remedy)});
  }
  void lookAtFiles();
  void lookAtJobs();
  void lookForDamaged(const std::string& folder);
  // Empty where there is no file; what is wrong with it is a finding.
  Dictionary readObject(const std::string& path, const std::string& remedy);
  std::vector<Alarm> alarmsFromFile();
  // Absent where a store cannot be read, which is a finding of its own.
  std::optional<Period> readPeriod(const std::vector<Alarm>& alarms);
  void judge(const Period& period);
  void judgeOff(const Period& period);

  const Paths& paths;
  FileSystem& files;
  Hearth& hearth;
};

Exit Look::take() {
  auto alarms = hearth.alarms();
  if (!alarms && alarms.error() != Outcome::notConnected) return hearth.fail(alarms.error());
  hearthdRuns = alarms.has_value();
  lookAtFiles();
  if (hearthdRuns) lookAtJobs();
  if (const auto period = readPeriod(alarms ? *alarms : alarmsFromFile())) judge(*period);
  for (const auto& grant : platform::linux_::readGrants(files, paths)) {
    if (!grant.problem.empty()) add(grant.file + " does not count: " + grant.problem, "mend what it names");
  }
  return done;
}

// One that waits has ended by itself, or could not be started.
void Look::lookAtJobs() {
  const auto jobs = hearth.jobs();
  for (const Job& each : jobs ? *jobs : std::vector<Job>()) {
    if (each.state == "waiting") add(each.name + " does not run: " + each.detail, "mend what it names");
  }
}

void Look::lookAtFiles() {
  if (!files.identity(paths.etc)) add(paths.etc + ": there is no device", "hearthctl init");
  readObject(paths.device(), "mend it");
  readObject(paths.cloud(), "mend it, and hearthctl jobs restart com.kestrel.cloudsyncd");
  if (const auto names = files.list(paths.jobs())) {
    for (const std::string& name : *names) {
      if (name.ends_with(".json")) readObject(paths.jobs() + "/" + name, "mend it, and start hearthd anew");
    }
  }
  for (const auto source : platform::allCases<KeyValueSource>()) {
    lookForDamaged(std::filesystem::path(settingsPath(paths, source)).parent_path());
  }
  lookForDamaged(paths.hearthd());
}

void Look::lookForDamaged(const std::string& folder) {
  const auto names = files.list(folder);
  if (!names) return;
  for (const std::string& name : *names) {
    if (name.find(".json.damaged-") == std::string::npos) continue;
    add(folder + "/" + name + ": was damaged, and has been moved aside",
        "mend it, remove its checksum line and move it back, or delete it");
  }
}

Dictionary Look::readObject(const std::string& path, const std::string& remedy) {
  const auto text = platform::linux_::readFile(files, path, fileLimit);
  if (!text && text.error() == std::errc::no_such_file_or_directory) return {};
  std::string problem = text ? "" : text.error().message();
  const auto object = text ? parseObject(*text, problem) : platform::Result<Dictionary>(text.error());
  if (object) return *object;
  add(path + ": " + problem, remedy);
  return {};
}

// What is no alarm is left out, as there is nothing to compare it with.
std::vector<Alarm> Look::alarmsFromFile() {
  const std::string path = paths.alarms();
  say("hearthd does not run; the alarms are those of " + path);
  const Dictionary whole = readObject(path, "mend it before hearthd starts, which would move it aside");
  const auto* list = platform::find<List>(whole, "alarms");
  if (!list && !whole.empty()) add(path + ": not a list of alarms", "delete it");
  std::vector<Alarm> alarms;
  for (const Value& value : list ? *list : List()) {
    const auto* entry = value.as<Dictionary>();
    const auto* date = entry ? platform::find<platform::Date>(*entry, "date") : nullptr;
    const auto text = [&](const char* key) {
      const auto* found = platform::find<std::string>(*entry, key);
      return found ? *found : "";
    };
    if (!date) continue;
    alarms.push_back(
        {text("job"), text("stream"), text("name"), static_cast<double>(date->nanoseconds) / 1e9});
  }
  return alarms;
}

std::optional<Period> Look::readPeriod(const std::vector<Alarm>& alarms) {
  std::map<KeyValueSource, Dictionary> contents;
  for (const auto source : platform::allCases<KeyValueSource>()) {
    std::string problem;
    const auto values = Settings(paths, source, files, hearth).values(problem);
    if (values) {
      contents[source] = *values;
    } else if (values.error() != std::errc::no_such_file_or_directory) {  // that one has been named already
      add(settingsPath(paths, source) + ": " + problem,
          values.error() == Outcome::malformedFile
              ? "hearthctl settings edit " + std::string(platform::rawValue(source))
              : "let it be read");
    }
  }
  if (contents.size() < platform::allCases<KeyValueSource>().size()) return std::nullopt;
  Period period{flagIn(contents[KeyValueSource::root]), flagIn(contents[KeyValueSource::cloud]),
                endIn(contents[KeyValueSource::cloud]), std::nullopt};
  for (const Alarm& alarm : alarms) {
    if (alarm.job == daemonJob && alarm.stream == platform::EventStreams::alarms && alarm.name == flagKey)
      period.alarm = alarm.date;
  }
  return period;
}

void Look::judge(const Period& period) {
  if (!period.cloudFlag) return judgeOff(period);
  const std::string restart = hearthdRuns ? "hearthctl jobs restart " + daemonJob : "start hearthd";
  if (!period.rootFlag) add("the cloud flag is on, and the root flag off", restart);
  if (!period.end) {
    add("the flag is on without an end time", "pairwellctl logging off");
  } else if (*period.end < platform::linux_::LinuxClock().now().count()) {
    add("the end has passed, " + describeTime(*period.end) + ", and the flag is still on",
        hearthdRuns ? "pairwellctl logging, which ends it" : restart);
  } else if (!period.alarm) {
    add("there is no alarm for the end, " + describeTime(*period.end), restart);
  } else if (*period.alarm != std::trunc(*period.end)) {
    add("the alarm, " + describeTime(*period.alarm) + ", is not at the end, " + describeTime(*period.end),
        restart);
  }
}

// What a crash between two steps leaves behind, or an absence while another device switched off.
void Look::judgeOff(const Period& period) {
  if (period.rootFlag) {
    add("the root flag is on, and the cloud flag off", "hearthctl settings set root " + flagKey + " false");
  }
  if (period.end) {
    const bool hasPassed = *period.end < platform::linux_::LinuxClock().now().count();
    add("an end time is left with the flag off, " + describeTime(*period.end) +
            (hasPassed ? "; the next \"on\" clears it, and a second one is needed"
                       : "; the next \"on\" takes it up"),
        "hearthctl settings unset cloud " + endKey);
  }
  if (period.alarm) {
    add("an alarm is left with the flag off, " + describeTime(*period.alarm),
        hearthdRuns ? "hearthctl alarms cancel " + flagKey
                    : "start hearthd, then hearthctl alarms cancel " + flagKey);
  }
}

}  // namespace

Exit check(Output& output, const Paths& paths, FileSystem& files, Hearth& hearth) {
  Look look(paths, files, hearth);
  if (const Exit failure = look.take(); failure != done) return failure;
  if (!look.findings.empty() && look.hearthdRuns) {
    // The daemon may be in the middle of a switch: what is wrong for good is still there afterwards.
    std::this_thread::sleep_for(switchTime);
    look.findings.clear();
    if (const Exit failure = look.take(); failure != done) return failure;
  }
  for (const Finding& finding : look.findings) {
    output.add({{"problem", finding.problem}, {"remedy", finding.remedy}},
               {finding.problem + "\n    remedy: " + finding.remedy});
  }
  if (look.findings.empty()) output.add({{"agree", true}}, {"all stores and alarms agree"});
  output.print();
  return look.findings.empty() ? done : failed;
}

}  // namespace tools
