// Production work queues.
//
// The server queue (user-interactive) is one thread of its own. Utility queues are serial
// executors over a shared pool that adds a thread whenever a task waits and no worker is idle,
// so a task blocked for seconds on one queue never holds up another. The low-priority
// concurrent queue is a small pool whose threads run at nice 10. Delays are Asio timers on a
// timer thread. Destruction stops every thread after the tasks already queued have run.
#pragma once

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/Dispatch.h"

// A pool of threads that grows up to `maxThreads` while all of its workers are busy.
class SXElasticPool {
 public:
  SXElasticPool(std::string threadName, int niceness, size_t maxThreads);
  ~SXElasticPool();
  SXElasticPool(const SXElasticPool&) = delete;
  SXElasticPool& operator=(const SXElasticPool&) = delete;

  void submit(SXTask task);

  // Tasks queued or running, and tasks begun since the start. A stop waits for the pools to
  // stay idle across a pass of the server queue.
  struct Activity {
    size_t busy = 0;
    uint64_t begun = 0;
  };
  Activity activity() const;
  // Work waiting outside the pool (a suspended queue's) that activity() counts as busy.
  void hold(int delta);

 private:
  void work();

  const std::string threadName_;
  const int niceness_;
  const size_t maxThreads_;
  mutable std::mutex mutex_;
  std::condition_variable wake_;
  std::deque<SXTask> tasks_;          // GUARDED_BY(mutex_)
  std::vector<std::thread> threads_;  // GUARDED_BY(mutex_)
  size_t idle_ = 0;                   // GUARDED_BY(mutex_)
  size_t held_ = 0;                   // GUARDED_BY(mutex_)
  uint64_t begun_ = 0;                // GUARDED_BY(mutex_)
  bool stopping_ = false;             // GUARDED_BY(mutex_)
};

class SXAsioDispatch final : public SXDispatch {
 public:
  SXAsioDispatch();
  ~SXAsioDispatch() override;

  std::shared_ptr<SXWorkQueue> createSerialQueue(std::string label,
                                                 SXQualityOfService qos) override;
  std::shared_ptr<SXWorkQueue> lowPriorityConcurrentQueue() override;
  void after(std::chrono::nanoseconds delay, std::shared_ptr<SXWorkQueue> queue,
             SXTask task) override;

  // Both pools together (the utility queues and the low-priority queue). Tasks still waiting
  // for their delay are not counted.
  SXElasticPool::Activity activity() const;

 private:
  SXElasticPool utilityPool_;
  std::shared_ptr<SXWorkQueue> lowPriorityQueue_;
  std::shared_ptr<SXElasticPool> lowPriorityPool_;
  asio::io_context timers_;
  asio::executor_work_guard<asio::io_context::executor_type> timersWork_;
  std::thread timerThread_;
};
