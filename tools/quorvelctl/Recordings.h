// quorvelctl's recording management: making a recording from audio files,
// listing the database's recordings, and showing a composition's state. These
// work on the recordings directory directly, as any recorder app does, and
// need no daemon.
//
// Each returns the process exit status (0, or 1 with a message on stderr).
// Called from main() only.
#pragma once

#include <string>
#include <vector>

namespace quorvelctl {

// `quorvelctl new TITLE FILE...`: a new recording titled TITLE whose
// fragments are FILE..., in order; prints its composed audio file's URL.
int newRecording(const std::string& title, const std::vector<std::string>& files, bool json);
// `quorvelctl list`: title, date, duration and URL of each recording.
int listRecordings(bool json);
// `quorvelctl info URL`: the composition's fragments, whether each is
// composed, and whether the composed file and its waveform exist.
int showRecording(const std::string& url, bool json);

}  // namespace quorvelctl
