#include "SXReportingBlockThrottle.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <exception>
#include <limits>
#include <optional>
#include <string_view>
#include <unordered_set>

#include "Statistics/SXReportingUtility.h"
#include "common/SXThreadSafety.h"

namespace {

// Keys whose values never take part in the comparison: three time stamps and the two control
// keys, so that neither a time stamp nor a control value makes two messages differ. Constant
// initialised, so the list exists before `main` and before any client can connect.
constexpr std::array<std::string_view, 5> kDefaultExclusionList = {
    "systemuptime_sec", "processuptime_ms", "sxreporting_timestamp", "_comparison_field_blacklist",
    "_throttle_seconds"};

constexpr std::string_view kBlacklistKey = "_comparison_field_blacklist";
constexpr std::string_view kThrottleSecondsKey = "_throttle_seconds";
constexpr double kDefaultSleepTime = 0.5;
constexpr double kMaxSleepTime = 5.0;
constexpr unsigned kCompletionWaitSeconds = 5;
constexpr auto kIdlePause = std::chrono::milliseconds(100);
constexpr const char* kWorkerLabel = "com.vendra.sonex.reporting.blockthrottle";
// Far enough for any throttle time, near enough that the clock arithmetic cannot overflow.
constexpr double kMaxDelaySeconds = 1e9;

SXDate dueIn(const SXClock& clock, double seconds) {
  SXDate now = clock.now();
  if (!(seconds > 0)) return now;  // zero, negative and not-a-number: due at once
  seconds = std::min(seconds, kMaxDelaySeconds);
  return now + std::chrono::duration_cast<SXDate::duration>(std::chrono::duration<double>(seconds));
}

// Plain decimal: integral values (of any number kind) as exact integers, so that 1, 1u and 1.0
// give the same text; other floating values in the shortest fixed-point form that reads back.
std::string numberText(const SXValue& value) {
  if (value.is_boolean()) return value.get<bool>() ? "1" : "0";
  if (value.is_number_unsigned()) return std::to_string(value.get<uint64_t>());
  if (value.is_number_integer()) return std::to_string(value.get<int64_t>());
  double d = value.get<double>();
  if (std::isnan(d)) return "nan";
  if (std::isinf(d)) return d > 0 ? "inf" : "-inf";
  if (d == std::trunc(d) && d >= -0x1p63 && d < 0x1p64) {
    return d < 0 ? std::to_string(static_cast<int64_t>(d))
                 : std::to_string(static_cast<uint64_t>(d));
  }
  std::array<char, 400> buf;  // the longest fixed-point double has about 330 characters
  auto [end, ec] = std::to_chars(buf.data(), buf.data() + buf.size(), d, std::chars_format::fixed);
  return ec == std::errc() ? std::string(buf.data(), end) : std::string("nan");
}

// Quoted, with only the quote, the backslash and control bytes escaped: injective on any bytes,
// valid UTF-8 or not.
void appendQuoted(std::string& out, std::string_view text) {
  static constexpr char kHex[] = "0123456789abcdef";
  out.push_back('"');
  for (char c : text) {
    auto byte = static_cast<unsigned char>(c);
    if (c == '"' || c == '\\') {
      out.push_back('\\');
      out.push_back(c);
    } else if (byte < 0x20) {
      out.append("\\u00");
      out.push_back(kHex[byte >> 4]);
      out.push_back(kHex[byte & 0xF]);
    } else {
      out.push_back(c);
    }
  }
  out.push_back('"');
}

// The nested form of a value inside an array or dictionary: compact JSON with dictionary keys in
// ascending byte order, numbers as `numberText`, strings quoted (so "1" and 1 differ here).
void appendNested(std::string& out, const SXValue& value) {
  switch (value.type()) {
    case SXValue::value_t::string:
      appendQuoted(out, value.get_ref<const std::string&>());
      return;
    case SXValue::value_t::array: {
      out.push_back('[');
      for (size_t i = 0; i < value.size(); ++i) {
        if (i) out.push_back(',');
        appendNested(out, value[i]);
      }
      out.push_back(']');
      return;
    }
    case SXValue::value_t::object: {
      out.push_back('{');
      bool first = true;
      for (const auto& [key, element] : value.items()) {  // std::map order: ascending bytes
        if (!first) out.push_back(',');
        first = false;
        appendQuoted(out, key);
        out.push_back(':');
        appendNested(out, element);
      }
      out.push_back('}');
      return;
    }
    case SXValue::value_t::binary: {
      static constexpr char kHex[] = "0123456789abcdef";
      const auto& bytes = value.get_binary();
      out.push_back('<');
      for (uint8_t b : bytes) {
        out.push_back(kHex[b >> 4]);
        out.push_back(kHex[b & 0xF]);
      }
      if (bytes.has_subtype()) out.append(":" + std::to_string(bytes.subtype()));
      out.push_back('>');
      return;
    }
    case SXValue::value_t::null:
    case SXValue::value_t::discarded:
      out.append("null");
      return;
    default:
      out.append(numberText(value));
      return;
  }
}

// The text of a payload value in the key: a string as it is, null as "(null)", anything else in
// its nested form.
std::string keyFieldText(const SXValue& value) {
  if (value.is_string()) return value.get<std::string>();
  if (value.is_null()) return "(null)";
  std::string out;
  appendNested(out, value);
  return out;
}

std::unordered_set<std::string_view> excludedKeys(const SXValue& payload) {
  std::unordered_set<std::string_view> excluded(kDefaultExclusionList.begin(),
                                                kDefaultExclusionList.end());
  auto blacklist = payload.find(kBlacklistKey);
  if (blacklist != payload.end() && blacklist->is_array()) {
    for (const auto& element : *blacklist) {
      // Non-string elements name no key.
      if (element.is_string()) excluded.insert(element.get_ref<const std::string&>());
    }
  }
  if (payload.contains("Volume") && payload.contains("VolumeOperationTime")) {
    excluded.insert("Volume");
    excluded.insert("VolumeOperationTime");
  }
  return excluded;
}

// Whether the integer part of a number, truncated toward zero, is at most 4. Not-a-number has
// no integer part and fails.
bool integerPartAtMostFour(const SXValue& value) {
  if (value.is_number_unsigned()) return value.get<uint64_t>() <= 4;
  if (value.is_number_integer() || value.is_boolean()) return value.get<int64_t>() <= 4;
  return std::trunc(value.get<double>()) <= 4;
}

double narrowedToFloat(double seconds) {
  // Below the float range the conversion itself is undefined; IEEE rounding would give -inf.
  if (seconds < -std::numeric_limits<float>::max()) {
    return -std::numeric_limits<double>::infinity();
  }
  return static_cast<double>(static_cast<float>(seconds));
}

}  // namespace

// ---- SXReportingBlockThrottleSchedule ----

struct SXReportingBlockThrottleSchedule::State : std::enable_shared_from_this<State> {
  State(std::shared_ptr<SXDispatch> dispatch, std::shared_ptr<SXWorkQueue> queue,
        std::shared_ptr<SXClock> clock)
      : dispatch(std::move(dispatch)), queue(std::move(queue)), clock(std::move(clock)) {}

  // Fires the timers due by now, then either ends the run or arranges the next wake-up. Only
  // the wake-up holding the current token acts; the others were replaced by a re-arm.
  void step(uint64_t token);
  // Makes a wake-up at `due` the only one that acts and returns the call that queues it, to be
  // made once `mutex` is released.
  std::function<void()> wakeAtLocked(SXDate due) SX_REQUIRES(mutex);

  const std::shared_ptr<SXDispatch> dispatch;
  const std::shared_ptr<SXWorkQueue> queue;
  const std::shared_ptr<SXClock> clock;

  SXMutex mutex;
  std::vector<std::shared_ptr<SXReportingBlockThrottleTimer>> timers SX_GUARDED_BY(mutex);
  std::function<void()> done SX_GUARDED_BY(mutex);  // set while a run is in progress
  bool running SX_GUARDED_BY(mutex) = false;
  uint64_t wakeToken SX_GUARDED_BY(mutex) = 0;
  std::optional<SXDate> wakeAt SX_GUARDED_BY(mutex);  // empty while a step fires timers
};

std::function<void()> SXReportingBlockThrottleSchedule::State::wakeAtLocked(SXDate due) {
  uint64_t token = ++wakeToken;
  wakeAt = due;
  auto delay = std::max(std::chrono::nanoseconds::zero(),
                        std::chrono::duration_cast<std::chrono::nanoseconds>(due - clock->now()));
  return [self = shared_from_this(), delay, token] {
    self->dispatch->after(delay, self->queue, [self, token] { self->step(token); });
  };
}

void SXReportingBlockThrottleSchedule::State::step(uint64_t token) {
  SXMutexLock lock(mutex);
  if (token != wakeToken) return;
  wakeAt.reset();  // a re-arm while timers fire queues a fresh wake-up
  for (;;) {
    std::erase_if(timers, [](const auto& timer) { return !timer->valid_; });
    if (timers.empty()) {
      running = false;
      auto finished = std::move(done);
      done = nullptr;
      lock.unlock();
      if (finished) finished();
      return;
    }
    auto earliest =
        std::min_element(timers.begin(), timers.end(),
                         [](const auto& a, const auto& b) { return a->due_ < b->due_; });
    if ((*earliest)->due_ > clock->now()) {
      auto queueWakeUp = wakeAtLocked((*earliest)->due_);
      lock.unlock();
      queueWakeUp();
      return;
    }
    auto timer = std::move(*earliest);
    timers.erase(earliest);
    timer->valid_ = false;  // one-shot
    lock.unlock();
    if (timer->action_) timer->action_();
    lock.lock();
    // A re-arm during the action queued a wake-up of its own, which carries on from here.
    if (token != wakeToken) return;
  }
}

SXReportingBlockThrottleSchedule::SXReportingBlockThrottleSchedule(
    std::shared_ptr<SXDispatch> dispatch, std::shared_ptr<SXWorkQueue> queue,
    std::shared_ptr<SXClock> clock)
    : state_(std::make_shared<State>(std::move(dispatch), std::move(queue), std::move(clock))) {}

void SXReportingBlockThrottleSchedule::add(std::shared_ptr<SXReportingBlockThrottleTimer> timer) {
  if (!timer) return;
  SXMutexLock lock(state_->mutex);
  state_->timers.push_back(std::move(timer));
}

void SXReportingBlockThrottleSchedule::run(std::function<void()> done) {
  uint64_t token;
  {
    SXMutexLock lock(state_->mutex);
    state_->running = true;
    state_->done = std::move(done);
    token = ++state_->wakeToken;
  }
  state_->step(token);
}

// ---- SXReportingBlockThrottleTimer ----

SXReportingBlockThrottleTimer::SXReportingBlockThrottleTimer(
    const SXReportingBlockThrottleSchedule& schedule, SXDate due, std::function<void()> action)
    : state_(schedule.state_), due_(due), action_(std::move(action)) {}

void SXReportingBlockThrottleTimer::setFireDate(SXDate due) {
  std::function<void()> queueWakeUp;
  {
    SXMutexLock lock(state_->mutex);
    due_ = due;
    // Only an earlier time needs a wake-up of its own: a wake-up that comes too early finds
    // nothing due and waits again for the earliest time.
    if (state_->running && valid_ && (!state_->wakeAt || due < *state_->wakeAt)) {
      queueWakeUp = state_->wakeAtLocked(due);
    }
  }
  if (queueWakeUp) queueWakeUp();
}

void SXReportingBlockThrottleTimer::invalidate() {
  SXMutexLock lock(state_->mutex);
  valid_ = false;
}

// ---- SXReportingBlockThrottleTimerWrapper ----

std::function<void()> SXReportingBlockThrottleTimerWrapper::block() const {
  SXMutexLock lock(mutex_);
  return block_;
}

void SXReportingBlockThrottleTimerWrapper::setBlock(std::function<void()> block) {
  // The replaced operation is destroyed here, outside the lock: its captures may do anything.
  exchangeBlock(std::move(block));
}

std::function<void()> SXReportingBlockThrottleTimerWrapper::exchangeBlock(
    std::function<void()> block) {
  SXMutexLock lock(mutex_);
  return std::exchange(block_, std::move(block));
}

std::shared_ptr<SXReportingBlockThrottleTimer> SXReportingBlockThrottleTimerWrapper::timer() const {
  SXMutexLock lock(mutex_);
  return timer_;
}

void SXReportingBlockThrottleTimerWrapper::setTimer(
    std::shared_ptr<SXReportingBlockThrottleTimer> timer) {
  SXMutexLock lock(mutex_);
  timer_ = std::move(timer);
}

void SXReportingBlockThrottleTimerWrapper::sleepFor(double seconds) {
  if (auto current = timer()) current->setFireDate(dueIn(*clock_, seconds));
}

// ---- SXReportingBlockThrottle: message keys and throttle time ----

std::string SXReportingBlockThrottle::buildMessageKey(const SXValue& payload, int64_t reporterID,
                                                      SXReportingCategory category,
                                                      SXReportingMessageType type) {
  std::string key;
  if (payload.is_object()) {
    auto excluded = excludedKeys(payload);
    for (const auto& [name, value] : payload.items()) {  // std::map order: ascending bytes
      key.append(name).push_back('|');
      key.append(excluded.count(name) ? "^" : keyFieldText(value)).push_back('|');
    }
  }
  key.append("reporterID|").append(std::to_string(reporterID)).push_back('|');
  key.append(SXReportingUtilityCategoryName(category)).push_back('|');
  key.append(SXReportingUtilityTypeName(type));
  return key;
}

double SXReportingBlockThrottle::determineSleepTime(const SXValue& payload, SXLogFacility& log) {
  if (!payload.is_object()) return kDefaultSleepTime;
  auto it = payload.find(kThrottleSecondsKey);
  if (it == payload.end()) return kDefaultSleepTime;
  const SXValue& time = *it;
  // Booleans are numbers of the value model (1 and 0).
  if (!time.is_number() && !time.is_boolean()) {
    SXLOG(log, nullptr, SXLogLevel::kInfo, "Rejecting non Numbox value of throttle time. {time=%@}",
          time);
    return kDefaultSleepTime;
  }
  if (!integerPartAtMostFour(time)) {
    SXLOG(log, nullptr, SXLogLevel::kInfo, "Rejecting large throttle time. {time=%@, max=%f}", time,
          kMaxSleepTime);
    return kDefaultSleepTime;
  }
  return narrowedToFloat(time.get<double>());
}

// ---- SXReportingBlockThrottle: the throttle ----

std::shared_ptr<SXReportingBlockThrottle> SXReportingBlockThrottle::create(
    std::shared_ptr<SXDispatch> dispatch, std::shared_ptr<SXClock> clock,
    std::shared_ptr<SXLogFacility> log, std::shared_ptr<const SXLogScope> verboseScope) {
  auto throttle = std::make_shared<SXReportingBlockThrottle>(
      Passkey{}, std::move(dispatch), std::move(clock), std::move(log), std::move(verboseScope));
  throttle->queue_->async([self = throttle] { self->workerPass(); });
  return throttle;
}

// User-interactive: the platform gives such a queue a thread of its own, which is the worker
// thread, so sends never wait behind other work of the process nor it behind them.
SXReportingBlockThrottle::SXReportingBlockThrottle(Passkey, std::shared_ptr<SXDispatch> dispatch,
                                                   std::shared_ptr<SXClock> clock,
                                                   std::shared_ptr<SXLogFacility> log,
                                                   std::shared_ptr<const SXLogScope> verboseScope)
    : dispatch_(std::move(dispatch)),
      clock_(std::move(clock)),
      log_(std::move(log)),
      verboseScope_(std::move(verboseScope)),
      queue_(dispatch_->createSerialQueue(kWorkerLabel, SXQualityOfService::kUserInteractive)),
      schedule_(dispatch_, queue_, clock_) {
  unscheduledTimerKeys_.reserve(6);
}

void SXReportingBlockThrottle::addMessageBlock(std::function<void()> block, int64_t reporterID,
                                               const SXValue& message, SXReportingCategory category,
                                               SXReportingMessageType type) {
  std::string key = buildMessageKey(message, reporterID, category, type);
  double sleepTime = determineSleepTime(message, *log_);

  SXMutexLock inFlight(inFlightMutex_);
  if (auto it = timersInFlight_.find(key); it != timersInFlight_.end()) {
    SXLOG(*log_, verboseScope_.get(), SXLogLevel::kDebug, "Dropping duplicate message for %@", key);
    it->second->sleepFor(sleepTime);
    // The replaced operation is never run; it is destroyed only after the lock is released.
    std::function<void()> replaced = it->second->exchangeBlock(std::move(block));
    inFlight.unlock();
    return;
  }
  auto wrapper = std::make_shared<SXReportingBlockThrottleTimerWrapper>(clock_);
  wrapper->setBlock(std::move(block));
  // Weak captures: the wrapper owns the timer, and the throttle outlives every timer it runs.
  auto action = [weakThrottle = weak_from_this(),
                 weakWrapper = std::weak_ptr<SXReportingBlockThrottleTimerWrapper>(wrapper), key] {
    auto throttle = weakThrottle.lock();
    auto entry = weakWrapper.lock();
    if (throttle && entry) throttle->fire(key, entry);
  };
  wrapper->setTimer(std::make_shared<SXReportingBlockThrottleTimer>(
      schedule_, dueIn(*clock_, sleepTime), std::move(action)));
  timersInFlight_.emplace(key, std::move(wrapper));
  inFlight.unlock();

  SXMutexLock unscheduled(unscheduledMutex_);
  unscheduledTimerKeys_.push_back(std::move(key));
}

void SXReportingBlockThrottle::fire(
    const std::string& key, const std::shared_ptr<SXReportingBlockThrottleTimerWrapper>& entry) {
  std::function<void()> block;
  {
    // Read under the in-flight lock so that a duplicate's re-arm and replacement, which form one
    // critical section, are seen whole: a duplicate whose re-arm makes the entry due at once
    // must have its own operation sent, not the one it replaces.
    SXMutexLock inFlight(inFlightMutex_);
    block = entry->block();
  }
  if (block) {
    // A throwing operation must not end the worker, which runs every other send.
    try {
      block();
    } catch (const std::exception& e) {
      SXLOG(*log_, nullptr, SXLogLevel::kError, "Send operation failed: %s", e.what());
    } catch (...) {
      SXLOG(*log_, nullptr, SXLogLevel::kError, "Send operation failed");
    }
  }
  {
    SXMutexLock inFlight(inFlightMutex_);
    if (auto timer = entry->timer()) timer->invalidate();
    auto it = timersInFlight_.find(key);
    if (it != timersInFlight_.end() && it->second == entry) timersInFlight_.erase(it);
    if (!timersInFlight_.empty()) return;
  }
  inFlightChanged_.notify_all();
}

// The loop of the worker thread, one pass per task: the flag is tested once per pass, so a run
// phase in progress finishes first, and new entries join the schedule only between phases.
void SXReportingBlockThrottle::workerPass() {
  if (!shouldKeepRunning_.load()) return;
  if (unscheduledTimerKeysCount() == 0) {
    idleSleep();
    return;
  }
  SXLOG(*log_, verboseScope_.get(), SXLogLevel::kDebug,
        "calling workingRunLoop run from inside thread block");
  scheduleUnscheduledTimers();
  schedule_.run([self = shared_from_this()] { self->idleSleep(); });
}

void SXReportingBlockThrottle::idleSleep() {
  SXLOG(*log_, verboseScope_.get(), SXLogLevel::kDebug, "sleeping in thread");
  dispatch_->after(kIdlePause, queue_, [self = shared_from_this()] { self->workerPass(); });
}

void SXReportingBlockThrottle::scheduleUnscheduledTimers() {
  SXMutexLock unscheduled(unscheduledMutex_);
  {
    SXMutexLock inFlight(inFlightMutex_);
    for (const auto& key : unscheduledTimerKeys_) {
      auto it = timersInFlight_.find(key);
      if (it != timersInFlight_.end()) schedule_.add(it->second->timer());
    }
  }
  unscheduledTimerKeys_.clear();
}

void SXReportingBlockThrottle::waitForCompletion() {
  SXLOG(*log_, nullptr, SXLogLevel::kInfo,
        "waitForCompletion. timersInFlight=%u unscheduledTimerKeys=%u", timersInFlightCount(),
        unscheduledTimerKeysCount());
  if (timersInFlightCount() == 0) return;
  // The time limit is a task of the platform's dispatch, so it runs on the platform clock, and
  // on the concurrent queue, so it ends the wait even when the caller is a send holding up the
  // worker.
  auto expired = std::make_shared<bool>(false);  // under inFlightMutex_
  dispatch_->after(std::chrono::seconds(kCompletionWaitSeconds),
                   dispatch_->lowPriorityConcurrentQueue(),
                   [weakThrottle = weak_from_this(), expired] {
                     auto throttle = weakThrottle.lock();
                     if (!throttle) return;
                     {
                       SXMutexLock lock(throttle->inFlightMutex_);
                       *expired = true;
                     }
                     throttle->inFlightChanged_.notify_all();
                   });
  SXLOG(*log_, verboseScope_.get(), SXLogLevel::kDebug,
        "Waiting up to %u seconds for blockThrottle queue to be empty.", kCompletionWaitSeconds);
  size_t pending;
  {
    SXMutexLock lock(inFlightMutex_);
    lock.wait(inFlightChanged_,
              [&]() SX_REQUIRES(inFlightMutex_) { return timersInFlight_.empty() || *expired; });
    pending = timersInFlight_.size();
  }
  if (pending) {
    SXLOG(*log_, nullptr, SXLogLevel::kDefault,
          "Giving up on waiting for completion after %u seconds. timersInFlight=%u",
          kCompletionWaitSeconds, pending);
  }
}

size_t SXReportingBlockThrottle::timersInFlightCount() const {
  SXMutexLock lock(inFlightMutex_);
  return timersInFlight_.size();
}

size_t SXReportingBlockThrottle::unscheduledTimerKeysCount() const {
  SXMutexLock lock(unscheduledMutex_);
  return unscheduledTimerKeys_.size();
}
