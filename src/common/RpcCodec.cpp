#include "common/RpcCodec.h"

#include "common/MsgpackValue.h"
#include "common/SXPackedValue.h"

namespace {
// The request itself and its params array sit above the payload.
constexpr int kEnvelopeDepth = 2;
// A buffer that grew past this for one large message is freed once idle.
constexpr size_t kKeptBufferBytes = 4 * MSGPACK_UNPACKER_INIT_BUFFER_SIZE;
}  // namespace

RpcStreamDecoder::RpcStreamDecoder(RpcLimits limits) : limits_(limits), unpacker_(makeUnpacker()) {}

msgpack::v1::unpacker RpcStreamDecoder::makeUnpacker() const {
  return msgpack::v1::unpacker(
      nullptr, nullptr, MSGPACK_UNPACKER_INIT_BUFFER_SIZE,
      msgpack::unpack_limit(limits_.maxContainerEntries, limits_.maxContainerEntries,
                            limits_.maxMessageBytes, limits_.maxMessageBytes,
                            limits_.maxMessageBytes,
                            static_cast<size_t>(limits_.maxPayloadDepth + kEnvelopeDepth)));
}

size_t RpcStreamDecoder::bufferedBytes() const {
  return unpacker_.parsed_size() + unpacker_.nonparsed_size();
}

void RpcStreamDecoder::shrinkIfIdle() {
  if (bufferedBytes() > kKeptBufferBytes) grown_ = true;
  if (grown_ && bufferedBytes() == 0) {
    unpacker_ = makeUnpacker();
    grown_ = false;
  }
}

char* RpcStreamDecoder::prepare(size_t size) {
  unpacker_.reserve_buffer(size);
  return unpacker_.buffer();
}

void RpcStreamDecoder::commit(size_t size) { unpacker_.buffer_consumed(size); }

RpcStreamDecoder::Status RpcStreamDecoder::next(SXValue& message) {
  const msgpack::object* object = nullptr;
  Status status = next(object);
  if (status == Status::kMessage) {
    message = SXValueFromMsgpack(*object, limits_.maxPayloadDepth + kEnvelopeDepth);
  }
  return status;
}

RpcStreamDecoder::Status RpcStreamDecoder::next(const msgpack::object*& message) {
  if (!error_.empty()) return Status::kBroken;
  releaseHeld();
  try {
    if (unpacker_.execute()) {
      if (unpacker_.parsed_size() > limits_.maxMessageBytes) {
        error_ = "message larger than " + std::to_string(limits_.maxMessageBytes) + " bytes";
        return Status::kBroken;
      }
      tookMessage(unpacker_.parsed_size());
      current_ = unpacker_.data();
      holding_ = true;
      SXCheckValueModel(current_, limits_.maxPayloadDepth + kEnvelopeDepth);
      unpacker_.reset();
      message = &current_;
      return Status::kMessage;
    }
    if (unpacker_.parsed_size() + unpacker_.nonparsed_size() > limits_.maxMessageBytes) {
      error_ = "message larger than " + std::to_string(limits_.maxMessageBytes) + " bytes";
      return Status::kBroken;
    }
    return Status::kNeedMore;
  } catch (const msgpack::depth_size_overflow&) {
    error_ = "message nested deeper than " + std::to_string(limits_.maxPayloadDepth) + " levels";
  } catch (const msgpack::size_overflow&) {
    error_ = "message holds a container or string larger than allowed";
  } catch (const std::exception& e) {
    error_ = std::string("malformed MessagePack: ") + e.what();
  }
  return Status::kBroken;
}

namespace {

// Steps `reader` over one value that decoding would accept: containers nested `depth` deep at
// most, of `maxEntries` at most, and dictionaries keyed by strings. False for anything else.
bool SkipAcceptedValue(SXPackedReader& reader, int depth, size_t maxEntries) {
  using Kind = SXPackedReader::Kind;
  SXPackedReader::Item item = reader.next();
  if (reader.endedEarly()) return false;
  if (item.kind != Kind::kArray && item.kind != Kind::kMap) return true;
  if (depth <= 0 || item.count > maxEntries) return false;
  for (uint32_t i = 0; i < item.count; ++i) {
    if (item.kind == Kind::kMap && reader.next().kind != Kind::kString) return false;
    if (!SkipAcceptedValue(reader, depth - 1, maxEntries)) return false;
  }
  return true;
}

}  // namespace

std::optional<RpcPackedRequest> RpcStreamDecoder::peekRequest() {
  using Kind = SXPackedReader::Kind;
  // Only at the start of a message that the unpacker has not begun.
  if (!error_.empty() || unpacker_.parsed_size() != 0) return std::nullopt;
  const char* begin = unpacker_.nonparsed_buffer();
  size_t available = std::min(unpacker_.nonparsed_size(), limits_.maxMessageBytes);
  // A request cut off by the end of what has arrived is common and no error: no exception.
  SXPackedReader reader(begin, begin + available, SXPackedReader::OnEnd::kStop);
  try {
    SXPackedReader::Item envelope = reader.next();
    if (envelope.kind != Kind::kArray || envelope.count != 4) return std::nullopt;
    SXPackedReader::Item type = reader.next();
    SXPackedReader::Item msgid = reader.next();
    SXPackedReader::Item method = reader.next();
    if (reader.endedEarly() || type.kind != Kind::kUnsigned || type.u != 0 ||
        msgid.kind != Kind::kUnsigned || msgid.u > UINT32_MAX || method.kind != Kind::kString) {
      return std::nullopt;
    }
    const char* params = reader.position();
    if (SXPackedReader(reader).next().kind != Kind::kArray) return std::nullopt;
    // The params array sits one level below the request.
    if (!SkipAcceptedValue(reader, limits_.maxPayloadDepth + kEnvelopeDepth - 1,
                           limits_.maxContainerEntries)) {
      return std::nullopt;
    }
    return RpcPackedRequest{static_cast<uint32_t>(msgid.u), method.data,
                            std::string_view(params, reader.position() - params),
                            static_cast<size_t>(reader.position() - begin)};
  } catch (const std::out_of_range&) {
    return std::nullopt;  // not MessagePack
  }
}

void RpcStreamDecoder::skipRequest(const RpcPackedRequest& request) {
  releaseHeld();
  unpacker_.skip_nonparsed_buffer(request.bytes);
  tookMessage(request.bytes);
}

void RpcStreamDecoder::releaseHeld() {
  if (!holding_) return;
  // The unpacker keeps its zone (strings are copied into it, never referenced from the
  // buffer) and reuses it, instead of a fresh zone per message.
  unpacker_.reset_zone();
  holding_ = false;
}

void RpcStreamDecoder::tookMessage(size_t bytes) {
  lastMessageBytes_ = bytes;
  if (bytes > kKeptBufferBytes) grown_ = true;
}

std::optional<RpcRequestView> RpcParseRequest(const msgpack::object& message, std::string& why,
                                              std::optional<uint32_t>& msgid) {
  using msgpack::type::object_type;
  msgid.reset();
  const bool isArray = message.type == object_type::ARRAY;
  const msgpack::object* items = isArray ? message.via.array.ptr : nullptr;
  // Whatever else is wrong, an array whose second element can be a msgid gets its error reply.
  if (isArray && message.via.array.size >= 2 && items[1].type == object_type::POSITIVE_INTEGER &&
      items[1].via.u64 <= UINT32_MAX) {
    msgid = static_cast<uint32_t>(items[1].via.u64);
  }
  if (!isArray || message.via.array.size != 4 || items[0].type != object_type::POSITIVE_INTEGER ||
      items[0].via.u64 != 0) {
    why = "not a MessagePack-RPC request [0, msgid, method, params]";
    return std::nullopt;
  }
  if (!msgid) {
    why = "msgid is not an unsigned 32-bit integer";
    return std::nullopt;
  }
  if (items[2].type != object_type::STR) {
    why = "method is not a string";
    return std::nullopt;
  }
  if (items[3].type != object_type::ARRAY) {
    why = "params is not an array";
    return std::nullopt;
  }
  return RpcRequestView{*msgid, std::string_view(items[2].via.str.ptr, items[2].via.str.size),
                        &items[3]};
}

std::optional<RpcRequest> RpcParseRequest(const SXValue& message, std::string& why,
                                          std::optional<uint32_t>& msgid) {
  msgpack::sbuffer bytes;
  msgpack::packer<msgpack::sbuffer> packer(bytes);
  SXPackValue(packer, message);
  msgpack::object_handle handle = msgpack::unpack(bytes.data(), bytes.size());
  auto view = RpcParseRequest(handle.get(), why, msgid);
  if (!view) return std::nullopt;
  return RpcRequest{view->msgid, std::string(view->method), message[3]};
}

std::optional<RpcResponse> RpcParseResponse(const SXValue& message) {
  if (!message.is_array() || message.size() != 4 || !message[0].is_number_unsigned() ||
      message[0].get<uint64_t>() != 1 || !message[1].is_number_unsigned() ||
      message[1].get<uint64_t>() > UINT32_MAX) {
    return std::nullopt;
  }
  return RpcResponse{static_cast<uint32_t>(message[1].get<uint64_t>()), message[2], message[3]};
}

void RpcEncodeRequest(msgpack::sbuffer& out, uint32_t msgid, std::string_view method,
                      const SXValue& params) {
  msgpack::packer<msgpack::sbuffer> p(out);
  p.pack_array(4);
  p.pack_uint32(0);
  p.pack_uint32(msgid);
  p.pack_str(static_cast<uint32_t>(method.size()));
  p.pack_str_body(method.data(), static_cast<uint32_t>(method.size()));
  if (params.is_array()) {
    SXPackValue(p, params);
  } else {
    p.pack_array(0);
  }
}

namespace {
template <typename Stream>
void encodeResponse(Stream& out, uint32_t msgid, const SXValue& error, const SXValue& result) {
  msgpack::packer<Stream> p(out);
  p.pack_array(4);
  p.pack_uint32(1);
  p.pack_uint32(msgid);
  SXPackValue(p, error);
  SXPackValue(p, result);
}
}  // namespace

void RpcEncodeResponse(msgpack::sbuffer& out, uint32_t msgid, const SXValue& error,
                       const SXValue& result) {
  encodeResponse(out, msgid, error, result);
}

void RpcEncodeResponse(std::string& out, uint32_t msgid, const SXValue& error,
                       const SXValue& result) {
  SXStringSink sink{&out};
  encodeResponse(sink, msgid, error, result);
}
