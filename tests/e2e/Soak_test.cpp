// A steady stream of messages for a while (SXR_SOAK_SECONDS, one minute unless set), then a
// row by row check that every message reached the analytics store and the spool with its
// payload.
#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <set>

#include "support/Daemon.h"

namespace {

using namespace std::chrono_literals;

constexpr int kClients = 4;
constexpr int kMessagesPerSecond = 200;

double soakSeconds() {
  const char* text = std::getenv("SXR_SOAK_SECONDS");
  double seconds = text ? std::atof(text) : 0;
  return seconds > 0 ? seconds : 60;
}

SXValue payloadOf(int64_t sequence) {
  return {{"seq", sequence},
          {"client", sequence % kClients},
          {"route name", "speaker " + std::to_string(sequence % 7)},
          {"level", static_cast<double>(sequence) / 4}};
}

// The payload as the spool keeps it: keys with spaces rewritten.
SXValue spooled(int64_t sequence) {
  SXValue payload = payloadOf(sequence);
  payload["route_name"] = payload["route name"];
  payload.erase("route name");
  return payload;
}

// Sequence number -> payload of each row, failing on duplicates.
std::map<int64_t, SXValue> bySequence(const std::vector<SXValue>& rows) {
  std::map<int64_t, SXValue> out;
  for (const auto& row : rows) {
    SXValue payload = SXValue::parse(row["payload_json"].get<std::string>());
    int64_t sequence = payload["seq"].get<int64_t>();
    EXPECT_TRUE(out.emplace(sequence, payload).second) << "twice: " << sequence;
  }
  return out;
}

}  // namespace

TEST(SoakEndToEnd, EveryMessageOfASteadyStreamIsStored) {
  TestDaemon daemon;
  std::vector<std::unique_ptr<SXReportingClient>> clients;
  std::vector<std::future<SXCallResult<bool>>> starts;
  for (int k = 0; k < kClients; ++k) {
    clients.push_back(daemon.client());
    ASSERT_TRUE(replied(clients[k]->createReportingSession(100 + k)));
    ASSERT_TRUE(replied(
        clients[k]->setConfiguration(SXValue{{"HostApplicationDisplayID", "soak"}}, 100 + k)));
    starts.push_back(clients[k]->startReportingSessionForID(100 + k, kSXWaitForever));
  }
  long before = residentKiB(daemon.pid());
  long peak = before;

  const double seconds = soakSeconds();
  const int64_t total = static_cast<int64_t>(seconds * kMessagesPerSecond);
  std::vector<std::future<SXCallResult<std::optional<SXError>>>> sends;
  auto began = std::chrono::steady_clock::now();
  auto nextSample = began;
  for (int64_t n = 0; n < total; ++n) {
    auto due = began + std::chrono::microseconds(n * 1000000 / kMessagesPerSecond);
    std::this_thread::sleep_until(due);
    int k = static_cast<int>(n % kClients);
    sends.push_back(clients[k]->sendMessage(payloadOf(n), 3, 1, std::vector<int64_t>{100 + k}));
    if (std::chrono::steady_clock::now() >= nextSample) {
      peak = std::max(peak, residentKiB(daemon.pid()));
      nextSample += 1s;
    }
  }
  double elapsed = std::chrono::duration<double>(std::chrono::steady_clock::now() - began).count();
  for (auto& send : sends) EXPECT_EQ(replied(std::move(send)), std::nullopt);
  for (int k = 0; k < kClients; ++k) {
    EXPECT_TRUE(replied(clients[k]->stopReportingSessionForID(100 + k)));
  }
  for (auto& start : starts) EXPECT_TRUE(replied(std::move(start)));
  long after = residentKiB(daemon.pid());

  auto events = bySequence(daemon.waitForRows(
      "tallyvane.db",
      "SELECT payload_json FROM events WHERE name = 'com.vendra.sonex.Playback.Start'", total,
      60s));
  auto messages = bySequence(daemon.waitForRows(
      "fernreporting.db",
      "SELECT payload_json FROM messages WHERE session_id IS NOT NULL AND category = 3", total,
      60s));
  ASSERT_EQ(events.size(), static_cast<size_t>(total));
  ASSERT_EQ(messages.size(), static_cast<size_t>(total));
  for (int64_t n = 0; n < total; ++n) {
    SXValue event = payloadOf(n);
    event["HostApplicationDisplayID"] = "soak";
    ASSERT_EQ(events[n], event) << n;
    ASSERT_EQ(messages[n], spooled(n)) << n;
  }
  // The summaries of the stops go out after their replies; wait for them, then count.
  SXValue counters;
  EXPECT_TRUE(waitUntil([&] {
    counters = replied(clients[0]->status())["counters"];
    return counters["messages_delivered"]["fernreporting"] == total + kClients;
  })) << counters.dump();
  EXPECT_EQ(counters["messages_received"], total);
  EXPECT_EQ(counters["messages_delivered"]["tallyvane"], total);
  std::printf(
      "soak: %lld messages in %.1f s (%d/s over %d clients); daemon RSS %ld KiB before, "
      "%ld KiB peak, %ld KiB after\n",
      static_cast<long long>(total), elapsed, kMessagesPerSecond, kClients, before, peak, after);
}
