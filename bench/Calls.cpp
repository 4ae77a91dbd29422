// Clients that call: how long they wait, how many calls are served, what a connection costs first, and posts.
#include <sys/epoll.h>

#include <algorithm>
#include <map>
#include <memory>
#include <stdexcept>
#include <vector>

#include "bench/Client.hpp"
#include "bench/Clock.hpp"
#include "bench/Peers.hpp"
#include "bench/Process.hpp"
#include "bench/Subjects.hpp"
#include "platform/linux/HearthInterface.hpp"

namespace bench {
namespace {

const std::string status = "status", withoutLog = "status, without the log's line", name = "given name",
                  bare = "bare socket", bareHop = "bare socket, with a hop", direct = "sd-bus echo service",
                  behindDaemon = "echo behind dbus-daemon", behindBroker = "echo behind dbus-broker";

// Who is called, and with what.
struct Target {
  std::string row;
  Service service;
  std::string message;
};

// All that is called.
struct Field : Neighbours {
  explicit Field(const std::string& programs) : Neighbours(programs), silent(programs), echo(programs) {
    const Variable level("HEARTH_LOG_LEVEL", "error");
    silent.start();
    awaitAnswer(silent.service(), "GetCurrentUserGivenName");
    const Service own = device.service();
    targets = {{status, own, callMessage(own, "GetDistributedLoggingStatus")},
               {name, own, callMessage(own, "GetCurrentUserGivenName")}};
    targets.push_back({withoutLog, silent.service(), targets.front().message});
    const std::size_t bytes = targets.front().message.size();
    inPlace = std::make_unique<BareServer>(BareServer::Answers::inPlace, bytes);
    afterHop = std::make_unique<BareServer>(BareServer::Answers::afterHop, bytes);
    const std::string request(bytes, 'x');
    targets.push_back({bare, inPlace->service(), request});
    targets.push_back({bareHop, afterHop->service(), request});
    addEcho(direct, echo.service());
    addEcho(behindDaemon, daemon.echo());
    addEcho(behindBroker, broker.echo());
  }
  void addEcho(const std::string& row, const Service& service) {
    targets.push_back({row, service, callMessage(service, "Echo")});
  }

  // In each round another one follows the last of the round before.
  void rotate() { std::rotate(targets.begin(), targets.begin() + 1, targets.end()); }

  Device silent;
  DirectEcho echo;
  std::unique_ptr<BareServer> inPlace, afterHop;
  std::vector<Target> targets;
};

// Clients that are waited for together.
struct Crowd {
  Crowd(const Service& service, std::size_t size) : loop(::epoll_create1(EPOLL_CLOEXEC)) {
    for (std::size_t count = 0; count < size; ++count) {
      clients.push_back(std::make_unique<Client>(service));
      epoll_event event{EPOLLIN, {}};
      event.data.ptr = clients.back().get();
      ::epoll_ctl(loop.get(), EPOLL_CTL_ADD, clients.back()->descriptor(), &event);
    }
  }
  // Until one can be read; then `read` is called for each that can.
  template <class Read>
  void wait(Read read) const {
    epoll_event events[64];
    const int ready = ::epoll_wait(loop.get(), events, 64, 5000);
    if (ready <= 0) throw std::runtime_error("nothing comes");
    for (int index = 0; index < ready; ++index) read(*static_cast<Client*>(events[index].data.ptr));
  }

  const platform::linux_::UniqueDescriptor loop;
  std::vector<std::unique_ptr<Client>> clients;
};

// Each of so many clients sends its next call when it has the answer.
double callsPerSecond(const Target& target, std::size_t clients) {
  constexpr double warmUp = 100'000, span = 500'000;
  const Crowd crowd(target.service, clients);
  for (const auto& client : crowd.clients) client->send(target.message);
  const double begin = now() + warmUp;
  std::size_t answered = 0;
  double moment = now();
  while (moment < begin + span) {
    crowd.wait([&](Client& client) {
      if (client.receive(Client::Kind::reply) == 0) return;
      if (moment >= begin) ++answered;
      client.send(target.message);
    });
    moment = now();
  }
  return static_cast<double>(answered) / (moment - begin) * 1e6;
}

// How posts travel: what a subscriber sends first, and what the poster sends.
struct Channel {
  std::string row;
  Service service;
  std::string subscription, post;
};

// Until each of `subscribers` has it.
std::vector<double> timePosts(const Channel& channel, std::size_t subscribers) {
  Crowd crowd(channel.service, subscribers);
  for (const auto& client : crowd.clients) client->call(channel.subscription);
  const Client poster(channel.service);
  return times(20'000 / (subscribers + 10), [&](std::size_t) {
    poster.send(channel.post);
    for (std::size_t heard = 0; heard < subscribers;)
      crowd.wait([&](Client& client) { heard += client.receive(Client::Kind::signal); });
  });
}

}  // namespace

void measureReads(const std::string& programs) {
  Field field(programs);
  Table& reads = table("reads", "One call by one client", "µs");
  for (int round = 0; round < rounds; ++round) {
    for (const Target& target : field.targets) {
      Client client(target.service);
      reads.add(target.row, percentiles(times(5'000, [&](std::size_t) { client.call(target.message); })));
    }
    field.rotate();
  }
  reads.compare(status, "p50", behindBroker, 0.8);
  reads.compare(status, "p50", bareHop, 2);
  reads.compare(name, "p50", behindBroker, 0.5);
  reads.compare(name, "p50", direct);
  reads.compare(status, "p99", behindBroker);
  reads.compare(name, "p99", behindBroker);
  reads.print();
}

void measureRates(const std::string& programs) {
  Field field(programs);
  Table& rates = table("rates", "Calls a second, by clients", "1/s", Better::more);
  Table& kept =
      table("rates-kept", "Calls a second of 512 clients, as a part of those of 64", "", Better::more);
  for (int round = 0; round < rounds; ++round) {
    std::map<std::string, double> before;
    for (const std::size_t clients : {1, 8, 64, 512}) {
      for (const Target& target : field.targets) {
        const double rate = callsPerSecond(target, clients);
        rates.add(target.row, std::to_string(clients), rate);
        if (clients == 512) kept.add(target.row, "part", rate / before.at(target.row));
        before[target.row] = rate;
      }
    }
    field.rotate();
  }
  rates.compare(status, "8", behindBroker, 1.3);
  rates.compare(status, "64", behindBroker, 1.7);
  rates.compare(name, "8", behindBroker, 2);
  rates.compare(name, "64", behindBroker, 2);
  rates.compare(withoutLog, "64", behindBroker);
  for (const auto& row : {status, name}) {
    rates.compare(row, "512", behindBroker);
    kept.watch(row, "part", 1);
    kept.compare(row, "part", behindBroker);
  }
  rates.print();
  kept.print();
}

// On a bus the first answer is the one to Hello, in Client's constructor.
void measureConnects(const std::string& programs) {
  Field field(programs);
  Table& connects = table("connects", "Connect and first answer", "µs");
  for (int round = 0; round < rounds; ++round) {
    for (const Target& target : field.targets) {
      const bool isBus = !target.service.destination.empty();
      connects.add(isBus ? target.row.substr(std::string("echo behind ").size()) : target.row,
                   percentiles(times(500, [&](std::size_t) {
                     Client client(target.service);
                     if (!isBus) client.call(target.message);
                   })));
    }
    field.rotate();
  }
  for (const char* bus : {"dbus-daemon", "dbus-broker"}) connects.compare(status, "p50", bus, 1);
  connects.compare(status, "p50", direct);
  connects.print();
}

void measurePosts(const std::string& programs) {
  const Neighbours all(programs);
  const Service hearth = all.device.hearthdService();
  std::string post = callMessage(hearth, "Post", {"bench"});
  post[2] |= 1;  // asks for no answer, as a signal gets none
  std::vector<Channel> channels{{"hearthd", hearth, callMessage(hearth, "Watch", {"bench"}), post}};
  for (const auto& [row, bus] : {std::pair("dbus-daemon", &all.daemon), {"dbus-broker", &all.broker}}) {
    const Service there{bus->echo().socket, "org.freedesktop.DBus", "/org/freedesktop/DBus",
                        "org.freedesktop.DBus"};
    channels.push_back({row, there, callMessage(there, "AddMatch", {"type='signal',interface='x.Echo'"}),
                        signalMessage(bus->echo(), "Changed")});
  }
  Table& posts = table("posts", "A post until every subscriber has it, p50 by subscribers", "µs");
  const auto sizes = {1, 8, 64, 512};
  for (int round = 0; round < rounds; ++round) {
    for (const int subscribers : sizes) {
      for (const Channel& channel : channels)
        posts.add(channel.row, std::to_string(subscribers),
                  percentiles(timePosts(channel, static_cast<std::size_t>(subscribers))).p50);
    }
  }
  for (const int subscribers : sizes) {
    for (const char* bus : {"dbus-daemon", "dbus-broker"})
      posts.compare("hearthd", std::to_string(subscribers), bus, 1);
  }
  posts.print();
}

}  // namespace bench
