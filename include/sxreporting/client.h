// SXReportingClient: a connection to the reporting service over its Unix socket, with one
// method per protocol operation.
//
// Threads: every method may be called from any thread. Each client object owns one I/O thread
// that does all socket work, runs the time-outs and runs every callback; futures are fulfilled
// on that thread too. Do not block the I/O thread in a callback (for example by waiting on
// another future of the same client): no reply can arrive while it is blocked.
//
// Replies: every call completes exactly once, with an SXCallResult that says whether the
// service replied (and with what), rejected the request as malformed (remote error), sent
// nothing within the call's time-out, or the connection ended first. Some operations never
// reply by design (reporter ID 0 for setServiceType, stop and destroy; a second start of a
// started session; killService), so each call has a time-out; the client default is 5 s.
//
// Throughput: requests are pipelined (any number in flight) and requests queued while a write
// is in flight go out together in the next write.
//
// One connection per object: after the connection ends, calls complete at once with
// kConnectionLost; make a new client to connect again.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "sxreporting/types.h"

class SXRpcChannel;

enum class SXCallStatus {
  kReplied,         // the service replied; `value` holds the reply
  kRemoteError,     // the service rejected the request; `error` holds its error string
  kTimedOut,        // no reply within the call's time-out (it may never come)
  kConnectionLost,  // the connection ended (or never was) before a reply came
  kBadReply,        // a reply came but was not of the operation's type
};

const char* SXCallStatusName(SXCallStatus status);

template <typename T>
struct SXCallResult {
  SXCallStatus status = SXCallStatus::kReplied;
  T value{};          // the reply; meaningful only when status is kReplied
  std::string error;  // what went wrong otherwise, in words

  bool replied() const { return status == SXCallStatus::kReplied; }
};

template <typename T>
using SXCallback = std::function<void(SXCallResult<T>)>;

// The reply of `reporterID:valid:`: {0, 65535} when no session has the asked ID.
struct SXReporterIDValidity {
  int64_t reporterID = 0;
  SXReportingServiceType serviceType = kSXReportingServiceTypeUnknown;
  bool operator==(const SXReporterIDValidity&) const = default;
};

// A call's time-out: nothing means the client's default; kSXWaitForever means no time-out.
using SXTimeout = std::optional<std::chrono::milliseconds>;
inline constexpr std::chrono::milliseconds kSXWaitForever = std::chrono::milliseconds::max();

struct SXClientOptions {
  std::string socketPath;  // empty: the default path (SXREPORTING_SOCKET, else ./var/run/...)
  std::chrono::milliseconds defaultTimeout = std::chrono::seconds(5);
};

class SXReportingClient {
 public:
  explicit SXReportingClient(SXClientOptions options = {});
  // Closes the connection (pending calls complete with kConnectionLost) and stops the I/O
  // thread. May be called from a callback of this client.
  ~SXReportingClient();
  SXReportingClient(const SXReportingClient&) = delete;
  SXReportingClient& operator=(const SXReportingClient&) = delete;

  // Connects to the socket, blocking until connected. Only the first call connects. On failure
  // returns false and, when `error` is given, stores why there.
  bool connect(std::string* error = nullptr);
  // Ends the connection; calls still pending complete with kConnectionLost.
  void close();
  bool connected() const;
  const std::string& socketPath() const;

  // --- The operations, in protocol order. Each has a callback form and a future form.
  void createReportingSession(int64_t reporterID, SXCallback<bool> callback,
                              SXTimeout timeout = {});
  std::future<SXCallResult<bool>> createReportingSession(int64_t reporterID,
                                                         SXTimeout timeout = {});

  // No reply for reporter ID 0.
  void setServiceType(SXReportingServiceType serviceType, int64_t reporterID,
                      SXCallback<bool> callback, SXTimeout timeout = {});
  std::future<SXCallResult<bool>> setServiceType(SXReportingServiceType serviceType,
                                                 int64_t reporterID, SXTimeout timeout = {});

  // 65535 when no session has the ID.
  void getServiceNameForReporterID(int64_t reporterID, SXCallback<SXReportingServiceType> callback,
                                   SXTimeout timeout = {});
  std::future<SXCallResult<SXReportingServiceType>> getServiceNameForReporterID(
      int64_t reporterID, SXTimeout timeout = {});

  // Nothing sends nil, which clears the session's configuration.
  void setConfiguration(std::optional<SXValue> configuration, int64_t reporterID,
                        SXCallback<bool> callback, SXTimeout timeout = {});
  std::future<SXCallResult<bool>> setConfiguration(std::optional<SXValue> configuration,
                                                   int64_t reporterID, SXTimeout timeout = {});

  // Replies true only when the session stops (false at once when there is no such session);
  // never replies for reporter ID 0 or a session already started. Pass kSXWaitForever to wait
  // for the stop however long it takes.
  void startReportingSessionForID(int64_t reporterID, SXCallback<bool> callback,
                                  SXTimeout timeout = {});
  std::future<SXCallResult<bool>> startReportingSessionForID(int64_t reporterID,
                                                             SXTimeout timeout = {});

  // Replies nothing (delivered) or the reporting-disabled error. No reporter IDs broadcasts
  // to every started session; an empty list sends to none.
  void sendMessage(SXValue message, SXReportingCategory category, SXReportingMessageType type,
                   std::optional<std::vector<int64_t>> reporterIDs,
                   SXCallback<std::optional<SXError>> callback, SXTimeout timeout = {});
  std::future<SXCallResult<std::optional<SXError>>> sendMessage(
      SXValue message, SXReportingCategory category, SXReportingMessageType type,
      std::optional<std::vector<int64_t>> reporterIDs, SXTimeout timeout = {});

  // No reply for reporter ID 0.
  void stopReportingSessionForID(int64_t reporterID, SXCallback<bool> callback,
                                 SXTimeout timeout = {});
  std::future<SXCallResult<bool>> stopReportingSessionForID(int64_t reporterID,
                                                            SXTimeout timeout = {});

  // No reply for reporter ID 0.
  void destroyReportingSession(int64_t reporterID, SXCallback<bool> callback,
                               SXTimeout timeout = {});
  std::future<SXCallResult<bool>> destroyReportingSession(int64_t reporterID,
                                                          SXTimeout timeout = {});

  // `reporterID:valid:`.
  void reporterID(int64_t reporterID, SXCallback<SXReporterIDValidity> callback,
                  SXTimeout timeout = {});
  std::future<SXCallResult<SXReporterIDValidity>> reporterID(int64_t reporterID,
                                                             SXTimeout timeout = {});

  void getAllReporters(SXCallback<std::vector<int64_t>> callback, SXTimeout timeout = {});
  std::future<SXCallResult<std::vector<int64_t>>> getAllReporters(SXTimeout timeout = {});

  // Never replies: the service exits. Completes with kTimedOut or kConnectionLost.
  void killService(SXCallback<bool> callback, SXTimeout timeout = {});
  std::future<SXCallResult<bool>> killService(SXTimeout timeout = {});

  // Read-only introspection: clients, their sessions, the enable switch and the defaults.
  void status(SXCallback<SXValue> callback, SXTimeout timeout = {});
  std::future<SXCallResult<SXValue>> status(SXTimeout timeout = {});

  // Any method with any params (an array); the reply comes back undecoded.
  void call(const std::string& method, SXValue params, SXCallback<SXValue> callback,
            SXTimeout timeout = {});
  std::future<SXCallResult<SXValue>> call(const std::string& method, SXValue params,
                                          SXTimeout timeout = {});

 private:
  template <typename T>
  void typedCall(const char* method, SXValue params, SXCallback<T> callback, SXTimeout timeout);
  template <typename T>
  std::future<SXCallResult<T>> futureCall(const char* method, SXValue params, SXTimeout timeout);

  std::shared_ptr<SXRpcChannel> impl_;  // shared with the I/O thread, which may outlive this object
  std::thread thread_;
};
