// Children through Subprocess: the descriptor map, how a child ended, and the
// parent-death signal that must follow the process, not the spawning thread.
#include "platform/Subprocess.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <string>
#include <thread>

namespace platform {
namespace {

struct Pipe {
  int read = -1, write = -1;
  Pipe() {
    int fds[2];
    EXPECT_EQ(::pipe2(fds, O_CLOEXEC), 0);
    read = fds[0];
    write = fds[1];
  }
  ~Pipe() {
    closeWrite();
    if (read >= 0) ::close(read);
  }
  void closeWrite() {
    if (write >= 0) ::close(write);
    write = -1;
  }
  std::string readAll() {
    std::string text;
    char buffer[256];
    for (ssize_t n; (n = ::read(read, buffer, sizeof buffer)) > 0;) text.append(buffer, n);
    return text;
  }
};

TEST(SubprocessTest, MapsDescriptorsAndSaysHowTheChildEnded) {
  Pipe out;
  auto child = Subprocess::spawn(
      {.arguments = {"/bin/sh", "-c", "echo mapped >&3; echo closed >&4 || exit 3; exit 5"},
       .descriptors = {{3, out.write}, {0, Subprocess::kDevNull}}});
  ASSERT_TRUE(child) << child.error();
  out.closeWrite();
  EXPECT_EQ(out.readAll(), "mapped\n");
  const int status = child->wait();
  EXPECT_EQ(Subprocess::describeStatus(status), "exited with status 3");  // fd 4 was closed
  EXPECT_EQ(child->wait(), status);

  auto sleeper = Subprocess::spawn({.arguments = {"sleep", "100"}, .searchPath = true});
  ASSERT_TRUE(sleeper);
  EXPECT_FALSE(sleeper->poll());
  sleeper->kill(SIGKILL);
  EXPECT_EQ(Subprocess::describeStatus(sleeper->wait()), "died with SIGKILL");
  EXPECT_EQ(Subprocess::exitCode(sleeper->wait()), 128 + SIGKILL);

  auto missing = Subprocess::spawn({.arguments = {"/no/such/program"}});
  ASSERT_FALSE(missing);
  EXPECT_EQ(missing.error().code(), ENOENT);
}

// A child that asked for SIGKILL when its parent goes is killed when the
// thread that spawned it ends, unless Subprocess spawned it from its own.
TEST(SubprocessTest, AParentDeathSignalFollowsTheProcessNotTheSpawningThread) {
  auto spawnFromAThreadThatEnds = [](bool outlives, Pipe& in, Pipe& out) {
    std::optional<Subprocess> child;
    std::thread([&] {
      auto spawned = Subprocess::spawn(
          {.arguments = {"setpriv", "--pdeathsig", "KILL", "sh", "-c", "echo ready; exec cat"},
           .searchPath = true,
           .descriptors = {{0, in.read}, {1, out.write}},
           .outlivesSpawningThread = outlives});
      ASSERT_TRUE(spawned) << spawned.error();
      child.emplace(std::move(*spawned));
      // The thread ends only once the child has asked for the signal.
      char ready[6];
      ASSERT_EQ(::read(out.read, ready, sizeof ready), 6);
    }).join();
    return child;
  };
  Pipe keptIn, keptOut, lostIn, lostOut;
  auto kept = spawnFromAThreadThatEnds(true, keptIn, keptOut);
  auto lost = spawnFromAThreadThatEnds(false, lostIn, lostOut);
  ASSERT_TRUE(kept && lost);
  EXPECT_EQ(Subprocess::describeStatus(lost->wait()), "died with SIGKILL");
  ASSERT_EQ(::write(keptIn.write, "alive", 5), 5);
  keptIn.closeWrite();
  keptOut.closeWrite();
  EXPECT_EQ(keptOut.readAll(), "alive");
  EXPECT_EQ(Subprocess::describeStatus(kept->wait()), "exited with status 0");
}

}  // namespace
}  // namespace platform
