#include "Quorvel/composition/RCCaptureFormat.h"

#include <algorithm>

namespace quorvel {

const std::vector<std::string>& RCCaptureFormat::fileExtensionsSupported() {
  static const std::vector<std::string> extensions = {"m4a", "flac", "wav"};
  return extensions;
}

bool RCCaptureFormat::isFileExtensionSupported(std::string_view extension) {
  const auto& extensions = fileExtensionsSupported();
  return std::find(extensions.begin(), extensions.end(), extension) != extensions.end();
}

const std::string& RCCaptureFormat::defaultFileExtension() { return fileExtensionsSupported()[0]; }

}  // namespace quorvel
