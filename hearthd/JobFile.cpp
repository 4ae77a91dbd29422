#include "hearthd/JobFile.hpp"

#include <set>
#include <string_view>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/Json.hpp"

namespace hearth {
namespace {

constexpr std::size_t fileLimit = 1 << 20;

// Reads the fields of one file; the first fault is kept.
class Reader {
 public:
  explicit Reader(const platform::Dictionary& fields_) : fields(fields_) {}

  std::string text(std::string_view key) {
    const platform::Value* value = find(key);
    if (!value) return fail(key, "is missing"), "";
    const auto text = platform::toText(*value);
    if (!text || text->empty()) return fail(key, "is not a text"), "";
    // The system would take a path, or a variable, to end there.
    if (text->find('\0') != text->npos) fail(key, "has a NUL in it");
    return *text;
  }

  // Part of a file name below run/, whose path the system would read to the first NUL only: "hearthd.sock"
  // with one behind it would be hearthd's own socket.
  std::string fileName(std::string_view key, std::string name) {
    if (name.find_first_of(std::string_view("/\0", 2)) != std::string::npos || name.starts_with('.'))
      fail(key, "cannot be a file's name");
    return name;
  }

  std::vector<std::string> texts(std::string_view key) {
    const platform::Value* value = find(key);
    if (!value) return {};
    auto texts = platform::toTexts(*value);
    if (!texts) return fail(key, "is not a list of texts"), std::vector<std::string>();
    return std::move(*texts);
  }

  std::map<std::string, std::string> environment(std::string_view key) {
    std::map<std::string, std::string> variables;
    const platform::Value* value = find(key);
    if (!value) return variables;
    const auto* entries = value->as<platform::Dictionary>();
    if (!entries) return fail(key, "is not a dictionary of texts"), variables;
    for (const auto& [name, entry] : *entries) {
      const auto text = platform::toText(entry);
      if (!text) fail(key, "is not a dictionary of texts");
      if (text) variables[name] = *text;
    }
    return variables;
  }

  bool boolean(std::string_view key, bool otherwise) {
    const platform::Value* value = find(key);
    if (!value) return otherwise;
    const auto boolean = platform::toBool(*value);
    if (!boolean) fail(key, "is not a boolean");
    return boolean.value_or(otherwise);
  }

  const std::string& problem() const { return _problem; }

  void fail(std::string_view key, std::string_view what) {
    if (_problem.empty()) _problem = '"' + std::string(key) + "\" " + std::string(what);
  }

 private:
  const platform::Value* find(std::string_view key) const {
    const auto found = fields.find(key);
    return found == fields.end() ? nullptr : &found->second;
  }

  const platform::Dictionary& fields;
  std::string _problem;
};

JobDescription readJob(const std::string& bytes, const std::string& root, std::string& problem) {
  JobDescription job;
  const auto value = platform::linux_::parseJson(bytes, problem);
  if (!value) return job;
  const auto* fields = value->as<platform::Dictionary>();
  if (!fields) {
    problem = "is not a dictionary";
    return job;
  }
  Reader reader(*fields);
  job.name = reader.fileName("name", reader.text("name"));
  job.program = reader.text("program");
  if (!job.program.starts_with('/')) job.program = root + "/" + job.program;
  job.environment = reader.environment("environment");
  for (std::string& service : reader.texts("services")) {
    job.services.push_back(reader.fileName("services", std::move(service)));
    if (job.services.back() == "hearthd") reader.fail("services", "names hearthd's own socket");
  }
  job.streams = reader.texts("streams");
  job.matching = reader.texts("matching");
  job.restart = reader.boolean("restart", true);
  problem = reader.problem();
  return job;
}

// What of `job` an earlier one has; empty if nothing.
std::string conflict(const JobDescription& job, const std::vector<JobDescription>& earlier) {
  std::set<std::string> services;
  for (const JobDescription& other : earlier) {
    if (other.name == job.name) return "a second job " + job.name;
    services.insert(other.services.begin(), other.services.end());
  }
  for (const std::string& service : job.services) {
    if (!services.insert(service).second) return "a second service " + service;
  }
  return "";
}

}  // namespace

bool mayPass(std::error_code error) {
  const auto is = [error](std::errc other) { return error == other; };
  return is(std::errc::interrupted) || is(std::errc::not_enough_memory) ||
         is(std::errc::no_space_on_device) || is(std::errc::too_many_files_open) ||
         is(std::errc::too_many_files_open_in_system);
}

platform::Result<std::vector<JobDescription>> readJobs(platform::linux_::FileSystem& files,
                                                       const std::string& folder, const std::string& root) {
  std::vector<JobDescription> jobs;
  const auto log = platform::hearthLog("hearthd");
  const auto names = files.list(folder);
  if (!names) {
    const bool ends = mayPass(names.error());
    log.error("%s: %s%s", folder, names.error().message(), ends ? "; hearthd ends" : "");
    if (ends) return names.error();
    return jobs;
  }
  for (const std::string& name : *names) {
    if (!name.ends_with(".json")) continue;
    const std::string path = folder + "/" + name;
    const auto bytes = platform::linux_::readFile(files, path, fileLimit);
    if (!bytes && mayPass(bytes.error())) {
      log.error("%s: %s; hearthd ends", path, bytes.error().message());
      return bytes.error();
    }
    std::string problem = bytes ? "" : bytes.error().message();
    JobDescription job;
    if (bytes) job = readJob(*bytes, root, problem);
    if (problem.empty()) problem = conflict(job, jobs);
    if (problem.empty()) {
      jobs.push_back(std::move(job));
    } else {
      log.error("%s: %s; the file is skipped", path, problem);
    }
  }
  return jobs;
}

}  // namespace hearth
