// Work queues.
//
// A serial queue runs its tasks one at a time in submission order; the concurrent queue runs
// them on several threads in any order. `after` runs a task on a queue once a delay has passed.
// Tasks must not throw. All methods may be called from any thread, including from tasks.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>

using SXTask = std::function<void()>;

enum class SXQualityOfService { kUserInteractive, kUtility, kBackground };

class SXWorkQueue {
 public:
  virtual ~SXWorkQueue() = default;
  virtual void async(SXTask task) = 0;
  virtual const std::string& label() const = 0;

  // Serial queues: once the task running now returns, no further task starts until resume()
  // has been called as often as suspend(); tasks submitted meanwhile wait in their order. A
  // task can thus wait for a completion or a timer without holding a thread. The concurrent
  // queue ignores both.
  virtual void suspend() = 0;
  virtual void resume() = 0;
};

// While one is alive on a thread, the thread-backed serial queues that this thread hands tasks
// to wake their worker once, when the outermost one ends, instead of once per task: a reader
// that hands on every request of one read pays for one wake-up, not thirty. Tasks are queued
// at once and run in their order; only the wake-up waits. Other queues ignore it.
class SXCoalescedWakes {
 public:
  SXCoalescedWakes();
  ~SXCoalescedWakes();
  SXCoalescedWakes(const SXCoalescedWakes&) = delete;
  SXCoalescedWakes& operator=(const SXCoalescedWakes&) = delete;
};

class SXDispatch {
 public:
  virtual ~SXDispatch() = default;

  // A new serial queue. User-interactive queues get a thread of their own; utility queues are
  // serial executors over a shared pool that grows while its workers are blocked, so that a
  // long wait in one queue never delays another.
  virtual std::shared_ptr<SXWorkQueue> createSerialQueue(std::string label,
                                                         SXQualityOfService qos) = 0;

  // The shared low-priority concurrent queue.
  virtual std::shared_ptr<SXWorkQueue> lowPriorityConcurrentQueue() = 0;

  // Runs `task` on `queue` once `delay` has passed.
  virtual void after(std::chrono::nanoseconds delay, std::shared_ptr<SXWorkQueue> queue,
                     SXTask task) = 0;
};
