// One thread of its own on which an adapter runs its callers' completions, in the order they
// were posted, so that no completion runs on the caller's thread or under the caller's lock.
//
// post() may be called from any thread, completions included. A completion that throws is
// caught; the error goes to the default log of `log`.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <thread>

#include "platform/Log.h"

class SXCompletionThread {
 public:
  SXCompletionThread(std::string name, std::shared_ptr<SXLogFacility> log);
  // Runs what is already posted, then joins. When it is the thread itself that destroys its
  // owner (a completion held the last reference), the thread finishes that work on its own.
  ~SXCompletionThread();
  SXCompletionThread(const SXCompletionThread&) = delete;
  SXCompletionThread& operator=(const SXCompletionThread&) = delete;

  void post(std::function<void()> task);

 private:
  struct State;
  std::shared_ptr<State> state_;  // shared with the thread
  std::thread thread_;
};
