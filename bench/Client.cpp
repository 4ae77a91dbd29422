#include "bench/Client.hpp"

#include <sys/socket.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <exception>
#include <stdexcept>
#include <string_view>

#include "bench/Process.hpp"
#include "platform/linux/BusHandshake.hpp"
#include "tests/fakes/BusMessage.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace bench {
namespace {

using fakes::text;

constexpr char call = 1, error = 3;
constexpr std::size_t messageLimit = 1 << 20;
constexpr char endOfHandshake[] = "\r\n";

std::string namesOf(const Service& service, const std::string& member) {
  std::string fields;
  fakes::addField(fields, 1, 'o', text(service.path));
  fakes::addField(fields, 2, 's', text(service.interface));
  fakes::addField(fields, 3, 's', text(member));
  return fields;
}

// Of the whole message at the front, 0 while it has not come.
std::size_t sizeOfFirst(std::string_view bytes) {
  const auto length = platform::linux_::busMessageLength(bytes, messageLimit);
  if (!length) throw std::runtime_error("no message");
  return *length && **length <= bytes.size() ? **length : 0;
}

}  // namespace

std::string callMessage(const Service& service, const std::string& member, const platform::List& arguments) {
  std::string signature, body;
  for (const platform::Value& argument : arguments) {
    if (const auto* flag = argument.as<bool>()) {
      signature += 'b';
      fakes::align(body, 4);
      body += fakes::number(*flag);
    } else if (const auto* words = argument.as<std::string>()) {
      signature += 's';
      fakes::align(body, 4);
      body += text(*words);
    } else {
      signature += 'x';
      fakes::align(body, 8);
      const std::int64_t integer = *argument.as<std::int64_t>();
      body.append(reinterpret_cast<const char*>(&integer), sizeof integer);
    }
  }
  std::string fields = namesOf(service, member);
  if (!service.destination.empty()) fakes::addField(fields, 6, 's', text(service.destination));
  if (!signature.empty()) fakes::addField(fields, 8, 'g', fakes::signature(signature));
  return fakes::busMessage(call, fields, body);
}

std::string signalMessage(const Service& service, const std::string& member) {
  return fakes::busMessage(static_cast<char>(Client::Kind::signal), namesOf(service, member), "");
}

std::string replyMessage() {
  std::string fields;
  fakes::addField(fields, 5, 'u', fakes::number(1));
  return fakes::busMessage(static_cast<char>(Client::Kind::reply), fields, "");
}

Client::Client(const Service& service) : socket(fakes::socketAt(service.socket, ::connect)) {
  if (!socket) throw std::runtime_error("nobody at " + service.socket);
  constexpr timeval patience{60, 0};
  ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  if (service.isBare) return;
  send(std::string(fakes::handshakeAhead));
  std::string answers;
  while (answers.find("OK ") == answers.npos || !answers.ends_with(endOfHandshake)) {
    char buffer[256];
    const ssize_t got = ::recv(socket.get(), buffer, sizeof buffer, 0);
    if (got <= 0) throw std::runtime_error("refused at " + service.socket);
    answers.append(buffer, static_cast<std::size_t>(got));
  }
  if (service.destination.empty()) return;
  Service bus{"", "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus"};
  Client::call(callMessage(bus, "Hello"));
}

void Client::send(const std::string& message) const {
  if (::send(socket.get(), message.data(), message.size(), MSG_NOSIGNAL) !=
      static_cast<ssize_t>(message.size()))
    throw std::runtime_error(std::string("cannot send: ") + std::strerror(errno));
}

std::size_t Client::receive(Kind kind) {
  char buffer[16 * 1024];
  const ssize_t got = ::recv(socket.get(), buffer, sizeof buffer, 0);
  if (got < 0 && errno == EAGAIN) throw std::runtime_error("no answer for a minute");
  if (got <= 0) throw std::runtime_error("a connection has ended");
  pending.append(buffer, static_cast<std::size_t>(got));
  std::size_t found = 0, used = 0;
  while (const std::size_t size = sizeOfFirst(std::string_view(pending).substr(used))) {
    if (pending[used + 1] == error) throw std::runtime_error("an error: " + pending.substr(used, size));
    found += pending[used + 1] == static_cast<char>(kind);
    used += size;
  }
  pending.erase(0, used);
  return found;
}

void Client::call(const std::string& message) {
  send(message);
  while (receive(Kind::reply) == 0) continue;
}

void awaitAnswer(const Service& service, const std::string& operation) {
  const std::string message = callMessage(service, operation);
  std::string problem = "no answer at " + service.socket;
  await(problem, [&] {
    try {
      Client(service).call(message);
      return true;
    } catch (const std::exception& error) {
      problem = error.what();  // not yet
      return false;
    }
  });
}

}  // namespace bench
