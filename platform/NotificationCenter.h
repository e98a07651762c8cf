// NotificationCenter: in-process notifications by name. Observers register a
// callback for a name (or for every name, with an empty one); a post calls
// every matching observer synchronously on the posting thread, in the order
// they were added. The process has one default center; others may be built.
//
// Every member may be called from any thread, and from inside an observer
// (adding or removing observers, posting again). An observer removed while a
// post is running on another thread may still get that post; once
// removeObserver() has returned, later posts never reach it.
#pragma once

#include <any>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace platform {

struct Notification {
  std::string name;
  std::any object;
  std::map<std::string, std::any> userInfo;
};

class NotificationCenter {
 public:
  using Observer = std::function<void(const Notification&)>;
  using ObserverToken = std::uint64_t;

  static NotificationCenter& defaultCenter();

  NotificationCenter();
  ~NotificationCenter();
  NotificationCenter(const NotificationCenter&) = delete;
  NotificationCenter& operator=(const NotificationCenter&) = delete;

  // Calls `observer` for every notification named `name` (every one when
  // `name` is empty) until removed. Tokens are never reused.
  ObserverToken addObserver(std::string name, Observer observer);
  // Unknown or already removed tokens are ignored.
  void removeObserver(ObserverToken token);
  void postNotificationName(std::string name, std::any object = std::any{},
                            std::map<std::string, std::any> userInfo = {});

 private:
  struct Entry;
  mutable std::mutex mutex_;
  std::vector<std::shared_ptr<Entry>> entries_;  // in the order added
  ObserverToken nextToken_ = 1;
};

}  // namespace platform
