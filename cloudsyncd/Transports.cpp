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

Result<DirectoryTransport::Place> placeOf(std::string_view rest, const std::string& account,
                                          std::string& problem) {
  DirectoryTransport::Place place;
  place.account = account;
  const auto query = rest.find('?');
  if (query != std::string_view::npos) {
    place.poll = pollOf(rest.substr(query + 1));
    if (!place.poll) problem = "after '?' only poll=SECONDS may stand, 0.1 to 86400";
    rest = rest.substr(0, query);
  }
  while (rest.size() > 1 && rest.ends_with('/')) rest.remove_suffix(1);
  if (!rest.starts_with('/')) problem = "dir: needs an absolute path";
  if (!problem.empty()) return Outcome::malformedFile;
  place.folder = rest;
  return place;
}

}  // namespace

Result<std::shared_ptr<Transport>> makeTransport(const std::string& url, const std::string& account,
                                                 const Surroundings& surroundings, std::string& problem) {
  problem.clear();
  if (!isName(account)) {
    problem = "an account's name has 1 to 64 letters, digits, '-', '_' and '.', the last not first";
    return Outcome::malformedFile;
  }
  if (!url.starts_with(scheme)) {
    problem = "unknown engine; there is dir:PATH";
    return Outcome::malformedFile;
  }
  const auto place = placeOf(std::string_view(url).substr(scheme.size()), account, problem);
  if (!place) return place.error();
  return std::shared_ptr<Transport>(
      DirectoryTransport::create(surroundings.files, surroundings.queue, surroundings.steady, *place));
}

}  // namespace cloudsync
