// Production named notifications: one file per name in `<runtime-dir>/notify/`.
//
// Posting a name opens the file of that name for writing and closes it, which every inotify
// watch on the directory sees as IN_CLOSE_WRITE; `touch` and a rename into the directory count
// as posts too. Each adapter instance owns one inotify watch on the directory and one watcher
// thread, which hands each registration of a posted name its token on the registration's
// queue. Several processes may post and watch the same directory. Posts of one name that
// arrive before the watcher reads them may be delivered once. When the directory is removed,
// the watcher recreates and watches it again; posts made in between are lost.
//
// All methods may be called from any thread, handlers included. On failure both methods
// return the errno of the failure: EINVAL for a name that is empty, "." or "..", or holds "/"
// or a NUL byte, or for a missing queue or handler; ENAMETOOLONG for a name too long to be a
// file name; registerDispatch returns the set-up error when inotify could not be set up.
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "common/SXThreadSafety.h"
#include "platform/Log.h"
#include "platform/Notify.h"
#include "platform/Status.h"

class SXInotifyNotifications final : public SXNotifications {
 public:
  SXInotifyNotifications(std::string runtimeDir, std::shared_ptr<SXLogFacility> log);
  // Stops the watcher thread. Deliveries already queued still run; none are queued after.
  ~SXInotifyNotifications() override;
  SXInotifyNotifications(const SXInotifyNotifications&) = delete;
  SXInotifyNotifications& operator=(const SXInotifyNotifications&) = delete;

  int registerDispatch(const std::string& name, int& token, std::shared_ptr<SXWorkQueue> queue,
                       SXNotifyHandler handler) override;
  int post(const std::string& name) override;
  // The same post from a process that watches nothing (the admin tool): no watcher is set up.
  // The failure says "cannot post <name>: <why>".
  static SXStatus postIn(const std::string& runtimeDir, const std::string& name);

  // 0 when `name` can name a file in the notify directory, otherwise EINVAL or ENAMETOOLONG.
  static int checkName(const std::string& name);

 private:
  struct Registration {
    int token;
    std::shared_ptr<SXWorkQueue> queue;
    SXNotifyHandler handler;
  };

  enum class WatchState { kWatching, kRemoved, kBroken };

  int setUp();
  void watch();
  // Reads and delivers every pending event; says whether the directory is still watched.
  WatchState readEvents();
  // Watches the directory again after it was removed, recreating it.
  WatchState rewatch();
  // Queues a delivery for each registration of `names` (all registrations when `everything`).
  void deliver(const std::vector<std::string>& names, bool everything);

  const std::string directory_;               // immutable
  const std::shared_ptr<SXLogFacility> log_;  // immutable
  int inotifyFd_ = -1;                        // owned; set before the watcher starts
  int wakeFd_ = -1;                           // owned eventfd; set before the watcher starts
  int setupError_ = 0;                        // immutable after construction
  std::thread watcher_;

  SXMutex mutex_;
  std::multimap<std::string, Registration> registrations_ SX_GUARDED_BY(mutex_);
};
