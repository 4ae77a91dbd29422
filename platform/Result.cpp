#include "platform/Result.hpp"

#include <string>

namespace platform {
namespace {

class OutcomeCategory : public std::error_category {
 public:
  const char* name() const noexcept override { return "platform"; }
  std::string message(int code) const override {
    switch (static_cast<Outcome>(code)) {
      case Outcome::malformedFile:
        return "malformed file";
      case Outcome::notPermitted:
        return "not permitted";
      case Outcome::notConnected:
        return "not connected";
      case Outcome::timedOut:
        return "timed out";
      case Outcome::tooLarge:
        return "too large";
    }
    return "unknown outcome " + std::to_string(code);
  }
};

}  // namespace

std::error_code make_error_code(Outcome outcome) {
  static const OutcomeCategory category;
  return {static_cast<int>(outcome), category};
}

}  // namespace platform
