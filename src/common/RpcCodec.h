// MessagePack-RPC framing, free of I/O: a stream decoder that turns bytes into messages, and
// encoders for requests and responses.
//
//   request  [0, msgid, method, params]
//   response [1, msgid, error, result]
#pragma once

#include <msgpack.hpp>
#include <optional>
#include <string>

#include "sxreporting/types.h"

struct RpcLimits {
  size_t maxMessageBytes = 1 << 20;  // one message, all of its bytes
  int maxPayloadDepth = 32;          // nesting inside the params of a request
  size_t maxContainerEntries = 1 << 16;
};

// A request read from its bytes without decoding them.
struct RpcPackedRequest {
  uint32_t msgid = 0;
  std::string_view method;
  std::string_view params;  // the MessagePack bytes of the params array
  size_t bytes = 0;         // of the whole request
};

// Decodes a byte stream into whole messages. Not thread-safe; one per connection.
class RpcStreamDecoder {
 public:
  enum class Status { kMessage, kNeedMore, kBroken };

  explicit RpcStreamDecoder(RpcLimits limits = {});

  // Space for at least `size` more bytes; write into it and then call `commit`.
  char* prepare(size_t size);
  void commit(size_t size);

  // The next whole message. kBroken (with `error()`) when the bytes are not MessagePack, a
  // message is larger than allowed, it nests too deeply or it has no place in the value model;
  // the stream cannot go on then.
  Status next(SXValue& message);
  // The same without decoding it into values: `message` points at the decoded object, which
  // stays valid until the next call.
  Status next(const msgpack::object*& message);
  // The next message, when it is a whole, well-formed request inside the limits whose params
  // the value model can hold, read in place: valid until the stream is read again. Nothing
  // when that is not so or not yet known; `next` then decodes the message (and says what is
  // wrong with it). The request stays at the head of the stream until `skipRequest`.
  std::optional<RpcPackedRequest> peekRequest();
  // Steps over the request `peekRequest` returned, as `next` would have.
  void skipRequest(const RpcPackedRequest& request);
  const std::string& error() const { return error_; }
  // The MessagePack bytes of the message `next` returned last.
  size_t lastMessageBytes() const { return lastMessageBytes_; }
  // Bytes read but not yet returned as a message: the start of a message still being received.
  size_t bufferedBytes() const;
  // Frees a buffer that a large message grew, once nothing is buffered, so that one large
  // request does not keep its memory for the rest of the connection.
  void shrinkIfIdle();

 private:
  RpcLimits limits_;
  msgpack::v1::unpacker makeUnpacker() const;
  // Lets the zone reuse what the last decoded message held.
  void releaseHeld();
  // A message of `bytes` was taken from the stream.
  void tookMessage(size_t bytes);

  msgpack::v1::unpacker unpacker_;  // v1: lets us see a whole message's size before reset
  msgpack::object current_;         // the last message, in the unpacker's zone
  bool holding_ = false;            // the zone holds the last message's objects
  std::string error_;
  size_t lastMessageBytes_ = 0;
  bool grown_ = false;  // a message or a partial one outgrew the initial buffer
};

struct RpcRequest {
  uint32_t msgid = 0;
  std::string method;
  SXValue params;  // always an array
};

struct RpcResponse {
  uint32_t msgid = 0;
  SXValue error;  // null when the call succeeded
  SXValue result;
};

// A request as parts of its decoded object.
struct RpcRequestView {
  uint32_t msgid = 0;
  std::string_view method;
  const msgpack::object* params = nullptr;  // always an array
};

// Reads a decoded message as a request. On failure returns nothing and says why in `why`;
// `msgid` is set whenever the message carried a usable one, so the caller can still answer.
std::optional<RpcRequestView> RpcParseRequest(const msgpack::object& message, std::string& why,
                                              std::optional<uint32_t>& msgid);
// The same for a message in the value model.
std::optional<RpcRequest> RpcParseRequest(const SXValue& message, std::string& why,
                                          std::optional<uint32_t>& msgid);
std::optional<RpcResponse> RpcParseResponse(const SXValue& message);

void RpcEncodeRequest(msgpack::sbuffer& out, uint32_t msgid, std::string_view method,
                      const SXValue& params);
void RpcEncodeResponse(msgpack::sbuffer& out, uint32_t msgid, const SXValue& error,
                       const SXValue& result);
// Appends the response to `out`.
void RpcEncodeResponse(std::string& out, uint32_t msgid, const SXValue& error,
                       const SXValue& result);
