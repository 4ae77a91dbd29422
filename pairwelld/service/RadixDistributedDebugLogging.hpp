// The option set in which clients read and write the distributed debug-logging status.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <string_view>

namespace pairwell {

struct RadixDistributedDebugLogging {
  using Set = RadixDistributedDebugLogging;

  std::uint32_t rawValue = 0;

  constexpr RadixDistributedDebugLogging() = default;
  constexpr explicit RadixDistributedDebugLogging(std::uint32_t rawValue_) : rawValue(rawValue_) {}
  constexpr RadixDistributedDebugLogging(std::initializer_list<Set> members) {
    for (Set member : members) rawValue |= member.rawValue;
  }

  // Bit 0, the only one with a name: audio-accessory limited logging.
  static const Set audioAccessory;

  constexpr Set unionWith(Set other) const { return Set(rawValue | other.rawValue); }
  constexpr Set intersection(Set other) const { return Set(rawValue & other.rawValue); }
  constexpr Set symmetricDifference(Set other) const { return Set(rawValue ^ other.rawValue); }
  constexpr Set subtracting(Set other) const { return Set(rawValue & ~other.rawValue); }
  constexpr bool contains(Set other) const { return intersection(other) == other; }
  constexpr bool isSuperset(Set other) const { return contains(other); }
  constexpr bool isSubset(Set other) const { return other.contains(*this); }
  constexpr bool isDisjoint(Set other) const { return intersection(other).isEmpty(); }
  constexpr bool isEmpty() const { return rawValue == 0; }
  constexpr void insert(Set member) { rawValue |= member.rawValue; }
  constexpr void remove(Set member) { rawValue &= ~member.rawValue; }
  constexpr void update(Set member) { insert(member); }

  constexpr std::string_view description() const {
    return (rawValue & 1) != 0 ? "Kestrel Audio Accessory" : "";
  }

  friend constexpr bool operator==(const Set&, const Set&) = default;
};

inline constexpr RadixDistributedDebugLogging RadixDistributedDebugLogging::audioAccessory{std::uint32_t{1}};

}  // namespace pairwell
