// IPC listener and connections.
//
// A listener accepts client connections and asks its delegate whether to take each one. A
// connection carries requests (a method name and an array of params) to its exported object on
// the connection's own thread, and carries replies back from any thread. When the peer closes
// cleanly the connection is invalidated; a reset, a read error or a malformed stream first
// interrupts and then invalidates it. Each handler runs at most once, on the connection's
// thread.
#pragma once

#include <cstdint>
#include <functional>
#include <limits>
#include <memory>
#include <string>
#include <string_view>

#include "common/MsgpackValue.h"
#include "platform/ByteBudget.h"
#include "sxreporting/types.h"

// Sends the reply of one request: `error` null and `result` the value, or `error` a string
// saying what was wrong with the request. Call it at most once, from any thread; dropping it
// sends nothing.
using SXIpcReplyFn = std::function<void(const SXValue& error, const SXValue& result)>;

class SXIpcExportedObject {
 public:
  virtual ~SXIpcExportedObject() = default;
  // Called on the connection's thread for each request, in arrival order. `params` is the
  // object's to keep or move from; `wireBytes` is the size of the whole request as received.
  virtual void handleRequest(std::string_view method, SXValue params, size_t wireBytes,
                             SXIpcReplyFn reply) = 0;
  // The same for params as the connection decoded them, valid until this returns; an object
  // that keeps some of them in their MessagePack form overrides it. By default they become
  // values.
  virtual void handleRequest(std::string_view method, const msgpack::object& params,
                             size_t wireBytes, SXIpcReplyFn reply) {
    handleRequest(method, SXValueFromMsgpack(params, std::numeric_limits<int>::max()), wireBytes,
                  std::move(reply));
  }
  // The same for params still in their MessagePack bytes, valid until this returns: the bytes
  // of an array that the value model can hold. An object that reads some requests that way
  // overrides it, and moves from `reply` only when it returns true; false, and the connection
  // decodes the request and calls one of the above.
  virtual bool handlePackedRequest(std::string_view /*method*/, std::string_view /*params*/,
                                   size_t /*wireBytes*/, SXIpcReplyFn& /*reply*/) {
    return false;
  }
};

class SXIpcConnection {
 public:
  virtual ~SXIpcConnection() = default;
  virtual int32_t processIdentifier() const = 0;
  virtual std::string description() const = 0;
  // Set before `resume`. The connection holds the object strongly until it is invalidated.
  virtual void setExportedObject(std::shared_ptr<SXIpcExportedObject> object) = 0;
  virtual void setInterruptionHandler(std::function<void()> handler) = 0;
  virtual void setInvalidationHandler(std::function<void()> handler) = 0;
  // Starts delivering requests.
  virtual void resume() = 0;
  // What the client has made the service hold; the connection stops reading while it is over
  // its limit. Null when the connection keeps no budget.
  virtual std::shared_ptr<SXByteBudget> budget() const { return nullptr; }
};

class SXIpcListenerDelegate {
 public:
  virtual ~SXIpcListenerDelegate() = default;
  // Called on the listener's thread for each new connection, before it is resumed. Returning
  // false closes it.
  virtual bool shouldAcceptNewConnection(const std::shared_ptr<SXIpcConnection>& connection) = 0;
};

class SXIpcListener {
 public:
  virtual ~SXIpcListener() = default;
  virtual void setDelegate(std::shared_ptr<SXIpcListenerDelegate> delegate) = 0;
  // Serves connections; returns only when the service ends.
  virtual void resume() = 0;
};
