// MD5 of a large file: our digest against md5sum, measured in the same run,
// both with a warm page cache, best of three each. Prints the throughput
// ratio (ours / md5sum); the target is at least 0.95.
//
//   md5_bench [FILE]   (without FILE: a 1 GiB file of random bytes in /tmp)
#include <fmt/format.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <random>
#include <string>
#include <vector>

#include "Quorvel/files/RCMD5.h"

namespace {

using Clock = std::chrono::steady_clock;

double seconds(Clock::duration d) { return std::chrono::duration<double>(d).count(); }

std::string runMd5sum(const std::string& path) {
  FILE* pipe = ::popen(("md5sum '" + path + "'").c_str(), "r");
  char buffer[33] = {};
  const std::size_t got = std::fread(buffer, 1, 32, pipe);
  ::pclose(pipe);
  return std::string(buffer, got);
}

}  // namespace

int main(int argc, char** argv) {
  std::string path;
  bool made = false;
  if (argc > 1) {
    path = argv[1];
  } else {
    path = fmt::format("/tmp/qv-md5-bench-{}.bin", ::getpid());
    std::ofstream out(path, std::ios::binary);
    std::mt19937_64 random(42);
    std::vector<std::uint64_t> block(1 << 17);  // 1 MiB
    for (int i = 0; i < 1024; ++i) {
      for (auto& word : block) word = random();
      out.write(reinterpret_cast<const char*>(block.data()), std::streamsize(block.size() * 8));
    }
    made = true;
  }
  const double megabytes = double(std::filesystem::file_size(path)) / (1 << 20);

  // Warm the cache for both.
  (void)quorvel::RCMD5DataForPath(path);
  const std::string reference = runMd5sum(path);

  double best = 1e9, bestReference = 1e9;
  std::string ours;
  for (int round = 0; round < 3; ++round) {
    auto start = Clock::now();
    auto digest = quorvel::RCMD5DataForPath(path);
    best = std::min(best, seconds(Clock::now() - start));
    ours = digest ? quorvel::RCMD5HexString(*digest) : "none";

    start = Clock::now();
    (void)runMd5sum(path);
    bestReference = std::min(bestReference, seconds(Clock::now() - start));
  }
  if (made) std::filesystem::remove(path);

  fmt::print("file: {:.0f} MiB\n", megabytes);
  fmt::print("quorvel MD5: {:.3f} s  {:.0f} MiB/s  {}\n", best, megabytes / best, ours);
  fmt::print("md5sum:      {:.3f} s  {:.0f} MiB/s  {}\n", bestReference, megabytes / bestReference,
             reference);
  fmt::print("throughput ratio (ours / md5sum): {:.3f} (target >= 0.95)\n", bestReference / best);
  return ours == reference ? 0 : 1;
}
