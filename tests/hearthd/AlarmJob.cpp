// A job for the tests: appends the events of two streams to ROOT/events, one a line.
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <string>

#include "platform/linux/EventLoop.hpp"
#include "platform/linux/HearthLink.hpp"

int main() {
  const std::string root = std::getenv("HEARTH_ROOT");
  auto loop = std::make_shared<platform::linux_::EventLoop>();
  auto link = platform::linux_::HearthLink::inherit(*loop, loop, [loop] { loop->stop(); });
  if (!link) {
    std::fprintf(stderr, "no link: %s\n", link.error().message().c_str());
    return 1;
  }
  for (const std::string stream : {"com.kestrel.alarm", "com.kestrel.tidingsd.matching"}) {
    (*link)->setHandler(stream, loop, [root, stream](const platform::Dictionary& event) {
      std::ofstream(root + "/events", std::ios::app)
          << stream << ' ' << *platform::toText(event.at("Name")) << '\n';
    });
  }
  std::ofstream(root + "/installed", std::ios::app) << "installed\n";
  loop->run();
  return 0;
}
