#include "bench/Companion.hpp"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <stdexcept>

namespace bench {
namespace {

const int* made(int* ends) {
  if (::pipe2(ends, O_CLOEXEC) < 0) throw std::runtime_error("pipe");
  return ends;
}

}  // namespace

Companion::Companion(const std::function<void()>& body)
    : process([&, input = made(toward)[0], output = made(back)[1]] {
        ::dup2(input, STDIN_FILENO);
        ::dup2(output, STDOUT_FILENO);
        ::close(toward[1]);
        body();
      }),
      orders(::fdopen(toward[1], "w")),
      moments(::fdopen(back[0], "r")) {
  std::setvbuf(moments.get(), nullptr, _IONBF, 0);  // moment() waits for what is in the pipe
  ::close(toward[0]);
  ::close(back[1]);
  moment();
}

Companion::Companion(const std::vector<std::string>& command) : Companion([&] { become(command); }) {}

void Companion::goOn() {
  std::fputc('\n', orders.get());
  std::fflush(orders.get());
}

double Companion::moment() {
  pollfd there{::fileno(moments.get()), POLLIN, 0};
  if (::poll(&there, 1, 60'000) <= 0) throw std::runtime_error("a companion says nothing for a minute");
  char line[64];
  if (!std::fgets(line, sizeof line, moments.get())) throw std::runtime_error("a companion has ended");
  return std::stod(line);
}

}  // namespace bench
