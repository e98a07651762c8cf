// RCCaptureFormat: the audio file formats recordings are captured in: "m4a"
// (AAC, the default), "flac" and "wav". Constants only; any thread.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace quorvel {

class RCCaptureFormat {
 public:
  // The file extensions of the capture formats, lower case, without dots.
  static const std::vector<std::string>& fileExtensionsSupported();
  // Whether `extension` is exactly (case-sensitively) one of them.
  static bool isFileExtensionSupported(std::string_view extension);
  static const std::string& defaultFileExtension();
};

}  // namespace quorvel
