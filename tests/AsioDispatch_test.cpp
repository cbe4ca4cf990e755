#include "platform/AsioDispatch.h"

#include <gtest/gtest.h>

#include <future>
#include <thread>

using namespace std::chrono_literals;

// The second half of the tasks is handed on inside nested SXCoalescedWakes scopes, which put
// off the worker's wake-up to the end of the outer one, beside a queue that goes meanwhile.
TEST(AsioDispatch, SerialQueuesKeepOrderAndNeverOverlap) {
  SXAsioDispatch dispatch;
  for (auto qos : {SXQualityOfService::kUserInteractive, SXQualityOfService::kUtility}) {
    auto queue = dispatch.createSerialQueue("q", qos);
    std::vector<int> order;  // touched only by the queue's tasks
    std::atomic<int> running{0};
    std::promise<void> done;
    auto submit = [&](int i) {
      queue->async([&, i] {
        EXPECT_EQ(running.fetch_add(1), 0);
        order.push_back(i);
        running.fetch_sub(1);
        if (i == 999) done.set_value();
      });
    };
    for (int i = 0; i < 500; ++i) submit(i);
    {
      SXCoalescedWakes outer;
      auto gone = dispatch.createSerialQueue("gone", qos);
      gone->async([] {});
      gone.reset();
      for (int i = 500; i < 750; ++i) submit(i);
      SXCoalescedWakes inner;
      for (int i = 750; i < 1000; ++i) submit(i);
    }
    ASSERT_EQ(done.get_future().wait_for(10s), std::future_status::ready);
    for (int i = 0; i < 1000; ++i) ASSERT_EQ(order[static_cast<size_t>(i)], i);
  }
}

TEST(AsioDispatch, ABlockedUtilityQueueNeverDelaysAnother) {
  SXAsioDispatch dispatch;
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  std::vector<std::shared_ptr<SXWorkQueue>> blocked;
  // More blocked queues than the machine has cores: the pool must grow past them.
  for (int i = 0; i < 8; ++i) {
    blocked.push_back(dispatch.createSerialQueue("blocked", SXQualityOfService::kUtility));
    blocked.back()->async([released] { released.wait(); });
  }
  auto free = dispatch.createSerialQueue("free", SXQualityOfService::kUtility);
  std::promise<void> ran;
  free->async([&] { ran.set_value(); });
  EXPECT_EQ(ran.get_future().wait_for(10s), std::future_status::ready);
  release.set_value();
}

TEST(AsioDispatch, AfterWaitsForItsDelay) {
  SXAsioDispatch dispatch;
  auto start = std::chrono::steady_clock::now();
  std::promise<std::chrono::steady_clock::time_point> ran;
  dispatch.after(200ms, dispatch.lowPriorityConcurrentQueue(),
                 [&] { ran.set_value(std::chrono::steady_clock::now()); });
  auto future = ran.get_future();
  ASSERT_EQ(future.wait_for(10s), std::future_status::ready);
  EXPECT_GE(future.get() - start, 200ms);
}
