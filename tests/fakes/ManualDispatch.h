// Queues that run nothing until the test says so. Every task of every queue goes into one
// shared log in submission order; `runAll` runs tasks (including those that tasks submit)
// until none is left, skipping the tasks of suspended queues until they resume. Delayed tasks
// are recorded with their delay and run by `runAll` too. Thread-safe, so that tasks submitted
// from other threads are seen.
#pragma once

#include <atomic>
#include <deque>
#include <mutex>
#include <vector>

#include "platform/Dispatch.h"

class ManualDispatch final : public SXDispatch {
 public:
  ManualDispatch();
  std::shared_ptr<SXWorkQueue> createSerialQueue(std::string label,
                                                 SXQualityOfService qos) override;
  std::shared_ptr<SXWorkQueue> lowPriorityConcurrentQueue() override { return lowPriority_; }
  void after(std::chrono::nanoseconds delay, std::shared_ptr<SXWorkQueue> queue,
             SXTask task) override;

  // Runs queued tasks in submission order until none is left; returns how many ran.
  size_t runAll();
  size_t pending() const;
  // Delays passed to `after`, in order.
  std::vector<std::chrono::nanoseconds> delays() const;
  // Labels of the queues created, in order.
  std::vector<std::string> createdQueues() const;

  // `suspended`, when given, is the count of the queue's suspensions: the task waits while it
  // is above zero.
  void enqueue(const std::string& label, SXTask task,
               std::shared_ptr<const std::atomic<int>> suspended = nullptr);

 private:
  struct Queued {
    std::string label;
    SXTask task;
    std::shared_ptr<const std::atomic<int>> suspended;
  };
  mutable std::mutex mutex_;
  std::deque<Queued> tasks_;                      // GUARDED_BY(mutex_)
  std::vector<std::chrono::nanoseconds> delays_;  // GUARDED_BY(mutex_)
  std::vector<std::string> created_;              // GUARDED_BY(mutex_)
  std::shared_ptr<SXWorkQueue> lowPriority_;
};
