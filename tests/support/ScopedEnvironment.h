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
    for (const auto& [name, old] : saved_) put(name, old ? old->c_str() : nullptr);
  }
  ScopedEnvironment(const ScopedEnvironment&) = delete;
  ScopedEnvironment& operator=(const ScopedEnvironment&) = delete;

  // Sets `name` to `value`; a null value unsets it.
  void set(const std::string& name, const char* value) {
    if (!saved_.contains(name)) {
      const char* old = ::getenv(name.c_str());
      saved_[name] = old ? std::optional<std::string>(old) : std::nullopt;
    }
    put(name, value);
  }
  void set(const std::string& name, const std::string& value) { set(name, value.c_str()); }
  void unset(const std::string& name) { set(name, nullptr); }

 private:
  static void put(const std::string& name, const char* value) {
    if (value)
      ::setenv(name.c_str(), value, 1);
    else
      ::unsetenv(name.c_str());
  }
  std::map<std::string, std::optional<std::string>> saved_;
};

}  // namespace quorvel::testing
