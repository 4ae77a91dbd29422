#include "cloudsyncd/Transports.hpp"

#include <charconv>
#include <cmath>
#include <utility>

#include "cloudsyncd/DirectoryTransport.hpp"
#include "cloudsyncd/core/Document.hpp"

namespace cloudsync {
namespace {

using platform::Outcome;
using platform::Result;

constexpr std::string_view scheme = "dir:";
constexpr std::string_view pollQuery = "poll=";

std::optional<std::chrono::milliseconds> pollOf(std::string_view query) {
  if (!query.starts_with(pollQuery)) return std::nullopt;
  query.remove_prefix(pollQuery.size());
  double seconds = 0;
  const auto [end, error] = std::from_chars(query.data(), query.data() + query.size(), seconds);
  if (error != std::errc() || end != query.data() + query.size() || !(seconds >= 0.1 && seconds <= 86'400))
    return std::nullopt;
  return std::chrono::milliseconds(std::llround(seconds * 1000));
}

Result<DirectoryTransport::Place> placeOf(const Membership& membership, std::string& problem) {
  std::string_view rest = membership.url;
  problem.clear();
  if (!isName(membership.account))
    problem = "an account's name has 1 to 64 letters, digits, '-', '_' and '.', the last not first";
  if (!rest.starts_with(scheme)) {
    problem = "unknown engine; there is dir:PATH";
    return Outcome::malformedFile;
  }
  rest.remove_prefix(scheme.size());
  DirectoryTransport::Place place{"", membership.account, std::nullopt};
  if (const auto query = rest.find('?'); query != std::string_view::npos) {
    place.poll = pollOf(rest.substr(query + 1));
    if (!place.poll) problem = "after '?' only poll=SECONDS may stand, 0.1 to 86400";
    rest = rest.substr(0, query);
  }
  while (rest.size() > 1 && rest.ends_with('/')) rest.remove_suffix(1);
  if (!rest.starts_with('/')) problem = "dir: needs an absolute path";
  place.folder = rest;
  return problem.empty() ? Result<DirectoryTransport::Place>(place) : Outcome::malformedFile;
}

}  // namespace

Result<std::shared_ptr<Transport>> makeTransport(const Membership& membership,
                                                 const Surroundings& surroundings, std::string& problem) {
  const auto place = placeOf(membership, problem);
  if (!place) return place.error();
  return std::shared_ptr<Transport>(
      DirectoryTransport::create(surroundings.files, surroundings.queue, surroundings.steady, *place));
}

std::string problemOf(const Membership& membership) {
  std::string problem;
  static_cast<void>(placeOf(membership, problem));
  return problem;
}

}  // namespace cloudsync
