#include "linux/JsonPreferences.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "fakes/FakeLog.h"
#include "support/SqliteTestSupport.h"

namespace fs = std::filesystem;

namespace {

constexpr const char* kDomain = "com.vendra.sonex";

class JsonPreferencesTest : public ::testing::Test {
 protected:
  std::unique_ptr<SXJsonPreferences> open() {
    return std::make_unique<SXJsonPreferences>(configDir_ + "/preferences", log_);
  }
  std::string domainFile(const std::string& domain = kDomain) const {
    return configDir_ + "/preferences/" + domain + ".json";
  }
  void writeFile(const std::string& path, const std::string& text) {
    fs::create_directories(fs::path(path).parent_path());
    std::ofstream(path) << text;
  }
  size_t errorLines() const {
    size_t n = 0;
    for (const auto& line : log_->lines()) n += line.level == SXLogLevel::kError;
    return n;
  }

  SXTestTempDir temporary_;
  const std::string root_ = temporary_.path();
  const std::string configDir_ = root_ + "/config";  // absent until the first write
  std::shared_ptr<FakeLog> log_ = std::make_shared<FakeLog>();
};

TEST(PreferencesValueTest, ReadsAsString) {
  EXPECT_EQ(SXPreferencesValueAsString("iPod"), "iPod");
  EXPECT_EQ(SXPreferencesValueAsString(-42), "-42");
  EXPECT_EQ(SXPreferencesValueAsString(18446744073709551615u), "18446744073709551615");
  EXPECT_EQ(SXPreferencesValueAsString(0.1), "0.1");
  // Only text and numbers name something; a switch or a structure does not.
  EXPECT_EQ(SXPreferencesValueAsString(true), std::nullopt);
  EXPECT_EQ(SXPreferencesValueAsString(nullptr), std::nullopt);
  EXPECT_EQ(SXPreferencesValueAsString(SXValue::object()), std::nullopt);
}

TEST(PreferencesValueTest, ReadsAsBool) {
  for (SXValue yes :
       {SXValue(true), SXValue(1), SXValue(-1), SXValue(7u), SXValue(0.5), SXValue("YES"),
        SXValue("yes"), SXValue("True"), SXValue("TRUE"), SXValue("1")}) {
    EXPECT_TRUE(SXPreferencesValueAsBool(yes)) << yes.dump();
  }
  for (SXValue no :
       {SXValue(false), SXValue(0), SXValue(0u), SXValue(0.0), SXValue("NO"), SXValue("false"),
        SXValue("0"), SXValue("Y"), SXValue(" YES"), SXValue("yess"), SXValue("2"), SXValue(""),
        SXValue(nullptr), SXValue::array({true}), SXValue::object({{"a", true}})}) {
    EXPECT_FALSE(SXPreferencesValueAsBool(no)) << no.dump();
  }
  EXPECT_FALSE(SXPreferencesValueAsBool(std::string("YES\0", 4)));
}

TEST_F(JsonPreferencesTest, MalformedFileReadsEmptyWithOneErrorPerRead) {
  auto prefs = open();
  for (const char* text : {"not json", "[1, 2]", "\"text\"", "", "{\"a\": 1"}) {
    writeFile(domainFile(), text);
    size_t before = errorLines();
    EXPECT_EQ(prefs->copyDomain(kDomain), SXValue::object()) << text;
    EXPECT_EQ(errorLines(), before + 1) << text;
    EXPECT_EQ(prefs->copyValue(kDomain, "a"), std::nullopt) << text;
    EXPECT_EQ(errorLines(), before + 2) << text;
  }

  // A write leaves the broken file as it is (it may be an administrator's typo); once the file
  // is gone, writes work again.
  EXPECT_FALSE(prefs->setValue(kDomain, "a", SXValue(2)).ok());
  EXPECT_EQ(SXTestReadFile(domainFile()), "{\"a\": 1");
  fs::remove(domainFile());
  ASSERT_TRUE(prefs->setValue(kDomain, "a", SXValue(2)).ok());
  size_t before = errorLines();
  EXPECT_EQ(prefs->copyDomain(kDomain), SXValue({{"a", 2}}));
  EXPECT_EQ(errorLines(), before);
}

TEST_F(JsonPreferencesTest, RefusesDomainsThatAreNotFileNames) {
  auto prefs = open();
  writeFile(configDir_ + "/secret.json", R"({"a": 1})");
  for (std::string domain :
       {std::string(""), std::string("."), std::string(".."), std::string("../secret"),
        std::string("a/b"), std::string("/etc"), std::string("a\0b", 3)}) {
    EXPECT_FALSE(prefs->setValue(domain, "a", SXValue(2)).ok()) << domain;
    EXPECT_EQ(prefs->copyValue(domain, "a"), std::nullopt) << domain;
    EXPECT_EQ(prefs->copyDomain(domain), SXValue::object()) << domain;
  }
  EXPECT_EQ(SXValue::parse(std::ifstream(configDir_ + "/secret.json")), SXValue({{"a", 1}}));
  EXPECT_FALSE(fs::exists(configDir_ + "/preferences/a"));
}

TEST_F(JsonPreferencesTest, WritesReplaceOneKeyOrLeaveTheFileAsItWas) {
  auto prefs = open();
  ASSERT_TRUE(prefs->setValue(kDomain, "a", SXValue(1)).ok());
  ASSERT_TRUE(prefs->setValue(kDomain, "b", SXValue::object({{"nested", {1, 2}}})).ok());
  EXPECT_FALSE(prefs->setValue(kDomain, "b", SXValue("\xff\xfe")).ok());
  EXPECT_FALSE(prefs->setValue(kDomain, "b", SXValue(SXValue::value_t::discarded)).ok());
  ASSERT_TRUE(prefs->setValue(kDomain, "a", SXValue("one")).ok());
  EXPECT_EQ(prefs->copyDomain(kDomain), SXValue({{"a", "one"}, {"b", {{"nested", {1, 2}}}}}));
  for (const auto& entry : fs::directory_iterator(configDir_ + "/preferences")) {
    std::string name = entry.path().filename();
    EXPECT_TRUE(name == std::string(kDomain) + ".json" ||
                name == std::string(kDomain) + ".json.lock")
        << name;
  }

  // An unwritable place for the store is an error, not a crash.
  writeFile(root_ + "/file", "");
  SXJsonPreferences blocked(root_ + "/file/preferences", log_);
  EXPECT_FALSE(blocked.setValue(kDomain, "a", SXValue(1)).ok());
}

TEST_F(JsonPreferencesTest, ConcurrentWritersKeepEachOthersKeys) {
  constexpr int kKeys = 40;
  std::vector<pid_t> children;
  for (const char* prefix : {"p", "q"}) {
    pid_t pid = ::fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      SXJsonPreferences child(configDir_ + "/preferences", std::make_shared<FakeLog>());
      // Each writer adds keys of its own; a writer that read the file before another's rename
      // and wrote after it would drop the other's keys.
      for (int i = 0; i < kKeys; ++i) {
        if (!child.setValue(kDomain, prefix + std::to_string(i), SXValue(i)).ok()) ::_exit(1);
      }
      ::_exit(0);
    }
    children.push_back(pid);
  }
  for (pid_t pid : children) {
    int status = 0;
    ASSERT_EQ(::waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  SXValue domain = open()->copyDomain(kDomain);
  EXPECT_EQ(domain.size(), size_t(2 * kKeys));
  for (const char* prefix : {"p", "q"}) {
    for (int i = 0; i < kKeys; ++i) EXPECT_EQ(domain[prefix + std::to_string(i)], i);
  }
  EXPECT_EQ(errorLines(), 0u);
}

}  // namespace
