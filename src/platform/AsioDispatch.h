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

// A pool of threads: as many as there are cores run whatever is queued, and the pool grows,
// up to `maxThreads`, only while all of its workers are blocked (no task has finished for a
// moment while tasks wait). A flood of short tasks thus runs on a few threads, and a task
// that waits (a session's backend wait) never holds up the others for long.
class SXElasticPool {
 public:
  SXElasticPool(std::string threadName, int niceness, size_t maxThreads);
  ~SXElasticPool();
  SXElasticPool(const SXElasticPool&) = delete;
  SXElasticPool& operator=(const SXElasticPool&) = delete;

  void submit(SXTask task);

 private:
  void work();
  // Adds a worker when the pool has made no progress for a moment while tasks wait.
  void supervise();
  // REQUIRES: mutex_ held.
  void addWorker();

  const std::string threadName_;
  const int niceness_;
  const size_t maxThreads_;
  const size_t busyThreads_;  // workers started without waiting for a stall
  std::mutex mutex_;
  std::condition_variable wake_;
  std::condition_variable stalled_;   // tasks wait and no worker is idle
  std::deque<SXTask> tasks_;          // GUARDED_BY(mutex_)
  std::vector<std::thread> threads_;  // GUARDED_BY(mutex_)
  size_t idle_ = 0;                   // GUARDED_BY(mutex_)
  uint64_t finished_ = 0;             // GUARDED_BY(mutex_): tasks run so far
  std::thread supervisor_;            // GUARDED_BY(mutex_): started with the first stall
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

 private:
  SXElasticPool utilityPool_;
  std::shared_ptr<SXWorkQueue> lowPriorityQueue_;
  std::shared_ptr<SXElasticPool> lowPriorityPool_;
  asio::io_context timers_;
  asio::executor_work_guard<asio::io_context::executor_type> timersWork_;
  std::thread timerThread_;
};
