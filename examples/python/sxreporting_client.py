#!/usr/bin/python3
"""A small client of the reporting service in Python: MessagePack-RPC over its Unix socket.

Needs only python3-msgpack. Run as a script, it creates a session, sets its type, configures
it, sends it a message, checks it, lists every session and destroys it again:

    python3 sxreporting_client.py [--socket PATH] [--reporter-id ID]

The socket defaults to $SXREPORTING_SOCKET, else to the service's socket in the runtime
directory ($SXREPORTING_RUNTIME_DIR; ./var/run by default, /run/sxreportingd for root).
"""

import argparse
import os
import socket
import sys
import time

import msgpack

SERVICE_IDENTIFIER = "com.vendra.audio.kitbench.reporting.service"
SERVICE_TYPE_UNKNOWN = 65535

REQUEST, RESPONSE = 0, 1


class SXReportingError(Exception):
    """The service rejected a request (its error string is the message)."""


class SXReportingTimeout(SXReportingError):
    """No reply within the call's time-out. Some operations never reply by design."""


class SXReportingConnectionLost(SXReportingError):
    """The service closed the connection before replying."""


def default_socket_path():
    if os.environ.get("SXREPORTING_SOCKET"):
        return os.environ["SXREPORTING_SOCKET"]
    runtime_dir = os.environ.get("SXREPORTING_RUNTIME_DIR")
    if not runtime_dir:
        runtime_dir = "/run/sxreportingd" if os.geteuid() == 0 else os.path.join("var", "run")
    return os.path.join(runtime_dir, SERVICE_IDENTIFIER)


class SXReportingClient:
    """One connection to the service. Calls block until their reply, one at a time.

    Replies may come out of order (a start's reply waits for its session's stop), so replies
    to other message IDs that arrive while waiting are kept for their own calls.
    Not thread-safe: use one client per thread.
    """

    def __init__(self, socket_path=None, timeout=5.0):
        self.socket_path = socket_path or default_socket_path()
        self.timeout = timeout
        self._sock = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self._sock.connect(self.socket_path)
        self._unpacker = msgpack.Unpacker(raw=False, strict_map_key=False,
                                          unicode_errors="replace")
        self._next_msgid = 0
        self._early_replies = {}  # msgid -> (error, result) of replies not yet asked for
        self._abandoned = set()  # msgids whose calls timed out: their late replies are dropped

    def close(self):
        self._sock.close()

    def __enter__(self):
        return self

    def __exit__(self, *exc):
        self.close()

    def call(self, method, params, timeout=None):
        """Sends one request and returns its result. timeout: seconds, None for the default."""
        msgid = self._next_msgid
        self._next_msgid = (self._next_msgid + 1) % 2**32
        self._sock.sendall(msgpack.packb([REQUEST, msgid, method, params], use_bin_type=True))
        error, result = self._wait_for(msgid, self.timeout if timeout is None else timeout)
        if error is not None:
            raise SXReportingError(f"{method}: {error}")
        return result

    def _wait_for(self, msgid, timeout):
        deadline = time.monotonic() + timeout
        while msgid not in self._early_replies:
            left = deadline - time.monotonic()
            if left <= 0:
                self._abandoned.add(msgid)
                raise SXReportingTimeout(f"no reply within {timeout:g} s")
            self._sock.settimeout(left)
            try:
                data = self._sock.recv(65536)
            except socket.timeout:
                continue
            except ConnectionError as e:
                raise SXReportingConnectionLost(f"the connection ended: {e}") from e
            if not data:
                raise SXReportingConnectionLost("the service closed the connection")
            self._unpacker.feed(data)
            for message in self._unpacker:
                if isinstance(message, list) and len(message) == 4 and message[0] == RESPONSE:
                    if message[1] in self._abandoned:
                        self._abandoned.discard(message[1])
                    else:
                        self._early_replies[message[1]] = (message[2], message[3])
        return self._early_replies.pop(msgid)

    # --- The operations. Reporter IDs are signed 64-bit; service types 0..65535.

    def create_reporting_session(self, reporter_id, timeout=None):
        return self.call("createReportingSession:reply:", [reporter_id], timeout)

    def set_service_type(self, service_type, reporter_id, timeout=None):
        """Never replies for reporter ID 0."""
        return self.call("setServiceType:reportingSession:reply:", [service_type, reporter_id],
                         timeout)

    def get_service_name_for_reporter_id(self, reporter_id, timeout=None):
        return self.call("getServiceNameForReporterID:reply:", [reporter_id], timeout)

    def set_configuration(self, configuration, reporter_id, timeout=None):
        """configuration: a dict, or None to clear it."""
        return self.call("setConfiguration:forReporterID:reply:", [configuration, reporter_id],
                         timeout)

    def start_reporting_session_for_id(self, reporter_id, timeout=None):
        """Replies True only when the session stops: pass a long timeout."""
        return self.call("startReportingSessionForID:reply:", [reporter_id], timeout)

    def send_message(self, message, category, message_type, reporter_ids, timeout=None):
        """reporter_ids: a list, or None for every started session. Returns True when the
        service took the message, False when reporting is disabled."""
        method = "sendMessage:withCategory:andType:forReportingIDs:reply:"
        return self.call(method, [message, category, message_type, reporter_ids], timeout) is None

    def stop_reporting_session_for_id(self, reporter_id, timeout=None):
        return self.call("stopReportingSessionForID:reply:", [reporter_id], timeout)

    def destroy_reporting_session(self, reporter_id, timeout=None):
        return self.call("destroyReportingSession:reply:", [reporter_id], timeout)

    def reporter_id_valid(self, reporter_id, timeout=None):
        """{"reporterID": ..., "serviceType": ...}; reporterID 0 when there is no session."""
        return self.call("reporterID:valid:", [reporter_id], timeout)

    def get_all_reporters(self, timeout=None):
        return self.call("getAllReporters:", [], timeout)

    def status(self, timeout=None):
        return self.call("status:", [], timeout)


def main(argv):
    parser = argparse.ArgumentParser(description="Walk one session through its life.")
    parser.add_argument("--socket", help="the service's socket")
    parser.add_argument("--reporter-id", type=int, default=42)
    args = parser.parse_args(argv)
    rid = args.reporter_id
    try:
        with SXReportingClient(args.socket) as client:
            print("create:", client.create_reporting_session(rid))
            print("set-type:", client.set_service_type(2, rid))  # telephony
            print("configure:",
                  client.set_configuration({"HostApplicationDisplayID": "python-example"}, rid))
            delivered = client.send_message({"event": "route", "value": 3}, 3, 1, [rid])
            print("send:", "delivered" if delivered else "not delivered (reporting is disabled)")
            valid = client.reporter_id_valid(rid)
            print(f"valid: reporterID {valid['reporterID']}, serviceType {valid['serviceType']}")
            print("list:", " ".join(str(i) for i in client.get_all_reporters()))
            print("destroy:", client.destroy_reporting_session(rid))
    except (OSError, SXReportingError) as e:
        print(f"sxreporting_client: {e}", file=sys.stderr)
        return 1
    return 0


if __name__ == "__main__":
    sys.exit(main(sys.argv[1:]))
