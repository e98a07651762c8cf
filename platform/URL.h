// URL: an absolute file URL ("file:///dir/My%20Recording.m4a"). A value type,
// immutable, safe to share across threads. Equality compares the canonical
// absolute string, so "/a/./b" and "/a/b" differ until standardized.
#pragma once

#include <fmt/format.h>

#include <cstddef>
#include <functional>
#include <iosfwd>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

class URL {
 public:
  // The file URL of `path`. A relative path is taken relative to the current
  // working directory. A trailing '/' marks a directory URL.
  static URL fileURLWithPath(std::string_view path);

  // Parses an absolute "file://" URL (empty or "localhost" host, percent-
  // encoded path). Returns nullopt for anything else: other schemes, relative
  // URLs, a query or fragment, bad or NUL escapes.
  static std::optional<URL> fileURLFromString(std::string_view text);

  // What the daemon accepts from clients: a "file://" URL, or an absolute
  // path taken as the file URL of that path. Nullopt for anything else.
  static std::optional<URL> fromFileURLStringOrPath(std::string_view text);

  // The canonical percent-encoded string, "file:///…".
  const std::string& absoluteString() const { return storage_->absolute; }
  // The decoded path, without a trailing '/' (except for "/").
  const std::string& path() const { return storage_->path; }
  bool hasDirectoryPath() const;

  std::string lastPathComponent() const;
  // The extension of the last path component without its dot; "" if none.
  std::string pathExtension() const;

  URL URLByAppendingPathComponent(std::string_view component) const;
  URL URLByDeletingLastPathComponent() const;
  URL URLByAppendingPathExtension(std::string_view extension) const;
  URL URLByDeletingPathExtension() const;
  URL URLByReplacingPathExtension(std::string_view extension) const;
  // Removes "." and ".." segments and repeated slashes; does not touch the
  // file system (symbolic links are not resolved).
  URL URLByStandardizingPath() const;

  friend bool operator==(const URL& a, const URL& b) {
    return a.storage_ == b.storage_ || a.absoluteString() == b.absoluteString();
  }
  friend auto operator<=>(const URL& a, const URL& b) {
    return a.absoluteString() <=> b.absoluteString();
  }

  // Copies share the strings, which never change: a request's URL is copied
  // into every step and table it passes through. Moving copies too, so a
  // moved-from URL is still the same URL and never an empty one.
  URL(const URL&) = default;
  URL& operator=(const URL&) = default;
  URL(URL&& other) noexcept : storage_(other.storage_) {}
  URL& operator=(URL&& other) noexcept {
    storage_ = other.storage_;
    return *this;
  }
  ~URL() = default;

 private:
  struct Storage {
    std::string path;
    std::string absolute;
  };
  URL(std::string path, bool directory);
  std::shared_ptr<const Storage> storage_;
};

// Percent-encodes a decoded path for use in a file URL.
std::string percentEncodePath(std::string_view path);
// Decodes %XX escapes; nullopt for malformed escapes or an encoded NUL.
std::optional<std::string> percentDecode(std::string_view text);

std::ostream& operator<<(std::ostream& out, const URL& url);

}  // namespace platform

template <>
struct std::hash<platform::URL> {
  std::size_t operator()(const platform::URL& url) const noexcept {
    return std::hash<std::string>()(url.absoluteString());
  }
};

template <>
struct fmt::formatter<platform::URL> : fmt::formatter<std::string_view> {
  auto format(const platform::URL& url, fmt::format_context& ctx) const {
    return fmt::formatter<std::string_view>::format(url.absoluteString(), ctx);
  }
};
