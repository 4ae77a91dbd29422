#include "cloudsyncd/NatsConnection.hpp"

#include <nats/nats.h>
#include <signal.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <optional>
#include <utility>

#include "cloudsyncd/core/Document.hpp"

namespace cloudsync {
namespace {

using platform::Outcome;
using platform::Result;

// A server that does not answer at once may not be there; others may.
constexpr std::chrono::milliseconds connectPatience{2000};
// All of it, with what encrypts it: for that the library knows no limit.
constexpr std::chrono::milliseconds openPatience{2500};
// A connection whose other end is gone without a word is noticed within twice this; oftener would wake the
// device.
constexpr std::chrono::milliseconds pingInterval{30'000};
// What is received and not taken yet. Whatever is lost is read afterwards.
constexpr int pendingMessages = 256;
constexpr int pendingBytes = 8 << 20;
// The engine keeps this many copies where it has the servers.
constexpr int replicas = 3;

template <class T, void (*destroy)(T*)>
struct Destroy {
  void operator()(T* object) const { destroy(object); }
};
template <class T, void (*destroy)(T*)>
using Owned = std::unique_ptr<T, Destroy<T, destroy>>;
using Options = Owned<natsOptions, natsOptions_Destroy>;
using Handle = Owned<natsMsg, natsMsg_Destroy>;
using StreamInfo = Owned<jsStreamInfo, jsStreamInfo_Destroy>;

// Subjects know '.' as a separator; everything else in a name is plain.
std::string tokenOf(std::string_view name) {
  std::string token;
  for (const char letter : name) letter == '.' ? token += "=2E" : token += letter;
  return token;
}

// Absent for what is no name's.
std::optional<std::string> nameOf(std::string_view token) {
  std::string name(token);
  for (auto at = name.find('='); at != std::string::npos; at = name.find('=')) {
    if (name.compare(at, 3, "=2E") != 0) return std::nullopt;
    name.replace(at, 3, ".");
  }
  return isName(name) ? std::optional(name) : std::nullopt;
}

// Interrupts what blocks the thread for longer than `openPatience`, and again, as the first signal may fall
// between two calls.
class Interruption {
 public:
  Interruption() {
    struct sigaction nothing {};
    nothing.sa_handler = [](int) {};  // and no SA_RESTART
    ::sigaction(SIGALRM, &nothing, nullptr);
    sigevent event{};
    event.sigev_notify = SIGEV_THREAD_ID;
    event.sigev_signo = SIGALRM;
    event._sigev_un._tid = ::gettid();
    isSet = ::timer_create(CLOCK_MONOTONIC, &event, &timer) == 0;
    if (!isSet) return;
    const auto span = [](std::chrono::nanoseconds time) {
      return timespec{time.count() / 1'000'000'000, time.count() % 1'000'000'000};
    };
    const itimerspec times{span(std::chrono::milliseconds(100)), span(openPatience)};
    ::timer_settime(timer, 0, &times, nullptr);
  }
  ~Interruption() {
    if (isSet) ::timer_delete(timer);
  }
  Interruption(const Interruption&) = delete;
  Interruption& operator=(const Interruption&) = delete;
  bool isDue() const { return std::chrono::steady_clock::now() - begin >= openPatience; }

 private:
  const std::chrono::steady_clock::time_point begin = std::chrono::steady_clock::now();
  bool isSet = false;
  timer_t timer{};
};

std::string textOf(natsMsg* message) {
  return {::natsMsg_GetData(message), static_cast<std::size_t>(::natsMsg_GetDataLength(message))};
}

std::string lastErrorText(natsStatus status) {
  natsStatus last = NATS_OK;
  const char* text = ::nats_GetLastError(&last);
  if (!text || !*text || last != status) return ::natsStatus_GetText(status);
  // It begins with the library's own line of code: "(conn.c:2088): No server ...".
  const std::string_view whole(text);
  const auto end = whole.starts_with('(') ? whole.find("): ") : whole.npos;
  return std::string(end == whole.npos ? whole : whole.substr(end + 3));
}

Options optionsFor(const std::string& server, const NatsAccess& access, const std::string& inbox,
                   natsStatus& status) {
  natsOptions* made = nullptr;
  status = ::natsOptions_Create(&made);
  Options options(made);
  const auto set = [&](auto function, auto... arguments) {
    if (status == NATS_OK) status = function(options.get(), arguments...);
  };
  set(::natsOptions_SetURL, ("nats://" + server).c_str());
  set(::natsOptions_SetTimeout, connectPatience.count());
  set(::natsOptions_SetWriteDeadline, NatsConnection::patience.count());
  set(::natsOptions_SetPingInterval, pingInterval.count());
  set(::natsOptions_SetMaxPingsOut, 1);
  // A new connection has to read everything anyhow, and another server may be the better one.
  set(::natsOptions_SetAllowReconnect, false);
  set(::natsOptions_SetName, "cloudsyncd");
  set(::natsOptions_SetCustomInboxPrefix, inbox.c_str());
  if (!access.user.empty()) set(::natsOptions_SetUserInfo, access.user.c_str(), access.password.c_str());
  if (!access.credentials.empty())
    set(::natsOptions_SetUserCredentialsFromFiles, access.credentials.c_str(),
        static_cast<const char*>(nullptr));
  if (access.isEncrypted) set(::natsOptions_SetSecure, true);
  if (!access.authorities.empty()) set(::natsOptions_LoadCATrustedCertificates, access.authorities.c_str());
  if (!access.certificate.empty())
    set(::natsOptions_LoadCertificatesChain, access.certificate.c_str(), access.key.c_str());
  return options;
}

}  // namespace

struct NatsConnection::Library {
  Owned<natsConnection, natsConnection_Destroy> connection;
  Owned<jsCtx, jsCtx_Destroy> streams;
  Owned<natsSubscription, natsSubscription_Destroy> subscription;
  std::int64_t dropped = 0;

  natsStatus connect(natsOptions* options) {
    const Interruption interruption;
    natsConnection* made = nullptr;
    const natsStatus status = ::natsConnection_Connect(&made, options);
    connection.reset(made);
    return status == NATS_SSL_ERROR && interruption.isDue() ? NATS_TIMEOUT : status;
  }
  natsStatus openStreams() {
    jsOptions options;
    ::jsOptions_Init(&options);
    options.Wait = patience.count();
    jsCtx* made = nullptr;
    const natsStatus status = ::natsConnection_JetStream(&made, connection.get(), &options);
    streams.reset(made);
    return status;
  }
  // Once it returns, the server has the subscription.
  natsStatus subscribe(const std::string& subject) {
    natsSubscription* made = nullptr;
    natsStatus status = ::natsConnection_SubscribeSync(&made, connection.get(), subject.c_str());
    subscription.reset(made);
    if (status == NATS_OK) status = ::natsSubscription_SetPendingLimits(made, pendingMessages, pendingBytes);
    return status == NATS_OK ? ::natsConnection_FlushTimeout(connection.get(), connectPatience.count())
                             : status;
  }

  // A stream that was made while servers were down has one copy for good, unless somebody sees to it.
  void replicate(jsStreamInfo& info) {
    if (!info.Cluster || info.Config->Replicas >= replicas) return;
    info.Config->Replicas = replicas;
    jsErrCode ignored{};
    ::js_UpdateStream(nullptr, streams.get(), info.Config, nullptr, &ignored);
  }

  // The server's last error, which no call answers.
  std::string lastSaid() const {
    const char* said = nullptr;
    ::natsConnection_GetLastError(connection.get(), &said);
    return said ? said : "";
  }

  std::error_code fail(natsStatus status, jsErrCode code, const std::string& what, std::string& problem) {
    problem = what + ": " + lastErrorText(status);
    if (code == JSStreamNotFoundErr) return std::make_error_code(std::errc::no_such_file_or_directory);
    if (status == NATS_MAX_PAYLOAD || code == JSStreamMessageExceedsMaximumErr)
      return std::make_error_code(std::errc::message_size);
    if (status != NATS_TIMEOUT) return make_error_code(Outcome::notConnected);
    // What the server had against a request it says apart from it.
    const std::string said = lastSaid();
    problem = what + ": no answer" + (said.empty() ? "" : "; " + said);
    return make_error_code(Outcome::timedOut);
  }
};

Result<std::shared_ptr<NatsConnection>> NatsConnection::open(const std::string& server,
                                                             const NatsAccess& access,
                                                             const std::string& account,
                                                             std::string& problem) {
  natsStatus status = NATS_OK;
  const auto options = optionsFor(server, access, "_INBOX." + tokenOf(account), status);
  auto library = std::make_unique<Library>();
  if (status == NATS_OK) status = library->connect(options.get());
  if (status == NATS_OK) status = library->openStreams();
  const std::shared_ptr<NatsConnection> connection(new NatsConnection(std::move(library), account));
  if (status == NATS_OK) status = connection->library->subscribe(connection->all);
  if (status == NATS_OK) return connection;
  return connection->library->fail(status, {}, server, problem);
}

NatsConnection::NatsConnection(std::unique_ptr<Library> library_, const std::string& account)
    : library(std::move(library_)),
      name("pairwell-" + tokenOf(account)),
      prefix("pairwell." + tokenOf(account) + "."),
      all(prefix + "*") {}

NatsConnection::~NatsConnection() = default;

void NatsConnection::close() { ::natsConnection_Close(library->connection.get()); }

bool NatsConnection::isAlive() {
  return ::natsConnection_FlushTimeout(library->connection.get(), connectPatience.count()) == NATS_OK;
}

Result<NatsConnection::Stream> NatsConnection::stream(std::string& problem) {
  auto found = lookUp(problem);
  if (found || found.error() != std::errc::no_such_file_or_directory) return found;
  const auto made = makeStream(problem);
  std::string ignored;  // another device may have made it meanwhile
  found = lookUp(made ? problem : ignored);
  return found || made ? found : made.error();
}

Result<NatsConnection::Stream> NatsConnection::lookUp(std::string& problem) {
  jsOptions options;
  ::jsOptions_Init(&options);
  options.Stream.Info.SubjectsFilter = all.c_str();
  jsStreamInfo* found = nullptr;
  jsErrCode code{};
  const natsStatus status = ::js_GetStreamInfo(&found, library->streams.get(), name.c_str(), &options, &code);
  if (status != NATS_OK) return library->fail(status, code, "stream " + name, problem);
  const StreamInfo info(found);
  if (!std::exchange(isReplicated, true)) library->replicate(*info);
  Stream stream{info->Created, info->State.LastSeq, {}};
  const auto* subjects = info->State.Subjects;
  for (int index = 0; subjects && index < subjects->Count; ++index) {
    if (stream.devices.size() == devicesRead) break;
    if (auto device = deviceOf(subjects->List[index].Subject)) stream.devices.push_back(std::move(*device));
  }
  return stream;
}

// A server may send anything.
std::optional<std::string> NatsConnection::deviceOf(std::string_view subject) const {
  return subject.starts_with(prefix) ? nameOf(subject.substr(prefix.size())) : std::nullopt;
}

Result<void> NatsConnection::makeStream(std::string& problem) {
  const char* subjects[] = {all.c_str()};
  jsStreamConfig config;
  ::jsStreamConfig_Init(&config);
  config.Name = name.c_str();
  config.Subjects = subjects;
  config.SubjectsLen = 1;
  config.MaxMsgsPerSubject = 1;
  config.Storage = js_FileStorage;
  natsStatus status = NATS_OK;
  jsErrCode code{};
  for (const int copies : {replicas, 1}) {
    config.Replicas = copies;
    status = ::js_AddStream(nullptr, library->streams.get(), &config, nullptr, &code);
    if (status == NATS_OK) return {};
    if (code != JSStreamReplicasNotSupportedErr && code != JSClusterNoPeersErr &&
        code != JSInsufficientResourcesErr)
      break;
  }
  return library->fail(status, code, "stream " + name + " cannot be made", problem);
}

Result<std::string> NatsConnection::document(const std::string& device, std::string& problem) {
  natsMsg* found = nullptr;
  jsErrCode code{};
  const std::string subject = prefix + tokenOf(device);
  const natsStatus status =
      ::js_GetLastMsg(&found, library->streams.get(), name.c_str(), subject.c_str(), nullptr, &code);
  if (code == JSNoMessageFoundErr) return std::string();
  if (status != NATS_OK) return library->fail(status, code, "stream " + name, problem);
  const Handle message(found);
  return textOf(found);
}

Result<void> NatsConnection::publish(const std::string& device, std::string_view document,
                                     std::string& problem) {
  jsPubOptions options;
  ::jsPubOptions_Init(&options);
  options.ExpectStream = name.c_str();
  jsErrCode code{};
  const natsStatus status = ::js_Publish(nullptr, library->streams.get(), (prefix + tokenOf(device)).c_str(),
                                         document.data(), static_cast<int>(document.size()), &options, &code);
  if (status == NATS_OK) return {};
  return library->fail(status, code, "stream " + name, problem);
}

// A purge is not heard by those who are connected, so an empty message goes before it.
Result<void> NatsConnection::remove(const std::string& device, std::string& problem) {
  if (const auto emptied = publish(device, "", problem); !emptied) return emptied;
  const std::string subject = prefix + tokenOf(device);
  jsOptions options;
  ::jsOptions_Init(&options);
  options.Stream.Purge.Subject = subject.c_str();
  jsErrCode code{};
  const natsStatus status = ::js_PurgeStream(library->streams.get(), name.c_str(), &options, &code);
  if (status == NATS_OK) return {};
  return library->fail(status, code, "stream " + name, problem);
}

Result<NatsConnection::Message> NatsConnection::receive(std::string& problem) {
  constexpr std::int64_t aDay = 86'400'000;
  for (;;) {
    natsMsg* found = nullptr;
    const natsStatus status = ::natsSubscription_NextMsg(&found, library->subscription.get(), aDay);
    if (status == NATS_TIMEOUT || status == NATS_SLOW_CONSUMER) continue;
    if (status != NATS_OK) {
      const std::string said = library->lastSaid();
      problem = said.empty() ? ::natsStatus_GetText(status) : said;
      return Outcome::notConnected;
    }
    const Handle received(found);
    auto device = deviceOf(::natsMsg_GetSubject(found));
    if (!device) continue;
    Message message{std::move(*device), textOf(found), false};
    std::int64_t dropped = 0;
    if (::natsSubscription_GetDropped(library->subscription.get(), &dropped) == NATS_OK)
      message.othersAreLost = std::exchange(library->dropped, dropped) != dropped;
    return message;
  }
}

}  // namespace cloudsync
