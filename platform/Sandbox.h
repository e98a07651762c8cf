// Sandbox: confines the calling process before it touches untrusted input.
// A process applies it once, early, and can never undo it. It is a free
// function, not an object: nothing is owned after it returns.
//
// Threads: call applySandbox on the thread that will do the confined work,
// before starting any other thread. The system-call filter reaches every
// thread that exists at the time, but the filesystem rules confine only the
// calling thread and the threads it starts afterwards.
//
// What the confined process can no longer do: create sockets (its already
// open descriptors keep working, so a worker talks over a socketpair it was
// handed), connect, bind, listen or accept, run programs, trace or read other
// processes, mount, load kernel modules, use keyrings, BPF, perf events,
// io_uring or userfaultfd, or enter new namespaces. With the kernel's
// filesystem rules in place it reads only its policy's paths and what a
// running process needs (shared libraries, locale, time zone and converter
// data, /proc/self, /dev/null, /dev/urandom, the CPU list), and writes only
// below its policy's write paths. A library that opens a socket lazily (the
// journal's, say) must have opened it before the call.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace platform {

struct SandboxPolicy {
  // Directories (with everything below them) or single files that may be
  // read. Paths that do not exist are left out.
  std::vector<std::string> readPaths;
  // Directories below which files and directories may be created, written,
  // truncated, renamed and removed (and read).
  std::vector<std::string> writePaths;
  // The most address space the process may map; 0 leaves it unlimited.
  std::uint64_t addressSpaceLimitBytes = 0;
};

// Applies, best effort, everything the kernel supports, in this order:
// no_new_privs, the address-space limit, the filesystem rules (with the
// highest rule set version the kernel offers; left out when it has none) and
// the system-call filter, whose refused calls fail with EPERM. Returns one
// line saying what applied, e.g.
// "sandbox: no_new_privs, address space 2048 MiB, landlock ABI 3,
// seccomp (31 calls refused)". Never aborts: what fails is named in the line.
std::string applySandbox(const SandboxPolicy& policy);

// The filesystem rule set version (Landlock ABI) this kernel offers; 0 when
// it has none or it is disabled. Safe on any thread; changes nothing.
int landlockABI();

}  // namespace platform
