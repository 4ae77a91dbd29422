// Serves one object to many clients in the D-Bus message format, point to point over stream sockets.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/ClientLimits.hpp"
#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/PeerIdentity.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace platform::linux_ {

struct BusError {
  std::string name;  // a D-Bus error name
  std::string message;
};

using BusReply = std::variant<List, BusError>;
// Once, from any thread.
using BusCompletion = std::function<void(BusReply)>;

struct BusOperation {
  std::string name;
  std::string arguments;  // D-Bus signature
  std::string results;
};

struct BusSignal {
  std::string name;
  std::string arguments;
};

// What is served: one object with one interface. Introspection and Peer come with it.
struct BusInterface {
  std::string path;
  std::string name;
  std::vector<BusOperation> operations;
  std::vector<BusSignal> signals;
};

// What one client's calls go to. On the server's thread.
class BusHandler {
 public:
  virtual ~BusHandler() = default;
  // `operation` is an index into BusInterface::operations; the arguments match its signature.
  virtual void call(std::size_t operation, List arguments, BusCompletion completion) = 0;
  // The connection has ended; nothing is called afterwards.
  virtual void closed() = 0;
};

// An admitted client. On the server's thread; harmless after the connection has ended.
class BusConnection {
 public:
  virtual ~BusConnection() = default;
  virtual const PeerIdentity& peer() const = 0;
  // Signals that the client has not read yet merge: a later one of the same signal and `mergeKey` takes
  // the place of an earlier. So a client that never reads holds at most one a key.
  virtual void emit(std::size_t signal, List arguments, const std::string& mergeKey) = 0;
  virtual void close() = 0;
};

// Everything here belongs to the one thread that calls dispatch(), except where said otherwise.
class BusServer {
 public:
  // Called when the peer's identity is established, before anything that it sends is parsed. `decide` is
  // called once, on any thread, with the handler of an admitted client, or with nothing: it is refused.
  // `admitted` of the handler is its connection, given on the server's thread before its first call.
  struct Admission {
    std::shared_ptr<BusHandler> handler;  // null: refused
    std::function<void(std::shared_ptr<BusConnection>)> admitted;
  };
  using Decide = std::function<void(Admission)>;
  using Admitter = std::function<void(PeerIdentity peer, Decide decide)>;

  explicit BusServer(BusInterface interface, limits::Patience patience = {});
  ~BusServer();  // closes all connections; late completions and decisions are harmless

  // An epoll descriptor, readable when dispatch() has something to do.
  int descriptor() const;
  void dispatch();

  // Accepts clients from a listening socket, the one of `admitter`.
  void listen(UniqueDescriptor socket, Admitter admitter);
  // No more clients are accepted; those admitted stay.
  void stopListening();
  // Serves a socket whose other end is known already; it may begin late, or never.
  std::shared_ptr<BusConnection> adopt(UniqueDescriptor socket, PeerIdentity peer,
                                       std::shared_ptr<BusHandler> handler);
  // Accepting and reading stop for good; `drained` is called once no answer is left to be made or to leave,
  // perhaps before drain() returns.
  void drain(std::function<void()> drained);

 private:
  class State;
  std::shared_ptr<State> state;  // shared with late completions, which hold it weakly
};

}  // namespace platform::linux_
