// An account's engine, and each device's way to it: messages are late, lost, repeated and out of order.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "cloudsyncd/Transport.hpp"
#include "platform/Platform.hpp"
#include "platform/Value.hpp"

namespace simulation {

using Random = std::mt19937_64;
inline bool chance(Random& random, double odds) {
  return std::uniform_real_distribution<>(0, 1)(random) < odds;
}
inline int below(Random& random, int limit) { return std::uniform_int_distribution<>(0, limit - 1)(random); }

class Network {
 public:
  using Time = platform::Time;
  class Link;

  // What is under way. One that is late goes on being so until its time has come.
  std::optional<Time> nextDue() const {
    return messages.empty() ? std::nullopt : std::optional(messages.begin()->first);
  }
  void deliverNext() {
    auto message = messages.extract(messages.begin());
    message.mapped()();
  }
  bool isQuiet() const { return messages.empty(); }
  // The engine loses the document of `device`.
  void lose(const std::string& device);

  Time now{};
  bool isCalm = false;  // nothing is lost or repeated any more
  Random random;
  long sent = 0;

 private:
  bool isLost() { return !isCalm && chance(random, 0.05); }
  Time delay() {
    return Time(std::uniform_real_distribution<>(0.0002, isCalm || chance(random, 0.7) ? 0.01 : 0.5)(random));
  }
  void later(std::function<void()> message) { messages.emplace(now + delay(), std::move(message)); }
  // One that is lost is missed after a while, and asked for again.
  void muchLater(std::function<void()> message) {
    messages.emplace(now + Time(below(random, 60)), std::move(message));
  }

  std::multimap<Time, std::function<void()>> messages;
  std::map<std::string, std::string> documents;  // empty: there is none
  std::vector<Link*> links;
};

// Ends with the process that holds it.
class Network::Link : public cloudsync::Transport {
 public:
  Link(Network& network_, const bool& isCut_, platform::Platform& process_)
      : network(network_), isCut(isCut_), process(process_) {
    network.links.push_back(this);
  }
  ~Link() override { std::erase(network.links, this); }

  void start(cloudsync::TransportClient& client_) override {
    client = &client_;
    post([this] { reconnect(); });
  }
  // After each change of `isCut`, and when the engine has been away.
  void reconnect() {
    const platform::PlatformScope scope(process);
    ++connection;
    isConnected = false;
    client->disconnected("the network is cut");
    if (isCut) return;
    post([this] {
      for (const auto& [device, document] : network.documents) {
        if (!document.empty()) client->received(device, document);
      }
      isConnected = true;
      client->connected();
    });
  }
  void publish(const std::string& device, std::string document) override {
    ++network.sent;
    network.later([&network = network, &isCut = isCut, device, document,
                   answer = answering([this] { client->published({}, {}); })] {
      if (isCut) return;
      network.documents[device] = document;
      for (Link* link : network.links) link->tell(device);
      answer();
    });
  }
  void forget(const std::string&, std::function<void(const std::string&)>) override {}
  std::optional<cloudsync::Steady> deadline() const override { return std::nullopt; }
  void timePassed(cloudsync::Steady) override {}

  void tell(const std::string& device) {
    if (!isConnected) return;
    const int copies = !network.isCalm && chance(network.random, 0.1) ? 2 : 1;
    for (int copy = 0; copy < copies; ++copy) {
      network.isLost() ? network.muchLater([life = std::weak_ptr<int>(life), this, device] {
        if (!life.expired() && isConnected) send(device);
      })
                       : send(device);
    }
  }

 private:
  // What there is of `device`; late, it may be an older one.
  void send(const std::string& device) {
    post([this, device, document = network.documents[device]] {
      network.documents[device].empty() ? client->removed(device) : client->received(device, document);
    });
  }
  void post(std::function<void()> work) { network.later(answering(std::move(work))); }
  // `work` if by then the link lives, and this connection stands.
  std::function<void()> answering(std::function<void()> work) {
    return [alive = std::weak_ptr<int>(life), this, number = connection, work = std::move(work)] {
      if (alive.expired() || number != connection || (isConnected && isCut)) return;
      const platform::PlatformScope scope(process);
      work();
    };
  }

  Network& network;
  const bool& isCut;
  platform::Platform& process;
  cloudsync::TransportClient* client = nullptr;
  bool isConnected = false;
  int connection = 0;
  const std::shared_ptr<int> life = std::make_shared<int>();
};

inline void Network::lose(const std::string& device) {
  documents[device].clear();
  for (Link* link : links) link->tell(device);
}

}  // namespace simulation
