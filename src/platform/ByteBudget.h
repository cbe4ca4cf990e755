// A count of the bytes one client has made the daemon hold (requests read but not handled,
// payloads waiting for a store or a send, delayed standalone sends), with a limit, inside a
// pool that every client's budget shares.
//
// Nothing is ever refused here: a budget over its limit only tells its connection to stop
// reading, and the bytes come back as the work that holds them finishes. A budget is over
// its limit when it holds more than its own limit, or when the pool holds more than the
// pool's limit and the budget holds more than a small floor: under pressure every client
// keeps a little room, so that a client with nothing in flight is never held back by others.
//
// Threads: any thread may add, release and read. The waker runs on the thread whose release
// brought the budget back under its limit, at most once per `armWake` call.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>

class SXByteBudget {
 public:
  // Bytes held until this object is destroyed. Move-only.
  class Charge {
   public:
    Charge() = default;
    Charge(std::shared_ptr<SXByteBudget> budget, uint64_t bytes);
    ~Charge() { reset(); }
    Charge(Charge&& other) noexcept;
    Charge& operator=(Charge&& other) noexcept;
    Charge(const Charge&) = delete;
    Charge& operator=(const Charge&) = delete;
    void reset();
    uint64_t bytes() const { return bytes_; }

   private:
    std::shared_ptr<SXByteBudget> budget_;
    uint64_t bytes_ = 0;
  };

  // `floor`: what the budget may hold while the pool is over its limit.
  SXByteBudget(uint64_t limit, std::shared_ptr<SXByteBudget> pool = nullptr, uint64_t floor = 0);
  SXByteBudget(const SXByteBudget&) = delete;
  SXByteBudget& operator=(const SXByteBudget&) = delete;

  void add(uint64_t bytes);
  void release(uint64_t bytes);

  bool overLimit() const;
  // Whether the pool (or this budget, when it has none) is over its own limit.
  bool poolOverLimit() const;
  uint64_t held() const { return held_.load(std::memory_order_relaxed); }
  uint64_t limit() const { return limit_; }
  uint64_t floor() const { return floor_; }
  const std::shared_ptr<SXByteBudget>& pool() const { return pool_; }

  // Set before the budget is shared. Called once after each `armWake` when a release leaves
  // the budget under its limit.
  void setWaker(std::function<void()> waker) { waker_ = std::move(waker); }
  void armWake() { wakeArmed_.store(true); }

 private:
  void wakeIfRoom();

  const uint64_t limit_;
  const std::shared_ptr<SXByteBudget> pool_;
  const uint64_t floor_;
  std::atomic<uint64_t> held_{0};
  std::atomic<bool> wakeArmed_{false};
  std::function<void()> waker_;
};

// The memory a decoded value takes, estimated from the size of its MessagePack encoding: a
// dictionary's nodes take several times the bytes that encode them.
inline uint64_t SXDecodedBytes(size_t wireBytes) { return 256 + 4 * uint64_t{wireBytes}; }

// `value` itself, holding `charge` as well for as long as the returned pointer is held.
template <typename T>
std::shared_ptr<const T> SXChargedAlias(std::shared_ptr<const T> value,
                                        SXByteBudget::Charge charge) {
  struct Holder {
    std::shared_ptr<const T> value;
    SXByteBudget::Charge charge;
  };
  const T* raw = value.get();
  auto holder = std::make_shared<Holder>(Holder{std::move(value), std::move(charge)});
  return std::shared_ptr<const T>(holder, raw);
}

// A value that holds its bytes of a budget for as long as anyone holds the value: the shared
// payload of a message carries its client's charge to every store and queue that keeps it.
template <typename T>
std::shared_ptr<const T> SXChargedShared(T value, SXByteBudget::Charge charge) {
  struct Holder {
    T value;
    SXByteBudget::Charge charge;
  };
  auto holder = std::make_shared<Holder>(Holder{std::move(value), std::move(charge)});
  return std::shared_ptr<const T>(holder, &holder->value);
}
