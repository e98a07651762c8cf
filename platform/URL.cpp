#include "platform/URL.h"

#include <unistd.h>

#include <cctype>
#include <cerrno>

#include <ostream>
#include <vector>

namespace platform {
namespace {

constexpr std::string_view kScheme = "file://";

bool isAllowedInPath(unsigned char c) {
  if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9')) return true;
  switch (c) {
    case '-':
    case '.':
    case '_':
    case '~':  // unreserved
    case '!':
    case '$':
    case '&':
    case '\'':
    case '(':
    case ')':  // sub-delims
    case '*':
    case '+':
    case ',':
    case ';':
    case '=':
    case ':':
    case '@':
    case '/':
      return true;
    default:
      return false;
  }
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

std::string currentDirectory() {
  std::vector<char> buffer(4096);
  while (getcwd(buffer.data(), buffer.size()) == nullptr) {
    if (errno != ERANGE) return "/";
    buffer.resize(buffer.size() * 2);
  }
  return buffer.data();
}

bool startsWithCaseInsensitive(std::string_view text, std::string_view prefix) {
  if (text.size() < prefix.size()) return false;
  for (std::size_t i = 0; i < prefix.size(); ++i) {
    if (std::tolower(static_cast<unsigned char>(text[i])) != prefix[i]) return false;
  }
  return true;
}

}  // namespace

std::string percentEncodePath(std::string_view path) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(path.size());
  for (unsigned char c : path) {
    if (isAllowedInPath(c)) {
      out.push_back(static_cast<char>(c));
    } else {
      out.push_back('%');
      out.push_back(kHex[c >> 4]);
      out.push_back(kHex[c & 0xF]);
    }
  }
  return out;
}

std::optional<std::string> percentDecode(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\0') return std::nullopt;
    if (text[i] != '%') {
      out.push_back(text[i]);
      continue;
    }
    if (i + 2 >= text.size()) return std::nullopt;
    int high = hexValue(text[i + 1]);
    int low = hexValue(text[i + 2]);
    if (high < 0 || low < 0) return std::nullopt;
    char decoded = static_cast<char>(high * 16 + low);
    if (decoded == '\0') return std::nullopt;
    out.push_back(decoded);
    i += 2;
  }
  return out;
}

URL::URL(std::string path, bool directory) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  // (push_back: GCC 12 at -O3 takes assigning "/" for an overlapping copy.)
  if (path.empty()) path.push_back('/');
  std::string absolute = std::string(kScheme) + percentEncodePath(path);
  if (directory && path != "/") absolute += '/';
  storage_ = std::make_shared<const Storage>(Storage{std::move(path), std::move(absolute)});
}

URL URL::fileURLWithPath(std::string_view path) {
  std::string absolute;
  if (path.empty() || path.front() != '/') {
    absolute = currentDirectory();
    if (absolute.back() != '/') absolute += '/';
  }
  absolute += path;
  bool directory = !path.empty() && path.back() == '/';
  return URL(std::move(absolute), directory);
}

std::optional<URL> URL::fileURLFromString(std::string_view text) {
  if (!startsWithCaseInsensitive(text, kScheme)) return std::nullopt;
  std::string_view rest = text.substr(kScheme.size());
  std::size_t slash = rest.find('/');
  if (slash == std::string_view::npos) return std::nullopt;
  std::string_view host = rest.substr(0, slash);
  if (!host.empty() && !startsWithCaseInsensitive(host, "localhost")) return std::nullopt;
  if (!host.empty() && host.size() != 9) return std::nullopt;
  std::string_view encoded = rest.substr(slash);
  if (encoded.find_first_of("?#") != std::string_view::npos) return std::nullopt;
  auto decoded = percentDecode(encoded);
  if (!decoded) return std::nullopt;
  bool directory = decoded->size() > 1 && decoded->back() == '/';
  return URL(std::move(*decoded), directory);
}

std::optional<URL> URL::fromFileURLStringOrPath(std::string_view text) {
  if (!text.empty() && text.front() == '/') {
    if (text.find('\0') != std::string_view::npos) return std::nullopt;
    return fileURLWithPath(text);
  }
  return fileURLFromString(text);
}

bool URL::hasDirectoryPath() const { return absoluteString().back() == '/'; }

std::string URL::lastPathComponent() const {
  if (path() == "/") return "/";
  return path().substr(path().rfind('/') + 1);
}

std::string URL::pathExtension() const {
  std::string last = lastPathComponent();
  std::size_t dot = last.rfind('.');
  if (dot == std::string::npos || dot == 0 || dot + 1 == last.size()) return {};
  return last.substr(dot + 1);
}

URL URL::URLByAppendingPathComponent(std::string_view component) const {
  std::string path = this->path();
  if (path.back() != '/') path += '/';
  while (!component.empty() && component.front() == '/') component.remove_prefix(1);
  path += component;
  return URL(std::move(path), !component.empty() && component.back() == '/');
}

URL URL::URLByDeletingLastPathComponent() const {
  if (path() == "/") return *this;
  std::size_t slash = path().rfind('/');
  return URL(slash == 0 ? std::string("/") : path().substr(0, slash), true);
}

URL URL::URLByAppendingPathExtension(std::string_view extension) const {
  if (extension.empty() || path() == "/") return *this;
  return URL(path() + "." + std::string(extension), hasDirectoryPath());
}

URL URL::URLByDeletingPathExtension() const {
  std::string extension = pathExtension();
  if (extension.empty()) return *this;
  return URL(path().substr(0, path().size() - extension.size() - 1), hasDirectoryPath());
}

URL URL::URLByReplacingPathExtension(std::string_view extension) const {
  return URLByDeletingPathExtension().URLByAppendingPathExtension(extension);
}

URL URL::URLByStandardizingPath() const {
  std::vector<std::string_view> segments;
  std::string_view rest = path();
  while (!rest.empty()) {
    std::size_t slash = rest.find('/');
    std::string_view segment = rest.substr(0, slash);
    rest = slash == std::string_view::npos ? std::string_view() : rest.substr(slash + 1);
    if (segment.empty() || segment == ".") continue;
    if (segment == "..") {
      if (!segments.empty()) segments.pop_back();
      continue;
    }
    segments.push_back(segment);
  }
  std::string path;
  for (std::string_view segment : segments) {
    path += '/';
    path += segment;
  }
  return URL(path.empty() ? std::string("/") : std::move(path), hasDirectoryPath());
}

std::ostream& operator<<(std::ostream& out, const URL& url) { return out << url.absoluteString(); }

}  // namespace platform
