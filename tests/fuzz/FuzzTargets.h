// The fuzz targets' bodies, shared by the libFuzzer entry points (fuzz_*.cpp, clang only) and by
// the test that replays the corpus (tests/FuzzCorpus_test.cpp), so both run the same checks. A
// broken property calls SXR_FUZZ_FAILED(what): a trap for the fuzzer, a failure in the test.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <msgpack.hpp>
#include <optional>
#include <string>
#include <vector>

#include "Service/SXReportingBlockThrottle.h"
#include "Service/SXReportingSession.h"
#include "common/MsgpackValue.h"
#include "common/RpcCodec.h"
#include "common/SXPackedValue.h"
#include "common/SXThreadSafety.h"
#include "common/SXValueText.h"
#include "platform/DiscardLog.h"
#include "support/TestEnvironment.h"

#ifndef SXR_FUZZ_FAILED
#define SXR_FUZZ_FAILED(what) __builtin_trap()
#endif
#define SXR_FUZZ_CHECK(condition)                  \
  do {                                             \
    if (!(condition)) SXR_FUZZ_FAILED(#condition); \
  } while (0)

// Takes a fixed-size number from the front of the fuzz input; zeros once it runs out.
template <typename T>
T SXFuzzTake(const uint8_t*& data, size_t& size) {
  T value{};
  size_t n = std::min(sizeof(T), size);
  std::memcpy(&value, data, n);
  data += n;
  size -= n;
  return value;
}

// A value from MessagePack bytes within the default limits, and its packed form: the bytes as
// sent, as the service keeps a payload; nothing when they are not one.
inline std::optional<std::pair<SXValue, SXPackedValue>> SXFuzzUnpackBoth(const char* bytes,
                                                                         size_t length) {
  RpcLimits limits;
  try {
    size_t offset = 0;
    msgpack::object_handle handle = msgpack::unpack(
        bytes, length, offset, nullptr, nullptr,
        msgpack::unpack_limit(limits.maxContainerEntries, limits.maxContainerEntries,
                              limits.maxMessageBytes, limits.maxMessageBytes,
                              limits.maxMessageBytes, limits.maxPayloadDepth + 1));
    return std::pair{SXValueFromMsgpack(handle.get(), limits.maxPayloadDepth),
                     SXPackedValue::fromBytes(std::string_view(bytes, offset))};
  } catch (const std::exception&) {
    return std::nullopt;
  }
}

inline std::optional<SXValue> SXFuzzUnpack(const char* bytes, size_t length) {
  auto both = SXFuzzUnpackBoth(bytes, length);
  if (!both) return std::nullopt;
  return std::move(both->first);
}

// A value from arbitrary bytes: MessagePack when the first byte is even, JSON text when it is
// odd. Nothing when the bytes are neither; never throws.
inline std::optional<SXValue> SXFuzzValue(const uint8_t* data, size_t size) {
  if (size == 0) return std::nullopt;
  const char* bytes = reinterpret_cast<const char*>(data + 1);
  if (data[0] % 2 == 0) return SXFuzzUnpack(bytes, size - 1);
  SXValue value = SXValue::parse(bytes, bytes + size - 1, nullptr, false);
  if (value.is_discarded()) return std::nullopt;
  return value;
}

// ---- The wire decoder: never crashes, and the messages it yields do not depend on where the
// reads happened to split the stream.

struct SXFuzzDecoded {
  std::vector<std::string> messages;  // compact JSON, so that NaN compares equal
  RpcStreamDecoder::Status last = RpcStreamDecoder::Status::kNeedMore;
};

// A request read in place, as the message decoding gives.
inline SXValue SXFuzzInPlaceMessage(const RpcPackedRequest& request) {
  msgpack::object_handle params = msgpack::unpack(request.params.data(), request.params.size());
  SXR_FUZZ_CHECK(params.get().type == msgpack::type::ARRAY);
  return SXValue::array({0, request.msgid, std::string(request.method),
                         SXValueFromMsgpack(params.get(), std::numeric_limits<int>::max())});
}

// The messages of `stream` fed to a decoder in `chunks` (all at once when there are none).
// `inPlace`: requests are read in place where the decoder can.
inline SXFuzzDecoded SXFuzzDecode(const RpcLimits& limits, const std::string& stream,
                                  const std::vector<size_t>& chunks, bool inPlace) {
  RpcStreamDecoder decoder(limits);
  SXFuzzDecoded out;
  SXValue message;
  auto nextMessage = [&] {
    if (std::optional<RpcPackedRequest> request; inPlace && (request = decoder.peekRequest())) {
      message = SXFuzzInPlaceMessage(*request);
      decoder.skipRequest(*request);
      SXR_FUZZ_CHECK(decoder.lastMessageBytes() == request->bytes);
      return RpcStreamDecoder::Status::kMessage;
    }
    return decoder.next(message);
  };
  for (size_t i = 0, at = 0; at < stream.size(); ++i) {
    size_t n = chunks.empty() ? stream.size() : chunks[i % chunks.size()];
    n = std::min(n, stream.size() - at);
    std::memcpy(decoder.prepare(n), stream.data() + at, n);
    decoder.commit(n);
    at += n;
    while ((out.last = nextMessage()) == RpcStreamDecoder::Status::kMessage) {
      std::string why;
      std::optional<uint32_t> msgid;
      if (!RpcParseRequest(message, why, msgid)) SXR_FUZZ_CHECK(!why.empty());
      RpcParseResponse(message);
      out.messages.push_back(message.dump(-1, ' ', false, SXValue::error_handler_t::replace));
    }
    if (out.last == RpcStreamDecoder::Status::kBroken) {
      SXR_FUZZ_CHECK(!decoder.error().empty());
      break;
    }
  }
  return out;
}

// Input: one byte choosing tight or default limits, one byte giving 1-8 chunk sizes, the
// sizes (1-64 bytes each), then the stream.
inline void SXFuzzRpcDecoder(const uint8_t* data, size_t size) {
  RpcLimits limits;
  if (SXFuzzTake<uint8_t>(data, size) % 2) {
    limits = {.maxMessageBytes = 512, .maxPayloadDepth = 4, .maxContainerEntries = 16};
  }
  std::vector<size_t> chunks(SXFuzzTake<uint8_t>(data, size) % 8 + 1);
  for (size_t& chunk : chunks) chunk = SXFuzzTake<uint8_t>(data, size) % 64 + 1;
  std::string stream(reinterpret_cast<const char*>(data), size);
  SXFuzzDecoded whole = SXFuzzDecode(limits, stream, {}, false);
  SXFuzzDecoded cut = SXFuzzDecode(limits, stream, chunks, false);
  SXFuzzDecoded inPlace = SXFuzzDecode(limits, stream, chunks, true);
  SXR_FUZZ_CHECK(whole.last == cut.last);
  SXR_FUZZ_CHECK(whole.messages == cut.messages);
  SXR_FUZZ_CHECK(inPlace.last == whole.last);
  SXR_FUZZ_CHECK(inPlace.messages == whole.messages);
}

// ---- MessagePack objects into the value model and back: conversion never crashes, and a value
// packs to the same bytes after a round trip.

inline std::string SXFuzzPack(const SXValue& value) {
  msgpack::sbuffer buffer;
  msgpack::packer<msgpack::sbuffer> packer(buffer);
  SXPackValue(packer, value);
  return std::string(buffer.data(), buffer.size());
}

inline void SXFuzzMsgpackValue(const uint8_t* data, size_t size) {
  auto both = SXFuzzUnpackBoth(reinterpret_cast<const char*>(data), size);
  if (!both) return;
  const auto& [decoded, packed] = *both;
  // The stores' texts, written from the packed form, are those of the decoded value.
  SXR_FUZZ_CHECK(SXValueText(packed.value()) == SXValueText(decoded));
  if (decoded.is_object()) {
    SXR_FUZZ_CHECK(SXPackedDictionaryText(packed) == SXValueText(decoded));
    SXValue withHost = decoded;
    const SXValue host = "host";
    withHost["HostApplicationDisplayID"] = host;
    SXR_FUZZ_CHECK(
        SXPackedDictionaryText(packed, false, SXTextMember{"HostApplicationDisplayID", &host}) ==
        SXValueText(withHost));
    SXR_FUZZ_CHECK(SXPackedDictionaryText(packed, true) ==
                   SXValueText(SXReportingSessionUnderscoreKeys(decoded)));
  }
  std::string first = SXFuzzPack(decoded);
  std::optional<SXValue> back = SXFuzzUnpack(first.data(), first.size());
  SXR_FUZZ_CHECK(back.has_value());
  if (back) SXR_FUZZ_CHECK(SXFuzzPack(*back) == first);
}

// ---- What the service does with a client's payload: the key rewrite, the throttle's message
// key and hold-back time, and a session's summary event and file on an internal build.

inline void SXFuzzRewrite(const SXValue& payload) {
  SXValue rewritten = SXReportingSessionUnderscoreKeys(payload);
  SXR_FUZZ_CHECK(rewritten.is_object());
  if (payload.is_object()) SXR_FUZZ_CHECK(rewritten.size() <= payload.size());
  for (const auto& [key, value] : rewritten.items()) {
    SXR_FUZZ_CHECK(key.find(' ') == std::string::npos);
  }
}

inline void SXFuzzThrottle(const SXValue& payload, int64_t reporterID, uint32_t category,
                           uint16_t type) {
  SXDiscardLog log;
  std::string key = SXReportingBlockThrottle::buildMessageKey(payload, reporterID, category, type);
  SXValue copy = payload;
  SXR_FUZZ_CHECK(SXReportingBlockThrottle::buildMessageKey(copy, reporterID, category, type) ==
                 key);
  SXReportingBlockThrottle::determineSleepTime(payload, log);
}

// The summary file's name must stay one name inside the diagnostic-logs directory.
inline void SXFuzzSummary(const SXValue& payload, int64_t reporterID, uint32_t category,
                          uint16_t type) {
  TestEnvironment t(SXValue{{"InternalBuild", true}}, {});
  auto session = SXReportingSession::initWithID(t.environment, reporterID, SXValue::array());
  session->setServiceType(type);
  if (payload.is_object()) session->setConfiguration(&payload);
  session->start();
  session->sendMessage(payload, category, type, nullptr);
  session->createSummaryEventForSession();
  t.drain();
  SXMutexLock lock(t.fileSystem->mutex_);
  for (const auto& [path, contents] : t.fileSystem->files) {
    SXR_FUZZ_CHECK(path.rfind("/diag/", 0) == 0);
    std::string name = path.substr(std::min(path.size(), std::string("/diag/").size()));
    SXR_FUZZ_CHECK(name.find('/') == std::string::npos);
    SXR_FUZZ_CHECK(name.find('\0') == std::string::npos);
    SXR_FUZZ_CHECK(name != "." && name != "..");
    SXR_FUZZ_CHECK(name.size() <= 255);
  }
}

// Input: reporter ID (8 bytes), category (4), type (2), then the value (see SXFuzzValue).
inline void SXFuzzPayload(const uint8_t* data, size_t size) {
  auto reporterID = SXFuzzTake<int64_t>(data, size);
  auto category = SXFuzzTake<uint32_t>(data, size);
  auto type = SXFuzzTake<uint16_t>(data, size);
  std::optional<SXValue> payload = SXFuzzValue(data, size);
  if (!payload) return;
  SXFuzzRewrite(*payload);
  SXFuzzThrottle(*payload, reporterID, category, type);
  SXFuzzSummary(*payload, reporterID, category, type);
}
