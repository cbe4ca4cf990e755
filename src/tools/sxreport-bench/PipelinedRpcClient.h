// The benchmark's client: one MessagePack-RPC connection over a Unix stream socket that keeps
// up to `window` requests in flight and times every reply. The daemon and the baseline echo
// server are driven by this same code, so that the two figures differ only by the server.
//
// Threads: construct and connect() on any thread before the connection is used; every other
// call, and every callback, on the thread running the io_context. The figures (latency(),
// rejected(), error()) may be read by another thread once the io_context has stopped;
// measuredReplies() may be read at any time.
#pragma once

#include <sys/types.h>

#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <atomic>
#include <chrono>
#include <functional>
#include <msgpack.hpp>
#include <string>
#include <unordered_map>

#include "LatencyHistogram.h"

// A msgpack::packer stream that appends to a string, so that buffers can be swapped cheaply.
struct ByteSink {
  std::string bytes;
  void write(const char* data, size_t size) { bytes.append(data, size); }
};

// What a reply must carry for the request to count as served (the echo server answers nil to
// everything, so the baseline is never checked).
enum class BenchExpect { kAnything, kNil, kTrue };

struct BenchRequest {
  const std::string* method = nullptr;
  ByteSink params;        // the packed params array
  bool windowed = true;   // counts against the window; false for a reply held until later
  bool measured = false;  // its latency and count go into the figures
  BenchExpect expect = BenchExpect::kAnything;
};

// Fills in the next request of a phase; returns false when the phase has no more.
using RequestSource = std::function<bool(BenchRequest&)>;

class PipelinedRpcClient {
 public:
  PipelinedRpcClient(asio::io_context& io, size_t window, bool checkResults);
  PipelinedRpcClient(const PipelinedRpcClient&) = delete;
  PipelinedRpcClient& operator=(const PipelinedRpcClient&) = delete;

  // Connects, blocking. On failure returns false and says why in `error`.
  bool connect(const std::string& socketPath, std::string& error);
  // The process at the other end (SO_PEERCRED), or -1.
  pid_t peerPid();

  // Sends the phase's requests and calls `done` once every windowed reply has come (with
  // `awaitAll`, every reply, held ones too) or the connection failed.
  void runPhase(RequestSource source, bool awaitAll, std::function<void()> done);
  // Ends the connection; a pending phase completes as failed.
  void abort(const std::string& why);
  void close();

  uint64_t measuredReplies() const { return measuredReplies_.load(std::memory_order_relaxed); }
  uint64_t replies() const { return replies_.load(std::memory_order_relaxed); }
  const LatencyHistogram& latency() const { return latency_; }
  uint64_t rejected() const { return rejected_; }
  bool failed() const { return !error_.empty(); }
  // Why the connection failed, else the first rejected reply, else empty.
  const std::string& error() const { return error_.empty() ? firstRejection_ : error_; }
  // Requests still waiting for a reply.
  size_t inFlight() const { return inflight_.size(); }

 private:
  struct InFlight {
    std::chrono::steady_clock::time_point sent;
    bool windowed;
    bool measured;
    BenchExpect expect;
  };

  void readSome();
  void handleReply(const msgpack::object& reply);
  void pump();
  void fill();
  void flush();
  void checkDone();
  void fail(const std::string& why);

  asio::local::stream_protocol::socket socket_;
  const size_t window_;
  const bool checkResults_;
  msgpack::v1::unpacker unpacker_;
  bool reading_ = false;

  RequestSource source_;  // empty once the phase has sent everything
  bool awaitAll_ = false;
  std::function<void()> done_;
  BenchRequest request_;  // reused for every request

  uint32_t nextMsgid_ = 1;
  std::unordered_map<uint32_t, InFlight> inflight_;
  size_t windowed_ = 0;  // windowed requests in flight
  ByteSink out_;         // encoded, not yet handed to the socket
  std::string writing_;  // handed to the socket, write in progress
  bool writeActive_ = false;

  LatencyHistogram latency_;
  std::atomic<uint64_t> measuredReplies_{0};
  std::atomic<uint64_t> replies_{0};
  uint64_t rejected_ = 0;
  std::string firstRejection_;
  std::string error_;
};
