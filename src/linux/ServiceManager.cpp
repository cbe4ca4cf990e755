#include "linux/ServiceManager.h"

#include <systemd/sd-daemon.h>
#include <time.h>

#include <cstdint>
#include <string>

void SXServiceManager::notify(std::string_view state) { sd_notify(0, std::string(state).c_str()); }

void SXServiceManager::ready(std::string_view status) {
  notify("READY=1\nSTATUS=" + std::string(status));
}

void SXServiceManager::reloading() {
  timespec now{};
  ::clock_gettime(CLOCK_MONOTONIC, &now);
  auto usec = static_cast<unsigned long long>(now.tv_sec) * 1'000'000ULL +
              static_cast<unsigned long long>(now.tv_nsec / 1000);
  notify("RELOADING=1\nSTATUS=reloading the configuration\nMONOTONIC_USEC=" + std::to_string(usec));
}

void SXServiceManager::stopping(std::string_view status) {
  notify("STOPPING=1\nSTATUS=" + std::string(status));
}

void SXServiceManager::status(std::string_view status) { notify("STATUS=" + std::string(status)); }

void SXServiceManager::watchdogAlive() { notify("WATCHDOG=1"); }

std::optional<std::chrono::microseconds> SXServiceManager::keepAliveInterval() {
  uint64_t usec = 0;
  if (sd_watchdog_enabled(0, &usec) <= 0 || usec == 0) return std::nullopt;
  return std::chrono::microseconds(usec / 2);
}
