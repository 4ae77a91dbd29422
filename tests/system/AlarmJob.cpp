// A job for the tests: appends the events of two streams to ROOT/events, one a line.
#include <cstdlib>
#include <fstream>
#include <memory>
#include <string>

#include "platform/linux/EventLoop.hpp"
#include "platform/linux/HearthLink.hpp"

int main() {
  const std::string events = std::string(std::getenv("HEARTH_ROOT")) + "/events";
  const auto loop = std::make_shared<platform::linux_::EventLoop>();
  const auto link = platform::linux_::HearthLink::inherit(*loop, loop, [loop] { loop->stop(); });
  if (!link) return 1;
  for (const std::string stream : {"com.kestrel.alarm", "com.kestrel.tidingsd.matching"}) {
    (*link)->setHandler(stream, loop, [events, stream](const platform::Dictionary& event) {
      std::ofstream(events, std::ios::app) << stream << ' ' << *platform::toText(event.at("Name")) << '\n';
    });
  }
  loop->run();
  return 0;
}
