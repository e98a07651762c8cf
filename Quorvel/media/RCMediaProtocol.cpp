// Encoding and decoding of the media worker's frames. Decoding never trusts
// the bytes: every field is type-checked, numbers are range-checked, and a
// reply that does not fit the shape above is an error value, never an
// exception or a crash (the daemon decodes what a possibly compromised
// worker sends).
#include "Quorvel/media/RCMediaProtocol.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>

#include <nlohmann/json.hpp>

#include "Quorvel/errors/RCErrors.h"

namespace quorvel {
namespace {

using json = nlohmann::json;

// Longest error message carried; longer ones are cut.
constexpr std::size_t kMaxMessageBytes = 4096;

std::string dump(const json& value) {
  return value.dump(-1, ' ', false, json::error_handler_t::replace);
}

struct Malformed {
  std::string what;
};

const json& field(const json& object, const char* name) {
  auto found = object.find(name);
  if (found == object.end()) throw Malformed{std::string("no \"") + name + "\""};
  return *found;
}

std::string stringField(const json& object, const char* name) {
  const json& value = field(object, name);
  if (!value.is_string()) throw Malformed{std::string("\"") + name + "\" is not a string"};
  return value.get<std::string>();
}

double numberField(const json& object, const char* name) {
  const json& value = field(object, name);
  if (value.is_null()) return std::numeric_limits<double>::quiet_NaN();
  if (!value.is_number()) throw Malformed{std::string("\"") + name + "\" is not a number"};
  return value.get<double>();
}

std::uint64_t idField(const json& object) {
  const json& value = field(object, "id");
  if (!value.is_number_unsigned()) throw Malformed{"\"id\" is not an unsigned number"};
  return value.get<std::uint64_t>();
}

platform::URL urlField(const json& object, const char* name) {
  std::optional<platform::URL> url = platform::URL::fileURLFromString(stringField(object, name));
  if (!url) throw Malformed{std::string("\"") + name + "\" is not a file URL"};
  return *url;
}

json encodeNumber(double value) { return std::isfinite(value) ? json(value) : json(nullptr); }

json encodeProbe(const RCMediaProbe& probe) {
  json titles = json::array();
  for (const RCMetadataItem& item : probe.titleItems) {
    titles.push_back({{"value", item.stringValue}, {"language", item.language}});
  }
  return {{"playable", probe.playable},
          {"duration", encodeNumber(probe.duration)},
          {"container", probe.containerName},
          {"titles", std::move(titles)},
          {"created",
           probe.creationDate ? json(probe.creationDate->timeIntervalSince1970()) : json(nullptr)}};
}

RCMediaProbe decodeProbe(const json& object) {
  RCMediaProbe probe;
  const json& playable = field(object, "playable");
  if (!playable.is_boolean()) throw Malformed{"\"playable\" is not a boolean"};
  probe.playable = playable.get<bool>();
  probe.duration = numberField(object, "duration");
  if (probe.duration < 0) throw Malformed{"negative duration"};
  probe.containerName = stringField(object, "container");
  const json& titles = field(object, "titles");
  if (!titles.is_array()) throw Malformed{"\"titles\" is not an array"};
  for (const json& title : titles) {
    if (!title.is_object()) throw Malformed{"a title is not an object"};
    probe.titleItems.push_back(
        RCMetadataItem{stringField(title, "value"), stringField(title, "language")});
  }
  const double created = numberField(object, "created");
  if (std::isfinite(created)) {
    if (std::fabs(created) > 1e12) throw Malformed{"creation date out of range"};
    probe.creationDate = platform::Date::dateWithTimeIntervalSince1970(created);
  }
  return probe;
}

// How deep underlying errors are carried: a compose that blames a segment
// wraps what reading it found, and nothing needs more.
constexpr int kMaxErrorDepth = 2;

json encodeErrorObject(const platform::Error& error, int depth = 1) {
  std::string message = error.localizedDescription();
  if (message.size() > kMaxMessageBytes) message.resize(kMaxMessageBytes);
  json object{{"domain", error.domain()}, {"code", error.code()}, {"message", message}};
  if (const platform::Error* underlying = error.underlyingError();
      underlying != nullptr && depth < kMaxErrorDepth) {
    object["underlying"] = encodeErrorObject(*underlying, depth + 1);
  }
  return object;
}

platform::Error decodeErrorObject(const json& error, int depth = 1) {
  if (!error.is_object()) throw Malformed{"\"error\" is not an object"};
  const json& code = field(error, "code");
  if (!code.is_number_integer()) throw Malformed{"\"code\" is not an integer"};
  std::string domain = stringField(error, "domain");
  if (domain.empty()) throw Malformed{"empty error domain"};
  std::string message = stringField(error, "message");
  if (message.size() > kMaxMessageBytes) message.resize(kMaxMessageBytes);
  if (auto underlying = error.find("underlying"); underlying != error.end()) {
    if (depth >= kMaxErrorDepth) throw Malformed{"underlying errors nested too deep"};
    return platform::Error(std::move(domain), code.get<long>(), std::move(message),
                           decodeErrorObject(*underlying, depth + 1));
  }
  return platform::Error(std::move(domain), code.get<long>(), std::move(message));
}

std::optional<RCMediaJobKind> kindNamed(const std::string& name) {
  for (RCMediaJobKind kind :
       {RCMediaJobKind::Probe, RCMediaJobKind::ProbeMany, RCMediaJobKind::Compose,
        RCMediaJobKind::Waveform, RCMediaJobKind::WriteTitle}) {
    if (name == RCMediaJobKindName(kind)) return kind;
  }
  return std::nullopt;
}

}  // namespace

std::string RCMediaEncodeFrame(std::string_view body) {
  std::string frame(4, '\0');
  const std::uint32_t size = std::uint32_t(body.size());
  for (int i = 0; i < 4; ++i) frame[i] = char((size >> (8 * i)) & 0xff);
  frame.append(body);
  return frame;
}

void RCMediaFrameReader::append(const char* data, std::size_t size) {
  if (offset_ > 0 && offset_ == buffer_.size()) {
    buffer_.clear();
    offset_ = 0;
  }
  buffer_.append(data, size);
}

platform::Result<std::optional<std::string>> RCMediaFrameReader::next() {
  if (pendingBytes() < 4) return std::optional<std::string>();
  std::uint32_t size = 0;
  for (int i = 0; i < 4; ++i) size |= std::uint32_t(std::uint8_t(buffer_[offset_ + i])) << (8 * i);
  if (size > kRCMediaMaxFrameBytes) {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeWorkerFailed, "a frame of " + std::to_string(size) +
                                                       " bytes exceeds the limit of " +
                                                       std::to_string(kRCMediaMaxFrameBytes)));
  }
  if (pendingBytes() < 4 + std::size_t(size)) return std::optional<std::string>();
  std::string body = buffer_.substr(offset_ + 4, size);
  offset_ += 4 + std::size_t(size);
  if (offset_ > 65536 && offset_ * 2 > buffer_.size()) {
    buffer_.erase(0, offset_);
    offset_ = 0;
  }
  return std::optional<std::string>(std::move(body));
}

const char* RCMediaJobKindName(RCMediaJobKind kind) {
  switch (kind) {
    case RCMediaJobKind::Probe:
      return "probe";
    case RCMediaJobKind::ProbeMany:
      return "probeMany";
    case RCMediaJobKind::Compose:
      return "compose";
    case RCMediaJobKind::Waveform:
      return "waveform";
    case RCMediaJobKind::WriteTitle:
      return "writeTitle";
  }
  return "?";
}

std::string RCMediaEncodeRequest(const RCMediaRequest& request) {
  json body = {{"id", request.id}, {"job", RCMediaJobKindName(request.kind)}};
  if (request.kind != RCMediaJobKind::ProbeMany) body["url"] = request.url.absoluteString();
  switch (request.kind) {
    case RCMediaJobKind::Probe:
      break;
    case RCMediaJobKind::ProbeMany: {
      json urls = json::array();
      for (const platform::URL& url : request.urls) urls.push_back(url.absoluteString());
      body["urls"] = std::move(urls);
      break;
    }
    case RCMediaJobKind::Compose: {
      json segments = json::array();
      for (const RCComposerSegment& segment : request.segments) {
        segments.push_back({{"url", segment.fragmentURL.absoluteString()},
                            {"start", encodeNumber(segment.contentStart)},
                            {"duration", encodeNumber(segment.contentDuration)}});
      }
      body["segments"] = std::move(segments);
      body["waveform"] =
          request.destination ? json(request.destination->absoluteString()) : json(nullptr);
      break;
    }
    case RCMediaJobKind::Waveform:
      body["destination"] = request.destination ? request.destination->absoluteString() : "";
      break;
    case RCMediaJobKind::WriteTitle:
      body["title"] = request.title;
      body["language"] = request.language;
      break;
  }
  return dump(body);
}

platform::Result<RCMediaRequest> RCMediaDecodeRequest(std::string_view text) {
  json body = json::parse(text, nullptr, false);
  try {
    if (!body.is_object()) throw Malformed{"not a JSON object"};
    RCMediaRequest request;
    request.id = idField(body);
    std::optional<RCMediaJobKind> kind = kindNamed(stringField(body, "job"));
    if (!kind) throw Malformed{"unknown job"};
    request.kind = *kind;
    if (request.kind != RCMediaJobKind::ProbeMany) request.url = urlField(body, "url");
    switch (request.kind) {
      case RCMediaJobKind::Probe:
        break;
      case RCMediaJobKind::ProbeMany: {
        const json& urls = field(body, "urls");
        if (!urls.is_array()) throw Malformed{"\"urls\" is not an array"};
        if (urls.empty() || urls.size() > kRCMediaMaxProbeBatch) {
          throw Malformed{"\"urls\" names " + std::to_string(urls.size()) + " files, not 1 to " +
                          std::to_string(kRCMediaMaxProbeBatch)};
        }
        for (const json& url : urls) {
          if (!url.is_string()) throw Malformed{"a URL is not a string"};
          std::optional<platform::URL> file =
              platform::URL::fileURLFromString(url.get<std::string>());
          if (!file) throw Malformed{"a URL is not a file URL"};
          request.urls.push_back(std::move(*file));
        }
        break;
      }
      case RCMediaJobKind::Compose: {
        const json& segments = field(body, "segments");
        if (!segments.is_array()) throw Malformed{"\"segments\" is not an array"};
        for (const json& segment : segments) {
          if (!segment.is_object()) throw Malformed{"a segment is not an object"};
          request.segments.push_back(RCComposerSegment{urlField(segment, "url"),
                                                       numberField(segment, "start"),
                                                       numberField(segment, "duration")});
        }
        if (!field(body, "waveform").is_null()) request.destination = urlField(body, "waveform");
        break;
      }
      case RCMediaJobKind::Waveform:
        request.destination = urlField(body, "destination");
        break;
      case RCMediaJobKind::WriteTitle:
        request.title = stringField(body, "title");
        request.language = stringField(body, "language");
        break;
    }
    return request;
  } catch (const Malformed& malformed) {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeInvalidArgument, "malformed request: " + malformed.what));
  }
}

std::string RCMediaEncodeProgress(std::uint64_t id, double fraction) {
  return dump({{"id", id}, {"progress", std::isfinite(fraction) ? fraction : 0.0}});
}

std::string RCMediaEncodeResult(std::uint64_t id, const RCMediaProbe* probe) {
  return dump({{"id", id}, {"result", probe ? encodeProbe(*probe) : json::object()}});
}

std::string RCMediaEncodeError(std::uint64_t id, const platform::Error& error) {
  return dump({{"id", id}, {"error", encodeErrorObject(error)}});
}

std::string RCMediaEncodeItem(std::uint64_t id, std::size_t index,
                              const platform::Result<RCMediaProbe>& probe) {
  json item = {{"index", index}};
  if (probe) {
    item["result"] = encodeProbe(*probe);
  } else {
    item["error"] = encodeErrorObject(probe.error());
  }
  return dump({{"id", id}, {"item", std::move(item)}});
}

platform::Result<RCMediaReply> RCMediaDecodeReply(std::string_view text) {
  json body = json::parse(text, nullptr, false);
  try {
    if (!body.is_object()) throw Malformed{"not a JSON object"};
    RCMediaReply reply;
    reply.id = idField(body);
    if (auto progress = body.find("progress"); progress != body.end()) {
      if (!progress->is_number()) throw Malformed{"\"progress\" is not a number"};
      reply.kind = RCMediaReply::Kind::Progress;
      reply.progress = std::clamp(progress->get<double>(), 0.0, 1.0);
      if (!std::isfinite(reply.progress)) reply.progress = 0;
    } else if (auto result = body.find("result"); result != body.end()) {
      if (!result->is_object()) throw Malformed{"\"result\" is not an object"};
      reply.kind = RCMediaReply::Kind::Result;
      if (result->contains("playable")) reply.probe = decodeProbe(*result);
    } else if (auto item = body.find("item"); item != body.end()) {
      if (!item->is_object()) throw Malformed{"\"item\" is not an object"};
      const json& index = field(*item, "index");
      if (!index.is_number_unsigned() || index.get<std::uint64_t>() >= kRCMediaMaxProbeBatch) {
        throw Malformed{"\"index\" is not below " + std::to_string(kRCMediaMaxProbeBatch)};
      }
      reply.kind = RCMediaReply::Kind::Item;
      reply.index = std::size_t(index.get<std::uint64_t>());
      const bool probed = item->contains("result");
      if (probed == item->contains("error")) throw Malformed{"an item needs a result or an error"};
      if (probed) {
        const json& result = field(*item, "result");
        if (!result.is_object()) throw Malformed{"\"result\" is not an object"};
        reply.probe = decodeProbe(result);
      } else {
        reply.error = decodeErrorObject(field(*item, "error"));
      }
    } else if (auto error = body.find("error"); error != body.end()) {
      reply.kind = RCMediaReply::Kind::Error;
      reply.error = decodeErrorObject(*error);
    } else {
      throw Malformed{"neither progress, item, result nor error"};
    }
    return reply;
  } catch (const Malformed& malformed) {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeWorkerFailed, "malformed reply: " + malformed.what));
  }
}

}  // namespace quorvel
