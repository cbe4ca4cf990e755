// Work queues for tests. A FakeWorkQueue is a serial queue with a thread of its own; tests ask
// it whether code runs on it and wait for it to go idle. FakeDispatch hands out such queues
// (its low-priority "concurrent" queue is one of them too, which is one valid order) and runs
// `after` tasks from a timer thread of its own.
#pragma once

#include <chrono>
#include <condition_variable>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "common/SXThreadSafety.h"
#include "platform/Dispatch.h"

class FakeWorkQueue final : public SXWorkQueue {
 public:
  explicit FakeWorkQueue(std::string label = "fake-queue");
  // Runs the tasks already queued, then stops the thread. Safe from one of its own tasks.
  ~FakeWorkQueue() override;
  FakeWorkQueue(const FakeWorkQueue&) = delete;
  FakeWorkQueue& operator=(const FakeWorkQueue&) = delete;

  void async(SXTask task) override;
  const std::string& label() const override { return label_; }
  void suspend() override;
  void resume() override;

  // Whether the caller runs on this queue's thread.
  bool isCurrent() const;
  // Waits until every task queued before the call has run; false when `timeout` passes first.
  bool drain(std::chrono::milliseconds timeout = std::chrono::seconds(30));
  size_t tasksRun() const;

 private:
  // Shared with the thread, so a queue released by its own task can let the thread finish.
  struct State {
    SXMutex mutex;
    std::condition_variable changed;
    std::deque<SXTask> tasks SX_GUARDED_BY(mutex);
    size_t queued SX_GUARDED_BY(mutex) = 0;
    size_t run SX_GUARDED_BY(mutex) = 0;
    int suspended SX_GUARDED_BY(mutex) = 0;
    bool stopping SX_GUARDED_BY(mutex) = false;
  };
  static void Run(std::shared_ptr<State> state);

  const std::string label_;
  std::shared_ptr<State> state_;
  std::thread thread_;
};

class FakeDispatch final : public SXDispatch {
 public:
  FakeDispatch();
  // Drops `after` tasks still waiting.
  ~FakeDispatch() override;
  FakeDispatch(const FakeDispatch&) = delete;
  FakeDispatch& operator=(const FakeDispatch&) = delete;

  std::shared_ptr<SXWorkQueue> createSerialQueue(std::string label,
                                                 SXQualityOfService qos) override;
  std::shared_ptr<SXWorkQueue> lowPriorityConcurrentQueue() override;
  void after(std::chrono::nanoseconds delay, std::shared_ptr<SXWorkQueue> queue,
             SXTask task) override;

  // Every queue created so far, in creation order, and the quality of service asked for.
  std::vector<std::pair<std::shared_ptr<FakeWorkQueue>, SXQualityOfService>> createdQueues() const;
  std::shared_ptr<FakeWorkQueue> lowPriorityQueue() const { return lowPriority_; }

 private:
  using Clock = std::chrono::steady_clock;
  struct Timer {
    std::shared_ptr<SXWorkQueue> queue;
    SXTask task;
  };
  void runTimers();

  const std::shared_ptr<FakeWorkQueue> lowPriority_;
  mutable SXMutex mutex_;
  std::condition_variable timersChanged_;
  std::vector<std::pair<std::shared_ptr<FakeWorkQueue>, SXQualityOfService>> created_
      SX_GUARDED_BY(mutex_);
  std::multimap<Clock::time_point, Timer> timers_ SX_GUARDED_BY(mutex_);
  bool stopping_ SX_GUARDED_BY(mutex_) = false;
  std::thread timerThread_;
};
