// The saved-recordings directory: where the recordings database, the
// composed audio files and the composition bundles live. Everything that
// must stay inside it (the confined removal, the model, compositions) asks
// this one unit where it is.
//
// Plain functions over one process-wide setting; safe to call from any
// thread.
#pragma once

#include <optional>
#include <string>

namespace quorvel {

// The directory as an absolute, standardized path: the one set with
// RCSetSavedRecordingsDirectory, else $QUORVEL_RECORDINGS_DIR, else
// ${XDG_DATA_HOME:-~/.local/share}/quorvel/Recordings. Created (mode 0700)
// when missing.
std::string RCSavedRecordingsDirectory();

// Sets the directory (the daemon's --recordings-dir, tests); nullopt goes
// back to the environment's choice.
void RCSetSavedRecordingsDirectory(std::optional<std::string> directory);

}  // namespace quorvel
