// Linked into every test above the platform: the process's media engine is
// the in-process one from the start, as in an app; tests of the worker
// client install that one themselves.
#include "QuorvelMedia/RCInProcessMediaEngine.h"

namespace {

const bool installed = [] {
  quorvel::RCUseInProcessMediaEngine();
  return true;
}();

}  // namespace
