#include "common/RpcCodec.h"

#include <gtest/gtest.h>

#include <cmath>

#include "common/MsgpackValue.h"
#include "common/SXFormat.h"
#include "common/SXPackedValue.h"
#include "common/SXValueText.h"

namespace {

std::string encodeRequest(uint32_t id, const std::string& method, const SXValue& params) {
  msgpack::sbuffer buffer;
  RpcEncodeRequest(buffer, id, method, params);
  return std::string(buffer.data(), buffer.size());
}

void feed(RpcStreamDecoder& decoder, const std::string& bytes) {
  char* dst = decoder.prepare(bytes.size());
  std::memcpy(dst, bytes.data(), bytes.size());
  decoder.commit(bytes.size());
}

SXValue nested(int depth) {
  SXValue v = 1;
  for (int i = 0; i < depth; ++i) v = SXValue{{"k", v}};
  return v;
}

}  // namespace

TEST(RpcStreamDecoder, MessagesSurviveAnyChunkBoundary) {
  SXValue params = {SXValue{{"a b", 1.5}, {"bin", SXValue::binary({1, 2, 3})}}, 3, 1, nullptr};
  std::string bytes = encodeRequest(7, "m", params) + encodeRequest(8, "n", SXValue::array());
  for (size_t chunk = 1; chunk <= bytes.size(); ++chunk) {
    RpcStreamDecoder decoder;
    std::vector<SXValue> got;
    for (size_t off = 0; off < bytes.size(); off += chunk) {
      feed(decoder, bytes.substr(off, chunk));
      SXValue message;
      while (true) {
        // Read in place only once whole, and then the same request.
        std::optional<RpcPackedRequest> inPlace = decoder.peekRequest();
        if (decoder.next(message) != RpcStreamDecoder::Status::kMessage) {
          EXPECT_FALSE(inPlace) << "chunk " << chunk;
          break;
        }
        if (inPlace) {
          EXPECT_EQ(inPlace->bytes, decoder.lastMessageBytes());
        }
        got.push_back(message);
      }
    }
    ASSERT_EQ(got.size(), 2u) << "chunk " << chunk;
    std::string why;
    std::optional<uint32_t> id;
    auto request = RpcParseRequest(got[0], why, id);
    ASSERT_TRUE(request);
    EXPECT_EQ(request->msgid, 7u);
    EXPECT_EQ(request->params, params);
  }
}

TEST(RpcStreamDecoder, BreaksOnGarbageOversizeDeepNestingAndHugeDeclaredContainers) {
  using Status = RpcStreamDecoder::Status;
  struct Case {
    std::string bytes;
    Status status;
    RpcLimits limits = {};
  };
  const Case cases[] = {
      {std::string("\xc1\xc1\xc1", 3), Status::kBroken},  // 0xc1 is never used by MessagePack
      // Over the limit before the message is even whole.
      {encodeRequest(1, "m", SXValue::array({std::string(2000, 'x')})).substr(0, 1500),
       Status::kBroken,
       {.maxMessageBytes = 1024}},
      {encodeRequest(1, "m", SXValue::array({nested(32)})), Status::kMessage},
      {encodeRequest(1, "m", SXValue::array({nested(33)})), Status::kBroken},
      // An array32 that declares 4G entries: refused, not allocated.
      {std::string("\x94\x00\x01\xa1m\xdd\xff\xff\xff\xff", 10), Status::kBroken},
      {std::string("\x94\x00\x01\xa1m\x91\x81\x01\x02", 10), Status::kBroken},  // key 1
  };
  for (const Case& c : cases) {
    RpcStreamDecoder decoder(c.limits);
    feed(decoder, c.bytes);
    // Read in place only what decoding accepts.
    EXPECT_EQ(decoder.peekRequest().has_value(), c.status == Status::kMessage);
    SXValue message;
    EXPECT_EQ(decoder.next(message), c.status) << testing::PrintToString(c.bytes.substr(0, 16));
  }
}

TEST(RpcParseRequest, SaysWhatIsWrongAndKeepsAnyUsableMsgid) {
  const std::string notRequest = "not a MessagePack-RPC request [0, msgid, method, params]";
  struct Row {
    SXValue message;
    std::optional<uint32_t> id;  // the msgid an error reply can carry
    std::string why;
  } rows[] = {
      {SXValue{1, 2}, 2u, notRequest},
      {SXValue{0, 5, "m"}, 5u, notRequest},
      {SXValue{0, 5, "m", SXValue::array(), 1}, 5u, notRequest},
      {SXValue{7, 5, "m", SXValue::array()}, 5u, notRequest},
      {SXValue{2, "m", SXValue::array()}, std::nullopt, notRequest},  // a notification
      {SXValue{0, -1, "m", SXValue::array()}, std::nullopt,
       "msgid is not an unsigned 32-bit integer"},
      {SXValue{0, 4294967296ull, "m", SXValue::array()}, std::nullopt,
       "msgid is not an unsigned 32-bit integer"},
      {SXValue("m"), std::nullopt, notRequest},
      {SXValue{0, 5, 3, SXValue::array()}, 5u, "method is not a string"},
      {SXValue{0, 5, "m", 1}, 5u, "params is not an array"},
  };
  for (const Row& row : rows) {
    std::string why;
    std::optional<uint32_t> id;
    EXPECT_FALSE(RpcParseRequest(row.message, why, id)) << row.message.dump();
    EXPECT_EQ(id, row.id) << row.message.dump();
    EXPECT_EQ(why, row.why) << row.message.dump();
  }
}

TEST(MsgpackValue, DictionariesTakeKeysInAnyOrderTheLastRepeatWinsAndOnlyStringKeys) {
  msgpack::sbuffer buffer;
  msgpack::packer<msgpack::sbuffer> p(buffer);
  p.pack_map(5);
  for (auto [key, value] : {std::pair{"b", 1}, {"c", 2}, {"a", 3}, {"c", 4}, {"d", 5}}) {
    p.pack(key);
    p.pack(value);
  }
  auto handle = msgpack::unpack(buffer.data(), buffer.size());
  EXPECT_EQ(SXValueFromMsgpack(handle.get()), (SXValue{{"a", 3}, {"b", 1}, {"c", 4}, {"d", 5}}));

  buffer.clear();
  p.pack_map(1);
  p.pack_int(1);
  p.pack_int(2);
  handle = msgpack::unpack(buffer.data(), buffer.size());
  EXPECT_THROW(SXValueFromMsgpack(handle.get()), SXValueConversionError);
}

TEST(SXValueText, DictionariesAreTheCompactDumpAndPackedOnesWriteTheSameText) {
  const SXValue host = "player";
  const std::vector<uint8_t> bytes = {0, 255};
  // Texts of every length around the 8- and 16-byte blocks they are checked in, with a byte
  // to escape first, in the middle or last; and more keys than are sorted without the heap.
  SXValue blocks = SXValue::object();
  for (size_t length : {1, 7, 8, 9, 15, 16, 17, 24, 31, 32, 33}) {
    const std::string text(length, 'p');
    blocks["e" + text] = text.substr(1) + "\"";
    blocks["f" + text] = "\x1f" + text.substr(1);
    blocks["m" + text] = text.substr(0, length / 2) + "\x7f" + text.substr(length / 2 + 1);
  }
  for (const SXValue& payload :
       {SXValue::object(), SXValue{{"a", 1}},
        SXValue{{"zz", {1, 2}}, {"HostApplicationDisplayID", "x"}},
        SXValue{{"Host", 1}, {"Hz", 2.5}, {"b", {{"c", "\xff\n"}}}},
        SXValue{{"q\"u\\o\te", "\x7f\x01"}, {"\xc3\xa9t\xc3\xa9", "caf\xc3\xa9"}, {"", ""}},
        SXValue{{"n", {nullptr, true, -1, 18446744073709551615ull, 1e300, 0.1, SXValue::object()}},
                {"f", {12.0, -0.0, 1e-7, 1e21, 5e-324, NAN, -INFINITY, INT64_MIN}},
                {"bin", SXValue::binary(bytes)},
                {"ext", SXValue::binary(bytes, 7)},
                {"arr", SXValue::array()}},
        SXValue{{"A", "}\\\"{,]"}, {"Host", {{"x", {1, "]"}}}}, {"I", nullptr}, {"z", false}},
        blocks, SXValue::array({1}), SXValue()}) {
    SXValue merged = payload.is_object() ? payload : SXValue::object();
    merged["HostApplicationDisplayID"] = host;
    EXPECT_EQ(SXValueText(merged), merged.dump(-1, ' ', false, SXValue::error_handler_t::replace));
    const SXPackedValue packed = SXPackedValue::fromValue(payload);
    EXPECT_EQ(SXValueText(packed.value()), SXValueText(payload));
    EXPECT_EQ(
        SXPackedDictionaryText(packed, false, SXTextMember{"HostApplicationDisplayID", &host}),
        SXValueText(merged));
    if (payload.is_object()) {
      EXPECT_EQ(SXPackedDictionaryText(packed), SXValueText(payload));
    }
  }
  // Decoded from a client's bytes: keys in any order and repeated, floats of both sizes (a
  // whole one stays a float), integers of every width.
  msgpack::sbuffer buffer;
  msgpack::packer<msgpack::sbuffer> p(buffer);
  p.pack_map(7);
  p.pack("f"), p.pack_float(0.1f), p.pack("w");
  buffer.write("\xcb\x40\x28\0\0\0\0\0\0", 9);  // 12.0 as a float64: msgpack-c packs an int
  p.pack("b"), p.pack(1);
  p.pack("c"), p.pack_array(2), p.pack_uint64(UINT64_MAX), p.pack_int64(INT64_MIN);
  p.pack("d"), p.pack_map(2), p.pack("y"), p.pack_nil(), p.pack("x"), p.pack_true();
  p.pack("b"), p.pack_int8(-3), p.pack("e"), p.pack_str(0);
  auto handle = msgpack::unpack(buffer.data(), buffer.size());
  const SXValue decoded = SXValueFromMsgpack(handle.get());
  const SXPackedValue packed = SXPackedValue::fromBytes({buffer.data(), buffer.size()});
  EXPECT_EQ(SXPackedDictionaryText(packed), SXValueText(decoded));
  EXPECT_EQ(SXPackedDictionaryText(packed),
            R"({"b":-3,"c":[18446744073709551615,-9223372036854775808],"d":{"x":true,"y":null},)"
            R"("e":"","f":0.10000000149011612,"w":12.0})");
  EXPECT_TRUE(packed.hasMember("d"));
  EXPECT_FALSE(packed.hasMember("x"));
  // More keys than are sorted without the heap, sent in reverse order.
  msgpack::sbuffer reversed;
  msgpack::packer<msgpack::sbuffer> r(reversed);
  r.pack_map(static_cast<uint32_t>(blocks.size()));
  for (auto it = blocks.rbegin(); it != blocks.rend(); ++it) {
    r.pack(it.key()), r.pack(it.value().get<std::string>());
  }
  EXPECT_EQ(SXPackedDictionaryText(SXPackedValue::fromBytes({reversed.data(), reversed.size()})),
            SXValueText(blocks));
}

TEST(SXValueText, EveryKind) {
  EXPECT_EQ(SXValueText(SXValue("a b")), "a b");
  EXPECT_EQ(SXValueText(SXValue(-3)), "-3");
  EXPECT_EQ(SXValueText(SXValue(1.235)), "1.235");
  EXPECT_EQ(SXValueText(SXValue(12.0)), "12");
  EXPECT_EQ(SXValueText(SXValue(true)), "1");
  EXPECT_EQ(SXValueText(SXValue()), "(null)");
  EXPECT_EQ(SXValueText(SXValue{{"b", 1}, {"a", "x"}}), R"({"a":"x","b":1})");
  EXPECT_EQ(SXValueText(SXValue("\xff")), "\xff");
  EXPECT_NO_THROW(SXValueText(SXValue{{"k", "\xff"}}));
}

TEST(SXFormat, PrintfConversionsAndValues) {
  EXPECT_EQ(SXFormat("%lli|%i|%lu|%d", int64_t{-5}, uint16_t{65535}, uint64_t{7}, -1),
            "-5|65535|7|-1");
  EXPECT_EQ(SXFormat("%@ %@ %@", std::string("s"), SXValue{1, 2}, nullptr), "s [1,2] (null)");
  EXPECT_EQ(SXFormat("time=%@ max=%f", 1.5, 5.0), "time=1.5 max=5.000000");
  EXPECT_EQ(SXFormat("100%% %s", "done"), "100% done");
  EXPECT_EQ(SXFormat("%i : %i", static_cast<int32_t>(0xFFFFFFFFu)), "-1 : (null)");
}
