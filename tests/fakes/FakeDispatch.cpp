#include "fakes/FakeDispatch.h"

FakeWorkQueue::FakeWorkQueue(std::string label)
    : label_(std::move(label)), state_(std::make_shared<State>()), thread_(Run, state_) {}

FakeWorkQueue::~FakeWorkQueue() {
  {
    SXMutexLock lock(state_->mutex);
    state_->stopping = true;
  }
  state_->changed.notify_all();
  if (thread_.get_id() == std::this_thread::get_id()) {
    thread_.detach();  // the thread holds the state and ends after this task
  } else {
    thread_.join();
  }
}

void FakeWorkQueue::Run(std::shared_ptr<State> state) {
  SXMutexLock lock(state->mutex);
  for (;;) {
    lock.wait(state->changed, [&]() SX_REQUIRES(state->mutex) {
      return state->stopping || (!state->tasks.empty() && state->suspended == 0);
    });
    // Stopping, and nothing left to run (or nothing that may run).
    if (state->tasks.empty() || state->suspended > 0) return;
    SXTask task = std::move(state->tasks.front());
    state->tasks.pop_front();
    lock.unlock();
    task();
    task = nullptr;  // what the task holds is released before the queue counts it as run
    lock.lock();
    ++state->run;
    state->changed.notify_all();
  }
}

void FakeWorkQueue::async(SXTask task) {
  {
    SXMutexLock lock(state_->mutex);
    state_->tasks.push_back(std::move(task));
    ++state_->queued;
  }
  state_->changed.notify_all();
}

void FakeWorkQueue::suspend() {
  SXMutexLock lock(state_->mutex);
  ++state_->suspended;
}

void FakeWorkQueue::resume() {
  {
    SXMutexLock lock(state_->mutex);
    if (state_->suspended > 0) --state_->suspended;
  }
  state_->changed.notify_all();
}

bool FakeWorkQueue::isCurrent() const { return thread_.get_id() == std::this_thread::get_id(); }

bool FakeWorkQueue::drain(std::chrono::milliseconds timeout) {
  SXMutexLock lock(state_->mutex);
  size_t target = state_->queued;
  return lock.waitFor(state_->changed, timeout,
                      [&]() SX_REQUIRES(state_->mutex) { return state_->run >= target; });
}

size_t FakeWorkQueue::tasksRun() const {
  SXMutexLock lock(state_->mutex);
  return state_->run;
}

FakeDispatch::FakeDispatch()
    : lowPriority_(std::make_shared<FakeWorkQueue>("low-priority")),
      timerThread_([this] { runTimers(); }) {}

FakeDispatch::~FakeDispatch() {
  {
    SXMutexLock lock(mutex_);
    stopping_ = true;
  }
  timersChanged_.notify_all();
  timerThread_.join();
}

std::shared_ptr<SXWorkQueue> FakeDispatch::createSerialQueue(std::string label,
                                                             SXQualityOfService qos) {
  auto queue = std::make_shared<FakeWorkQueue>(std::move(label));
  SXMutexLock lock(mutex_);
  created_.emplace_back(queue, qos);
  return queue;
}

std::shared_ptr<SXWorkQueue> FakeDispatch::lowPriorityConcurrentQueue() { return lowPriority_; }

void FakeDispatch::after(std::chrono::nanoseconds delay, std::shared_ptr<SXWorkQueue> queue,
                         SXTask task) {
  auto due = Clock::now() + std::chrono::duration_cast<Clock::duration>(delay);
  {
    SXMutexLock lock(mutex_);
    timers_.emplace(due, Timer{std::move(queue), std::move(task)});
  }
  timersChanged_.notify_all();
}

std::vector<std::pair<std::shared_ptr<FakeWorkQueue>, SXQualityOfService>>
FakeDispatch::createdQueues() const {
  SXMutexLock lock(mutex_);
  return created_;
}

void FakeDispatch::runTimers() {
  SXMutexLock lock(mutex_);
  while (!stopping_) {
    if (timers_.empty()) {
      lock.wait(timersChanged_);
      continue;
    }
    auto first = timers_.begin();
    if (first->first > Clock::now()) {
      lock.waitUntil(timersChanged_, first->first);
      continue;
    }
    Timer timer = std::move(first->second);
    timers_.erase(first);
    lock.unlock();
    timer.queue->async(std::move(timer.task));
    lock.lock();
  }
}
