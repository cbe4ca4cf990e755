#!/usr/bin/python3
"""Writes the seed corpus of the fuzz targets into corpus/<target>/ (run from anywhere)."""
import json
import os
import struct

import msgpack

HERE = os.path.dirname(os.path.abspath(__file__))


def write(target, name, data):
    folder = os.path.join(HERE, "corpus", target)
    os.makedirs(folder, exist_ok=True)
    with open(os.path.join(folder, name), "wb") as f:
        f.write(data)


def request(msgid, method, params):
    return msgpack.packb([0, msgid, method, params])


PAYLOAD = {"peak level": 1, "route": "a b", "EngineOnTime": 12.5, "nested": {"k v": [1, 2.5]}}
REQUESTS = [
    request(1, "createReportingSession:reply:", [42]),
    request(2, "setServiceType:reportingSession:reply:", [7, 42]),
    request(3, "setConfiguration:forReporterID:reply:", [{"HostApplicationDisplayID": "player"}, 42]),
    request(4, "startReportingSessionForID:reply:", [42]),
    request(5, "sendMessage:withCategory:andType:forReportingIDs:reply:", [PAYLOAD, 3, 1, [42]]),
    request(6, "sendMessage:withCategory:andType:forReportingIDs:reply:", [PAYLOAD, 3, 1, None]),
    request(7, "stopReportingSessionForID:reply:", [42]),
    request(8, "reporterID:valid:", [-1]),
    request(9, "getAllReporters:", []),
    request(10, "getServiceNameForReporterID:reply:", [2**63 - 1]),
]
stream = b"".join(REQUESTS)
write("fuzz_rpc_decoder", "session", bytes([0, 3, 1, 7, 64]) + stream)
write("fuzz_rpc_decoder", "tight-limits", bytes([1, 1, 5]) + stream)
write("fuzz_rpc_decoder", "response", bytes([0, 1, 2]) + msgpack.packb([1, 3, None, True]))
write("fuzz_rpc_decoder", "truncated", bytes([0, 2, 1, 2]) + stream[: len(stream) // 2 + 3])
write("fuzz_rpc_decoder", "deep", bytes([1, 1, 9]) + request(1, "x", [[[[[[[1]]]]]]]))
write("fuzz_rpc_decoder", "not-msgpack", bytes([0, 1, 1]) + b"\xc1\xc1GET / HTTP/1.1\r\n")
write("fuzz_rpc_decoder", "bad-msgid", bytes([0, 1, 1]) + msgpack.packb([0, -5, 3, {}]))

VALUES = {
    "map": {"a": 1, "b": [True, False, None], "c": {"d": -1, "e": 2**64 - 1, "f": -2**63}},
    "float32": None,
    "bin": b"\x00\x01\xff",
    "ext": msgpack.ExtType(3, b"abc"),
    "array": [1.5, "x", [], {}, "\u00e9\u4e2d"],
    "int-key": None,
}
for name, value in VALUES.items():
    if name == "float32":
        data = b"\xca" + struct.pack(">f", 1.25)
    elif name == "int-key":
        data = b"\x81\x01\x02"
    else:
        data = msgpack.packb(value, use_bin_type=True)
    write("fuzz_msgpack_value", name, data)


def payload(name, reporter, category, mtype, value, as_json=False):
    head = struct.pack("<qIH", reporter, category, mtype)
    body = bytes([1]) + json.dumps(value).encode() if as_json else bytes([0]) + msgpack.packb(value)
    write("fuzz_payload", name, head + body)


payload("spaced-keys", 42, 3, 1, {"a b": 1, "a_b": 2, "peak level": 1.5})
payload("host-dots", 1, 0xFFFFFFFF, 65535, {"HostApplicationDisplayID": "../../etc/.x"})
payload("host-long", -1, 0x08000003, 7, {"HostApplicationDisplayID": "\u00e9" * 80}, True)
payload("host-control", 7, 1, 2, {"HostApplicationDisplayID": "a\u0001b\u007f/c"}, True)
payload("throttle", 5, 3, 1, {"_throttle_seconds": 4.99, "_comparison_field_blacklist": ["k"],
                              "k": 1, "Volume": 0.5, "VolumeOperationTime": 3})
payload("throttle-big", 5, 3, 1, {"_throttle_seconds": 1e300, "systemuptime_sec": 100})
payload("not-a-dict", 0, 0, 0, [1, "two", {"three": 3}], True)
write("fuzz_msgpack_value", "ext-negative", b"\xc7\x03\xfdabc")
