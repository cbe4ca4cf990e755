// The service manager's notification channel (systemd's NOTIFY_SOCKET): readiness, reload and
// stop notices, a status line and watchdog keep-alives. Without a service manager
// (NOTIFY_SOCKET unset) every call does nothing, so the daemon runs the same by hand.
//
// Any thread may call any method; nothing throws and failures are ignored, since the daemon
// serves its clients whether or not the manager hears it.
#pragma once

#include <chrono>
#include <optional>
#include <string_view>

class SXServiceManager {
 public:
  // READY=1: the socket listens and the stores are open; also ends a reload.
  void ready(std::string_view status);
  // RELOADING=1 with MONOTONIC_USEC, at the start of a configuration reload.
  void reloading();
  // STOPPING=1: the stop drain has begun.
  void stopping(std::string_view status);
  void status(std::string_view status);
  // WATCHDOG=1: the daemon has proved itself alive.
  void watchdogAlive();

  // How often to send watchdogAlive(): half the interval the manager asked this process for
  // (WATCHDOG_USEC), or nothing when it asked for none.
  static std::optional<std::chrono::microseconds> keepAliveInterval();

 private:
  void notify(std::string_view state);
};
