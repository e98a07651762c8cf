// Audio assets read through the process's media engine: in an app that is
// FFmpeg on the calling thread, in the daemon a job for the media worker.
#include "Quorvel/media/RCAudioAsset.h"

#include "Quorvel/media/RCAssetMetadataLoader.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "platform/Log.h"

namespace quorvel {
namespace {

platform::Result<RCCommonMetadata> readCommonMetadata(const platform::URL& url) {
  auto probe = RCMediaEngine::current()->probe(url);
  if (!probe) return platform::fail(probe.error());
  return RCCommonMetadata{std::move(probe->titleItems), probe->creationDate};
}

}  // namespace

RCAudioAsset::RCAudioAsset(platform::URL url, double duration, std::string containerName)
    : url_(std::move(url)), duration_(duration), containerName_(std::move(containerName)) {}

std::shared_ptr<RCAudioAsset> RCAudioAsset::assetWithURL(const platform::URL& url) {
  auto probe = RCMediaEngine::current()->probe(url);
  if (!probe) {
    QV_LOG(platform::kLogLevelDebug, "No asset for {}: {}", url.lastPathComponent(), probe.error());
    return nullptr;
  }
  if (!probe->playable) {
    QV_LOG(platform::kLogLevelDebug, "No asset for {}: no playable audio stream",
           url.lastPathComponent());
    return nullptr;
  }
  return std::make_shared<RCAudioAsset>(url, probe->duration, std::move(probe->containerName));
}

platform::Result<std::shared_ptr<RCAudioAsset>> RCAudioAsset::examineAssetWithURL(
    const platform::URL& url) {
  return examineAssetWithProbe(url, RCMediaEngine::current()->probe(url));
}

platform::Result<std::shared_ptr<RCAudioAsset>> RCAudioAsset::examineAssetWithProbe(
    const platform::URL& url, platform::Result<RCMediaProbe> probe) {
  if (!probe) {
    // The media engine reports what it read and found unusable in the asset
    // domain; anything else (POSIX, the worker's own failures) is a failure
    // to look.
    if (probe.error().domain() == kRCAudioAssetErrorDomain) return nullptr;
    return platform::fail(probe.error());
  }
  if (!probe->playable) return nullptr;
  return std::make_shared<RCAudioAsset>(url, probe->duration, std::move(probe->containerName));
}

platform::Result<RCCommonMetadata> RCAudioAsset::loadCommonMetadata() const {
  return readCommonMetadata(url_);
}

void RCAudioAsset::loadCommonMetadataAsync(CommonMetadataCompletion completion) const {
  RCAssetMetadataLoader::shared().submit(
      [url = url_, completion = std::move(completion)]() mutable {
        completion(readCommonMetadata(url));
      });
}

}  // namespace quorvel
