#include "AbuseAttacks.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <deque>
#include <functional>
#include <msgpack.hpp>
#include <sstream>
#include <unordered_map>

#include "PipelinedRpcClient.h"
#include "platform/Status.h"
#include "sxreporting/types.h"

namespace {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

// The protocol's method names, as the requests spell them.
namespace method = sxr::method;

constexpr uint16_t kTelephony = 2;  // standalone messages go out without a random delay
constexpr size_t kConfigurationBytes = 900'000;
constexpr size_t kPayloadBytes = 900'000;
constexpr size_t kIdListPayloadBytes = 500'000;
constexpr size_t kRepeatedIds = 2000;
constexpr size_t kUnknownIds = 65'536;
constexpr size_t kConfigSessions = 16;
// Each getAllReporters: reply lists them all; more would only add set-up lines to the log.
constexpr size_t kUnreadSessions = 100;
constexpr size_t kUnknownMethodBytes = 60'000;  // echoed back in the error reply
// A request just under the daemon's default 1 MiB limit, of which all but the last bytes go.
constexpr size_t kPartialFrameBytes = (1 << 20) - 512;
constexpr size_t kPartialFrameHeld = 512;
constexpr size_t kPipelineWindow = 8;
constexpr uint64_t kMaxRequests = 1'000'000;  // per attack, whatever the time
constexpr uint64_t kMaxConnections = 1000;    // per attack, reconnections included
constexpr size_t kMaxBuffered = 4 << 20;      // encoded but not yet written
constexpr size_t kMaxReadPerCall = 4 << 20;
constexpr size_t kErrorTextBytes = 160;

// Appends to a string the caller owns.
struct StringSink {
  std::string& out;
  void write(const char* data, size_t size) { out.append(data, size); }
};

template <typename F>
std::string packed(F&& f) {
  ByteSink sink;
  msgpack::packer<ByteSink> packer(sink);
  f(packer);
  return std::move(sink.bytes);
}

void packString(msgpack::packer<ByteSink>& packer, std::string_view text) {
  packer.pack_str(static_cast<uint32_t>(text.size()));
  packer.pack_str_body(text.data(), static_cast<uint32_t>(text.size()));
}

void appendFrame(std::string& out, uint32_t msgid, std::string_view method,
                 std::initializer_list<std::string_view> params) {
  StringSink sink{out};
  msgpack::packer<StringSink> packer(sink);
  packer.pack_array(4);
  packer.pack_uint8(0);
  packer.pack_uint32(msgid);
  packer.pack_str(static_cast<uint32_t>(method.size()));
  packer.pack_str_body(method.data(), static_cast<uint32_t>(method.size()));
  for (std::string_view piece : params) out.append(piece);
}

std::string arrayHeader(uint32_t size) {
  return packed([&](auto& packer) { packer.pack_array(size); });
}

std::string integer(int64_t value) {
  return packed([&](auto& packer) { packer.pack_int64(value); });
}

// A dictionary of about `bytes` packed, in many small entries: what costs a decoder most per
// byte, as an abusive configuration or payload would.
std::string bigDictionary(size_t bytes, std::string_view kind) {
  char key[32], value[48];
  std::snprintf(key, sizeof key, "%.*s %06u", static_cast<int>(kind.size()), kind.data(), 0u);
  std::snprintf(value, sizeof value, "value of %.*s %06u", static_cast<int>(kind.size()),
                kind.data(), 0u);
  size_t entryBytes = std::strlen(key) + std::strlen(value) + 2;
  auto entries = static_cast<uint32_t>(std::min<size_t>(bytes / entryBytes, 60'000));
  return packed([&](auto& packer) {
    packer.pack_map(entries + 1);
    packString(packer, "HostApplicationDisplayID");
    packString(packer, "sxreport-bench abuse");
    for (uint32_t i = 0; i < entries; ++i) {
      std::snprintf(key, sizeof key, "%.*s %06u", static_cast<int>(kind.size()), kind.data(), i);
      std::snprintf(value, sizeof value, "value of %.*s %06u", static_cast<int>(kind.size()),
                    kind.data(), i);
      packString(packer, key);
      packString(packer, value);
    }
  });
}

std::string describe(const msgpack::object& object) {
  std::ostringstream text;
  text << object;
  std::string out = text.str();
  if (out.size() > kErrorTextBytes) out = out.substr(0, kErrorTextBytes) + "...";
  return out;
}

void noteError(AttackCounters& counters, const std::string& what) {
  if (counters.firstError.empty()) counters.firstError = what;
}

bool over(Clock::time_point deadline, const std::atomic<bool>& stop) {
  return stop.load() || Clock::now() >= deadline;
}

int pollMillis(Clock::time_point until, std::chrono::milliseconds cap = 50ms) {
  auto left = std::chrono::duration_cast<std::chrono::milliseconds>(until - Clock::now());
  return static_cast<int>(std::clamp(left, 0ms, cap).count());
}

void sleepUntil(Clock::time_point until, const std::atomic<bool>& stop) {
  while (!stop.load() && Clock::now() < until)
    std::this_thread::sleep_for(std::min<Clock::duration>(10ms, until - Clock::now()));
}

bool wouldBlock(int error) { return error == EAGAIN || error == EWOULDBLOCK || error == EINTR; }

// A non-blocking Unix stream socket.
class RawSocket {
 public:
  enum class Connect { kConnected, kBusy, kFailed };

  RawSocket() = default;
  RawSocket(RawSocket&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  RawSocket& operator=(RawSocket&& other) noexcept {
    if (this != &other) {
      close();
      fd_ = std::exchange(other.fd_, -1);
    }
    return *this;
  }
  ~RawSocket() { close(); }

  int fd() const { return fd_; }
  void close() {
    if (fd_ >= 0) ::close(fd_);
    fd_ = -1;
  }

  // One attempt. kBusy: the listener's backlog is full, try again later. A connection still
  // in progress counts as connected: the first write waits for it.
  Connect startConnect(const std::string& path, std::string& error) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
      error = "socket path too long: " + path;
      return Connect::kFailed;
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    if (fd_ < 0) fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd_ < 0) {
      error = SXErrnoText("socket", errno);
      return Connect::kFailed;
    }
    if (::connect(fd_, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 ||
        errno == EINPROGRESS) {
      return Connect::kConnected;
    }
    if (errno == EAGAIN) return Connect::kBusy;
    error = SXErrnoText("cannot connect to " + path, errno);
    close();
    return Connect::kFailed;
  }

  // Tries until `deadline` while the backlog is full.
  bool connect(const std::string& path, Clock::time_point deadline, std::string& error) {
    for (;;) {
      Connect result = startConnect(path, error);
      if (result == Connect::kConnected) return true;
      if (result == Connect::kFailed) return false;
      if (Clock::now() >= deadline) {
        error = "the daemon's listen backlog stayed full";
        close();
        return false;
      }
      std::this_thread::sleep_for(10ms);
    }
  }

  pid_t peerPid() const {
    ucred credentials{};
    socklen_t size = sizeof credentials;
    if (::getsockopt(fd_, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) return -1;
    return credentials.pid;
  }

 private:
  int fd_ = -1;
};

// Replies as they come off a socket.
class ReplyReader {
 public:
  enum class Read { kOk, kClosed };

  // Reads what the socket holds now, up to a bound, so a flood cannot keep it here.
  Read readAvailable(int fd) {
    size_t total = 0;
    while (total < kMaxReadPerCall) {
      unpacker_.reserve_buffer(64 * 1024);
      ssize_t n = ::recv(fd, unpacker_.buffer(), unpacker_.buffer_capacity(), MSG_DONTWAIT);
      if (n > 0) {
        unpacker_.buffer_consumed(static_cast<size_t>(n));
        total += static_cast<size_t>(n);
        continue;
      }
      if (n < 0 && wouldBlock(errno)) return Read::kOk;
      return Read::kClosed;
    }
    return Read::kOk;
  }

  // The next whole reply; throws on bytes that are not MessagePack.
  bool next(msgpack::object_handle& handle) { return unpacker_.next(handle); }

 private:
  msgpack::v1::unpacker unpacker_;
};

struct ParsedReply {
  uint32_t msgid = 0;
  const msgpack::object* error = nullptr;
  const msgpack::object* result = nullptr;
};

bool parseReply(const msgpack::object& reply, ParsedReply& out) {
  if (reply.type != msgpack::type::ARRAY || reply.via.array.size != 4) return false;
  const msgpack::object* fields = reply.via.array.ptr;
  if (fields[0].type != msgpack::type::POSITIVE_INTEGER || fields[0].via.u64 != 1 ||
      fields[1].type != msgpack::type::POSITIVE_INTEGER) {
    return false;
  }
  out.msgid = static_cast<uint32_t>(fields[1].via.u64);
  out.error = &fields[2];
  out.result = &fields[3];
  return true;
}

// Sends `bytes` whole, waiting for room until `deadline`.
bool sendAll(int fd, std::string_view bytes, Clock::time_point deadline) {
  size_t sent = 0;
  while (sent < bytes.size()) {
    ssize_t n = ::send(fd, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n > 0) {
      sent += static_cast<size_t>(n);
      continue;
    }
    if (n < 0 && !wouldBlock(errno)) return false;
    if (Clock::now() >= deadline) return false;
    pollfd p{fd, POLLOUT, 0};
    ::poll(&p, 1, pollMillis(deadline));
  }
  return true;
}

// One request and its reply on a connection that has nothing else in flight: the reply's
// latency, or nothing when none came by `deadline` (`closed` when the daemon ended it).
std::optional<uint64_t> roundTripOn(int fd, ReplyReader& reader, uint32_t msgid,
                                    std::string_view method, std::string_view params,
                                    Clock::time_point deadline, bool& closed) {
  closed = false;
  std::string frame;
  appendFrame(frame, msgid, method, {params});
  auto sent = Clock::now();
  if (!sendAll(fd, frame, deadline)) {
    closed = Clock::now() < deadline;
    return std::nullopt;
  }
  // Whether the replies read so far hold ours; throws when the bytes are not MessagePack.
  auto replied = [&] {
    msgpack::object_handle handle;
    while (reader.next(handle)) {
      ParsedReply reply;
      if (parseReply(handle.get(), reply) && reply.msgid == msgid) return true;
    }
    return false;
  };
  auto latency = [&] {
    return static_cast<uint64_t>(
        std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now() - sent).count());
  };
  for (;;) {
    try {
      if (replied()) return latency();
    } catch (const std::exception&) {
      closed = true;
      return std::nullopt;
    }
    if (Clock::now() >= deadline) return std::nullopt;
    pollfd p{fd, POLLIN, 0};
    ::poll(&p, 1, pollMillis(deadline));
    if (p.revents != 0 && reader.readAvailable(fd) == ReplyReader::Read::kClosed) {
      closed = true;
      // What came before the end may still hold the reply.
      try {
        if (replied()) return latency();
      } catch (const std::exception&) {
      }
      return std::nullopt;
    }
  }
}

// The requests of one connection: encoded ahead of the socket, numbered, and remembered until
// their replies come.
class RequestQueue {
 public:
  explicit RequestQueue(bool trackReplies) : track_(trackReplies) {}

  // `held`: a reply that comes only later (a start's), so it is neither awaited nor counted
  // against the window.
  void add(std::string_view method, std::initializer_list<std::string_view> params,
           BenchExpect expect, bool attack, bool held = false) {
    uint32_t msgid = nextMsgid_++;
    appendFrame(out_, msgid, method, params);
    frameEnds_.push_back(appendedBefore_ + out_.size());
    if (track_ && !held) {
      inflight_[msgid] = {expect, attack};
      if (attack) ++windowed_;
    }
  }

  size_t buffered() const { return out_.size() - written_; }
  size_t windowed() const { return windowed_; }
  size_t awaited() const { return inflight_.size(); }

  // Writes what the socket takes; false when the daemon has ended the connection.
  bool writeSome(int fd, AttackCounters& counters) {
    while (written_ < out_.size()) {
      ssize_t n =
          ::send(fd, out_.data() + written_, out_.size() - written_, MSG_NOSIGNAL | MSG_DONTWAIT);
      if (n < 0) {
        if (wouldBlock(errno)) break;
        return false;
      }
      written_ += static_cast<size_t>(n);
      counters.bytesWritten += static_cast<uint64_t>(n);
    }
    uint64_t writtenTotal = appendedBefore_ + written_;
    while (!frameEnds_.empty() && frameEnds_.front() <= writtenTotal) {
      frameEnds_.pop_front();
      ++counters.requests;
    }
    if (written_ == out_.size()) {
      appendedBefore_ += out_.size();
      out_.clear();
      written_ = 0;
    }
    return true;
  }

  void handleReply(const msgpack::object& object, AttackCounters& counters) {
    ParsedReply reply;
    if (!parseReply(object, reply)) {
      ++counters.errorReplies;
      noteError(counters, "not a MessagePack-RPC response: " + describe(object));
      return;
    }
    auto found = inflight_.find(reply.msgid);
    if (found == inflight_.end()) return;
    Awaited request = found->second;
    inflight_.erase(found);
    if (request.attack) --windowed_;
    ++counters.replies;
    if (reply.error->type != msgpack::type::NIL) {
      ++counters.errorReplies;
      noteError(counters, "error " + describe(*reply.error));
      return;
    }
    bool served =
        request.expect == BenchExpect::kAnything ||
        (request.expect == BenchExpect::kNil && reply.result->type == msgpack::type::NIL) ||
        (request.expect == BenchExpect::kTrue && reply.result->type == msgpack::type::BOOLEAN &&
         reply.result->via.boolean);
    if (!served) {
      ++counters.refused;
      noteError(counters, "result " + describe(*reply.result));
    }
  }

  uint64_t unansweredAttacks() const { return windowed_; }

 private:
  struct Awaited {
    BenchExpect expect;
    bool attack;
  };

  const bool track_;
  std::string out_;
  size_t written_ = 0;
  uint64_t appendedBefore_ = 0;     // bytes of the frames already written and dropped
  std::deque<uint64_t> frameEnds_;  // of frames not yet written whole, counted from the start
  std::unordered_map<uint32_t, Awaited> inflight_;
  size_t windowed_ = 0;
  uint32_t nextMsgid_ = 1;
};

// An attack that pipelines requests over one connection at a time, opening another when the
// daemon ends one.
struct Pipeline {
  size_t client = 0;  // reporter ID slot
  size_t window = 0;  // attack requests awaiting replies; 0: never read replies
  std::function<void(RequestQueue&, int64_t firstID)> setup;
  std::function<void(RequestQueue&, uint64_t n, int64_t firstID)> attack;
};

enum class Ended { kDeadline, kClosed, kSpent };

Ended driveConnection(int fd, const Pipeline& pipeline, int64_t firstID, Clock::time_point deadline,
                      const std::atomic<bool>& stop, AttackCounters& counters, uint64_t& sent) {
  const bool reading = pipeline.window > 0;
  RequestQueue queue(reading);
  ReplyReader reader;
  if (pipeline.setup) pipeline.setup(queue, firstID);
  auto closed = [&] {
    ++counters.closedByDaemon;
    counters.unanswered += queue.unansweredAttacks();
    return Ended::kClosed;
  };
  while (!over(deadline, stop)) {
    while (sent < kMaxRequests && (!reading || queue.windowed() < pipeline.window) &&
           queue.buffered() < kMaxBuffered) {
      pipeline.attack(queue, sent++, firstID);
    }
    if (sent >= kMaxRequests && queue.buffered() == 0 && (!reading || queue.awaited() == 0)) {
      return Ended::kSpent;
    }
    pollfd p{fd, static_cast<short>((queue.buffered() > 0 ? POLLOUT : 0) | (reading ? POLLIN : 0)),
             0};
    if (::poll(&p, 1, pollMillis(deadline)) <= 0) continue;
    if ((p.revents & POLLOUT) && !queue.writeSome(fd, counters)) return closed();
    if (!reading) {
      // Replies pile up unread; only the end of the connection is of interest.
      if (p.revents & (POLLHUP | POLLERR)) return closed();
      continue;
    }
    if (p.revents & (POLLIN | POLLHUP | POLLERR)) {
      bool ended = reader.readAvailable(fd) == ReplyReader::Read::kClosed;
      try {
        msgpack::object_handle handle;
        while (reader.next(handle)) queue.handleReply(handle.get(), counters);
      } catch (const std::exception& e) {
        noteError(counters, std::string("malformed reply: ") + e.what());
        ended = true;
      }
      if (ended) return closed();
    }
  }
  counters.unanswered += queue.unansweredAttacks();
  return Ended::kDeadline;
}

AttackCounters runPipelined(const Pipeline& pipeline, const AttackPlan& plan,
                            Clock::time_point deadline, const std::atomic<bool>& stop) {
  AttackCounters counters;
  uint64_t sent = 0;
  for (uint64_t connection = 0; connection < kMaxConnections && !over(deadline, stop);
       ++connection) {
    RawSocket socket;
    std::string error;
    if (!socket.connect(plan.socketPath, std::min(deadline, Clock::now() + 2s), error)) {
      ++counters.connectFailures;
      noteError(counters, error);
      sleepUntil(std::min(deadline, Clock::now() + 50ms), stop);
      continue;
    }
    ++counters.connections;
    // Fresh IDs for each connection: the sessions of one the daemon ended may linger briefly.
    int64_t firstID = plan.scenario->sessionID(pipeline.client, connection * 4096);
    if (driveConnection(socket.fd(), pipeline, firstID, deadline, stop, counters, sent) ==
        Ended::kSpent) {
      break;
    }
  }
  return counters;
}

// The setup of a session that takes messages: created, telephony, configured, started.
void startedSession(RequestQueue& queue, int64_t id) {
  std::string params = arrayHeader(1) + integer(id);
  queue.add(method::kCreate, {params}, BenchExpect::kTrue, false);
  queue.add(method::kSetServiceType, {arrayHeader(2), integer(kTelephony), integer(id)},
            BenchExpect::kTrue, false);
  queue.add(method::kSetConfiguration, {arrayHeader(2), bigDictionary(100, "setting"), integer(id)},
            BenchExpect::kTrue, false);
  queue.add(method::kStart, {params}, BenchExpect::kTrue, false, true);
}

std::string categoryAndType() {
  return integer(BenchScenario::kCategory) + integer(BenchScenario::kType);
}

AttackCounters largeConfigurations(const AttackPlan& plan, Clock::time_point deadline,
                                   const std::atomic<bool>& stop) {
  const std::string configuration = bigDictionary(kConfigurationBytes, "setting");
  Pipeline pipeline;
  pipeline.client = 1;
  pipeline.window = kPipelineWindow;
  pipeline.setup = [](RequestQueue& queue, int64_t firstID) {
    for (size_t k = 0; k < kConfigSessions; ++k) {
      queue.add(method::kCreate, {arrayHeader(1), integer(firstID + static_cast<int64_t>(k))},
                BenchExpect::kTrue, false);
    }
  };
  pipeline.attack = [&](RequestQueue& queue, uint64_t n, int64_t firstID) {
    int64_t id = firstID + static_cast<int64_t>(n % kConfigSessions);
    queue.add(method::kSetConfiguration, {arrayHeader(2), configuration, integer(id)},
              BenchExpect::kTrue, true);
  };
  return runPipelined(pipeline, plan, deadline, stop);
}

AttackCounters longIdLists(const AttackPlan& plan, Clock::time_point deadline,
                           const std::atomic<bool>& stop) {
  const std::string payload = bigDictionary(kIdListPayloadBytes, "field");
  const std::string smallPayload = bigDictionary(200, "field");
  const std::string header = arrayHeader(4);
  const std::string meta = categoryAndType();
  // Distinct IDs no session has: from the middle of this benchmark's range for the slot.
  std::string unknown = arrayHeader(kUnknownIds);
  for (size_t i = 0; i < kUnknownIds; ++i) {
    unknown += integer(plan.scenario->sessionID(3, (uint64_t{1} << 27) + i));
  }
  Pipeline pipeline;
  pipeline.client = 3;
  pipeline.window = kPipelineWindow;
  pipeline.setup = [](RequestQueue& queue, int64_t firstID) { startedSession(queue, firstID); };
  std::string repeated;
  int64_t repeatedFor = 0;
  pipeline.attack = [&](RequestQueue& queue, uint64_t n, int64_t firstID) {
    if (n % 2 == 1) {
      queue.add(method::kSendMessage, {header, smallPayload, meta, unknown}, BenchExpect::kNil,
                true);
      return;
    }
    if (repeated.empty() || repeatedFor != firstID) {
      repeated = arrayHeader(kRepeatedIds);
      for (size_t i = 0; i < kRepeatedIds; ++i) repeated += integer(firstID);
      repeatedFor = firstID;
    }
    queue.add(method::kSendMessage, {header, payload, meta, repeated}, BenchExpect::kNil, true);
  };
  return runPipelined(pipeline, plan, deadline, stop);
}

AttackCounters unreadReplies(const AttackPlan& plan, Clock::time_point deadline,
                             const std::atomic<bool>& stop) {
  const std::string unknownMethod(kUnknownMethodBytes, 'x');
  const std::string noParams = arrayHeader(0);
  Pipeline pipeline;
  pipeline.client = 4;
  pipeline.window = 0;
  pipeline.setup = [](RequestQueue& queue, int64_t firstID) {
    // Every session makes each getAllReporters: reply longer.
    for (size_t k = 0; k < kUnreadSessions; ++k) {
      queue.add(method::kCreate, {arrayHeader(1), integer(firstID + static_cast<int64_t>(k))},
                BenchExpect::kTrue, false);
    }
  };
  pipeline.attack = [&](RequestQueue& queue, uint64_t n, int64_t) {
    // Mostly a tiny request with a long reply; now and then one whose error repeats its name.
    if (n % 16 == 15) {
      queue.add(unknownMethod, {noParams}, BenchExpect::kAnything, true);
    } else {
      queue.add(method::kGetAllReporters, {noParams}, BenchExpect::kAnything, true);
    }
  };
  return runPipelined(pipeline, plan, deadline, stop);
}

AttackCounters largePayloads(const AttackPlan& plan, Clock::time_point deadline,
                             const std::atomic<bool>& stop) {
  const std::string payload = bigDictionary(kPayloadBytes, "field");
  const std::string header = arrayHeader(4);
  const std::string meta = categoryAndType();
  Pipeline pipeline;
  pipeline.client = 5;
  pipeline.window = kPipelineWindow;
  pipeline.setup = [](RequestQueue& queue, int64_t firstID) { startedSession(queue, firstID); };
  std::string ids;
  int64_t idsFor = 0;
  pipeline.attack = [&](RequestQueue& queue, uint64_t, int64_t firstID) {
    if (ids.empty() || idsFor != firstID) {
      ids = arrayHeader(1) + integer(firstID);
      idsFor = firstID;
    }
    queue.add(method::kSendMessage, {header, payload, meta, ids}, BenchExpect::kNil, true);
  };
  return runPipelined(pipeline, plan, deadline, stop);
}

// Descriptors this process may still open, keeping some for everything else.
size_t descriptorBudget() {
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return 256;
  rlim_t soft = limit.rlim_cur == RLIM_INFINITY ? 65536 : limit.rlim_cur;
  return soft > 512 ? static_cast<size_t>(soft - 256) : 0;
}

AttackCounters partialFrames(const AttackPlan& plan, Clock::time_point deadline,
                             const std::atomic<bool>& stop) {
  AttackCounters counters;
  // A send to the benchmark's own session whose payload is one long string, cut short.
  std::string frame;
  {
    std::string prefix = arrayHeader(4);
    std::string tail = categoryAndType() + arrayHeader(1) + integer(plan.scenario->sessionID(2, 0));
    appendFrame(frame, 1, method::kSendMessage, {prefix});
    std::string probe = frame + packed([](auto& packer) {
                          packer.pack_map(1);
                          packString(packer, "blob");
                          packer.pack_str(70'000);  // str32 header, as the real one
                        });
    size_t blob = kPartialFrameBytes - probe.size() - tail.size();
    frame += packed([&](auto& packer) {
      packer.pack_map(1);
      packString(packer, "blob");
      packer.pack_str(static_cast<uint32_t>(blob));
    });
    frame.append(blob, 'p');
    frame += tail;
  }
  const size_t prefixBytes = frame.size() - kPartialFrameHeld;

  struct Held {
    RawSocket socket;
    size_t sent = 0;
    Clock::time_point lastWrite{};  // or the connect, before any
    bool closed = false;
  };
  const size_t wanted = std::min(plan.partialConnections, descriptorBudget());
  std::vector<Held> held;
  held.reserve(wanted);
  const auto margin = plan.partialFrameTimeout + 1500ms;
  // Until every prefix is out (or the attack's time is up), then long enough past the last byte
  // for the daemon's timeout to end them all, within a bound.
  auto holdUntil = deadline + margin;
  Clock::time_point lastWrite{};
  std::vector<pollfd> fds;
  std::vector<size_t> index;
  std::string scratch(64 * 1024, '\0');
  while (!stop.load()) {
    auto now = Clock::now();
    bool sending = now < deadline;
    if (!sending ||
        (held.size() == wanted && counters.partialPrefixes + counters.closedByDaemon >= wanted)) {
      holdUntil = std::min(holdUntil, std::max(deadline, lastWrite + margin));
    }
    if (now >= holdUntil) break;
    // Open a few more each round, so the first ones are writing while the rest connect.
    for (size_t k = 0; sending && k < 64 && held.size() < wanted; ++k) {
      Held connection;
      std::string error;
      auto result = connection.socket.startConnect(plan.socketPath, error);
      if (result == RawSocket::Connect::kBusy) break;
      if (result == RawSocket::Connect::kFailed) {
        ++counters.connectFailures;
        noteError(counters, error);
        break;
      }
      ++counters.connections;
      ++counters.partialConnections;
      connection.lastWrite = lastWrite = Clock::now();
      held.push_back(std::move(connection));
    }
    fds.clear();
    index.clear();
    for (size_t i = 0; i < held.size(); ++i) {
      if (held[i].closed) continue;
      short events = POLLIN;
      if (sending && held[i].sent < prefixBytes) events |= POLLOUT;
      fds.push_back({held[i].socket.fd(), events, 0});
      index.push_back(i);
    }
    if (fds.empty()) {
      if (held.size() == wanted || !sending) break;
      sleepUntil(std::min(deadline, Clock::now() + 10ms), stop);
      continue;
    }
    if (::poll(fds.data(), fds.size(), pollMillis(holdUntil)) <= 0) continue;
    now = Clock::now();
    for (size_t k = 0; k < fds.size(); ++k) {
      Held& connection = held[index[k]];
      bool ended = false;
      if (fds[k].revents & POLLOUT) {
        ssize_t n = ::send(fds[k].fd, frame.data() + connection.sent, prefixBytes - connection.sent,
                           MSG_NOSIGNAL | MSG_DONTWAIT);
        if (n > 0) {
          connection.sent += static_cast<size_t>(n);
          counters.bytesWritten += static_cast<uint64_t>(n);
          connection.lastWrite = lastWrite = now;
          if (connection.sent == prefixBytes) ++counters.partialPrefixes;
        } else if (n < 0 && !wouldBlock(errno)) {
          ended = true;
        }
      }
      if (!ended && (fds[k].revents & (POLLIN | POLLHUP | POLLERR))) {
        // Whatever the daemon says first (an error reply, say), the end of the stream counts.
        ssize_t n = ::recv(fds[k].fd, scratch.data(), scratch.size(), MSG_DONTWAIT);
        ended = n == 0 || (n < 0 && !wouldBlock(errno));
      }
      if (ended) {
        connection.closed = true;
        connection.socket.close();
        ++counters.closedByDaemon;
        counters.closeDelays.push_back(
            std::chrono::duration<double>(now - connection.lastWrite).count());
      }
    }
  }
  counters.partialPrefixBytes = prefixBytes;
  counters.partialFrameBytes = frame.size();
  return counters;
}

}  // namespace

const char* AttackName(AttackKind kind) {
  switch (kind) {
    case AttackKind::kLargeConfigurations:
      return "large-config";
    case AttackKind::kPartialFrames:
      return "partial-frames";
    case AttackKind::kLongIdLists:
      return "id-lists";
    case AttackKind::kUnreadReplies:
      return "unread-replies";
    case AttackKind::kLargePayloads:
      return "large-payloads";
  }
  return "?";
}

void AttackCounters::merge(const AttackCounters& other) {
  connections += other.connections;
  connectFailures += other.connectFailures;
  requests += other.requests;
  bytesWritten += other.bytesWritten;
  replies += other.replies;
  errorReplies += other.errorReplies;
  refused += other.refused;
  closedByDaemon += other.closedByDaemon;
  unanswered += other.unanswered;
  partialConnections += other.partialConnections;
  partialPrefixes += other.partialPrefixes;
  partialPrefixBytes = std::max(partialPrefixBytes, other.partialPrefixBytes);
  partialFrameBytes = std::max(partialFrameBytes, other.partialFrameBytes);
  closeDelays.insert(closeDelays.end(), other.closeDelays.begin(), other.closeDelays.end());
  if (firstError.empty()) firstError = other.firstError;
}

AttackCounters RunAttack(AttackKind kind, const AttackPlan& plan, Clock::time_point deadline,
                         const std::atomic<bool>& stop) {
  switch (kind) {
    case AttackKind::kLargeConfigurations:
      return largeConfigurations(plan, deadline, stop);
    case AttackKind::kPartialFrames:
      return partialFrames(plan, deadline, stop);
    case AttackKind::kLongIdLists:
      return longIdLists(plan, deadline, stop);
    case AttackKind::kUnreadReplies:
      return unreadReplies(plan, deadline, stop);
    case AttackKind::kLargePayloads:
      return largePayloads(plan, deadline, stop);
  }
  return {};
}

pid_t AbusePeerPid(const std::string& socketPath) {
  RawSocket socket;
  std::string error;
  if (!socket.connect(socketPath, Clock::now() + 2s, error)) return -1;
  return socket.peerPid();
}

Prober::Prober(std::string socketPath, const BenchScenario& scenario, size_t phases)
    : socketPath_(std::move(socketPath)), scenario_(scenario), phases_(phases) {}

Prober::~Prober() { stop(); }

void Prober::start() {
  thread_ = std::thread([this] { run(); });
}

void Prober::stop() {
  stop_.store(true);
  if (thread_.joinable()) thread_.join();
}

void Prober::run() {
  const std::atomic<bool>& stop = stop_;
  for (uint64_t connection = 0; !stop.load(); ++connection) {
    RawSocket socket;
    std::string error;
    if (!socket.connect(socketPath_, Clock::now() + 2s, error)) {
      ++phases_[phase_.load()].unanswered;
      sleepUntil(Clock::now() + 100ms, stop);
      continue;
    }
    if (connection > 0) ++reconnects_;
    int64_t id = scenario_.sessionID(0, connection);
    std::string params = arrayHeader(1) + integer(id);
    ReplyReader reader;
    uint32_t msgid = 1;
    bool closed = false;
    // A session of its own, so that the probes look one up; not timed.
    if (!roundTripOn(socket.fd(), reader, msgid++, method::kCreate, params,
                     Clock::now() + kReplyTimeout, closed)) {
      ++phases_[phase_.load()].unanswered;
      continue;
    }
    auto next = Clock::now();
    while (!stop.load()) {
      sleepUntil(next, stop);
      if (stop.load()) break;
      Phase& phase = phases_[phase_.load()];
      auto sent = Clock::now();
      next = sent + kInterval;
      auto latency = roundTripOn(socket.fd(), reader, msgid++, method::kValid, params,
                                 sent + kReplyTimeout, closed);
      if (latency) {
        phase.latency.record(*latency);
        continue;
      }
      ++phase.unanswered;
      // A probe that timed out waited that long; one the daemon cut short says nothing.
      if (!closed) {
        phase.latency.record(static_cast<uint64_t>(
            std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now() - sent).count()));
      }
      break;  // a fresh connection, so a late reply cannot be taken for the next one's
    }
  }
}

std::optional<uint64_t> Prober::RoundTrip(const std::string& socketPath, int64_t reporterID,
                                          std::chrono::milliseconds timeout, std::string& error) {
  auto deadline = Clock::now() + timeout;
  RawSocket socket;
  if (!socket.connect(socketPath, deadline, error)) return std::nullopt;
  ReplyReader reader;
  bool closed = false;
  auto latency = roundTripOn(socket.fd(), reader, 1, method::kValid,
                             arrayHeader(1) + integer(reporterID), deadline, closed);
  if (!latency) {
    error = closed ? "the daemon closed the connection"
                   : "no reply within " + std::to_string(timeout.count()) + " ms";
  }
  return latency;
}
