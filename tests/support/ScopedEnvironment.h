// ScopedEnvironment: sets and unsets environment variables for a test and
// puts every one it touched back as it was when the object goes. Owned by the
// test; use it before starting threads that read the environment.
#pragma once

#include <stdlib.h>

#include <map>
#include <optional>
#include <string>

namespace quorvel::testing {

class ScopedEnvironment {
 public:
  ScopedEnvironment() = default;
  ScopedEnvironment(std::initializer_list<std::pair<const char*, const char*>> values) {
    for (const auto& [name, value] : values) set(name, value);
  }
  ~ScopedEnvironment() {
    for (const auto& [name, old] : saved_) {
      if (old) {
        ::setenv(name.c_str(), old->c_str(), 1);
      } else {
        ::unsetenv(name.c_str());
      }
    }
  }
  ScopedEnvironment(const ScopedEnvironment&) = delete;
  ScopedEnvironment& operator=(const ScopedEnvironment&) = delete;

  // Sets `name` to `value`; a null value unsets it.
  void set(const std::string& name, const char* value) {
    remember(name);
    if (value) {
      ::setenv(name.c_str(), value, 1);
    } else {
      ::unsetenv(name.c_str());
    }
  }
  void set(const std::string& name, const std::string& value) { set(name, value.c_str()); }
  void unset(const std::string& name) { set(name, nullptr); }

 private:
  void remember(const std::string& name) {
    if (saved_.contains(name)) return;
    const char* old = ::getenv(name.c_str());
    saved_[name] = old ? std::optional<std::string>(old) : std::nullopt;
  }
  std::map<std::string, std::optional<std::string>> saved_;
};

}  // namespace quorvel::testing
