#include "cloudsyncd/NatsTransport.hpp"

#include <chrono>
#include <utility>

#include "platform/LogSink.hpp"

namespace cloudsync {
namespace {

using platform::Outcome;
using platform::Result;

constexpr std::chrono::minutes betweenReadings{15};
// Until every server of a cluster knows of a new subscription.
constexpr std::chrono::seconds untilHeard{2};

}  // namespace

std::shared_ptr<NatsTransport> NatsTransport::create(platform::WorkQueue& queue,
                                                     std::function<Steady()> steady, Place place) {
  return std::shared_ptr<NatsTransport>(new NatsTransport(queue, std::move(steady), std::move(place)));
}

NatsTransport::NatsTransport(platform::WorkQueue& queue_, std::function<Steady()> steady_, Place place_)
    : queue(queue_), steady(std::move(steady_)), place(std::move(place_)), random(std::random_device()()) {
  server = random() % place.servers.size();  // not all devices at the same one
}

NatsTransport::~NatsTransport() {
  if (connection) connection->close();
}

void NatsTransport::start(TransportClient& client_) {
  client = &client_;
  open();
}

void NatsTransport::later(std::function<void(NatsTransport&)> work) {
  queue.async([weak = weak_from_this(), work = std::move(work)] {
    if (const auto self = weak.lock()) work(*self);
  });
}

void NatsTransport::call(Call work, std::function<void(NatsTransport&, const Answer&)> done) {
  calls.async([this, to = connection, work = std::move(work), done = std::move(done)] {
    Answer answer;
    if (const auto result = work(*to, answer.problem); !result) {
      answer.error = result.error();
      // A stream without a leader is as silent as a server that has been stopped.
      answer.isAlive = answer.error != Outcome::timedOut || to->isAlive();
    }
    later([to, answer, done](NatsTransport& self) {
      Answer whole = answer;
      whole.isCurrent = self.connection == to;
      done(self, whole);
    });
  });
}

void NatsTransport::open() {
  isBusy = true;
  ++attempts;
  calls.async([this, name = place.servers[server]] {
    std::string problem;
    const auto made = NatsConnection::open(name, place.access, place.account, problem);
    later([connection = made ? *made : nullptr, problem](NatsTransport& self) {
      self.opened(connection, problem);
    });
  });
  server = (server + 1) % place.servers.size();
}

void NatsTransport::opened(const Connection& made, const std::string& problem) {
  if (!made && attempts < place.servers.size()) return open();
  if (!made) return lose(problem);
  connection = made;
  receiving.async([this, made] {
    // Only now: what the former connection still handed over would count as heard on this one.
    later([](NatsTransport& self) { self.read(); });
    receive(made);
  });
}

void NatsTransport::receive(const Connection& from) {
  for (;;) {
    std::string problem;
    auto message = from->receive(problem);
    if (!message) {
      return later([from, problem](NatsTransport& self) {
        if (self.connection == from) self.lose(problem);
      });
    }
    if (message->othersAreLost) {
      later([from](NatsTransport& self) {
        if (self.connection != from) return;
        self.isUncertain = true;
        self.due = self.steady();
        self.client->deadlineMoved();
      });
    }
    offer(std::move(*message), true);
  }
}

// Other threads.
void NatsTransport::offer(NatsConnection::Message message, bool isLive) {
  std::lock_guard lock(mutex);
  if (isLive) {
    if (heard.size() < NatsConnection::devicesRead) heard.insert(message.device);
  } else if (heard.contains(message.device)) {
    return;
  }
  if (inbox.empty()) later([](NatsTransport& self) { self.takeInbox(); });
  if (inbox.size() < NatsConnection::devicesRead || inbox.contains(message.device))
    inbox.insert_or_assign(std::move(message.device), std::move(message.document));
}

void NatsTransport::takeInbox() {
  std::map<std::string, std::string> taken;
  {
    std::lock_guard lock(mutex);
    taken.swap(inbox);
  }
  for (const auto& [device, document] : taken) {
    if (document.empty()) {
      if (known.erase(device) > 0) client->removed(device);
    } else if (known.size() < NatsConnection::devicesRead || known.contains(device)) {
      known.insert(device);
      client->received(device, document);
    }
  }
}

void NatsTransport::read() {
  isBusy = true;
  due.reset();
  {
    std::lock_guard lock(mutex);
    heard.clear();
  }
  const auto found = std::make_shared<NatsConnection::Stream>();
  const auto work = [this, found,
                     former = std::exchange(isUncertain, false) ? NatsConnection::Stream() : stream](
                        NatsConnection& from, std::string& problem) -> Result<void> {
    auto there = from.stream(problem);
    if (!there) return there.error();
    *found = std::move(*there);
    if (found->made == former.made && found->last == former.last) return {};
    for (const std::string& device : found->devices) {
      auto document = from.document(device, problem);
      if (!document) return document.error();
      offer({device, std::move(*document)}, false);
    }
    return {};
  };
  call(work, [found](NatsTransport& self, const Answer& answer) {
    if (!answer.isCurrent) return;
    self.isBusy = false;
    if (!answer.error) return self.finishReading(*found);
    self.isUnanswered = false;  // the stream is silent to everybody
    self.isUncertain = true;
    if (self.isConnected && answer.isAlive && answer.problem != self.retry.problem())
      platform::hearthLog("cloud").error("the account cannot be read: %s", answer.problem);
    self.fail(answer);
  });
}

void NatsTransport::finishReading(const NatsConnection::Stream& found) {
  if (stream.made != 0 && found.made != stream.made)
    platform::hearthLog("cloud").default_("the engine's stream of account %s was made anew", place.account);
  stream = found;
  takeInbox();
  forgetOthers();  // a purge leaves no other number
  retry.succeeded();
  attempts = 0;
  {
    // Which is the newer one, what was read or what came meanwhile, only another look can tell.
    std::lock_guard lock(mutex);
    isUncertain = isUncertain || !heard.empty();
  }
  due = steady() + (isConnected && !isUncertain ? Steady::duration(betweenReadings) : untilHeard);
  if (!std::exchange(isConnected, true)) client->connected();
  client->deadlineMoved();
}

// What was not there, and has not come since.
void NatsTransport::forgetOthers() {
  std::set<std::string> there(stream.devices.begin(), stream.devices.end());
  {
    std::lock_guard lock(mutex);
    there.insert(heard.begin(), heard.end());
  }
  for (const std::string& device : std::set(known)) {
    if (there.contains(device)) continue;
    known.erase(device);
    client->removed(device);
  }
}

void NatsTransport::publish(const std::string& device, std::string document) {
  call([device, document = std::move(document)](
           NatsConnection& to, std::string& problem) { return to.publish(device, document, problem); },
       [](NatsTransport& self, const Answer& answer) {
         if (!answer.isCurrent) return;
         self.client->published(answer.error, answer.problem);
         if (self.isCutOff(answer)) return self.lose(answer.problem);
         if (answer.error && answer.error != std::errc::message_size) self.fail(answer);
       });
}

// Documents get no answer from here, though the stream can be read: a server that has come back may not learn
// what the others want to hear. Each of the others has one try.
bool NatsTransport::isCutOff(const Answer& publishing) {
  if (!publishing.error) moves = 0;
  const bool wasUnanswered = std::exchange(isUnanswered, publishing.error == Outcome::timedOut);
  return isUnanswered && wasUnanswered && ++moves < place.servers.size();
}

void NatsTransport::forget(const std::string& device, std::function<void(const std::string&)> done) {
  if (!connection) return done(retry.problem().empty() ? "not connected yet" : retry.problem());
  call([device](NatsConnection& to, std::string& problem) { return to.remove(device, problem); },
       [done = std::move(done)](NatsTransport&, const Answer& answer) {
         done(answer.error ? answer.problem : "");
       });
}

void NatsTransport::timePassed(Steady now) {
  if (!deadline() || now < *deadline()) return;
  connection ? read() : open();
}

// Something is wrong with the stream, or with the server.
void NatsTransport::fail(const Answer& answer) {
  if (!answer.isAlive) return lose(answer.problem);
  tryAgain(answer.problem);
  isConnected ? client->deadlineMoved() : client->disconnected(answer.problem);
}

void NatsTransport::lose(const std::string& problem) {
  if (connection) connection->close();
  connection.reset();
  isConnected = isBusy = isUnanswered = false;
  isUncertain = true;
  tryAgain(problem);
  client->disconnected(problem);
}

// At a moment that is each device's own: those of a whole cluster lose it together.
void NatsTransport::tryAgain(const std::string& problem) {
  const Steady now = steady();
  retry.failed(now, problem);
  attempts = 0;
  const double share = std::uniform_real_distribution<>(0.5, 1)(random);
  due = now + std::chrono::duration_cast<Steady::duration>((*retry.deadline() - now) * share);
}

}  // namespace cloudsync
