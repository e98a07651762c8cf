#include "Models/RCURLSet.h"

namespace quorvel {

void RCURLSet::addURL(const platform::URL& url) { _set.insert(url.URLByStandardizingPath()); }

bool RCURLSet::containsURL(const std::optional<platform::URL>& url) const {
  return url && _set.contains(url->URLByStandardizingPath());
}

std::set<platform::URL> RCURLSet::URLs() const { return {_set.begin(), _set.end()}; }

}  // namespace quorvel
