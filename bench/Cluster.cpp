#include "bench/Cluster.hpp"

#include <sys/socket.h>

#include <algorithm>
#include <fstream>
#include <utility>

#include "platform/linux/Json.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace bench {
namespace {

using platform::Dictionary;
using platform::linux_::UniqueDescriptor;

constexpr const char* program = "/usr/sbin/nats-server";

std::string place(int port) { return "127.0.0.1:" + std::to_string(port); }

// One of packaging/nats: a user may use his account's one stream and nothing else.
std::string accountRule(const std::string& name) {
  std::string may;
  for (const char* request :
       {"STREAM.INFO", "STREAM.CREATE", "STREAM.UPDATE", "STREAM.MSG.GET", "STREAM.PURGE"})
    may += std::string(", \"$JS.API.") + request + ".pairwell-" + name + "\"";
  return name + " { jetstream { max_file: 64MB, max_mem: 0, max_streams: 1 }, users: [ { user: " + name +
         ", password: " + Cluster::password() + ", permissions { publish: [ \"pairwell." + name + ".*\"" +
         may + " ], subscribe: [ \"pairwell." + name + ".*\", \"_INBOX." + name + ".>\" ] } } ] }\n";
}

std::string lastLine(const std::string& file) {
  std::ifstream lines(file);
  std::string last;
  for (std::string line; std::getline(lines, line);) last = line;
  return last;
}

std::string answerOf(int port, const std::string& path) {
  const UniqueDescriptor socket(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const sockaddr_in address = fakes::loopback(port);
  const std::string request = "GET /" + path + " HTTP/1.0\r\n\r\n";
  if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
      ::send(socket.get(), request.data(), request.size(), MSG_NOSIGNAL) < 0)
    return "";
  std::string answer;
  char part[16384];
  for (ssize_t got; (got = ::recv(socket.get(), part, sizeof part, 0)) > 0;)
    answer.append(part, static_cast<std::size_t>(got));
  const auto head = answer.find("\r\n\r\n");
  return head == answer.npos ? "" : answer.substr(head + 4);
}

template <class Visit>
void forEach(const Dictionary& in, const char* list, Visit visit) {
  const auto* values = platform::find<platform::List>(in, list);
  for (const platform::Value& value : values ? *values : platform::List()) {
    if (const auto* each = value.as<Dictionary>()) visit(*each);
  }
}

}  // namespace

Cluster::Cluster(std::size_t accounts) {
  configure(accounts);
  for (std::size_t number = 0; number < size; ++number) start(number);
  await("the servers do not find together", [&] { return isReady(); });
}

void Cluster::configure(std::size_t accounts) {
  std::ofstream shared(root.path + "/accounts.conf");
  for (std::size_t number = 0; number < accounts; ++number) shared << accountRule(account(number));
  std::string routes;
  for (const Server& server : servers)
    routes += (routes.empty() ? "nats://" : ", nats://") + place(server.cluster);
  for (std::size_t number = 0; number < size; ++number) {
    const Server& server = servers.at(number);
    std::ofstream(folder(number) + ".conf")
        << "server_name: n" << number << "\nlisten: \"" << place(server.port) << "\"\nhttp: \""
        << place(server.monitor) << "\"\nmax_payload: 2MB\njetstream { store_dir: \"" << folder(number)
        << "\", max_memory_store: 0, max_file_store: 10GB }\ncluster { name: pairwell, listen: \""
        << place(server.cluster) << "\", routes: [ " << routes << "] }\naccounts { include accounts.conf }\n";
  }
  std::ofstream(root.path + "/access.json") << "{\"password\": \"" << password() << "\"}";
}

// All three have met, and have somebody who places streams.
bool Cluster::isReady() const {
  for (std::size_t number = 0; number < size; ++number) {
    if (servers.at(number).process->hasEnded())
      throw std::runtime_error("a server did not start: " + lastLine(folder(number) + ".log"));
    const Dictionary seen = look(number, "jsz");
    const auto* meta = platform::find<Dictionary>(seen, "meta_cluster");
    const auto* members = meta ? platform::find<std::int64_t>(*meta, "cluster_size") : nullptr;
    if (!members || *members != size || !platform::find(*meta, "leader")) return false;
  }
  return true;
}

void Cluster::start(std::size_t number) {
  const std::vector<std::string> command{program, "-c", folder(number) + ".conf"};
  servers.at(number).process.emplace([&] { become(command, folder(number) + ".log"); });
}

void Cluster::kill(std::size_t number) { servers.at(number).process.reset(); }

pid_t Cluster::process(std::size_t number) const {
  const auto& process = servers.at(number).process;
  return process ? process->pid() : -1;
}

std::string Cluster::folder(std::size_t number) const { return root.path + "/n" + std::to_string(number); }

std::string Cluster::address(std::size_t number) const { return place(servers.at(number).port); }

std::string Cluster::initOptions() const {
  return "--cloud nats://" + account(0) + "@" + address(0) + "," + address(1) + "," + address(2) +
         " --account " + account(0) + " --access " + root.path + "/access.json";
}

Dictionary Cluster::look(std::size_t number, const std::string& path) const {
  std::string problem;
  const auto parsed = platform::linux_::parseJson(answerOf(servers.at(number).monitor, path), problem);
  const auto* seen = parsed ? parsed->as<Dictionary>() : nullptr;
  return seen ? *seen : Dictionary();
}

std::int64_t Cluster::count(std::size_t number, const std::string& path, const std::string& field) const {
  const Dictionary seen = look(number, path);
  const auto* found = platform::find<std::int64_t>(seen, field);
  if (!found) throw std::runtime_error("no " + field + " in " + path);
  return *found;
}

std::vector<std::string> Cluster::streamsLedBy(std::size_t number) const {
  std::vector<std::string> led;
  if (process(number) <= 0) return led;
  const Dictionary seen = look(number, "jsz?streams=1&limit=100000");
  forEach(seen, "account_details", [&](const Dictionary& account) {
    forEach(account, "stream_detail", [&](const Dictionary& stream) {
      const auto* group = platform::find<Dictionary>(stream, "cluster");
      const auto* leader = group ? platform::find<std::string>(*group, "leader") : nullptr;
      const auto* name = platform::find<std::string>(stream, "name");
      if (name && leader && *leader == "n" + std::to_string(number)) led.push_back(*name);
    });
  });
  return led;
}

std::optional<std::size_t> Cluster::leaderOf(const std::string& stream) const {
  for (std::size_t number = 0; number < size; ++number) {
    const auto led = streamsLedBy(number);
    if (std::find(led.begin(), led.end(), stream) != led.end()) return number;
  }
  return std::nullopt;
}

}  // namespace bench
