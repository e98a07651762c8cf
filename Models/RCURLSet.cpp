#include "Models/RCURLSet.h"

namespace quorvel {
namespace {

// Absolute, no empty, "." or ".." segment, no trailing separator.
bool isStandard(std::string_view path) {
  if (path.empty() || path.front() != '/') return false;
  if (path.size() == 1) return true;
  if (path.back() == '/') return false;
  std::size_t start = 1;
  while (start <= path.size()) {
    std::size_t end = path.find('/', start);
    if (end == std::string_view::npos) end = path.size();
    std::string_view segment = path.substr(start, end - start);
    if (segment.empty() || segment == "." || segment == "..") return false;
    start = end + 1;
  }
  return true;
}

}  // namespace

std::string RCURLSet::standardizedPath(std::string_view path) {
  if (isStandard(path)) return std::string(path);
  return platform::URL::fileURLWithPath(path).URLByStandardizingPath().path();
}

void RCURLSet::addPath(std::string_view path) {
  if (isStandard(path)) {
    _set.emplace(path);
  } else {
    _set.insert(standardizedPath(path));
  }
}

bool RCURLSet::containsPath(std::string_view path) const {
  return _set.contains(isStandard(path) ? std::string(path) : standardizedPath(path));
}

std::set<platform::URL> RCURLSet::URLs() const {
  std::set<platform::URL> urls;
  for (const std::string& path : _set) urls.insert(platform::URL::fileURLWithPath(path));
  return urls;
}

}  // namespace quorvel
