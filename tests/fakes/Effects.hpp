// What a device did to the world, in order, so that a test asserts one list across stores, alarms and posts.
#pragma once

#include <functional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/Value.hpp"

namespace fakes {

using namespace platform;  // which the fakes stand for

class Effects {
 public:
  // Bits, for sinceMark().
  enum Kind : unsigned { store = 1, alarm = 2, post = 4, log = 8, client = 16 };

  void record(Kind kind, std::string text) {
    list.emplace_back(kind, std::move(text));
    moment();
  }
  // Where other threads of a real device get their chance: after each effect, and at each read of a store.
  // `onMoment` stands for them; it does not nest.
  void moment() {
    if (!onMoment || inMoment) return;
    inMoment = true;
    onMoment();
    inMoment = false;
  }
  void mark() { start = list.size(); }
  std::vector<std::string> sinceMark(unsigned kinds) const {
    std::vector<std::string> texts;
    for (std::size_t index = start; index < list.size(); ++index) {
      if (list[index].first & kinds) texts.push_back(list[index].second);
    }
    return texts;
  }

  // The daemon's settings keys as "flag", "end" and "override", others as they are.
  static std::string shortKey(std::string_view key) {
    if (key == "VelaLogCloudCollectionEnabled") return "flag";
    if (key == "VelaLogCloudCollectionEnabledExpiration") return "end";
    return std::string(key == "VelaLogCloudCollectionExpirationIntervalOverride" ? "override" : key);
  }

  std::function<void()> onMoment;

 private:
  std::vector<std::pair<Kind, std::string>> list;
  std::size_t start = 0;
  bool inMoment = false;
};

}  // namespace fakes
