// The block throttle: a delayed sender that keys messages by content and sends only the newest
// of a burst of equal messages.
//
// A caller hands the throttle a send operation together with the message it will send. The
// throttle keeps one pending entry per message key and runs the entry's operation once the
// message's throttle time has passed without another message of the same key; a message whose
// key is pending replaces the pending operation and restarts the wait from its own arrival.
// One worker thread per throttle schedules the timers, fires them and runs every send
// operation, so operations must be safe to run on a thread other than their caller's.
//
// Locks: the in-flight lock guards the table of pending entries; the pending-schedule lock
// guards the list of keys not yet on the worker's schedule. Locks nest only in this order:
// pending-schedule lock, in-flight lock, an entry's own lock, the schedule's timer lock. No lock
// is held while an operation runs.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/Log.h"
#include "sxreporting/types.h"

class SXReportingBlockThrottleTimer;

// The worker's schedule: the timers it runs and the condition on which it waits for the earliest
// of them. Only the worker adds timers and runs the schedule; any thread may move a timer's due
// time or invalidate it, and a running schedule re-reads due times whenever it is woken.
class SXReportingBlockThrottleSchedule {
 public:
  using Clock = std::chrono::steady_clock;

  SXReportingBlockThrottleSchedule() = default;
  SXReportingBlockThrottleSchedule(const SXReportingBlockThrottleSchedule&) = delete;
  SXReportingBlockThrottleSchedule& operator=(const SXReportingBlockThrottleSchedule&) = delete;

  // Puts `timer` on the schedule; worker thread only.
  void add(std::shared_ptr<SXReportingBlockThrottleTimer> timer);
  // Fires every timer on the schedule at its due time, until none is left; worker thread only.
  // A timer already due when it joined fires at once.
  void run();

 private:
  friend class SXReportingBlockThrottleTimer;
  // Shared with the timers so that a timer outliving its schedule stays safe to re-arm.
  struct TimerLock {
    std::mutex mutex;
    std::condition_variable changed;  // a due time moved or a timer was invalidated
  };

  // Takes the first timer due by now off the schedule, or waits until one may be due.
  // Returns nullptr when no timer is left. REQUIRES: lock holds timerLock_->mutex.
  std::shared_ptr<SXReportingBlockThrottleTimer> nextDueTimer(std::unique_lock<std::mutex>& lock);

  std::shared_ptr<TimerLock> timerLock_ = std::make_shared<TimerLock>();
  std::vector<std::shared_ptr<SXReportingBlockThrottleTimer>> timers_;  // worker thread only
};

// A one-shot timer of a schedule: runs its action once, on the worker, at its due time.
class SXReportingBlockThrottleTimer {
 public:
  using Clock = SXReportingBlockThrottleSchedule::Clock;

  SXReportingBlockThrottleTimer(const SXReportingBlockThrottleSchedule& schedule,
                                Clock::time_point due, std::function<void()> action);
  SXReportingBlockThrottleTimer(const SXReportingBlockThrottleTimer&) = delete;
  SXReportingBlockThrottleTimer& operator=(const SXReportingBlockThrottleTimer&) = delete;

  // Any thread; a running schedule picks the new due time up at once.
  void setFireDate(Clock::time_point due);
  Clock::time_point fireDate() const;
  // Any thread; a timer that has not fired yet never fires.
  void invalidate();
  bool isValid() const;

 private:
  friend class SXReportingBlockThrottleSchedule;
  std::shared_ptr<SXReportingBlockThrottleSchedule::TimerLock> lock_;
  Clock::time_point due_;               // guarded by lock_->mutex
  bool valid_ = true;                   // guarded by lock_->mutex
  const std::function<void()> action_;  // run by the worker only
};

// One pending entry: the operation to run when the entry comes due, and its timer.
class SXReportingBlockThrottleTimerWrapper {
 public:
  std::function<void()> block() const;
  void setBlock(std::function<void()> block);
  // Sets `block` and returns the operation it replaces.
  std::function<void()> exchangeBlock(std::function<void()> block);
  std::shared_ptr<SXReportingBlockThrottleTimer> timer() const;
  void setTimer(std::shared_ptr<SXReportingBlockThrottleTimer> timer);

  // Moves the entry's due time to now plus `seconds`; zero, negative or not-a-number makes it
  // due at once. Any thread, also while the timer waits on the worker's schedule.
  void sleepFor(double seconds);

 private:
  mutable std::mutex mutex_;
  std::function<void()> block_;                           // guarded by mutex_
  std::shared_ptr<SXReportingBlockThrottleTimer> timer_;  // guarded by mutex_
};

class SXReportingBlockThrottle : public std::enable_shared_from_this<SXReportingBlockThrottle> {
  struct Passkey {};

 public:
  // Creates a throttle and starts its worker. The worker holds the throttle, so the throttle
  // lives until its worker stops (see `stop`). Info and default lines go to the default log;
  // verbose lines go through `verboseScope` (nullptr: the default log).
  static std::shared_ptr<SXReportingBlockThrottle> create(
      std::shared_ptr<SXLogFacility> log, std::shared_ptr<const SXLogScope> verboseScope);

  SXReportingBlockThrottle(Passkey, std::shared_ptr<SXLogFacility> log,
                           std::shared_ptr<const SXLogScope> verboseScope);
  SXReportingBlockThrottle(const SXReportingBlockThrottle&) = delete;
  SXReportingBlockThrottle& operator=(const SXReportingBlockThrottle&) = delete;
  ~SXReportingBlockThrottle();

  // Queues `block` to run on the worker once the message's throttle time has passed without
  // another message of the same key. Never runs `block` on the caller's thread. An empty
  // `block` holds its entry like any other and sends nothing.
  void addMessageBlock(std::function<void()> block, int64_t reporterID, const SXValue& message,
                       SXReportingCategory category, SXReportingMessageType type);

  // Blocks for at most 5 seconds while entries are pending. Cancels nothing.
  void waitForCompletion();

  // Ends the worker after its current run phase (every timer already on its schedule fires
  // first) and joins it. The system itself never stops a throttle; owners that must not leave
  // a thread behind (tests) call this before letting go. From a send operation it only asks
  // the worker to end. Entries not yet on the schedule never fire once stopped.
  void stop();
  bool shouldKeepRunning() const { return shouldKeepRunning_.load(); }

  size_t timersInFlightCount() const;
  size_t unscheduledTimerKeysCount() const;

  // The message key: the payload's keys in ascending byte order, each followed by "^" when
  // excluded from comparison or else by its value's text, then "reporterID", the reporter ID,
  // the category name and the type name, joined by "|". A payload that is not a dictionary
  // counts as empty.
  static std::string buildMessageKey(const SXValue& payload, int64_t reporterID,
                                     SXReportingCategory category, SXReportingMessageType type);

  // The payload's "_throttle_seconds" narrowed to single precision, or 0.5 when it is absent,
  // not a number or 5 or more (with an info line on the default log of `log`).
  static double determineSleepTime(const SXValue& payload, SXLogFacility& log);

 private:
  void workerLoop();
  // Puts the timers of all unscheduled keys on the worker's schedule and empties the list.
  void scheduleUnscheduledTimers();
  // Runs the entry's current operation, then removes the entry. Worker thread only.
  void fire(const std::string& key, const std::shared_ptr<SXReportingBlockThrottleTimerWrapper>&);
  void idleSleep();

  const std::shared_ptr<SXLogFacility> log_;
  const std::shared_ptr<const SXLogScope> verboseScope_;

  mutable std::mutex inFlightMutex_;
  std::unordered_map<std::string, std::shared_ptr<SXReportingBlockThrottleTimerWrapper>>
      timersInFlight_;  // guarded by inFlightMutex_

  mutable std::mutex unscheduledMutex_;
  std::vector<std::string> unscheduledTimerKeys_;  // guarded by unscheduledMutex_

  SXReportingBlockThrottleSchedule schedule_;  // run by the worker only; timers refer to it

  std::atomic<bool> shouldKeepRunning_{true};
  std::mutex idleMutex_;  // with idleCondition_, lets `stop` cut the idle sleep
  std::condition_variable idleCondition_;
  std::thread queueThread_;  // set once by `create`
};
