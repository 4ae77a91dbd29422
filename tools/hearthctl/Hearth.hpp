// What hearthctl asks of hearthd.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <system_error>
#include <vector>

#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/BusClient.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/Paths.hpp"
#include "tools/Output.hpp"

namespace tools {

struct Alarm {
  std::string job;
  std::string stream;
  std::string name;
  double date;  // seconds since 1970
};

struct Job {
  std::string name;
  std::string state;
  std::int64_t pid;    // 0 where none runs
  std::string detail;  // how its last run ended, or why it could not be started
};

class Hearth {
 public:
  explicit Hearth(const platform::linux_::Paths& paths) : socket(paths.hearthdSocket()) {}

  platform::Result<std::vector<Alarm>> alarms();
  platform::Result<std::vector<Job>> jobs();

  // The commands; each prints, and answers how to exit.
  Exit perform(platform::linux_::HearthOperation operation, const platform::List& arguments);
  Exit listJobs(Output& output);
  Exit listAlarms(Output& output);
  Exit cancelAlarms(Output& output, const std::string& name);
  // Ends after `count` posts, or after `timeout` seconds, which is a failure if there was a count.
  Exit watch(Output& output, const std::vector<std::string>& names, std::optional<unsigned> count,
             std::optional<double> timeout);

  // Posts the notification by which whoever writes root preferences announces it; says so if it cannot.
  void announceRootChange();
  // Says what went wrong with the last call.
  Exit fail(std::error_code error) const;

 private:
  platform::Result<platform::List> call(platform::linux_::HearthOperation operation,
                                        const platform::List& arguments = {});

  const std::string socket;
  std::unique_ptr<platform::linux_::BusClient> client;
  std::string answer;  // the error that hearthd answered, if it was that
};

}  // namespace tools
