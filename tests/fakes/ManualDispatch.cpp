#include "fakes/ManualDispatch.h"

namespace {

class ManualQueue final : public SXWorkQueue {
 public:
  ManualQueue(std::string label, ManualDispatch& dispatch)
      : label_(std::move(label)), dispatch_(dispatch) {}
  void async(SXTask task) override { dispatch_.enqueue(label_, std::move(task)); }
  const std::string& label() const override { return label_; }

 private:
  const std::string label_;
  ManualDispatch& dispatch_;
};

}  // namespace

ManualDispatch::ManualDispatch()
    : lowPriority_(std::make_shared<ManualQueue>("lowpriority", *this)) {}

std::shared_ptr<SXWorkQueue> ManualDispatch::createSerialQueue(std::string label,
                                                               SXQualityOfService) {
  {
    std::lock_guard lock(mutex_);
    created_.push_back(label);
  }
  return std::make_shared<ManualQueue>(std::move(label), *this);
}

void ManualDispatch::after(std::chrono::nanoseconds delay, std::shared_ptr<SXWorkQueue> queue,
                           SXTask task) {
  {
    std::lock_guard lock(mutex_);
    delays_.push_back(delay);
  }
  queue->async(std::move(task));
}

void ManualDispatch::enqueue(const std::string& label, SXTask task) {
  std::lock_guard lock(mutex_);
  tasks_.emplace_back(label, std::move(task));
}

size_t ManualDispatch::runAll() {
  size_t ran = 0;
  for (;;) {
    SXTask task;
    {
      std::lock_guard lock(mutex_);
      if (tasks_.empty()) return ran;
      task = std::move(tasks_.front().second);
      tasks_.pop_front();
    }
    task();
    ++ran;
  }
}

size_t ManualDispatch::pending() const {
  std::lock_guard lock(mutex_);
  return tasks_.size();
}

std::vector<std::chrono::nanoseconds> ManualDispatch::delays() const {
  std::lock_guard lock(mutex_);
  return delays_;
}

std::vector<std::string> ManualDispatch::createdQueues() const {
  std::lock_guard lock(mutex_);
  return created_;
}
