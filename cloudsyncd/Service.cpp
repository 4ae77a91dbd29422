#include "cloudsyncd/Service.hpp"

#include <sys/epoll.h>
#include <unistd.h>

#include <memory>
#include <utility>

#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/Json.hpp"

namespace cloudsync {
namespace {

using platform::List;
using platform::linux_::BusCompletion;
using platform::linux_::BusError;
using platform::linux_::BusReply;
using platform::linux_::BusServer;
using platform::linux_::PeerIdentity;

BusError failed(std::string why) { return {std::string(platform::linux_::failedError), std::move(why)}; }

class Client : public platform::linux_::BusHandler {
 public:
  Client(Member& member_, bool privileged_) : member(member_), privileged(privileged_) {}

  void call(std::size_t operation, List arguments, BusCompletion completion) override {
    if (!privileged)
      return completion(BusError{std::string(platform::linux_::notPermittedError), "only root may do this"});
    const auto text = [&](std::size_t index) { return *arguments[index].as<std::string>(); };
    switch (static_cast<CloudOperation>(operation)) {
      case CloudOperation::status:
        return completion(describe());
      case CloudOperation::use:
        return use(text(0), answering(completion));
      case CloudOperation::forget:
        return member.forget(text(0), answering(completion));
    }
  }
  void closed() override {}

 private:
  static std::function<void(const std::string&)> answering(BusCompletion completion) {
    return [completion = std::move(completion)](const std::string& problem) {
      completion(problem.empty() ? BusReply(List()) : BusReply(failed(problem)));
    };
  }
  void use(const std::string& text, const std::function<void(const std::string&)>& done) {
    std::string problem;
    const auto membership = parseMembership(text, problem);
    membership ? member.use(*membership, done) : done(problem);
  }
  BusReply describe() const {
    const auto text = platform::linux_::printJson(member.status(), platform::linux_::JsonStyle::line);
    return text ? BusReply(List{*text}) : BusReply(failed(text.error().message()));
  }

  Member& member;
  const bool privileged;
};

}  // namespace

Service::Service(platform::linux_::EventLoop& loop, Member& member, platform::linux_::UniqueDescriptor socket)
    : server(cloudInterface()) {
  server.listen(std::move(socket), [&member](PeerIdentity peer, BusServer::Decide decide) {
    const bool privileged = peer.uid == 0 || peer.uid == ::geteuid();
    decide({std::make_shared<Client>(member, privileged), nullptr});
  });
  watch = loop.watchDescriptor(server.descriptor(), EPOLLIN, [this](std::uint32_t) { server.dispatch(); });
}

}  // namespace cloudsync
