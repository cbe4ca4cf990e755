// The block throttle: a delayed sender that keys messages by content and sends only the newest
// of a burst of equal messages.
//
// A caller hands the throttle a send operation together with the message it will send. The
// throttle keeps one pending entry per message key and runs the entry's operation once the
// message's throttle time has passed without another message of the same key; a message whose
// key is pending replaces the pending operation and restarts the wait from its own arrival.
// Each throttle has a worker: a user-interactive serial queue of the platform's dispatch, which
// the platform gives a thread of its own. The worker schedules the timers, fires them and runs
// every send operation, so operations must be safe to run on a thread other than their caller's
// and a slow send never delays other work of the process. Its waits (the idle pause between
// looks at new entries, the time until the next due entry) are delayed tasks on that queue
// rather than sleeps, and all times come from the platform clock.
//
// Locks: the in-flight lock guards the table of pending entries; the pending-schedule lock
// guards the list of keys not yet on the worker's schedule. Locks nest only in this order:
// pending-schedule lock, in-flight lock, an entry's own lock, the schedule's lock. No lock is
// held while an operation runs.
#pragma once

#include <atomic>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

#include "common/SXThreadSafety.h"
#include "platform/Clock.h"
#include "platform/Dispatch.h"
#include "platform/Log.h"
#include "sxreporting/types.h"

class SXReportingBlockThrottleTimer;

// The worker's schedule: the timers of the current run phase. Only the worker adds timers and
// starts a run; any thread may move a timer's due time or invalidate it. A run waits for the
// earliest due time with one delayed task on the worker's queue; a due time moved earlier
// replaces that task with one for the new time, so a re-arm takes effect while the run goes on.
class SXReportingBlockThrottleSchedule {
 public:
  SXReportingBlockThrottleSchedule(std::shared_ptr<SXDispatch> dispatch,
                                   std::shared_ptr<SXWorkQueue> queue,
                                   std::shared_ptr<SXClock> clock);
  SXReportingBlockThrottleSchedule(const SXReportingBlockThrottleSchedule&) = delete;
  SXReportingBlockThrottleSchedule& operator=(const SXReportingBlockThrottleSchedule&) = delete;

  // Puts `timer` on the schedule; worker only.
  void add(std::shared_ptr<SXReportingBlockThrottleTimer> timer);
  // Fires every timer on the schedule at its due time, until none is left, then runs `done`;
  // all on the worker. A timer already due when the run starts fires at once. Worker only, and
  // not again before `done` has been called.
  void run(std::function<void()> done);

  // Shared with the timers and the pending wake-up, so that a timer outliving its schedule
  // stays safe to re-arm.
  struct State;

 private:
  friend class SXReportingBlockThrottleTimer;
  std::shared_ptr<State> state_;
};

// A one-shot timer of a schedule: runs its action once, on the worker, at its due time.
class SXReportingBlockThrottleTimer {
 public:
  SXReportingBlockThrottleTimer(const SXReportingBlockThrottleSchedule& schedule, SXDate due,
                                std::function<void()> action);
  SXReportingBlockThrottleTimer(const SXReportingBlockThrottleTimer&) = delete;
  SXReportingBlockThrottleTimer& operator=(const SXReportingBlockThrottleTimer&) = delete;

  // Any thread; a running schedule picks the new due time up at once.
  void setFireDate(SXDate due);
  // Any thread; a timer that has not fired yet never fires.
  void invalidate();

 private:
  friend struct SXReportingBlockThrottleSchedule::State;
  std::shared_ptr<SXReportingBlockThrottleSchedule::State> state_;
  SXDate due_;                          // under the schedule's mutex
  bool valid_ = true;                   // under the schedule's mutex
  const std::function<void()> action_;  // run by the worker only
};

// One pending entry: the operation to run when the entry comes due, and its timer.
class SXReportingBlockThrottleTimerWrapper {
 public:
  explicit SXReportingBlockThrottleTimerWrapper(std::shared_ptr<SXClock> clock)
      : clock_(std::move(clock)) {}

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
  const std::shared_ptr<SXClock> clock_;
  mutable SXMutex mutex_;
  std::function<void()> block_ SX_GUARDED_BY(mutex_);
  std::shared_ptr<SXReportingBlockThrottleTimer> timer_ SX_GUARDED_BY(mutex_);
};

class SXReportingBlockThrottle : public std::enable_shared_from_this<SXReportingBlockThrottle> {
  struct Passkey {};

 public:
  // Creates a throttle and starts its worker on a queue of `dispatch`; due times are read from
  // `clock`. The worker holds the throttle, so the throttle lives until its worker stops (see
  // `stop`). Info and default lines go to the default log; verbose lines go through
  // `verboseScope` (nullptr: the default log).
  static std::shared_ptr<SXReportingBlockThrottle> create(
      std::shared_ptr<SXDispatch> dispatch, std::shared_ptr<SXClock> clock,
      std::shared_ptr<SXLogFacility> log, std::shared_ptr<const SXLogScope> verboseScope);

  SXReportingBlockThrottle(Passkey, std::shared_ptr<SXDispatch> dispatch,
                           std::shared_ptr<SXClock> clock, std::shared_ptr<SXLogFacility> log,
                           std::shared_ptr<const SXLogScope> verboseScope);
  SXReportingBlockThrottle(const SXReportingBlockThrottle&) = delete;
  SXReportingBlockThrottle& operator=(const SXReportingBlockThrottle&) = delete;

  // Queues `block` to run on the worker once the message's throttle time has passed without
  // another message of the same key. Never runs `block` on the caller's thread. An empty
  // `block` holds its entry like any other and sends nothing.
  void addMessageBlock(std::function<void()> block, int64_t reporterID, const SXValue& message,
                       SXReportingCategory category, SXReportingMessageType type);

  // Blocks for at most 5 seconds while entries are pending: it returns as soon as the last
  // entry has fired, or when a 5-second task on the dispatch's concurrent queue ends the wait
  // (so a call from a send operation, which holds up the worker, still ends). Cancels nothing.
  void waitForCompletion();

  // Ends the worker at its next look at new entries, after its current run phase (every timer
  // already on its schedule fires first); the worker then lets go of the throttle. The system
  // itself never stops a throttle; owners that must not leave work behind (tests) call this
  // before letting go. Entries not yet on the schedule never fire once stopped.
  void stop() { shouldKeepRunning_.store(false); }
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
  // One pass of the worker loop: a run phase when new entries wait, then the idle pause.
  // Each pass holds the throttle until it has queued the next.
  void workerPass();
  void idleSleep();
  // Puts the timers of all unscheduled keys on the worker's schedule and empties the list.
  void scheduleUnscheduledTimers();
  // Runs the entry's current operation, then removes the entry. Worker only.
  void fire(const std::string& key, const std::shared_ptr<SXReportingBlockThrottleTimerWrapper>&);

  const std::shared_ptr<SXDispatch> dispatch_;
  const std::shared_ptr<SXClock> clock_;
  const std::shared_ptr<SXLogFacility> log_;
  const std::shared_ptr<const SXLogScope> verboseScope_;
  const std::shared_ptr<SXWorkQueue> queue_;  // the worker

  mutable SXMutex inFlightMutex_;
  std::unordered_map<std::string, std::shared_ptr<SXReportingBlockThrottleTimerWrapper>>
      timersInFlight_ SX_GUARDED_BY(inFlightMutex_);
  std::condition_variable inFlightChanged_;  // with inFlightMutex_: emptied, or a wait timed out

  mutable SXMutex unscheduledMutex_;
  std::vector<std::string> unscheduledTimerKeys_ SX_GUARDED_BY(unscheduledMutex_);

  SXReportingBlockThrottleSchedule schedule_;  // run by the worker only; timers refer to it

  std::atomic<bool> shouldKeepRunning_{true};
};
