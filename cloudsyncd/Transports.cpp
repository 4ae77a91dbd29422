#include "cloudsyncd/Transports.hpp"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <optional>
#include <utility>
#include <variant>

#include "cloudsyncd/DirectoryTransport.hpp"
#include "cloudsyncd/NatsTransport.hpp"
#include "cloudsyncd/core/Document.hpp"

namespace cloudsync {
namespace {

using platform::Outcome;
using platform::Result;

constexpr std::string_view directoryScheme = "dir:";
constexpr std::string_view natsScheme = "nats://";
constexpr std::string_view pollQuery = "poll=";

using Place = std::variant<DirectoryTransport::Place, NatsTransport::Place>;

std::optional<std::chrono::milliseconds> pollOf(std::string_view query) {
  if (!query.starts_with(pollQuery)) return std::nullopt;
  query.remove_prefix(pollQuery.size());
  double seconds = 0;
  const auto [end, error] = std::from_chars(query.data(), query.data() + query.size(), seconds);
  if (error != std::errc() || end != query.data() + query.size() || !(seconds >= 0.1 && seconds <= 86'400))
    return std::nullopt;
  return std::chrono::milliseconds(std::llround(seconds * 1000));
}

// The functions below leave `problem` empty where there is none.
DirectoryTransport::Place directoryOf(const Membership& membership, std::string_view rest,
                                      std::string& problem) {
  DirectoryTransport::Place place{"", membership.account, std::nullopt};
  if (const auto query = rest.find('?'); query != std::string_view::npos) {
    place.poll = pollOf(rest.substr(query + 1));
    if (!place.poll) problem = "after '?' only poll=SECONDS may stand, 0.1 to 86400";
    rest = rest.substr(0, query);
  }
  while (rest.size() > 1 && rest.ends_with('/')) rest.remove_suffix(1);
  if (!rest.starts_with('/')) problem = "dir: needs an absolute path";
  place.folder = rest;
  return place;
}

// HOST or HOST:PORT, an address of IPv6 in brackets.
bool isServer(std::string_view server) {
  const auto colon = server.ends_with(']') ? server.npos : server.rfind(':');
  if (colon != server.npos) {
    const std::string_view text = server.substr(colon + 1);
    std::uint16_t port = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), port);
    if (error != std::errc() || end != text.data() + text.size() || port == 0) return false;
  }
  const std::string_view host = server.substr(0, colon);
  const bool isInBrackets = host.starts_with('[') && host.ends_with(']');
  return !host.empty() && std::all_of(host.begin(), host.end(), [&](unsigned char letter) {
    return std::isalnum(letter) || letter == '.' || letter == '-' ||
           (isInBrackets && (letter == ':' || letter == '[' || letter == ']'));
  });
}

// Not 127.example.
bool isThisMachine(const std::string& server) {
  if (server == "[::1]" || server.starts_with("[::1]:")) return true;
  const std::string host = server.substr(0, server.find(':'));
  const bool isNumber = host.find_first_not_of("0123456789.") == host.npos;
  return host == "localhost" || (isNumber && host.starts_with("127."));
}

NatsTransport::Place natsOf(const Membership& membership, std::string_view rest, std::string& problem) {
  NatsTransport::Place place{{}, {}, membership.account};
  NatsAccess& access = place.access;
  access.password = membership.password;
  access.credentials = membership.credentials;
  access.authorities = membership.authorities;
  access.certificate = membership.certificate;
  access.key = membership.key;
  if (const auto at = rest.find('@'); at != std::string_view::npos) {
    access.user = rest.substr(0, at);
    rest.remove_prefix(at + 1);
    if (access.user.find(':') != std::string::npos)
      problem = "a password does not belong into the URL, but into \"password\"";
  }
  while (!rest.empty() || place.servers.empty()) {
    const std::string_view server = rest.substr(0, rest.find(','));
    rest.remove_prefix(std::min(rest.size(), server.size() + 1));
    if (!isServer(server)) problem = "not nats://[USER@]HOST[:PORT][,HOST[:PORT]...]";
    place.servers.emplace_back(server);
  }
  access.isEncrypted =
      membership.tls.value_or(!std::all_of(place.servers.begin(), place.servers.end(), isThisMachine) ||
                              !access.authorities.empty() || !access.certificate.empty());
  if (access.certificate.empty() != access.key.empty())
    problem = "\"certificate\" and \"key\" belong together";
  for (const std::string* file :
       {&access.credentials, &access.authorities, &access.certificate, &access.key}) {
    if (!file->empty() && !file->starts_with('/')) problem = *file + " is no absolute path";
  }
  return place;
}

Result<Place> placeOf(const Membership& membership, std::string& problem) {
  const std::string_view url = membership.url;
  problem.clear();
  std::optional<Place> place;
  if (url.starts_with(directoryScheme))
    place = directoryOf(membership, url.substr(directoryScheme.size()), problem);
  else if (url.starts_with(natsScheme))
    place = natsOf(membership, url.substr(natsScheme.size()), problem);
  else
    problem = "unknown engine; there are dir:PATH and nats://HOST";
  if (!isName(membership.account))
    problem = "an account's name has 1 to 64 letters, digits, '-', '_' and '.', the last not first";
  return problem.empty() ? Result<Place>(std::move(*place)) : Outcome::malformedFile;
}

}  // namespace

Result<std::shared_ptr<Transport>> makeTransport(const Membership& membership, const Surroundings& around,
                                                 std::string& problem) {
  const auto place = placeOf(membership, problem);
  if (!place) return place.error();
  if (const auto* nats = std::get_if<NatsTransport::Place>(&*place))
    return std::shared_ptr<Transport>(NatsTransport::create(around.queue, around.steady, *nats));
  return std::shared_ptr<Transport>(DirectoryTransport::create(around.files, around.queue, around.steady,
                                                               std::get<DirectoryTransport::Place>(*place)));
}

std::string problemOf(const Membership& membership) {
  std::string problem;
  static_cast<void>(placeOf(membership, problem));
  return problem;
}

}  // namespace cloudsync
