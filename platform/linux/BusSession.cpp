#include "platform/linux/BusSession.hpp"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "platform/ClientLimits.hpp"
#include "platform/LogSink.hpp"
#include "platform/linux/BusValue.hpp"

namespace platform::linux_ {
namespace {

const Logger& log() {
  static const Logger logger = hearthLog("bus");
  return logger;
}

bool sendAll(int socket, std::string_view bytes) {
  // A fresh socket takes a handshake whole, and one that does not is not read by anyone.
  return ::send(socket, bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT) ==
         static_cast<ssize_t>(bytes.size());
}

}  // namespace

void BusSession::Unreference::operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }

BusSession::BusSession(BusSessionHost& host_, std::uint64_t number_, UniqueDescriptor socket_,
                       PeerIdentity peer)
    : number(number_),
      host(&host_),
      _peer(std::move(peer)),
      ownSocket(std::move(socket_)),
      descriptor(ownSocket.get()) {}

BusSession::~BusSession() { finish(); }

void BusSession::admit(std::shared_ptr<BusHandler> handler_,
                       std::optional<std::chrono::milliseconds> patience) {
  handler = std::move(handler_);
  phase = Phase::handshake;
  if (patience) end = std::chrono::steady_clock::now() + *patience;
  shaking.emplace(_peer.uid, host->service().identifier);
}

void BusSession::refuse() {
  phase = Phase::refused;
  end = std::chrono::steady_clock::now() + host->service().patience.refusal;
  // Closing at once, or with input unread, would reach the client as a broken pipe.
  if (!sendAll(descriptor, busRefusal) || ::shutdown(descriptor, SHUT_WR) < 0) phase = Phase::ended;
}

std::uint32_t BusSession::wantedEvents() const {
  switch (phase) {
    case Phase::undecided:
    case Phase::ended:
      return 0;
    case Phase::refused:
    case Phase::handshake:
      return EPOLLIN;
    case Phase::running:
      break;
  }
  const bool reads = !inputEnded && !readingStopped && outstanding() < limits::outstanding;
  return (reads ? EPOLLIN : 0u) | (unsent() > 0 ? EPOLLOUT : 0u);
}

void BusSession::ready(std::uint32_t events) {
  if (events & EPOLLOUT) flush();
  if (events & EPOLLIN) {
    readSome();
    handleInput();
  }
  // Nobody is left to answer; what can still be read was sent before.
  if ((events & (EPOLLHUP | EPOLLERR)) && !(events & EPOLLIN)) close();
}

void BusSession::processEnded() {
  // In a handshake, too: who sends everything ahead may be gone before he is admitted.
  while (phase == Phase::handshake || phase == Phase::running) {
    if (inputEnded || outstanding() >= limits::outstanding || !readSome()) break;
    handleInput();
  }
  close();
}

void BusSession::deadlinePassed() {
  if (phase == Phase::refused) return close();
  fail(phase == Phase::handshake ? "the handshake takes too long" : "nothing moves any more");
}

// Whether something was read. One turn's worth at most, or a flood would starve the others.
bool BusSession::readSome() {
  if (phase == Phase::ended) return false;
  char buffer[limits::bytesPerTurn];
  const ssize_t count = ::recv(descriptor, buffer, sizeof buffer, MSG_DONTWAIT);
  if (count > 0) {
    if (phase != Phase::refused) input.append(buffer, static_cast<std::size_t>(count));
    return true;
  }
  if (count == 0) inputEnded = true;
  if (count < 0 && errno != EAGAIN && errno != EINTR) close();
  if (inputEnded && isDrained()) close();
  return false;
}

void BusSession::handleInput() {
  if (handling) return;  // an operation that is answered while it is called comes through here again
  handling = true;
  std::size_t used = phase == Phase::handshake ? shakeHands() : 0;
  while (phase == Phase::running && !readingStopped && outstanding() < limits::outstanding) {
    const std::string_view rest = std::string_view(input).substr(used);
    const auto length = busMessageLength(rest, limits::messageBytes);
    if (!length) {
      fail(length.error() == Outcome::tooLarge ? "a message is too large" : "a message is malformed");
    } else if (!*length || **length > rest.size()) {
      break;
    } else if (handleMessage(rest.substr(0, **length))) {
      used += **length;
    }
  }
  input.erase(0, used);
  if (input.empty()) input.shrink_to_fit();  // thousands may be idle
  handling = false;
  if (phase == Phase::running) {
    sendSignals();  // a message that was handled may have taken the unread output with it
    reconsiderDeadline(used > 0);
  }
  if (inputEnded && isDrained()) close();
}

// How many bytes it has used.
std::size_t BusSession::shakeHands() {
  std::string_view rest = input;
  std::string answers;
  const auto progress = shaking->advance(rest, answers);
  // Fails for who has gone; what he has sent counts all the same.
  if (!answers.empty()) sendAll(descriptor, answers);
  if (progress == BusHandshake::Progress::failed) {
    fail("the handshake failed");
  } else if (progress == BusHandshake::Progress::done) {
    shaking.reset();
    end.reset();
    phase = Phase::running;
    if (!beginMessages()) fail("no bus can be made");
  }
  return input.size() - rest.size();
}

// Of `bytes` into the pipe; how many it took.
std::size_t BusSession::pass(std::string_view bytes) const {
  const ssize_t count = ::write(feed.get(), bytes.data(), bytes.size());
  return count < 0 ? 0 : static_cast<std::size_t>(count);
}

// Makes the library's bus. It insists on a handshake of its own: it gets one through the pipe, and its answer
// is thrown away. Only then the client's socket takes the place of the output.
bool BusSession::beginMessages() {
  int ends[2], answer[2];
  if (::pipe2(ends, O_CLOEXEC | O_NONBLOCK) < 0) return false;
  UniqueDescriptor inner(ends[0]);
  feed.reset(ends[1]);
  // A message, and no more of what a user's pipes may take together. Beyond that they are given less.
  ::fcntl(feed.get(), F_SETPIPE_SZ, static_cast<int>(limits::messageBytes));
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, answer) < 0) return false;
  UniqueDescriptor output(answer[0]);
  const UniqueDescriptor thrownAway(answer[1]);
  const int outputNumber = output.get();
  constexpr std::string_view handshake("\0AUTH ANONYMOUS\r\nBEGIN\r\n", 24);
  if (pass(handshake) < handshake.size()) return false;
  int result = host->service().open(*this, std::move(inner), std::move(output), bus);
  while (result > 0) result = sd_bus_process(bus, nullptr);
  if (result < 0 || sd_bus_is_ready(bus) <= 0) return false;

  const int before = descriptor;
  if (::dup3(descriptor, outputNumber, O_CLOEXEC) < 0) return false;
  descriptor = outputNumber;
  host->socketMoved(*this, before);
  ownSocket.reset();
  sendSignals();
  return true;
}

bool BusSession::handleMessage(std::string_view message) {
  const std::size_t before = dispatched;
  int result = 0;
  // In parts if need be: of a user with many pipes each is small.
  while (result >= 0 && !message.empty() && dispatched == before) {
    const std::size_t passed = pass(message);
    if (passed == 0) {
      fail("a message cannot be passed on");
      return false;
    }
    message.remove_prefix(passed);
    do {
      result = sd_bus_process(bus, nullptr);
    } while (result > 0 && dispatched == before);
  }
  // Of a client that has gone the library closes the socket: its number may be another client's next.
  if (result < 0 || sd_bus_is_ready(bus) <= 0) {
    fail("a message is refused");
  } else if (dispatched == before) {
    fail("a message is malformed");  // the library drops such a one, and would wait for the next
  }
  return phase == Phase::running;
}

int BusSession::call(sd_bus_message* message) {
  if (phase != Phase::running) return 1;
  const auto& operations = host->service().interface.operations;
  const std::string_view member = sd_bus_message_get_member(message);
  std::size_t operation = 0;  // the library has found name and types to fit
  while (operations.at(operation).name != member) ++operation;
  auto arguments = readValues(message, operations[operation].arguments);
  if (!arguments) return -arguments.error().value();
  const std::uint64_t identifier = ++lastCall;
  unanswered.emplace(identifier, Call{operation, Message(sd_bus_message_ref(message))});
  handler->call(operation, std::move(*arguments), host->completion(number, identifier));
  return 1;
}

void BusSession::complete(std::uint64_t identifier, BusReply reply) {
  const auto found = unanswered.find(identifier);
  if (found == unanswered.end() || phase != Phase::running) return;
  const Call answered = std::move(found->second);
  unanswered.erase(found);
  Message answer = makeAnswer(answered, reply);
  if (!answer) return fail("an answer cannot be made");
  if (sd_bus_message_get_expect_reply(answered.message.get()) > 0) send(std::move(answer));
  if (!input.empty() || inputEnded) handleInput();  // which may have been held up
}

BusSession::Message BusSession::makeAnswer(const Call& call, const BusReply& reply) const {
  sd_bus_message* answer = nullptr;
  if (const auto* error = std::get_if<BusError>(&reply)) {
    const sd_bus_error description{error->name.c_str(), error->message.c_str(), 0};
    sd_bus_message_new_method_error(call.message.get(), &answer, &description);
    return Message(answer);
  }
  if (sd_bus_message_new_method_return(call.message.get(), &answer) < 0) return nullptr;
  Message owned(answer);
  const BusOperation& operation = host->service().interface.operations[call.operation];
  if (const auto appended = appendValues(answer, operation.results, std::get<List>(reply)); !appended) {
    log().error("%s: the answer does not fit: %s", operation.name, appended.error().message());
    return nullptr;
  }
  return owned;
}

void BusSession::stopReading() {
  readingStopped = true;
  if (phase == Phase::refused || phase == Phase::handshake || phase == Phase::undecided) close();
}

void BusSession::emit(std::size_t signal, List arguments, const std::string& mergeKey) {
  if (!host) return;
  const auto turn = host->takeTurn();
  if (phase == Phase::ended || phase == Phase::refused) return;
  const auto earlier = std::find_if(signals.begin(), signals.end(), [&](const Signal& candidate) {
    return candidate.signal == signal && candidate.mergeKey == mergeKey;
  });
  if (earlier == signals.end()) {
    signals.push_back({mergeKey, signal, std::move(arguments)});
  } else {
    earlier->arguments = std::move(arguments);
  }
  if (phase == Phase::running) sendSignals();
  host->changed(*this);
}

// While output is unread, signals wait here, where they merge.
void BusSession::sendSignals() {
  std::size_t sent = 0;
  for (; sent < signals.size() && unsent() == 0 && phase == Phase::running; ++sent) {
    const BusInterface& interface = host->service().interface;
    const BusSignal& description = interface.signals.at(signals[sent].signal);
    sd_bus_message* message = nullptr;
    if (sd_bus_message_new_signal(bus, &message, interface.path.c_str(), interface.name.c_str(),
                                  description.name.c_str()) < 0)
      return fail("a signal cannot be made");
    Message owned(message);
    if (appendValues(message, description.arguments, signals[sent].arguments)) {
      send(std::move(owned));
    } else {
      log().error("signal %s does not fit", description.name);
    }
  }
  signals.erase(signals.begin(), signals.begin() + static_cast<std::ptrdiff_t>(sent));
}

void BusSession::send(Message message) {
  if (sd_bus_send(bus, message.get(), nullptr) < 0) return close();  // the client has gone
  reconsiderDeadline(false);
}

void BusSession::flush() {
  if (phase != Phase::running) return;
  const std::size_t before = unsent();
  int result = 1;
  while (result > 0) result = sd_bus_process(bus, nullptr);  // the pipe is empty: it only writes
  if (result < 0) return close();
  sendSignals();
  reconsiderDeadline(unsent() < before);
  handleInput();
}

std::size_t BusSession::unsent() const {
  std::uint64_t count = 0;
  if (bus) sd_bus_get_n_queued_write(bus, &count);
  return static_cast<std::size_t>(count);
}

// By the client: an incomplete message, or unread output.
bool BusSession::isHeldUp() const {
  return unsent() > 0 || (!input.empty() && outstanding() < limits::outstanding);
}

void BusSession::reconsiderDeadline(bool moved) {
  if (!isHeldUp()) {
    end.reset();
  } else if (!end || moved) {
    end = std::chrono::steady_clock::now() + host->service().patience.stall;
  }
}

void BusSession::close() {
  if (!host) return;
  const auto turn = host->takeTurn();
  if (std::exchange(phase, Phase::ended) != Phase::ended) host->changed(*this);
}

void BusSession::fail(const char* reason) {
  if (phase != Phase::ended) log().info("client %d: %s; it is disconnected", _peer.pid, reason);
  close();
}

void BusSession::finish() {
  host = nullptr;
  unanswered.clear();  // messages refer to the bus
  bus = sd_bus_close_unref(bus);
  ownSocket.reset();
  feed.reset();
  if (const auto told = std::exchange(handler, nullptr)) told->closed();
}

}  // namespace platform::linux_
