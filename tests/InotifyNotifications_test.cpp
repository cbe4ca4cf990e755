#include "linux/InotifyNotifications.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <set>
#include <thread>

#include "common/SXThreadSafety.h"
#include "fakes/FakeLog.h"
#include "linux/AsioDispatch.h"
#include "support/Daemon.h"
#include "support/SqliteTestSupport.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;

namespace {

constexpr const char* kName = "com.vendra.sonex.reporting";
constexpr auto kDeadline = 30s;

// The thread that runs `queue`'s tasks; everything queued before has run once it is known.
std::thread::id threadOf(SXWorkQueue& queue) {
  auto ran = std::make_shared<std::promise<std::thread::id>>();
  queue.async([ran] { ran->set_value(std::this_thread::get_id()); });
  auto future = ran->get_future();
  EXPECT_EQ(future.wait_for(kDeadline), std::future_status::ready) << queue.label();
  return future.get();
}

// Which registration a delivery was for, its token, and the thread it ran on.
struct Delivery {
  std::string tag;
  int token;
  std::thread::id thread;
};

class InotifyNotificationsTest : public ::testing::Test {
 protected:
  std::unique_ptr<SXInotifyNotifications> open() {
    return std::make_unique<SXInotifyNotifications>(runtimeDir_, log_);
  }
  // Registers a handler that records each delivery.
  int subscribe(SXNotifications& notify, const std::string& name,
                const std::shared_ptr<SXWorkQueue>& queue, const std::string& tag) {
    int token = 0;
    auto record = [this, tag](int got) {
      SXMutexLock lock(mutex_);
      delivered_.push_back({tag, got, std::this_thread::get_id()});
    };
    EXPECT_EQ(notify.registerDispatch(name, token, queue, record), 0);
    return token;
  }
  std::vector<Delivery> delivered() {
    SXMutexLock lock(mutex_);
    return delivered_;
  }
  bool waitFor(size_t count) {
    return waitUntil([&] { return delivered().size() >= count; }, kDeadline);
  }
  std::string notifyFile(const std::string& name) const { return runtimeDir_ + "/notify/" + name; }

  SXTestTempDir temporary_;
  const std::string runtimeDir_ = temporary_.path();
  std::shared_ptr<FakeLog> log_ = std::make_shared<FakeLog>();
  // Outlive the queues below, which run the handlers that record into them.
  SXMutex mutex_;
  std::vector<Delivery> delivered_ SX_GUARDED_BY(mutex_);
  SXAsioDispatch dispatch_;
  std::shared_ptr<SXWorkQueue> queue1_ =
      dispatch_.createSerialQueue("q1", SXQualityOfService::kUserInteractive);
  std::shared_ptr<SXWorkQueue> queue2_ =
      dispatch_.createSerialQueue("q2", SXQualityOfService::kUserInteractive);
};

// A handler that throws is logged, and delivery goes on.
TEST_F(InotifyNotificationsTest, PostReachesEachRegistrationOfTheNameOnItsQueue) {
  auto notify = open();
  int boom = 0;
  ASSERT_EQ(notify->registerDispatch("boom", boom, queue1_,
                                     [](int) { throw std::runtime_error("handler failed"); }),
            0);
  ASSERT_EQ(notify->post("boom"), 0);
  EXPECT_TRUE(log_->waitFor("notification handler " + std::to_string(boom) + " threw"));
  int token1 = subscribe(*notify, kName, queue1_, "first");
  int token2 = subscribe(*notify, kName, queue2_, "second");
  int other = subscribe(*notify, "other", queue1_, "other");
  EXPECT_EQ(std::set<int>({boom, token1, token2, other}).size(), 4u);

  // Events are read in order, so once `kName` is delivered the earlier post has been seen.
  EXPECT_EQ(notify->post("nobody.listens"), 0);
  EXPECT_EQ(notify->post(kName), 0);
  ASSERT_TRUE(waitFor(2));
  const std::thread::id thread1 = threadOf(*queue1_), thread2 = threadOf(*queue2_);

  auto all = delivered();
  ASSERT_EQ(all.size(), 2u);
  for (const auto& delivery : all) {
    EXPECT_EQ(delivery.thread, delivery.tag == "first" ? thread1 : thread2) << delivery.tag;
    EXPECT_EQ(delivery.token, delivery.tag == "first" ? token1 : token2) << delivery.tag;
  }
  EXPECT_NE(all[0].tag, all[1].tag);
}

TEST_F(InotifyNotificationsTest, RefusesBadNamesAndArgumentsAndFailsSetUpWithoutThrowing) {
  auto notify = open();
  int token = -7;
  for (std::string name : {std::string(""), std::string("."), std::string(".."), std::string("a/b"),
                           std::string("/"), std::string("a\0b", 3), std::string(300, 'x')}) {
    EXPECT_NE(notify->post(name), 0) << name;
    EXPECT_NE(notify->registerDispatch(name, token, queue1_, [](int) {}), 0) << name;
  }
  EXPECT_NE(notify->registerDispatch(kName, token, nullptr, [](int) {}), 0);
  EXPECT_NE(notify->registerDispatch(kName, token, queue1_, nullptr), 0);
  EXPECT_EQ(token, -7);
  EXPECT_FALSE(fs::exists(runtimeDir_ + "/b"));

  // A set-up that failed (the runtime directory is a file) is reported, not thrown.
  std::ofstream(runtimeDir_ + "/file") << "";
  SXInotifyNotifications failed(runtimeDir_ + "/file", log_);
  EXPECT_NE(failed.registerDispatch(kName, token, queue1_, [](int) {}), 0);
  EXPECT_NE(failed.post(kName), 0);
  EXPECT_FALSE(log_->lines().empty());
}

TEST_F(InotifyNotificationsTest, OtherWaysOfChangingTheFileCountAsPostsAndSurviveItsRemoval) {
  auto notify = open();
  subscribe(*notify, kName, queue1_, "name");
  std::ofstream(notifyFile(kName)) << "written by a shell";  // IN_CLOSE_WRITE
  ASSERT_TRUE(waitFor(1));
  ASSERT_EQ(::utimensat(AT_FDCWD, notifyFile(kName).c_str(), nullptr, 0), 0);  // IN_ATTRIB
  ASSERT_TRUE(waitFor(2));
  std::ofstream(runtimeDir_ + "/staged") << "";
  fs::rename(runtimeDir_ + "/staged", notifyFile(kName));  // IN_MOVED_TO
  ASSERT_TRUE(waitFor(3));

  // A removed directory is watched again. A post may land before the watcher recreates its
  // watch; keep posting until one arrives.
  fs::remove_all(runtimeDir_ + "/notify");
  auto deadline = std::chrono::steady_clock::now() + kDeadline;
  while (delivered().size() < 4 && std::chrono::steady_clock::now() < deadline) {
    ASSERT_EQ(notify->post(kName), 0);
    std::this_thread::sleep_for(20ms);
  }
  EXPECT_GE(delivered().size(), 4u);
  EXPECT_TRUE(log_->contains("watched again"));
}

}  // namespace
