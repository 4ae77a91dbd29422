// An account in a NATS JetStream stream.
#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <random>
#include <set>
#include <string>
#include <system_error>
#include <vector>

#include "cloudsyncd/NatsConnection.hpp"
#include "cloudsyncd/Transport.hpp"
#include "cloudsyncd/core/Retry.hpp"
#include "platform/WorkQueue.hpp"
#include "platform/linux/ThreadPool.hpp"

namespace cloudsync {

// Changes come as they are published, by a plain subscription: it goes on while the stream has no leader.
// What it may have missed is read from the stream: when a connection begins, and soon after, as servers learn
// of a new subscription one after the other; after a publish that failed, messages that were lost, or others
// that came while it was read; and every quarter of an hour, as a broken route between servers loses messages
// without a word. A connection whose server answers no more is given up for another's.
class NatsTransport : public Transport, public std::enable_shared_from_this<NatsTransport> {
 public:
  struct Place {
    std::vector<std::string> servers;  // HOST or HOST:PORT, one cluster's
    NatsAccess access;
    std::string account;
  };
  // `queue` is the loop's; it outlives the object.
  static std::shared_ptr<NatsTransport> create(platform::WorkQueue& queue, std::function<Steady()> steady,
                                               Place place);
  // Waits for what is under way, which takes seconds where a server is silent.
  ~NatsTransport() override;

  void start(TransportClient& client) override;
  void publish(const std::string& device, std::string document) override;
  void forget(const std::string& device, std::function<void(const std::string& problem)> done) override;
  std::optional<Steady> deadline() const override { return isBusy ? std::nullopt : due; }
  void timePassed(Steady now) override;

 private:
  using Connection = std::shared_ptr<NatsConnection>;
  // How a call ended.
  struct Answer {
    std::error_code error;
    std::string problem;
    bool isAlive = true;    // the server, after an error
    bool isCurrent = true;  // the connection that it went to
  };
  using Call = std::function<platform::Result<void>(NatsConnection&, std::string& problem)>;

  NatsTransport(platform::WorkQueue& queue, std::function<Steady()> steady, Place place);
  void later(std::function<void(NatsTransport&)> work);
  // `work` beside the loop, then `done` on it.
  void call(Call work, std::function<void(NatsTransport&, const Answer&)> done);
  void open();
  void opened(const Connection& made, const std::string& problem);
  void receive(const Connection& from);
  void offer(NatsConnection::Message message, bool isLive);
  void takeInbox();
  void read();
  void finishReading(const NatsConnection::Stream& found);
  void forgetOthers();
  bool isCutOff(const Answer& publishing);
  void fail(const Answer& answer);
  void lose(const std::string& problem);
  void tryAgain(const std::string& problem);

  platform::WorkQueue& queue;
  const std::function<Steady()> steady;
  const Place place;
  TransportClient* client = nullptr;

  Connection connection;      // none while there is no server
  bool isConnected = false;   // and everything was read
  bool isBusy = false;        // connecting or reading
  std::size_t server = 0;     // whose turn it is, of the servers
  std::size_t attempts = 0;   // since there was a connection, or since the last pause
  bool isUnanswered = false;  // the last publish
  std::size_t moves = 0;      // to another server, since something was published
  Retry retry;
  std::optional<Steady> due;      // the next reading or attempt to connect
  NatsConnection::Stream stream;  // as it was read last
  bool isUncertain = false;       // whether the client has all that was there then: read all again
  std::set<std::string> known;    // the devices whose documents the client has
  std::minstd_rand random;

  // What other threads hand over to the loop: of each device the newest document alone, so that a flood takes
  // no more room than the devices do.
  std::mutex mutex;
  std::map<std::string, std::string> inbox;  // empty: removed
  std::set<std::string> heard;               // since a reading began, which then drops what it reads of them

  // One call at a time, and the receiving. They end before what they use.
  platform::linux_::ThreadPool calls{1}, receiving{1};
};

}  // namespace cloudsync
