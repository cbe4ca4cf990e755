// The daemon's life once it serves: signals, the watchdog and the stop drain.
//
// Signals are taken by an asio::signal_set on the I/O thread, so nothing runs in an
// asynchronous signal handler.
//   SIGTERM, SIGINT  stop: STOPPING=1; the I/O thread stops accepting and reading
//                    (`stopReading`), then a thread of its own runs `drain`; once it returns,
//                    `finish` ends the I/O loop and exitStatus() is 0. A drain that outlasts
//                    `drainTimeout`, or a second SIGTERM or SIGINT during it, ends the process
//                    at once with status 1 after a line saying what was left (`leftovers`).
//   SIGHUP           RELOADING=1, `reload` on the I/O thread, READY=1.
// While the service manager asks for a watchdog, WATCHDOG=1 goes every half interval, and only
// after a ping has gone through the server queue (`throughServerQueue`) and back to the I/O
// thread, so that a stuck queue or a stuck I/O thread stops the keep-alives.
#pragma once

#include <asio/any_io_executor.hpp>
#include <asio/signal_set.hpp>
#include <asio/steady_timer.hpp>
#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>

#include "linux/ServiceManager.h"
#include "platform/Log.h"

class SXReportingLifecycle {
 public:
  struct Hooks {
    std::function<void()> stopReading;                              // I/O thread
    std::function<std::string()> drain;                             // says what it drained
    std::function<std::string()> leftovers;                         // any thread
    std::function<void()> reload;                                   // I/O thread
    std::function<void(std::function<void()>)> throughServerQueue;  // runs it on that queue
    std::function<void()> finish;                                   // any thread
  };

  SXReportingLifecycle(asio::any_io_executor io, Hooks hooks, SXServiceManager& manager,
                       std::chrono::milliseconds drainTimeout, std::shared_ptr<SXLogFacility> log);
  ~SXReportingLifecycle();  // waits for the drain thread
  SXReportingLifecycle(const SXReportingLifecycle&) = delete;
  SXReportingLifecycle& operator=(const SXReportingLifecycle&) = delete;

  // Takes the signals and starts the watchdog. I/O thread, or before it runs.
  void start();
  // Once the I/O loop has ended: 0 after a complete drain.
  int exitStatus() const { return drained_.load() ? 0 : 1; }

 private:
  void awaitSignal();
  void onSignal(int signal);
  void beginStop(const char* signal);
  [[noreturn]] void cutShort(const std::string& why);
  void keepAlive(std::chrono::microseconds interval);

  const asio::any_io_executor io_;
  const Hooks hooks_;
  SXServiceManager& manager_;
  const std::chrono::milliseconds drainTimeout_;
  const std::shared_ptr<SXLogFacility> log_;
  asio::signal_set signals_;
  asio::steady_timer drainTimer_;     // I/O thread
  asio::steady_timer watchdogTimer_;  // I/O thread
  bool stopping_ = false;             // I/O thread
  std::atomic<bool> drained_{false};
  std::atomic<bool> pingOut_{false};  // a watchdog ping is on its way round
  std::thread drainThread_;
};
