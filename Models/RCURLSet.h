// RCURLSet: a set of file URLs whose members are compared in standardized
// form ("." and ".." segments and repeated separators resolved), so
// "/r/./a.m4a" and "/r/x/../a.m4a" are one member. The orphan recovery run
// keeps the files it must not touch in one of these.
//
// Members are kept as standardized paths, so a large set (a database of
// tens of thousands of recordings, each in every capture format) costs a
// string per member; paths already in standard form are not rebuilt.
//
// Not thread-safe: one run owns it and uses it from its one thread.
#pragma once

#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_set>
#include <vector>

#include "platform/URL.h"

namespace quorvel {

class RCURLSet {
 public:
  RCURLSet() = default;
  virtual ~RCURLSet() = default;

  // A new set holding each of `urls` (added one by one with addURL); made
  // as a `Set`, so a subclass gets an instance of itself.
  template <typename Set = RCURLSet>
  static std::unique_ptr<Set> setWithURLs(const std::vector<platform::URL>& urls) {
    auto set = std::make_unique<Set>();
    for (const platform::URL& url : urls) set->addURL(url);
    return set;
  }

  // Stores the standardized `url`; adding a member again changes nothing.
  void addURL(const platform::URL& url) { addPath(url.path()); }
  // Whether the standardized `url` is a member; false without a URL.
  bool containsURL(const std::optional<platform::URL>& url) const {
    return url && containsPath(url->path());
  }
  // The same for an absolute path.
  void addPath(std::string_view path);
  bool containsPath(std::string_view path) const;

  // A snapshot of the members in standardized form: later additions do not
  // change it.
  std::set<platform::URL> URLs() const;
  // The members as standardized paths, without copying; invalidated by the
  // next addition.
  const std::unordered_set<std::string>& paths() const { return _set; }
  std::size_t count() const { return _set.size(); }

  // `path` with "." and ".." segments and repeated separators resolved.
  static std::string standardizedPath(std::string_view path);

 private:
  std::unordered_set<std::string> _set;
};

}  // namespace quorvel
