#include "linux/CompletionThread.h"

#include <pthread.h>

#include <condition_variable>
#include <deque>
#include <exception>
#include <mutex>

#include "common/SXThreadSafety.h"
#include "platform/DiscardLog.h"

struct SXCompletionThread::State {
  void run();

  std::shared_ptr<SXLogFacility> log;
  SXMutex mutex;
  std::condition_variable wake;
  std::deque<std::function<void()>> tasks SX_GUARDED_BY(mutex);
  bool stopping SX_GUARDED_BY(mutex) = false;
};

void SXCompletionThread::State::run() {
  for (;;) {
    std::function<void()> task;
    {
      SXMutexLock lock(mutex);
      lock.wait(wake, [&]() SX_REQUIRES(mutex) { return stopping || !tasks.empty(); });
      if (tasks.empty()) return;
      task = std::move(tasks.front());
      tasks.pop_front();
    }
    try {
      task();
    } catch (const std::exception& e) {
      SXLOG(*log, nullptr, SXLogLevel::kError, "a completion failed: %s", e.what());
    } catch (...) {
      SXLOG(*log, nullptr, SXLogLevel::kError, "a completion failed");
    }
  }
}

SXCompletionThread::SXCompletionThread(std::string name, std::shared_ptr<SXLogFacility> log)
    : state_(std::make_shared<State>()) {
  state_->log = SXLogOrDiscard(std::move(log));
  thread_ = std::thread([state = state_, name = std::move(name)] {
    pthread_setname_np(pthread_self(), name.substr(0, 15).c_str());
    state->run();
  });
}

SXCompletionThread::~SXCompletionThread() {
  {
    SXMutexLock lock(state_->mutex);
    state_->stopping = true;
  }
  state_->wake.notify_all();
  if (thread_.get_id() == std::this_thread::get_id()) {
    thread_.detach();
  } else {
    thread_.join();
  }
}

void SXCompletionThread::post(std::function<void()> task) {
  {
    SXMutexLock lock(state_->mutex);
    state_->tasks.push_back(std::move(task));
  }
  state_->wake.notify_one();
}
