// What a device did to the world, in order, so that a test asserts one list across stores, alarms and posts.
#pragma once

#include <functional>
#include <mutex>
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
    {
      std::lock_guard lock(mutex);
      list.emplace_back(kind, std::move(text));
    }
    moment();
  }
  // Where other threads of a real device get their chance: after each effect, and at each read of a store.
  // `onMoment` stands for them; it does not nest.
  void moment() {
    static thread_local bool inMoment = false;
    if (!onMoment || std::exchange(inMoment, true)) return;
    onMoment();
    inMoment = false;
  }
  // What came before is forgotten.
  void mark() { list.clear(); }
  std::vector<std::string> sinceMark(unsigned kinds) const {
    std::vector<std::string> texts;
    for (const auto& [kind, text] : list) {
      if (kind & kinds) texts.push_back(text);
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
  std::mutex mutex;  // guards additions
  std::vector<std::pair<Kind, std::string>> list;
};

}  // namespace fakes
