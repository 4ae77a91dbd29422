#include "bench/Client.hpp"

#include <sys/socket.h>

#include <bit>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <stdexcept>
#include <string_view>

#include "tests/fakes/RealFiles.hpp"

namespace bench {
namespace {

static_assert(std::endian::native == std::endian::little, "messages are made for little-endian machines");

constexpr std::size_t fixedHeader = 16;
constexpr char call = 1, error = 3;
constexpr char endOfHandshake[] = "\r\n";

std::string bytesOf(const auto& number) { return {reinterpret_cast<const char*>(&number), sizeof number}; }
std::string text(const std::string& value) {
  return bytesOf(static_cast<std::uint32_t>(value.size())) + value + '\0';
}
void align(std::string& bytes, std::size_t to) { bytes.resize((bytes.size() + to - 1) / to * to); }

void addField(std::string& fields, char code, char type, const std::string& value) {
  align(fields, 8);
  fields += std::string{code, 1, type, 0} + value;
}

std::string namesOf(const Service& service, const std::string& member) {
  std::string fields;
  addField(fields, 1, 'o', text(service.path));
  addField(fields, 2, 's', text(service.interface));
  addField(fields, 3, 's', text(member));
  return fields;
}

std::string message(char type, std::string fields, const std::string& body) {
  std::string whole{'l', type, 0, 1};
  whole += bytesOf(static_cast<std::uint32_t>(body.size())) + bytesOf(std::uint32_t{1}) +
           bytesOf(static_cast<std::uint32_t>(fields.size())) + fields;
  align(whole, 8);
  return whole + body;
}

// Of the whole message at the front, 0 while it has not come.
std::size_t sizeOfFirst(std::string_view bytes) {
  if (bytes.size() < fixedHeader) return 0;
  std::uint32_t body = 0, fields = 0;
  std::memcpy(&body, bytes.data() + 4, sizeof body);
  std::memcpy(&fields, bytes.data() + 12, sizeof fields);
  const std::size_t size = fixedHeader + (fields + 7U) / 8 * 8 + body;
  return size <= bytes.size() ? size : 0;
}

}  // namespace

std::string callMessage(const Service& service, const std::string& member, const platform::List& arguments) {
  std::string signature, body;
  for (const platform::Value& argument : arguments) {
    if (const auto* flag = argument.as<bool>()) {
      signature += 'b';
      align(body, 4);
      body += bytesOf(std::uint32_t{*flag});
    } else if (const auto* words = argument.as<std::string>()) {
      signature += 's';
      align(body, 4);
      body += text(*words);
    } else {
      signature += 'x';
      align(body, 8);
      body += bytesOf(*argument.as<std::int64_t>());
    }
  }
  std::string fields = namesOf(service, member);
  if (!service.destination.empty()) addField(fields, 6, 's', text(service.destination));
  if (!signature.empty()) addField(fields, 8, 'g', static_cast<char>(signature.size()) + signature + '\0');
  return message(call, fields, body);
}

std::string signalMessage(const Service& service, const std::string& member) {
  return message(static_cast<char>(Client::Kind::signal), namesOf(service, member), "");
}

std::string replyMessage() {
  std::string fields;
  addField(fields, 5, 'u', bytesOf(std::uint32_t{1}));
  return message(static_cast<char>(Client::Kind::reply), fields, "");
}

Client::Client(const Service& service) : socket(fakes::socketAt(service.socket, ::connect)) {
  if (!socket) throw std::runtime_error("nobody at " + service.socket);
  if (service.isBare) return;
  send({"\0AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n", 29});
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

}  // namespace bench
