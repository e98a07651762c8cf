// RCURLSet: a set of file URLs whose members are compared in standardized
// form ("." and ".." segments and repeated separators resolved), so
// "/r/./a.m4a" and "/r/x/../a.m4a" are one member. The orphan recovery run
// keeps the files it must not touch in one of these.
//
// Not thread-safe: one run owns it and uses it from its one thread.
#pragma once

#include <memory>
#include <set>
#include <unordered_set>
#include <vector>

#include "platform/URL.h"

namespace quorvel {

class RCURLSet {
 public:
  RCURLSet() = default;
  virtual ~RCURLSet() = default;

  // A new set holding each of `urls` (added one by one with addURL).
  template <typename Set = RCURLSet>
  static std::unique_ptr<Set> setWithURLs(const std::vector<platform::URL>& urls) {
    auto set = std::make_unique<Set>();
    for (const platform::URL& url : urls) set->addURL(url);
    return set;
  }

  // Stores the standardized `url`; adding a member again changes nothing.
  void addURL(const platform::URL& url);
  // Whether the standardized `url` is a member; false without a URL.
  bool containsURL(const std::optional<platform::URL>& url) const;
  // A snapshot of the members in standardized form: later additions do not
  // change it.
  std::set<platform::URL> URLs() const;
  std::size_t count() const { return _set.size(); }

 private:
  std::unordered_set<platform::URL> _set;
};

}  // namespace quorvel
