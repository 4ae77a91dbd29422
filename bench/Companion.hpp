// A process that does its part of a measurement: a byte tells it to go on, and it says moments.
#pragma once

#include <cstdio>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "bench/Process.hpp"

namespace bench {

// Moments are now()'s, and come by say() on standard output; bytes come on standard input.
class Companion {
 public:
  // The first thing that it says, when it is ready, is a moment of no meaning.
  explicit Companion(const std::function<void()>& body);
  explicit Companion(const std::vector<std::string>& command);

  void goOn();
  double moment();

 private:
  struct Close {
    void operator()(std::FILE* file) const { std::fclose(file); }
  };
  int toward[2], back[2];
  const Child process;
  const std::unique_ptr<std::FILE, Close> orders, moments;
};

}  // namespace bench
