// Production work queues.
//
// The server queue (user-interactive) is one thread of its own. Utility queues are serial
// executors over a shared pool of one thread per core that adds a thread when a task has
// waited for a worker for a while, so a task blocked for seconds on one queue never holds up
// another, while tasks that wait a moment (a commit, a lock) do not fill the process with
// threads. The low-priority
// concurrent queue is a small pool whose threads run at nice 10. Delays are Asio timers on a
// timer thread. Destruction stops every thread after the tasks already queued have run.
#pragma once

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <thread>
#include <vector>

#include "common/SXThreadSafety.h"
#include "platform/Dispatch.h"

// A pool of threads. Up to `eagerThreads` start as soon as a task finds every worker busy;
// beyond them, up to `maxThreads`, one more starts each time the pool stalls: the oldest
// waiting task has waited `stallAfter` and no worker has taken a task meanwhile (they are
// blocked, not busy). Workers beyond `eagerThreads`
// that stay idle for `idleExitAfter` end.
class SXElasticPool {
 public:
  struct Options {
    size_t eagerThreads = 2;
    size_t maxThreads = 256;
    std::chrono::milliseconds stallAfter{100};
    std::chrono::milliseconds idleExitAfter{30'000};
  };
  SXElasticPool(std::string threadName, int niceness, Options options);
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
  struct Queued {
    SXTask task;
    std::chrono::steady_clock::time_point since;
  };
  void work();
  void watchForStalls();
  void startWorker() SX_REQUIRES(mutex_);

  const std::string threadName_;
  const int niceness_;
  const Options options_;
  mutable SXMutex mutex_;
  std::condition_variable wake_;     // a task queued, or stopping
  std::condition_variable waiting_;  // a task waits with no idle worker, or stopping
  std::deque<Queued> tasks_ SX_GUARDED_BY(mutex_);
  std::vector<std::thread> threads_ SX_GUARDED_BY(mutex_);
  std::thread watcher_ SX_GUARDED_BY(mutex_);         // started when first needed
  bool watcherAsleep_ SX_GUARDED_BY(mutex_) = false;  // waiting for a task to watch
  size_t idle_ SX_GUARDED_BY(mutex_) = 0;
  size_t held_ SX_GUARDED_BY(mutex_) = 0;
  uint64_t begun_ SX_GUARDED_BY(mutex_) = 0;
  std::chrono::steady_clock::time_point lastBegin_ SX_GUARDED_BY(mutex_);
  bool stopping_ SX_GUARDED_BY(mutex_) = false;
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
