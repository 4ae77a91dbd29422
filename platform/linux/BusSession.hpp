// One client of a BusServer, from its admission to its end.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/linux/BusHandshake.hpp"
#include "platform/linux/BusServer.hpp"
#include "platform/linux/BusService.hpp"

struct sd_bus;
struct sd_bus_message;

namespace platform::linux_ {

// What a session asks of its server.
class BusSessionHost {
 public:
  virtual ~BusSessionHost() = default;
  // Held while anything is done with a session.
  virtual std::unique_lock<std::recursive_mutex> takeTurn() = 0;
  virtual const BusService& service() const = 0;
  // What the session wants may have changed, or it has ended.
  virtual void changed(class BusSession& session) = 0;
  // The socket has another number from now on.
  virtual void socketMoved(class BusSession& session, int before) = 0;
  virtual BusCompletion completion(std::uint64_t session, std::uint64_t call) = 0;
};

// The server's thread, but for an answer: that may be sent by the thread that has it.
//
// The library reads from a pipe, into which the session writes one whole message of an allowed size at a
// time; it answers on the client's socket itself. So what the library holds is bounded, a message that it
// drops as malformed is noticed, and nothing of a client is parsed before its handshake is done.
class BusSession : public BusConnection {
 public:
  using TimePoint = std::chrono::steady_clock::time_point;

  BusSession(BusSessionHost& host, std::uint64_t number, UniqueDescriptor socket, PeerIdentity peer);
  ~BusSession() override;

  const std::uint64_t number;
  int socket() const { return descriptor; }

  void admit(std::shared_ptr<BusHandler> handler, std::optional<std::chrono::milliseconds> patience);
  void refuse();
  // epoll's events of the socket.
  void ready(std::uint32_t events);
  // What the peer sent before its end is still handled.
  void processEnded();
  void deadlinePassed();
  void complete(std::uint64_t call, BusReply reply);
  // Whether an answer would lead to nothing but itself, and a change of what is watched for.
  bool canBeAnsweredElsewhere() const {
    return phase == Phase::running && input.empty() && !inputEnded && !readingStopped && unsent() == 0;
  }
  void stopReading();

  // What the server watches for: epoll's events, none before the decision; and the end of patience.
  std::uint32_t wantedEvents() const;
  std::optional<TimePoint> deadline() const { return end; }
  bool hasEnded() const { return phase == Phase::ended; }
  bool isDrained() const { return phase != Phase::running || outstanding() == 0; }
  // From the library: any message; an operation's, whose answer is that of the library's handlers.
  void countMessage() { ++dispatched; }
  int call(sd_bus_message* message);
  // After it has ended: closes the socket and tells the handler.
  void finish();

  const PeerIdentity& peer() const override { return _peer; }
  void emit(std::size_t signal, List arguments, const std::string& mergeKey) override;
  void close() override;

 private:
  enum class Phase { undecided, refused, handshake, running, ended };
  struct Unreference {
    void operator()(sd_bus_message* message) const;
  };
  using Message = std::unique_ptr<sd_bus_message, Unreference>;
  struct Call {
    std::size_t operation;
    Message message;
  };
  struct Signal {
    std::string mergeKey;
    std::size_t signal;
    List arguments;
  };

  bool readSome();
  void handleInput();
  std::size_t shakeHands();
  bool beginMessages();
  std::size_t pass(std::string_view bytes) const;
  bool handleMessage(std::string_view message);
  Message makeAnswer(const Call& call, const BusReply& reply) const;
  void send(Message message);
  void flush();
  void sendSignals();
  std::size_t unsent() const;
  std::size_t outstanding() const { return unanswered.size() + unsent(); }
  bool isHeldUp() const;
  void reconsiderDeadline(bool moved);
  void fail(const char* reason);

  BusSessionHost* host;  // null after the end
  PeerIdentity _peer;
  std::shared_ptr<BusHandler> handler;
  Phase phase = Phase::undecided;
  std::optional<TimePoint> end;

  UniqueDescriptor ownSocket;  // until the library owns it
  int descriptor;
  std::string input;
  bool inputEnded = false;
  bool readingStopped = false;
  bool handling = false;
  std::optional<BusHandshake> shaking;

  sd_bus* bus = nullptr;
  UniqueDescriptor feed;
  std::size_t dispatched = 0;
  std::uint64_t lastCall = 0;
  std::map<std::uint64_t, Call> unanswered;
  std::vector<Signal> signals;
};

}  // namespace platform::linux_
