#include "linux/AsioDispatch.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>
#include <atomic>

namespace {

void nameThisThread(const std::string& name) {
  pthread_setname_np(pthread_self(), name.substr(0, 15).c_str());
}

// Serial queue on a thread of its own.
class ThreadQueue;

// This thread's open SXCoalescedWakes scopes and the queues whose wake-up waits for them.
thread_local int tlsWakeScopes = 0;
struct DeferredWake {
  const ThreadQueue* queue;  // identity only: the queue may be gone by the scope's end
  std::weak_ptr<ThreadQueue> alive;
};
thread_local std::vector<DeferredWake> tlsDeferredWakes;

class ThreadQueue final : public SXWorkQueue, public std::enable_shared_from_this<ThreadQueue> {
 public:
  explicit ThreadQueue(std::string label) : label_(std::move(label)) {
    thread_ = std::thread([this] { run(); });
  }
  ~ThreadQueue() override {
    {
      SXMutexLock lock(mutex_);
      stopping_ = true;
    }
    wake_.notify_one();
    if (thread_.get_id() == std::this_thread::get_id()) {
      thread_.detach();  // the last owner let go from inside one of our own tasks
    } else {
      thread_.join();
    }
  }
  void async(SXTask task) override {
    {
      SXMutexLock lock(mutex_);
      tasks_.push_back(std::move(task));
    }
    if (tlsWakeScopes == 0) {
      wake_.notify_one();
    } else {
      deferWake();
    }
  }
  void wakeNow() { wake_.notify_one(); }
  const std::string& label() const override { return label_; }
  void suspend() override {
    SXMutexLock lock(mutex_);
    ++suspended_;
  }
  void resume() override {
    {
      SXMutexLock lock(mutex_);
      if (suspended_ > 0) --suspended_;
    }
    wake_.notify_one();
  }

 private:
  void deferWake() {
    for (const DeferredWake& deferred : tlsDeferredWakes) {
      if (deferred.queue == this) return;
    }
    tlsDeferredWakes.push_back({this, weak_from_this()});
  }

  void run() {
    nameThisThread("sxr-server");
    SXMutexLock lock(mutex_);
    for (;;) {
      lock.wait(wake_, [this]() SX_REQUIRES(mutex_) {
        return stopping_ || (!tasks_.empty() && suspended_ == 0);
      });
      if (stopping_ && (tasks_.empty() || suspended_ > 0)) return;
      // Take everything queued so far: one lock round-trip per batch, not per task.
      std::deque<SXTask> batch;
      batch.swap(tasks_);
      lock.unlock();
      while (!batch.empty()) {
        SXTask task = std::move(batch.front());
        batch.pop_front();
        task();
        if (suspended_.load() > 0) break;  // the rest goes back, ahead of newer tasks
      }
      lock.lock();
      tasks_.insert(tasks_.begin(), std::make_move_iterator(batch.begin()),
                    std::make_move_iterator(batch.end()));
    }
  }

  const std::string label_;
  SXMutex mutex_;
  std::condition_variable wake_;
  std::deque<SXTask> tasks_ SX_GUARDED_BY(mutex_);
  // Changed under mutex_; the batch loop reads it without the lock between tasks.
  std::atomic<int> suspended_{0};
  bool stopping_ SX_GUARDED_BY(mutex_) = false;
  std::thread thread_;
};

// Serial executor over a shared pool: at most one drain of this queue runs at a time.
class PoolSerialQueue final : public SXWorkQueue,
                              public std::enable_shared_from_this<PoolSerialQueue> {
 public:
  PoolSerialQueue(std::string label, SXElasticPool& pool) : label_(std::move(label)), pool_(pool) {}
  void async(SXTask task) override {
    bool schedule = false;
    {
      SXMutexLock lock(mutex_);
      tasks_.push_back(std::move(task));
      schedule = startDrain();
    }
    if (schedule) submitDrain();
  }
  const std::string& label() const override { return label_; }
  // A suspended queue counts as busy in the pool's activity, as a thread blocked in a wait
  // would: a stop's drain waits for what is held behind it.
  void suspend() override {
    SXMutexLock lock(mutex_);
    if (suspended_++ == 0) pool_.hold(+1);
  }
  void resume() override {
    bool schedule = false;
    {
      SXMutexLock lock(mutex_);
      if (suspended_ == 0) return;
      if (--suspended_ == 0) pool_.hold(-1);
      schedule = startDrain();
    }
    if (schedule) submitDrain();
  }

 private:
  // Whether the caller must submit a drain.
  bool startDrain() SX_REQUIRES(mutex_) {
    if (draining_ || suspended_ > 0 || tasks_.empty()) return false;
    draining_ = true;
    return true;
  }
  void submitDrain() {
    pool_.submit([self = shared_from_this()] { self->drain(); });
  }

  // Runs a turn of tasks, then lets the other queues' drains have the thread before the next.
  void drain() {
    for (int ran = 0; ran < kTasksPerTurn; ++ran) {
      SXTask task;
      {
        SXMutexLock lock(mutex_);
        if (tasks_.empty() || suspended_ > 0) {
          draining_ = false;
          return;
        }
        task = std::move(tasks_.front());
        tasks_.pop_front();
      }
      task();
    }
    submitDrain();
  }

  static constexpr int kTasksPerTurn = 64;

  const std::string label_;
  SXElasticPool& pool_;
  SXMutex mutex_;
  std::deque<SXTask> tasks_ SX_GUARDED_BY(mutex_);
  bool draining_ SX_GUARDED_BY(mutex_) = false;
  int suspended_ SX_GUARDED_BY(mutex_) = 0;
};

class PoolConcurrentQueue final : public SXWorkQueue {
 public:
  PoolConcurrentQueue(std::string label, std::shared_ptr<SXElasticPool> pool)
      : label_(std::move(label)), pool_(std::move(pool)) {}
  void async(SXTask task) override { pool_->submit(std::move(task)); }
  const std::string& label() const override { return label_; }
  void suspend() override {}
  void resume() override {}

 private:
  const std::string label_;
  std::shared_ptr<SXElasticPool> pool_;
};

}  // namespace

SXElasticPool::SXElasticPool(std::string threadName, int niceness, Options options)
    : threadName_(std::move(threadName)), niceness_(niceness), options_(options) {}

SXElasticPool::~SXElasticPool() {
  std::vector<std::thread> threads;
  {
    SXMutexLock lock(mutex_);
    stopping_ = true;
    threads.swap(threads_);
    if (watcher_.joinable()) threads.push_back(std::move(watcher_));
  }
  wake_.notify_all();
  waiting_.notify_all();
  for (auto& t : threads) {
    if (t.get_id() == std::this_thread::get_id()) {
      t.detach();
    } else {
      t.join();
    }
  }
}

void SXElasticPool::submit(SXTask task) {
  SXMutexLock lock(mutex_);
  if (stopping_) return;
  tasks_.push_back({std::move(task), std::chrono::steady_clock::now()});
  if (idle_ >= tasks_.size()) {
    wake_.notify_one();
  } else if (threads_.size() < options_.eagerThreads) {
    startWorker();
  } else if (threads_.size() < options_.maxThreads) {
    // Every worker is busy: the watcher adds one if this goes on.
    if (!watcher_.joinable()) {
      watcher_ = std::thread([this] { watchForStalls(); });
    } else if (watcherAsleep_) {
      waiting_.notify_one();
    }
  }
}

void SXElasticPool::startWorker() {
  threads_.emplace_back([this] { work(); });
}

void SXElasticPool::watchForStalls() {
  nameThisThread(threadName_ + "-w");
  SXMutexLock lock(mutex_);
  auto lastStart = std::chrono::steady_clock::time_point::min();
  for (;;) {
    watcherAsleep_ = true;
    lock.wait(waiting_,
              [this]() SX_REQUIRES(mutex_) { return stopping_ || idle_ < tasks_.size(); });
    watcherAsleep_ = false;
    if (stopping_) return;
    // Stalled: the oldest task has waited, and no worker has taken a task meanwhile (workers
    // kept busy by the CPU still take tasks; blocked ones do not). A worker just started has
    // not taken its task yet: the next one waits its own turn.
    auto due = std::max({tasks_.front().since, lastBegin_, lastStart}) + options_.stallAfter;
    if (lock.waitUntil(waiting_, due, [this]() SX_REQUIRES(mutex_) { return stopping_; })) return;
    auto now = std::chrono::steady_clock::now();
    if (idle_ < tasks_.size() && tasks_.front().since + options_.stallAfter <= now &&
        lastBegin_ + options_.stallAfter <= now && threads_.size() < options_.maxThreads) {
      startWorker();
      lastStart = now;
    }
  }
}

void SXElasticPool::work() {
  nameThisThread(threadName_);
  if (niceness_ != 0) {
    ::setpriority(PRIO_PROCESS, static_cast<id_t>(::syscall(SYS_gettid)), niceness_);
  }
  SXMutexLock lock(mutex_);
  for (;;) {
    ++idle_;
    bool woken = lock.waitFor(wake_, options_.idleExitAfter, [this]() SX_REQUIRES(mutex_) {
      return stopping_ || !tasks_.empty();
    });
    --idle_;
    if (!woken && threads_.size() > options_.eagerThreads) {
      // A worker added for a stall that is over.
      auto self = std::find_if(threads_.begin(), threads_.end(), [](const std::thread& t) {
        return t.get_id() == std::this_thread::get_id();
      });
      if (self != threads_.end()) {
        self->detach();
        threads_.erase(self);
        return;
      }
    }
    if (tasks_.empty()) {
      if (stopping_) return;  // stopping, and nothing left to run
      continue;
    }
    SXTask task = std::move(tasks_.front().task);
    tasks_.pop_front();
    ++begun_;
    lastBegin_ = std::chrono::steady_clock::now();
    lock.unlock();
    task();
    task = nullptr;  // release what the task captured before we sleep again
    lock.lock();
  }
}

SXElasticPool::Activity SXElasticPool::activity() const {
  SXMutexLock lock(mutex_);
  return {tasks_.size() + threads_.size() - idle_ + held_, begun_};
}

void SXElasticPool::hold(int delta) {
  SXMutexLock lock(mutex_);
  held_ += delta;
}

SXAsioDispatch::SXAsioDispatch()
    : utilityPool_("sxr-utility", 0,
                   {.eagerThreads = std::max(2u, std::thread::hardware_concurrency())}),
      lowPriorityPool_(std::make_shared<SXElasticPool>(
          "sxr-lowprio", 10, SXElasticPool::Options{.eagerThreads = 2, .maxThreads = 2})),
      timersWork_(asio::make_work_guard(timers_)) {
  lowPriorityQueue_ =
      std::make_shared<PoolConcurrentQueue>("com.vendra.sonex.lowpriority", lowPriorityPool_);
  timerThread_ = std::thread([this] {
    nameThisThread("sxr-timer");
    timers_.run();
  });
}

SXAsioDispatch::~SXAsioDispatch() {
  timersWork_.reset();
  timers_.stop();
  timerThread_.join();
}

SXCoalescedWakes::SXCoalescedWakes() { ++tlsWakeScopes; }

SXCoalescedWakes::~SXCoalescedWakes() {
  if (--tlsWakeScopes > 0) return;
  for (const DeferredWake& deferred : std::exchange(tlsDeferredWakes, {})) {
    if (auto queue = deferred.alive.lock()) queue->wakeNow();
  }
}

std::shared_ptr<SXWorkQueue> SXAsioDispatch::createSerialQueue(std::string label,
                                                               SXQualityOfService qos) {
  if (qos == SXQualityOfService::kUserInteractive) {
    return std::make_shared<ThreadQueue>(std::move(label));
  }
  return std::make_shared<PoolSerialQueue>(std::move(label), utilityPool_);
}

SXElasticPool::Activity SXAsioDispatch::activity() const {
  auto utility = utilityPool_.activity();
  auto low = lowPriorityPool_->activity();
  return {utility.busy + low.busy, utility.begun + low.begun};
}

std::shared_ptr<SXWorkQueue> SXAsioDispatch::lowPriorityConcurrentQueue() {
  return lowPriorityQueue_;
}

void SXAsioDispatch::after(std::chrono::nanoseconds delay, std::shared_ptr<SXWorkQueue> queue,
                           SXTask task) {
  if (delay <= std::chrono::nanoseconds::zero()) {
    queue->async(std::move(task));
    return;
  }
  auto timer = std::make_shared<asio::steady_timer>(timers_, delay);
  timer->async_wait(
      [timer, queue = std::move(queue), task = std::move(task)](const std::error_code& ec) mutable {
        if (!ec) queue->async(std::move(task));
      });
}
