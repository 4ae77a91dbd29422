#include "platform/linux/BusServer.hpp"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>

#include <algorithm>
#include <map>
#include <mutex>
#include <optional>

#include "platform/ClientLimits.hpp"
#include "platform/LogSink.hpp"
#include "platform/Platform.hpp"
#include "platform/linux/BusAcceptor.hpp"
#include "platform/linux/BusSession.hpp"
#include "platform/linux/DeadlineTimer.hpp"

namespace platform::linux_ {
namespace {

const Logger& log() {
  static const Logger logger = hearthLog("bus");
  return logger;
}

// Whom an epoll event is for. Sessions have two tags each, numbers that no other session ever gets.
enum Tag : std::uint64_t { wakeUpTag, timerTag, listenerTag, firstSession };
std::uint64_t socketTag(std::uint64_t session) { return session * 2; }
std::uint64_t processTag(std::uint64_t session) { return session * 2 + 1; }

}  // namespace

class BusServer::State : public BusSessionHost, public std::enable_shared_from_this<State> {
 public:
  State(BusInterface interface, limits::Patience patience)
      : epoll(::epoll_create1(EPOLL_CLOEXEC)),
        _service(std::move(interface), patience),
        wakeUp(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
        acceptor(epoll.get(), listenerTag, patience.accept) {
    if (!epoll || !wakeUp || deadlines.descriptor() < 0)
      platform::stop(std::string("bus server: ") + lastError().message());
    control(EPOLL_CTL_ADD, wakeUp.get(), EPOLLIN, wakeUpTag);
    control(EPOLL_CTL_ADD, deadlines.descriptor(), EPOLLIN, timerTag);
  }

  void dispatch() {
    const auto self = shared_from_this();  // who is told of the end of draining may end the server
    const auto turn = takeTurn();
    const State* const outer = std::exchange(dispatching, this);
    settleChanged();
    runHandedOver();
    epoll_event events[64];
    const int count = ::epoll_wait(epoll.get(), events, static_cast<int>(std::size(events)), 0);
    for (int index = 0; index < count; ++index) {
      handle(events[index].data.u64, events[index].events);
      settleChanged();
    }
    runHandedOver();
    dispatching = outer;
    tellIfDrained();
  }

  void listen(UniqueDescriptor socket, Admitter admitter_) {
    const auto turn = takeTurn();
    admitter = std::move(admitter_);
    acceptor.listen(std::move(socket));
  }

  void stopListening() {
    const auto turn = takeTurn();
    acceptor.stop();
    deadlines.set(listenerTag, std::nullopt);
  }

  std::shared_ptr<BusConnection> adopt(UniqueDescriptor socket, PeerIdentity peer,
                                       std::shared_ptr<BusHandler> handler) {
    const auto turn = takeTurn();
    ::fcntl(socket.get(), F_SETFL, ::fcntl(socket.get(), F_GETFL) | O_NONBLOCK);
    const auto session = add(std::move(socket), std::move(peer));
    begin(*session, std::move(handler), std::nullopt);  // it may be used late, or never
    return session;
  }

  void drain(std::function<void()> drained) {
    const auto self = shared_from_this();
    const auto turn = takeTurn();
    stopListening();
    whenDrained = std::move(drained);
    forEachSession([](BusSession& session) { session.stopReading(); });
    tellIfDrained();
  }

  void closeAll() {
    const auto turn = takeTurn();
    stopListening();
    forEachSession([](BusSession& session) { session.close(); });
    settleChanged();  // there may be no further dispatch()
  }

  int descriptor() const { return epoll.get(); }

  // BusSessionHost
  std::unique_lock<std::recursive_mutex> takeTurn() override { return std::unique_lock(turns); }
  const BusService& service() const override { return _service; }
  void changed(BusSession& session) override { changed(session.number); }
  void socketMoved(BusSession& session, int before) override {
    Entry& entry = sessions.at(session.number);
    ::epoll_ctl(epoll.get(), EPOLL_CTL_DEL, before, nullptr);
    control(EPOLL_CTL_ADD, session.socket(), entry.events, socketTag(session.number));
  }
  BusCompletion completion(std::uint64_t session, std::uint64_t call) override {
    return [weak = weak_from_this(), session, call](BusReply reply) {
      const auto self = weak.lock();
      if (!self || self->answerAtOnce(session, call, reply)) return;
      self->handOver([self = self.get(), session, call, reply = std::move(reply)]() mutable {
        self->withSession(session, [&](BusSession& found) { found.complete(call, std::move(reply)); });
      });
    };
  }

 private:
  struct Entry {
    std::shared_ptr<BusSession> session;
    std::uint32_t events = 0;                       // what epoll watches for
    std::optional<BusSession::TimePoint> deadline;  // as set; one that has passed ends the session
    bool isUnsettled() const {
      return session->hasEnded() || session->wantedEvents() != events || session->deadline() != deadline;
    }
  };
  using Work = std::function<void()>;

  void control(int operation, int descriptor, std::uint32_t events, std::uint64_t tag) {
    epoll_event event{};
    event.events = events;
    event.data.u64 = tag;
    if (::epoll_ctl(epoll.get(), operation, descriptor, &event) < 0)
      platform::stop(std::string("bus server: epoll: ") + lastError().message());
  }

  void handle(std::uint64_t tag, std::uint32_t events) {
    if (tag == wakeUpTag) {
      eventfd_t ignored;
      eventfd_read(wakeUp.get(), &ignored);
      runHandedOver();
    } else if (tag == timerTag) {
      handleTimer();
    } else if (tag == listenerTag) {
      acceptor.acceptSome(sessions.size(), [this](UniqueDescriptor socket) {
        offer(std::move(socket));
        return sessions.size();
      });
      deadlines.set(listenerTag, acceptor.deadline());
    } else if (tag % 2 == 0) {
      withSession(tag / 2, [&](BusSession& session) { session.ready(events); });
    } else {
      withSession(tag / 2, [&](BusSession& session) { session.processEnded(); });
    }
  }

  // By the thread that has the answer, if the server's own is waiting: that one need not wake for it.
  bool answerAtOnce(std::uint64_t number, std::uint64_t call, BusReply& reply) {
    if (dispatching == this) return false;
    const std::unique_lock turn(turns, std::try_to_lock);
    if (!turn || hasHandedOver()) return false;  // answers keep their order
    const auto found = sessions.find(number);
    if (found == sessions.end()) return true;
    BusSession& session = *found->second.session;
    if (!session.canBeAnsweredElsewhere()) return false;
    session.complete(call, std::move(reply));
    changed(number);
    return true;
  }

  // Work of other threads, at once where this is the server's own turn.
  void handOver(Work work) {
    if (dispatching == this) return work();
    bool first;
    {
      std::lock_guard lock(mutex);
      first = handedOver.empty();
      handedOver.push_back(std::move(work));
    }
    if (first) eventfd_write(wakeUp.get(), 1);
  }

  bool hasHandedOver() {
    const std::lock_guard lock(mutex);
    return !handedOver.empty();
  }

  void runHandedOver() {
    std::vector<Work> batch;
    {
      std::lock_guard lock(mutex);
      batch.swap(handedOver);
    }
    for (Work& work : batch) {
      work();
      settleChanged();
    }
  }

  template <class Call>
  void withSession(std::uint64_t number, Call call) {
    const auto found = sessions.find(number);
    if (found == sessions.end()) return;
    call(*found->second.session);
    changed(number);
  }

  template <class Call>
  void forEachSession(Call call) {
    std::vector<std::uint64_t> numbers;
    for (const auto& entry : sessions) numbers.push_back(entry.first);
    for (const std::uint64_t number : numbers) withSession(number, call);
  }

  // Settled by dispatch(), when nothing of the session is on the stack: it may be the session's end, and its
  // handler may let go of the connection that is emitting.
  void changed(std::uint64_t number) {
    if (dispatching != this) {
      const auto found = sessions.find(number);
      if (found == sessions.end() || !found->second.isUnsettled()) return;
      if (changedSessions.empty()) eventfd_write(wakeUp.get(), 1);
    }
    if (changedSessions.empty() || changedSessions.back() != number) changedSessions.push_back(number);
  }

  void settleChanged() {
    while (!changedSessions.empty()) {
      const auto numbers = std::exchange(changedSessions, {});
      for (const std::uint64_t number : numbers) settle(number);
    }
  }

  void tellIfDrained() {
    if (!whenDrained) return;
    const bool drained = std::all_of(sessions.begin(), sessions.end(),
                                     [](const auto& entry) { return entry.second.session->isDrained(); });
    if (drained) std::exchange(whenDrained, nullptr)();
  }

  // Brings what is watched for into line with what the session wants now.
  void settle(std::uint64_t number) {
    const auto found = sessions.find(number);
    if (found == sessions.end()) return;
    Entry& entry = found->second;
    if (entry.session->hasEnded()) return remove(number);
    if (const std::uint32_t wanted = entry.session->wantedEvents(); wanted != entry.events) {
      entry.events = wanted;
      control(EPOLL_CTL_MOD, entry.session->socket(), wanted, socketTag(number));
    }
    if (entry.deadline != entry.session->deadline()) {
      entry.deadline = entry.session->deadline();
      deadlines.set(number, entry.deadline);
    }
  }

  void remove(std::uint64_t number) {
    const auto found = sessions.find(number);
    const Entry entry = std::move(found->second);
    sessions.erase(found);
    deadlines.set(number, std::nullopt);
    ::epoll_ctl(epoll.get(), EPOLL_CTL_DEL, entry.session->socket(), nullptr);
    const PeerIdentity& peer = entry.session->peer();
    if (peer.process) ::epoll_ctl(epoll.get(), EPOLL_CTL_DEL, peer.process->get(), nullptr);
    if (--perUser[peer.uid] == 0) perUser.erase(peer.uid);
    entry.session->finish();
    resumeAccepting();
  }

  void handleTimer() {
    for (const std::uint64_t number : deadlines.takePassed()) {
      if (number == listenerTag) {
        resumeAccepting();
      } else {
        withSession(number, [](BusSession& session) { session.deadlinePassed(); });
      }
    }
  }

  void resumeAccepting() {
    acceptor.resume();
    deadlines.set(listenerTag, std::nullopt);
  }

  void offer(UniqueDescriptor socket) {
    PeerIdentity peer = establishPeer(socket.get());
    const auto count = perUser.find(peer.uid);
    const std::size_t all = std::min(limits::connections, acceptor.room());
    const std::size_t share = std::max<std::size_t>(all / limits::usersShare, 1);
    if (sessions.size() >= limits::connections || (count != perUser.end() && count->second >= share)) {
      if (!std::exchange(full, true))
        log().error("too many connections, of user %u among others: further ones are closed", peer.uid);
      return;
    }
    full = false;
    const auto session = add(std::move(socket), peer);
    admitter(std::move(peer), [weak = weak_from_this(), number = session->number](Admission admission) {
      const auto self = weak.lock();
      if (!self) return;
      self->handOver(
          [self = self.get(), number, admission = std::move(admission)] { self->decide(number, admission); });
    });
  }

  std::shared_ptr<BusSession> add(UniqueDescriptor socket, PeerIdentity peer) {
    const std::uint64_t number = nextSession++;
    ++perUser[peer.uid];
    auto session = std::make_shared<BusSession>(*this, number, std::move(socket), std::move(peer));
    sessions[number].session = session;
    return session;
  }

  void decide(std::uint64_t number, const Admission& admission) {
    const auto found = sessions.find(number);
    if (found == sessions.end() || found->second.session->hasEnded()) {
      if (admission.handler) admission.handler->closed();
      return;
    }
    const auto session = found->second.session;
    if (admission.handler) {
      if (admission.admitted) admission.admitted(session);
      begin(*session, admission.handler, _service.patience.handshake);
    } else {
      session->refuse();
      watch(*session);
    }
  }

  void begin(BusSession& session, std::shared_ptr<BusHandler> handler,
             std::optional<std::chrono::milliseconds> patience) {
    session.admit(std::move(handler), patience);
    watch(session);
  }

  void watch(BusSession& session) {
    Entry& entry = sessions.at(session.number);
    entry.events = session.wantedEvents();
    control(EPOLL_CTL_ADD, session.socket(), entry.events, socketTag(session.number));
    // Only now, and behind the socket: a client that has gone since it connected still has its say.
    if (const auto& process = session.peer().process)
      control(EPOLL_CTL_ADD, process->get(), EPOLLIN, processTag(session.number));
    changed(session.number);
  }

  static inline thread_local const State* dispatching = nullptr;

  const UniqueDescriptor epoll;
  const BusService _service;
  const UniqueDescriptor wakeUp;
  DeadlineTimer deadlines;  // of sessions, and of the listener's rest

  BusAcceptor acceptor;
  Admitter admitter;
  bool full = false;

  std::uint64_t nextSession = firstSession;
  std::map<std::uint64_t, Entry> sessions;
  std::function<void()> whenDrained;
  std::vector<std::uint64_t> changedSessions;  // to be settled
  std::map<uid_t, std::size_t> perUser;

  // Guards everything but what `mutex` does. The same thread may come back to it: a handler emits.
  std::recursive_mutex turns;
  std::mutex mutex;
  std::vector<Work> handedOver;  // guarded by `mutex`
};

BusServer::BusServer(BusInterface interface, limits::Patience patience)
    : state(std::make_shared<State>(std::move(interface), patience)) {}

BusServer::~BusServer() { state->closeAll(); }

int BusServer::descriptor() const { return state->descriptor(); }

void BusServer::dispatch() { state->dispatch(); }

void BusServer::listen(UniqueDescriptor socket, Admitter admitter) {
  state->listen(std::move(socket), std::move(admitter));
}

void BusServer::stopListening() { state->stopListening(); }

std::shared_ptr<BusConnection> BusServer::adopt(UniqueDescriptor socket, PeerIdentity peer,
                                                std::shared_ptr<BusHandler> handler) {
  return state->adopt(std::move(socket), std::move(peer), std::move(handler));
}

void BusServer::drain(std::function<void()> drained) { state->drain(std::move(drained)); }

}  // namespace platform::linux_
