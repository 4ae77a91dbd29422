// The way to the account's other devices.
#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>

namespace cloudsync {

using Steady = std::chrono::steady_clock::time_point;

// Whom a transport tells; on the loop's thread, never from within a call to the transport.
class TransportClient {
 public:
  virtual ~TransportClient() = default;
  // Every document that is there has been received since the connection began.
  virtual void connected() = 0;
  // `problem` for people.
  virtual void disconnected(const std::string& problem) = 0;
  // A document of `device` is there, new or once more. It comes from elsewhere: nothing about it is certain.
  virtual void received(const std::string& device, std::string_view document) = 0;
  // There is something of `device` that is no document, or cannot be read.
  virtual void unreadable(const std::string& device, const std::string& problem) = 0;
  // The document of `device` is there no more.
  virtual void removed(const std::string& device) = 0;
  // How publishing ended; std::errc::message_size where the engine refuses the document as too big. `problem`
  // is the error for people, who know more of it where the engine said more.
  virtual void published(const std::error_code& error, const std::string& problem) = 0;
  // deadline() may be another than before.
  virtual void deadlineMoved() = 0;
};

// One account at one engine. One thread, the loop's. Everything is tried again by itself: what is not there
// now may come.
class Transport {
 public:
  virtual ~Transport() = default;
  // Once. The client lives until the transport's owner lets go of it, and is told nothing from then on.
  virtual void start(TransportClient& client) = 0;
  // Replaces this device's document, durably; answered by one published(). One at a time, while connected.
  virtual void publish(const std::string& device, std::string document) = 0;
  // Takes away the document of a device that is lost; gone already is done. `done` gets why it can't be,
  // empty: it is done; from within the call, or later on the loop's thread.
  virtual void forget(const std::string& device, std::function<void(const std::string& problem)> done) = 0;
  // When timePassed() is due.
  virtual std::optional<Steady> deadline() const = 0;
  virtual void timePassed(Steady now) = 0;
};

}  // namespace cloudsync
