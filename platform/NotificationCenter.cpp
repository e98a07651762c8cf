// A post copies the matching entries under the mutex and calls them outside
// it, so observers may use the center freely; each entry carries a removed
// flag checked right before its call, so a removal made earlier in the same
// post (or before it) is honoured.
#include "platform/NotificationCenter.h"

#include <algorithm>
#include <atomic>

namespace platform {

struct NotificationCenter::Entry {
  ObserverToken token;
  std::string name;
  Observer observer;
  std::atomic<bool> removed{false};
};

NotificationCenter& NotificationCenter::defaultCenter() {
  static NotificationCenter* center = new NotificationCenter();
  return *center;
}

NotificationCenter::NotificationCenter() = default;
NotificationCenter::~NotificationCenter() = default;

NotificationCenter::ObserverToken NotificationCenter::addObserver(std::string name,
                                                                  Observer observer) {
  auto entry = std::make_shared<Entry>();
  entry->name = std::move(name);
  entry->observer = std::move(observer);
  std::lock_guard lock(mutex_);
  entry->token = nextToken_++;
  entries_.push_back(entry);
  return entry->token;
}

void NotificationCenter::removeObserver(ObserverToken token) {
  std::lock_guard lock(mutex_);
  auto it = std::find_if(entries_.begin(), entries_.end(),
                         [&](const auto& entry) { return entry->token == token; });
  if (it == entries_.end()) return;
  (*it)->removed = true;
  entries_.erase(it);
}

void NotificationCenter::postNotificationName(std::string name, std::any object,
                                              std::map<std::string, std::any> userInfo) {
  std::vector<std::shared_ptr<Entry>> matching;
  {
    std::lock_guard lock(mutex_);
    for (const auto& entry : entries_) {
      if (entry->name.empty() || entry->name == name) matching.push_back(entry);
    }
  }
  if (matching.empty()) return;
  const Notification notification{std::move(name), std::move(object), std::move(userInfo)};
  for (const auto& entry : matching) {
    if (!entry->removed) entry->observer(notification);
  }
}

}  // namespace platform
