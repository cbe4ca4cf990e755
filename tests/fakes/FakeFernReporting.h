// The production spool on a temporary directory, except that its sessions' configurations
// complete at once on the caller's thread (so that the backend wait, whose timer a manual
// dispatch runs at once, always finds them), or wait for deliverHeld() while held.
#pragma once

#include <string>
#include <vector>

#include "common/SXThreadSafety.h"
#include "sqlite/SqliteFernReporting.h"
#include "support/SqliteTestSupport.h"

class FakeFernReporting final : public FernReporting {
 public:
  std::shared_ptr<FernSecureHierarchyToken> newHierarchyToken(
      const std::shared_ptr<FernSecureHierarchyToken>& parent) override {
    return real_.newHierarchyToken(parent);
  }
  std::shared_ptr<FernReportingSession> openSession(const SXValue& sessionInfo,
                                                    const SXValue& userInfo,
                                                    const SXValue& frameworksToCheck) override {
    auto session = real_.openSession(sessionInfo, userInfo, frameworksToCheck);
    return session ? std::make_shared<Session>(std::move(session), held_) : nullptr;
  }
  bool sendOneMessage(const SXValue& sessionInfo, const SXValue& userInfo, uint16_t category,
                      uint16_t type, const SXValue& payload,
                      std::optional<FernError>& error) override {
    return real_.sendOneMessage(sessionInfo, userInfo, category, type, payload, error);
  }

  // Configurations started from now on wait for deliverHeld() (`hold`) or complete at once.
  void holdConfigurations(bool hold) {
    SXMutexLock lock(held_->mutex);
    held_->holding = hold;
  }
  // Completes the held configurations, on the caller's thread.
  void deliverHeld() {
    std::vector<FernBackendsCompletion> due;
    {
      SXMutexLock lock(held_->mutex);
      due.swap(held_->completions);
    }
    for (auto& completion : due) completion(std::vector<std::string>{"spool"});
  }

  // The number of rows of `from` ("messages WHERE session_id IS NULL"), read from the spool.
  int64_t count(const std::string& from) const {
    auto rows = SXTestQuery(path_, "SELECT COUNT(*) AS n FROM " + from);
    return rows.empty() ? -1 : rows[0]["n"].get<int64_t>();
  }
  // The payloads of the messages `where` selects, in the order they were stored.
  std::vector<SXValue> payloads(const std::string& where = "1") const {
    std::vector<SXValue> out;
    for (const auto& row : SXTestQuery(
             path_, "SELECT payload_json AS p FROM messages WHERE " + where + " ORDER BY id")) {
      out.push_back(SXValue::parse(row["p"].get<std::string>()));
    }
    return out;
  }
  std::vector<SXValue> rows(const std::string& sql) const { return SXTestQuery(path_, sql); }

 private:
  struct Held {
    SXMutex mutex;
    bool holding SX_GUARDED_BY(mutex) = false;
    std::vector<FernBackendsCompletion> completions SX_GUARDED_BY(mutex);
  };
  class Session final : public FernReportingSession {
   public:
    Session(std::shared_ptr<FernReportingSession> real, std::shared_ptr<Held> held)
        : real_(std::move(real)), held_(std::move(held)) {}
    std::string description() const override { return real_->description(); }
    void startConfiguration(FernBackendsCompletion completion) override {
      {
        SXMutexLock lock(held_->mutex);
        if (held_->holding) return held_->completions.push_back(std::move(completion));
      }
      completion(std::vector<std::string>{"spool"});
    }
    bool sendMessage(uint16_t category, uint16_t type, const SXValue& payload,
                     std::optional<FernError>& error) override {
      return real_->sendMessage(category, type, payload, error);
    }
    std::vector<FernSendOutcome> sendMessages(const std::vector<FernMessage>& messages) override {
      return real_->sendMessages(messages);
    }
    void flushMessages(FernFlushCompletion completion) override {
      real_->flushMessages(std::move(completion));
    }

   private:
    const std::shared_ptr<FernReportingSession> real_;
    const std::shared_ptr<Held> held_;
  };

  const SXTestTempDir dir_;
  const std::string path_ = dir_.file("fernreporting.db");
  SXSqliteFernReporting real_{path_, dir_.file("backends.json"), nullptr};
  const std::shared_ptr<Held> held_ = std::make_shared<Held>();
};
