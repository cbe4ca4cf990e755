// The service delegate over a TestEnvironment, driven through fake connections with the
// queues run by hand.
#pragma once

#include <memory>
#include <string_view>

#include "Service/SXReportingServiceDelegate.h"
#include "fakes/FakeIpc.h"
#include "support/TestEnvironment.h"

struct FakeService {
  explicit FakeService(SXReportingLimits limits = {})
      : environment(t.makeEnvironment(limits)),
        delegate(SXReportingServiceDelegate::init(environment)) {}
  ~FakeService() { t.drain(); }

  // A connection the delegate accepted, its registration run.
  std::shared_ptr<FakeIpcConnection> connect(int32_t pid) {
    auto connection = std::make_shared<FakeIpcConnection>(pid);
    EXPECT_TRUE(delegate->shouldAcceptNewConnection(connection)) << pid;
    t.drain();
    return connection;
  }
  // The result of the request's reply, or "no reply" when none came once the queues ran.
  SXValue call(FakeIpcConnection& c, std::string_view method, SXValue params) {
    size_t before = c.responses().size();
    c.request(method, std::move(params));
    t.drain();
    auto all = c.responses();
    return all.size() > before ? all.back().result : SXValue("no reply");
  }
  SXValue status() {
    SXValue out;
    environment->serverQueue()->async([&] { out = delegate->statusSnapshot(); });
    t.drain();
    return out;
  }
  uint64_t dropped(const char* guardrail) {
    return status()["counters"]["guardrail_dropped"][guardrail].get<uint64_t>();
  }

  TestEnvironment t;
  std::shared_ptr<SXReportingEnvironment> environment;
  std::shared_ptr<SXReportingServiceDelegate> delegate;
};
