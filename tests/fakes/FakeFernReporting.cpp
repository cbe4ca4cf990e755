#include "fakes/FakeFernReporting.h"

#include <condition_variable>
#include <deque>
#include <mutex>
#include <thread>

#include "common/SXThreadSafety.h"

namespace {

// A thread that runs tasks in the order they were posted. Tasks not yet run when it is
// destroyed are dropped.
class Deliverer {
 public:
  Deliverer() : shared_(std::make_shared<Shared>()) {
    thread_ = std::thread([shared = shared_] { shared->run(); });
  }
  ~Deliverer() {
    {
      SXMutexLock lock(shared_->mutex);
      shared_->stopping = true;
    }
    shared_->wake.notify_all();
    // A completion may drop the last reference to the fake; the thread cannot join itself.
    if (thread_.get_id() == std::this_thread::get_id()) {
      thread_.detach();
    } else {
      thread_.join();
    }
  }
  Deliverer(const Deliverer&) = delete;
  Deliverer& operator=(const Deliverer&) = delete;

  void post(std::function<void()> task) {
    {
      SXMutexLock lock(shared_->mutex);
      shared_->due.push_back(std::move(task));
    }
    shared_->wake.notify_all();
  }

 private:
  struct Shared {
    void run() {
      SXMutexLock lock(mutex);
      while (!stopping) {
        if (due.empty()) {
          lock.wait(wake);
          continue;
        }
        auto task = std::move(due.front());
        due.pop_front();
        lock.unlock();
        task();
        task = nullptr;
        lock.lock();
      }
    }
    SXMutex mutex;
    std::condition_variable wake;
    std::deque<std::function<void()>> due SX_GUARDED_BY(mutex);
    bool stopping SX_GUARDED_BY(mutex) = false;
  };
  std::shared_ptr<Shared> shared_;
  std::thread thread_;
};

}  // namespace

// What the fake and its sessions share; sessions refer to it weakly.
class FakeFernReporting::State {
 public:
  using Kind = Event::Kind;

  void startConfiguration(int session, FernBackendsCompletion completion) {
    SXMutexLock lock(mutex);
    append({.kind = Kind::kStartConfiguration, .session = session});
    std::function<void()> deliver = [completion] {
      if (completion) completion(std::vector<std::string>{"fake"});
    };
    if (configurationDelivery == Delivery::kNever) return held.push_back(std::move(deliver));
    lock.unlock();
    deliver();
  }

  bool send(Event event, std::optional<FernError>& error) {
    SXMutexLock lock(mutex);
    const SendFailure failure = event.kind == Kind::kSingleMessage ? singleFailure : SendFailure{};
    append(std::move(event));
    if (failure.fails && failure.error) error = failure.error;
    return !failure.fails;
  }

  void flush(int session, FernFlushCompletion completion) {
    SXMutexLock lock(mutex);
    append({.kind = Kind::kFlush, .session = session});
    deliverer.post([completion] {
      if (completion) completion(std::nullopt);
    });
  }

  void append(Event event) SX_REQUIRES(mutex) {
    events.push_back(std::move(event));
    changed.notify_all();
  }

  SXMutex mutex;
  std::condition_variable changed;
  std::vector<Event> events SX_GUARDED_BY(mutex);
  Delivery configurationDelivery SX_GUARDED_BY(mutex) = Delivery::kInline;
  SendFailure singleFailure SX_GUARDED_BY(mutex);
  int sessions SX_GUARDED_BY(mutex) = 0;
  int tokens SX_GUARDED_BY(mutex) = 0;
  std::vector<std::function<void()>> held SX_GUARDED_BY(mutex);  // kNever completions
  Deliverer deliverer;  // declared last: stopped before the rest goes
};

class FakeFernReporting::Session final : public FernReportingSession {
 public:
  Session(std::weak_ptr<State> state, int number) : state_(std::move(state)), number_(number) {}

  std::string description() const override {
    return "<FakeFernReportingSession " + std::to_string(number_) + ">";
  }
  void startConfiguration(FernBackendsCompletion completion) override {
    if (auto state = state_.lock()) state->startConfiguration(number_, std::move(completion));
  }
  bool sendMessage(uint16_t category, uint16_t type, const SXValue& payload,
                   std::optional<FernError>& error) override {
    auto state = state_.lock();
    if (!state) {
      error = FernError{"the fake server-reporting service is gone"};
      return false;
    }
    return state->send({.kind = Event::Kind::kMessage,
                        .session = number_,
                        .category = category,
                        .type = type,
                        .payload = payload},
                       error);
  }
  void flushMessages(FernFlushCompletion completion) override {
    if (auto state = state_.lock()) state->flush(number_, std::move(completion));
  }

 private:
  const std::weak_ptr<State> state_;
  const int number_;
};

FakeFernReporting::FakeFernReporting() : state_(std::make_shared<State>()) {}

FakeFernReporting::~FakeFernReporting() = default;

std::shared_ptr<FernSecureHierarchyToken> FakeFernReporting::newHierarchyToken(
    const std::shared_ptr<FernSecureHierarchyToken>& parent) {
  SXMutexLock lock(state_->mutex);
  state_->append({.kind = Event::Kind::kToken});
  std::string identifier = "fake-token-" + std::to_string(++state_->tokens);
  if (parent) identifier = parent->identifier() + "/" + identifier;
  return std::make_shared<FernSecureHierarchyToken>(identifier);
}

std::shared_ptr<FernReportingSession> FakeFernReporting::openSession(const SXValue& sessionInfo,
                                                                     const SXValue& userInfo,
                                                                     const SXValue&) {
  SXMutexLock lock(state_->mutex);
  const int number = ++state_->sessions;
  state_->append({.kind = Event::Kind::kOpen,
                  .session = number,
                  .sessionInfo = sessionInfo,
                  .userInfo = userInfo});
  return std::make_shared<Session>(state_, number);
}

bool FakeFernReporting::sendOneMessage(const SXValue& sessionInfo, const SXValue& userInfo,
                                       uint16_t category, uint16_t type, const SXValue& payload,
                                       std::optional<FernError>& error) {
  return state_->send({.kind = Event::Kind::kSingleMessage,
                       .sessionInfo = sessionInfo,
                       .userInfo = userInfo,
                       .category = category,
                       .type = type,
                       .payload = payload},
                      error);
}

void FakeFernReporting::setConfigurationDelivery(Delivery delivery) {
  SXMutexLock lock(state_->mutex);
  state_->configurationDelivery = delivery;
}

void FakeFernReporting::setSingleMessageFailure(SendFailure failure) {
  SXMutexLock lock(state_->mutex);
  state_->singleFailure = std::move(failure);
}

void FakeFernReporting::deliverHeld() {
  SXMutexLock lock(state_->mutex);
  for (auto& task : state_->held) state_->deliverer.post(std::move(task));
  state_->held.clear();
}

std::vector<FakeFernReporting::Event> FakeFernReporting::events() const {
  SXMutexLock lock(state_->mutex);
  return state_->events;
}

std::vector<FakeFernReporting::Event> FakeFernReporting::events(Event::Kind kind) const {
  auto out = events();
  std::erase_if(out, [kind](const Event& e) { return e.kind != kind; });
  return out;
}

std::vector<FakeFernReporting::Event> FakeFernReporting::messages(int session) const {
  auto out = events(Event::Kind::kMessage);
  std::erase_if(out, [session](const Event& e) { return e.session != session; });
  return out;
}

bool FakeFernReporting::waitFor(const std::function<bool(const std::vector<Event>&)>& ready,
                                std::chrono::milliseconds timeout) const {
  SXMutexLock lock(state_->mutex);
  return lock.waitFor(state_->changed, timeout,
                      [&]() SX_REQUIRES(state_->mutex) { return ready(state_->events); });
}
