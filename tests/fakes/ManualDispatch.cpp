#include "fakes/ManualDispatch.h"

#include <algorithm>

namespace {

class ManualQueue final : public SXWorkQueue {
 public:
  ManualQueue(std::string label, ManualDispatch& dispatch)
      : label_(std::move(label)), dispatch_(dispatch) {}
  void async(SXTask task) override { dispatch_.enqueue(std::move(task), suspended_); }
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

}  // namespace

ManualDispatch::ManualDispatch() : ManualDispatch(nullptr) {}

ManualDispatch::ManualDispatch(std::shared_ptr<FakeClock> clock)
    : clock_(std::move(clock)), lowPriority_(std::make_shared<ManualQueue>("lowpriority", *this)) {}

std::shared_ptr<SXWorkQueue> ManualDispatch::createSerialQueue(std::string label,
                                                               SXQualityOfService) {
  return std::make_shared<ManualQueue>(std::move(label), *this);
}

void ManualDispatch::after(std::chrono::nanoseconds delay, std::shared_ptr<SXWorkQueue> queue,
                           SXTask task) {
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

size_t ManualDispatch::advance(std::chrono::nanoseconds delay) {
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

void ManualDispatch::enqueue(SXTask task, std::shared_ptr<const std::atomic<int>> suspended) {
  SXMutexLock lock(mutex_);
  tasks_.push_back({std::move(task), std::move(suspended)});
}

size_t ManualDispatch::runAll() {
  size_t ran = 0;
  for (;;) {
    SXTask task;
    {
      SXMutexLock lock(mutex_);
      auto next = std::find_if(tasks_.begin(), tasks_.end(), [](const Queued& queued) {
        return !queued.suspended || queued.suspended->load() == 0;
      });
      if (next == tasks_.end()) return ran;
      task = std::move(next->task);
      tasks_.erase(next);
    }
    task();
    ++ran;
  }
}

std::vector<std::chrono::nanoseconds> ManualDispatch::delays() const {
  SXMutexLock lock(mutex_);
  return delays_;
}
