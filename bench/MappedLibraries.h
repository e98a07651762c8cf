// How many shared libraries a running process has mapped: the distinct ".so"
// paths in /proc/PID/maps. A process's start-up cost and its memory grow with
// every library the dynamic loader has to map and relocate.
#pragma once

#include <sys/types.h>

#include <fstream>
#include <set>
#include <string>

namespace quorvel::bench {

inline int mappedSharedLibraries(pid_t pid) {
  std::ifstream maps("/proc/" + std::to_string(pid) + "/maps");
  std::set<std::string> libraries;
  std::string line;
  while (std::getline(maps, line)) {
    std::size_t path = line.find('/');
    if (path == std::string::npos) continue;
    std::string file = line.substr(path);
    std::size_t name = file.rfind('/');
    if (file.find(".so", name) != std::string::npos) libraries.insert(file);
  }
  return int(libraries.size());
}

}  // namespace quorvel::bench
