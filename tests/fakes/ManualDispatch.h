// Queues that run nothing until the test says so. Every task of every queue goes into one
// shared log in submission order; `runAll` runs tasks (including those that tasks submit)
// until none is left, skipping the tasks of suspended queues until they resume. Delayed tasks
// are recorded with their delay and run by `runAll` too, unless the dispatch keeps a manual
// time: then each waits until `advance` moves the clock to its due time. Thread-safe, so that
// tasks submitted from other threads are seen.
#pragma once

#include <algorithm>
#include <atomic>
#include <deque>
#include <mutex>
#include <vector>

#include "common/SXThreadSafety.h"
#include "fakes/FakeClock.h"
#include "platform/Dispatch.h"

class ManualDispatch final : public SXDispatch {
 public:
  ManualDispatch() = default;
  // Delayed tasks wait for `clock` to reach their due time (see `advance`).
  explicit ManualDispatch(std::shared_ptr<FakeClock> clock) : clock_(std::move(clock)) {}

  std::shared_ptr<SXWorkQueue> createSerialQueue(std::string label, SXQualityOfService) override {
    return std::make_shared<Queue>(std::move(label), *this);
  }
  std::shared_ptr<SXWorkQueue> lowPriorityConcurrentQueue() override { return lowPriority_; }
  void after(std::chrono::nanoseconds delay, std::shared_ptr<SXWorkQueue> queue,
             SXTask task) override {
    {
      SXMutexLock lock(mutex_);
      delays_.push_back(delay);
      if (clock_) {
        delayed_.push_back({clock_->now() + std::chrono::duration_cast<SXDate::duration>(delay),
                            std::move(queue), std::move(task)});
        return;
      }
    }
    queue->async(std::move(task));
  }

  // Runs queued tasks in submission order until none is left; returns how many ran.
  size_t runAll() {
    size_t ran = 0;
    for (;;) {
      SXTask task;
      {
        SXMutexLock lock(mutex_);
        auto next = std::find_if(tasks_.begin(), tasks_.end(), [](const Queued& queued) {
          return queued.suspended->load() == 0;
        });
        if (next == tasks_.end()) return ran;
        task = std::move(next->task);
        tasks_.erase(next);
      }
      task();
      ++ran;
    }
  }
  // Manual time only: moves the clock forward by `delay`, stopping at each delayed task's due
  // time (earliest first) to hand it to its queue and `runAll`; returns how many tasks ran.
  size_t advance(std::chrono::nanoseconds delay) {
    SXDate target = clock_->now() + std::chrono::duration_cast<SXDate::duration>(delay);
    size_t ran = runAll();
    for (;;) {
      Delayed next;
      {
        SXMutexLock lock(mutex_);
        // The earliest due; among equal due times the first submitted.
        auto earliest =
            std::min_element(delayed_.begin(), delayed_.end(),
                             [](const Delayed& a, const Delayed& b) { return a.due < b.due; });
        if (earliest == delayed_.end() || earliest->due > target) break;
        next = std::move(*earliest);
        delayed_.erase(earliest);
      }
      if (next.due > clock_->now()) clock_->set(next.due);
      next.queue->async(std::move(next.task));
      ran += runAll();
    }
    if (target > clock_->now()) clock_->set(target);
    return ran + runAll();
  }
  // Delays passed to `after`, in order.
  std::vector<std::chrono::nanoseconds> delays() const {
    SXMutexLock lock(mutex_);
    return delays_;
  }

 private:
  // A serial queue: its tasks wait while its count of suspensions is above zero.
  class Queue final : public SXWorkQueue {
   public:
    Queue(std::string label, ManualDispatch& dispatch)
        : label_(std::move(label)), dispatch_(dispatch) {}
    void async(SXTask task) override {
      SXMutexLock lock(dispatch_.mutex_);
      dispatch_.tasks_.push_back({std::move(task), suspended_});
    }
    const std::string& label() const override { return label_; }
    void suspend() override { ++*suspended_; }
    void resume() override {
      int count = suspended_->load();
      while (count > 0 && !suspended_->compare_exchange_weak(count, count - 1)) {
      }
    }

   private:
    const std::string label_;
    ManualDispatch& dispatch_;
    const std::shared_ptr<std::atomic<int>> suspended_ = std::make_shared<std::atomic<int>>(0);
  };
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
  std::shared_ptr<SXWorkQueue> lowPriority_ = std::make_shared<Queue>("lowpriority", *this);
};
