// The saved-recordings directory: an explicit setting under a mutex, then the
// environment, resolved on every call so tests and the daemon's option can
// change it before first use.
#include "Quorvel/files/RCRecordingsDirectory.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <mutex>

#include "platform/Error.h"
#include "platform/Log.h"
#include "platform/URL.h"

namespace quorvel {
namespace {

std::mutex& directoryMutex() {
  static std::mutex mutex;
  return mutex;
}

std::optional<std::string>& directoryOverride() {
  static std::optional<std::string> directory;
  return directory;
}

std::string environment(const char* name) {
  const char* value = std::getenv(name);
  return value ? value : "";
}

std::string homeDirectory() {
  std::string home = environment("HOME");
  if (!home.empty()) return home;
  if (const passwd* entry = ::getpwuid(::getuid())) return entry->pw_dir;
  return "/";
}

std::string standardized(std::string_view path) {
  return platform::URL::fileURLWithPath(path).URLByStandardizingPath().path();
}

void createDirectories(const std::string& path) {
  std::string partial;
  std::size_t at = 0;
  while (at != std::string::npos) {
    std::size_t slash = path.find('/', at + 1);
    partial = path.substr(0, slash);
    at = slash;
    if (partial.empty()) continue;
    if (::mkdir(partial.c_str(), 0700) != 0 && errno != EEXIST) {
      QV_LOG(platform::kLogLevelError, "ERROR: cannot create directory {}: {}", partial,
             platform::posixError(errno, "mkdir").localizedDescription());
      return;
    }
  }
}

}  // namespace

std::string RCSavedRecordingsDirectory() {
  std::string directory;
  {
    std::lock_guard lock(directoryMutex());
    if (directoryOverride()) directory = *directoryOverride();
  }
  if (directory.empty()) directory = environment("QUORVEL_RECORDINGS_DIR");
  if (directory.empty()) {
    std::string dataHome = environment("XDG_DATA_HOME");
    if (dataHome.empty() || dataHome.front() != '/') dataHome = homeDirectory() + "/.local/share";
    directory = dataHome + "/quorvel/Recordings";
  }
  directory = standardized(directory);
  struct stat info {};
  if (::stat(directory.c_str(), &info) != 0) createDirectories(directory);
  return directory;
}

void RCSetSavedRecordingsDirectory(std::optional<std::string> directory) {
  std::lock_guard lock(directoryMutex());
  directoryOverride() = std::move(directory);
}

}  // namespace quorvel
