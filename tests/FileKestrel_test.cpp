#include "linux/FileKestrel.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>

#include "fakes/FakeLog.h"
#include "support/SqliteTestSupport.h"

namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;

class FileKestrelTest : public ::testing::Test {
 protected:
  void publish(const std::string& relative, const std::string& contents) {
    fs::create_directories((root_ / relative).parent_path());
    std::ofstream(root_ / relative) << contents;
  }

  // The usual tree: each driver group, a group the drivers must not match, hidden entries.
  void publishTree() {
    publish("VendraAE2MCA/-/underruns", "3\n");
    publish("Speaker/-/temp", "  40 ");
    publish("Speaker/-/-", "2");
    publish("Codec/MCA/overruns", "1");
    publish("Amp/MCA/clips", "+4");
    publish("Haptics/Stats/clips", "7");
    publish("Haptics/Other/ignored", "100");
    publish("Speaker/-/.temp.swp", "junk");
    publish(".staging/MCA/x", "1");
  }

  std::vector<std::string> keys(const std::optional<SXValue>& value) {
    std::vector<std::string> out;
    if (value) {
      for (const auto& [key, entry] : value->items()) out.push_back(key);
    }
    return out;
  }

  std::optional<SXValue> channels(const std::optional<std::string>& group,
                                  const std::optional<std::string>& subgroup) {
    error_.reset();
    return kestrel_->copyChannelsInGroup(group, subgroup, 0, error_);
  }

  SXValue sample(const std::optional<std::string>& group,
                 const std::optional<std::string>& subgroup) {
    auto found = channels(group, subgroup);
    EXPECT_TRUE(found);
    subscription_ = kestrel_->createSubscription(found.value_or(SXValue()), subscribed_);
    return resample();
  }

  SXValue resample() {
    std::optional<KestrelError> error;
    auto samples = kestrel_->createSamples(subscription_.get(), subscribed_, error);
    EXPECT_FALSE(error);
    return samples.value_or(SXValue());
  }

  std::map<std::string, int64_t> counters(const SXValue& samples) {
    std::map<std::string, int64_t> out;
    kestrel_->iterate(samples, [&](const KestrelChannelSample& s) {
      out[s.channelName.value_or("<none>")] = s.value;
      return 0;
    });
    return out;
  }

  SXTestTempDir temporary_;
  const fs::path dir_ = temporary_.path();
  const fs::path root_ = dir_ / "kestrel";
  std::shared_ptr<FakeLog> log_ = std::make_shared<FakeLog>();
  std::unique_ptr<SXFileKestrel> kestrel_ = std::make_unique<SXFileKestrel>(root_.string(), log_);
  std::optional<KestrelError> error_;
  std::shared_ptr<KestrelSubscription> subscription_;
  SXValue subscribed_;
};

TEST_F(FileKestrelTest, QueriesMatchGroupAndSubgroupDirectoriesInsideTheTree) {
  // Without a tree (no driver statistics on this machine) there is nothing, and no error.
  EXPECT_EQ(channels(std::nullopt, std::nullopt), std::nullopt);
  EXPECT_FALSE(error_);
  publishTree();
  fs::create_directories(root_ / "Empty" / "-");
  // Symlinks never lead out of the tree: not listed, whether the query names them or not.
  std::ofstream(dir_ / "secret") << "1234";
  fs::create_directories(dir_ / "outside" / "MCA");
  std::ofstream(dir_ / "outside" / "MCA" / "x") << "5";
  fs::create_symlink(dir_ / "secret", root_ / "Speaker" / "-" / "leak");
  fs::create_directory_symlink(dir_ / "outside", root_ / "Linked");
  fs::create_directory_symlink(dir_ / "outside" / "MCA", root_ / "Codec" / "Linked");

  auto speaker = channels("Speaker", std::nullopt);
  EXPECT_THAT(keys(speaker), ElementsAre("Speaker/-/-", "Speaker/-/temp"));
  EXPECT_EQ((*speaker)["Speaker/-/-"],
            (SXValue{{"group", "Speaker"}, {"subgroup", nullptr}, {"name", nullptr}}));
  EXPECT_THAT(keys(channels(std::nullopt, "MCA")),
              ElementsAre("Amp/MCA/clips", "Codec/MCA/overruns"));
  EXPECT_THAT(keys(channels("Haptics", "Stats")), ElementsAre("Haptics/Stats/clips"));
  EXPECT_EQ(kestrel_->getChannelCount(*channels(std::nullopt, std::nullopt)), 7);
  EXPECT_FALSE(error_);

  // A group that exists without channels is an empty dictionary; one that does not, nothing.
  auto empty = channels("Empty", std::nullopt);
  ASSERT_TRUE(empty);
  EXPECT_EQ(kestrel_->getChannelCount(*empty), 0);
  EXPECT_EQ(channels("Missing", std::nullopt), std::nullopt);
  EXPECT_EQ(channels(std::nullopt, "Missing"), std::nullopt);
  EXPECT_EQ(channels("Linked", "MCA"), std::nullopt);
  EXPECT_EQ(channels("Codec", "Linked"), std::nullopt);
  EXPECT_FALSE(error_);

  // Nor read when subscribed by name: skipped like an unreadable counter.
  SXValue wanted = {{"Speaker/-/leak", SXValue::object()},
                    {"Linked/MCA/x", SXValue::object()},
                    {"Codec/Linked/x", SXValue::object()},
                    {"Speaker/-/temp", SXValue::object()}};
  subscription_ = kestrel_->createSubscription(wanted, subscribed_);
  EXPECT_EQ(counters(resample()), (std::map<std::string, int64_t>{{"temp", 40}}));
  EXPECT_TRUE(log_->contains("cannot read kestrel channel: " +
                             (root_ / "Speaker" / "-" / "leak").string()));

  // The root itself may be a symlink: it is configuration.
  fs::create_directory_symlink(root_, dir_ / "root-link");
  SXFileKestrel linkedRoot((dir_ / "root-link").string(), log_);
  EXPECT_EQ(linkedRoot.getChannelCount(
                linkedRoot.copyChannelsInGroup("Haptics", std::nullopt, 0, error_).value_or(0)),
            2);

  for (const char* bad : {"..", "a/b", "-", ""}) {
    EXPECT_EQ(channels(bad, std::nullopt), std::nullopt) << bad;
    ASSERT_TRUE(error_) << bad;
    EXPECT_EQ(error_->code, EINVAL);
  }
}

TEST_F(FileKestrelTest, SamplingReadsFilesAnewAndSkipsBadCounters) {
  publishTree();
  publish("Speaker/-/garbage", "12abc");
  publish("Speaker/-/empty", "");
  publish("Speaker/-/gone", "5");
  publish("Speaker/-/huge", "99999999999999999999");
  SXValue first = sample("Speaker", std::nullopt);
  EXPECT_EQ(counters(first),
            (std::map<std::string, int64_t>{{"<none>", 2}, {"gone", 5}, {"temp", 40}}));
  EXPECT_EQ(first["Speaker/-/temp"]["value"], 40);
  for (const char* bad : {"garbage", "empty", "huge"}) {
    std::string path = (root_ / "Speaker" / "-" / bad).string();
    EXPECT_EQ(log_->count("kestrel channel " + path + " does not hold a decimal integer"), 1u)
        << bad;
  }

  publish("Speaker/-/temp", "45");
  publish("Speaker/-/garbage", "-3");
  fs::remove(root_ / "Speaker" / "-" / "gone");
  // A FIFO where a counter was must neither block sampling nor count.
  fs::remove(root_ / "Speaker" / "-" / "empty");
  ASSERT_EQ(::mkfifo((root_ / "Speaker" / "-" / "empty").c_str(), 0600), 0);
  size_t errorsBefore = log_->lines().size();
  SXValue second = resample();
  EXPECT_EQ(counters(second),
            (std::map<std::string, int64_t>{{"<none>", 2}, {"garbage", -3}, {"temp", 45}}));
  EXPECT_EQ(log_->lines().size(), errorsBefore + 2);  // "empty" and "huge" again, "gone" quiet
  EXPECT_TRUE(log_->contains("Speaker/-/empty is not a regular file"));

  std::optional<KestrelError> error;
  auto delta = kestrel_->createSamplesDelta(&first, second, error);
  EXPECT_FALSE(error);
  ASSERT_TRUE(delta);
  EXPECT_EQ(counters(*delta), (std::map<std::string, int64_t>{{"<none>", 0}, {"temp", 5}}));
}

TEST_F(FileKestrelTest, BadArgumentsSetAnError) {
  publishTree();
  std::optional<KestrelError> error;
  EXPECT_EQ(kestrel_->createSamples(nullptr, SXValue::object(), error), std::nullopt);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, EINVAL);

  SXValue samples = sample("Haptics", "Stats");
  SXValue notSamples = "text";
  for (const SXValue* previous : {static_cast<SXValue*>(nullptr), &notSamples}) {
    error.reset();
    EXPECT_EQ(kestrel_->createSamplesDelta(previous, samples, error), std::nullopt);
    EXPECT_TRUE(error);
  }

  // Subscribed channels that point outside the tree are never read.
  SXValue escaping = {{"../../etc/passwd", SXValue::object()}, {"a/b", SXValue::object()}};
  SXValue subscribed;
  auto handle = kestrel_->createSubscription(escaping, subscribed);
  EXPECT_EQ(subscribed, SXValue::object());
  error.reset();
  EXPECT_EQ(kestrel_->createSamples(handle.get(), escaping, error), SXValue::object());
  EXPECT_EQ(kestrel_->createSubscription("not channels", subscribed), nullptr);

  int calls = 0;
  kestrel_->iterate(samples, [&](const KestrelChannelSample&) { return ++calls; });
  kestrel_->iterate(SXValue(42), [&](const KestrelChannelSample&) { return ++calls; });
  EXPECT_EQ(calls, 1);
}

}  // namespace
