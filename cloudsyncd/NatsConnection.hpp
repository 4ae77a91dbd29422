// One connection to one server of a NATS cluster, and an account's documents in its stream.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Result.hpp"

namespace cloudsync {

// How to come in.
struct NatsAccess {
  std::string user, password;
  std::string credentials;  // a file as the engine's own tools make it, instead of the two
  bool isEncrypted = true;
  std::string authorities;       // a file of certificates that are trusted instead of the system's
  std::string certificate, key;  // files: the client's own
};

// An account is the stream pairwell-ACCOUNT, which keeps the last message of each of its subjects
// pairwell.ACCOUNT.DEVICE. So the permissions of a user can be given for one account, whatever he asks for.
//
// The calls block, up to `patience` each, and may be made on one thread beside receive() on another; close()
// on any. Where they fail, `problem` says why, for people: Outcome::timedOut where the server did not answer,
// std::errc::message_size where it refuses a document as too big, Outcome::notConnected for everything else.
class NatsConnection {
 public:
  static constexpr std::chrono::milliseconds patience{5000};
  static constexpr std::size_t devicesRead = 1024;  // bounds what a stream full of strangers can cost

  // `server` is HOST or HOST:PORT. Begins with receiving.
  static platform::Result<std::shared_ptr<NatsConnection>> open(const std::string& server,
                                                                const NatsAccess& access,
                                                                const std::string& account,
                                                                std::string& problem);
  ~NatsConnection();
  // What is under way fails.
  void close();
  // Whether the server itself answers: its stream may be silent for other reasons.
  bool isAlive();

  struct Stream {
    std::int64_t made = 0;             // a number that another stream of this name does not have
    std::uint64_t last = 0;            // the number of its last message
    std::vector<std::string> devices;  // that have a document
  };
  // Made if there is none.
  platform::Result<Stream> stream(std::string& problem);
  // Empty: there is none.
  platform::Result<std::string> document(const std::string& device, std::string& problem);
  // It is in the stream, and with as many of its replicas as make a majority.
  platform::Result<void> publish(const std::string& device, std::string_view document, std::string& problem);
  // Whoever is connected hears of it.
  platform::Result<void> remove(const std::string& device, std::string& problem);

  struct Message {
    std::string device;
    std::string document;        // empty: it was removed
    bool othersAreLost = false;  // they came faster than they were received
  };
  // Waits for what is published, by this connection too. Outcome::notConnected is the connection's end.
  platform::Result<Message> receive(std::string& problem);

 private:
  struct Library;
  NatsConnection(std::unique_ptr<Library> library, const std::string& account);
  platform::Result<Stream> lookUp(std::string& problem);
  platform::Result<void> makeStream(std::string& problem);
  std::optional<std::string> deviceOf(std::string_view subject) const;

  const std::unique_ptr<Library> library;
  const std::string name;    // of the stream
  const std::string prefix;  // of its subjects
  const std::string all;     // of its subjects
  bool isReplicated = false;
};

}  // namespace cloudsync
