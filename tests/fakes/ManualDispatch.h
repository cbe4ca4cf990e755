// Queues that run nothing until the test says so. Every task of every queue goes into one
// shared log in submission order; `runAll` runs tasks (including those that tasks submit)
// until none is left, skipping the tasks of suspended queues until they resume. Delayed tasks
// are recorded with their delay and run by `runAll` too, unless the dispatch keeps a manual
// time: then each waits until `advance` moves the clock to its due time. Thread-safe, so that
// tasks submitted from other threads are seen.
#pragma once

#include <atomic>
#include <deque>
#include <mutex>
#include <vector>

#include "common/SXThreadSafety.h"
#include "fakes/FakeClock.h"
#include "platform/Dispatch.h"

class ManualDispatch final : public SXDispatch {
 public:
  ManualDispatch();
  // Delayed tasks wait for `clock` to reach their due time (see `advance`).
  explicit ManualDispatch(std::shared_ptr<FakeClock> clock);
  std::shared_ptr<SXWorkQueue> createSerialQueue(std::string label,
                                                 SXQualityOfService qos) override;
  std::shared_ptr<SXWorkQueue> lowPriorityConcurrentQueue() override { return lowPriority_; }
  void after(std::chrono::nanoseconds delay, std::shared_ptr<SXWorkQueue> queue,
             SXTask task) override;

  // Runs queued tasks in submission order until none is left; returns how many ran.
  size_t runAll();
  // Manual time only: moves the clock forward by `delay`, stopping at each delayed task's due
  // time (earliest first) to hand it to its queue and `runAll`; returns how many tasks ran.
  size_t advance(std::chrono::nanoseconds delay);
  // Delays passed to `after`, in order.
  std::vector<std::chrono::nanoseconds> delays() const;

  // `suspended`, when given, is the count of the queue's suspensions: the task waits while it
  // is above zero.
  void enqueue(SXTask task, std::shared_ptr<const std::atomic<int>> suspended = nullptr);

 private:
  struct Queued {
    SXTask task;
    std::shared_ptr<const std::atomic<int>> suspended;
  };
  struct Delayed {
    SXDate due;
    std::shared_ptr<SXWorkQueue> queue;
    SXTask task;
  };
  const std::shared_ptr<FakeClock> clock_;  // null: delays are not waited for
  mutable SXMutex mutex_;
  std::deque<Queued> tasks_ SX_GUARDED_BY(mutex_);
  std::vector<std::chrono::nanoseconds> delays_ SX_GUARDED_BY(mutex_);
  std::vector<Delayed> delayed_ SX_GUARDED_BY(mutex_);  // in order of `after`
  std::shared_ptr<SXWorkQueue> lowPriority_;
};
