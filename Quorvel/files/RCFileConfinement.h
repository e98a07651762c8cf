// File confinement: the daemon writes and deletes only inside the recordings
// directory. Every removal goes through RCRemoveItemInSavedRecordingsDirectory,
// which refuses anything outside that directory and never follows a symbolic
// link: not in the path leading to the item, not inside a directory it
// removes (a link is removed as the link itself).
//
// Plain functions without state of their own; safe to call from any thread.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/Error.h"
#include "platform/URL.h"

namespace quorvel {

// The path of `url` relative to `directory`, both compared in standardized
// form ("." and ".." resolved lexically), when `url` lies strictly inside it;
// nullopt otherwise (outside, or the directory itself).
std::optional<std::string> RCPathRelativeToDirectory(const platform::URL& url,
                                                     std::string_view directory);

// Whether `url` names an entry directly inside `directory` (one level deep).
bool RCIsURLDirectlyInsideDirectory(const platform::URL& url, std::string_view directory);

// Whether `name` is a plain file name: not empty, not "." or "..", no '/' and
// no NUL. Names read from manifests must be plain to stay inside their bundle.
bool RCIsPlainFileName(std::string_view name);

// Removes the file, link or directory tree at `url`, which must lie strictly
// inside `directory`. Symbolic links are never followed: a link on the way to
// the item refuses the removal (RCErrorCodeNotConfined), a link inside a tree
// is unlinked itself. A missing item fails with ENOENT (POSIX domain). The
// first failure inside a tree is reported after the rest of it was tried.
platform::Status RCRemoveItemConfinedToDirectory(const platform::URL& url,
                                                 std::string_view directory);

// RCRemoveItemConfinedToDirectory with the saved-recordings directory.
platform::Status RCRemoveItemInSavedRecordingsDirectory(const platform::URL& url);

}  // namespace quorvel
